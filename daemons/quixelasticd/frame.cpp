#include "daemons/quixelasticd/frame.hpp"

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/env.hpp"

namespace orvane {
namespace elasticd {

namespace {

// Waits until `fd` is ready for `events` or the deadline passes.
IoStatus WaitFor(int fd, short events, int64_t deadline_micros) {
  for (;;) {
    const int64_t left = deadline_micros - Env::Current()->NowMicros();
    if (left <= 0) return IoStatus::kTimeout;
    struct pollfd p = {fd, events, 0};
    const int timeout_ms = static_cast<int>(std::min<int64_t>(left / 1000 + 1, 60000));
    const int rc = ::poll(&p, 1, timeout_ms);
    if (rc > 0) return IoStatus::kOk;
    if (rc < 0 && errno != EINTR) return IoStatus::kError;
  }
}

}  // namespace

IoStatus ReadExact(int fd, void* buf, size_t n, int64_t deadline_micros) {
  char* p = static_cast<char*>(buf);
  while (n > 0) {
    const ssize_t got = ::recv(fd, p, n, MSG_DONTWAIT);
    if (got > 0) {
      p += got;
      n -= static_cast<size_t>(got);
      continue;
    }
    if (got == 0) return IoStatus::kClosed;
    if (errno == EINTR) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) return IoStatus::kError;
    const IoStatus st = WaitFor(fd, POLLIN, deadline_micros);
    if (st != IoStatus::kOk) return st;
  }
  return IoStatus::kOk;
}

IoStatus Discard(int fd, uint64_t n, int64_t deadline_micros) {
  char sink[16384];
  while (n > 0) {
    const size_t chunk = n < sizeof(sink) ? static_cast<size_t>(n) : sizeof(sink);
    const IoStatus st = ReadExact(fd, sink, chunk, deadline_micros);
    if (st != IoStatus::kOk) return st;
    n -= chunk;
  }
  return IoStatus::kOk;
}

IoStatus WriteExact(int fd, const void* buf, size_t n, int64_t deadline_micros) {
  const char* p = static_cast<const char*>(buf);
  while (n > 0) {
    // MSG_NOSIGNAL: a peer that went away is an error here, not a SIGPIPE for the daemon.
    const ssize_t put = ::send(fd, p, n, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (put > 0) {
      p += put;
      n -= static_cast<size_t>(put);
      continue;
    }
    if (put < 0 && errno == EINTR) continue;
    if (put < 0 && errno != EAGAIN && errno != EWOULDBLOCK) return IoStatus::kError;
    const IoStatus st = WaitFor(fd, POLLOUT, deadline_micros);
    if (st != IoStatus::kOk) return st;
  }
  return IoStatus::kOk;
}

IoStatus ReadFrameLength(int fd, uint32_t* length, int64_t deadline_micros) {
  unsigned char raw[4];
  const IoStatus st = ReadExact(fd, raw, sizeof(raw), deadline_micros);
  if (st == IoStatus::kOk) std::memcpy(length, raw, sizeof(raw));
  return st;
}

IoStatus WriteFrame(int fd, const std::string& text, int64_t deadline_micros) {
  const uint32_t length = static_cast<uint32_t>(text.size() + 1);
  std::string frame(4 + text.size() + 1, '\0');
  std::memcpy(&frame[0], &length, 4);
  std::memcpy(&frame[4], text.data(), text.size());
  return WriteExact(fd, frame.data(), frame.size(), deadline_micros);
}

}  // namespace elasticd
}  // namespace orvane
