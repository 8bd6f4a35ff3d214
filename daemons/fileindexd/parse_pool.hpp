// ParsePool turns files into documents (ParseFile, and with it the extraction helpers) on a few
// threads of its own, so that one slow file does not hold back the rest of a crawl: jobs go in
// with Submit and finished documents come out in the order they finish. Owned and used by one
// thread; destroying it drops the jobs not started and leaves the running ones to end alone.
#ifndef ORVANE_DAEMONS_FILEINDEXD_PARSE_POOL_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_PARSE_POOL_HPP_

#include <json/json.h>

#include <cstddef>
#include <memory>
#include <string>

namespace orvane {
namespace fileindexd {

// Threads a pool runs: one per CPU, and never fewer than two, so that a slow file always
// leaves another thread for the rest.
size_t DefaultParseThreads();

class ParsePool {
 public:
  struct Result {
    std::string path;
    bool ok = false;  // false: the file could not be described (it went away)
    Json::Value doc;  // the document as ParseFile gives it
    std::string error;
  };

  explicit ParsePool(size_t threads = DefaultParseThreads());
  ~ParsePool();
  ParsePool(const ParsePool&) = delete;
  ParsePool& operator=(const ParsePool&) = delete;

  // Queues the document of `path`, with its contents when `need_meta`.
  void Submit(const std::string& path, bool need_meta);
  // A finished job: waits for one when `wait`, else false when none has finished yet. False
  // too when nothing is queued or running.
  bool Next(Result* out, bool wait);
  // Jobs submitted and not yet taken with Next.
  size_t outstanding() const { return outstanding_; }
  size_t threads() const { return threads_; }

 private:
  struct State;
  void StartThread();

  const size_t threads_;
  size_t started_ = 0;
  size_t outstanding_ = 0;
  std::shared_ptr<State> state_;
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_PARSE_POOL_HPP_
