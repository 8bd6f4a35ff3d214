// SafeDir: a folder of the system's own files below a share (its queue, the index database),
// reached from a trusted folder one component at a time without following symbolic links, so
// that nothing a user plants in a share makes the daemons write or read elsewhere. Every entry
// the system owns must be owned by root (or by the process's effective user) and not writable by
// group or others; modes left wider by older installations are tightened (0700 folders, 0600
// files). A SafeDir owns its descriptor; it is movable and may be used from any thread.
#ifndef ORVANE_PLATFORM_SAFE_DIR_HPP_
#define ORVANE_PLATFORM_SAFE_DIR_HPP_

#include <sys/stat.h>

#include <string>
#include <vector>

#include "common/fd.hpp"

namespace orvane {
namespace platform {

// Where a path of the system's own splits: `trusted` is followed as the administrator wrote it,
// `owned` are the components below it that the system owns. The owned part begins at the first
// "@eaDir" component; a path without one (a scratch or administrator-chosen folder) is trusted
// whole.
struct SystemPathSplit {
  std::string trusted;
  std::vector<std::string> owned;
};
SystemPathSplit SplitSystemPath(const std::string& path);

class SafeDir {
 public:
  SafeDir() = default;
  SafeDir(SafeDir&&) = default;
  SafeDir& operator=(SafeDir&&) = default;

  // Opens the folder `path` (absolute). With `create`, missing owned folders are made with mode
  // 0700 (a missing trusted part 0755); without, a missing one gives an invalid SafeDir (errno
  // ENOENT). A symbolic link, a
  // non-folder, a wrong owner or a mode that cannot be tightened is refused with
  // Error(kErrUnsafePath) naming the entry and what to do (logged once per entry); other
  // failures are Error(kErrSystem).
  static SafeDir Open(const std::string& path, bool create);

  bool valid() const { return fd_.valid(); }
  int fd() const { return fd_.get(); }
  const std::string& path() const { return path_; }

  // Opens the regular file `name` in this folder with `flags` (O_NOFOLLOW and O_CLOEXEC are
  // added; a created file gets mode 0600). In an owned folder the file is checked and narrowed
  // like the folders, and must have no other name (hard link); in a trusted one it is taken as
  // it is. An invalid descriptor with errno set (ENOENT when
  // missing) on a plain failure; throws Error(kErrUnsafePath) on a refusal.
  UniqueFd OpenFile(const std::string& name, int flags) const;
  // Checks and tightens the entry `name` when it exists (a file, or with `dir` a folder); false
  // when it does not exist. Throws Error(kErrUnsafePath) on a refusal.
  bool CheckEntry(const std::string& name, bool dir) const;
  // Opens the owned sub-folder `name`, created 0700 with `create`; invalid when missing.
  SafeDir Sub(const std::string& name, bool create) const;
  // Whether an entry of that name exists (any type; a link is not followed).
  bool Exists(const std::string& name) const;
  // The entry's own status (a link is not followed); false with errno set.
  bool Stat(const std::string& name, struct stat* st) const;
  // rename/unlink inside this folder: 0 or -1 with errno set.
  int Rename(const std::string& from, const std::string& to) const;
  int RenameTo(const std::string& from, const SafeDir& to_dir, const std::string& to) const;
  int Unlink(const std::string& name) const;
  // Removes the sub-folder `name` when it is empty: 0 or -1 with errno set.
  int RemoveDir(const std::string& name) const;
  // Removes the entry `name` and, for a folder, everything below it, never following a link.
  // 0 (also when missing) or -1 with errno set.
  int RemoveTree(const std::string& name) const;
  // fsync() of the folder itself, so that entries made in it reach the disk.
  bool Sync() const;

 private:
  SafeDir(UniqueFd fd, std::string path, bool owned)
      : fd_(std::move(fd)), path_(std::move(path)), owned_(owned) {}

  UniqueFd fd_;
  std::string path_;
  bool owned_ = false;
};

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_SAFE_DIR_HPP_
