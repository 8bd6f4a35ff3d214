// Resolution of the system's fixed absolute paths through ORVANE_ROOT, so that tests, the quick
// start and unprivileged users can run the whole system inside a scratch folder.
// Stateless; safe from any thread.
#ifndef ORVANE_COMMON_ROOT_HPP_
#define ORVANE_COMMON_ROOT_HPP_

#include <string>

namespace orvane {

// `fixed_path` prefixed with $ORVANE_ROOT when that variable is set and not empty; otherwise
// `fixed_path` as it stands. Every fixed path the library or a daemon opens goes through here.
std::string RootedPath(const std::string& fixed_path);

// Creates the missing parent folders of `path` (mode 0755). True when they exist afterwards.
bool MakeParentDirs(const std::string& path);

// RootedPath() of a file the caller is about to create: its parent folders are created too.
std::string RootedPathForWrite(const std::string& fixed_path);

}  // namespace orvane

#endif  // ORVANE_COMMON_ROOT_HPP_
