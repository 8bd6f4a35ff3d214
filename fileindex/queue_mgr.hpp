// QueueMgr owns the two files of one share's event queue: the live queue that the file-change
// daemon appends to, and the ".tmp" side file holding the batch being worked off. A batch is
// taken by renaming the live queue under its own lock, so writers start a fresh file; a side
// file left by an interrupted pass is finished first. One per pass; not thread-safe.
//
// Writers append under LockFile(queue path) too, and must check after locking that the file
// they locked is still the one at the path (it may have just been renamed to the side file).
#ifndef ORVANE_FILEINDEX_QUEUE_MGR_HPP_
#define ORVANE_FILEINDEX_QUEUE_MGR_HPP_

#include <functional>
#include <memory>
#include <string>

#include "fileindex/optree.hpp"

namespace orvane {
namespace fileindex {

class QueueMgr {
 public:
  explicit QueueMgr(const std::string& queue_path);
  QueueMgr(const QueueMgr&) = delete;
  QueueMgr& operator=(const QueueMgr&) = delete;

  // Moves the live queue to the side file unless a side file is already waiting.
  // Throws Error 502 when the rename fails, Error 506 when the queue lock cannot be taken.
  void PrepareTmpQueue();
  // The tree of the live queue / of the side file, built on first call and cached.
  std::shared_ptr<OPTree> GetOPTree() const;
  std::shared_ptr<OPTree> GetOPTreeTmp() const;
  // With `tmp`, takes a batch and hands out the side file's operations; otherwise reads the live
  // queue in place. Returns what OPTree::ProcessOP returns, 0 when there is no file.
  size_t ProcessOP(std::function<void(std::shared_ptr<OP>)> callback, bool tmp);
  // Removes the side file once its batch is done.
  void DeleteTmp();

  // Whether an event in either file concerns `full_path` or something below it, under its new
  // or its former name. Errors of malformed lines propagate.
  bool IsFullPathProcessing(const std::string& full_path);
  // Whether a plain re-index of `full_path` or of one of its ancestors is queued.
  bool IsFullPathHasReindex(const std::string& full_path);

  // Whether `pred` holds for an event of the queue file at `path`, read in order until it does;
  // false when there is no file. Throws Error 502 when the file cannot be opened, Error 906 for a
  // line over the event limit. A `pred` that always answers false visits every event.
  static bool FindQueue(const std::string& path, const std::function<bool(const Event&)>& pred);

 private:
  std::string queue_path_;
  std::string queue_path_tmp_;
  mutable std::shared_ptr<OPTree> op_tree_;
  mutable std::shared_ptr<OPTree> op_tree_tmp_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_QUEUE_MGR_HPP_
