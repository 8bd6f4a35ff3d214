#include "fileindex/status_mgr.hpp"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/lock_file.hpp"
#include "common/root.hpp"
#include "common/sdk/credentials.hpp"
#include "common/util.hpp"

namespace orvane {
namespace fileindex {

const char kFileIndexStatusCfgPath[] = "/var/packages/Orvane/etc/fileindex.status";
const char kStatusCfgLockPath[] = "/tmp/orvane_cfg_fi_status.lock";

StatusMgr::StatusMgr() {
  const std::string path = RootedPath(kFileIndexStatusCfgPath);
  JsonValue data;
  if (IsFileExist(path) && !data.fromFile(path)) {
    ThrowError(__FILE__, __LINE__, __func__,
               "IsFileExist(kFileIndexStatusCfgPath) && !data_.fromFile(kFileIndexStatusCfgPath)",
               kErrLoadConfig, "Cannot load json: " + path);
  }
  data_.swap(data);
}

int StatusMgr::GetShareStatus(const std::string& share) const {
  int status = 0;
  GetJsonValue(status, data_["share"], share, false);
  return status;
}

void StatusMgr::SetShareStatus(const std::string& share, int bits) {
  LockFile lock(RootedPathForWrite(kStatusCfgLockPath), true);
  unsigned int cur = 0;
  // Read through a const reference: a missing "share" object is an error, not created here.
  const Json::Value& data = data_;
  GetJsonValue(cur, data["share"], share, false);
  data_["share"][share] = Json::UInt(cur | static_cast<unsigned int>(bits));
  Save();
}

void StatusMgr::Save() {
  sdk::SDKCredentials root("root");
  const std::string path = RootedPathForWrite(kFileIndexStatusCfgPath);
  const JsonValue data(data_);
  if (!data.toFile(path)) {
    ThrowError(__FILE__, __LINE__, __func__, "!data_.toFile(kFileIndexStatusCfgPath)",
               kErrSaveConfig, "Failed to save json: " + path);
  }
  if (-1 == chmod(path.c_str(), 0644)) {
    ThrowError(__FILE__, __LINE__, __func__, "-1 == chmod(kFileIndexStatusCfgPath, 0644)",
               kErrSystem, std::string("chmod failed, reason=") + strerror(errno));
  }
}

}  // namespace fileindex
}  // namespace orvane
