// User: one platform user (name, uid, primary group) and, when the home service is on for it,
// its home folder. Built by GetUser() (common/util.hpp), which throws when the user is unknown.
// Copyable value; the home path is looked up lazily, so one object belongs to one thread.
#ifndef ORVANE_COMMON_SDK_USER_HPP_
#define ORVANE_COMMON_SDK_USER_HPP_

#include <sys/types.h>

#include <string>

namespace orvane {
namespace sdk {

class User {
 public:
  User(const std::string& name, uid_t uid, gid_t gid, bool home_enabled);

  const std::string& GetName() const { return name_; }
  uid_t GetUID() const { return uid_; }
  gid_t GetGID() const { return gid_; }
  bool IsHomeEnabled() const { return home_enabled_; }

  // The user's home folder on the volume; empty while the home service is off for the user.
  // Throws Error 502 when the platform cannot say.
  const std::string& GetHomePath() const;

 private:
  std::string name_;
  uid_t uid_;
  gid_t gid_;
  bool home_enabled_;
  mutable std::string home_path_;
};

}  // namespace sdk
}  // namespace orvane

#endif  // ORVANE_COMMON_SDK_USER_HPP_
