#include "platform/daemon_sock.hpp"

#include <gtest/gtest.h>

#include <cerrno>
#include <vector>

#include "common/wire.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace quixdaemon {
namespace {

using orvane::test::FakeDaemon;
using orvane::test::TempDir;

TEST(DaemonSockTest, OneFrameEachWayAndTheReplyWithoutItsNul) {
  TempDir dir;
  FakeDaemon daemon(dir.Path("d.sock"), FakeDaemon::Replies({std::string("{\"ok\":1}\0", 9)}));
  DomainSockConnection conn(dir.Path("d.sock"));
  ASSERT_TRUE(conn.Connect(1000));
  ASSERT_TRUE(conn.Send("small"));
  std::string reply;
  ASSERT_TRUE(conn.Recv(reply));
  EXPECT_EQ(reply, "{\"ok\":1}");
  EXPECT_EQ(daemon.raw_frames(), std::vector<std::string>{orvane::wire::EncodeFrame("small")});
  conn.Disconnect();
  EXPECT_FALSE(conn.Send("x"));
  EXPECT_EQ(errno, ENOTCONN);
}

// The connection's own bound and time-outs are the ones that apply, not the wire's defaults.
TEST(DaemonSockTest, TheConnectionsOwnBoundAndTimeoutApply) {
  TempDir dir;
  const std::vector<std::pair<FakeDaemon::Handler, int>> cases = {
      {[](int fd, const std::string&) { FakeDaemon::WaitForPeerClose(fd, 5000); }, ETIMEDOUT},
      {FakeDaemon::Replies({std::string(100, 'y')}), EMSGSIZE},
  };
  for (const auto& [handler, expected_errno] : cases) {
    SCOPED_TRACE(expected_errno);
    FakeDaemon daemon(dir.Path("bad.sock"), handler);
    DomainSockConnection conn(dir.Path("bad.sock"));
    conn.SetTimeouts(300, 200);
    conn.SetMaxFrameBytes(99);
    ASSERT_TRUE(conn.Connect(1000));
    ASSERT_TRUE(conn.Send("{\"command\":\"x\"}"));
    std::string reply = "stale";
    EXPECT_FALSE(conn.Recv(reply));
    EXPECT_EQ(errno, expected_errno);
    EXPECT_TRUE(reply.empty());
    conn.Disconnect();  // lets the fake daemon's handler return
  }
}

}  // namespace
}  // namespace quixdaemon
