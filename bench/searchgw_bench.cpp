// Latency of the search gateway end to end: HTTP requests as the file server's Spotlight
// backend sends them, on one kept-alive connection, through the gateway to the engine's public
// socket and back, over an index of many file documents (each with a few words of content).
//
//   searchgw_bench [documents=1000000 [searches=200]]
//
// The engine, its server and the gateway run in this process below a scratch ORVANE_ROOT.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "bench/bench_util.hpp"
#include "common/fd.hpp"
#include "daemons/searchgw/gateway.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::Cmd;
using orvane::bench::Seconds;

const char kId[] = "fileindex_bench";
const char* kWords[] = {"holiday", "report", "invoice",  "summer", "family", "project", "draft",
                        "final",   "budget", "meeting",  "photo",  "scan",   "notes",   "backup",
                        "music",   "video",  "contract", "slides", "thesis", "recipe"};
const char* kExts[] = {"jpg", "pdf", "docx", "mp3", "mp4", "txt", "xlsx", "png"};
std::string g_socket;

std::string NameOf(uint64_t i) {
  std::mt19937_64 rng(i * 2654435761u + 17);
  std::string name = kWords[rng() % 20];
  name += "_";
  name += kWords[rng() % 20];
  name += "_" + std::to_string(rng() % 100000) + "." + kExts[rng() % 8];
  return name;
}

// A rare word: one document in about 20,000 holds each.
std::string RareWord(uint64_t i) { return "zq" + std::to_string(i % 50); }

void Load(uint64_t count) {
  std::atomic<uint64_t> next{0};
  auto send = [&] {
    for (;;) {
      const uint64_t done = next.fetch_add(1000);
      if (done >= count) return;
      Json::Value req;
      for (uint64_t i = done; i < std::min(done + 1000, count); ++i) {
        const std::string dir = "/volume1/share/d" + std::to_string(i / 1000);
        const std::string name = NameOf(i);
        Json::Value& sub = req["compound"].append(Json::Value(Json::objectValue));
        sub["command"] = "document_upsert_by_id";
        Json::Value& data = sub["data"];
        data["id"] = kId;
        data["doc_id"] = dir + "/" + name;
        Json::Value& d = data["data"];
        d["QUIXMDPath"] = dir + "/" + name;
        d["QUIXMDFSName"] = name;
        d["QUIXMDParent"] = dir;
        d["QUIXMDSearchFileName"] = name;
        d["QUIXMDSearchAncestor"] = dir;
        d["QUIXMDExtension"] = name.substr(name.rfind('.') + 1);
        d["QUIXMDIsDir"] = false;
        d["QUIXMDFSSize"] = static_cast<Json::Int64>(i * 37 % 10000000);
        d["QUIXMDFSContentChangeDate"] = static_cast<Json::Int64>(1600000000 + i);
        d["QUIXMDTextContent"] = std::string(kWords[i % 20]) + " minutes of the " +
                                 kWords[(i / 20) % 20] + " " +
                                 (i % 400 == 0 ? RareWord(i / 400) : "plain");
      }
      if (orvane::bench::Request(g_socket, req)["has_fail"].asBool()) {
        std::fprintf(stderr, "a batch had failures\n");
        std::exit(1);
      }
    }
  };
  std::thread other(send);
  send();
  other.join();
}

class Http {
 public:
  explicit Http(uint16_t port) : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_port = htons(port);
    sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (::connect(fd_.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa) != 0) std::exit(1);
  }
  // One search; the number of hits the reply's total gives, or exits on a failure.
  long Search(const std::string& query) {
    std::string body = R"({"from": 0, "size": 50, "_source": ["path.real"], "query": )"
                       R"({"query_string": {"query": ")" +
                       query + R"("}}})";
    const std::string req = "POST /" + std::string(kId) +
                            "/_search HTTP/1.1\r\nHost: 127.0.0.1\r\nContent-Type: "
                            "application/json\r\nContent-Length: " +
                            std::to_string(body.size()) + "\r\n\r\n" + body;
    if (::send(fd_.get(), req.data(), req.size(), MSG_NOSIGNAL) != ssize_t(req.size()))
      std::exit(1);
    std::string in;
    size_t head_end, length = 0;
    char buf[65536];
    for (;;) {
      head_end = in.find("\r\n\r\n");
      if (head_end != std::string::npos) {
        const size_t cl = in.find("Content-Length: ");
        length = std::strtoul(in.c_str() + cl + 16, nullptr, 10);
        if (in.size() >= head_end + 4 + length) break;
      }
      const ssize_t n = ::recv(fd_.get(), buf, sizeof buf, 0);
      if (n <= 0) std::exit(1);
      in.append(buf, size_t(n));
    }
    if (in.compare(0, 12, "HTTP/1.1 200") != 0) {
      std::fprintf(stderr, "%s: %s\n", query.c_str(), in.c_str());
      std::exit(1);
    }
    const size_t total = in.find("\"value\":", head_end);
    return std::strtol(in.c_str() + total + 8, nullptr, 10);
  }

 private:
  orvane::UniqueFd fd_;
};

void Measure(const char* what, Http* http, const std::vector<std::string>& queries) {
  std::vector<double> ms;
  long hits = 0;
  for (const std::string& q : queries) {
    const auto start = Clock::now();
    hits += http->Search(q);
    ms.push_back(Seconds(start) * 1000);
  }
  std::sort(ms.begin(), ms.end());
  std::printf(
      "%-44s p50 %6.1f ms  p95 %6.1f ms  max %6.1f ms  (%zu searches, %.0f hits each on"
      " average)\n",
      what, ms[ms.size() / 2], ms[ms.size() * 95 / 100], ms.back(), ms.size(),
      double(hits) / double(ms.size()));
}

}  // namespace

int main(int argc, char** argv) {
  const uint64_t total = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 1000000;
  const size_t searches = argc > 2 ? std::strtoul(argv[2], nullptr, 10) : 200;
  const std::string dir = orvane::bench::ScratchRoot("searchgw-bench", false);
  if (dir.empty()) return 1;
  orvane::bench::InProcessEngine engine(dir);
  engine.Serve(true);
  g_socket = engine.socket();
  orvane::bench::Request(g_socket, orvane::bench::FileIndexCreate(kId, dir + "/db"));
  auto start = Clock::now();
  Load(total);
  Json::Value commit;
  commit["id"] = kId;
  orvane::bench::Request(g_socket, Cmd("commit", commit));
  std::printf("loaded %llu documents in %.1f s\n", static_cast<unsigned long long>(total),
              Seconds(start));

  orvane::searchgw::GatewayOptions options;
  options.port = 0;
  options.engine_socket = engine.public_socket();
  orvane::searchgw::Gateway gateway(options);
  gateway.Start();
  Http http(gateway.port());

  std::mt19937_64 rng(7);
  // The file server confines every search to its share at least: the whole index here.
  const std::string share = " AND path.real.fulltext:\\\"/volume1/share\\\"";
  auto folder = [&] {
    return " AND path.real.fulltext:\\\"/volume1/share/d" +
           std::to_string(rng() % std::max<uint64_t>(total / 1000, 1)) + "\\\"";
  };
  std::vector<std::string> names, scoped, common, contents, common_contents;
  for (size_t i = 0; i < searches; ++i) {
    // A name part of about 1 in 10,000 files, and the same within one folder of 1,000.
    const std::string part = "_" + std::to_string(rng() % 100000) + ".";
    names.push_back("(name:*" + part + "*)" + share);
    scoped.push_back("(name:*" + part + "*)" + folder());
    // A word in one name of ten, and in one content of twenty, within one folder.
    common.push_back("(name:*" + std::string(kWords[rng() % 20]) + "*)" + folder());
    contents.push_back("(content:" + RareWord(rng() % 50) + ")" + share);
    common_contents.push_back("(content:" + std::string(kWords[rng() % 20]) + ")" + folder());
  }
  Measure("name (a part of the name), whole share", &http, names);
  Measure("name, within one folder", &http, scoped);
  Measure("name (a common word), within one folder", &http, common);
  Measure("content (a rare word), whole share", &http, contents);
  Measure("content (a common word), within one folder", &http, common_contents);
  gateway.Stop();
  return 0;
}
