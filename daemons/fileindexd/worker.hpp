// Worker drains one share's queue into the search engine on its own thread: a pass takes the
// queued batch (or the batch a crash left behind), applies its operations through an Indexer,
// commits and only then drops the batch, so a batch is never lost half-done. Between passes it
// sleeps on inotify of the queue's folder and a wake pipe. Start/Stop/Wake/Report may be called
// from any thread.
#ifndef ORVANE_DAEMONS_FILEINDEXD_WORKER_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_WORKER_HPP_

#include <json/json.h>

#include <atomic>
#include <cstdint>
#include <ctime>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_set>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "daemons/fileindexd/reconciler.hpp"

namespace orvane {
namespace fileindex {
class OP;
}  // namespace fileindex

namespace fileindexd {

class Indexer;

// How often a failing operation is tried before it is recorded and skipped, and the first
// back-off (doubled after every failure).
constexpr int kOpAttempts = 4;
constexpr int64_t kOpRetryMicros = 1000000;
// Back-off of a pass the engine could not take (unreachable, volume full): doubled up to the cap.
constexpr int64_t kPassRetryMicros = 2000000;
constexpr int64_t kPassRetryMaxMicros = 60000000;
// The longest sleep between passes when nothing wakes the worker.
constexpr int kIdleWaitMillis = 30000;

class Worker {
 public:
  // `paused` answers, at the time asked, whether indexing is globally paused; `resume_at` when
  // a timed pause ends (0: no end known).
  struct PauseGate {
    std::function<bool()> paused;
    std::function<time_t()> resume_at;
  };

  Worker(const std::string& share, const std::string& queue_path, PauseGate gate);
  ~Worker();
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  // Starts the thread. Throws Error 502 when the wake pipe or inotify cannot be set up.
  void Start();
  // Ends the current operation early and joins the thread; a batch not finished stays queued.
  void Stop();
  // Stop without the join, so that several workers can be told at once and joined after.
  void RequestStop();
  // Makes the worker look at its queue (and the pause) now.
  void Wake();
  // {"share", "state" ("idle", "indexing", "reconciling"), "queue_length", "ops_pending",
  //  "ops_done", "documents_written", "documents_deleted", "last_pass", "passes", "errors",
  //  "last_error", "paused", "out_of_space", "long_paths", "unsafe", "reconciling" (the one
  //  running, or null), "last_reconcile" (or null), "reconciliations" (the last of each
  //  folder)}; "unsafe" is the refusal of a planted entry among the share's own files (the path
  //  and what to do), empty while they are sound.
  //  "long_paths" counts the paths of PATH_MAX bytes and more met since the start, which cannot
  //  be indexed. A reconciliation is {"folder", "started", "compared", and once done
  //  "finished", "duration_ms", "added", "removed", "refreshed", "pass"}.
  Json::Value Report() const;
  const std::string& share() const { return share_; }

  // One pass on the caller's thread (the worker's loop calls it too); false when the engine or
  // the volume could not take the batch and it must be tried again later. Throws the queue's
  // and the folder file's Errors.
  bool RunPass();

 private:
  void Run();
  // Applies one operation of a pass, trying one that fails on its own kOpAttempts times before
  // it is recorded and skipped. Throws the pass's abort when the worker stops or the engine or
  // the volume cannot take it.
  void ApplyWithRetry(Indexer* indexer, const std::shared_ptr<fileindex::OP>& op);
  void Wait(int timeout_ms);
  // Sleeps, ending early on a stop or when `cut_short` is set.
  void Backoff(int64_t micros, const std::atomic<bool>* cut_short = nullptr);
  // Opens the queue's folder (made when missing, modes narrowed) and checks its files; throws
  // Error(kErrUnsafePath) on a planted entry.
  void CheckSystemFiles();
  void RecordFailure(const Error& e);
  void RecordError(const std::string& text);
  // Adds the over-long paths a pass met to the worker's count; logs the first new one.
  void TakeLongPaths(const Indexer& indexer);

  // The indexer's reconciliation observer for the pass numbered `pass`.
  void OnReconcile(uint64_t pass, const std::string& folder, const ReconcileCounts& counts,
                   bool finished);

  struct Reconciliation {
    std::string folder;
    uint64_t pass = 0;
    time_t started = 0;
    time_t finished = 0;
    int64_t started_us = 0;
    int64_t duration_ms = 0;
    ReconcileCounts counts;
  };
  static Json::Value ToJson(const Reconciliation& r, bool done);

  const std::string share_;
  const std::string queue_path_;
  PauseGate gate_;
  UniqueFd wake_read_;
  UniqueFd wake_write_;
  UniqueFd inotify_;
  // The queue folder's watch was set up (or failed for good); touched by Start() before the
  // thread runs and by passes after.
  bool watch_tried_ = false;
  std::atomic<bool> stop_{false};
  std::atomic<bool> woken_{false};  // set by Wake; ends a pass's back-off
  std::thread thread_;

  mutable std::mutex mu_;  // guards the figures below
  uint64_t ops_pending_ = 0;
  uint64_t ops_done_ = 0;
  uint64_t documents_written_ = 0;
  uint64_t documents_deleted_ = 0;
  uint64_t errors_ = 0;
  std::string last_error_;
  time_t last_pass_ = 0;
  uint64_t passes_ = 0;  // passes that took a batch
  bool out_of_space_ = false;
  std::unordered_set<size_t> long_paths_;
  bool reconciling_ = false;
  Reconciliation current_;                            // while reconciling_
  std::map<std::string, Reconciliation> reconciled_;  // the last of each folder
  std::string last_reconciled_;
  std::string unsafe_;
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_WORKER_HPP_
