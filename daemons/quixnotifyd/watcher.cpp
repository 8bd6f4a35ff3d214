#include "daemons/quixnotifyd/watcher.hpp"

#include <dirent.h>
#include <poll.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "fileindex/notify.hpp"
#include "fileindex/queue_file.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"
#include "platform/fault.hpp"
#include "platform/monitor_queue.hpp"

namespace orvane {
namespace quixnotifyd {

using QUIX::QUIXNOTIFYD::MonitorQueue;

namespace {

constexpr uint32_t kDirEvents = IN_ATTRIB | IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                IN_MOVED_TO | IN_DELETE_SELF | IN_ONLYDIR | IN_DONT_FOLLOW |
                                IN_EXCL_UNLINK;

// How long the first half of a rename waits for its second half before it counts as a move out
// of the watched folders. The kernel queues both halves together, so this is rarely needed.
constexpr int kMovePairMillis = 20;

// Through the fault seam, so that tests can run out of watches without touching the machine's
// limit.
int AddWatch(int fd, const std::string& path, uint32_t mask) {
  if (auto fault = platform::FaultFor("inotify_add_watch")) {
    errno = fault->err;
    return fault->result;
  }
  return inotify_add_watch(fd, path.c_str(), mask);
}

std::string ReconcileLine(const std::string& folder) {
  Json::Value line(Json::objectValue);
  line["event"] = kReindex;
  line["path"] = folder;
  line["is_dir"] = true;
  line["data"]["reconcile"] = true;
  return JsonToString(line) + "\n";
}

// The share holding `path`; "" when the platform does not know it.
std::string ShareOf(const std::string& path) {
  try {
    std::string share;
    std::string share_path;
    fileindex::GetShareNamePathByFullPath(share, share_path, path);
    return share;
  } catch (const Error&) {
    return "";
  }
}

long long ReadNumber(const char* path) {
  long long value = -1;
  std::ifstream(path) >> value;
  return value;
}

// The inotify watch limit in force and the setting that holds it: the machine's, or a lower one
// of the user namespace the daemon runs in (a container).
struct WatchLimit {
  const char* setting;
  long long value;
};

WatchLimit CurrentWatchLimit() {
  WatchLimit limit{"fs.inotify.max_user_watches",
                   ReadNumber("/proc/sys/fs/inotify/max_user_watches")};
  const long long own = ReadNumber("/proc/sys/user/max_inotify_watches");
  if (own > 0 && (limit.value <= 0 || own < limit.value)) {
    limit = WatchLimit{"user.max_inotify_watches", own};
  }
  return limit;
}

}  // namespace

Watcher::Watcher(const WatcherOptions& options)
    : options_(options), fd_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
  ORVANE_THROW_IF(!fd_.valid(), kErrSystem,
                  std::string("inotify_init1 failed, reason=") + std::strerror(errno));
  const std::string registry = RootedPath(QUIX::QUIXNOTIFYD::kRegistrationDir);
  MakeParentDirs(registry + "/");
  registry_wd_ = inotify_add_watch(fd_.get(), registry.c_str(),
                                   IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE);
  ORVANE_THROW_IF(registry_wd_ < 0, kErrSystem,
                  "cannot watch " + registry + ", reason=" + std::strerror(errno));
  ClearStaleFlags();
  Reload();
}

void Watcher::Reload() {
  reload_ = false;
  unwatched_.clear();
  // The watches of directories still wanted are kept (adding a watch again returns its
  // descriptor), so that no change is missed while the registrations are read again; the others
  // go once the new ones are in place.
  std::unordered_map<int, Dir> former;
  former.swap(dirs_);
  moves_.clear();
  targets_.clear();
  watch_mask_ = kDirEvents;
  const std::vector<Json::Value> records = MonitorQueue::List();
  for (const Json::Value& record : records) {
    for (const Json::Value& entry : record["config"]) {
      Target target;
      target.queue = record["queue"].asString();
      target.root = entry["path"].asString();
      target.mask = entry["mask"].asUInt();
      target.ignore = JsonArr2Vec<std::string>(entry["ignore"]);
      if (target.mask & kModify) watch_mask_ |= IN_MODIFY;
      targets_.push_back(std::move(target));
    }
  }
  for (size_t i = 0; i < targets_.size(); ++i) WatchTree(targets_[i].root, {i}, true);
  ORVANE_LOG(LOG_INFO, "watching %zu folders of %zu registrations in %zu directories",
             targets_.size(), records.size(), dirs_.size());
  for (const auto& entry : former) {
    if (dirs_.count(entry.first) == 0) inotify_rm_watch(fd_.get(), entry.first);
  }
  UpdateLimitMarks();
}

void Watcher::ReconcileAll() {
  for (size_t t = 0; t < targets_.size(); ++t) EmitReconcile(t);
}

std::set<std::string> Watcher::limited_folders() const { return limited_; }

void Watcher::ClearStaleFlags() {
  // Only this daemon sets these flags, so every one found is a former run's.
  const unsigned int ours = fileindex::kShareStatusQueueNoSpace | fileindex::kShareStatusWatchLimit;
  try {
    fileindex::StatusMgr status;
    const Json::Value& flags = status.data()["share"];
    if (!flags.isObject()) return;
    for (const std::string& share : flags.getMemberNames()) {
      if (flags[share].isUInt() && (flags[share].asUInt() & ours) != 0) {
        fileindex::StatusMgr().UnsetShareStatus(share, static_cast<int>(ours));
      }
    }
  } catch (const Error& e) {
    ORVANE_LOG(LOG_ERR, "cannot clear the flags of a former run in the status file: %s", e.what());
  }
}

void Watcher::WatchTree(const std::string& root, const std::vector<size_t>& targets, bool is_root) {
  std::vector<std::string> stack = {root};
  while (!stack.empty()) {
    const std::string path = std::move(stack.back());
    stack.pop_back();
    const int wd = AddWatch(fd_.get(), path, watch_mask_);
    if (wd < 0 && errno == ENOSPC) {
      // Out of watches: the folder is reconciled periodically instead. The walk goes on below,
      // so that the administrator is told how many watches are missing.
      for (size_t t : targets) ++unwatched_[targets_[t].root];
      errno = 0;
    } else if (wd < 0) {
      // A folder that vanished meanwhile is reported by its parent.
      if (errno != ENOENT && errno != ENOTDIR) {
        ORVANE_LOG(LOG_ERR, "cannot watch %s [err: %m]", path.c_str());
      }
      errno = 0;
      continue;
    } else {
      Dir& dir = dirs_[wd];
      dir.path = path;
      dir.is_root = dir.is_root || (is_root && path == root);
      for (size_t t : targets) {
        if (std::find(dir.targets.begin(), dir.targets.end(), t) == dir.targets.end()) {
          dir.targets.push_back(t);
        }
      }
    }
    DIR* d = opendir(path.c_str());
    if (d == nullptr) continue;
    while (struct dirent* entry = readdir(d)) {
      const std::string name = entry->d_name;
      if (name == "." || name == ".." || Ignored(targets, name)) continue;
      const std::string child = path + "/" + name;
      if (entry->d_type == DT_DIR || (entry->d_type == DT_UNKNOWN && IsDirExist(child, false))) {
        stack.push_back(child);
      }
    }
    closedir(d);
  }
}

std::vector<int> Watcher::WatchesUnder(const std::string& path) const {
  std::vector<int> found;
  const std::string prefix = path + "/";
  for (const auto& [wd, dir] : dirs_) {
    if (dir.path == path || StringStartWith(dir.path, prefix)) found.push_back(wd);
  }
  return found;
}

void Watcher::UnwatchTree(const std::string& path) {
  for (int wd : WatchesUnder(path)) {
    inotify_rm_watch(fd_.get(), wd);
    dirs_.erase(wd);
  }
}

std::vector<size_t> Watcher::TargetsOf(const std::string& root) const {
  std::vector<size_t> found;
  for (size_t t = 0; t < targets_.size(); ++t) {
    if (targets_[t].root == root) found.push_back(t);
  }
  return found;
}

void Watcher::EmitReconcile(size_t t) {
  const Target& target = targets_[t];
  // A queue on a full volume already holds the reconciliation of all its folders.
  if (no_space_.count(target.queue) != 0) return;
  pending_[target.queue] += ReconcileLine(target.root);
}

std::string Watcher::ReconcileLines(const std::string& queue) const {
  std::string lines;
  std::set<std::string> seen;
  for (const Target& target : targets_) {
    if (target.queue == queue && seen.insert(target.root).second) {
      lines += ReconcileLine(target.root);
    }
  }
  return lines;
}

void Watcher::FlagShare(const std::string& path, int bits, bool set) {
  const std::string share = ShareOf(path);
  try {
    ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "no share holds " + path);
    // The watcher may be the first to flag anything on a new system.
    fileindex::StatusMgr::CreateIfMissing();
    fileindex::StatusMgr status;
    if (set) {
      status.SetShareStatus(share, bits);
    } else {
      status.UnsetShareStatus(share, bits);
    }
  } catch (const Error& e) {
    ORVANE_LOG(LOG_ERR, "cannot record the state of share %s in the status file: %s", share.c_str(),
               e.what());
  }
}

void Watcher::UpdateLimitMarks() {
  const bool none_before = limited_.empty();
  size_t missing = 0;
  std::vector<std::string> marked;
  for (const auto& [root, count] : unwatched_) {
    if (count == 0) continue;
    missing += count;
    if (limited_.insert(root).second) marked.push_back(root);
  }
  std::vector<std::string> unmarked;
  for (auto it = limited_.begin(); it != limited_.end();) {
    auto found = unwatched_.find(*it);
    if (found != unwatched_.end() && found->second > 0) {
      ++it;
      continue;
    }
    unmarked.push_back(*it);
    it = limited_.erase(it);
  }
  for (const std::string& root : unmarked) {
    ORVANE_LOG(LOG_INFO, "%s is no longer short of watches: its periodic reconciliation ends",
               root.c_str());
    const std::string share = ShareOf(root);
    // The share keeps its mark while another of its folders is still short of watches.
    if (std::none_of(limited_.begin(), limited_.end(),
                     [&](const std::string& r) { return ShareOf(r) == share; })) {
      FlagShare(root, fileindex::kShareStatusWatchLimit, false);
    }
  }
  if (marked.empty()) return;
  if (none_before) next_limit_retry_ = Env::Current()->NowMicros() + options_.limit_retry_micros;
  const WatchLimit limit = CurrentWatchLimit();
  const long long needed = limit.value > 0 ? limit.value + static_cast<long long>(missing) : -1;
  for (const std::string& root : marked) {
    ORVANE_LOG(LOG_ERR,
               "%zu directories below %s are not watched: the inotify watch limit is reached. "
               "Raise %s (now %lld) to at least %lld, e.g. in /etc/sysctl.d/ and with sysctl -w; "
               "until then the folder is reconciled every %lld s",
               unwatched_[root], root.c_str(), limit.setting, limit.value, needed,
               static_cast<long long>(options_.limit_retry_micros / 1000000));
    FlagShare(root, fileindex::kShareStatusWatchLimit, true);
  }
  // One notification for the folders found short together, not one per folder.
  fileindex::NotifyWatchLimit(marked.front(), limit.setting, needed);
}

void Watcher::CheckWatchLimit() {
  if (!limited_.empty() && Env::Current()->NowMicros() >= next_limit_retry_) {
    next_limit_retry_ = Env::Current()->NowMicros() + options_.limit_retry_micros;
    for (const std::string& root : std::set<std::string>(limited_)) {
      // Watches first, so that the reconciliation reads the disk after the changes it misses.
      unwatched_[root] = 0;
      const std::vector<size_t> targets = TargetsOf(root);
      WatchTree(root, targets, true);
      for (size_t t : targets) EmitReconcile(t);
    }
  }
  UpdateLimitMarks();
}

bool Watcher::Ignored(const std::vector<size_t>& targets, const std::string& name) const {
  for (size_t t : targets) {
    const auto& ignore = targets_[t].ignore;
    if (std::find(ignore.begin(), ignore.end(), name) != ignore.end()) return true;
  }
  return false;
}

void Watcher::Emit(const std::vector<size_t>& targets, uint32_t bits, const std::string& path,
                   const std::string& path_old, bool is_dir) {
  std::vector<const std::string*> written;
  for (size_t t : targets) {
    const Target& target = targets_[t];
    // A queue on a full volume gets one reconciliation instead of its lines.
    if ((target.mask & bits) == 0 || no_space_.count(target.queue) != 0) continue;
    // Nested folders of one registration share its queue: one line per queue.
    if (std::any_of(written.begin(), written.end(),
                    [&](const std::string* q) { return *q == target.queue; })) {
      continue;
    }
    written.push_back(&target.queue);
    Json::Value line(Json::objectValue);
    line["event"] = bits;
    line["path"] = path;
    if (!path_old.empty()) line["path_old"] = path_old;
    line["is_dir"] = is_dir;
    std::string& pending = pending_[target.queue];
    pending += JsonToString(line) + "\n";
    if (pending.size() > options_.max_pending_bytes) {
      pending = ReconcileLines(target.queue);
      ORVANE_LOG(LOG_ERR,
                 "queue %s cannot be written: too many changes held, dropped for a "
                 "reconciliation of its folders",
                 target.queue.c_str());
    }
  }
}

void Watcher::Handle(const struct inotify_event& event) {
  if (event.mask & IN_Q_OVERFLOW) {
    // Changes were lost and nothing says where: every folder is compared with its index.
    ORVANE_LOG(LOG_WARNING, "the kernel's event queue overflowed: every folder is reconciled");
    ReconcileAll();
    return;
  }
  if (event.wd == registry_wd_) {
    reload_ = true;
    return;
  }
  auto it = dirs_.find(event.wd);
  if (it == dirs_.end()) return;
  if (event.mask & IN_IGNORED) {
    dirs_.erase(it);
    return;
  }
  const Dir& dir = it->second;
  const std::vector<size_t> targets = dir.targets;
  if (event.mask & IN_DELETE_SELF) {
    // A registered folder itself went away; any other folder is reported by its parent.
    if (dir.is_root) Emit(targets, kDelete, dir.path, "", true);
    return;
  }
  const std::string name = event.len > 0 ? event.name : "";
  if (name.empty() || Ignored(targets, name)) return;
  const std::string path = dir.path + "/" + name;
  const bool is_dir = (event.mask & IN_ISDIR) != 0;

  if (event.mask & IN_MOVED_FROM) {
    moves_[event.cookie] = Move{path, is_dir, targets};
    return;
  }
  if (event.mask & IN_MOVED_TO) {
    auto from = moves_.find(event.cookie);
    if (from == moves_.end()) {
      // Moved in from outside the watched folders: new to us.
      if (is_dir) WatchTree(path, targets, false);
      Emit(targets, kCreate, path, "", is_dir);
      return;
    }
    const Move move = std::move(from->second);
    moves_.erase(from);
    std::vector<size_t> both;
    std::vector<size_t> only_from;
    std::vector<size_t> only_to;
    auto queue_in = [this](const std::vector<size_t>& set, size_t t) {
      return std::any_of(set.begin(), set.end(),
                         [&](size_t o) { return targets_[o].queue == targets_[t].queue; });
    };
    for (size_t t : targets) (queue_in(move.targets, t) ? both : only_to).push_back(t);
    for (size_t t : move.targets) {
      if (!queue_in(targets, t)) only_from.push_back(t);
    }
    if (is_dir) {
      // The subtree keeps its watches (the kernel's watches follow the inodes) under the new
      // names and the new folder's queues; events already queued for them then read right.
      for (int wd : WatchesUnder(move.path)) {
        Dir& moved = dirs_[wd];
        moved.path = path + moved.path.substr(move.path.size());
        moved.targets = targets;
        moved.is_root = false;
      }
    }
    Emit(both, kRename, path, move.path, is_dir);
    Emit(only_from, kDelete, move.path, "", is_dir);
    Emit(only_to, kCreate, path, "", is_dir);
    return;
  }
  if (event.mask & IN_CREATE) {
    // Entries made inside a new folder before its watch exists are found by the re-index that
    // the folder's own create event causes.
    if (is_dir) WatchTree(path, targets, false);
    Emit(targets, kCreate, path, "", is_dir);
  }
  if (event.mask & IN_DELETE) Emit(targets, kDelete, path, "", is_dir);
  if (event.mask & IN_ATTRIB) Emit(targets, kAttrib, path, "", is_dir);
  if (event.mask & IN_MODIFY) Emit(targets, kModify, path, "", is_dir);
  if (event.mask & IN_CLOSE_WRITE) Emit(targets, kCloseWrite, path, "", is_dir);
}

void Watcher::FinishMoves() {
  // What was moved out of every watched folder is gone as far as the index is concerned.
  for (auto& [cookie, move] : moves_) {
    if (move.is_dir) UnwatchTree(move.path);
    Emit(move.targets, kDelete, move.path, "", move.is_dir);
  }
  moves_.clear();
}

void Watcher::Flush() {
  for (auto it = pending_.begin(); it != pending_.end();) {
    const std::string& queue = it->first;
    bool appended = false;
    bool refused = false;
    try {
      appended = it->second.empty() || fileindex::QueueFileAppend(queue, it->second);
    } catch (const Error& e) {
      // A planted entry where the queue belongs: the refusal is logged where it is found, once.
      refused = e.code == kErrUnsafePath;
      if (!refused) ORVANE_LOG(LOG_ERR, "%s", e.what());
      errno = 0;
    }
    if (appended) {
      if (no_space_.erase(queue) != 0) {
        ORVANE_LOG(LOG_INFO, "queue %s can be written again: its folders are reconciled",
                   queue.c_str());
        FlagShare(queue, fileindex::kShareStatusQueueNoSpace, false);
      }
      it = pending_.erase(it);
      continue;
    }
    if (errno == ENOSPC || errno == EDQUOT) {
      // However long the volume stays full, one reconciliation written once there is room finds
      // every change again; holding the lines meanwhile would only fill memory.
      if (no_space_.insert(queue).second) {
        ORVANE_LOG(
            LOG_ERR,
            "cannot append to queue %s [err: %m]: its changes are no longer queued and "
            "its folders will be reconciled once it can be written; free space on its volume",
            queue.c_str());
        FlagShare(queue, fileindex::kShareStatusQueueNoSpace, true);
        fileindex::SendZRMNotify();
      }
      it->second = ReconcileLines(queue);
    } else if (!refused) {
      // Kept and tried again on the next pass; Emit() bounds what is kept.
      ORVANE_LOG(LOG_ERR, "cannot append to queue %s [err: %m]", queue.c_str());
    }
    errno = 0;
    ++it;
  }
}

bool Watcher::RunOnce(int timeout_ms) {
  alignas(struct inotify_event) char buf[64 * 1024];
  struct pollfd pfd = {fd_.get(), POLLIN, 0};
  // Lines held for a queue that cannot be written are tried again every second.
  int wait = pending_.empty() ? timeout_ms : std::min(timeout_ms, 1000);
  for (;;) {
    const int ready = poll(&pfd, 1, wait);
    if (ready < 0 && errno != EINTR) return false;
    if (ready <= 0) break;
    const ssize_t n = read(fd_.get(), buf, sizeof(buf));
    if (n < 0 && errno != EAGAIN && errno != EINTR) return false;
    for (ssize_t off = 0; off < n;) {
      const auto* event = reinterpret_cast<const struct inotify_event*>(buf + off);
      Handle(*event);
      off += sizeof(struct inotify_event) + event->len;
    }
    // Half a rename may still be on its way; anything else is written now.
    if (moves_.empty()) break;
    wait = kMovePairMillis;
  }
  FinishMoves();
  CheckWatchLimit();
  Flush();
  if (reload_) Reload();
  return true;
}

void Watcher::Run(const std::atomic<bool>& stop, int tick_ms) {
  while (!stop.load()) {
    if (!RunOnce(tick_ms)) {
      ORVANE_LOG(LOG_ERR, "inotify failed [err: %m]");
      return;
    }
  }
  Flush();
}

}  // namespace quixnotifyd
}  // namespace orvane
