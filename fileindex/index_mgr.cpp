#include "fileindex/index_mgr.hpp"

#include <memory>
#include <set>
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/lock_file.hpp"
#include "common/root.hpp"
#include "common/sdk/share.hpp"
#include "fileindex/communication.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace fileindex {
namespace {

// Held around every load-change-save of the folder file.
class FolderCfgLock {
 public:
  FolderCfgLock() : lock_(RootedPathForWrite(kFolderCfgLockPath), true) {}

 private:
  LockFile lock_;
};

Json::Value ShareNameData(const std::string& share) {
  Json::Value data(Json::objectValue);
  data["share_name"] = share;
  return data;
}

void NotifySettingChanged(const std::string& share, bool is_upsert) {
  Json::Value data = ShareNameData(share);
  data["is_upsert"] = is_upsert;
  SendCommandToDaemon("notify_setting_changed", data);
}

bool SwitchesAnyOn(const Folder& folder) {
  return folder.IsDocument() || folder.IsAudio() || folder.IsVideo() || folder.IsPhoto();
}

void FolderUpsert(const Json::Value& folder_list, bool create, bool updater_mode) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  FolderMgr folder_mgr_orig;
  ORVANE_THROW_IF(!folder_list.isArray(), kErrInvalidParam, JsonToString(folder_list));

  std::vector<std::shared_ptr<Folder>> diffs;
  std::set<std::string> shares;
  for (const Json::Value& element : folder_list) {
    auto folder_new = std::make_shared<Folder>(element);
    ORVANE_THROW_IF(!CanPathBeIndexed(folder_new->GetPath()) && !updater_mode, kErrPathCannotIndex,
                    "Path cannot index: " + folder_new->GetPath());
    ORVANE_THROW_IF(create && folder_mgr.HasFolder(folder_new->GetPath()), kErrFolderInvalid,
                    "Duplicated ID: " + folder_new->GetPath());
    std::shared_ptr<Folder> diff;
    folder_mgr.Upsert(diff, folder_new);
    // A change that flips no switch leaves nothing for the indexer to re-read.
    diffs.push_back(diff && SwitchesAnyOn(*diff) ? diff : nullptr);

    const std::string share_name = folder_new->GetShare();
    sdk::SDKShare share(share_name);
    ORVANE_THROW_IF(!share.IsSpaceEnough(), kErrSpaceNotEnough,
                    "Share (" + share_name + ") space not enough");
    shares.insert(share_name);
  }

  SetupRelatedServices(true);
  for (const std::string& share : shares) {
    if (create && !folder_mgr_orig.IsShareIndexed(share)) elastic::ShareIndexCreate(share);
    UpsertQUIXNotifydCfg(share, folder_mgr);
  }
  folder_mgr.Save();
  // Folder status questions read the status file; a system that never paused has none yet.
  StatusMgr::CreateIfMissing();
  for (const std::string& share : shares) NotifySettingChanged(share, true);
  if (updater_mode) return;
  for (const auto& diff : diffs) {
    if (diff) AddCustomEvent(kEventFolderSettings, diff->GetFullPath(), "", diff->GetIndexCfg());
  }
}

}  // namespace

void FolderAdd(const Json::Value& folder_list, bool updater_mode) {
  FolderUpsert(folder_list, true, updater_mode);
}

void FolderSet(const Json::Value& folder_list, bool updater_mode) {
  FolderUpsert(folder_list, false, updater_mode);
}

}  // namespace fileindex
}  // namespace orvane
