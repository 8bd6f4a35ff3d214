#include "daemons/fileindexd/server.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <system_error>
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"

namespace orvane {
namespace fileindexd {

namespace {

using Clock = std::chrono::steady_clock;

// Reads exactly `size` bytes before `deadline`; false on end of stream, time-out or error. The
// deadline is for the whole command, so a client dripping a byte at a time is cut off as surely
// as one that sends nothing.
bool ReadFull(int fd, void* buf, size_t size, Clock::time_point deadline) {
  char* p = static_cast<char*>(buf);
  while (size > 0) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    if (left <= 0) return false;
    struct pollfd pfd = {fd, POLLIN, 0};
    const int ready = poll(&pfd, 1, static_cast<int>(left));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return false;
    const ssize_t n = recv(fd, p, size, MSG_DONTWAIT);
    if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

bool WriteFull(int fd, const void* buf, size_t size, int flags) {
  const char* p = static_cast<const char*>(buf);
  while (size > 0) {
    const ssize_t n = send(fd, p, size, MSG_NOSIGNAL | flags);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// `flags` MSG_DONTWAIT for a reply written on the accepting thread, which must never block.
void WriteReply(int fd, const Json::Value& reply, int flags = 0) {
  std::string text = JsonToString(reply);
  text.push_back('\0');
  const uint32_t len = static_cast<uint32_t>(text.size());
  if (!WriteFull(fd, &len, sizeof(len), flags) || !WriteFull(fd, text.data(), text.size(), flags)) {
    Log(LOG_WARNING, "fileindexd: a client left before its reply: %m");
  }
}

}  // namespace

CommandServer::CommandServer(const std::string& socket_path, Handler handler)
    : path_(socket_path), handler_(std::move(handler)) {}

CommandServer::~CommandServer() { Stop(); }

Json::Value CommandServer::ErrorReply(int code, const std::string& msg) {
  Json::Value r(Json::objectValue);
  r["success"] = false;
  r["error"]["code"] = code;
  r["error"]["msg"] = msg;
  return r;
}

void CommandServer::Start() {
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  ORVANE_THROW_IF(path_.size() >= sizeof(addr.sun_path), kErrSystem,
                  "socket path too long: " + path_);
  std::memcpy(addr.sun_path, path_.c_str(), path_.size() + 1);
  MakeParentDirs(path_);
  listen_.Reset(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ORVANE_THROW_IF(!listen_.valid(), kErrSystem, "socket failed");
  // A socket file left by a killed daemon would make bind fail; the pid file lock already
  // ensures no other daemon is serving it.
  unlink(path_.c_str());
  ORVANE_THROW_IF(bind(listen_.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0,
                  kErrSystem, "bind failed: " + path_);
  chmod(path_.c_str(), 0666);
  ORVANE_THROW_IF(listen(listen_.get(), 128) != 0, kErrSystem, "listen failed");
  int fds[2];
  ORVANE_THROW_IF(pipe2(fds, O_CLOEXEC) != 0, kErrSystem, "pipe2 failed");
  stop_read_.Reset(fds[0]);
  stop_write_.Reset(fds[1]);
  thread_ = std::thread([this] { Serve(); });
}

void CommandServer::Stop() {
  if (thread_.joinable()) {
    const char byte = 1;
    (void)!write(stop_write_.get(), &byte, 1);
    thread_.join();
  }
  {
    // Clients still sending get an end of stream; commands already read are finished and
    // answered, since their effect has begun.
    std::unique_lock<std::mutex> lock(mu_);
    for (int fd : open_fds_) shutdown(fd, SHUT_RD);
    idle_cv_.wait(lock, [this] { return active_ == 0; });
  }
  if (listen_.valid()) {
    listen_.Close();
    unlink(path_.c_str());
  }
}

void CommandServer::Serve() {
  for (;;) {
    struct pollfd fds[2] = {{listen_.get(), POLLIN, 0}, {stop_read_.get(), POLLIN, 0}};
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      Log(LOG_ERR, "fileindexd: poll on the command socket failed: %m");
      return;
    }
    if (fds[1].revents != 0) return;
    UniqueFd conn(accept4(listen_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    if (!conn.valid()) {
      // Out of descriptors: a short breath instead of a busy loop on a pending connection.
      if (errno == EMFILE || errno == ENFILE) poll(nullptr, 0, 100);
      continue;
    }
    struct ucred cred = {};
    socklen_t cred_len = sizeof(cred);
    if (getsockopt(conn.get(), SOL_SOCKET, SO_PEERCRED, &cred, &cred_len) != 0) {
      WriteReply(conn.get(), ErrorReply(103, "cannot identify the caller"), MSG_DONTWAIT);
      continue;
    }
    const bool privileged = cred.uid == 0 || cred.uid == geteuid();
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (!privileged &&
          (capped_ >= kMaxConnections || per_user_[cred.uid] >= kMaxConnectionsPerUser)) {
        Log(LOG_WARNING, "fileindexd: connection of user %u refused: too many connections",
            cred.uid);
        WriteReply(conn.get(),
                   ErrorReply(kErrTooManyConnections,
                              "too many connections to fileindexd; try again in a moment"),
                   MSG_DONTWAIT);
        continue;
      }
      ++active_;
      if (!privileged) {
        ++capped_;
        ++per_user_[cred.uid];
      }
      open_fds_.insert(conn.get());
    }
    const int fd = conn.get();
    try {
      std::thread([this, c = std::move(conn), uid = cred.uid, privileged]() mutable {
        ServeOne(std::move(c), uid, privileged);
      }).detach();
    } catch (const std::system_error& e) {
      // The lambda that owned the connection is gone, and closed it with it.
      Log(LOG_ERR, "fileindexd: no thread for a connection: %s", e.what());
      std::lock_guard<std::mutex> lock(mu_);
      open_fds_.erase(fd);
      --active_;
      if (!privileged) {
        --capped_;
        if (--per_user_[cred.uid] == 0) per_user_.erase(cred.uid);
      }
    }
  }
}

void CommandServer::ServeOne(UniqueFd conn, uid_t uid, bool privileged) {
  const int fd = conn.get();
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(kClientTimeoutMillis);
  struct timeval tv = {kClientTimeoutMillis / 1000, (kClientTimeoutMillis % 1000) * 1000};
  setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv));
  [&] {
    uint32_t len = 0;
    // A client that sent nothing gets nothing.
    if (!ReadFull(fd, &len, sizeof(len), deadline)) return;
    if (len == 0 || len > kMaxCommandFrame) {
      WriteReply(fd, ErrorReply(104, "frame length " + std::to_string(len) + " out of range"));
      return;
    }
    std::vector<char> payload(len);
    if (!ReadFull(fd, payload.data(), len, deadline)) return;
    size_t text_len = len;
    while (text_len > 0 && payload[text_len - 1] == '\0') --text_len;
    JsonValue command;
    if (!command.fromString(std::string(payload.data(), text_len)) || !command.isObject() ||
        !command["type"].isString()) {
      WriteReply(fd, ErrorReply(100, "malformed command"));
      return;
    }
    Json::Value reply;
    try {
      reply = handler_(command, uid);
    } catch (const Error& e) {
      reply = ErrorReply(e.code, e.what());
    } catch (const std::exception& e) {
      reply = ErrorReply(kErrSystem, e.what());
    }
    WriteReply(fd, reply);
  }();
  std::lock_guard<std::mutex> lock(mu_);
  // Out of the set before the descriptor closes, so Stop never shuts down a reused number.
  open_fds_.erase(fd);
  conn.Close();
  if (!privileged) {
    --capped_;
    if (--per_user_[uid] == 0) per_user_.erase(uid);
  }
  // Notified under the lock: once Stop sees no connection left, this thread touches nothing of
  // the server again.
  --active_;
  idle_cv_.notify_all();
}

}  // namespace fileindexd
}  // namespace orvane
