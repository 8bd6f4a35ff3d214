// Desktop notifications to the administrators, sent through the platform's notifier program.
// Stateless free functions; safe from any thread. The notifier's outcome is not checked: a lost
// notification must never stop indexing.
#ifndef ORVANE_COMMON_NOTIFY_HPP_
#define ORVANE_COMMON_NOTIFY_HPP_

#include <string>

namespace orvane {
namespace fileindex {

// The index has no space left on its volume.
void SendZRMNotify();
// The search engine lacks memory (it keeps answering that it is busy).
void NotifyLackOfMemory();
// The inotify watch limit leaves directories below `folder` unwatched: the sysctl `setting` must
// be raised to `needed` (-1 when not known).
void NotifyWatchLimit(const std::string& folder, const std::string& setting, long long needed);

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_COMMON_NOTIFY_HPP_
