#include "daemons/quixelasticd/access.hpp"

#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

namespace orvane {
namespace elasticd {

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
}

int AccessChecker::Bits(const std::string& path) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return -1;
  if (st.st_uid == uid_) return (st.st_mode >> 6) & 7;
  if (std::find(groups_.begin(), groups_.end(), st.st_gid) != groups_.end()) {
    return (st.st_mode >> 3) & 7;
  }
  return st.st_mode & 7;
}

bool AccessChecker::CanEnter(const std::string& dir) {
  auto it = dirs_.find(dir);
  if (it != dirs_.end()) return it->second;
  bool ok = true;
  if (dir != "/") {
    const size_t slash = dir.find_last_of('/');
    if (slash == std::string::npos) return false;
    ok = CanEnter(slash == 0 ? "/" : dir.substr(0, slash));
  }
  if (ok) {
    const int bits = Bits(dir);
    ok = bits >= 0 && (bits & 1) != 0;
  }
  dirs_[dir] = ok;
  return ok;
}

bool AccessChecker::CanOpen(const std::string& path) {
  if (uid_ == 0) return true;
  if (path.empty() || path[0] != '/') return false;
  const size_t slash = path.find_last_of('/');
  if (!CanEnter(slash == 0 ? "/" : path.substr(0, slash))) return false;
  const int bits = Bits(path);
  return bits >= 0 && (bits & 4) != 0;
}

}  // namespace elasticd
}  // namespace orvane
