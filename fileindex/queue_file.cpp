#include "fileindex/queue_file.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace orvane {
namespace fileindex {
namespace {

constexpr size_t kBufferSize = 256 * 1024;

}  // namespace

QueueFileReader::QueueFileReader(const std::string& path)
    : fd_(open(path.c_str(), O_RDONLY | O_CLOEXEC)) {
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

}  // namespace fileindex
}  // namespace orvane
