#include "platform/safe_dir.hpp"

#include <dirent.h>
#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>
#include <set>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"

namespace orvane {
namespace platform {
namespace {

constexpr mode_t kDirMode = 0700;
constexpr mode_t kFileMode = 0600;
constexpr const char* kSystemDir = "@eaDir";

std::string Join(const std::string& dir, const std::string& name) {
  return dir == "/" ? "/" + name : dir + "/" + name;
}

// A refusal is logged the first time only: the worker meets it again on every pass.
[[noreturn]] void Refuse(const std::string& path, const std::string& what) {
  const std::string message =
      "unsafe index file " + path + ": " + what +
      "; move it aside or remove it (a user who may write the share can have planted it), and "
      "the system makes its own root-only one in its place";
  static std::mutex mu;
  static std::set<std::string> logged;
  bool first;
  {
    std::lock_guard<std::mutex> lock(mu);
    first = logged.insert(message).second;
  }
  if (first) Log(LOG_ERR, "%s", message.c_str());
  throw Error(kErrUnsafePath, message);
}

std::string Describe(const struct stat& st) {
  if (S_ISLNK(st.st_mode)) return "it is a symbolic link";
  if (S_ISDIR(st.st_mode)) return "it is a folder";
  if (S_ISREG(st.st_mode)) return "it is a file";
  return "it is a special file";
}

// Checks an opened entry of the system's own and narrows its mode. `fd` is the entry itself.
void CheckOpened(int fd, const std::string& path, bool dir) {
  struct stat st;
  if (fstat(fd, &st) != 0) {
    throw Error(kErrSystem, "cannot inspect " + path + ": " + std::strerror(errno));
  }
  if (dir ? !S_ISDIR(st.st_mode) : !S_ISREG(st.st_mode)) {
    Refuse(path, Describe(st) + (dir ? ", not a folder" : ", not a regular file"));
  }
  if (st.st_uid != 0 && st.st_uid != geteuid()) {
    Refuse(path, "it is owned by uid " + std::to_string(st.st_uid) + ", not by root");
  }
  if (!dir && st.st_nlink > 1) Refuse(path, "it has other names (hard links)");
  const mode_t want = dir ? kDirMode : kFileMode;
  if ((st.st_mode & 07777) == want) return;
  if (fchmod(fd, want) == 0) return;
  // Read bits left to others by an older installation are only a leak while they last; write
  // bits would let anyone change what the daemons read.
  if ((st.st_mode & 022) != 0) {
    Refuse(path, std::string("it is writable by others and cannot be made root-only (") +
                     std::strerror(errno) + ")");
  }
  Log(LOG_WARNING, "cannot narrow the mode of %s: %m", path.c_str());
}

// Turns a failed open of an owned entry into a refusal when the entry is of the wrong kind.
[[noreturn]] void OpenFailed(int dirfd, const std::string& name, const std::string& path,
                             bool dir) {
  const int failure = errno;
  struct stat st;
  if ((failure == ELOOP || failure == ENOTDIR || failure == ENXIO || failure == EISDIR) &&
      fstatat(dirfd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
    Refuse(path, Describe(st) + (dir ? ", not a folder" : ", not a regular file"));
  }
  errno = failure;
  throw Error(kErrSystem, "cannot open " + path + ": " + std::strerror(failure));
}

// Opens (and with `create` makes) the owned folder `name` in `dirfd`; invalid when missing.
UniqueFd OpenOwnedDir(int dirfd, const std::string& name, const std::string& path, bool create) {
  for (int attempt = 0; attempt < 2; ++attempt) {
    UniqueFd fd(openat(dirfd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (fd.valid()) {
      CheckOpened(fd.get(), path, true);
      return fd;
    }
    if (errno != ENOENT) OpenFailed(dirfd, name, path, true);
    if (!create) return UniqueFd();
    if (mkdirat(dirfd, name.c_str(), kDirMode) != 0 && errno != EEXIST) {
      throw Error(kErrSystem, "cannot create folder " + path + ": " + std::strerror(errno));
    }
  }
  throw Error(kErrSystem, "folder " + path + " vanished while it was being created");
}

// Removes `name` in `parent` depth first without following a link; a folder on another file
// system than `dev` (a mount point) is left in place and fails the removal.
int RemoveAt(int parent, const std::string& name, dev_t dev) {
  struct stat st;
  if (fstatat(parent, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno == ENOENT ? 0 : -1;
  if (!S_ISDIR(st.st_mode)) return unlinkat(parent, name.c_str(), 0) == 0 || errno == ENOENT ? 0 : -1;
  if (st.st_dev != dev) {
    errno = EBUSY;
    return -1;
  }
  const int fd = openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return -1;
  DIR* d = fdopendir(fd);
  if (d == nullptr) {
    close(fd);
    return -1;
  }
  int rc = 0;
  while (struct dirent* ent = readdir(d)) {
    if (std::strcmp(ent->d_name, ".") == 0 || std::strcmp(ent->d_name, "..") == 0) continue;
    if (RemoveAt(dirfd(d), ent->d_name, dev) != 0) rc = -1;
  }
  const int failure = errno;
  closedir(d);
  errno = failure;
  if (rc != 0) return -1;
  return unlinkat(parent, name.c_str(), AT_REMOVEDIR) == 0 || errno == ENOENT ? 0 : -1;
}

}  // namespace

SystemPathSplit SplitSystemPath(const std::string& path) {
  SystemPathSplit split;
  std::vector<std::string> parts;
  for (size_t pos = 0; pos < path.size();) {
    const size_t next = path.find('/', pos);
    const size_t end = next == std::string::npos ? path.size() : next;
    if (end > pos) parts.push_back(path.substr(pos, end - pos));
    pos = end + 1;
  }
  size_t first_owned = parts.size();
  for (size_t i = 0; i < parts.size(); ++i) {
    if (parts[i] == kSystemDir) {
      first_owned = i;
      break;
    }
  }
  split.trusted = "/";
  for (size_t i = 0; i < first_owned; ++i) split.trusted = Join(split.trusted, parts[i]);
  split.owned.assign(parts.begin() + static_cast<std::ptrdiff_t>(first_owned), parts.end());
  return split;
}

SafeDir SafeDir::Open(const std::string& path, bool create) {
  if (path.empty() || path[0] != '/') {
    throw Error(kErrInvalidParam, "not an absolute path: " + path);
  }
  const SystemPathSplit split = SplitSystemPath(path);
  // The trusted part is the administrator's (the share's own path): made like any other folder
  // when missing, and never narrowed.
  if (create) {
    MakeParentDirs(Join(split.trusted, split.owned.empty() ? "" : split.owned[0]));
  }
  UniqueFd fd(open(split.trusted.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd.valid()) {
    if (errno == ENOENT && !create) return SafeDir();
    throw Error(kErrSystem, "cannot open " + split.trusted + ": " + std::strerror(errno));
  }
  std::string at = split.trusted;
  for (const std::string& name : split.owned) {
    at = Join(at, name);
    UniqueFd next = OpenOwnedDir(fd.get(), name, at, create);
    if (!next.valid()) {
      errno = ENOENT;
      return SafeDir();
    }
    fd = std::move(next);
  }
  return SafeDir(std::move(fd), at, !split.owned.empty());
}

UniqueFd SafeDir::OpenFile(const std::string& name, int flags) const {
  const std::string path = Join(path_, name);
  UniqueFd fd(openat(fd_.get(), name.c_str(), flags | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK,
                     kFileMode));
  if (!fd.valid()) {
    if (owned_ && (errno == ELOOP || errno == ENXIO || errno == EISDIR)) {
      OpenFailed(fd_.get(), name, path, false);
    }
    return fd;
  }
  if (owned_) CheckOpened(fd.get(), path, false);
  // Regular files only from here on: the flag was there to keep a planted FIFO from blocking.
  const int fl = fcntl(fd.get(), F_GETFL);
  if (fl >= 0) (void)fcntl(fd.get(), F_SETFL, fl & ~O_NONBLOCK);
  return fd;
}

bool SafeDir::CheckEntry(const std::string& name, bool dir) const {
  const std::string path = Join(path_, name);
  if (dir) return OpenOwnedDir(fd_.get(), name, path, false).valid();
  UniqueFd fd = OpenFile(name, O_RDONLY);
  if (fd.valid()) return true;
  if (errno == ENOENT) return false;
  throw Error(kErrSystem, "cannot open " + path + ": " + std::strerror(errno));
}

SafeDir SafeDir::Sub(const std::string& name, bool create) const {
  const std::string path = Join(path_, name);
  UniqueFd fd = OpenOwnedDir(fd_.get(), name, path, create);
  if (!fd.valid()) return SafeDir();
  return SafeDir(std::move(fd), path, true);
}

bool SafeDir::Exists(const std::string& name) const {
  struct stat st;
  return Stat(name, &st);
}

bool SafeDir::Stat(const std::string& name, struct stat* st) const {
  return fstatat(fd_.get(), name.c_str(), st, AT_SYMLINK_NOFOLLOW) == 0;
}

int SafeDir::Rename(const std::string& from, const std::string& to) const {
  return renameat(fd_.get(), from.c_str(), fd_.get(), to.c_str());
}

int SafeDir::RenameTo(const std::string& from, const SafeDir& to_dir,
                      const std::string& to) const {
  return renameat(fd_.get(), from.c_str(), to_dir.fd(), to.c_str());
}

int SafeDir::Unlink(const std::string& name) const { return unlinkat(fd_.get(), name.c_str(), 0); }

int SafeDir::RemoveDir(const std::string& name) const {
  return unlinkat(fd_.get(), name.c_str(), AT_REMOVEDIR);
}

int SafeDir::RemoveTree(const std::string& name) const {
  struct stat st;
  if (fstat(fd_.get(), &st) != 0) return -1;
  return RemoveAt(fd_.get(), name, st.st_dev);
}

bool SafeDir::Sync() const { return fsync(fd_.get()) == 0; }

}  // namespace platform
}  // namespace orvane
