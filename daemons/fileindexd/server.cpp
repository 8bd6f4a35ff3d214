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
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"

namespace orvane {
namespace fileindexd {

namespace {

// Reads or writes exactly `size` bytes; false on end of stream, time-out or error.
bool ReadFull(int fd, void* buf, size_t size) {
  char* p = static_cast<char*>(buf);
  while (size > 0) {
    const ssize_t n = read(fd, p, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

bool WriteFull(int fd, const void* buf, size_t size) {
  const char* p = static_cast<const char*>(buf);
  while (size > 0) {
    const ssize_t n = send(fd, p, size, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

void WriteReply(int fd, const Json::Value& reply) {
  std::string text = JsonToString(reply);
  text.push_back('\0');
  const uint32_t len = static_cast<uint32_t>(text.size());
  if (!WriteFull(fd, &len, sizeof(len)) || !WriteFull(fd, text.data(), text.size())) {
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
  ORVANE_THROW_IF(listen(listen_.get(), 64) != 0, kErrSystem, "listen failed");
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
    if (!conn.valid()) continue;
    ServeOne(conn.get());
  }
}

void CommandServer::ServeOne(int fd) {
  struct timeval tv = {kClientTimeoutMillis / 1000, (kClientTimeoutMillis % 1000) * 1000};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
  setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv));
  struct ucred cred = {};
  socklen_t cred_len = sizeof(cred);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &cred_len) != 0) {
    WriteReply(fd, ErrorReply(103, "cannot identify the caller"));
    return;
  }
  uint32_t len = 0;
  if (!ReadFull(fd, &len, sizeof(len))) return;  // a client that sent nothing gets nothing
  if (len == 0 || len > kMaxCommandFrame) {
    WriteReply(fd, ErrorReply(104, "frame length " + std::to_string(len) + " out of range"));
    return;
  }
  std::vector<char> payload(len);
  if (!ReadFull(fd, payload.data(), len)) return;
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
    reply = handler_(command, cred.uid);
  } catch (const Error& e) {
    reply = ErrorReply(e.code, e.what());
  } catch (const std::exception& e) {
    reply = ErrorReply(kErrSystem, e.what());
  }
  WriteReply(fd, reply);
}

}  // namespace fileindexd
}  // namespace orvane
