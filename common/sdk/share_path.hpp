// SharePathMgr turns a full path on a volume into the share path that the index stores
// ("/<share>/<rest>"), or, for a user's own home folder, into its "/home/<rest>" form.
// Stateless; safe from any thread.
#ifndef ORVANE_COMMON_SDK_SHARE_PATH_HPP_
#define ORVANE_COMMON_SDK_SHARE_PATH_HPP_

#include <string>

#include "common/sdk/user.hpp"

namespace orvane {
namespace sdk {

class SharePathMgr {
 public:
  // The share path of `vol_path`; with `home_form`, a path inside `user`'s own home is written
  // below "/home". Empty (after a log line) when no share holds the path. Throws Error 502 when
  // the user's home folder cannot be found.
  static std::string GetSharePath(const std::string& vol_path, const User& user, bool home_form);
};

}  // namespace sdk
}  // namespace orvane

#endif  // ORVANE_COMMON_SDK_SHARE_PATH_HPP_
