// SDKCredentials: a scoped switch of the process's effective user (and groups). Credentials are
// process-wide, so a scope affects every thread; keep it short (one file write) and on one thread.
// Every switch is serialised through SDKMutex(). Not copyable.
#ifndef ORVANE_COMMON_SDK_CREDENTIALS_HPP_
#define ORVANE_COMMON_SDK_CREDENTIALS_HPP_

#include <sys/types.h>

#include <string>

namespace orvane {
namespace sdk {

class SDKCredentials {
 public:
  // Remembers the current identity; the destructor goes back to it. Throws Error 503 when the
  // current effective user cannot be looked up.
  SDKCredentials();
  // Switches to `name` (to root for an administrator). The destructor, when the identity changed,
  // applies `name` again rather than the identity found at construction. Throws Error 503.
  explicit SDKCredentials(const std::string& name);
  ~SDKCredentials();
  SDKCredentials(const SDKCredentials&) = delete;
  SDKCredentials& operator=(const SDKCredentials&) = delete;

  // Switches to `name`, or to root when `name` is an administrator. Throws Error 503.
  void AsUser(const std::string& name);

 private:
  uid_t euid_;
  gid_t egid_;
  std::string username_;
};

}  // namespace sdk
}  // namespace orvane

#endif  // ORVANE_COMMON_SDK_CREDENTIALS_HPP_
