#include "fileindex/index_mgr.hpp"

#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <map>
#include <memory>
#include <set>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/lock_file.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/sdk/credentials.hpp"
#include "common/sdk/share.hpp"
#include "common/sdk/share_path.hpp"
#include "common/util.hpp"
#include "fileindex/communication.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/queue_file.hpp"
#include "fileindex/queue_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"
#include "platform/fileidx.hpp"
#include "platform/monitor_queue.hpp"
#include "platform/safe_dir.hpp"

namespace orvane {
namespace fileindex {

const char kFileIndexUserInfosPath[] = "/var/packages/Orvane/etc/userinfos";

namespace {

constexpr char kUserInfosLockPath[] = "/tmp/orvane_cfg_userinfos.lock";

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
  std::vector<CustomEvent> events;
  for (const auto& diff : diffs) {
    if (diff)
      events.push_back({kEventFolderSettings, diff->GetFullPath(), "", diff->GetIndexCfg()});
  }
  AddCustomEvents(events);
}

}  // namespace

void FolderAdd(const Json::Value& folder_list, bool updater_mode) {
  FolderUpsert(folder_list, true, updater_mode);
}

void FolderSet(const Json::Value& folder_list, bool updater_mode) {
  FolderUpsert(folder_list, false, updater_mode);
}

namespace {

void SendWorkerCommand(const std::string& cmd, const std::string& share) {
  SendCommandToDaemon(cmd, ShareNameData(share));
}

// The folders named by a request of share paths, in request order. Error 120 for a request that
// is not an array of strings, 902 for a path that is not configured.
std::vector<std::shared_ptr<Folder>> RequestedFolders(const FolderMgr& folder_mgr,
                                                      const Json::Value& path_list) {
  ORVANE_THROW_IF(!path_list.isArray(), kErrInvalidParam, JsonToString(path_list));
  std::vector<std::shared_ptr<Folder>> folders;
  for (const Json::Value& it : path_list) {
    ORVANE_THROW_IF(!it.isString(), kErrInvalidParam, JsonToString(it));
    std::shared_ptr<Folder> folder;
    folder_mgr.Get(folder, it.asString());
    folders.push_back(folder);
  }
  return folders;
}

// Reads an optional request member, refusing one of another JSON type.
const Json::Value* OptionalMember(const Json::Value& request, const std::string& key,
                                  bool (*is_type)(const Json::Value&)) {
  const Json::Value* member = request.find(key.data(), key.data() + key.size());
  if (member != nullptr) {
    ORVANE_THROW_IF(!is_type(*member), kErrInvalidParam, "Bad type of " + key + AppendData(request));
  }
  return member;
}

void GetOptional(std::string& out, const Json::Value& request, const std::string& key) {
  auto is_string = [](const Json::Value& v) { return v.isString(); };
  if (const Json::Value* member = OptionalMember(request, key, is_string)) out = member->asString();
}

void GetOptional(unsigned int& out, const Json::Value& request, const std::string& key) {
  auto is_uint = [](const Json::Value& v) {
    return (v.type() == Json::intValue || v.type() == Json::uintValue) && v.isUInt();
  };
  if (const Json::Value* member = OptionalMember(request, key, is_uint)) out = member->asUInt();
}

// The number of lines in a queue file; 0 when there is none.
size_t CountQueueLines(const std::string& path) {
  try {
    QueueFileReader reader(path);
    if (!reader) return 0;
    size_t count = 0;
    std::string line;
    while (reader.ReadLine(&line, kMaxEventLineLength)) ++count;
    return count;
  } catch (const Error&) {
    return 0;  // a refused queue is the worker's to report; the summary still answers
  }
}

std::string ComposeIndexPath(int (*compose)(const char*, char*, size_t),
                             const std::string& share_path) {
  char buf[PATH_MAX];
  ORVANE_THROW_IF(0 > compose(share_path.c_str(), buf, sizeof(buf)), kErrSystem,
                  "Cannot compose index location of " + share_path);
  return buf;
}

// The indexed shares whose folder lies on the volume mounted at `volume`.
std::vector<std::string> SharesOnVolume(const std::string& volume) {
  ORVANE_THROW_IF(volume.empty(), kErrInvalidParam, "Missing volume path");
  FolderMgr folder_mgr;
  const std::string prefix = volume == "/" ? volume : volume + "/";
  std::vector<std::string> shares;
  for (const std::string& share : folder_mgr.GetIndexedShares()) {
    sdk::SDKShare sdk_share(share);
    if (StringStartWith(sdk_share.GetPath() + "/", prefix)) shares.push_back(share);
  }
  return shares;
}

JsonValue LoadUserInfos() {
  const std::string path = RootedPath(kFileIndexUserInfosPath);
  // Under the installation root, and named as the file it stands for so that a failure logs
  // the condition as it reads.
  const char* const kFileIndexUserInfosPath = path.c_str();
  JsonValue user_infos;
  ORVANE_THROW_IF(
      IsFileExist(kFileIndexUserInfosPath) && !user_infos.fromFile(kFileIndexUserInfosPath),
      kErrLoadConfig, "Cannot load json: " + path);
  return user_infos;
}

void SaveUserInfos(const JsonValue& user_infos) {
  const std::string path = RootedPath(kFileIndexUserInfosPath);
  // Under the installation root, and named as the file it stands for so that a failure logs
  // the condition as it reads.
  const char* const kFileIndexUserInfosPath = path.c_str();
  sdk::SDKCredentials root("root");
  ORVANE_THROW_IF(!user_infos.toFile(kFileIndexUserInfosPath), kErrSaveConfig,
                  "Cannot save json: " + path);
  ORVANE_THROW_IF(-1 == chmod(kFileIndexUserInfosPath, 0644), kErrSystem, path);
}

void ReindexHomeRecycleBins(AUTH_TYPE auth) {
  using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them
  std::unique_ptr<QLIBSZLIST, void (*)(PSZLIST)> list(QLIBCSzListAlloc(64), QLIBCSzListFree);
  ORVANE_THROW_IF(!list, kErrSystem, "QLIBCSzListAlloc failed");
  PSZLIST raw = list.release();
  errno = 0;
  const bool all = auth == AUTH_ALL;
  const int count = all ? QUIXRecycleHomeEnumRecyclePath(&raw)
                        : QUIXRecycleHomeEnumRecyclePathForAuthType(&raw, auth);
  list.reset(raw);
  if (0 > count) {
    const char* call =
        all ? "QUIXRecycleHomeEnumRecyclePath" : "QUIXRecycleHomeEnumRecyclePathForAuthType";
    ORVANE_LOG_FAILED("%s failed. auth: %d", call, static_cast<int>(auth));
    return;
  }
  // One bin that cannot be queued must not keep the others from being queued.
  std::unique_ptr<Error> first_error;
  for (int i = 0; i < QLIBCSzListCount(list.get()); ++i) {
    const char* path = QLIBCSzListGet(list.get(), i);
    if (path == nullptr) continue;
    try {
      AddCustomEvent(kEventReindex, path, "", Json::Value());
    } catch (const Error& e) {
      if (!first_error) first_error = std::make_unique<Error>(e);
    }
  }
  if (first_error) throw *first_error;
}

}  // namespace

void FolderDelete(const Json::Value& path_list) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(!path_list.isArray(), kErrInvalidParam, JsonToString(path_list));
  std::vector<std::shared_ptr<Folder>> diffs;
  std::set<std::string> shares;
  for (const Json::Value& it : path_list) {
    ORVANE_THROW_IF(!it.isString(), kErrInvalidParam, JsonToString(it));
    const std::string path = it.asString();
    ORVANE_THROW_IF(!folder_mgr.HasFolder(path), kErrFolderNotFound, path);
    shares.insert(GetShareNameByPath(path));
    std::shared_ptr<Folder> diff;
    folder_mgr.Delete(diff, path);
    diffs.push_back(diff);
  }

  for (const std::string& share : shares) {
    if (folder_mgr.IsShareIndexed(share)) {
      UpsertQUIXNotifydCfg(share, folder_mgr);
    } else {
      DeleteQUIXNotifydCfg(share);
      elastic::ShareIndexDelete(share);
    }
  }
  folder_mgr.Save();
  for (const std::string& share : shares) NotifySettingChanged(share, false);
  std::vector<CustomEvent> events;
  for (const auto& diff : diffs) {
    // What no folder covers any more leaves with its share's index or through the daemon's own
    // handling of the removal; below another folder only the flipped switches need re-reading.
    const std::string full_path = diff->GetFullPath();
    if (SwitchesAnyOn(*diff) && folder_mgr.IsFullPathIndexed(full_path)) {
      events.push_back({kEventFolderSettings, full_path, "", diff->GetIndexCfg()});
    }
  }
  AddCustomEvents(events);
  if (folder_mgr.folders().empty()) SetupRelatedServices(false);
}

void FolderReindex(const Json::Value& path_list) {
  // Nothing is saved, but the index rebuild must not interleave with another operation's
  // changes to the same share.
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  const std::vector<std::shared_ptr<Folder>> requested = RequestedFolders(folder_mgr, path_list);
  std::map<std::string, std::set<std::string>> asked;
  for (const auto& folder : requested) asked[folder->GetShare()].insert(folder->GetPath());

  std::vector<std::string> rebuilt;
  for (const auto& entry : asked) {
    const std::string& share = entry.first;
    const bool whole_share =
        std::all_of(folder_mgr.folders().begin(), folder_mgr.folders().end(), [&](const auto& f) {
          return f->GetShare() != share || entry.second.count(f->GetPath()) != 0;
        });
    if (!whole_share) continue;
    elastic::ShareIndexDelete(share);
    elastic::ShareIndexCreate(share);
    StatusMgr::CreateIfMissing();
    StatusMgr().UnsetShareStatus(share, kShareStatusNeedReindex);
    rebuilt.push_back(share);
  }
  std::vector<CustomEvent> events;
  for (const auto& folder : requested) {
    events.push_back({kEventReindex, folder->GetFullPath(), "", Json::Value()});
  }
  AddCustomEvents(events);
  for (const std::string& share : rebuilt) SendWorkerCommand("worker_create", share);
}

Json::Value FolderList(const Json::Value& request) {
  ORVANE_THROW_IF(!request.isObject(), kErrInvalidParam, JsonToString(request));
  unsigned int offset = 0;
  unsigned int limit = std::numeric_limits<unsigned int>::max();
  std::string sort_by = "name";
  std::string sort_direction = "asc";
  std::string group = "all";
  std::string keyword;
  Json::Value additionals(Json::arrayValue);
  GetOptional(offset, request, "offset");
  GetOptional(limit, request, "limit");
  GetOptional(sort_by, request, "sort_by");
  GetOptional(sort_direction, request, "sort_direction");
  GetOptional(group, request, "group");
  GetOptional(keyword, request, "keyword");
  if (request.isMember("additional")) additionals = request["additional"];

  FolderMgr folder_mgr;
  std::vector<std::shared_ptr<Folder>> folders;
  unsigned int total = 0;
  folder_mgr.List(folders, total, offset, limit, sort_by, sort_direction, group, keyword);
  Json::Value result(Json::objectValue);
  Json::Value& out = result["folders"] = Json::Value(Json::arrayValue);
  // A malformed additional is refused even when nothing matches.
  ORVANE_THROW_IF(!additionals.isArray(), kErrInvalidParam, JsonToString(additionals));
  for (const Json::Value& it : additionals) {
    ORVANE_THROW_IF(!it.isString() || it.asString() != "status", kErrInvalidParam,
                    "Unknown additioal: " + JsonToString(it));
  }
  for (const auto& folder : folders) out.append(folder->GetDataWithAdditional(additionals));
  result["total"] = Json::Int64{total};
  return result;
}

Json::Value FolderGet(const std::string& path, const Json::Value& additionals) {
  FolderMgr folder_mgr;
  std::shared_ptr<Folder> folder;
  folder_mgr.Get(folder, path);
  return folder->GetDataWithAdditional(additionals);
}

Json::Value FolderListGroups() {
  FolderMgr folder_mgr;
  Json::Value groups(Json::arrayValue);
  for (const std::string& group : folder_mgr.GetGroups()) groups.append(group);
  return groups;
}

Json::Value FolderSummary() {
  FolderMgr folder_mgr;
  StatusMgr status;
  // A system that never paused nor flagged anything may have no status file yet.
  const bool has_status = !status.data().isNull();
  const long long resume_time = has_status ? status.GetPauseInfo() : -1;
  const long long now = static_cast<long long>(Env::Current()->Now());

  Json::Value summary(Json::objectValue);
  summary["folder_count"] = static_cast<Json::Int64>(folder_mgr.folders().size());
  summary["resume_time"] = Json::Int64(resume_time);
  summary["paused"] = resume_time == 0 || resume_time > now;
  Json::Value& shares = summary["shares"] = Json::Value(Json::arrayValue);
  for (const std::string& share : folder_mgr.GetIndexedShares()) {
    sdk::SDKShare sdk_share(share);
    const std::string& queue = sdk_share.GetQueuePath();
    const int bits = has_status ? status.GetShareStatus(share) : 0;
    Json::Value entry(Json::objectValue);
    entry["share"] = share;
    entry["folder_count"] = static_cast<Json::Int64>(
        std::count_if(folder_mgr.folders().begin(), folder_mgr.folders().end(),
                      [&](const auto& f) { return f->GetShare() == share; }));
    entry["queue_length"] =
        static_cast<Json::Int64>(CountQueueLines(queue) + CountQueueLines(queue + ".tmp"));
    entry["status"] = bits;
    entry["need_reindex"] = (bits & kShareStatusNeedReindex) != 0;
    entry["volume_paused"] = (bits & kShareStatusVolumePaused) != 0;
    entry["queue_no_space"] = (bits & kShareStatusQueueNoSpace) != 0;
    entry["watch_limit"] = (bits & kShareStatusWatchLimit) != 0;
    shares.append(entry);
  }
  return summary;
}

Json::Value FolderGetProcessingStatus(const std::string& path) {
  FolderMgr folder_mgr;
  std::shared_ptr<Folder> folder;
  folder_mgr.Get(folder, path);
  Json::Value result(Json::objectValue);
  result["path"] = path;
  folder->GetStatus(result);
  result["pending"] = folder->IsIndexing();
  return result;
}

void ShareRename(const std::string& share_from, const std::string& share_to) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(share_from.empty(), kErrInvalidParam, "Missing share_from");
  ORVANE_THROW_IF(share_to.empty(), kErrInvalidParam, "Missing share_to");
  for (const auto& folder : folder_mgr.folders()) {
    if (folder->GetShare() == share_from) folder->SetShare(share_to);
  }
  folder_mgr.Changed();
  folder_mgr.Save();

  sdk::SDKShare share(share_to);
  elastic::ShareIndexRename(share_from, share_to, share.GetDBPath());
  const std::string path = share.GetPath();
  AddCustomEvent(kEventRename, path, ReplacePathShare(path, share_from, share_to), Json::Value());
}

void SharePause(const std::string& share) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  if (!folder_mgr.IsShareIndexed(share)) return;
  SendWorkerCommand("worker_delete", share);
  DeleteQUIXNotifydCfg(share);
  elastic::ShareIndexPause(share);
  for (const auto& folder : folder_mgr.folders()) {
    if (folder->GetShare() == share) folder->SetPaused(true);
  }
  folder_mgr.Save();
}

void ShareResume(const std::string& share) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  if (!folder_mgr.IsShareIndexed(share)) return;
  elastic::ShareIndexResume(share);
  UpsertQUIXNotifydCfg(share, folder_mgr);
  SendWorkerCommand("worker_create", share);
  for (const auto& folder : folder_mgr.folders()) {
    if (folder->GetShare() == share) folder->SetPaused(false);
  }
  folder_mgr.Save();
}

void ShareRebuild(const std::string& share) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  sdk::SDKShare sdk_share(share);
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  if (!folder_mgr.IsShareIndexed(share)) return;
  elastic::ShareIndexDelete(share);
  elastic::ShareIndexCreate(share);
  UpsertQUIXNotifydCfg(share, folder_mgr);
  AddCustomEvent(kEventReindex, sdk_share.GetPath(), "", Json::Value());
  SendWorkerCommand("worker_create", share);
}

void ShareClearPaused(const std::string& share, const std::string& share_path) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  ORVANE_THROW_IF(share_path.empty(), kErrInvalidParam, "Missing share path");
  CleanShareIndexData(share, share_path);
  elastic::ShareIndexDelete(share);
  folder_mgr.DeleteByShare(share);
  folder_mgr.Save();
  if (folder_mgr.folders().empty()) SetupRelatedServices(false);
}

void ShareAutoClean(const std::string& share) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  sdk::SDKShare sdk_share(share);
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  if (folder_mgr.IsShareIndexed(share)) return;
  elastic::ShareIndexDelete(share);
  DeleteQUIXNotifydCfg(share);
  CleanShareIndexData(share, sdk_share.GetPath());
}

void ShareCheckRecycle(const std::string& share) {
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  sdk::SDKShare sdk_share(share);
  const std::string recycle = sdk_share.GetPath() + "/#recycle";
  if (IsDirExist(recycle, false)) AddCustomEvent(kEventReindex, recycle, "", Json::Value());
}

void ShareMigrate(const std::string& share, const std::string& share_path_from) {
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  ORVANE_THROW_IF(share.empty(), kErrInvalidParam, "Missing share name");
  ORVANE_THROW_IF(share_path_from.empty(), kErrInvalidParam, "Missing share path");
  if (!folder_mgr.IsShareIndexed(share)) return;
  sdk::SDKShare sdk_share(share);
  elastic::ShareIndexMigrate(share, sdk_share.GetDBPath());
  const std::string old_queue =
      ComposeIndexPath(platform::FILEIDXQueuePathCompose, share_path_from);
  ORVANE_THROW_IF(!QUIX::QUIXNOTIFYD::MonitorQueue::Delete(
                      old_queue, kAppName, QUIX::QUIXNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION),
                  kErrSystem, "MonitorQueue::Delete failed, share=" + share);
  UpsertQUIXNotifydCfg(share, folder_mgr);
  AddCustomEvent(kEventRename, sdk_share.GetPath(), share_path_from, Json::Value());
  SendWorkerCommand("worker_create", share);
}

void CleanShareIndexData(const std::string& share, const std::string& share_path) {
  ORVANE_THROW_IF(share_path.empty() || share_path[0] != '/', kErrInvalidParam,
                  "Bad share path of " + share + ": " + share_path);
  const std::string queue = ComposeIndexPath(platform::FILEIDXQueuePathCompose, share_path);
  const std::string db = ComposeIndexPath(platform::FILEIDXDBPathCompose, share_path);
  // Through the folders' own descriptors, never a link: a planted "@eaDir" link must not make
  // root remove files somewhere else.
  auto remove = [](const std::string& path) {
    const platform::SafeDir dir = platform::SafeDir::Open(Dirname(path), false);
    if (!dir.valid()) return;
    ORVANE_THROW_IF(0 != dir.RemoveTree(Basename(path)), kErrSystem, "Cannot remove: " + path);
  };
  remove(queue);
  remove(queue + ".tmp");
  remove(db);
}

void VolumePause(const std::string& volume) {
  for (const std::string& share : SharesOnVolume(volume)) {
    SharePause(share);
    StatusMgr::CreateIfMissing();
    StatusMgr().SetShareStatus(share, kShareStatusVolumePaused);
  }
}

void VolumeResume(const std::string& volume) {
  for (const std::string& share : SharesOnVolume(volume)) {
    ShareResume(share);
    StatusMgr::CreateIfMissing();
    StatusMgr().UnsetShareStatus(share, kShareStatusVolumePaused);
  }
}

void VolumeClearPaused(const std::string& volume) {
  for (const std::string& share : SharesOnVolume(volume)) {
    std::string share_path;
    {
      sdk::SDKShare sdk_share(share);
      share_path = sdk_share.GetPath();
    }
    ShareClearPaused(share, share_path);
    StatusMgr::CreateIfMissing();
    StatusMgr().ClearShareStatus(share);
  }
}

void UserRename(const std::string& user_from, const std::string& user_to) {
  ORVANE_THROW_IF(user_from.empty(), kErrInvalidParam, "Missing user_from");
  ORVANE_THROW_IF(user_to.empty(), kErrInvalidParam, "Missing user_to");
  FolderCfgLock lock;
  FolderMgr folder_mgr;
  const std::string home_from = "/homes/" + user_from;
  const std::string home_to = "/homes/" + user_to;
  for (const auto& folder : folder_mgr.folders()) {
    const std::string& path = folder->GetPath();
    if (!StringStartWith(path + "/", home_from + "/")) continue;
    const std::string new_path = home_to + path.substr(home_from.size());
    ORVANE_LOG(LOG_ERR, "Update homes rule: [%s] -> [%s]", path.c_str(), new_path.c_str());
    folder->SetPath(new_path);
  }
  folder_mgr.Changed();
  folder_mgr.Save();
  AddCustomEvent(kEventRename, GetFullPath(home_to), GetFullPath(home_from), Json::Value());
}

void UserDelete(unsigned int uid) {
  Json::Value paths(Json::arrayValue);
  const std::string key = std::to_string(uid);
  {
    FolderMgr folder_mgr;
    JsonValue user_infos = LoadUserInfos();
    Json::Value user_info;
    std::string home_path;
    GetJsonValue(user_info, user_infos, key, true);
    GetJsonValue(home_path, user_info, "home_path", true);
    for (const auto& folder : folder_mgr.folders()) {
      if (StringStartWith(folder->GetPath() + "/", home_path + "/")) {
        paths.append(folder->GetPath());
      }
    }
  }
  if (!paths.empty()) FolderDelete(paths);

  LockFile lock(RootedPathForWrite(kUserInfosLockPath), true);
  JsonValue user_infos = LoadUserInfos();
  if (user_infos.isObject() && user_infos.isMember(key)) {
    user_infos.removeMember(key);
    SaveUserInfos(user_infos);
  }
}

void UserRemember(unsigned int uid) {
  std::unique_ptr<sdk::User> user = GetUserByUID(uid);
  const std::string& home = user->GetHomePath();
  if (home.empty()) {
    ORVANE_LOG(LOG_DEBUG, "User [%s] has no home to remember", user->GetName().c_str());
    return;
  }
  const std::string home_path = sdk::SharePathMgr::GetSharePath(home, *user, false);
  ORVANE_THROW_IF(home_path.empty(), kErrSystem, "No share holds the home of " + user->GetName());

  LockFile lock(RootedPathForWrite(kUserInfosLockPath), true);
  JsonValue user_infos = LoadUserInfos();
  if (user_infos.isNull()) user_infos = Json::Value(Json::objectValue);
  ORVANE_THROW_IF(!user_infos.isObject(), kErrInvalidParam,
                  "Not an object" + AppendData(user_infos));
  user_infos[std::to_string(uid)]["home_path"] = home_path;
  SaveUserInfos(user_infos);
}

void HomeEnable(AUTH_TYPE auth) { ReindexHomeRecycleBins(auth); }

void HomeDisable(AUTH_TYPE auth) { ReindexHomeRecycleBins(auth); }

}  // namespace fileindex
}  // namespace orvane
