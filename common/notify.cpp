#include "common/notify.hpp"

#include <cerrno>

#include "common/root.hpp"
#include "platform/notifier.hpp"
#include "platform/service.hpp"

namespace orvane {
namespace fileindex {
namespace {

// Wait for the notifier, no standard streams, no inherited descriptors, its own session.
constexpr int kNotifierExecFlags = 187;

// The outcome is not checked, so it must not linger in errno for the caller's next log line.
class KeepErrno {
 public:
  KeepErrno() : saved_(errno) {}
  ~KeepErrno() { errno = saved_; }

 private:
  int saved_;
};

}  // namespace

void SendZRMNotify() {
  KeepErrno keep;
  const std::string notifier = RootedPath(platform::kNotifierPath);
  platform::QLIBCExecl(notifier.c_str(), kNotifierExecFlags, "-c", "QUIX.Orvane.Application", "-b",
                       "true", "-e", "false", "@administrators", "app:displayname",
                       "error:index_no_space",
                       "<a data-quix-app=\"QUIX.Orvane.Application\" data-quix-fn=\"preference\">",
                       "</a>", static_cast<const char*>(nullptr));
}

void NotifyLackOfMemory() {
  KeepErrno keep;
  const std::string notifier = RootedPath(platform::kNotifierPath);
  platform::QLIBCExecl(notifier.c_str(), kNotifierExecFlags, "-c", "QUIX.Orvane.Application",
                       "@administrators", "app:displayname", "error:lack_of_memory",
                       static_cast<const char*>(nullptr));
}

void NotifyWatchLimit(const std::string& folder, const std::string& setting, long long needed) {
  KeepErrno keep;
  const std::string notifier = RootedPath(platform::kNotifierPath);
  const std::string at_least = needed > 0 ? std::to_string(needed) : "more";
  platform::QLIBCExecl(notifier.c_str(), kNotifierExecFlags, "-c", "QUIX.Orvane.Application",
                       "@administrators", "app:displayname", "error:watch_limit", folder.c_str(),
                       setting.c_str(), at_least.c_str(), static_cast<const char*>(nullptr));
}

}  // namespace fileindex
}  // namespace orvane
