#include "fileindex/queue_mgr.hpp"

#include <fcntl.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "common/error.hpp"
#include "common/lock_file.hpp"
#include "common/util.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/queue_file.hpp"
#include "platform/safe_dir.hpp"

namespace orvane {
namespace fileindex {

QueueMgr::QueueMgr(const std::string& queue_path)
    : queue_path_(queue_path), queue_path_tmp_(queue_path + ".tmp") {}

void QueueMgr::PrepareTmpQueue() {
  // The queue's folder is reached without following links and everything below happens
  // through its descriptor, so a folder swapped in meanwhile is never the one renamed in.
  const platform::SafeDir dir = platform::SafeDir::Open(Dirname(queue_path_), false);
  if (!dir.valid()) return;
  const std::string live = Basename(queue_path_);
  const std::string side = Basename(queue_path_tmp_);
  UniqueFd queue = dir.OpenFile(live, O_RDONLY);
  if (!queue.valid()) {
    ORVANE_THROW_IF(errno != ENOENT, kErrLockFile,
                    "cannot open " + queue_path_ + ": " + std::strerror(errno));
    return;
  }
  LockFile lock(std::move(queue), queue_path_, true);
  // A waiting side file is an interrupted batch: it goes first and new events wait their turn.
  if (dir.CheckEntry(side, false)) return;
  ORVANE_THROW_IF(0 > dir.Rename(live, side), kErrSystem,
                  "cannot rename " + queue_path_ + " to " + queue_path_tmp_ + ": " +
                      std::strerror(errno));
}

std::shared_ptr<OPTree> QueueMgr::GetOPTree() const {
  if (!op_tree_) op_tree_ = std::make_shared<OPTree>(queue_path_);
  return op_tree_;
}

std::shared_ptr<OPTree> QueueMgr::GetOPTreeTmp() const {
  if (!op_tree_tmp_) op_tree_tmp_ = std::make_shared<OPTree>(queue_path_tmp_);
  return op_tree_tmp_;
}

size_t QueueMgr::ProcessOP(std::function<void(std::shared_ptr<OP>)> callback, bool tmp) {
  if (!tmp) return IsFileExist(queue_path_) ? GetOPTree()->ProcessOP(callback) : 0;
  PrepareTmpQueue();
  return IsFileExist(queue_path_tmp_) ? GetOPTreeTmp()->ProcessOP(callback) : 0;
}

void QueueMgr::DeleteTmp() {
  const platform::SafeDir dir = platform::SafeDir::Open(Dirname(queue_path_tmp_), false);
  if (dir.valid()) dir.Unlink(Basename(queue_path_tmp_));
}

bool QueueMgr::FindQueue(const std::string& path,
                         const std::function<bool(const Event&)>& pred) {
  if (!IsFileExist(path)) return false;
  QueueFileReader input_stream(path);
  ORVANE_THROW_IF(!input_stream, kErrSystem,
                  std::string("Failed to open queue, reason=") + std::strerror(errno));
  std::string line;
  while (input_stream.ReadLine(&line, kMaxEventLineLength)) {
    if (line.size() > kMaxEventLineLength) {
      throw Error(kErrMalformedEvent, "Event line too long: " + line.substr(0, 256) + "...");
    }
    if (pred(Event(line))) return true;
  }
  return false;
}

bool QueueMgr::IsFullPathProcessing(const std::string& full_path) {
  // Loading the folder configuration here is part of the question: a broken configuration
  // fails it the same way every other folder operation fails.
  FolderMgr folder_mgr;
  const std::string prefix = full_path + "/";
  auto concerns = [&prefix](const Event& e) {
    return StringStartWith(e.path + "/", prefix) || StringStartWith(e.path_old + "/", prefix);
  };
  return FindQueue(queue_path_, concerns) || FindQueue(queue_path_tmp_, concerns);
}

bool QueueMgr::IsFullPathHasReindex(const std::string& full_path) {
  const std::string path = full_path + "/";
  auto reindexes = [&path](const Event& e) {
    return e.event == kEventReindex && !IsReconcile(e.data) && StringStartWith(path, e.path + "/");
  };
  return FindQueue(queue_path_, reindexes) || FindQueue(queue_path_tmp_, reindexes);
}

}  // namespace fileindex
}  // namespace orvane
