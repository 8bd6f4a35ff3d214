#include "platform/share.hpp"

#include <dirent.h>
#include <grp.h>
#include <pwd.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <set>

#include "platform/internal.hpp"

namespace orvane {
namespace platform {

bool CopyOut(const std::string& text, char* buf, size_t size) {
  if (buf == nullptr || size == 0) return false;
  if (text.size() + 1 > size) {
    buf[0] = '\0';
    return false;
  }
  memcpy(buf, text.c_str(), text.size() + 1);
  return true;
}

bool PathIsAtOrBelow(const std::string& path, const std::string& dir) {
  if (path.compare(0, dir.size(), dir) != 0) return false;
  return path.size() == dir.size() || path[dir.size()] == '/';
}

namespace {

const ShareConfig* FindShareHolding(const PlatformConfig& config, const std::string& path) {
  const ShareConfig* best = nullptr;
  for (const ShareConfig& share : config.shares) {
    if (PathIsAtOrBelow(path, share.path) && (best == nullptr || share.path.size() > best->path.size())) {
      best = &share;
    }
  }
  return best;
}

// The public flag getters differ only in the field they read; `call` names the getter for the
// fault seam.
int FlagGet(const char* call, const QUIXSHARE* share, int* flag, int QUIXSHARE::*field) {
  PLATFORM_FAULT_POINT(call, flag);
  if (share == nullptr || flag == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  *flag = share->*field ? 1 : 0;
  return 0;
}

std::string GroupName(gid_t gid) {
  struct group gr;
  struct group* result = nullptr;
  std::vector<char> buf(16384);
  if (getgrgid_r(gid, &gr, buf.data(), buf.size(), &result) != 0 || result == nullptr) return "";
  return gr.gr_name;
}

// Access from the mode bits of the share's folder, judged like the kernel does for owner,
// group and others: reading and entering the folder gives read-only, writing as well read-write.
int AccessFromFolder(const std::string& path, const struct passwd& pw,
                     const std::vector<gid_t>& groups) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return SHARE_NOACCESS;
  mode_t bits;
  if (st.st_uid == pw.pw_uid) {
    bits = (st.st_mode >> 6) & 7;
  } else if (std::find(groups.begin(), groups.end(), st.st_gid) != groups.end()) {
    bits = (st.st_mode >> 3) & 7;
  } else {
    bits = st.st_mode & 7;
  }
  if ((bits & 5) != 5) return SHARE_NOACCESS;
  return (bits & 2) ? SHARE_READWRITE : SHARE_READONLY;
}

std::unique_ptr<QUIXSHARE> MakeRecord(const ShareConfig& config) {
  auto record = std::make_unique<QUIXSHARE>();
  // The configuration bounds both lengths, so these copies always fit.
  CopyOut(config.name, record->szName, sizeof(record->szName));
  CopyOut(config.path, record->szPath, sizeof(record->szPath));
  record->fFTPPrivilege = config.ftp_privilege;
  record->fReadOnly = config.readonly;
  record->fEncrypted = config.encrypted;
  record->fEncryption = config.encryption;
  record->fRecycleBin = config.recycle_bin;
  record->fHideUnreadable = config.hide_unreadable;
  record->user_access = config.user_access;
  record->group_access = config.group_access;
  return record;
}

}  // namespace

int QUIXShareGet(const char* name, PQUIXSHARE* share) {
  PLATFORM_FAULT_POINT("QUIXShareGet", nullptr);
  if (name == nullptr || share == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  *share = nullptr;
  auto config = ConfigForCall();
  if (!config) return -1;
  const ShareConfig* found = config->FindShare(name);
  if (found == nullptr) return PLATFORM_FAIL(-1, ENOENT, kQErrNoSuchShare);
  auto record = MakeRecord(*found);
  *share = record.release();
  return 0;
}

void QUIXShareFree(PQUIXSHARE share) { delete share; }

PSZLIST QLIBCSzListAlloc(int capacity) {
  if (auto fault = FaultFor("QLIBCSzListAlloc")) {
    errno = fault->err;
    if (fault->platform_err != 0) QLIBCErrSet(fault->platform_err);
    return nullptr;
  }
  if (capacity < 0) {
    PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
    return nullptr;
  }
  auto list = new QLIBSZLIST();
  list->items.reserve(static_cast<size_t>(std::min(capacity, 4096)));
  return list;
}

void QLIBCSzListFree(PSZLIST list) { delete list; }

int QLIBCSzListCount(const QLIBSZLIST* list) {
  return list == nullptr ? 0 : static_cast<int>(list->items.size());
}

const char* QLIBCSzListGet(const QLIBSZLIST* list, int i) {
  if (list == nullptr || i < 0 || static_cast<size_t>(i) >= list->items.size()) return nullptr;
  return list->items[i].c_str();
}

int QLIBCSzListPush(PSZLIST* list, const char* item) {
  if (list == nullptr || *list == nullptr || item == nullptr) {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  (*list)->items.emplace_back(item);
  return 0;
}

int QLIBShareEnum(PSZLIST* list, QLIBShareEnumFunc filter) {
  PLATFORM_FAULT_POINT("QLIBShareEnum", nullptr);
  if (list == nullptr || *list == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  auto config = ConfigForCall();
  if (!config) return -1;
  int added = 0;
  for (const ShareConfig& share : config->shares) {
    // The filter sees records of the same configuration that is being listed.
    if (filter != nullptr && filter(MakeRecord(share).get()) != 0) continue;
    (*list)->items.push_back(share.name);
    ++added;
  }
  return added;
}

int QUIXShareNamePathGet(const char* path, char* name, size_t name_size, char* share_path,
                         size_t share_path_size) {
  PLATFORM_FAULT_POINT("QUIXShareNamePathGet", nullptr);
  if (path == nullptr || name == nullptr || share_path == nullptr || path[0] != '/') {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  auto config = ConfigForCall();
  if (!config) return -1;
  const ShareConfig* share = FindShareHolding(*config, path);
  if (share == nullptr) return PLATFORM_FAIL(-1, ENOENT, kQErrNoSuchShare);
  if (!CopyOut(share->name, name, name_size) ||
      !CopyOut(share->path, share_path, share_path_size)) {
    return PLATFORM_FAIL(-1, ERANGE, kQErrBufferTooSmall);
  }
  return 0;
}

int QLIBShareIsEncryptedGet(const QUIXSHARE* share, int* flag) {
  return FlagGet(__func__, share, flag, &QUIXSHARE::fEncrypted);
}

int QLIBShareIsReadOnlyGet(const QUIXSHARE* share, int* flag) {
  return FlagGet(__func__, share, flag, &QUIXSHARE::fReadOnly);
}

int QLIBShareIsEncryptionGet(const QUIXSHARE* share, int* flag) {
  return FlagGet(__func__, share, flag, &QUIXSHARE::fEncryption);
}

int QLIBShareRecycleStatusGet(const QUIXSHARE* share, int* flag) {
  return FlagGet(__func__, share, flag, &QUIXSHARE::fRecycleBin);
}

int QLIBShareHideUnreadableGet(const QUIXSHARE* share, int* flag) {
  return FlagGet(__func__, share, flag, &QUIXSHARE::fHideUnreadable);
}

int QUIXShareUserPrivCalc(const char* user, const QUIXSHARE* share) {
  PLATFORM_FAULT_POINT("QUIXShareUserPrivCalc", nullptr);
  if (user == nullptr || share == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  struct passwd pw;
  struct passwd* found = nullptr;
  std::vector<char> buf(16384);
  if (getpwnam_r(user, &pw, buf.data(), buf.size(), &found) != 0 || found == nullptr) {
    return PLATFORM_FAIL(-1, ENOENT, kQErrNoSuchUser);
  }
  if (pw.pw_uid == 0) return SHARE_READWRITE;
  const std::vector<gid_t> groups = GroupList(pw);

  // Entries naming the user or one of the user's groups: a denial anywhere wins, otherwise the
  // widest grant counts.
  std::vector<int> matched;
  auto by_user = share->user_access.find(user);
  if (by_user != share->user_access.end()) matched.push_back(by_user->second);
  if (!share->group_access.empty()) {
    for (gid_t gid : groups) {
      auto by_group = share->group_access.find(GroupName(gid));
      if (by_group != share->group_access.end()) matched.push_back(by_group->second);
    }
  }
  if (matched.empty()) return AccessFromFolder(share->szPath, pw, groups);
  if (std::find(matched.begin(), matched.end(), SHARE_NOACCESS) != matched.end()) {
    return SHARE_NOACCESS;
  }
  return *std::max_element(matched.begin(), matched.end());
}

int QUIXShareIsShareRecycle(const char* path) {
  PLATFORM_FAULT_POINT("QUIXShareIsShareRecycle", nullptr);
  if (path == nullptr || path[0] != '/') return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  auto config = ConfigForCall();
  if (!config) return -1;
  const ShareConfig* share = FindShareHolding(*config, path);
  if (share == nullptr || !share->recycle_bin) return 0;
  return PathIsAtOrBelow(path, share->path + "/#recycle") ? 1 : 0;
}

int QUIXRecycleUserHomePathIsExist(const char* path, int flags) {
  PLATFORM_FAULT_POINT("QUIXRecycleUserHomePathIsExist", nullptr);
  if (path == nullptr || path[0] != '/') return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  auto config = ConfigForCall();
  if (!config) return -1;
  const ShareConfig* homes = config->FindShare("homes");
  if (homes == nullptr || !PathIsAtOrBelow(path, homes->path)) return 0;
  // <homes>/<user>/#recycle[/...]
  const std::string rest = std::string(path).substr(homes->path.size());
  const size_t user_end = rest.find('/', 1);
  if (rest.size() < 2 || user_end == std::string::npos) return 0;
  const std::string bin = homes->path + rest.substr(0, user_end) + "/#recycle";
  if ((flags & RECYCLE_HOME_CHECK_PATH) && !PathIsAtOrBelow(path, bin)) return 0;
  if ((flags & RECYCLE_HOME_CHECK_ENABLED) && !homes->recycle_bin) return 0;
  if (flags & RECYCLE_HOME_CHECK_EXIST) {
    struct stat st;
    if (lstat(bin.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return 0;
  }
  return 1;
}

namespace {

bool UserExists(const std::string& name) {
  struct passwd pw;
  struct passwd* found = nullptr;
  std::vector<char> buf(16384);
  return getpwnam_r(name.c_str(), &pw, buf.data(), buf.size(), &found) == 0 && found != nullptr;
}

// Users listed in the local account file; everyone else comes from a directory service.
std::set<std::string> LocalUserNames() {
  std::set<std::string> names;
  FILE* file = fopen("/etc/passwd", "re");
  if (file == nullptr) return names;
  while (struct passwd* pw = fgetpwent(file)) names.insert(pw->pw_name);
  fclose(file);
  return names;
}

int EnumHomeRecycle(PSZLIST* list, int auth_type) {
  if (list == nullptr || *list == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  auto config = ConfigForCall();
  if (!config) return -1;
  const ShareConfig* homes = config->FindShare("homes");
  if (homes == nullptr) return PLATFORM_FAIL(-1, ENOENT, kQErrNoSuchShare);
  std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(homes->path.c_str()), closedir);
  if (!dir) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  const std::set<std::string> local = LocalUserNames();
  std::vector<std::string> found;
  while (struct dirent* entry = readdir(dir.get())) {
    const std::string user = entry->d_name;
    if (user == "." || user == ".." || !UserExists(user)) continue;
    const int source = local.count(user) ? AUTH_LOCAL : (AUTH_DOMAIN | AUTH_LDAP);
    if ((source & auth_type) == 0) continue;
    const std::string bin = homes->path + "/" + user + "/#recycle";
    struct stat st;
    if (lstat(bin.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) found.push_back(bin);
  }
  std::sort(found.begin(), found.end());
  for (const std::string& bin : found) (*list)->items.push_back(bin);
  return static_cast<int>(found.size());
}

}  // namespace

int QUIXRecycleHomeEnumRecyclePath(PSZLIST* list) {
  PLATFORM_FAULT_POINT("QUIXRecycleHomeEnumRecyclePath", nullptr);
  return EnumHomeRecycle(list, AUTH_ALL);
}

int QUIXRecycleHomeEnumRecyclePathForAuthType(PSZLIST* list, AUTH_TYPE auth_type) {
  PLATFORM_FAULT_POINT("QUIXRecycleHomeEnumRecyclePathForAuthType", nullptr);
  return EnumHomeRecycle(list, auth_type);
}

}  // namespace platform
}  // namespace orvane
