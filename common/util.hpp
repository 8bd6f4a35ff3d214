// Small path, file and string utilities shared by every piece. They hold no state, report
// failure by their result only, and are safe from any thread.
#ifndef ORVANE_COMMON_UTIL_HPP_
#define ORVANE_COMMON_UTIL_HPP_

#include <dirent.h>

#include <string>

namespace orvane {

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

std::string RTrim(const std::string& s);
std::string LTrim(const std::string& s);
std::string Trim(const std::string& s);
// ASCII letters only; other bytes, UTF-8 sequences included, pass unchanged.
std::string ToLower(const std::string& s);

}  // namespace orvane

#endif  // ORVANE_COMMON_UTIL_HPP_
