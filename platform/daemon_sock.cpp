#include "platform/daemon_sock.hpp"

#include <cerrno>

namespace quixdaemon {

using orvane::wire::Deadline;
using orvane::wire::IoStatus;

bool DomainSockConnection::Connect(long timeout_ms) {
  Disconnect();
  fd_ = orvane::wire::Connect(path_, timeout_ms);
  return fd_.valid();
}

bool SockConnection::Send(const std::string& payload) {
  if (!fd_.valid()) {
    errno = ENOTCONN;
    return false;
  }
  const int saved_errno = errno;
  Deadline deadline = Deadline::Idle(idle_timeout_ms_, idle_timeout_ms_);
  if (orvane::wire::WriteFrame(fd_.get(), payload, deadline) != IoStatus::kOk) return false;
  errno = saved_errno;
  return true;
}

bool SockConnection::Recv(std::string& payload) {
  payload.clear();
  if (!fd_.valid()) {
    errno = ENOTCONN;
    return false;
  }
  const int saved_errno = errno;
  Deadline deadline = Deadline::Idle(reply_timeout_ms_, idle_timeout_ms_);
  if (orvane::wire::ReadFrame(fd_.get(), max_frame_bytes_, &payload, deadline) != IoStatus::kOk) {
    return false;
  }
  if (!payload.empty() && payload.back() == '\0') payload.pop_back();
  errno = saved_errno;
  return true;
}

}  // namespace quixdaemon
