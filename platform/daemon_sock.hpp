// Client end of the platform daemons' Unix-domain sockets: one frame out, one frame in (see
// common/wire.hpp). One connection object per exchange; it owns its descriptor and closes it
// when destroyed. Not thread-safe.
//
// Time-outs: Connect() bounds the wait for a full listen backlog; once connected, Recv() waits
// at most the reply time-out for the first byte of a frame and at most the idle time-out for
// each further byte; Send() gives a peer that does not read the idle time-out per wait.
#ifndef ORVANE_PLATFORM_DAEMON_SOCK_HPP_
#define ORVANE_PLATFORM_DAEMON_SOCK_HPP_

#include <cstdint>
#include <string>

#include "common/fd.hpp"
#include "common/wire.hpp"

namespace quixdaemon {

// A connected stream socket carrying frames. Failures return false with errno telling why:
// ETIMEDOUT for a time-out, ECONNRESET for a peer that closed in the middle of a frame or before
// answering, EMSGSIZE for a frame over the bound, ENOTCONN when not connected.
class SockConnection {
 public:
  virtual ~SockConnection() = default;
  SockConnection(const SockConnection&) = delete;
  SockConnection& operator=(const SockConnection&) = delete;

  // Sends `payload` as one frame.
  bool Send(const std::string& payload);
  // Receives one frame into `payload`. A single NUL that ends the payload is a C string's
  // terminator, not text, and is dropped.
  bool Recv(std::string& payload);
  // Closes the descriptor; the object may connect again.
  void Disconnect() { fd_.Reset(); }
  bool IsConnected() const { return fd_.valid(); }

  // Time-outs in milliseconds; 0 or less waits without limit.
  void SetTimeouts(int reply_timeout_ms, int idle_timeout_ms) {
    reply_timeout_ms_ = reply_timeout_ms;
    idle_timeout_ms_ = idle_timeout_ms;
  }
  // The largest frame Recv() accepts; a longer announced length fails at once, before anything
  // is allocated.
  void SetMaxFrameBytes(uint32_t max_frame_bytes) { max_frame_bytes_ = max_frame_bytes; }

 protected:
  SockConnection() = default;

  orvane::UniqueFd fd_;

 private:
  int reply_timeout_ms_ = orvane::wire::kClientReplyTimeoutMs;
  int idle_timeout_ms_ = orvane::wire::kClientIdleTimeoutMs;
  uint32_t max_frame_bytes_ = orvane::wire::kClientMaxFrameBytes;
};

// A SockConnection to a Unix-domain socket path.
class DomainSockConnection : public SockConnection {
 public:
  explicit DomainSockConnection(std::string path) : path_(std::move(path)) {}

  // Connects, waiting at most `timeout_ms` milliseconds (0 or less: no limit) while the
  // daemon's listen backlog is full. A path too long for a socket address fails with
  // ENAMETOOLONG.
  bool Connect(long timeout_ms);
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace quixdaemon

#endif  // ORVANE_PLATFORM_DAEMON_SOCK_HPP_
