#include "fileindex/queue_file.hpp"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "common/error.hpp"
#include "common/util.hpp"
#include "platform/safe_dir.hpp"

namespace orvane {
namespace fileindex {
namespace {

constexpr size_t kBufferSize = 256 * 1024;

// Opens (or with `create`, makes) the queue's folder. A folder that cannot be opened or made is
// an unreadable queue or a failed append like a full volume: false with errno saying why. A
// planted entry is the caller's to report.
bool OpenQueueDir(const std::string& queue_path, bool create, platform::SafeDir* dir) {
  try {
    *dir = platform::SafeDir::Open(Dirname(queue_path), create);
    return true;
  } catch (const Error& e) {
    if (e.code == kErrUnsafePath) throw;
    if (errno == 0) errno = EIO;
    return false;
  }
}

}  // namespace

QueueFileReader::QueueFileReader(const std::string& path) {
  platform::SafeDir dir;
  if (!OpenQueueDir(path, false, &dir) || !dir.valid()) return;
  fd_ = dir.OpenFile(Basename(path), O_RDONLY);
  if (fd_.valid()) buf_.reset(new char[kBufferSize]);
}

bool QueueFileReader::Fill() {
  if (eof_) return false;
  if (begin_ > 0) {
    std::memmove(buf_.get(), buf_.get() + begin_, end_ - begin_);
    end_ -= begin_;
    begin_ = 0;
  }
  for (;;) {
    ssize_t n = read(fd_.get(), buf_.get() + end_, kBufferSize - end_);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      // A read error ends the file like its end does: what was read is still used.
      eof_ = true;
      return false;
    }
    end_ += static_cast<size_t>(n);
    return true;
  }
}

bool QueueFileReader::ReadLine(std::string* line, size_t max_length) {
  if (!fd_.valid()) return false;
  line->clear();
  bool any = false;
  for (;;) {
    const char* start = buf_.get() + begin_;
    const char* nl = static_cast<const char*>(std::memchr(start, '\n', end_ - begin_));
    const size_t take = nl != nullptr ? static_cast<size_t>(nl - start) : end_ - begin_;
    if (line->size() <= max_length) {
      line->append(start, std::min(take, max_length + 1 - line->size()));
    }
    any = any || take > 0 || nl != nullptr;
    if (nl != nullptr) {
      begin_ += take + 1;
      return true;
    }
    begin_ = end_;
    if (!Fill()) return any;
  }
}

bool QueueFileAppend(const std::string& queue_path, const std::string& lines) {
  platform::SafeDir dir;
  if (!OpenQueueDir(queue_path, true, &dir)) return false;
  const std::string name = Basename(queue_path);
  for (;;) {
    UniqueFd fd = dir.OpenFile(name, O_WRONLY | O_APPEND | O_CREAT);
    if (!fd.valid()) return false;
    int rc;
    while ((rc = flock(fd.get(), LOCK_EX)) != 0 && errno == EINTR) {
    }
    if (rc != 0) return false;
    struct stat locked;
    struct stat current;
    if (fstat(fd.get(), &locked) != 0) return false;
    if (!dir.Stat(name, &current) || locked.st_ino != current.st_ino ||
        locked.st_dev != current.st_dev) {
      continue;  // renamed away under us: the next open creates the fresh live queue
    }
    size_t done = 0;
    while (done < lines.size()) {
      const ssize_t n = write(fd.get(), lines.data() + done, lines.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        // Whatever part of a line got out would run into the next line: cut it off.
        const int failure = errno;
        if (done > 0) (void)!ftruncate(fd.get(), locked.st_size);
        errno = failure;
        return false;
      }
      done += static_cast<size_t>(n);
    }
    return true;
  }
}

}  // namespace fileindex
}  // namespace orvane
