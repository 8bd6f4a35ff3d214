#include "bench/bench_util.hpp"

#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <sstream>

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

InProcessEngine::InProcessEngine(const std::string& root) : root_(root) {
  elasticd::EngineOptions options;
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
