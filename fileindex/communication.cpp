#include "fileindex/communication.hpp"

#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"

namespace orvane {
namespace fileindex {
namespace {

constexpr int kConnectAttempts = 5;
constexpr int64_t kConnectRetrySleep = 1000000;

std::string Reason(const char* what) { return std::string(what) + strerror(errno); }

}  // namespace

void BufferWrite(int fd, unsigned int size, const unsigned char* buf) {
  if (!wire::WriteBlocking(fd, buf, size, wire::kCommandTransfer)) {
    throw Error(kErrSystem, Reason("write failed, reason="));
  }
}

void BufferRead(int fd, unsigned int size, unsigned char* buf) {
  if (!wire::ReadBlocking(fd, buf, size, wire::kCommandTransfer)) {
    throw Error(kErrSystem, Reason("read failed, reason="));
  }
}

void SendCommandToDaemon(const std::string& cmd, const Json::Value& data) {
  // A write to a daemon that went away must fail, not kill the caller.
  signal(SIGPIPE, SIG_IGN);
  const int saved_errno = errno;

  int fd_socket = -1;
  ORVANE_THROW_IF(0 > (fd_socket = socket(PF_UNIX, SOCK_STREAM, 0)), kErrSystem,
                  Reason("socket failed, reason="));
  UniqueFd socket_fd(fd_socket);

  const std::string path = RootedPath(kFileIndexdSockPath);
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  if (path.size() < sizeof(addr.sun_path)) {
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    // Only a missing socket file is worth waiting for: the daemon may be starting. Whatever the
    // outcome, an unconnected socket makes the first write fail and say why.
    for (int attempt = 1; attempt <= kConnectAttempts; ++attempt) {
      if (connect(fd_socket, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) == 0) break;
      if (errno != ENOENT || attempt == kConnectAttempts) break;
      Env::Current()->SleepMicros(kConnectRetrySleep);
    }
  } else {
    ORVANE_LOG(LOG_ERR, "socket path too long: %s", path.c_str());
  }

  struct timeval tv = {wire::kDaemonSendTimeoutSec, 0};
  ORVANE_THROW_IF(0 > setsockopt(fd_socket, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)), kErrSystem,
                  Reason("setsockopt failed, reason="));
  // Without a receive time-out a daemon that never answers would hold the caller for ever.
  struct timeval rtv = {wire::kDaemonReplyTimeoutSec, 0};
  ORVANE_THROW_IF(0 > setsockopt(fd_socket, SOL_SOCKET, SO_RCVTIMEO, &rtv, sizeof(rtv)), kErrSystem,
                  Reason("setsockopt failed, reason="));

  Json::Value message(Json::objectValue);
  message["type"] = cmd;
  message["data"] = data;
  const std::string text = JsonToString(message);
  if (text.size() >= UINT32_MAX) {
    errno = EMSGSIZE;
    throw Error(kErrSystem, Reason("write failed, reason="));
  }
  // The terminating NUL travels too: the payload is the text as a C string.
  unsigned int length = static_cast<unsigned int>(text.size() + 1);
  BufferWrite(fd_socket, sizeof(length), reinterpret_cast<const unsigned char*>(&length));
  BufferWrite(fd_socket, length, reinterpret_cast<const unsigned char*>(text.c_str()));

  BufferRead(fd_socket, sizeof(length), reinterpret_cast<unsigned char*>(&length));
  if (length > wire::kMaxDaemonReplyBytes) {
    errno = EMSGSIZE;
    throw Error(kErrSystem, Reason("read failed, reason="));
  }
  std::vector<unsigned char> reply(length);
  BufferRead(fd_socket, length, reply.data());
  errno = saved_errno;  // failed connect attempts that came to nothing leave no trace
}

}  // namespace fileindex
}  // namespace orvane
