// What the benchmarks share: clocks and CPU figures, a client of the search engine's framed
// socket that gives up the whole run on any failure, and the engine (optionally with its
// server) run in this process below a scratch ORVANE_ROOT. Single-threaded use except
// Request(), which opens its own connection per call.
#ifndef ORVANE_BENCH_BENCH_UTIL_HPP_
#define ORVANE_BENCH_BENCH_UTIL_HPP_

#include <sys/types.h>

#include <json/json.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "common/fd.hpp"
#include "common/wire.hpp"
#include "daemons/quixelasticd/engine.hpp"
#include "daemons/quixelasticd/server.hpp"

namespace orvane {
namespace bench {

using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point since);
double Seconds(Clock::time_point a, Clock::time_point b);
double Median(std::vector<double> v);
// User plus system CPU seconds of this process (client and in-process engine threads
// together): a figure that other load on the machine does not distort the way wall time is.
double CpuSeconds();
// The same for any process, read from /proc (`pid` 0: this process); -1 when it is gone.
double ProcessCpuSeconds(pid_t pid);

// A request {"command": command, "data": data}.
Json::Value Cmd(const std::string& command, const Json::Value& data);
// index_create of the library's own file-index schema and settings.
Json::Value FileIndexCreate(const std::string& id, const std::string& path);
// One framed request on `socket` and its reply; a failed connection or a reply without
// success ends the process with the reason on stderr.
Json::Value Request(const std::string& socket, const Json::Value& request);

// Line-buffered stdout, engine errors to stderr, and a fresh scratch folder made the process's
// ORVANE_ROOT (0755 when `open_to_others`, so that another user reaches sockets below it).
// "" when the folder cannot be made.
std::string ScratchRoot(const std::string& prefix, bool open_to_others);

// The synthetic file documents of the search benchmarks: document i is named of two words, a
// number below 100,000 and an extension, and its content holds two words and, in one document of
// 400, the rare word RareWord(i / 400), which one document in about 20,000 holds.
std::string SyntheticName(uint64_t i);
std::string RareWord(uint64_t i);
// The i-th (modulo 20) of the words names and contents are made of.
std::string SyntheticWord(uint64_t i);
// Loads documents 0 to count-1 into index `id` on the engine's `socket` in batches of 1,000 from
// two threads, document i in the folder dir_of(i); any failure ends the process.
void LoadSynthetic(const std::string& socket, const std::string& id, uint64_t count,
                   const std::function<std::string(uint64_t)>& dir_of);

// The name-only file documents of the engine's benchmarks: document i is named of two of the
// twenty words NameWord(0..19), a number below 100,000 and one of eight extensions; FileDoc is
// the document the library sends for such a file in folder `parent`.
std::string NameWord(uint64_t i);
std::string NameOf(uint64_t i);
Json::Value FileDoc(const std::string& parent, const std::string& name, uint64_t i);

// One kept-alive HTTP/1.1 connection to a loopback port; any failure ends the process.
class HttpClient {
 public:
  explicit HttpClient(uint16_t port);
  // Sends `request` (whole, with its head) and returns the reply's head; the body in *body.
  // A reply other than 200 ends the process with the reply on stderr.
  std::string Exchange(const std::string& request, std::string* body);

 private:
  UniqueFd fd_;
};

// Sorts `ms` and prints its p50, p95 and max under `what`, with the average of `hits`.
void PrintLatency(const char* what, std::vector<double> ms, long hits);

// The engine started on `root` (opening done), and once Serve() is called its server on the
// daemon's sockets there. Stop() (or the destructor) stops both.
class InProcessEngine {
 public:
  // `stores`: where the indexes live; null for SQLite files below `root`.
  explicit InProcessEngine(const std::string& root,
                           std::shared_ptr<elasticd::StoreBackend> stores = nullptr);
  ~InProcessEngine();
  InProcessEngine(const InProcessEngine&) = delete;
  InProcessEngine& operator=(const InProcessEngine&) = delete;

  // Serves the main socket and, when `with_public`, the public search socket.
  void Serve(bool with_public);
  void Stop();

  elasticd::Engine& engine() { return *engine_; }
  std::string socket() const { return root_ + kElasticdSockPath; }
  std::string public_socket() const { return root_ + kElasticdSearchSockPath; }

 private:
  std::string root_;
  std::unique_ptr<elasticd::Engine> engine_;
  std::unique_ptr<elasticd::Server> server_;
  bool stopped_ = false;
};

}  // namespace bench
}  // namespace orvane

#endif  // ORVANE_BENCH_BENCH_UTIL_HPP_
