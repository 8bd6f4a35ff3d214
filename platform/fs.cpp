#include "platform/fs.hpp"

#include <fcntl.h>
#include <linux/btrfs.h>
#include <linux/magic.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <set>
#include <string>
#include <vector>

#include "common/fd.hpp"
#include "platform/config.hpp"
#include "platform/internal.hpp"

namespace orvane {
namespace platform {
namespace {

// Magic numbers that not every kernel header names.
constexpr uint64_t kZfsMagic = 0x2fc12fc1;
constexpr uint64_t kNtfs3Magic = 0x7366746e;
constexpr uint64_t kNtfsMagic = 0x5346544e;
constexpr uint64_t kExfatMagic = 0x2011bab0;
constexpr uint64_t kCifsMagic = 0xff534d42;
constexpr uint64_t kSmb2Magic = 0xfe534d42;
constexpr uint64_t kSmbMagic = 0x517b;
constexpr uint64_t kUdfMagic = 0x15013346;
constexpr uint64_t kCephMagic = 0x00c36400;
constexpr uint64_t kAfsMagic = 0x5346414f;
constexpr uint64_t kCodaMagic = 0x73757245;
constexpr uint64_t kFuseMagic = 0x65735546;
constexpr uint64_t kF2fsMagic = 0xf2f52010;
constexpr uint64_t kErofsMagic = 0xe0f5e1e2;
constexpr ino_t kBtrfsSubvolRootIno = 256;  // every btrfs subvolume root has this inode

// File systems that the kernel makes up and that never hold users' files.
const std::set<uint64_t>& PseudoMagics() {
  static const std::set<uint64_t> magics = {
      PROC_SUPER_MAGIC, SYSFS_MAGIC,      CGROUP_SUPER_MAGIC, CGROUP2_SUPER_MAGIC,
      DEBUGFS_MAGIC,    TRACEFS_MAGIC,    SECURITYFS_MAGIC,   DEVPTS_SUPER_MAGIC,
      PSTOREFS_MAGIC,   BPF_FS_MAGIC,     0x19800202 /* mqueue */, 0x62656570 /* configfs */,
      EFIVARFS_MAGIC,   HUGETLBFS_MAGIC,  BINFMTFS_MAGIC,     AUTOFS_SUPER_MAGIC,
      NSFS_MAGIC,       SOCKFS_MAGIC,     PIPEFS_MAGIC,       SELINUX_MAGIC,
  };
  return magics;
}

// The type text of the mount with id `mount_id`, from the process's mount table.
std::string MountFsType(uint64_t mount_id) {
  std::ifstream in("/proc/self/mountinfo");
  std::string line;
  const std::string id = std::to_string(mount_id) + " ";
  while (std::getline(in, line)) {
    if (line.compare(0, id.size(), id) != 0) continue;
    const size_t sep = line.find(" - ");
    if (sep == std::string::npos) return "";
    const size_t start = sep + 3;
    return line.substr(start, line.find(' ', start) - start);
  }
  return "";
}

int FuseKind(const char* path) {
  static const std::set<std::string> remote = {
      "sshfs", "rclone", "s3fs", "gcsfuse", "goofys", "blobfuse", "blobfuse2", "curlftpfs",
      "davfs", "smbnetfs", "glusterfs", "afpfs", "onedriver", "google-drive-ocamlfuse",
      "mountpoint-s3", "juicefs", "seaweedfs", "cephfs", "ceph-fuse", "lizardfs", "moosefs"};
  static const std::set<std::string> image = {"fuseiso", "squashfuse", "archivemount",
                                              "fuse-zip", "ratarmount", "cdemu"};
  struct statx stx;
  if (statx(AT_FDCWD, path, 0, STATX_MNT_ID, &stx) != 0 || !(stx.stx_mask & STATX_MNT_ID)) {
    return FS_TYPE_FUSE;
  }
  std::string type = MountFsType(stx.stx_mnt_id);  // "fuse.sshfs", "fuseblk", ...
  const size_t dot = type.find('.');
  const std::string subtype = dot == std::string::npos ? "" : type.substr(dot + 1);
  if (remote.count(subtype)) return FS_TYPE_FUSE_REMOTE;
  if (image.count(subtype)) return FS_TYPE_FUSE_IMAGE;
  return FS_TYPE_FUSE;
}

int TypeOfMagic(uint64_t magic, const char* path) {
  switch (magic) {
    case EXT4_SUPER_MAGIC: return FS_TYPE_EXT4;
    case BTRFS_SUPER_MAGIC: return FS_TYPE_BTRFS;
    case XFS_SUPER_MAGIC: return FS_TYPE_XFS;
    case kZfsMagic: return FS_TYPE_ZFS;
    case TMPFS_MAGIC: return FS_TYPE_TMPFS;
    case OVERLAYFS_SUPER_MAGIC: return FS_TYPE_OVERLAY;
    case MSDOS_SUPER_MAGIC:
    case kExfatMagic: return FS_TYPE_FAT;
    case kNtfsMagic:
    case kNtfs3Magic: return FS_TYPE_NTFS;
    case NFS_SUPER_MAGIC: return FS_TYPE_NFS;
    case kCifsMagic:
    case kSmb2Magic: return FS_TYPE_CIFS;
    case ISOFS_SUPER_MAGIC: return FS_TYPE_ISO9660;
    case kUdfMagic: return FS_TYPE_UDF;
    case SQUASHFS_MAGIC: return FS_TYPE_SQUASHFS;
    case kErofsMagic: return FS_TYPE_EROFS;
    case CRAMFS_MAGIC: return FS_TYPE_CRAMFS;
    case V9FS_MAGIC: return FS_TYPE_9P;
    case kSmbMagic:
    case kCephMagic:
    case kAfsMagic:
    case kCodaMagic: return FS_TYPE_NETWORK_OTHER;
    case kFuseMagic: return FuseKind(path);
    case kF2fsMagic: return FS_TYPE_F2FS;
    default: return PseudoMagics().count(magic) ? FS_TYPE_PSEUDO : FS_TYPE_UNKNOWN;
  }
}

bool IsReadOnlySnapshot(const std::string& entry) {
  struct statvfs vfs;
  if (statvfs(entry.c_str(), &vfs) == 0 && (vfs.f_flag & ST_RDONLY)) return true;
  UniqueFd fd(open(entry.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
  if (!fd.valid()) return false;
  struct statfs fs;
  struct stat st;
  if (fstatfs(fd.get(), &fs) != 0 || static_cast<uint64_t>(fs.f_type) != BTRFS_SUPER_MAGIC ||
      fstat(fd.get(), &st) != 0 || st.st_ino != kBtrfsSubvolRootIno) {
    return false;
  }
  uint64_t flags = 0;
  return ioctl(fd.get(), BTRFS_IOC_SUBVOL_GETFLAGS, &flags) == 0 && (flags & BTRFS_SUBVOL_RDONLY);
}

}  // namespace

int QUIXGetFSType(const char* path, int flags) {
  PLATFORM_FAULT_POINT("QUIXGetFSType", nullptr);
  if (path == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  struct statfs fs;
  if (statfs(path, &fs) != 0) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  return TypeOfMagic(static_cast<uint64_t>(fs.f_type), path);
}

int QUIXFSIsRemoteFS(int fs_type) {
  PLATFORM_FAULT_POINT("QUIXFSIsRemoteFS", nullptr);
  switch (fs_type) {
    case FS_TYPE_NFS:
    case FS_TYPE_CIFS:
    case FS_TYPE_9P:
    case FS_TYPE_NETWORK_OTHER:
    case FS_TYPE_FUSE_REMOTE: return 1;
    default: return 0;
  }
}

int QUIXFSIsImageFS(int fs_type) {
  PLATFORM_FAULT_POINT("QUIXFSIsImageFS", nullptr);
  switch (fs_type) {
    case FS_TYPE_ISO9660:
    case FS_TYPE_UDF:
    case FS_TYPE_SQUASHFS:
    case FS_TYPE_EROFS:
    case FS_TYPE_CRAMFS:
    case FS_TYPE_FUSE_IMAGE: return 1;
    default: return 0;
  }
}

int QUIXFSDirIsMntPoint(const char* path) {
  PLATFORM_FAULT_POINT("QUIXFSDirIsMntPoint", nullptr);
  if (path == nullptr || path[0] == '\0') return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  struct statx stx;
  if (statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS, &stx) != 0) {
    return PLATFORM_FAIL(-1, errno, kQErrSystem);
  }
  if (stx.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) {
    return (stx.stx_attributes & STATX_ATTR_MOUNT_ROOT) ? 1 : 0;
  }
  // Older kernels: a mount root sits on another device than its parent, or is its own parent.
  if (!S_ISDIR(stx.stx_mode)) return 0;
  struct stat self;
  struct stat parent;
  if (stat(path, &self) != 0 || stat((std::string(path) + "/..").c_str(), &parent) != 0) {
    return PLATFORM_FAIL(-1, errno, kQErrSystem);
  }
  return (self.st_dev != parent.st_dev || self.st_ino == parent.st_ino) ? 1 : 0;
}

int QLIBFhsPathInSnapshot(const char* path, int* in_snapshot) {
  PLATFORM_FAULT_POINT("QLIBFhsPathInSnapshot", in_snapshot);
  if (path == nullptr || in_snapshot == nullptr || path[0] != '/') {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  *in_snapshot = 0;
  auto config = ConfigForCall();
  if (!config) return -1;
  const std::string full = path;
  const ShareConfig* holder = nullptr;
  for (const ShareConfig& share : config->shares) {
    if (PathIsAtOrBelow(full, share.path) &&
        (holder == nullptr || share.path.size() > holder->path.size())) {
      holder = &share;
    }
  }
  if (holder == nullptr) return 0;
  const std::string views = holder->path + "/#snapshot";
  if (!PathIsAtOrBelow(full, views)) return 0;
  // The snapshot is the entry directly below "#snapshot"; the folder itself counts when it is a
  // read-only view as a whole.
  std::string entry = views;
  if (full.size() > views.size()) {
    const size_t end = full.find('/', views.size() + 1);
    entry = full.substr(0, end);
  }
  struct stat st;
  if (lstat(entry.c_str(), &st) != 0) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  *in_snapshot = IsReadOnlySnapshot(entry) ? 1 : 0;
  return 0;
}

int QUIXEAIsHiddenDir(const char* name) {
  PLATFORM_FAULT_POINT("QUIXEAIsHiddenDir", nullptr);
  if (name == nullptr) return 0;
  // Kept as a plain chain of comparisons: this runs for every component of every queued path.
  return (strcmp(name, "@eaDir") == 0 || strcmp(name, "@tmp") == 0 ||
          strcmp(name, "@sharebin") == 0 || strcmp(name, "@fileindex") == 0 ||
          strcmp(name, "lost+found") == 0)
             ? 1
             : 0;
}

int QUIXACLPermGet(const char* path, int* perm) {
  PLATFORM_FAULT_POINT("QUIXACLPermGet", perm);
  if (path == nullptr || perm == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  struct stat st;
  if (lstat(path, &st) != 0) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  const int saved = errno;
  int bits = 0;
  if (faccessat(AT_FDCWD, path, R_OK, AT_EACCESS) == 0) bits |= QUIX_ACL_READ;
  if (faccessat(AT_FDCWD, path, W_OK, AT_EACCESS) == 0) bits |= QUIX_ACL_WRITE;
  if (faccessat(AT_FDCWD, path, X_OK, AT_EACCESS) == 0) bits |= QUIX_ACL_EXECUTE;
  errno = saved;
  *perm = bits;
  return 0;
}

namespace {

// Copies the rest of `in` to `out`, in the kernel where it can.
bool CopyData(int in, int out) {
  bool kernel_copy = true;
  char buf[1 << 16];
  while (true) {
    if (kernel_copy) {
      const ssize_t n = copy_file_range(in, nullptr, out, nullptr, 1 << 30, 0);
      if (n > 0) continue;
      if (n == 0) return true;
      if (errno == EINTR) continue;
      if (errno != EXDEV && errno != ENOSYS && errno != EINVAL && errno != EOPNOTSUPP &&
          errno != EPERM) {
        return false;
      }
      kernel_copy = false;
    }
    const ssize_t n = read(in, buf, sizeof(buf));
    if (n == 0) return true;
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    for (ssize_t done = 0; done < n;) {
      const ssize_t w = write(out, buf + done, n - done);
      if (w < 0) {
        if (errno == EINTR) continue;
        return false;
      }
      done += w;
    }
  }
}

}  // namespace

int QUIXFileCopy(const char* src, const char* dst, const QUIXCOPYARGS* args) {
  PLATFORM_FAULT_POINT("QUIXFileCopy", nullptr);
  if (src == nullptr || dst == nullptr || args == nullptr || args->fCopy != 1) {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  UniqueFd in(open(src, O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!in.valid()) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  struct stat st;
  if (fstat(in.get(), &st) != 0) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  if (!S_ISREG(st.st_mode)) return PLATFORM_FAIL(-1, S_ISDIR(st.st_mode) ? EISDIR : EINVAL, kQErrBadParam);

  // Only a regular file is ever replaced: a device, folder or pipe in the destination's place
  // is refused rather than swapped for a file.
  struct stat dst_st;
  if (lstat(dst, &dst_st) == 0 && !S_ISREG(dst_st.st_mode) && !S_ISLNK(dst_st.st_mode)) {
    return PLATFORM_FAIL(-1, EEXIST, kQErrBadParam);
  }
  // The copy is built beside the destination and renamed over it, so a reader never sees half
  // a file and a failure leaves the old destination as it was.
  std::string tmp = std::string(dst) + ".XXXXXX";
  UniqueFd out(mkostemp(tmp.data(), O_CLOEXEC));
  if (!out.valid()) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  auto fail = [&tmp](int err) {
    unlink(tmp.c_str());
    return PLATFORM_FAIL(-1, err, err == ENOSPC ? kQErrVolumeFull
                                 : err == EDQUOT ? kQErrQuotaExceeded
                                                 : kQErrSystem);
  };
  if (!CopyData(in.get(), out.get())) return fail(errno);
  // Only root can give a file away; others keep the copy as their own.
  if (fchown(out.get(), st.st_uid, st.st_gid) != 0 && geteuid() == 0) return fail(errno);
  if (fchmod(out.get(), st.st_mode & 07777) != 0) return fail(errno);
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (futimens(out.get(), times) != 0) return fail(errno);
  if (fsync(out.get()) != 0) return fail(errno);
  if (!out.Close()) return fail(errno);
  if (rename(tmp.c_str(), dst) != 0) return fail(errno);
  if (args->fRemoveSrc == 1 && unlink(src) != 0 && errno != ENOENT) {
    return PLATFORM_FAIL(-1, errno, kQErrSystem);
  }
  return 0;
}

}  // namespace platform
}  // namespace orvane
