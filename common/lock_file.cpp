#include "common/lock_file.hpp"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/env.hpp"
#include "common/error.hpp"

namespace orvane {

LockFile::LockFile(const std::string& path, bool exclusive) : fd_(-1), path_(path) {
  for (int attempts_left = kMaxAttempts;;) {
    ORVANE_THROW_IF(0 > (fd_ = open(path_.c_str(), O_RDONLY | O_CREAT, 0644)), kErrLockFile,
                    "open failed, path=" + path_ + ", reason=" + std::strerror(errno));
    if (flock(fd_, (exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB) == 0) return;
    if (errno != EINTR && errno != EWOULDBLOCK) FailHard();
    close(fd_);
    fd_ = -1;
    NextAttempt(&attempts_left);
  }
}

LockFile::LockFile(UniqueFd fd, const std::string& path, bool exclusive)
    : fd_(fd.Release()), path_(path) {
  for (int attempts_left = kMaxAttempts;;) {
    if (flock(fd_, (exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB) == 0) return;
    if (errno != EINTR && errno != EWOULDBLOCK) FailHard();
    try {
      NextAttempt(&attempts_left);
    } catch (...) {
      close(fd_);
      fd_ = -1;
      throw;
    }
  }
}

// A hard failure is not retried. The object never comes to exist, so its destructor will not
// run: the descriptor is closed here or it would leak for the life of the process.
void LockFile::FailHard() {
  const int failure = errno;
  close(fd_);
  fd_ = -1;
  throw Error(kErrLockFile, std::strerror(failure));
}

void LockFile::NextAttempt(int* attempts_left) {
  Env::Current()->SleepMicros(static_cast<int64_t>(Env::Current()->Rand() % 10) * 100000);
  if (--*attempts_left == 0) throw Error(kErrLockFile, "Exceed max retry, path=" + path_);
}

LockFile::~LockFile() {
  if (fd_ >= 0) {
    flock(fd_, LOCK_UN);
    close(fd_);
  }
}

}  // namespace orvane
