#include "common/sdk/share_path.hpp"

#include <syslog.h>
#include <unistd.h>

#include <cerrno>

#include "common/log.hpp"
#include "common/util.hpp"
#include "platform/share.hpp"

namespace orvane {
namespace sdk {

using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them

namespace {

constexpr char kHomesShare[] = "homes";
constexpr char kHomesMarker[] = "/homes/";

// From the first "/homes/" on, or the whole text when there is none.
std::string FromHomesMarker(const std::string& path) {
  const size_t pos = path.find(kHomesMarker);
  return pos == std::string::npos ? path : path.substr(pos);
}

}  // namespace

std::string SharePathMgr::GetSharePath(const std::string& vol_path, const User& user,
                                       bool home_form) {
  char share_name[4096] = {};
  char share_path[4096] = {};
  if (0 != QUIXShareNamePathGet(vol_path.c_str(), share_name, sizeof(share_name), share_path,
                                sizeof(share_path))) {
    ORVANE_LOG_FAILED("QUIXShareNamePathGet failed, vol_path=%s", vol_path.c_str());
    return "";
  }
  const std::string name = share_name;
  const std::string path = share_path;

  if (name == kHomesShare && user.IsHomeEnabled() && home_form) {
    const std::string home_part = FromHomesMarker(user.GetHomePath());
    const std::string relative = FromHomesMarker(vol_path);
    if (StringStartWith(relative + "/", home_part + "/")) {
      return "/home" + relative.substr(home_part.size());
    }
  }

  if (vol_path.size() < path.size()) {
    ORVANE_LOG_FAILED("Malformed input: %s, %s", vol_path.c_str(), path.c_str());
    return "";
  }
  return "/" + name + vol_path.substr(path.size());
}

}  // namespace sdk
}  // namespace orvane
