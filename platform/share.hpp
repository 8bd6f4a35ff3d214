// Share, string-list and recycle-bin calls of the platform, on top of the platform
// configuration file. Results follow the platform's convention: a negative value (or null) on
// failure with errno and QLIBCErrGet() set, 0 or more on success. Every function is safe from
// any thread; records returned by QUIXShareGet belong to the caller until QUIXShareFree.
#ifndef ORVANE_PLATFORM_SHARE_HPP_
#define ORVANE_PLATFORM_SHARE_HPP_

#include <cstddef>
#include <map>
#include <string>
#include <vector>

#include "platform/config.hpp"

namespace orvane {
namespace platform {

// One share as the platform describes it.
struct QUIXSHARE {
  char szName[492];
  char szPath[4096];
  int fFTPPrivilege;
  int fReadOnly;
  int fEncrypted;
  int fEncryption;
  int fRecycleBin;
  int fHideUnreadable;
  std::map<std::string, int> user_access;
  std::map<std::string, int> group_access;
};
using PQUIXSHARE = QUIXSHARE*;

// QUIXShareGet: 0 and a new record in *share; -1 when the share is unknown (ENOENT,
// kQErrNoSuchShare) or the configuration is unusable.
int QUIXShareGet(const char* name, PQUIXSHARE* share);
void QUIXShareFree(PQUIXSHARE share);

// A growable list of strings.
struct QLIBSZLIST {
  std::vector<std::string> items;
};
using PSZLIST = QLIBSZLIST*;

PSZLIST QLIBCSzListAlloc(int capacity);
void QLIBCSzListFree(PSZLIST list);
int QLIBCSzListCount(const QLIBSZLIST* list);
// The i-th item, or null when i is out of range.
const char* QLIBCSzListGet(const QLIBSZLIST* list, int i);
int QLIBCSzListPush(PSZLIST* list, const char* item);

// Enumeration filter: return 0 to list the share, anything else to leave it out.
using QLIBShareEnumFunc = int (*)(const QUIXSHARE* share);
// Appends the names of the shares that the filter accepts (all with a null filter), in
// configuration order; returns how many were appended, or -1.
int QLIBShareEnum(PSZLIST* list, QLIBShareEnumFunc filter);

// The share whose path holds `path` (the deepest when shares nest), its name and its path.
// 0 on success; -1 when no share holds the path (ENOENT) or a buffer is too small (ERANGE).
int QUIXShareNamePathGet(const char* path, char* name, size_t name_size, char* share_path,
                         size_t share_path_size);

// Flag queries on a share record: 0 with *flag set to 0 or 1, or -1 for a null record.
int QLIBShareIsEncryptedGet(const QUIXSHARE* share, int* flag);
int QLIBShareIsReadOnlyGet(const QUIXSHARE* share, int* flag);
int QLIBShareIsEncryptionGet(const QUIXSHARE* share, int* flag);
int QLIBShareRecycleStatusGet(const QUIXSHARE* share, int* flag);
int QLIBShareHideUnreadableGet(const QUIXSHARE* share, int* flag);

// A user's access to a share: SHARE_READWRITE, SHARE_READONLY or SHARE_NOACCESS, or -1 when the
// user is unknown. See platform/README.md for the rule.
int QUIXShareUserPrivCalc(const char* user, const QUIXSHARE* share);

// Recycle bins. QUIXShareIsShareRecycle: 1 when `path` is a share's recycle bin "#recycle"
// (directly under the share's path) or lies inside it, and the share has its recycle bin on;
// 0 otherwise; -1 on bad input.
int QUIXShareIsShareRecycle(const char* path);

// Flags for QUIXRecycleUserHomePathIsExist.
constexpr int RECYCLE_HOME_CHECK_PATH = 0x01;      // the path lies in a home recycle bin
constexpr int RECYCLE_HOME_CHECK_EXIST = 0x02;     // ... and that recycle bin exists
constexpr int RECYCLE_HOME_CHECK_ENABLED = 0x08;   // ... and the "homes" recycle bin is on
// 1 when `path` lies in a user's home recycle bin "<homes>/<user>/#recycle" under the flags
// given; 0 otherwise; -1 on bad input.
int QUIXRecycleUserHomePathIsExist(const char* path, int flags);

// Account sources for the home recycle-bin enumeration.
// Local accounts are those of /etc/passwd; every other account the system knows (through NSS)
// counts as both a domain and a directory account, which Linux cannot tell apart.
enum AUTH_TYPE : int {
  AUTH_LOCAL = 0x01,
  AUTH_DOMAIN = 0x02,
  AUTH_LDAP = 0x04,
  AUTH_ALL = AUTH_LOCAL | AUTH_DOMAIN | AUTH_LDAP,
};
// Appends the existing home recycle-bin folders of every user (or of the users of one account
// source) to *list; returns how many, or -1 (no "homes" share, a listing failure).
int QUIXRecycleHomeEnumRecyclePath(PSZLIST* list);
int QUIXRecycleHomeEnumRecyclePathForAuthType(PSZLIST* list, AUTH_TYPE auth_type);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_SHARE_HPP_
