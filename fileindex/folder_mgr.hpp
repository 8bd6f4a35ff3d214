// FolderMgr is the in-memory list of indexed folders, loaded from the folder configuration file
// when constructed. A short-lived value: build one per operation; not thread-safe.
#ifndef ORVANE_FILEINDEX_FOLDER_MGR_HPP_
#define ORVANE_FILEINDEX_FOLDER_MGR_HPP_

#include <json/json.h>

#include <string>

namespace orvane {
namespace fileindex {

// Fixed paths, resolved through RootedPath() where opened.
extern const char kFileIndexFoldersCfgPath[];
extern const char kFolderCfgLockPath[];

class FolderMgr {
 public:
  // Loads the folder file; a missing file is an empty list, a malformed one throws Error 504.
  FolderMgr();
  FolderMgr(const FolderMgr&) = delete;
  FolderMgr& operator=(const FolderMgr&) = delete;

  // The folder records in file order.
  const Json::Value& folders() const { return folders_; }

 private:
  Json::Value folders_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_FOLDER_MGR_HPP_
