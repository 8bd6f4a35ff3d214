// UniqueFd owns one file descriptor and closes it when it goes out of scope.
// Movable, not copyable; not thread-safe.
#ifndef ORVANE_COMMON_FD_HPP_
#define ORVANE_COMMON_FD_HPP_

#include <unistd.h>

#include <utility>

namespace orvane {

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  ~UniqueFd() { Close(); }
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.Release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) Reset(other.Release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  int Release() { return std::exchange(fd_, -1); }
  void Reset(int fd = -1) {
    Close();
    fd_ = fd;
  }
  // Closes now; true when close() succeeded (or nothing was open).
  bool Close() {
    if (fd_ < 0) return true;
    const int fd = std::exchange(fd_, -1);
    return ::close(fd) == 0;
  }

 private:
  int fd_ = -1;
};

}  // namespace orvane

#endif  // ORVANE_COMMON_FD_HPP_
