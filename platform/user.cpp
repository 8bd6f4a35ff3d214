#include "platform/user.hpp"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "platform/config.hpp"
#include "platform/internal.hpp"

namespace orvane {
namespace platform {
namespace {

constexpr size_t kNssBufferBytes = 16384;

struct PasswdEntry {
  struct passwd pw;
  std::vector<char> buf = std::vector<char>(kNssBufferBytes);
};

// errno: ENOENT for an unknown user, else what NSS said.
bool LookupByName(const char* name, PasswdEntry* entry) {
  struct passwd* found = nullptr;
  const int rc = getpwnam_r(name, &entry->pw, entry->buf.data(), entry->buf.size(), &found);
  if (found != nullptr) return true;
  errno = rc != 0 ? rc : ENOENT;
  return false;
}

bool LookupByUid(uid_t uid, PasswdEntry* entry) {
  struct passwd* found = nullptr;
  const int rc = getpwuid_r(uid, &entry->pw, entry->buf.data(), entry->buf.size(), &found);
  if (found != nullptr) return true;
  errno = rc != 0 ? rc : ENOENT;
  return false;
}

int FillUser(const struct passwd& pw, PQUIXUSER* user) {
  auto record = std::make_unique<QUIXUSER>();
  if (!CopyOut(pw.pw_name, record->szName, sizeof(record->szName)) ||
      !CopyOut(pw.pw_dir != nullptr ? pw.pw_dir : "", record->szHomeDir,
               sizeof(record->szHomeDir))) {
    return PLATFORM_FAIL(-1, ERANGE, kQErrBufferTooSmall);
  }
  record->uid = pw.pw_uid;
  record->gid = pw.pw_gid;
  *user = record.release();
  return 0;
}

}  // namespace

std::vector<gid_t> GroupList(const struct passwd& pw) {
  int count = 32;
  std::vector<gid_t> groups(count);
  while (getgrouplist(pw.pw_name, pw.pw_gid, groups.data(), &count) < 0) {
    groups.resize(static_cast<size_t>(count) + 32);
    count = static_cast<int>(groups.size());
  }
  groups.resize(count);
  return groups;
}

namespace {

// For the calls that ask about a named user under the current configuration: -1 (errno and the
// platform error set) when the name, the configuration or the user is missing.
int ConfigAndUser(const char* name, std::shared_ptr<const PlatformConfig>* config,
                  PasswdEntry* entry) {
  if (name == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  *config = ConfigForCall();
  if (!*config) return -1;
  if (!LookupByName(name, entry)) return PLATFORM_FAIL(-1, errno, kQErrNoSuchUser);
  return 0;
}

}  // namespace

int QUIXUserGet(const char* name, PQUIXUSER* user) {
  PLATFORM_FAULT_POINT("QUIXUserGet", nullptr);
  if (name == nullptr || user == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  *user = nullptr;
  PasswdEntry entry;
  if (!LookupByName(name, &entry)) return PLATFORM_FAIL(-1, errno, kQErrNoSuchUser);
  return FillUser(entry.pw, user);
}

int QUIXUserGetByUID(uid_t uid, PQUIXUSER* user) {
  PLATFORM_FAULT_POINT("QUIXUserGetByUID", nullptr);
  if (user == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  *user = nullptr;
  PasswdEntry entry;
  if (!LookupByUid(uid, &entry)) return PLATFORM_FAIL(-1, errno, kQErrNoSuchUser);
  return FillUser(entry.pw, user);
}

void QUIXUserFree(PQUIXUSER user) { delete user; }

int QLIBGroupIsAdminGroupMem(const char* name, int flags) {
  PLATFORM_FAULT_POINT("QLIBGroupIsAdminGroupMem", nullptr);
  std::shared_ptr<const PlatformConfig> config;
  PasswdEntry entry;
  if (ConfigAndUser(name, &config, &entry) != 0) return -1;
  struct group gr;
  struct group* found = nullptr;
  std::vector<char> buf(kNssBufferBytes);
  if (getgrnam_r(config->admin_group.c_str(), &gr, buf.data(), buf.size(), &found) != 0 ||
      found == nullptr) {
    return 0;
  }
  const std::vector<gid_t> groups = GroupList(entry.pw);
  return std::find(groups.begin(), groups.end(), gr.gr_gid) != groups.end() ? 1 : 0;
}

bool ResetCredentialsByName(const char* name, bool set_groups) {
  PLATFORM_FAULT_POINT("ResetCredentialsByName", nullptr);
  if (name == nullptr) {
    PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
    return false;
  }
  PasswdEntry entry;
  if (!LookupByName(name, &entry)) {
    PLATFORM_FAIL(-1, errno, kQErrNoSuchUser);
    return false;
  }
  const struct passwd& pw = entry.pw;
  if (geteuid() != 0) {
    // Without root only a switch to yourself works: to the effective identity already in force,
    // or back to the real user (root again when the process started as root).
    if (pw.pw_uid == geteuid() && pw.pw_gid == getegid()) return true;
    if (pw.pw_uid != getuid()) {
      PLATFORM_FAIL(-1, EPERM, kQErrPermission);
      return false;
    }
    if (seteuid(pw.pw_uid) != 0) {
      PLATFORM_FAIL(-1, errno, kQErrPermission);
      return false;
    }
    if (pw.pw_uid != 0) {
      if (setegid(pw.pw_gid) != 0) {
        PLATFORM_FAIL(-1, errno, kQErrPermission);
        return false;
      }
      return true;
    }
  }
  // As root: group list, group, user, in that order (each later step gives up the right to the
  // earlier ones).
  if (set_groups) {
    const std::vector<gid_t> groups = GroupList(pw);
    if (setgroups(groups.size(), groups.data()) != 0) {
      PLATFORM_FAIL(-1, errno, kQErrSystem);
      return false;
    }
  }
  if (setegid(pw.pw_gid) != 0) {
    PLATFORM_FAIL(-1, errno, kQErrSystem);
    return false;
  }
  if (seteuid(pw.pw_uid) != 0) {
    PLATFORM_FAIL(-1, errno, kQErrSystem);
    return false;
  }
  return true;
}

int QUIXServiceUserHomeIsEnabled(const char* name) {
  PLATFORM_FAULT_POINT("QUIXServiceUserHomeIsEnabled", nullptr);
  std::shared_ptr<const PlatformConfig> config;
  PasswdEntry entry;
  if (ConfigAndUser(name, &config, &entry) != 0) return -1;
  return config->FindShare("homes") != nullptr ? 1 : 0;
}

int QUIXServiceHomePathGet(const char* name, char* buf, size_t size) {
  PLATFORM_FAULT_POINT("QUIXServiceHomePathGet", nullptr);
  if (name == nullptr || buf == nullptr || name[0] == '\0' ||
      std::string(name).find('/') != std::string::npos) {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  auto config = ConfigForCall();
  if (!config) return -1;
  const ShareConfig* homes = config->FindShare("homes");
  if (homes == nullptr) return PLATFORM_FAIL(-1, ENOENT, kQErrNotSupported);
  if (!CopyOut(homes->path + "/" + name, buf, size)) {
    return PLATFORM_FAIL(-1, ERANGE, kQErrBufferTooSmall);
  }
  return 0;
}

}  // namespace platform
}  // namespace orvane
