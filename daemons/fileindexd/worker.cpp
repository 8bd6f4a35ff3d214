#include "daemons/fileindexd/worker.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/inotify.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/indexer.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/notify.hpp"
#include "fileindex/queue_file.hpp"
#include "fileindex/queue_mgr.hpp"
#include "platform/safe_dir.hpp"

namespace orvane {
namespace fileindexd {

namespace {

// Thrown from the operation callback to end a pass without dropping its batch.
struct PassAborted {
  bool retry;  // false: the worker is stopping
  std::string why;
};

// Failures that are about the engine or the volume, not about one file: skipping the operation
// would lose it, so the whole batch waits instead.
bool IsPassFailure(const Error& e) {
  return e.code == kErrElastic || e.code == kErrSpaceNotEnough || e.code == kErrIndexDamaged;
}

// What the status says of a pass that could not be done.
std::string PassFailureText(const std::string& share, const Error& e) {
  if (e.code == kErrIndexDamaged) {
    return "the index of share " + share + " cannot be read and was set aside; the changes " +
           "wait until \"fileindexctl share rebuild " + share + "\" builds it again";
  }
  return e.what();
}

uint64_t CountLines(const std::string& path) {
  try {
    fileindex::QueueFileReader reader(path);
    uint64_t count = 0;
    std::string line;
    while (reader.ReadLine(&line, 0)) ++count;
    return count;
  } catch (const Error&) {
    return 0;  // a refused queue is reported through the worker's state
  }
}

}  // namespace

Worker::Worker(const std::string& share, const std::string& queue_path, PauseGate gate)
    : share_(share), queue_path_(queue_path), gate_(std::move(gate)) {}

Worker::~Worker() { Stop(); }

void Worker::Start() {
  int fds[2];
  ORVANE_THROW_IF(pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0, kErrSystem, "pipe2 failed");
  wake_read_.Reset(fds[0]);
  wake_write_.Reset(fds[1]);
  inotify_.Reset(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  ORVANE_THROW_IF(!inotify_.valid(), kErrSystem, "inotify_init1 failed");
  // The queue's folder is watched rather than the file: the file is renamed away on every pass
  // and created again by the next append. Making sure of the folder first also narrows the
  // modes an older installation left; a refusal is reported by every pass until it is resolved.
  try {
    CheckSystemFiles();
  } catch (const Error& e) {
    RecordFailure(e);
  }
  stop_.store(false);
  thread_ = std::thread([this] { Run(); });
}

void Worker::Stop() {
  RequestStop();
  if (thread_.joinable()) thread_.join();
}

void Worker::RequestStop() {
  stop_.store(true);
  Wake();
}

void Worker::Wake() {
  woken_.store(true);
  if (!wake_write_.valid()) return;
  const char byte = 1;
  // A full pipe already holds a wake-up.
  (void)!write(wake_write_.get(), &byte, 1);
}

Json::Value Worker::Report() const {
  Json::Value r(Json::objectValue);
  r["share"] = share_;
  r["queue_length"] = Json::UInt64(CountLines(queue_path_) + CountLines(queue_path_ + ".tmp"));
  std::lock_guard<std::mutex> lock(mu_);
  r["state"] = reconciling_ ? "reconciling" : (ops_pending_ > 0 ? "indexing" : "idle");
  r["ops_pending"] = Json::UInt64(ops_pending_);
  r["ops_done"] = Json::UInt64(ops_done_);
  r["documents_written"] = Json::UInt64(documents_written_);
  r["documents_deleted"] = Json::UInt64(documents_deleted_);
  r["last_pass"] = Json::Int64(last_pass_);
  r["errors"] = Json::UInt64(errors_);
  r["last_error"] = last_error_;
  r["paused"] = gate_.paused ? gate_.paused() : false;
  r["out_of_space"] = out_of_space_;
  r["long_paths"] = Json::UInt64(long_paths_.size());
  r["passes"] = Json::UInt64(passes_);
  r["reconciling"] = reconciling_ ? ToJson(current_, false) : Json::Value();
  const auto last = reconciled_.find(last_reconciled_);
  r["last_reconcile"] = last != reconciled_.end() ? ToJson(last->second, true) : Json::Value();
  r["reconciliations"] = Json::Value(Json::arrayValue);
  for (const auto& entry : reconciled_) r["reconciliations"].append(ToJson(entry.second, true));
  r["unsafe"] = unsafe_;
  return r;
}

Json::Value Worker::ToJson(const Reconciliation& rec, bool done) {
  Json::Value r(Json::objectValue);
  r["folder"] = rec.folder;
  r["started"] = Json::Int64(rec.started);
  r["compared"] = Json::UInt64(rec.counts.compared);
  if (!done) return r;
  r["finished"] = Json::Int64(rec.finished);
  r["duration_ms"] = Json::Int64(rec.duration_ms);
  r["added"] = Json::UInt64(rec.counts.added);
  r["removed"] = Json::UInt64(rec.counts.removed);
  r["refreshed"] = Json::UInt64(rec.counts.refreshed);
  r["pass"] = Json::UInt64(rec.pass);
  return r;
}

void Worker::OnReconcile(uint64_t pass, const std::string& folder, const ReconcileCounts& counts,
                         bool finished) {
  Env* env = Env::Current();
  std::lock_guard<std::mutex> lock(mu_);
  if (!reconciling_ || current_.folder != folder) {
    current_ = Reconciliation();
    current_.folder = folder;
    current_.pass = pass;
    current_.started = env->Now();
    current_.started_us = env->NowMicros();
    reconciling_ = true;
  }
  current_.counts = counts;
  if (!finished) return;
  current_.finished = env->Now();
  current_.duration_ms = (env->NowMicros() - current_.started_us) / 1000;
  reconciled_[folder] = current_;
  last_reconciled_ = folder;
  reconciling_ = false;
}

void Worker::Run() {
  int64_t backoff = kPassRetryMicros;
  while (!stop_.load()) {
    if (gate_.paused && gate_.paused()) {
      int wait = kIdleWaitMillis;
      const time_t until = gate_.resume_at ? gate_.resume_at() : 0;
      if (until > 0) {
        const int64_t left = (static_cast<int64_t>(until) - Env::Current()->Now()) * 1000 + 50;
        wait = static_cast<int>(std::clamp<int64_t>(left, 10, kIdleWaitMillis));
      }
      Wait(wait);
      continue;
    }
    // Events that arrive from here on wake the next wait, so none is missed between the drain
    // and the pass.
    Wait(0);
    bool done = false;
    try {
      done = RunPass();
    } catch (const Error& e) {
      RecordFailure(e);
    } catch (const std::exception& e) {
      RecordError(e.what());
    }
    if (stop_.load()) break;
    if (done) {
      backoff = kPassRetryMicros;
      // A pass that finished a batch left behind did not take the live queue yet.
      if (!IsFileExist(queue_path_)) Wait(kIdleWaitMillis);
    } else {
      // A command (a rebuild's worker_create, a resume) ends the wait: what it changed may be
      // what the pass was waiting for.
      woken_.store(false);
      Backoff(backoff, &woken_);
      backoff = std::min(backoff * 2, kPassRetryMaxMicros);
    }
  }
}

void Worker::CheckSystemFiles() {
  const platform::SafeDir dir = platform::SafeDir::Open(Dirname(queue_path_), true);
  dir.CheckEntry(Basename(queue_path_), false);
  dir.CheckEntry(Basename(queue_path_) + ".tmp", false);
  // The watch is set once the folder is known to be the system's own (a refused one is not
  // watched, and is polled until it is resolved).
  if (!watch_tried_ && inotify_.valid()) {
    watch_tried_ = true;
    if (inotify_add_watch(inotify_.get(), dir.path().c_str(),
                          IN_MODIFY | IN_CLOSE_WRITE | IN_CREATE | IN_MOVED_TO | IN_ONLYDIR |
                              IN_DONT_FOLLOW) < 0) {
      Log(LOG_WARNING, "fileindexd: cannot watch the queue folder of %s: %m; polling it",
          share_.c_str());
    }
  }
  std::lock_guard<std::mutex> lock(mu_);
  unsafe_.clear();
}

bool Worker::RunPass() {
  // Every pass makes sure of the queue's folder, so a folder planted or swapped in after the
  // start is reported instead of leaving the share quietly idle.
  CheckSystemFiles();
  if (!IsFileExist(queue_path_) && !IsFileExist(queue_path_ + ".tmp")) return true;
  Indexer indexer(share_, &stop_);
  indexer.BeginPass();
  fileindex::QueueMgr mgr(queue_path_);
  mgr.PrepareTmpQueue();
  if (!IsFileExist(queue_path_ + ".tmp")) return true;
  uint64_t pass = 0;
  {
    const auto tree = mgr.GetOPTreeTmp();
    std::lock_guard<std::mutex> lock(mu_);
    ops_pending_ = tree->crashed ? 1 : tree->ops.size();
    pass = ++passes_;
  }
  indexer.SetReconcileObserver(
      [this, pass](const std::string& folder, const ReconcileCounts& counts, bool finished) {
        OnReconcile(pass, folder, counts, finished);
      });
  const uint64_t written_before = indexer.documents_written();
  const uint64_t deleted_before = indexer.documents_deleted();
  auto account = [&] {
    TakeLongPaths(indexer);
    std::lock_guard<std::mutex> lock(mu_);
    reconciling_ = false;
    documents_written_ += indexer.documents_written() - written_before;
    documents_deleted_ += indexer.documents_deleted() - deleted_before;
  };
  size_t handed = 0;
  // Sends the upserts started ahead that are done, and those `op` must not overtake.
  const auto settle = [&](const fileindex::OP* op) {
    std::vector<std::shared_ptr<fileindex::OP>> failed;
    try {
      failed = indexer.SettleAhead(op);
    } catch (const Error& e) {
      if (IsPassFailure(e)) throw PassAborted{true, PassFailureText(share_, e)};
      throw;
    }
    for (const auto& again : failed) ApplyWithRetry(&indexer, again);
  };
  try {
    handed = mgr.ProcessOP(
        [&](std::shared_ptr<fileindex::OP> op) {
          if (stop_.load()) throw PassAborted{false, ""};
          settle(op.get());
          // A file whose contents are extracted is started ahead, so that a slow one does not
          // hold back the operations after it; it counts as done when handed over.
          if (!indexer.UpsertAhead(op)) ApplyWithRetry(&indexer, op);
          std::unique_lock<std::mutex> lock(mu_);
          // One that failed or stopped half-way is not running any more.
          reconciling_ = false;
          lock.unlock();
          // A crawl stopped half-way is not done: the batch is kept for the next start.
          if (stop_.load()) throw PassAborted{false, ""};
          lock.lock();
          ++ops_done_;
          if (ops_pending_ > 0) --ops_pending_;
        },
        true);
    settle(nullptr);
    if (stop_.load()) throw PassAborted{false, ""};
  } catch (const PassAborted& aborted) {
    account();
    if (aborted.retry) RecordError("batch kept for a later pass: " + aborted.why);
    return !aborted.retry;
  }
  account();
  if (handed > 0) {
    try {
      fileindex::elastic::IndexCommit(share_);
    } catch (const Error& e) {
      if (e.code == kErrSpaceNotEnough) {
        bool first = false;
        {
          std::lock_guard<std::mutex> lock(mu_);
          first = !out_of_space_;
          out_of_space_ = true;
        }
        // One notification per spell of full disk, not one per retried pass.
        if (first) fileindex::SendZRMNotify();
      }
      RecordError(std::string("commit: ") + PassFailureText(share_, e));
      return false;
    }
  }
  mgr.DeleteTmp();
  std::lock_guard<std::mutex> lock(mu_);
  out_of_space_ = false;
  ops_pending_ = 0;
  last_pass_ = Env::Current()->Now();
  return true;
}

void Worker::ApplyWithRetry(Indexer* indexer, const std::shared_ptr<fileindex::OP>& op) {
  int64_t delay = kOpRetryMicros;
  for (int attempt = 1;; ++attempt) {
    if (stop_.load()) throw PassAborted{false, ""};
    try {
      indexer->Apply(*op);
      return;
    } catch (const Error& e) {
      // The engine or the volume failing is no fault of this operation: the whole batch waits.
      if (IsPassFailure(e)) throw PassAborted{true, PassFailureText(share_, e)};
      std::ostringstream what;
      what << op;
      if (attempt >= kOpAttempts) {
        RecordError("skipped " + what.str() + ": " + e.what());
        return;
      }
      Log(LOG_WARNING, "fileindexd: %s failed (attempt %d of %d): %s", what.str().c_str(),
          attempt, kOpAttempts, e.what());
      Backoff(delay);
      delay *= 2;
    }
  }
}

void Worker::Wait(int timeout_ms) {
  struct pollfd fds[2] = {{wake_read_.get(), POLLIN, 0}, {inotify_.get(), POLLIN, 0}};
  if (poll(fds, 2, timeout_ms) < 0 && errno != EINTR) {
    Log(LOG_ERR, "fileindexd: poll failed: %m");
  }
  // Drain both: one pass answers every event so far.
  char buf[4096];
  while (read(wake_read_.get(), buf, sizeof(buf)) > 0) {
  }
  while (read(inotify_.get(), buf, sizeof(buf)) > 0) {
  }
}

void Worker::Backoff(int64_t micros, const std::atomic<bool>* cut_short) {
  // In slices, so that a stop does not wait out a long back-off.
  constexpr int64_t kSlice = 200000;
  while (micros > 0 && !stop_.load() && !(cut_short != nullptr && cut_short->load())) {
    const int64_t step = std::min(micros, kSlice);
    Env::Current()->SleepMicros(step);
    micros -= step;
  }
}

void Worker::TakeLongPaths(const Indexer& indexer) {
  size_t added = 0;
  {
    std::lock_guard<std::mutex> lock(mu_);
    for (size_t hash : indexer.long_paths()) added += long_paths_.insert(hash).second ? 1 : 0;
  }
  if (added == 0) return;
  // The path itself may be long beyond what a log line keeps: its start and its length find it.
  const std::string& first = indexer.first_long_path();
  Log(LOG_WARNING,
      "fileindexd: share %s: %zu more path(s) of %d bytes or more cannot be indexed; the first "
      "(%zu bytes) begins %.512s",
      share_.c_str(), added, PATH_MAX, first.size(), first.c_str());
}

void Worker::RecordFailure(const Error& e) {
  if (e.code != kErrUnsafePath) {
    RecordError(e.what());
    return;
  }
  // Logged once where it was found; the pass after the entry is removed clears it.
  std::lock_guard<std::mutex> lock(mu_);
  ++errors_;
  last_error_ = e.what();
  unsafe_ = e.what();
}

void Worker::RecordError(const std::string& text) {
  Log(LOG_ERR, "fileindexd: share %s: %s", share_.c_str(), text.c_str());
  std::lock_guard<std::mutex> lock(mu_);
  ++errors_;
  last_error_ = text;
}

}  // namespace fileindexd
}  // namespace orvane
