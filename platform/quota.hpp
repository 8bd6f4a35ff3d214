// Space checks before indexing: the free space of a folder's file system and, where that file
// system enforces user quotas, the user's remaining quota. Stateless; safe from any thread.
#ifndef ORVANE_PLATFORM_QUOTA_HPP_
#define ORVANE_PLATFORM_QUOTA_HPP_

#include <sys/types.h>

#include <cstdint>

namespace orvane {
namespace platform {

// 1 when `bytes` more fit on the file system of `path` for user `uid`; 0 when they do not, with
// QLIBCErrGet() set to kQErrVolumeFull (free space) or kQErrQuotaExceeded (the user's quota);
// -1 with errno set when the file system cannot be asked.
int QUIXQuotaIsEnough(uid_t uid, const char* path, uint64_t bytes);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_QUOTA_HPP_
