#include "common/util.hpp"

#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "common/error.hpp"
#include "common/sdk/sdk_mutex.hpp"
#include "platform/user.hpp"

namespace orvane {

using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them

namespace {

constexpr char kOrvaneUser[] = "Orvane";

// Builds a User from a looked-up record; the caller holds SDKMutex().
std::unique_ptr<sdk::User> UserOf(const QUIXUSER& info) {
  const bool home_enabled = QUIXServiceUserHomeIsEnabled(info.szName) == 1;
  return std::make_unique<sdk::User>(info.szName, info.uid, info.gid, home_enabled);
}

}  // namespace

bool CheckACLPerm(const std::string& path, int mask) {
  int perm = 0;
  if (0 > QUIXACLPermGet(path.c_str(), &perm)) return false;
  return (mask & perm) != 0;
}

bool IsMountPoint(const std::string& path) { return QUIXFSDirIsMntPoint(path.c_str()) > 0; }

bool MVFileImpl(const std::string& src, const std::string& dst, QUIXCOPYARGS* args) {
  return QUIXFileCopy(src.c_str(), dst.c_str(), args) == 0;
}

bool MVFile(const std::string& src, const std::string& dst) {
  QUIXCOPYARGS args;
  memset(&args, 0, sizeof(args));
  args.fCopy = 1;
  args.fRemoveSrc = 1;
  return MVFileImpl(src, dst, &args);
}

bool CPFile(const std::string& src, const std::string& dst) {
  QUIXCOPYARGS args;
  memset(&args, 0, sizeof(args));
  args.fCopy = 1;
  return MVFileImpl(src, dst, &args);
}

bool ChownOrvane(const std::string& path) {
  uid_t uid;
  gid_t gid;
  {
    LockMutex lock(sdk::SDKMutex());
    QUIXUSER* user_info = nullptr;
    ORVANE_THROW_IF(0 > QUIXUserGet(kOrvaneUser, &user_info) || !user_info, kErrChown,
                    std::string("QUIXUserGet failed, user=") + kOrvaneUser);
    uid = user_info->uid;
    gid = user_info->gid;
    QUIXUserFree(user_info);
  }
  return chown(path.c_str(), uid, gid) == 0;
}

std::unique_ptr<sdk::User> GetUser(const std::string& name) {
  LockMutex lock(sdk::SDKMutex());
  QUIXUSER* user_info = nullptr;
  ORVANE_THROW_IF(0 > QUIXUserGet(name.c_str(), &user_info) || !user_info, kErrChown,
                  "QUIXUserGet failed, user=" + name);
  std::unique_ptr<QUIXUSER, void (*)(PQUIXUSER)> owned(user_info, QUIXUserFree);
  return UserOf(*user_info);
}

std::unique_ptr<sdk::User> GetUserByUID(uid_t uid) {
  LockMutex lock(sdk::SDKMutex());
  QUIXUSER* user_info = nullptr;
  ORVANE_THROW_IF(0 > QUIXUserGetByUID(uid, &user_info) || !user_info, kErrChown,
                  "QUIXUserGetByUID failed, uid=" + std::to_string(uid));
  std::unique_ptr<QUIXUSER, void (*)(PQUIXUSER)> owned(user_info, QUIXUserFree);
  return UserOf(*user_info);
}

bool IsFileExist(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

bool IsDirExist(const std::string& path, bool follow_link) {
  std::string current = path;
  // Link texts are resolved one hop at a time; a loop of links would never end, so the chain is
  // cut at the kernel's own limit of 40 links per lookup.
  for (int hops = 0; hops <= 40; ++hops) {
    struct stat st;
    if (lstat(current.c_str(), &st) != 0) return false;
    if (S_ISDIR(st.st_mode)) return true;
    if (!S_ISLNK(st.st_mode) || !follow_link) return false;
    char buf[4096];
    ssize_t n = readlink(current.c_str(), buf, sizeof(buf) - 1);
    if (n < 0) return false;
    current.assign(buf, static_cast<size_t>(n));
  }
  return false;
}

bool IsDirentDir(const struct dirent& entry, const std::string& path) {
  if (entry.d_type == DT_DIR) return true;
  if (entry.d_type != DT_UNKNOWN) return false;
  struct stat st;
  lstat(path.c_str(), &st);
  return false;
}

bool StringStartWith(const std::string& str, const std::string& prefix) {
  return str.compare(0, prefix.size(), prefix) == 0;
}

std::string Basename(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

std::string Dirname(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(0, slash);
}

std::string GetFileExtension(const std::string& path, bool to_lower) {
  const std::string base = Basename(path);
  const size_t dot = base.rfind('.');
  if (dot == std::string::npos) return std::string();
  std::string ext = base.substr(dot + 1);
  return to_lower ? ToLower(ext) : ext;
}

std::string RealPath(const std::string& path) {
  std::unique_ptr<char[]> buf(new char[PATH_MAX]);
  if (realpath(path.c_str(), buf.get()) == nullptr) return std::string();
  return std::string(buf.get());
}

bool Unlink(const std::string& path) { return unlink(path.c_str()) == 0 || errno == ENOENT; }

std::string RTrim(const std::string& s) {
  size_t end = s.size();
  while (end > 0 && std::isspace(static_cast<unsigned char>(s[end - 1]))) --end;
  return s.substr(0, end);
}

std::string LTrim(const std::string& s) {
  size_t begin = 0;
  while (begin < s.size() && std::isspace(static_cast<unsigned char>(s[begin]))) ++begin;
  return s.substr(begin);
}

std::string Trim(const std::string& s) { return LTrim(RTrim(s)); }

std::string ToLower(const std::string& s) {
  std::string out(s);
  for (char& c : out) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return out;
}

}  // namespace orvane
