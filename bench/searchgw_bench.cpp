// Latency of the search gateway end to end: HTTP requests as the file server's Spotlight
// backend sends them, on one kept-alive connection, through the gateway to the engine's public
// socket and back, over an index of many file documents (each with a few words of content).
//
//   searchgw_bench [documents=1000000 [searches=200]]
//
// The engine, its server and the gateway run in this process below a scratch ORVANE_ROOT.
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "daemons/searchgw/gateway.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::Cmd;
using orvane::bench::Seconds;

const char kId[] = "fileindex_bench";
std::string g_socket;

// One search; the number of hits the reply's total gives.
long Search(orvane::bench::HttpClient* http, const std::string& query) {
  const std::string body = R"({"from": 0, "size": 50, "_source": ["path.real"], "query": )"
                           R"({"query_string": {"query": ")" +
                           query + R"("}}})";
  std::string reply;
  http->Exchange("POST /" + std::string(kId) +
                     "/_search HTTP/1.1\r\nHost: 127.0.0.1\r\nContent-Type: "
                     "application/json\r\nContent-Length: " +
                     std::to_string(body.size()) + "\r\n\r\n" + body,
                 &reply);
  return std::strtol(reply.c_str() + reply.find("\"value\":") + 8, nullptr, 10);
}

void Measure(const char* what, orvane::bench::HttpClient* http,
             const std::vector<std::string>& queries) {
  std::vector<double> ms;
  long hits = 0;
  for (const std::string& q : queries) {
    const auto start = Clock::now();
    hits += Search(http, q);
    ms.push_back(Seconds(start) * 1000);
  }
  orvane::bench::PrintLatency(what, std::move(ms), hits);
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
  orvane::bench::LoadSynthetic(g_socket, kId, total, [](uint64_t i) {
    return "/volume1/share/d" + std::to_string(i / 1000);
  });
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
  orvane::bench::HttpClient http(gateway.port());

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
    common.push_back("(name:*" + orvane::bench::SyntheticWord(rng()) + "*)" + folder());
    contents.push_back("(content:" + orvane::bench::RareWord(rng() % 50) + ")" + share);
    common_contents.push_back("(content:" + orvane::bench::SyntheticWord(rng()) + ")" + folder());
  }
  Measure("name (a part of the name), whole share", &http, names);
  Measure("name, within one folder", &http, scoped);
  Measure("name (a common word), within one folder", &http, common);
  Measure("content (a rare word), whole share", &http, contents);
  Measure("content (a common word), within one folder", &http, common_contents);
  gateway.Stop();
  return 0;
}
