#include "platform/daemon_sock.hpp"

#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <vector>

#include "common/wire.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace quixdaemon {
namespace {

using orvane::test::FakeDaemon;
using orvane::test::TempDir;
using orvane::wire::EncodeFrame;

TEST(DaemonSockTest, OneFrameEachWayAndTheReplyWithoutItsNul) {
  TempDir dir;
  FakeDaemon daemon(dir.Path("d.sock"), FakeDaemon::Replies({std::string("{\"ok\":1}\0", 9)}));
  DomainSockConnection conn(dir.Path("d.sock"));
  ASSERT_TRUE(conn.Connect(1000));
  ASSERT_TRUE(conn.Send("small"));
  std::string reply;
  ASSERT_TRUE(conn.Recv(reply));
  EXPECT_EQ(reply, "{\"ok\":1}");
  EXPECT_EQ(daemon.raw_frames(), std::vector<std::string>{EncodeFrame("small")});
  conn.Disconnect();
  EXPECT_FALSE(conn.IsConnected());
  EXPECT_FALSE(conn.Send("x"));
  EXPECT_EQ(errno, ENOTCONN);
  EXPECT_FALSE(conn.Recv(reply));
  EXPECT_EQ(errno, ENOTCONN);
}

// The connection's own bound and time-outs are the ones that apply.
TEST(DaemonSockTest, BrokenRepliesFailWithATellingErrno) {
  TempDir dir;
  struct Case {
    const char* name;
    FakeDaemon::Handler handler;
    int expected_errno;
    uint32_t max_frame_bytes = orvane::wire::kClientMaxFrameBytes;
  };
  const std::vector<Case> cases = {
      {"closes without answering", [](int, const std::string&) {}, ECONNRESET},
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
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(3));
    conn.Disconnect();  // lets the fake daemon's handler return
  }
}

}  // namespace
}  // namespace quixdaemon
