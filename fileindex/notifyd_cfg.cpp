#include "fileindex/notifyd_cfg.hpp"

#include <syslog.h>
#include <unistd.h>

#include <cerrno>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/sdk/share.hpp"
#include "fileindex/queue_file.hpp"
#include "fileindex/queue_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"
#include "platform/monitor_queue.hpp"
#include "platform/platform_error.hpp"
#include "platform/service.hpp"

namespace orvane {
namespace fileindex {

using QUIX::QUIXNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION;
using QUIX::QUIXNOTIFYD::MonitorQueue;
using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them

const char kAppName[] = "fileindex";

void UpsertQUIXNotifydCfg(const std::string& share, FolderMgr& folders) {
  sdk::SDKShare sdk_share(share);
  Json::Value monitor_queue(Json::objectValue);
  monitor_queue["queue"] = sdk_share.GetQueuePath();
  Json::Value& config = monitor_queue["config"] = Json::Value(Json::arrayValue);
  for (const auto& folder : folders.folders()) {
    if (folder->GetShare() != share) continue;
    Json::Value entry(Json::objectValue);
    entry["path"] = folder->GetFullPath();
    entry["mask"] = kMonitorMask;
    entry["ignore"].append("@eaDir");
    config.append(entry);
  }
  ORVANE_THROW_IF(!MonitorQueue::Upsert(monitor_queue, kAppName, MONITOR_QUEUE_TYPE_APPLICATION),
                  kErrSystem, "MonitorQueue::Upsert failed, share=" + share);
}

void DeleteQUIXNotifydCfg(const std::string& share_name) {
  sdk::SDKShare share(share_name);
  ORVANE_THROW_IF(
      !MonitorQueue::Delete(share.GetQueuePath(), kAppName, MONITOR_QUEUE_TYPE_APPLICATION),
      kErrSystem, "MonitorQueue::Delete failed, share=" + share_name);
}

void AddCustomEvent(int event, const std::string& path, const std::string& path_old,
                    const Json::Value& data) {
  std::string share_name;
  try {
    std::string share_path;
    GetShareNamePathByFullPath(share_name, share_path, path);
    sdk::SDKShare share(share_name);
    const std::string& queue_path = share.GetQueuePath();
    QueueMgr queue(queue_path);
    // A queued re-index of an ancestor will read everything below it again anyway.
    if (!share.CanBeIndexed() || queue.IsFullPathHasReindex(path)) return;

    Json::Value line(Json::objectValue);
    line["event"] = event;
    line["path"] = path;
    line["path_old"] = path_old;
    line["data"] = data;
    // The append takes the queue's lock and makes sure the file it locked is still the live
    // queue, so a line never lands in a batch that the indexer has already taken.
    if (!QueueFileAppend(queue_path, JsonToString(line) + "\n")) {
      ThrowError(__FILE__, __LINE__, __func__, "!QueueFileAppend(queue_path, line)", kErrSystem,
                 "Cannot append to queue: " + queue_path);
    }
  } catch (const Error& e) {
    if (errno != 0) {
      Log(LOG_ERR,
          "%s:%d (%d, %u) (%s) AddCustomEvent failed, code=%d, reason=%s. Set [%s] need reindex "
          "[err: %m]",
          SourceName(__FILE__), __LINE__, getpid(), geteuid(), __func__, e.code, e.what(),
          share_name.c_str());
      errno = 0;
    } else {
      Log(LOG_ERR,
          "%s:%d (%d, %u) (%s) AddCustomEvent failed, code=%d, reason=%s. Set [%s] need reindex",
          SourceName(__FILE__), __LINE__, getpid(), geteuid(), __func__, e.code, e.what(),
          share_name.c_str());
    }
    // Without a share there is nothing to flag; a flag that cannot be stored must not hide the
    // error that the caller is owed.
    if (!share_name.empty()) {
      try {
        StatusMgr status;
        status.SetShareStatus(share_name, kShareStatusNeedReindex);
      } catch (const Error& flag_error) {
        Log(LOG_ERR, "%s:%d Cannot flag [%s] for re-index: %s", SourceName(__FILE__), __LINE__,
            share_name.c_str(), flag_error.what());
      }
    }
    throw;
  }
}

namespace {

// Logs a platform call's failure with the platform error number and where it was recorded.
void LogPlatformFailure(int line, const char* func, const char* call) {
  if (errno != 0) {
    Log(LOG_ERR, "%s:%d (%d, %u) (%s) %s failed: err=[0x%04X %s:%d] [err: %m]",
        SourceName(__FILE__), line, getpid(), geteuid(), func, call, QLIBCErrGet(),
        QLIBCErrFileGet(), QLIBCErrLineGet());
    errno = 0;
  } else {
    Log(LOG_ERR, "%s:%d (%d, %u) (%s) %s failed: err=[0x%04X %s:%d]", SourceName(__FILE__), line,
        getpid(), geteuid(), func, call, QLIBCErrGet(), QLIBCErrFileGet(), QLIBCErrLineGet());
  }
}

// Sets the file-sharing search integration to `enable` when it is not already so, restarting
// file sharing so that the change takes effect.
void SetSearchIntegration(bool enable, const char* func) {
  // A setting that cannot be read (-1) is left alone either way.
  const int state = QUIXSMBIsEnableSpotlight();
  if (state != (enable ? 0 : 1)) return;
  errno = 0;
  if (0 > QUIXSMBSetSpotlight(enable ? 1 : 0)) {
    LogPlatformFailure(__LINE__, func, "QUIXSMBSetSpotlight");
    return;
  }
  errno = 0;
  if (0 > QLIBServiceRestart("samba")) LogPlatformFailure(__LINE__, func, "QLIBServiceRestart");
}

}  // namespace

void SetupRelatedServices(bool enable) {
  const char* func = "SetupRelatedServices";
  SetSearchIntegration(enable, func);
  errno = 0;
  if (enable) {
    if (0 > QLIBServiceStart("quixcontentextractd", TRUE)) {
      LogFailure(__FILE__, __LINE__, func, "0 > QLIBServiceStart(\"quixcontentextractd\", TRUE)");
    }
    errno = 0;
    if (0 > QLIBServicectlStart("pkg-Orvane-fileindexd", QLIB_SERVICECTL_UPSTART)) {
      LogFailure(__FILE__, __LINE__, func,
                 "0 > QLIBServicectlStart(\"pkg-Orvane-fileindexd\", QLIB_SERVICECTL_UPSTART)");
    }
  } else {
    if (0 > QLIBServicectlStop("pkg-Orvane-fileindexd", QLIB_SERVICECTL_UPSTART)) {
      LogFailure(__FILE__, __LINE__, func,
                 "0 > QLIBServicectlStop(\"pkg-Orvane-fileindexd\", QLIB_SERVICECTL_UPSTART)");
    }
  }
}

void PrepareServices() {
  FolderMgr folders;
  SetupRelatedServices(!folders.folders().empty());
}

}  // namespace fileindex
}  // namespace orvane
