// LockFile holds one flock() lock on a lock file for the lifetime of the object; it serialises
// processes, and threads of one process, around a shared file. It never waits blocked: a busy
// lock is retried at random intervals and given up with Error 506. Not copyable.
#ifndef ORVANE_COMMON_LOCK_FILE_HPP_
#define ORVANE_COMMON_LOCK_FILE_HPP_

#include <string>

#include "common/fd.hpp"

namespace orvane {

class LockFile {
 public:
  // Acquires the lock (exclusive or shared) or throws Error 506. The file is created with mode
  // 0644 if missing and never removed.
  LockFile(const std::string& path, bool exclusive);
  // Locks the file already open as `fd` (the caller opened it safely); `path` names it in
  // errors. The descriptor is owned from here on.
  LockFile(UniqueFd fd, const std::string& path, bool exclusive);
  ~LockFile();
  LockFile(const LockFile&) = delete;
  LockFile& operator=(const LockFile&) = delete;

  static constexpr int kMaxAttempts = 64;

 private:
  // Sleeps before the next attempt; throws Error 506 when none is left.
  [[noreturn]] void FailHard();
  void NextAttempt(int* attempts_left);

  int fd_;
  std::string path_;
};

}  // namespace orvane

#endif  // ORVANE_COMMON_LOCK_FILE_HPP_
