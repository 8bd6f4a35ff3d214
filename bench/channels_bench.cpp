// The cost of the two daemon channels against trivial local responders on real Unix sockets:
// round trips per second of one search-engine request (CPU time is the calling thread's, i.e. this
// library's own share of a round trip), and bytes per second of a 1 MiB indexing-daemon command.
#include <benchmark/benchmark.h>
#include <poll.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <string>
#include <thread>

#include "common/comm.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"
#include "fileindex/communication.hpp"

namespace {

using namespace orvane;  // NOLINT

// Answers every request frame on `path` with one fixed reply frame, one connection at a time.
class Responder {
 public:
  Responder(const std::string& path, const std::string& reply) : path_(path), reply_(reply) {
    MakeParentDirs(path);
    unlink(path.c_str());
    fd_ = socket(AF_UNIX, SOCK_STREAM, 0);
    struct sockaddr_un addr;
    std::memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    std::strcpy(addr.sun_path, path.c_str());
    if (bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 || listen(fd_, 64) != 0) {
      abort();
    }
    thread_ = std::thread([this] { Serve(); });
  }
  ~Responder() {
    stop_ = true;
    thread_.join();
    close(fd_);
    unlink(path_.c_str());
  }

 private:
  void Serve() {
    std::string payload;
    while (!stop_) {
      struct pollfd pfd = {fd_, POLLIN, 0};
      if (poll(&pfd, 1, 50) <= 0) continue;
      const int conn = accept(fd_, nullptr, nullptr);
      if (conn < 0) continue;
      wire::Deadline never = wire::Deadline::Never();
      if (wire::ReadFrame(conn, wire::kEngineMaxFrameBytes, &payload, never) ==
          wire::IoStatus::kOk) {
        wire::WriteFrame(conn, reply_, never);
      }
      close(conn);
    }
  }

  std::string path_;
  std::string reply_;
  int fd_ = -1;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

std::string ScratchRoot() {
  static const std::string root = [] {
    char tmpl[] = "/tmp/fileindex-bench-XXXXXX";
    const std::string dir = mkdtemp(tmpl);
    setenv("ORVANE_ROOT", dir.c_str(), 1);
    return dir;
  }();
  return root;
}

void BM_SendRequestImpl(benchmark::State& state) {
  Responder engine(ScratchRoot() + kElasticdSockPath, R"({"success":true,"data":[]})");
  Json::Value req;
  req["command"] = "document_del_by_id";
  req["data"]["id"] = "fileindex_photo";
  req["data"]["doc_id"] = "/volume1/photo/trips/2024/beach.jpg";
  Json::Value res;
  for (auto _ : state) {
    SendRequestImpl(res, req);
    benchmark::DoNotOptimize(res);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SendRequestImpl)->UseRealTime();

void BM_SendCommandToDaemon1MiB(benchmark::State& state) {
  Responder daemon(ScratchRoot() + kFileIndexdSockPath, "{}");
  Json::Value data;
  data["share_name"] = std::string(1 << 20, 's');
  for (auto _ : state) fileindex::SendCommandToDaemon("notify_setting_changed", data);
  state.SetBytesProcessed(state.iterations() * (int64_t{1} << 20));
}
BENCHMARK(BM_SendCommandToDaemon1MiB)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
