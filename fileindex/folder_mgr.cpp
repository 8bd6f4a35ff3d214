#include "fileindex/folder_mgr.hpp"

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"

namespace orvane {
namespace fileindex {

const char kFileIndexFoldersCfgPath[] = "/var/packages/Orvane/etc/fileindex.folders";
const char kFolderCfgLockPath[] = "/tmp/orvane_cfg_folder.lock";

FolderMgr::FolderMgr() : folders_(Json::arrayValue) {
  const std::string path = RootedPath(kFileIndexFoldersCfgPath);
  JsonValue folders;
  if (IsFileExist(path) && (!folders.fromFile(path) || !folders.isArray())) {
    ThrowError(
        __FILE__, __LINE__, __func__,
        "IsFileExist(kFileIndexFoldersCfgPath) && !folders.fromFile(kFileIndexFoldersCfgPath)",
        kErrLoadConfig, "Cannot load json: " + path);
  }
  if (folders.isArray()) folders_ = folders;
}

}  // namespace fileindex
}  // namespace orvane
