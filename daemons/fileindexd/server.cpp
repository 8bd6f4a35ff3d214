#include "daemons/fileindexd/server.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string_view>
#include <system_error>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"

namespace orvane {
namespace fileindexd {

namespace {

// `deadline` NoWait for a reply written on the accepting thread, which must never block.
void WriteReply(int fd, const Json::Value& reply, wire::Deadline deadline) {
  if (wire::WriteTextFrame(fd, JsonToString(reply), deadline) != wire::IoStatus::kOk) {
    Log(LOG_WARNING, "fileindexd: a client left before its reply: %m");
  }
}

// A client takes each part of its reply within the command time-out.
void WriteReply(int fd, const Json::Value& reply) {
  WriteReply(fd, reply,
             wire::Deadline::Idle(wire::kCommandTimeoutMillis, wire::kCommandTimeoutMillis));
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
      WriteReply(conn.get(), ErrorReply(kCodePermissionDenied, "cannot identify the caller"),
                 wire::Deadline::NoWait());
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
                   ErrorReply(kCodeTooManyConnections,
                              "too many connections to fileindexd; try again in a moment"),
                   wire::Deadline::NoWait());
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
  // The whole command is due this soon after connecting, so a client dripping a byte at a time
  // is cut off as surely as one that sends nothing.
  wire::Deadline deadline = wire::Deadline::In(wire::kCommandTimeoutMillis * 1000LL);
  [&] {
    uint32_t len = 0;
    // A client that sent nothing gets nothing.
    if (wire::ReadFrameLength(fd, &len, deadline) != wire::IoStatus::kOk) return;
    if (len == 0 || len > wire::kMaxCommandFrame) {
      WriteReply(
          fd, ErrorReply(kCodeTooLarge, "frame length " + std::to_string(len) + " out of range"));
      return;
    }
    std::string payload(len, '\0');
    if (wire::ReadExact(fd, &payload[0], len, deadline) != wire::IoStatus::kOk) return;
    const std::string_view text = wire::PayloadText(payload);
    JsonValue command;
    if (!command.fromString(text.data(), text.data() + text.size()) || !command.isObject() ||
        !command["type"].isString()) {
      WriteReply(fd, ErrorReply(kCodeMalformed, "malformed command"));
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
