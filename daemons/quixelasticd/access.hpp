// AccessChecker answers whether one local user could open a file: read permission on the file
// (and search permission on a folder) plus search permission on every folder above it, from
// the mode bits, owner and group of each, against the user's groups.
// One checker serves one request; it caches folder answers and is not thread-safe.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_ACCESS_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_ACCESS_HPP_

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace orvane {
namespace elasticd {

class AccessChecker {
 public:
  // Loads the supplementary groups of `uid` from the user database.
  AccessChecker(uid_t uid, gid_t gid);
  AccessChecker(const AccessChecker&) = delete;
  AccessChecker& operator=(const AccessChecker&) = delete;

  // False for a file that is gone, unreadable or behind a folder the user cannot enter.
  bool CanOpen(const std::string& path);

 private:
  // The permission bits (4 read, 2 write, 1 search) that apply to this user, or -1.
  int Bits(const std::string& path);
  bool CanEnter(const std::string& dir);

  uid_t uid_;
  std::vector<gid_t> groups_;
  std::map<std::string, bool> dirs_;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_ACCESS_HPP_
