// FolderMgr is the in-memory list of indexed folders, loaded from the folder file when
// constructed and written back only by Save(). It answers which folder governs a path, keeps the
// list consistent on insert and delete, reports which content switches a change flips, and
// serves the administration listing. A short-lived value: build one per operation, under the
// folder lock when it is to be saved; not thread-safe.
#ifndef ORVANE_FILEINDEX_FOLDER_MGR_HPP_
#define ORVANE_FILEINDEX_FOLDER_MGR_HPP_

#include <json/json.h>

#include <memory>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "fileindex/folder.hpp"

namespace orvane {
namespace fileindex {

// Fixed paths, resolved through RootedPath() where opened.
extern const char kFileIndexFoldersCfgPath[];
extern const char kFolderCfgLockPath[];

class FolderMgr {
 public:
  // Loads the folder file; a missing file is an empty list. Error 504 when it cannot be parsed
  // or its root is not an array, Error 120 for a malformed record.
  FolderMgr();
  ~FolderMgr();
  FolderMgr(const FolderMgr&) = delete;
  FolderMgr& operator=(const FolderMgr&) = delete;

  // Writes the list as root with mode 0644 (Error 505 / 502).
  void Save() const;

  // The first folder whose stored path is `path`; Error 902 when there is none.
  void Get(std::shared_ptr<Folder>& out, const std::string& path) const;
  bool HasFolder(const std::string& path) const;
  // The deepest folder at or above `full_path` (the earlier one among equals); null when none.
  std::shared_ptr<Folder> GetMostSuitableCfg(const std::string& full_path) const;
  bool IsFullPathIndexed(const std::string& full_path) const;
  // `full_path` is itself a configured folder.
  bool IsFullPathHasOwnCfg(const std::string& full_path) const;
  // Whether the governing folder wants metadata of this file's kind (true for other kinds).
  bool IsFullPathNeedMeta(const std::string& full_path) const;
  bool IsShareIndexed(const std::string& share) const;
  std::set<std::string> GetIndexedShares() const;
  std::set<std::string> GetGroups() const;

  // Replaces every folder of `folder`'s path with `folder`, at the end of the list; `diff` says
  // which switches the change flips for that path.
  void Upsert(std::shared_ptr<Folder>& diff, std::shared_ptr<Folder> folder);
  // Removes the folders of `path` (which must be configured); `diff` as for Upsert.
  void Delete(std::shared_ptr<Folder>& diff, const std::string& path);
  void DeleteByShare(const std::string& share);
  // What must be (re)indexed when `now`'s path goes from `base`'s settings to `now`'s.
  std::shared_ptr<Folder> DiffCfg(std::shared_ptr<Folder> now, std::shared_ptr<Folder> base);

  // Filtered (group, keyword in the name), counted, sorted and paged copy of the list.
  void List(std::vector<std::shared_ptr<Folder>>& out, unsigned int& total, unsigned int offset,
            unsigned int limit, const std::string& sort_by, const std::string& sort_direction,
            const std::string& group, const std::string& keyword) const;

  // Every record, in file order. A caller that changes a record's path or share through its
  // pointer calls Changed() afterwards.
  const std::vector<std::shared_ptr<Folder>>& folders() const { return folders_; }
  void Changed() { by_full_path_.reset(); }

 private:
  // Full path -> position of the first folder with that full path, built on first look-up.
  using FullPathIndex = std::unordered_map<std::string, size_t>;
  const FullPathIndex& Index() const;

  std::vector<std::shared_ptr<Folder>> folders_;
  mutable std::unique_ptr<FullPathIndex> by_full_path_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_FOLDER_MGR_HPP_
