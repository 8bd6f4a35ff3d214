#include "fileindex/notifyd_cfg.hpp"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <unordered_set>
#include <utility>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/sdk/share.hpp"
#include "common/util.hpp"
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

namespace {

// The lines gathered for one share's queue.
struct QueueBatch {
  std::string queue_path;
  bool can_be_indexed = false;
  // Paths whose plain re-index is queued (in the queue, its side file or this batch).
  std::unordered_set<std::string> reindexed;
  std::string lines;
};

// A re-index that only asks for the differences between a folder and its index. It does not
// stand in for a plain re-index, which reads every file again.
bool IsReconcile(uint32_t event, const Json::Value& data) {
  return event == kEventReindex && data.isObject() && data["reconcile"].asBool();
}

// Reads the plain re-index paths of one queue file; malformed lines fail as they would for the
// queue's own questions.
void CollectReindexes(const std::string& path, std::unordered_set<std::string>& out) {
  QueueMgr::FindQueue(path, [&out](const Event& event) {
    if (event.event == kEventReindex && !IsReconcile(event.event, event.data)) {
      out.insert(event.path);
    }
    return false;
  });
}

// Whether `path` or one of its ancestors is in `reindexed`.
bool HasReindex(const std::unordered_set<std::string>& reindexed, const std::string& path) {
  if (reindexed.empty()) return false;
  size_t end = path.size();
  while (true) {
    if (reindexed.count(path.substr(0, end)) != 0) return true;
    if (end == 0) return false;
    end = path.rfind('/', end - 1);
    if (end == std::string::npos) return false;
  }
}

void LogEventFailure(const Error& e, const std::string& share_name) {
  ORVANE_LOG_FAILED_IN("AddCustomEvent", "AddCustomEvent failed, code=%d, reason=%s. Set [%s] need reindex",
                       e.code, e.what(), share_name.c_str());
  // Without a share there is nothing to flag; a flag that cannot be stored must not hide the
  // error that the caller is owed.
  if (share_name.empty()) return;
  try {
    StatusMgr status;
    status.SetShareStatus(share_name, kShareStatusNeedReindex);
  } catch (const Error& flag_error) {
    ORVANE_LOG(LOG_ERR, "Cannot flag [%s] for re-index: %s", share_name.c_str(),
               flag_error.what());
  }
}

// Appends each share's gathered lines; the first failure is logged, flagged and thrown.
void FlushBatches(std::vector<std::pair<std::string, QueueBatch>>& batches) {
  for (auto& entry : batches) {
    QueueBatch& batch = entry.second;
    if (batch.lines.empty()) continue;
    try {
      // The append takes the queue's lock and makes sure the file it locked is still the live
      // queue, so a line never lands in a batch that the indexer has already taken.
      ORVANE_THROW_IF_IN("AddCustomEvent", !QueueFileAppend(batch.queue_path, batch.lines),
                         kErrSystem, "Cannot append to queue: " + batch.queue_path);
      batch.lines.clear();
    } catch (const Error& e) {
      LogEventFailure(e, entry.first);
      throw;
    }
  }
}

}  // namespace

void AddCustomEvents(const std::vector<CustomEvent>& events) {
  // Shares in order of first appearance, each with its gathered lines.
  std::vector<std::pair<std::string, QueueBatch>> batches;
  for (const CustomEvent& custom : events) {
    std::string share_name;
    try {
      std::string share_path;
      GetShareNamePathByFullPath(share_name, share_path, custom.path);
      auto it = std::find_if(batches.begin(), batches.end(),
                             [&](const auto& b) { return b.first == share_name; });
      if (it == batches.end()) {
        QueueBatch batch;
        sdk::SDKShare share(share_name);
        batch.queue_path = share.GetQueuePath();
        batch.can_be_indexed = share.CanBeIndexed();
        if (batch.can_be_indexed) {
          CollectReindexes(batch.queue_path, batch.reindexed);
          CollectReindexes(batch.queue_path + ".tmp", batch.reindexed);
        }
        batches.emplace_back(share_name, std::move(batch));
        it = batches.end() - 1;
      }
      QueueBatch& batch = it->second;
      // A queued re-index of an ancestor will read everything below it again anyway.
      if (!batch.can_be_indexed || HasReindex(batch.reindexed, custom.path)) continue;

      Json::Value line(Json::objectValue);
      line["event"] = custom.event;
      line["path"] = custom.path;
      line["path_old"] = custom.path_old;
      line["data"] = custom.data;
      const auto bits = static_cast<uint32_t>(custom.event);
      // A reconciliation is always of a folder.
      if (IsReconcile(bits, custom.data)) line["is_dir"] = true;
      batch.lines += JsonToString(line) + "\n";
      if (bits == kEventReindex && !IsReconcile(bits, custom.data)) {
        batch.reindexed.insert(custom.path);
      }
    } catch (const Error& e) {
      // What was gathered before the failure is still written.
      try {
        FlushBatches(batches);
      } catch (const Error&) {
      }
      LogEventFailure(e, share_name);
      throw;
    }
  }
  FlushBatches(batches);
}

void AddCustomEvent(int event, const std::string& path, const std::string& path_old,
                    const Json::Value& data) {
  AddCustomEvents({CustomEvent{event, path, path_old, data}});
}

namespace {

// Sets the file-sharing search integration to `enable` when it is not already so, restarting
// file sharing so that the change takes effect.
void SetSearchIntegration(bool enable, const char* func) {
  // A setting that cannot be read (-1) is left alone either way.
  const int state = QUIXSMBIsEnableSpotlight();
  if (state != (enable ? 0 : 1)) return;
  errno = 0;
  if (0 > QUIXSMBSetSpotlight(enable ? 1 : 0)) {
    // The platform error number and where the platform recorded it.
    ORVANE_LOG_FAILED_IN(func, "QUIXSMBSetSpotlight failed: err=[0x%04X %s:%d]", QLIBCErrGet(),
                         QLIBCErrFileGet(), QLIBCErrLineGet());
    return;
  }
  errno = 0;
  if (0 > QLIBServiceRestart("samba")) {
    ORVANE_LOG_FAILED_IN(func, "QLIBServiceRestart failed: err=[0x%04X %s:%d]", QLIBCErrGet(),
                         QLIBCErrFileGet(), QLIBCErrLineGet());
  }
}

}  // namespace

void SetupRelatedServices(bool enable) {
  SetSearchIntegration(enable, __func__);
  errno = 0;
  if (enable) {
    ORVANE_LOG_IF(0 > QLIBServiceStart("quixcontentextractd", TRUE));
    errno = 0;
    ORVANE_LOG_IF(0 > QLIBServicectlStart("pkg-Orvane-fileindexd", QLIB_SERVICECTL_UPSTART));
  } else {
    ORVANE_LOG_IF(0 > QLIBServicectlStop("pkg-Orvane-fileindexd", QLIB_SERVICECTL_UPSTART));
  }
}

void PrepareServices() {
  FolderMgr folders;
  SetupRelatedServices(!folders.folders().empty());
}

}  // namespace fileindex
}  // namespace orvane
