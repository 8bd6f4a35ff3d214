#include "common/sdk/user.hpp"

#include "common/error.hpp"
#include "platform/user.hpp"

namespace orvane {
namespace sdk {

using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them

User::User(const std::string& name, uid_t uid, gid_t gid, bool home_enabled)
    : name_(name), uid_(uid), gid_(gid), home_enabled_(home_enabled) {}

const std::string& User::GetHomePath() const {
  if (home_enabled_ && home_path_.empty()) {
    char path[4096] = {};
    ORVANE_THROW_IF(0 > QUIXServiceHomePathGet(name_.c_str(), path, sizeof(path)), kErrSystem,
                    "QUIXServiceHomePathGet failed, user=" + name_);
    home_path_ = path;
  }
  return home_path_;
}

}  // namespace sdk
}  // namespace orvane
