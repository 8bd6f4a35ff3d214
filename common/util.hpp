// Small path, file and string utilities shared by every piece. They hold no state, report
// failure by their result only, and are safe from any thread.
#ifndef ORVANE_COMMON_UTIL_HPP_
#define ORVANE_COMMON_UTIL_HPP_

#include <dirent.h>

#include <memory>
#include <string>

#include "common/sdk/user.hpp"
#include "platform/fs.hpp"

namespace orvane {

using platform::QUIXCOPYARGS;

// A regular file, not followed through a symbolic link.
bool IsFileExist(const std::string& path);
// A directory; with `follow_link` a symbolic link's text is followed as it stands (a relative
// text is taken relative to the working directory).
bool IsDirExist(const std::string& path, bool follow_link);
// Whether a directory entry is a directory. For DT_UNKNOWN the entry is lstat()ed and reported
// as not a directory either way.
bool IsDirentDir(const struct dirent& entry, const std::string& path);

bool StringStartWith(const std::string& str, const std::string& prefix);
// The text after the last "/"; the whole string without one; "" when the path ends in "/".
std::string Basename(const std::string& path);
// The text before the last "/"; the whole string without one; "" for "/x".
std::string Dirname(const std::string& path);
// The text after the last "." of the basename, "" when there is none.
std::string GetFileExtension(const std::string& path, bool to_lower);
// realpath(3), or "" when it fails.
std::string RealPath(const std::string& path);
// unlink(2) that counts a missing file as removed.
bool Unlink(const std::string& path);

// Whether the effective user has any of the access bits `mask` (platform::QUIX_ACL_*) on `path`,
// POSIX ACLs included; false when the path cannot be examined.
bool CheckACLPerm(const std::string& path, int mask);
// Whether `path` is the root of a mount (bind mounts included).
bool IsMountPoint(const std::string& path);
// Copies a regular file keeping mode, owner and times, as `args` says (QUIXCOPYARGS).
bool MVFileImpl(const std::string& src, const std::string& dst, QUIXCOPYARGS* args);
// Copies, then removes the source.
bool MVFile(const std::string& src, const std::string& dst);
// Copies and keeps the source.
bool CPFile(const std::string& src, const std::string& dst);
// Hands `path` to the package's service account "Orvane" (its uid and primary group). Throws
// Error 801 when that account does not exist; false when chown fails.
bool ChownOrvane(const std::string& path);
// The platform user `name` with its home-service flag. Throws Error 801 for an unknown user.
std::unique_ptr<sdk::User> GetUser(const std::string& name);
std::unique_ptr<sdk::User> GetUserByUID(uid_t uid);

std::string RTrim(const std::string& s);
std::string LTrim(const std::string& s);
std::string Trim(const std::string& s);
// ASCII letters only; other bytes, UTF-8 sequences included, pass unchanged.
std::string ToLower(const std::string& s);

}  // namespace orvane

#endif  // ORVANE_COMMON_UTIL_HPP_
