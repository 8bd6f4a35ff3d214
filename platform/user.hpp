// Users, groups, the credential switch and users' home folders on the platform. Users and groups
// are the system's own (NSS); a user is an administrator as a member of the configured
// administrators group; home folders live in the share "homes" as "<homes path>/<user>".
// Every function is safe from any thread, but credentials are process-wide: a switch affects
// every thread (callers serialise switches through SDKMutex()).
#ifndef ORVANE_PLATFORM_USER_HPP_
#define ORVANE_PLATFORM_USER_HPP_

#include <sys/types.h>

#include <cstddef>

namespace orvane {
namespace platform {

struct QUIXUSER {
  char szName[256];
  uid_t uid;
  gid_t gid;
  char szHomeDir[4096];  // the account's own home directory (passwd), not the share home
};
using PQUIXUSER = QUIXUSER*;

// 0 and a new record in *user; -1 with ENOENT and kQErrNoSuchUser for an unknown user.
int QUIXUserGet(const char* name, PQUIXUSER* user);
int QUIXUserGetByUID(uid_t uid, PQUIXUSER* user);
void QUIXUserFree(PQUIXUSER user);

// 1 when `name` belongs to the administrators group (as primary or supplementary group), 0 when
// not (or the group does not exist), -1 for an unknown user or an unusable configuration.
// `flags` is reserved (0).
int QLIBGroupIsAdminGroupMem(const char* name, int flags);

// Makes `name` the effective user: its supplementary groups (with `set_groups`), its primary
// group as effective group, its uid as effective uid. Root may switch to anyone; any other
// effective user only to itself: the identity in force, or the process's real user (so a root
// process that stepped down can come back). False with errno set on failure.
bool ResetCredentialsByName(const char* name, bool set_groups);

// 1 when the home service is on for `name`: the share "homes" is configured and the user exists;
// 0 when it is off; -1 for an unknown user or an unusable configuration.
int QUIXServiceUserHomeIsEnabled(const char* name);
// "<homes path>/<name>" into buf; -1 when the service is off for the user (ENOENT) or the buffer
// is too small (ERANGE).
int QUIXServiceHomePathGet(const char* name, char* buf, size_t size);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_USER_HPP_
