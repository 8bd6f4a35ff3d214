#include "daemons/fileindexd/index_daemon.hpp"

#include <syslog.h>
#include <unistd.h>

#include <memory>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/sdk/sdk_mutex.hpp"
#include "common/sdk/share.hpp"
#include "daemons/fileindexd/server.hpp"
#include "fileindex/folder.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/notifyd_cfg.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/user.hpp"

namespace orvane {
namespace fileindexd {

namespace {

Json::Value Ok(Json::Value data = Json::Value(Json::objectValue)) {
  Json::Value r(Json::objectValue);
  r["success"] = true;
  r["data"] = std::move(data);
  return r;
}

std::string ShareOf(const Json::Value& data) {
  const Json::Value& share = data.isObject() ? data["share_name"] : Json::Value::null;
  ORVANE_THROW_IF(!share.isString() || share.asString().empty(), kErrInvalidParam,
                  "\"share_name\" missing");
  return share.asString();
}

// The members of a worker's report that everyone may see: counts and states. The rest (the last
// error's text, the folders reconciled) names files of the share, which only administrators may
// know of.
// clang-format off
const char* const kPublicReportMembers[] = {
    "share", "queue_length", "ops_pending", "ops_done", "documents_written", "documents_deleted",
    "last_pass", "errors", "paused", "out_of_space", "long_paths", "state", "passes"};
// clang-format on

Json::Value PublicReport(const Json::Value& report) {
  Json::Value r(Json::objectValue);
  for (const char* key : kPublicReportMembers) {
    if (report.isMember(key)) r[key] = report[key];
  }
  return r;
}

}  // namespace

bool IsPrivilegedCaller(uid_t uid) {
  if (uid == 0 || uid == geteuid()) return true;
  LockMutex lock(sdk::SDKMutex());
  platform::PQUIXUSER user = nullptr;
  if (platform::QUIXUserGetByUID(uid, &user) != 0 || user == nullptr) return false;
  using UserPtr = std::unique_ptr<platform::QUIXUSER, void (*)(platform::PQUIXUSER)>;
  const UserPtr owned(user, platform::QUIXUserFree);
  return platform::QLIBGroupIsAdminGroupMem(user->szName, 0) == 1;
}

IndexDaemon::IndexDaemon() = default;

IndexDaemon::~IndexDaemon() { StopAll(); }

void IndexDaemon::Start() {
  try {
    // Flags recorded by the workers (a full volume) need the file to exist.
    fileindex::StatusMgr::CreateIfMissing();
    fileindex::StatusMgr status;
    if (status.data().isObject()) resume_time_.store(status.GetPauseInfo());
  } catch (const Error& e) {
    Log(LOG_ERR, "fileindexd: cannot read the pause from the status file: %s", e.what());
  }
  Reload();
}

void IndexDaemon::ReadShares(std::set<std::string>* indexed, std::set<std::string>* paused) {
  fileindex::FolderMgr folders;
  std::map<std::string, bool> all_paused;
  for (const auto& folder : folders.folders()) {
    const std::string share = folder->GetShare();
    indexed->insert(share);
    auto it = all_paused.emplace(share, true).first;
    it->second = it->second && folder->IsPaused();
  }
  for (const auto& [share, is_paused] : all_paused) {
    if (is_paused) paused->insert(share);
  }
}

void IndexDaemon::Reload() {
  std::set<std::string> indexed, paused;
  ReadShares(&indexed, &paused);
  std::vector<std::string> to_stop;
  {
    std::lock_guard<std::mutex> lock(mu_);
    // A share whose folders are now all paused stops as it would not have started.
    for (const auto& [share, worker] : workers_) {
      if (indexed.count(share) == 0 || paused.count(share) != 0) to_stop.push_back(share);
    }
  }
  for (const auto& share : to_stop) StopWorker(share);
  for (const auto& share : indexed) {
    if (paused.count(share) != 0) continue;
    // One share the platform no longer knows must not keep the others from starting.
    try {
      StartWorker(share);
    } catch (const Error& e) {
      Log(LOG_ERR, "fileindexd: no worker for share %s: %s", share.c_str(), e.what());
    }
  }
}

void IndexDaemon::StartWorker(const std::string& share) {
  std::lock_guard<std::mutex> lock(mu_);
  auto it = workers_.find(share);
  if (it != workers_.end()) {
    it->second->Wake();
    return;
  }
  sdk::SDKShare sdk_share(share);
  Worker::PauseGate gate;
  gate.paused = [this] { return IsPaused(); };
  gate.resume_at = [this] {
    const long long t = resume_time_.load();
    return static_cast<time_t>(t > 0 ? t : 0);
  };
  auto worker = std::make_unique<Worker>(share, sdk_share.GetQueuePath(), std::move(gate));
  worker->Start();
  Log(LOG_INFO, "fileindexd: worker of share %s started", share.c_str());
  workers_.emplace(share, std::move(worker));
}

void IndexDaemon::StopWorker(const std::string& share) {
  std::unique_ptr<Worker> worker;
  {
    std::lock_guard<std::mutex> lock(mu_);
    auto it = workers_.find(share);
    if (it == workers_.end()) return;
    worker = std::move(it->second);
    workers_.erase(it);
  }
  // Joined outside the lock: a worker may be finishing an operation.
  worker->Stop();
  Log(LOG_INFO, "fileindexd: worker of share %s stopped", share.c_str());
}

void IndexDaemon::StopAll() {
  std::map<std::string, std::unique_ptr<Worker>> workers;
  {
    std::lock_guard<std::mutex> lock(mu_);
    workers.swap(workers_);
  }
  // Ask all first, so their operations end together rather than one after another.
  for (auto& [share, worker] : workers) worker->RequestStop();
  workers.clear();
}

void IndexDaemon::ReconcileAll() {
  try {
    fileindex::FolderMgr folders;
    Json::Value reconcile(Json::objectValue);
    reconcile["reconcile"] = true;
    std::vector<fileindex::CustomEvent> events;
    for (const auto& folder : folders.folders()) {
      events.push_back(
          {static_cast<int>(fileindex::kEventReindex), folder->GetFullPath(), "", reconcile});
    }
    fileindex::AddCustomEvents(events);
    Log(LOG_INFO, "fileindexd: reconciliation of %zu folders queued", events.size());
  } catch (const Error& e) {
    Log(LOG_ERR, "fileindexd: cannot queue the reconciliation of the indexed folders: %s",
        e.what());
  }
}

bool IndexDaemon::IsPaused() const {
  const long long t = resume_time_.load();
  return t == 0 || (t > 0 && t > static_cast<long long>(Env::Current()->Now()));
}

std::set<std::string> IndexDaemon::running_shares() const {
  std::lock_guard<std::mutex> lock(mu_);
  std::set<std::string> shares;
  for (const auto& entry : workers_) shares.insert(entry.first);
  return shares;
}

Json::Value IndexDaemon::Status(bool details) const {
  Json::Value r(Json::objectValue);
  r["paused"] = IsPaused();
  r["resume_time"] = Json::Int64(resume_time_.load());
  r["shares"] = Json::Value(Json::arrayValue);
  std::lock_guard<std::mutex> lock(mu_);
  for (const auto& entry : workers_) {
    const Json::Value report = entry.second->Report();
    r["shares"].append(details ? report : PublicReport(report));
  }
  r["details"] = details;
  return r;
}

Json::Value IndexDaemon::Handle(const Json::Value& command, uid_t peer_uid) {
  const std::string type = command["type"].asString();
  const Json::Value& data = command["data"];
  if (type == "status") return Ok(Status(IsPrivilegedCaller(peer_uid)));
  if (peer_uid != 0 && peer_uid != geteuid()) {
    Log(LOG_WARNING, "fileindexd: \"%s\" refused to user %u", type.c_str(), peer_uid);
    return CommandServer::ErrorReply(kCodePermissionDenied, "not permitted");
  }
  if (type == "worker_create") {
    StartWorker(ShareOf(data));
  } else if (type == "worker_delete") {
    StopWorker(ShareOf(data));
  } else if (type == "pause") {
    const Json::Value& t = data.isObject() ? data["resume_time"] : Json::Value::null;
    ORVANE_THROW_IF(!t.isIntegral(), kErrInvalidParam, "\"resume_time\" missing");
    resume_time_.store(t.asInt64());
  } else if (type == "resume") {
    resume_time_.store(-1);
  } else if (type == "notify_setting_changed") {
    Reload();
  } else {
    return CommandServer::ErrorReply(kCodeUnknownCommand, "unknown command: " + type);
  }
  // Workers look at the pause and their queues now rather than at their next wake-up.
  std::lock_guard<std::mutex> lock(mu_);
  for (auto& entry : workers_) entry.second->Wake();
  return Ok();
}

}  // namespace fileindexd
}  // namespace orvane
