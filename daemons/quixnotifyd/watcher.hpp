// Watcher turns file-system changes below the registered folders into event lines of the
// registered queues. It reads the registrations at start and again whenever they change, keeps
// one inotify watch per directory below each registered folder (never inside an ignored name),
// pairs the two halves of a rename, and appends each pass's lines to every queue in one locked
// write. Where changes cannot be followed one by one (nobody watched, the kernel dropped events,
// the watch limit, a full queue volume) it queues a reconciliation of the folder instead.
// Single-threaded: every member belongs to one thread.
#ifndef ORVANE_DAEMONS_QUIXNOTIFYD_WATCHER_HPP_
#define ORVANE_DAEMONS_QUIXNOTIFYD_WATCHER_HPP_

#include <sys/inotify.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "common/fd.hpp"

namespace orvane {
namespace quixnotifyd {

// Event bits written to the queues. A re-index line whose data says "reconcile" asks the indexer
// to compare a folder with its index and send only the differences.
constexpr uint32_t kModify = 0x2;
constexpr uint32_t kAttrib = 0x4;
constexpr uint32_t kCloseWrite = 0x8;
constexpr uint32_t kCreate = 0x40;
constexpr uint32_t kDelete = 0x80;
constexpr uint32_t kRename = 0x100;
constexpr uint32_t kReindex = 0x10000;

struct WatcherOptions {
  // Lines kept for a queue that cannot be written are bounded; past this they are dropped for a
  // reconciliation of the queue's folders, written once the queue can be written again.
  size_t max_pending_bytes = 16 * 1024 * 1024;
  // How often a folder that could not be watched whole (the inotify watch limit) is reconciled
  // and its missing watches tried again.
  int64_t limit_retry_micros = 300 * 1000000LL;
};

class Watcher {
 public:
  // Throws Error 502 when inotify cannot be set up.
  explicit Watcher(const WatcherOptions& options = WatcherOptions());
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  // Waits up to `timeout_ms` for changes and writes their lines. False when inotify failed.
  bool RunOnce(int timeout_ms);
  // Loops until `stop` is set, at most `tick_ms` between looks at it.
  void Run(const std::atomic<bool>& stop, int tick_ms);
  // Re-reads the registrations and rebuilds every watch.
  void Reload();
  // Queues a reconciliation of every registered folder, for what changed while nobody watched.
  // Called once the watches are in place, so that a change made meanwhile is either in a line
  // after it or already on the disk the reconciliation reads.
  void ReconcileAll();
  // Directories watched, for status and tests.
  size_t watch_count() const { return dirs_.size(); }
  // Registered folders with directories left unwatched by the inotify watch limit.
  std::set<std::string> limited_folders() const;

 private:
  struct Target {
    std::string queue;
    std::string root;
    uint32_t mask;
    std::vector<std::string> ignore;
  };
  struct Dir {
    std::string path;
    std::vector<size_t> targets;  // indexes into targets_
    bool is_root = false;
  };
  struct Move {
    std::string path;
    bool is_dir;
    std::vector<size_t> targets;
  };

  void WatchTree(const std::string& root, const std::vector<size_t>& targets, bool is_root);
  // The registrations of the folder `root`.
  std::vector<size_t> TargetsOf(const std::string& root) const;
  void EmitReconcile(size_t t);
  // One reconcile line per folder registered for `queue`.
  std::string ReconcileLines(const std::string& queue) const;
  // Marks and unmarks the folders the watch limit leaves partly unwatched, and every
  // `limit_retry_micros` tries their watches again and reconciles them.
  void CheckWatchLimit();
  void UpdateLimitMarks();
  // Sets or clears a flag of the share holding `path` in the status file; failures are logged.
  static void FlagShare(const std::string& path, int bits, bool set);
  // Clears the flags a former run left for the shares of the registered folders: what still
  // holds is found again and marked again.
  void ClearStaleFlags();
  void UnwatchTree(const std::string& path);
  std::vector<int> WatchesUnder(const std::string& path) const;
  bool Ignored(const std::vector<size_t>& targets, const std::string& name) const;
  void Handle(const struct inotify_event& event);
  void FinishMoves();
  // Queues one line for every queue among `targets` whose mask takes `bits`.
  void Emit(const std::vector<size_t>& targets, uint32_t bits, const std::string& path,
            const std::string& path_old, bool is_dir);
  void Flush();

  const WatcherOptions options_;
  UniqueFd fd_;
  int registry_wd_ = -1;
  uint32_t watch_mask_ = 0;
  bool reload_ = false;
  std::vector<Target> targets_;
  std::unordered_map<int, Dir> dirs_;
  std::unordered_map<uint32_t, Move> moves_;
  std::map<std::string, std::string> pending_;  // queue path -> lines not yet written
  // Queues whose volume was full at the last append: they hold only their reconcile lines.
  std::set<std::string> no_space_;
  // Folder -> directories below it that the watch limit left unwatched since the last retry.
  std::map<std::string, size_t> unwatched_;
  // Folders marked in the status for the watch limit.
  std::set<std::string> limited_;
  int64_t next_limit_retry_ = 0;
};

}  // namespace quixnotifyd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXNOTIFYD_WATCHER_HPP_
