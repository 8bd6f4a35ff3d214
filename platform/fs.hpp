// File-system questions of the platform: the kind of file system a path lies on, mount points,
// snapshot views, the platform's hidden metadata folders, the effective user's access to a path,
// and a file copy that keeps mode, owner and times. Results follow the platform's convention
// (negative on failure, errno and QLIBCErrGet() set). Stateless; safe from any thread.
// platform/README.md says what each answer means on Linux.
#ifndef ORVANE_PLATFORM_FS_HPP_
#define ORVANE_PLATFORM_FS_HPP_

#include <cstdint>

namespace orvane {
namespace platform {

// The platform's file-system kinds.
enum FSTYPE : int {
  FS_TYPE_UNKNOWN = 0,  // a local file system not listed below
  FS_TYPE_EXT4 = 1,     // ext2, ext3, ext4
  FS_TYPE_BTRFS = 2,
  FS_TYPE_XFS = 3,
  FS_TYPE_ZFS = 4,
  FS_TYPE_TMPFS = 5,
  FS_TYPE_OVERLAY = 6,
  FS_TYPE_FAT = 7,      // vfat, exfat
  FS_TYPE_NTFS = 8,
  FS_TYPE_NFS = 9,
  FS_TYPE_CIFS = 10,    // CIFS and SMB2/3
  FS_TYPE_ISO9660 = 11,
  FS_TYPE_PSEUDO = 12,  // kernel-made views: proc, sysfs, devtmpfs, cgroup, debugfs, ...
  FS_TYPE_UDF = 13,
  FS_TYPE_SQUASHFS = 14,
  FS_TYPE_EROFS = 15,
  FS_TYPE_CRAMFS = 16,
  FS_TYPE_9P = 17,
  FS_TYPE_NETWORK_OTHER = 18,  // AFS, Ceph, Coda, SMB1, ...
  FS_TYPE_FUSE = 19,           // a FUSE file system on local storage
  FS_TYPE_FUSE_REMOTE = 20,    // a FUSE network mount: sshfs, rclone, s3fs, davfs, ...
  FS_TYPE_FUSE_IMAGE = 21,     // a FUSE-mounted image: fuseiso, squashfuse, archivemount, ...
  FS_TYPE_F2FS = 22,
};

// The kind of the file system holding `path` (followed through links), or -1 (the path does not
// exist, ...). `flags` is reserved (0).
int QUIXGetFSType(const char* path, int flags);
// Non-zero for network file systems.
int QUIXFSIsRemoteFS(int fs_type);
// Non-zero for disc and disk images and other read-only image file systems.
int QUIXFSIsImageFS(int fs_type);

// 1 when `path` (not followed when it is a link) is the root of a mount, bind mounts included;
// 0 when not; -1 when it cannot be examined.
int QUIXFSDirIsMntPoint(const char* path);

// Whether `path` lies in a snapshot view: the folder "#snapshot" directly under a share's path,
// at or below an entry of it that is a read-only snapshot (a read-only mount, or a read-only
// btrfs subvolume). 0 with *in_snapshot set, or -1 when the entry cannot be examined.
int QLIBFhsPathInSnapshot(const char* path, int* in_snapshot);

// 1 when `name` (one component) is one of the platform's own metadata folders, else 0.
int QUIXEAIsHiddenDir(const char* name);

// Access bits reported by QUIXACLPermGet.
constexpr int QUIX_ACL_EXECUTE = 0x01;
constexpr int QUIX_ACL_WRITE = 0x02;
constexpr int QUIX_ACL_READ = 0x04;
// The access that the effective user and groups have to `path`, as the kernel judges it (POSIX
// ACLs included): 0 with QUIX_ACL_* bits in *perm, or -1 when the path does not exist.
int QUIXACLPermGet(const char* path, int* perm);

// The copy call's argument record: 60 bytes, zero-filled by callers.
struct QUIXCOPYARGS {
  uint32_t fCopy;       // 1: copy the file
  uint32_t fRemoveSrc;  // 1: remove the source once the copy is complete
  uint32_t reserved[13];
};
static_assert(sizeof(QUIXCOPYARGS) == 60, "the copy record is 60 bytes");

// Copies the regular file `src` to `dst` (replaced atomically), keeping mode, owner (as root)
// and times; removes `src` afterwards when asked. 0 on success, -1 with errno set.
int QUIXFileCopy(const char* src, const char* dst, const QUIXCOPYARGS* args);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_FS_HPP_
