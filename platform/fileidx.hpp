// Where a share's index lives: its event queue file and database folder below the share's own
// "@eaDir" (never watched nor indexed, so the system's files never feed back into the index), and
// its search-engine index id. 0 or more on success, -1 with errno set (EINVAL for a bad argument,
// ENAMETOOLONG when the buffer is too small). Stateless; safe from any thread.
#ifndef ORVANE_PLATFORM_FILEIDX_HPP_
#define ORVANE_PLATFORM_FILEIDX_HPP_

#include <cstddef>
#include <string>

namespace orvane {
namespace platform {

// "<share path>/@eaDir/@fileindex/queue"
int FILEIDXQueuePathCompose(const char* share_path, char* buf, size_t size);
// "<share path>/@eaDir/@fileindex/db"
int FILEIDXDBPathCompose(const char* share_path, char* buf, size_t size);
// "fileindex_<share name>"
int FILEIDXGetIndexID(const char* share_name, char* buf, size_t size);

// The search-engine index id of a share, "fileindex_<share name>", with no checks: the one place
// the id is composed (the empty name gives the prefix that every id of ours begins with).
std::string ComposeIndexID(const std::string& share_name);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_FILEIDX_HPP_
