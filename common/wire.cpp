#include "common/wire.hpp"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstring>
#include <utility>

namespace orvane {
namespace wire {
namespace {

int64_t NowMicros() {
  return std::chrono::duration_cast<std::chrono::microseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

IoStatus Fail(IoStatus status, int error) {
  errno = error;
  return status;
}

// Waits until `fd` is ready for `events`. Errors and hang-ups count as ready: they surface in
// the send or recv that follows. A signal does not restart the wait from scratch.
IoStatus WaitFor(int fd, short events, const Deadline& deadline) {
  for (;;) {
    struct pollfd p = {fd, events, 0};
    const int n = ::poll(&p, 1, deadline.PollMillis());
    if (n > 0) return IoStatus::kOk;
    if (n == 0) {
      if (deadline.Passed()) return Fail(IoStatus::kTimeout, ETIMEDOUT);
      continue;
    }
    if (errno != EINTR) return IoStatus::kError;
  }
}

// Sends the buffers of `iov` in order.
IoStatus WriteVec(int fd, struct iovec* iov, size_t count, Deadline& deadline) {
  struct msghdr msg;
  std::memset(&msg, 0, sizeof(msg));
  msg.msg_iov = iov;
  msg.msg_iovlen = count;
  while (msg.msg_iovlen > 0 && msg.msg_iov->iov_len == 0) {
    ++msg.msg_iov;
    --msg.msg_iovlen;
  }
  while (msg.msg_iovlen > 0) {
    // MSG_NOSIGNAL: a peer that went away is an EPIPE failure, not a process-killing signal.
    const ssize_t n = ::sendmsg(fd, &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) return IoStatus::kError;
      const IoStatus st = WaitFor(fd, POLLOUT, deadline);
      if (st != IoStatus::kOk) return st;
      continue;
    }
    deadline.Progress();
    size_t done = static_cast<size_t>(n);
    while (msg.msg_iovlen > 0 && (done > 0 || msg.msg_iov->iov_len == 0)) {
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
  return IoStatus::kOk;
}

IoCalls& Calls() {
  static IoCalls calls;
  return calls;
}

}  // namespace

Deadline Deadline::NoWait() { return Deadline(NowMicros(), 0); }

Deadline Deadline::In(int64_t micros) { return Deadline(NowMicros() + micros, 0); }

Deadline Deadline::Idle(int64_t first_ms, int64_t idle_ms) {
  return Deadline(first_ms > 0 ? NowMicros() + first_ms * 1000 : kNoLimit,
                  idle_ms > 0 ? idle_ms * 1000 : -1);
}

void Deadline::Progress() {
  if (idle_ > 0) at_ = NowMicros() + idle_;
  if (idle_ < 0) at_ = kNoLimit;
}

int Deadline::PollMillis() const {
  if (at_ == kNoLimit) return -1;
  const int64_t left = at_ - NowMicros();
  if (left <= 0) return 0;
  return static_cast<int>(std::min<int64_t>((left + 999) / 1000, INT_MAX));
}

bool Deadline::Passed() const { return at_ != kNoLimit && NowMicros() >= at_; }

IoStatus ReadExact(int fd, void* buf, size_t size, Deadline& deadline) {
  char* p = static_cast<char*>(buf);
  while (size > 0) {
    const ssize_t n = ::recv(fd, p, size, MSG_DONTWAIT);
    if (n > 0) {
      p += n;
      size -= static_cast<size_t>(n);
      deadline.Progress();
      continue;
    }
    if (n == 0) return Fail(IoStatus::kClosed, ECONNRESET);
    if (errno == EINTR) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) return IoStatus::kError;
    const IoStatus st = WaitFor(fd, POLLIN, deadline);
    if (st != IoStatus::kOk) return st;
  }
  return IoStatus::kOk;
}

IoStatus WriteExact(int fd, const void* buf, size_t size, Deadline& deadline) {
  struct iovec iov = {const_cast<void*>(buf), size};
  return WriteVec(fd, &iov, 1, deadline);
}

IoStatus Discard(int fd, uint64_t size, Deadline& deadline) {
  char sink[16384];
  while (size > 0) {
    const size_t chunk = static_cast<size_t>(std::min<uint64_t>(size, sizeof(sink)));
    const IoStatus st = ReadExact(fd, sink, chunk, deadline);
    if (st != IoStatus::kOk) return st;
    size -= chunk;
  }
  return IoStatus::kOk;
}

IoStatus ReadFrameLength(int fd, uint32_t* length, Deadline& deadline) {
  unsigned char raw[sizeof(uint32_t)];
  const IoStatus st = ReadExact(fd, raw, sizeof(raw), deadline);
  if (st == IoStatus::kOk) std::memcpy(length, raw, sizeof(raw));
  return st;
}

IoStatus ReadFrame(int fd, uint32_t max_bytes, std::string* payload, Deadline& deadline) {
  payload->clear();
  uint32_t length = 0;
  IoStatus st = ReadFrameLength(fd, &length, deadline);
  if (st != IoStatus::kOk) return st;
  if (length > max_bytes) return Fail(IoStatus::kTooLarge, EMSGSIZE);
  constexpr size_t kStep = 64 * 1024;
  while (payload->size() < length) {
    const size_t offset = payload->size();
    const size_t step = std::min<size_t>(kStep, length - offset);
    payload->resize(offset + step);
    st = ReadExact(fd, &(*payload)[offset], step, deadline);
    if (st != IoStatus::kOk) {
      payload->clear();
      return st;
    }
  }
  return IoStatus::kOk;
}

IoStatus WriteFrame(int fd, std::string_view payload, Deadline& deadline) {
  if (payload.size() > UINT32_MAX) return Fail(IoStatus::kTooLarge, EMSGSIZE);
  uint32_t length = static_cast<uint32_t>(payload.size());
  struct iovec iov[2] = {{&length, sizeof(length)},
                         {const_cast<char*>(payload.data()), payload.size()}};
  return WriteVec(fd, iov, 2, deadline);
}

IoStatus WriteTextFrame(int fd, std::string_view text, Deadline& deadline) {
  if (text.size() >= UINT32_MAX) return Fail(IoStatus::kTooLarge, EMSGSIZE);
  uint32_t length = static_cast<uint32_t>(text.size() + 1);
  char nul = '\0';
  struct iovec iov[3] = {
      {&length, sizeof(length)}, {const_cast<char*>(text.data()), text.size()}, {&nul, 1}};
  return WriteVec(fd, iov, 3, deadline);
}

std::string EncodeFrame(std::string_view payload) {
  const uint32_t length = static_cast<uint32_t>(payload.size());
  std::string frame(reinterpret_cast<const char*>(&length), sizeof(length));
  frame.append(payload.data(), payload.size());
  return frame;
}

std::string_view PayloadText(std::string_view payload) {
  while (!payload.empty() && payload.back() == '\0') payload.remove_suffix(1);
  return payload;
}

UniqueFd Connect(const std::string& path, long timeout_ms) {
  const int saved_errno = errno;
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(addr.sun_path)) {
    errno = ENAMETOOLONG;
    return UniqueFd();
  }
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);

  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd.valid()) return fd;
  // A blocking connect to a Unix socket waits for room in the listener's backlog for as long as
  // the send time-out allows; that is how the time-out is honoured. It is cleared afterwards
  // because sends poll on their own.
  if (timeout_ms > 0) {
    struct timeval tv = {static_cast<time_t>(timeout_ms / 1000),
                         static_cast<suseconds_t>((timeout_ms % 1000) * 1000)};
    if (::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) != 0) return UniqueFd();
  }
  int rc;
  do {
    rc = ::connect(fd.get(), reinterpret_cast<const struct sockaddr*>(&addr), sizeof(addr));
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    if (errno == EAGAIN || errno == EINPROGRESS) errno = ETIMEDOUT;
    return UniqueFd();
  }
  struct timeval none = {0, 0};
  if (::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &none, sizeof(none)) != 0) return UniqueFd();
  errno = saved_errno;  // a success leaves no trace for the callers' failure logs
  return fd;
}

IoCalls SetIoCalls(IoCalls calls) {
  std::swap(Calls(), calls);
  return calls;
}

bool WriteBlocking(int fd, const void* buf, size_t size, const BlockingRules& rules) {
  const char* p = static_cast<const char*>(buf);
  int interrupts = rules.interrupts;
  size_t done = 0;
  while (done < size) {
    const size_t step = std::min(size - done, rules.chunk);
    const IoCalls& calls = Calls();
    const ssize_t n = calls.write ? calls.write(fd, p + done, step) : ::write(fd, p + done, step);
    if (n > 0) {
      done += static_cast<size_t>(n);
      continue;
    }
    if (errno == EINTR && interrupts > 0) {
      --interrupts;
      continue;
    }
    return false;
  }
  return true;
}

bool ReadBlocking(int fd, void* buf, size_t size, const BlockingRules& rules) {
  char* p = static_cast<char*>(buf);
  int interrupts = rules.interrupts;
  int closed_reads = rules.closed_reads;
  size_t done = 0;
  while (done < size) {
    const size_t step = std::min(size - done, rules.chunk);
    const IoCalls& calls = Calls();
    const ssize_t n = calls.read ? calls.read(fd, p + done, step) : ::read(fd, p + done, step);
    if (n > 0) {
      done += static_cast<size_t>(n);
      continue;
    }
    if (n == 0) {
      // The daemon answers before it closes, so an end of stream is read again; but a closed
      // socket never yields more, and waiting on it for ever would hang the caller.
      if (closed_reads-- > 0) continue;
      errno = ECONNRESET;
      return false;
    }
    if (errno == EINTR && interrupts > 0) {
      --interrupts;
      continue;
    }
    return false;
  }
  return true;
}

}  // namespace wire
}  // namespace orvane
