#include "platform/daemon_sock.hpp"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <vector>

#include "common/fd.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace quixdaemon {
namespace {

using orvane::test::FakeDaemon;
using orvane::test::TempDir;

std::string Frame(const std::string& payload) {
  const uint32_t length = static_cast<uint32_t>(payload.size());
  return std::string(reinterpret_cast<const char*>(&length), 4) + payload;
}

double SecondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

TEST(DaemonSockTest, FramesTravelBothWaysWithTheirExactBytesToAnExistingSocket) {
  TempDir dir;
  const std::string big(3 << 20, 'x');  // more than a socket buffer: partial sends and reads
  FakeDaemon daemon(dir.Path("d.sock"), [&](int fd, const std::string& request) {
    if (request == "small")
      FakeDaemon::WriteFrame(fd, std::string("{\"ok\":1}\0", 9));
    else
      FakeDaemon::WriteFrame(fd, request + "!");
  });

  DomainSockConnection conn(dir.Path("d.sock"));
  ASSERT_TRUE(conn.Connect(1000));
  ASSERT_TRUE(conn.Send("small"));
  std::string reply;
  ASSERT_TRUE(conn.Recv(reply));
  EXPECT_EQ(reply, "{\"ok\":1}");  // the terminating NUL is not part of the text
  conn.Disconnect();
  EXPECT_FALSE(conn.IsConnected());
  EXPECT_FALSE(conn.Send("x"));
  EXPECT_EQ(errno, ENOTCONN);

  ASSERT_TRUE(conn.Connect(1000));
  ASSERT_TRUE(conn.Send(big));
  ASSERT_TRUE(conn.Recv(reply));
  EXPECT_EQ(reply.size(), big.size() + 1);
  EXPECT_EQ(reply.back(), '!');
  ASSERT_EQ(daemon.raw_frames().size(), 2u);
  EXPECT_EQ(daemon.raw_frames()[0], Frame("small"));
  EXPECT_EQ(daemon.raw_frames()[1], Frame(big));

  DomainSockConnection missing(dir.Path("none.sock"));
  EXPECT_FALSE(missing.Connect(1000));
  EXPECT_EQ(errno, ENOENT);
  EXPECT_FALSE(missing.IsConnected());
  DomainSockConnection too_long("/" + std::string(200, 'a'));
  EXPECT_FALSE(too_long.Connect(1000));
  EXPECT_EQ(errno, ENAMETOOLONG);
}

TEST(DaemonSockTest, ConnectHonoursItsTimeOutWhenTheBacklogIsFull) {
  TempDir dir;
  const std::string path = dir.Path("full.sock");
  orvane::UniqueFd listener(socket(AF_UNIX, SOCK_STREAM, 0));
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  std::strcpy(addr.sun_path, path.c_str());
  ASSERT_EQ(bind(listener.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  ASSERT_EQ(listen(listener.get(), 0), 0);
  // Nobody accepts: fill the backlog with non-blocking connections until one is refused.
  std::vector<orvane::UniqueFd> pending;
  for (int i = 0; i < 64; ++i) {
    orvane::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0));
    if (connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) break;
    pending.push_back(std::move(fd));
  }
  ASSERT_LT(pending.size(), 64u);

  DomainSockConnection conn(path);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(conn.Connect(300));
  EXPECT_EQ(errno, ETIMEDOUT);
  EXPECT_GE(SecondsSince(start), 0.2);
  EXPECT_LT(SecondsSince(start), 5.0);
}

// Every misbehaving peer ends in a failed Recv with a telling errno, quickly and without the
// announced size being allocated; the frame bound is the connection's own.
TEST(DaemonSockTest, BrokenRepliesFailWithinTheTimeOuts) {
  TempDir dir;
  struct Case {
    const char* name;
    FakeDaemon::Handler handler;
    int expected_errno;
    uint32_t max_frame_bytes = kDefaultMaxFrameBytes;
  };
  const uint32_t four_gib_minus_one = 0xFFFFFFFFu;
  const std::vector<Case> cases = {
      {"closes without answering", [](int, const std::string&) {}, ECONNRESET},
      {"half a payload then close",
       [](int fd, const std::string&) {
         FakeDaemon::WriteAll(fd, Frame("0123456789").substr(0, 8));
       },
       ECONNRESET},
      {"announces 4 GiB",
       [&](int fd, const std::string&) {
         FakeDaemon::WriteAll(
             fd, std::string(reinterpret_cast<const char*>(&four_gib_minus_one), 4) + "{}");
         FakeDaemon::WaitForPeerClose(fd, 5000);
       },
       EMSGSIZE},
      {"stalls mid-frame",
       [](int fd, const std::string&) {
         FakeDaemon::WriteAll(fd, Frame("0123456789").substr(0, 8));
         FakeDaemon::WaitForPeerClose(fd, 5000);
       },
       ETIMEDOUT},
      {"never answers", [](int fd, const std::string&) { FakeDaemon::WaitForPeerClose(fd, 5000); },
       ETIMEDOUT},
      {"one byte over the bound", FakeDaemon::Replies({std::string(100, 'y')}), EMSGSIZE, 99},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    FakeDaemon daemon(dir.Path("bad.sock"), c.handler);
    DomainSockConnection conn(dir.Path("bad.sock"));
    conn.SetTimeouts(300, 200);
    conn.SetMaxFrameBytes(c.max_frame_bytes);
    ASSERT_TRUE(conn.Connect(1000));
    ASSERT_TRUE(conn.Send("{\"command\":\"x\"}"));
    const auto start = std::chrono::steady_clock::now();
    std::string reply = "stale";
    EXPECT_FALSE(conn.Recv(reply));
    EXPECT_EQ(errno, c.expected_errno);
    EXPECT_TRUE(reply.empty());
    EXPECT_LT(SecondsSince(start), 3.0);
    conn.Disconnect();  // lets the fake daemon's handler return
  }
}

}  // namespace
}  // namespace quixdaemon
