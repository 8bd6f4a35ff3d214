#include "fileindex/status_mgr.hpp"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/lock_file.hpp"
#include "common/root.hpp"
#include "common/sdk/credentials.hpp"
#include "common/util.hpp"
#include "fileindex/communication.hpp"

namespace orvane {
namespace fileindex {
namespace {

// The "share" member of a hand-edited document of any shape; null unless the document is an
// object (jsoncpp refuses member access on other types with an exception of its own).
const Json::Value& SharesOf(const Json::Value& data) {
  static const Json::Value kNull;
  if (!data.isObject()) return kNull;
  static constexpr char kShare[] = "share";
  const Json::Value* shares = data.find(kShare, kShare + sizeof(kShare) - 1);
  return shares != nullptr ? *shares : kNull;
}

}  // namespace

const char kFileIndexStatusCfgPath[] = "/var/packages/Orvane/etc/fileindex.status";
const char kStatusCfgLockPath[] = "/tmp/orvane_cfg_fi_status.lock";

StatusMgr::StatusMgr() {
  const std::string path = RootedPath(kFileIndexStatusCfgPath);
  // Under the installation root, and named as the file it stands for so that a failure logs
  // the condition as it reads.
  const char* const kFileIndexStatusCfgPath = path.c_str();
  ORVANE_THROW_IF(IsFileExist(kFileIndexStatusCfgPath) && !data_.fromFile(kFileIndexStatusCfgPath),
                  kErrLoadConfig, "Cannot load json: " + path);
}

long long StatusMgr::GetPauseInfo() const {
  long long resume_time = -1;
  GetJsonValue(resume_time, data_, "resume_time", false);
  return resume_time;
}

int StatusMgr::GetShareStatus(const std::string& share) const {
  int bits = 0;
  // A missing "share" member reads as null and is refused as "Not an object".
  GetJsonValue(bits, SharesOf(data_), share, false);
  return bits;
}

void StatusMgr::Pause(int hours) {
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  ORVANE_THROW_IF(hours < 0, kErrInvalidParam, "Pause length should NOT be negative");
  ORVANE_THROW_IF(!data_.isNull() && !data_.isObject(), kErrInvalidParam,
                  "Not an object" + AppendData(data_));
  long long resume_time = 0;
  if (hours != 0) {
    // The resume time has always been computed in 32 bits; the sum is wrapped the way that
    // arithmetic wraps rather than overflowing, and then widened with its sign.
    const int64_t wide = static_cast<int64_t>(Env::Current()->Now()) + int64_t{hours} * 3600;
    resume_time = static_cast<int32_t>(static_cast<uint32_t>(wide));
  }
  data_["resume_time"] = Json::Int64(resume_time);
  Save();
  Json::Value data(Json::objectValue);
  data["resume_time"] = Json::Int64(resume_time);
  SendCommandToDaemon("pause", data);
}

void StatusMgr::Resume() {
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  ORVANE_THROW_IF(!data_.isNull() && !data_.isObject(), kErrInvalidParam,
                  "Not an object" + AppendData(data_));
  data_["resume_time"] = Json::Int64(-1);
  Save();
  SendCommandToDaemon("resume", Json::Value());
}

unsigned int StatusMgr::StoredShareBits(const std::string& share) const {
  unsigned int bits = 0;
  GetJsonValue(bits, SharesOf(data_), share, false);
  return bits;
}

void StatusMgr::SetShareStatus(const std::string& share, int bits) {
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  const unsigned int cur = StoredShareBits(share);
  data_["share"][share] = Json::UInt(cur | static_cast<unsigned int>(bits));
  Save();
}

void StatusMgr::UnsetShareStatus(const std::string& share, int bits) {
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  const unsigned int cur = StoredShareBits(share);
  data_["share"][share] = Json::UInt(cur & ~static_cast<unsigned int>(bits));
  Save();
}

void StatusMgr::ClearShareStatus(const std::string& share) {
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  // removeMember on a null document would turn it into an object silently; refuse it the way
  // the other flag calls do.
  ORVANE_THROW_IF(!SharesOf(data_).isObject(), kErrInvalidParam,
                  "Not an object" + AppendData(data_));
  data_["share"].removeMember(share);
  Save();
}

void StatusMgr::Save() {
  const std::string path = RootedPath(kFileIndexStatusCfgPath);
  // Under the installation root, and named as the file it stands for so that a failure logs
  // the condition as it reads.
  const char* const kFileIndexStatusCfgPath = path.c_str();
  sdk::SDKCredentials root("root");
  ORVANE_THROW_IF(!data_.toFile(kFileIndexStatusCfgPath), kErrSaveConfig,
                  "Failed to save json: " + path);
  ORVANE_THROW_IF(-1 == chmod(kFileIndexStatusCfgPath, 0644), kErrSystem,
                  std::string("chmod failed, reason=") + strerror(errno));
}

void StatusMgr::CreateIfMissing() {
  if (IsFileExist(RootedPath(kFileIndexStatusCfgPath))) return;
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  if (IsFileExist(RootedPath(kFileIndexStatusCfgPath))) return;
  StatusMgr status;
  status.data_ = Json::Value(Json::objectValue);
  status.data_["share"] = Json::Value(Json::objectValue);
  status.Save();
}

}  // namespace fileindex
}  // namespace orvane
