// AccessChecker answers whether one local user could open a file now, decided as the kernel
// decides it: search permission on every folder from "/" down, read permission on the file's
// own folder (to list its name) and on the file, from the owner, group, mode bits and POSIX
// ACL of each, against the user's groups. Below the share's root no symlink is followed: a
// symlink on the way, or as the file itself, hides the file. Each folder and file is looked up
// in a descriptor of the folder above it as checked, so swapping folders during a check cannot
// pass off one inode's contents under another's permissions.
// One checker serves one request; it caches folder answers and one folder descriptor and is
// not thread-safe.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_ACCESS_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_ACCESS_HPP_

#include <sys/stat.h>
#include <sys/types.h>

#include <string>
#include <unordered_map>
#include <vector>

#include "common/fd.hpp"

namespace orvane {
namespace elasticd {

class AccessChecker {
 public:
  // Loads the supplementary groups of `uid` from the user database; `gid` is the caller's own.
  AccessChecker(uid_t uid, gid_t gid);
  // Exactly these groups, for a caller whose groups are known.
  AccessChecker(uid_t uid, std::vector<gid_t> groups);
  AccessChecker(const AccessChecker&) = delete;
  AccessChecker& operator=(const AccessChecker&) = delete;

  // False for a file that is gone, unreadable, a symlink, in a folder the user cannot list or
  // behind one the user cannot enter. Symlinks at or above `share_root` are followed as the
  // kernel follows them; with no share root none is. `path` must be absolute and plain (no
  // empty, "." or ".." component), as the indexer writes it.
  bool CanOpen(const std::string& path, const std::string& share_root = std::string());

  // The share root of an index kept in its share's own folder ("<share>/@eaDir/@fileindex/db"),
  // "" for an index kept anywhere else.
  static std::string ShareRootOf(const std::string& index_dir);

 private:
  struct Folder {
    bool enter = false;   // this folder and every one above it may be searched
    bool list = false;    // and this one may be read
    size_t link_end = 0;  // length of the deepest symlink on the way to it, 0 when none
    dev_t dev = 0;        // the inode that was checked
    ino_t ino = 0;
  };

  Folder FolderOf(const std::string& dir, int links);
  // An O_PATH descriptor of `dir` when the path still leads to the inode `f` checked, else -1.
  // Owned by the checker, valid until the next call.
  int FolderFd(const std::string& dir, const Folder& f);
  // The permission bits (4 read, 2 write, 1 search) the user has on `name` in the folder
  // `dir_fd`, whose status is `st`.
  int Bits(int dir_fd, const char* name, const struct stat& st);
  // The bits an access ACL gives a user who does not own the inode; -1 when there is no ACL.
  int AclBits(int dir_fd, const char* name, const struct stat& st);
  bool InGroup(gid_t gid) const;

  uid_t uid_;
  std::vector<gid_t> groups_;  // sorted, unique
  std::unordered_map<std::string, Folder> folders_;
  // One folder descriptor at a time, so that many requests at once hold few descriptors.
  std::string fd_dir_;
  UniqueFd fd_;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_ACCESS_HPP_
