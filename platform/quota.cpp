#include "platform/quota.hpp"

#include <fcntl.h>
#include <sys/quota.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "common/fd.hpp"
#include "platform/internal.hpp"

namespace orvane {
namespace platform {
namespace {

// Bytes the user may still write under a hard block quota; -1 when no quota applies (the file
// system has none, quotas are off, or the kernel is too old to ask by descriptor).
int64_t QuotaRoom(uid_t uid, const char* path) {
#ifdef SYS_quotactl_fd
  UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC | O_PATH));
  if (!fd.valid()) return -1;
  struct dqblk quota = {};
  const int saved = errno;
  const long rc = syscall(SYS_quotactl_fd, fd.get(), QCMD(Q_GETQUOTA, USRQUOTA), uid, &quota);
  errno = saved;
  if (rc != 0 || !(quota.dqb_valid & QIF_BLIMITS) || quota.dqb_bhardlimit == 0) return -1;
  const uint64_t limit = static_cast<uint64_t>(quota.dqb_bhardlimit) * 1024;
  return quota.dqb_curspace >= limit ? 0 : static_cast<int64_t>(limit - quota.dqb_curspace);
#else
  return -1;
#endif
}

}  // namespace

int QUIXQuotaIsEnough(uid_t uid, const char* path, uint64_t bytes) {
  PLATFORM_FAULT_POINT("QUIXQuotaIsEnough", nullptr);
  if (path == nullptr || path[0] != '/') return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  struct statvfs vfs;
  if (statvfs(path, &vfs) != 0) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  // Root may use the reserved blocks too; everyone else only what is available to users.
  const uint64_t free_blocks = uid == 0 ? vfs.f_bfree : vfs.f_bavail;
  if (free_blocks < bytes / vfs.f_frsize + (bytes % vfs.f_frsize != 0)) {
    return PLATFORM_FAIL(0, ENOSPC, kQErrVolumeFull);
  }
  const int64_t room = QuotaRoom(uid, path);
  if (room >= 0 && static_cast<uint64_t>(room) < bytes) {
    return PLATFORM_FAIL(0, EDQUOT, kQErrQuotaExceeded);
  }
  QLIBCErrSet(kQErrNone);
  return 1;
}

}  // namespace platform
}  // namespace orvane
