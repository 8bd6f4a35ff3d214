#include "bench/bench_util.hpp"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <random>
#include <sstream>
#include <thread>

#include "common/json_util.hpp"
#include "common/log.hpp"
#include "fileindex/elastic_control.hpp"
#include "platform/daemon_sock.hpp"

namespace orvane {
namespace bench {

double Seconds(Clock::time_point since) { return Seconds(since, Clock::now()); }

double Seconds(Clock::time_point a, Clock::time_point b) {
  return std::chrono::duration<double>(b - a).count();
}

double Median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

double CpuSeconds() {
  struct rusage ru;
  getrusage(RUSAGE_SELF, &ru);
  return ru.ru_utime.tv_sec + ru.ru_stime.tv_sec +
         (ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) / 1e6;
}

double ProcessCpuSeconds(pid_t pid) {
  std::ifstream in(pid == 0 ? std::string("/proc/self/stat")
                            : "/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  // The command name in parentheses may hold spaces; the fields are counted after it.
  const size_t close = text.rfind(')');
  if (close == std::string::npos) return -1;
  std::istringstream rest(text.substr(close + 2));
  std::string field;
  unsigned long long utime = 0, stime = 0;
  for (int i = 3; i <= 15 && rest >> field; ++i) {
    if (i == 14) utime = std::stoull(field);
    if (i == 15) stime = std::stoull(field);
  }
  return double(utime + stime) / sysconf(_SC_CLK_TCK);
}

Json::Value Cmd(const std::string& command, const Json::Value& data) {
  Json::Value r;
  r["command"] = command;
  r["data"] = data;
  return r;
}

Json::Value FileIndexCreate(const std::string& id, const std::string& path) {
  Json::Value create;
  create["id"] = id;
  create["path"] = path;
  create["settings"] = fileindex::elastic::GetFileIndexSettings();
  create["mappings"] = fileindex::elastic::GetFileIndexMappings();
  return Cmd("index_create", create);
}

Json::Value Request(const std::string& socket, const Json::Value& request) {
  quixdaemon::DomainSockConnection conn(socket);
  if (!conn.Connect(0)) {
    std::fprintf(stderr, "connect to %s: %s\n", socket.c_str(), std::strerror(errno));
    std::exit(1);
  }
  std::string reply;
  if (!conn.Send(JsonToString(request) + std::string(1, '\0')) || !conn.Recv(reply)) {
    std::fprintf(stderr, "request on %s: %s\n", socket.c_str(), std::strerror(errno));
    std::exit(1);
  }
  JsonValue v;
  if (!v.fromString(reply) || !v["success"].asBool()) {
    std::fprintf(stderr, "request failed: %s\n", reply.c_str());
    std::exit(1);
  }
  return v;
}

namespace {

const char* const kSyntheticWords[] = {"holiday", "report", "invoice",  "summer", "family",
                                       "project", "draft",  "final",    "budget", "meeting",
                                       "photo",   "scan",   "notes",    "backup", "music",
                                       "video",   "contract", "slides", "thesis", "recipe"};

}  // namespace

std::string SyntheticWord(uint64_t i) { return kSyntheticWords[i % 20]; }

namespace {

const char* const kNameWords[] = {"holiday", "report", "invoice", "summer", "family", "project", "draft",
                        "final", "budget", "meeting", "photo", "scan", "notes", "backup",
                        "music", "video", "contract", "slides", "thesis", "recipe"};
const char* const kNameExts[] = {"jpg", "pdf", "docx", "mp3", "mp4", "txt", "xlsx", "png"};

}  // namespace

std::string NameWord(uint64_t i) { return kNameWords[i % 20]; }

std::string NameOf(uint64_t i) {
  std::mt19937_64 rng(i * 2654435761u + 17);
  std::string name = kNameWords[rng() % 20];
  name += rng() % 2 ? "_" : " ";
  name += kNameWords[rng() % 20];
  name += "_" + std::to_string(rng() % 100000);
  name += ".";
  name += kNameExts[rng() % 8];
  return name;
}

// A name-and-attributes document, as the library sends for a file without extracted content.
Json::Value FileDoc(const std::string& parent, const std::string& name, uint64_t i) {
  const std::string path = parent + "/" + name;
  const std::string ext = name.substr(name.find_last_of('.') + 1);
  Json::Value d;
  d["QUIXMDPath"] = path;
  d["QUIXMDFSName"] = name;
  d["QUIXMDParent"] = parent;
  d["QUIXMDDisplayName"] = name;
  d["QUIXMDKind"] = ext;
  d["QUIXMDExtension"] = ext;
  d["QUIXMDSearchFileName"] = name;
  d["QUIXMDSearchAncestor"] = parent;
  d["QUIXMDIsDir"] = false;
  d["QUIXMDFSSize"] = static_cast<Json::Int64>(i * 37 % 10000000);
  d["QUIXMDFSContentChangeDate"] = static_cast<Json::Int64>(1600000000 + i);
  d["QUIXMDFSCreationDate"] = static_cast<Json::Int64>(1600000000 + i);
  d["QUIXMDAttributeChangeDate"] = static_cast<Json::Int64>(1600000000 + i);
  d["QUIXMDOwnerUserID"] = "1026";
  d["QUIXMDOwnerGroupID"] = "100";
  return d;
}

std::string SyntheticName(uint64_t i) {
  static const char* const kExts[] = {"jpg", "pdf", "docx", "mp3", "mp4", "txt", "xlsx", "png"};
  std::mt19937_64 rng(i * 2654435761u + 17);
  std::string name = SyntheticWord(rng());
  name += "_";
  name += SyntheticWord(rng());
  name += "_" + std::to_string(rng() % 100000) + "." + kExts[rng() % 8];
  return name;
}

std::string RareWord(uint64_t i) { return "zq" + std::to_string(i % 50); }

void LoadSynthetic(const std::string& socket, const std::string& id, uint64_t count,
                   const std::function<std::string(uint64_t)>& dir_of) {
  std::atomic<uint64_t> next{0};
  auto send = [&] {
    for (;;) {
      const uint64_t done = next.fetch_add(1000);
      if (done >= count) return;
      Json::Value req;
      for (uint64_t i = done; i < std::min(done + 1000, count); ++i) {
        const std::string dir = dir_of(i);
        const std::string name = SyntheticName(i);
        Json::Value& sub = req["compound"].append(Json::Value(Json::objectValue));
        sub["command"] = "document_upsert_by_id";
        Json::Value& data = sub["data"];
        data["id"] = id;
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
        d["QUIXMDTextContent"] = SyntheticWord(i) + " minutes of the " + SyntheticWord(i / 20) + " " +
                                 (i % 400 == 0 ? RareWord(i / 400) : "plain");
      }
      if (Request(socket, req)["has_fail"].asBool()) {
        std::fprintf(stderr, "a batch had failures\n");
        std::exit(1);
      }
    }
  };
  std::thread other(send);
  send();
  other.join();
}

HttpClient::HttpClient(uint16_t port) : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_in sa{};
  sa.sin_family = AF_INET;
  sa.sin_port = htons(port);
  sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(fd_.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa) != 0) {
    std::perror("connect");
    std::exit(1);
  }
}

std::string HttpClient::Exchange(const std::string& request, std::string* body) {
  if (::send(fd_.get(), request.data(), request.size(), MSG_NOSIGNAL) !=
      static_cast<ssize_t>(request.size())) {
    std::perror("send");
    std::exit(1);
  }
  std::string in;
  size_t head_end;
  size_t length = 0;
  char buf[65536];
  for (;;) {
    head_end = in.find("\r\n\r\n");
    if (head_end != std::string::npos) {
      const size_t cl = in.find("Content-Length: ");
      length = std::strtoul(in.c_str() + cl + 16, nullptr, 10);
      if (in.size() >= head_end + 4 + length) break;
    }
    const ssize_t n = ::recv(fd_.get(), buf, sizeof buf, 0);
    if (n <= 0) {
      std::fprintf(stderr, "the server closed the connection\n");
      std::exit(1);
    }
    in.append(buf, static_cast<size_t>(n));
  }
  if (in.compare(0, 12, "HTTP/1.1 200") != 0) {
    std::fprintf(stderr, "%s\n-> %s\n", request.substr(0, request.find('\r')).c_str(),
                 in.c_str());
    std::exit(1);
  }
  *body = in.substr(head_end + 4, length);
  return in.substr(0, head_end);
}

void PrintLatency(const char* what, std::vector<double> ms, long hits) {
  std::sort(ms.begin(), ms.end());
  std::printf(
      "%-44s p50 %6.1f ms  p95 %6.1f ms  max %6.1f ms  (%zu searches, %.0f hits each on"
      " average)\n",
      what, ms[ms.size() / 2], ms[ms.size() * 95 / 100], ms.back(), ms.size(),
      double(hits) / double(ms.size()));
}

std::string ScratchRoot(const std::string& prefix, bool open_to_others) {
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  SetLogSink([](int priority, const std::string& line) {
    if (priority <= 3) std::fprintf(stderr, "%s\n", line.c_str());
  });
  std::string tmpl = "/tmp/" + prefix + "-XXXXXX";
  if (mkdtemp(&tmpl[0]) == nullptr) return std::string();
  if (open_to_others) ::chmod(tmpl.c_str(), 0755);
  ::setenv("ORVANE_ROOT", tmpl.c_str(), 1);
  return tmpl;
}

InProcessEngine::InProcessEngine(const std::string& root,
                                 std::shared_ptr<elasticd::StoreBackend> stores)
    : root_(root) {
  elasticd::EngineOptions options;
  options.stores = std::move(stores);
  options.registry_file = root + "/state/indexes.json";
  options.running_marker = root + "/state/running";
  engine_.reset(new elasticd::Engine(options));
  engine_->Start();
  engine_->WaitOpened();
}

InProcessEngine::~InProcessEngine() { Stop(); }

void InProcessEngine::Serve(bool with_public) {
  elasticd::ServerOptions options;
  options.socket_path = socket();
  if (with_public) options.public_socket_path = public_socket();
  server_.reset(new elasticd::Server(*engine_, options));
  server_->Start();
}

void InProcessEngine::Stop() {
  if (stopped_) return;
  stopped_ = true;
  if (server_) server_->Stop();
  engine_->Shutdown();
}

}  // namespace bench
}  // namespace orvane
