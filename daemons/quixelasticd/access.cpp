#include "daemons/quixelasticd/access.hpp"

#include <endian.h>
#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <linux/posix_acl.h>
#include <linux/posix_acl_xattr.h>
#include <pwd.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "platform/fault.hpp"

namespace orvane {
namespace elasticd {

namespace {

constexpr const char kIndexInShare[] = "/@eaDir/@fileindex/db";
constexpr const char kAclName[] = "system.posix_acl_access";
// The kernel gives up resolving a path after this many symlinks.
constexpr int kMaxLinks = 40;

// Absolute, without empty, "." or ".." components: the folder answers are kept by path, and
// such a component would make one path name a folder that another path also names, or climb
// back out of a folder after its check.
bool IsPlainPath(const std::string& path) {
  if (path.empty() || path[0] != '/') return false;
  if (path == "/") return true;
  size_t start = 1;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    const size_t len = end - start;
    if (len == 0) return false;
    if (len <= 2 && path.compare(start, len, std::string(len, '.')) == 0) return false;
    start = end + 1;
  }
  return true;
}

std::string ParentOf(const std::string& path) {
  const size_t slash = path.find_last_of('/');
  return slash == 0 ? "/" : path.substr(0, slash);
}

#ifdef SYS_getxattrat
constexpr long kSysGetxattrat = SYS_getxattrat;
#else
constexpr long kSysGetxattrat = 464;  // one number on every architecture since Linux 6.13
#endif

struct XattrArgs {
  uint64_t value;
  uint32_t size;
  uint32_t flags;
};

// The access ACL of `name` in the folder `dir_fd` (not following a symlink), as getxattr()
// answers. Kernels without getxattrat() reach it through an O_PATH descriptor's /proc link.
ssize_t GetAcl(int dir_fd, const char* name, char* buf, size_t size) {
  XattrArgs args{reinterpret_cast<uintptr_t>(buf), static_cast<uint32_t>(size), 0};
  long n;
  if (auto fault = platform::FaultFor("getxattrat")) {
    n = fault->result;
    errno = fault->err;
  } else {
    n = ::syscall(kSysGetxattrat, dir_fd, name, AT_SYMLINK_NOFOLLOW, kAclName, &args, sizeof(args));
  }
  if (n >= 0 || errno != ENOSYS) return n;
  const UniqueFd fd(::openat(dir_fd, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) return -1;
  char link[32];
  std::snprintf(link, sizeof(link), "/proc/self/fd/%d", fd.get());
  return ::getxattr(link, kAclName, buf, size);
}

}  // namespace

AccessChecker::AccessChecker(uid_t uid, gid_t gid) : uid_(uid), groups_{gid} {
  struct passwd pw;
  struct passwd* found = nullptr;
  std::vector<char> buf(16384);
  if (getpwuid_r(uid, &pw, buf.data(), buf.size(), &found) == 0 && found != nullptr) {
    int n = 64;
    std::vector<gid_t> groups(n);
    if (getgrouplist(pw.pw_name, pw.pw_gid, groups.data(), &n) < 0) {
      groups.resize(n);
      getgrouplist(pw.pw_name, pw.pw_gid, groups.data(), &n);
    }
    groups.resize(std::max(n, 0));
    groups_.insert(groups_.end(), groups.begin(), groups.end());
  }
  std::sort(groups_.begin(), groups_.end());
  groups_.erase(std::unique(groups_.begin(), groups_.end()), groups_.end());
}

AccessChecker::AccessChecker(uid_t uid, std::vector<gid_t> groups)
    : uid_(uid), groups_(std::move(groups)) {
  std::sort(groups_.begin(), groups_.end());
  groups_.erase(std::unique(groups_.begin(), groups_.end()), groups_.end());
}

std::string AccessChecker::ShareRootOf(const std::string& index_dir) {
  std::string dir = index_dir;
  while (dir.size() > 1 && dir.back() == '/') dir.pop_back();
  const size_t n = sizeof(kIndexInShare) - 1;
  if (dir.size() <= n || dir.compare(dir.size() - n, n, kIndexInShare) != 0) return "";
  const std::string root = dir.substr(0, dir.size() - n);
  return IsPlainPath(root) ? root : "";
}

bool AccessChecker::InGroup(gid_t gid) const {
  return std::binary_search(groups_.begin(), groups_.end(), gid);
}

int AccessChecker::AclBits(int dir_fd, const char* name, const struct stat& st) {
  // Most files carry no ACL; the small buffer holds the common ones without an allocation.
  char small[sizeof(posix_acl_xattr_header) + 16 * sizeof(posix_acl_xattr_entry)];
  std::unique_ptr<char[]> large;
  char* buf = small;
  ssize_t n = GetAcl(dir_fd, name, small, sizeof(small));
  if (n < 0 && errno == ERANGE) {
    const ssize_t want = GetAcl(dir_fd, name, nullptr, 0);
    if (want > 0) {
      large.reset(new char[static_cast<size_t>(want)]);
      buf = large.get();
      n = GetAcl(dir_fd, name, buf, static_cast<size_t>(want));
    }
  }
  if (n < 0 && errno != ENODATA && errno != ENOTSUP) return 0;
  // The ACL was read by name: it is this inode's only if the name still holds the inode, and
  // the inode was not moved away and back meanwhile (a rename or link changes its ctime).
  struct stat again;
  if (::fstatat(dir_fd, name, &again, AT_SYMLINK_NOFOLLOW) != 0 || again.st_dev != st.st_dev ||
      again.st_ino != st.st_ino || again.st_ctim.tv_sec != st.st_ctim.tv_sec ||
      again.st_ctim.tv_nsec != st.st_ctim.tv_nsec) {
    return 0;
  }
  if (n < 0) return -1;

  // The kernel's stored form: a version, then entries in the order user owner, named users,
  // owning group, named groups, mask, other. Anything else is refused as the kernel would.
  posix_acl_xattr_header header;
  if (static_cast<size_t>(n) < sizeof(header)) return 0;
  std::memcpy(&header, buf, sizeof(header));
  const size_t count = (static_cast<size_t>(n) - sizeof(header)) / sizeof(posix_acl_xattr_entry);
  if (le32toh(header.a_version) != POSIX_ACL_XATTR_VERSION ||
      sizeof(header) + count * sizeof(posix_acl_xattr_entry) != static_cast<size_t>(n)) {
    return 0;
  }
  int mask = 7;
  int other = 0;
  int user = -1;   // a named entry for this user
  int group = -1;  // the union of the group entries that match
  for (size_t i = 0; i < count; ++i) {
    posix_acl_xattr_entry e;
    std::memcpy(&e, buf + sizeof(header) + i * sizeof(e), sizeof(e));
    const int perm = le16toh(e.e_perm) & 7;
    const uint32_t id = le32toh(e.e_id);
    switch (le16toh(e.e_tag)) {
      case ACL_USER_OBJ:
        break;  // the owner was decided from the mode bits, which mirror this entry
      case ACL_USER:
        if (id == uid_ && user < 0) user = perm;
        break;
      case ACL_GROUP_OBJ:
        if (InGroup(st.st_gid)) group = std::max(group, 0) | perm;
        break;
      case ACL_GROUP:
        if (InGroup(id)) group = std::max(group, 0) | perm;
        break;
      case ACL_MASK:
        mask = perm;
        break;
      case ACL_OTHER:
        other = perm;
        break;
      default:
        return 0;
    }
  }
  // A named user entry wins over every group; a matching group (any of them, each asked for
  // one permission at a time) wins over other, and both are limited by the mask. Taking the
  // union of the matching groups is exact because every question asked here is a single bit.
  if (user >= 0) return user & mask;
  if (group >= 0) return group & mask;
  return other;
}

int AccessChecker::Bits(int dir_fd, const char* name, const struct stat& st) {
  if (st.st_uid == uid_) return (st.st_mode >> 6) & 7;
  // With no group class bits the kernel does not look at the ACL at all.
  if ((st.st_mode & S_IRWXG) != 0) {
    const int acl = AclBits(dir_fd, name, st);
    if (acl >= 0) return acl;
  }
  if (InGroup(st.st_gid)) return (st.st_mode >> 3) & 7;
  return st.st_mode & 7;
}

int AccessChecker::FolderFd(const std::string& dir, const Folder& f) {
  if (fd_.valid() && fd_dir_ == dir) return fd_.get();
  fd_.Reset(::open(dir.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  fd_dir_ = dir;
  struct stat st;
  // A different inode now: the folders were moved since they were checked, and what the
  // path leads to has not been.
  if (fd_.valid() && (::fstat(fd_.get(), &st) != 0 || st.st_dev != f.dev || st.st_ino != f.ino)) {
    fd_.Reset();
  }
  return fd_.get();
}

AccessChecker::Folder AccessChecker::FolderOf(const std::string& dir, int links) {
  auto it = folders_.find(dir);
  if (it != folders_.end()) return it->second;
  Folder f;
  Folder parent;
  parent.enter = true;
  int up_fd = AT_FDCWD;  // "/" is looked at by its absolute name
  const char* name = dir.c_str();
  if (dir != "/") {
    const std::string up = ParentOf(dir);
    parent = FolderOf(up, links);
    up_fd = parent.enter ? FolderFd(up, parent) : -1;
    name = dir.c_str() + dir.find_last_of('/') + 1;
  }
  struct stat st;
  if (up_fd != -1 && ::fstatat(up_fd, name, &st, AT_SYMLINK_NOFOLLOW) == 0) {
    if (S_ISDIR(st.st_mode)) {
      const int bits = Bits(up_fd, name, st);
      f.enter = (bits & 1) != 0;
      f.list = (bits & 4) != 0;
      f.link_end = parent.link_end;
      f.dev = st.st_dev;
      f.ino = st.st_ino;
    } else if (S_ISLNK(st.st_mode) && links < kMaxLinks) {
      // Whether this link may be followed depends on the share it is asked for; the answer
      // for its target is what the kernel would find, and the link is remembered.
      std::unique_ptr<char, decltype(&std::free)> real(::realpath(dir.c_str(), nullptr),
                                                       &std::free);
      if (real && IsPlainPath(real.get())) {
        f = FolderOf(real.get(), links + 1);
        f.link_end = dir.size();
      }
    }
  }
  folders_[dir] = f;
  return f;
}

bool AccessChecker::CanOpen(const std::string& path, const std::string& share_root) {
  if (uid_ == 0) return true;
  if (!IsPlainPath(path) || path == "/") return false;
  const std::string dir = ParentOf(path);
  const Folder parent = FolderOf(dir, 0);
  if (!parent.enter || !parent.list) return false;
  // A symlink at or above the share's root is the administrator's; one below it is not.
  size_t followed = 0;
  if (!share_root.empty() && path.size() > share_root.size() &&
      path.compare(0, share_root.size(), share_root) == 0 &&
      (share_root == "/" || path[share_root.size()] == '/')) {
    followed = share_root.size();
  }
  if (parent.link_end > followed) return false;
  const int dir_fd = FolderFd(dir, parent);
  if (dir_fd < 0) return false;
  const char* name = path.c_str() + path.find_last_of('/') + 1;
  struct stat st;
  if (::fstatat(dir_fd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) return false;
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return false;
  return (Bits(dir_fd, name, st) & 4) != 0;
}

}  // namespace elasticd
}  // namespace orvane
