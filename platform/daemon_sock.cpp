#include "platform/daemon_sock.hpp"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <cerrno>
#include <chrono>
#include <cstring>

namespace quixdaemon {
namespace {

using Clock = std::chrono::steady_clock;

// Waits until `fd` is ready for `events`; false with ETIMEDOUT when `timeout_ms` runs out. A
// signal does not restart the full wait: the deadline is kept.
bool WaitFor(int fd, short events, int timeout_ms) {
  const bool unlimited = timeout_ms <= 0;
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(timeout_ms);
  for (;;) {
    int wait_ms = -1;
    if (!unlimited) {
      const auto left =
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
      wait_ms = left > 0 ? static_cast<int>(left) : 0;
    }
    struct pollfd pfd = {fd, events, 0};
    const int n = poll(&pfd, 1, wait_ms);
    if (n > 0) return true;  // errors and hang-ups surface in the following send or recv
    if (n == 0) {
      errno = ETIMEDOUT;
      return false;
    }
    if (errno != EINTR) return false;
  }
}

}  // namespace

bool DomainSockConnection::Connect(long timeout_ms) {
  const int saved_errno = errno;
  Disconnect();
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  if (path_.empty() || path_.size() >= sizeof(addr.sun_path)) {
    errno = ENAMETOOLONG;
    return false;
  }
  std::memcpy(addr.sun_path, path_.c_str(), path_.size() + 1);

  orvane::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd.valid()) return false;
  // A blocking connect to a Unix socket waits for room in the listener's backlog for as long as
  // the send time-out allows; that is how the time-out is honoured. It is cleared afterwards
  // because sends poll on their own.
  if (timeout_ms > 0) {
    struct timeval tv = {static_cast<time_t>(timeout_ms / 1000),
                         static_cast<suseconds_t>((timeout_ms % 1000) * 1000)};
    if (setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) != 0) return false;
  }
  int rc;
  do {
    rc = connect(fd.get(), reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr));
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    if (errno == EAGAIN || errno == EINPROGRESS) errno = ETIMEDOUT;
    return false;
  }
  struct timeval none = {0, 0};
  if (setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &none, sizeof(none)) != 0) return false;
  fd_ = std::move(fd);
  errno = saved_errno;  // a success leaves no trace for the callers' failure logs
  return true;
}

bool SockConnection::Send(const std::string& payload) {
  if (!fd_.valid()) {
    errno = ENOTCONN;
    return false;
  }
  if (payload.size() > UINT32_MAX) {
    errno = EMSGSIZE;
    return false;
  }
  const uint32_t length = static_cast<uint32_t>(payload.size());
  struct iovec iov[2] = {{const_cast<uint32_t*>(&length), sizeof(length)},
                         {const_cast<char*>(payload.data()), payload.size()}};
  struct msghdr msg;
  std::memset(&msg, 0, sizeof(msg));
  msg.msg_iov = iov;
  msg.msg_iovlen = 2;
  const int saved_errno = errno;
  size_t left = sizeof(length) + payload.size();
  while (left > 0) {
    // MSG_NOSIGNAL: a peer that went away is an EPIPE failure, not a process-killing signal.
    const ssize_t n = sendmsg(fd_.get(), &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) return false;
      if (!WaitFor(fd_.get(), POLLOUT, idle_timeout_ms_)) return false;
      continue;
    }
    size_t done = static_cast<size_t>(n);
    left -= done;
    while (done > 0 && msg.msg_iovlen > 0) {
      const size_t step = std::min(done, msg.msg_iov->iov_len);
      msg.msg_iov->iov_base = static_cast<char*>(msg.msg_iov->iov_base) + step;
      msg.msg_iov->iov_len -= step;
      done -= step;
      if (msg.msg_iov->iov_len == 0) {
        ++msg.msg_iov;
        --msg.msg_iovlen;
      }
    }
  }
  errno = saved_errno;
  return true;
}

bool SockConnection::RecvExact(char* buf, size_t size, int first_timeout_ms) {
  size_t got = 0;
  int timeout_ms = first_timeout_ms;
  while (got < size) {
    const ssize_t n = recv(fd_.get(), buf + got, size - got, MSG_DONTWAIT);
    if (n > 0) {
      got += static_cast<size_t>(n);
      timeout_ms = idle_timeout_ms_;
      continue;
    }
    if (n == 0) {
      errno = ECONNRESET;
      return false;
    }
    if (errno == EINTR) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) return false;
    if (!WaitFor(fd_.get(), POLLIN, timeout_ms)) return false;
  }
  return true;
}

bool SockConnection::Recv(std::string& payload) {
  payload.clear();
  if (!fd_.valid()) {
    errno = ENOTCONN;
    return false;
  }
  const int saved_errno = errno;
  uint32_t length = 0;
  if (!RecvExact(reinterpret_cast<char*>(&length), sizeof(length), reply_timeout_ms_)) {
    return false;
  }
  if (length > max_frame_bytes_) {
    errno = EMSGSIZE;
    return false;
  }
  // The buffer grows with the bytes that really arrive, so a peer announcing a large frame and
  // sending little costs little memory.
  constexpr size_t kStep = 64 * 1024;
  while (payload.size() < length) {
    const size_t offset = payload.size();
    const size_t step = std::min<size_t>(kStep, length - offset);
    payload.resize(offset + step);
    if (!RecvExact(&payload[offset], step, idle_timeout_ms_)) {
      payload.clear();
      return false;
    }
  }
  if (!payload.empty() && payload.back() == '\0') payload.pop_back();
  errno = saved_errno;
  return true;
}

}  // namespace quixdaemon
