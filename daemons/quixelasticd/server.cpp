#include "daemons/quixelasticd/server.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"

namespace orvane {
namespace elasticd {

using wire::Deadline;
using wire::IoStatus;

Server::Server(Engine& engine, ServerOptions options)
    : engine_(engine), options_(std::move(options)) {}

Server::~Server() { Stop(); }

UniqueFd Server::Listen(const std::string& path, mode_t mode) {
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  ORVANE_THROW_IF(path.size() >= sizeof(addr.sun_path), kErrSystem, "socket path too long: " + path);
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ORVANE_THROW_IF(!fd.valid(), kErrSystem, "socket failed");
  MakeParentDirs(path);
  // A socket file left by a run that was killed would make bind fail; the pid file lock
  // already guarantees that no other daemon owns it.
  ::unlink(path.c_str());
  // The umask closes the window between bind and chmod in which the file has wider rights.
  const mode_t old_mask = ::umask(0777 & ~mode);
  const int rc = ::bind(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr));
  ::umask(old_mask);
  ORVANE_THROW_IF(rc != 0, kErrSystem, "bind " + path + " failed");
  ORVANE_THROW_IF(::chmod(path.c_str(), mode) != 0, kErrSystem, "chmod " + path + " failed");
  if (options_.service_gid != static_cast<gid_t>(-1) && ::geteuid() == 0) {
    ORVANE_LOG_IF(::chown(path.c_str(), 0, options_.service_gid) != 0);
  }
  ORVANE_THROW_IF(::listen(fd.get(), 128) != 0, kErrSystem, "listen " + path + " failed");
  return fd;
}

void Server::Start() {
  int pipe_fds[2];
  ORVANE_THROW_IF(::pipe2(pipe_fds, O_CLOEXEC | O_NONBLOCK) != 0, kErrSystem, "pipe failed");
  stop_read_.Reset(pipe_fds[0]);
  stop_write_.Reset(pipe_fds[1]);
  main_fd_ = Listen(options_.socket_path, 0660);
  if (!options_.public_socket_path.empty()) public_fd_ = Listen(options_.public_socket_path, 0666);
  started_ = true;
  acceptor_ = std::thread([this] { AcceptLoop(); });
  ORVANE_LOG(LOG_INFO, "listening on %s", options_.socket_path.c_str());
}

namespace {

// The peer's uid from SO_PEERCRED; false when unknown.
bool PeerUid(int fd, uid_t* uid, gid_t* gid) {
  struct ucred cred;
  socklen_t len = sizeof(cred);
  if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return false;
  *uid = cred.uid;
  *gid = cred.gid;
  return true;
}

// Answers a connection that gets no place, without waiting for it: the reply fits in the
// socket's empty buffer, and a peer that is not reading simply loses it.
void Refuse(int fd, const std::string& why) {
  // Best effort: a full buffer or a peer already gone changes nothing.
  Deadline now = Deadline::NoWait();
  wire::WriteTextFrame(fd, JsonToString(Engine::ErrorReply(kCodeOverloaded, why)), now);
}

}  // namespace

bool Server::AdmitPublic(uid_t uid, std::string* why) {
  std::lock_guard<std::mutex> lock(mu_);
  if (public_active_ >= options_.max_public_connections) {
    *why = "too many connections to the search socket: try again shortly";
    return false;
  }
  int& mine = public_by_user_[uid];
  if (mine >= options_.max_public_connections_per_user) {
    *why = "too many connections from uid " + std::to_string(uid) + " (at most " +
           std::to_string(options_.max_public_connections_per_user) + "): close some and try again";
    return false;
  }
  ++mine;
  ++public_active_;
  ++active_;
  return true;
}

void Server::AcceptLoop() {
  uint64_t refused = 0;
  for (;;) {
    struct pollfd fds[3] = {{stop_read_.get(), POLLIN, 0},
                            {main_fd_.get(), POLLIN, 0},
                            {public_fd_.valid() ? public_fd_.get() : -1, POLLIN, 0}};
    const int rc = ::poll(fds, 3, -1);
    if (rc < 0) {
      if (errno == EINTR) continue;
      ORVANE_LOG(LOG_ERR, "poll failed [err: %m]");
      return;
    }
    if (fds[0].revents != 0) return;
    for (int i = 1; i < 3; ++i) {
      if ((fds[i].revents & POLLIN) == 0) continue;
      UniqueFd fd(::accept4(fds[i].fd, nullptr, nullptr, SOCK_CLOEXEC));
      if (!fd.valid()) {
        if (errno != EINTR && errno != EAGAIN) {
          ORVANE_LOG(LOG_ERR, "accept failed [err: %m]");
          // Out of descriptors: give connections in flight a moment to close some.
          if (errno == EMFILE || errno == ENFILE) Env::Current()->SleepMicros(10000);
        }
        continue;
      }
      if (i == 1) {
        {
          std::lock_guard<std::mutex> lock(mu_);
          ++active_;
          ++main_active_;
        }
        std::thread([this, conn = fd.Release()] {
          Serve(conn, false);
          ::close(conn);
          std::lock_guard<std::mutex> lock(mu_);
          --main_active_;
          if (--active_ == 0) idle_cv_.notify_all();
        }).detach();
        continue;
      }
      // The public socket: the place is decided here, before any thread, so that a flood of
      // connections costs the daemon one accept and one close each.
      uid_t uid;
      gid_t gid;
      std::string why;
      if (!PeerUid(fd.get(), &uid, &gid)) continue;
      if (!AdmitPublic(uid, &why)) {
        Refuse(fd.get(), why);
        // Counted, not logged one by one: a flood must not flood the log too.
        ++refused;
        if ((refused & (refused - 1)) == 0) {
          ORVANE_LOG(LOG_WARNING, "search socket: %llu connections refused so far, the last: %s",
                     static_cast<unsigned long long>(refused), why.c_str());
        }
        continue;
      }
      std::thread([this, conn = fd.Release(), uid] {
        Serve(conn, true);
        ::close(conn);
        std::lock_guard<std::mutex> lock(mu_);
        --public_active_;
        if (--public_by_user_[uid] == 0) public_by_user_.erase(uid);
        if (--active_ == 0) idle_cv_.notify_all();
      }).detach();
    }
  }
}

void Server::Serve(int fd, bool public_socket) {
  const int64_t wait =
      public_socket ? options_.public_request_timeout_micros : options_.io_timeout_micros;
  Deadline deadline = Deadline::In(wait);
  const uint32_t max_frame =
      public_socket ? std::min(options_.max_frame_bytes, options_.max_public_frame_bytes)
                    : options_.max_frame_bytes;
  auto reply = [&](const Json::Value& r) {
    Deadline taken = Deadline::In(options_.io_timeout_micros);
    wire::WriteTextFrame(fd, JsonToString(r), taken);
  };
  uint32_t length = 0;
  if (wire::ReadFrameLength(fd, &length, deadline) != IoStatus::kOk) return;
  if (length > max_frame) {
    // The payload is not read: answer and close, the peer sees the reply or a reset.
    reply(Engine::ErrorReply(kCodeTooLarge, "request of " + std::to_string(length) +
                                                " bytes is longer than the limit of " +
                                                std::to_string(max_frame)));
    return;
  }
  uid_t uid = 0;
  gid_t gid = 0;
  const bool known = PeerUid(fd, &uid, &gid);
  std::string busy;
  bool running = false;
  {
    std::lock_guard<std::mutex> lock(mu_);
    if (!public_socket) {
      if (main_active_ > options_.max_connections) busy = "too many connections";
    } else if (known) {
      int& mine = running_by_user_[uid];
      if (mine >= options_.max_public_requests_per_user) {
        busy = "too many searches of uid " + std::to_string(uid) + " in progress (at most " +
               std::to_string(options_.max_public_requests_per_user) + "): try again shortly";
        if (mine == 0) running_by_user_.erase(uid);
      } else {
        ++mine;
        running = true;
      }
    }
  }
  // Leaves the user's count of running requests as it found it, whichever way Serve returns.
  struct Running {
    Server* server;
    uid_t uid;
    bool on;
    ~Running() {
      if (!on) return;
      std::lock_guard<std::mutex> lock(server->mu_);
      if (--server->running_by_user_[uid] == 0) server->running_by_user_.erase(uid);
    }
  } running_guard{this, uid, running};
  const int refused =
      !busy.empty() ? static_cast<int>(kCodeOverloaded) : engine_.AdmitFrame(length);
  if (refused != 0) {
    if (wire::Discard(fd, length, deadline) != IoStatus::kOk) return;
    reply(Engine::ErrorReply(refused,
                             refused == kCodeOutOfMemory ? "the daemon is short of memory" : busy));
    return;
  }
  std::string payload(length, '\0');
  const IoStatus st =
      length == 0 ? IoStatus::kOk : wire::ReadExact(fd, &payload[0], length, deadline);
  if (st != IoStatus::kOk) {
    engine_.ReleaseFrame(length);
    return;
  }
  if (!known) {
    engine_.ReleaseFrame(length);
    reply(Engine::ErrorReply(kCodePermissionDenied, "the caller's identity is unknown"));
    return;
  }
  Caller caller;
  caller.uid = uid;
  caller.gid = gid;
  caller.privileged = !public_socket && (uid == 0 || uid == options_.service_uid);
  caller.peer_fd = fd;
  Json::Value result;
  try {
    result = engine_.Handle(payload, caller);
  } catch (const std::bad_alloc&) {
    result = Engine::ErrorReply(kCodeOutOfMemory, "out of memory");
  } catch (const std::exception& e) {
    ORVANE_LOG(LOG_ERR, "request failed: %s", e.what());
    result = Engine::ErrorReply(kCodeStorage, e.what());
  }
  payload.clear();
  payload.shrink_to_fit();
  engine_.ReleaseFrame(length);
  if (!result["success"].asBool() && result["error"]["code"].asInt() == kCodeCallerGone) {
    ORVANE_LOG(LOG_INFO, "search of uid %u stopped: its client hung up",
               static_cast<unsigned>(uid));
    return;
  }
  reply(result);
}

void Server::Stop() {
  if (!started_) return;
  started_ = false;
  const char byte = 0;
  ORVANE_LOG_IF(::write(stop_write_.get(), &byte, 1) != 1);
  if (acceptor_.joinable()) acceptor_.join();
  main_fd_.Close();
  public_fd_.Close();
  ::unlink(options_.socket_path.c_str());
  if (!options_.public_socket_path.empty()) ::unlink(options_.public_socket_path.c_str());
  std::unique_lock<std::mutex> lock(mu_);
  idle_cv_.wait(lock, [this] { return active_ == 0; });
}

}  // namespace elasticd
}  // namespace orvane
