// Watcher turns file-system changes below the registered folders into event lines of the
// registered queues. It reads the registrations at start and again whenever they change, keeps
// one inotify watch per directory below each registered folder (never inside an ignored name),
// pairs the two halves of a rename, and appends each pass's lines to every queue in one locked
// write. Single-threaded: Run() and RunOnce() belong to one thread.
#ifndef ORVANE_DAEMONS_QUIXNOTIFYD_WATCHER_HPP_
#define ORVANE_DAEMONS_QUIXNOTIFYD_WATCHER_HPP_

#include <sys/inotify.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <string>
#include <unordered_map>
#include <vector>

#include "common/fd.hpp"

namespace orvane {
namespace quixnotifyd {

// Event bits written to the queues.
constexpr uint32_t kModify = 0x2;
constexpr uint32_t kAttrib = 0x4;
constexpr uint32_t kCloseWrite = 0x8;
constexpr uint32_t kCreate = 0x40;
constexpr uint32_t kDelete = 0x80;
constexpr uint32_t kRename = 0x100;
constexpr uint32_t kOverflow = 0x200;

// Lines kept for a queue that cannot be written are bounded; past this the queue is given one
// overflow line instead, so the share is re-indexed whole once it can be written again.
constexpr size_t kMaxPendingBytes = 16 * 1024 * 1024;

class Watcher {
 public:
  // Throws Error 502 when inotify cannot be set up.
  Watcher();
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  // Waits up to `timeout_ms` for changes and writes their lines. False when inotify failed.
  bool RunOnce(int timeout_ms);
  // Loops until `stop` is set, at most `tick_ms` between looks at it.
  void Run(const std::atomic<bool>& stop, int tick_ms);
  // Re-reads the registrations and rebuilds every watch.
  void Reload();
  // Directories watched, for status and tests.
  size_t watch_count() const { return dirs_.size(); }

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
  void UnwatchTree(const std::string& path);
  std::vector<int> WatchesUnder(const std::string& path) const;
  bool Ignored(const std::vector<size_t>& targets, const std::string& name) const;
  void Handle(const struct inotify_event& event);
  void FinishMoves();
  // Queues one line for every queue among `targets` whose mask takes `bits`.
  void Emit(const std::vector<size_t>& targets, uint32_t bits, const std::string& path,
            const std::string& path_old, bool is_dir);
  void Flush();

  UniqueFd fd_;
  int registry_wd_ = -1;
  uint32_t watch_mask_ = 0;
  bool reload_ = false;
  std::vector<Target> targets_;
  std::unordered_map<int, Dir> dirs_;
  std::unordered_map<uint32_t, Move> moves_;
  std::map<std::string, std::string> pending_;  // queue path -> lines not yet written
};

}  // namespace quixnotifyd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXNOTIFYD_WATCHER_HPP_
