#include "test/fake_daemon.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string_view>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"

namespace orvane {
namespace test {
FakeDaemon::FakeDaemon(const std::string& socket_path, Handler handler, bool read_request)
    : path_(socket_path), handler_(std::move(handler)), read_request_(read_request) {
  MakeParentDirs(path_);
  unlink(path_.c_str());
  listen_fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  if (listen_fd_ < 0 || path_.size() >= sizeof(addr.sun_path)) {
    throw std::runtime_error("fake daemon: cannot make a socket for " + path_);
  }
  std::memcpy(addr.sun_path, path_.c_str(), path_.size() + 1);
  if (bind(listen_fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0 ||
      listen(listen_fd_, 16) != 0 || pipe2(stop_pipe_, O_CLOEXEC) != 0) {
    throw std::runtime_error("fake daemon: cannot listen on " + path_);
  }
  thread_ = std::thread([this] { Serve(); });
}

FakeDaemon::~FakeDaemon() {
  const char byte = 0;
  if (write(stop_pipe_[1], &byte, 1) != 1) ADD_FAILURE() << "fake daemon: cannot stop";
  thread_.join();
  close(listen_fd_);
  close(stop_pipe_[0]);
  close(stop_pipe_[1]);
  unlink(path_.c_str());
}

void FakeDaemon::Serve() {
  for (;;) {
    struct pollfd fds[2] = {{listen_fd_, POLLIN, 0}, {stop_pipe_[0], POLLIN, 0}};
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if (fds[1].revents != 0) return;
    const int fd = accept4(listen_fd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) continue;
    ++connections_;
    // A client that never sends a whole frame must not hold the daemon for ever.
    wire::Deadline deadline = wire::Deadline::Idle(5000, 5000);
    std::string payload;
    uint32_t length = 0;
    if (read_request_ && wire::ReadFrameLength(fd, &length, deadline) == wire::IoStatus::kOk &&
        length <= (256u << 20)) {
      payload.resize(length);
      if (wire::ReadExact(fd, &payload[0], length, deadline) != wire::IoStatus::kOk) {
        payload.clear();
      }
      std::lock_guard<std::mutex> lock(mu_);
      requests_.push_back(payload);
      raw_frames_.push_back(wire::EncodeFrame(payload));
    }
    handler_(fd, payload);
    close(fd);
  }
}

std::vector<std::string> FakeDaemon::requests() const {
  std::lock_guard<std::mutex> lock(mu_);
  return requests_;
}

std::vector<std::string> FakeDaemon::raw_frames() const {
  std::lock_guard<std::mutex> lock(mu_);
  return raw_frames_;
}

std::vector<Json::Value> FakeDaemon::json_requests() const {
  std::vector<Json::Value> out;
  for (const std::string& payload : requests()) {
    const std::string_view text = wire::PayloadText(payload);
    JsonValue value;
    value.fromString(text.data(), text.data() + text.size());
    out.push_back(value);
  }
  return out;
}

// A failed write means the client gave up; what it saw is what the test checks.
void FakeDaemon::WriteAll(int fd, const std::string& bytes) {
  wire::Deadline never = wire::Deadline::Never();
  wire::WriteExact(fd, bytes.data(), bytes.size(), never);
}

void FakeDaemon::WriteFrame(int fd, const std::string& payload) {
  wire::Deadline never = wire::Deadline::Never();
  wire::WriteFrame(fd, payload, never);
}

void FakeDaemon::WaitForPeerClose(int fd, int timeout_ms) {
  struct timeval tv = {timeout_ms / 1000, (timeout_ms % 1000) * 1000};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
  char buf[4096];
  while (read(fd, buf, sizeof(buf)) > 0) {
  }
}

FakeDaemon::Handler FakeDaemon::Replies(std::vector<std::string> replies) {
  auto next = std::make_shared<size_t>(0);
  return [replies = std::move(replies), next](int fd, const std::string&) {
    if (replies.empty()) return;
    const size_t i = std::min(*next, replies.size() - 1);
    ++*next;
    WriteFrame(fd, replies[i]);
  };
}

FakeDaemon::Handler FakeDaemon::EngineReplies(std::function<int(const Json::Value&)> fail) {
  return [fail](int fd, const std::string& request) {
    const Json::Value req = Parse(request);
    const int code = fail(req);
    Json::Value reply(Json::objectValue);
    reply["success"] = code == 0;
    if (code != 0) reply["error"]["code"] = code;
    if (req["command"] == "document_get_by_query") reply["data"] = Json::arrayValue;
    WriteFrame(fd, JsonToString(reply));
  };
}

Json::Value FakeDaemon::Parse(const std::string& text) {
  JsonValue value;
  EXPECT_TRUE(value.fromString(text)) << text;
  return value;
}

}  // namespace test
}  // namespace orvane
