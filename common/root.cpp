#include "common/root.hpp"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>

namespace orvane {

std::string RootedPath(const std::string& fixed_path) {
  const char* root = std::getenv("ORVANE_ROOT");
  if (root == nullptr || root[0] == '\0') return fixed_path;
  std::string prefix(root);
  while (prefix.size() > 1 && prefix.back() == '/') prefix.pop_back();
  return prefix + fixed_path;
}

bool MakeParentDirs(const std::string& path) {
  const size_t last = path.rfind('/');
  if (last == std::string::npos || last == 0) return true;
  const int saved_errno = errno;
  bool ok = true;
  for (size_t pos = path.find('/', 1); pos != std::string::npos && pos <= last;
       pos = path.find('/', pos + 1)) {
    const std::string dir = path.substr(0, pos);
    if (mkdir(dir.c_str(), 0755) != 0 && errno != EEXIST) {
      ok = false;
      break;
    }
  }
  struct stat st;
  ok = ok && stat(path.substr(0, last).c_str(), &st) == 0 && S_ISDIR(st.st_mode);
  errno = saved_errno;
  return ok;
}

std::string RootedPathForWrite(const std::string& fixed_path) {
  std::string path = RootedPath(fixed_path);
  MakeParentDirs(path);
  return path;
}

}  // namespace orvane
