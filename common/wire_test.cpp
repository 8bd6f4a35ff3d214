#include "common/wire.hpp"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "common/fd.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace wire {
namespace {

using Clock = std::chrono::steady_clock;

double SecondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

struct Pair {
  Pair() {
    int fds[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    a.Reset(fds[0]);
    b.Reset(fds[1]);
  }
  UniqueFd a, b;
};

std::string LengthBytes(uint32_t length) {
  return std::string(reinterpret_cast<const char*>(&length), sizeof(length));
}

// Larger than a socket buffer, so both sides move it in several partial calls.
TEST(WireTest, FramesKeepEveryByteThroughPartialTransfers) {
  Pair p;
  std::string big(3 << 20, 'x');
  big[12345] = '\0';
  std::thread writer([&] {
    Deadline never = Deadline::Never();
    EXPECT_EQ(WriteFrame(p.a.get(), big, never), IoStatus::kOk);
    EXPECT_EQ(WriteTextFrame(p.a.get(), "{}", never), IoStatus::kOk);
    EXPECT_EQ(WriteFrame(p.a.get(), "", never), IoStatus::kOk);
  });
  Deadline never = Deadline::Never();
  std::string payload;
  EXPECT_EQ(ReadFrame(p.b.get(), kClientMaxFrameBytes, &payload, never), IoStatus::kOk);
  EXPECT_EQ(payload, big);
  std::string raw(4 + 3, '?');
  EXPECT_EQ(ReadExact(p.b.get(), &raw[0], raw.size(), never), IoStatus::kOk);
  EXPECT_EQ(raw, LengthBytes(3) + std::string("{}\0", 3));
  EXPECT_EQ(PayloadText(raw.substr(4)), "{}");
  EXPECT_EQ(ReadFrame(p.b.get(), 0, &payload, never), IoStatus::kOk);
  EXPECT_EQ(payload, "");
  writer.join();
}

// Every misbehaving peer ends the read quickly with its own status and errno, and a refused
// length allocates nothing and waits for nothing.
TEST(WireTest, BrokenFramesFailWithTheirReason) {
  struct Case {
    const char* name;
    std::string sent;
    bool peer_closes;
    uint32_t max_bytes;
    IoStatus status;
    int error;
  };
  const std::vector<Case> cases = {
      {"closes without a frame", "", true, 100, IoStatus::kClosed, ECONNRESET},
      {"closes inside the payload", LengthBytes(10) + "0123", true, 100, IoStatus::kClosed,
       ECONNRESET},
      {"announces 4 GiB", LengthBytes(0xFFFFFFFFu) + "{}", false, kClientMaxFrameBytes,
       IoStatus::kTooLarge, EMSGSIZE},
      {"stalls inside the payload", LengthBytes(10) + "0123", false, 100, IoStatus::kTimeout,
       ETIMEDOUT},
      {"never sends", "", false, 100, IoStatus::kTimeout, ETIMEDOUT},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    Pair p;
    ASSERT_EQ(write(p.a.get(), c.sent.data(), c.sent.size()), static_cast<ssize_t>(c.sent.size()));
    if (c.peer_closes) p.a.Reset();
    Deadline deadline = Deadline::Idle(300, 200);
    std::string payload = "stale";
    const auto start = Clock::now();
    EXPECT_EQ(ReadFrame(p.b.get(), c.max_bytes, &payload, deadline), c.status);
    EXPECT_EQ(errno, c.error);
    EXPECT_EQ(payload, "");
    EXPECT_LT(SecondsSince(start), 3.0);
  }
}

// A whole-exchange limit cuts off a peer that sends a byte at a time; an idle limit starts again
// with every byte.
TEST(WireTest, DeadlinesInAndIdleDifferForADrippingPeer) {
  for (const bool idle : {false, true}) {
    SCOPED_TRACE(idle ? "idle" : "in");
    Pair p;
    std::thread dripper([&] {
      for (int i = 0; i < 8; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        if (write(p.a.get(), "z", 1) != 1) return;
      }
    });
    Deadline deadline = idle ? Deadline::Idle(400, 400) : Deadline::In(400000);
    char buf[8];
    EXPECT_EQ(ReadExact(p.b.get(), buf, sizeof(buf), deadline),
              idle ? IoStatus::kOk : IoStatus::kTimeout);
    dripper.join();
  }
}

TEST(WireTest, WritesToAGoneOrStuckPeerFailWithoutASignal) {
  Pair gone;
  gone.b.Reset();
  Deadline never = Deadline::Never();
  EXPECT_EQ(WriteFrame(gone.a.get(), "x", never), IoStatus::kError);  // no SIGPIPE
  EXPECT_EQ(errno, EPIPE);

  Pair stuck;  // nobody reads: the buffer fills and the writer waits its idle limit out
  const std::string big(8 << 20, 'y');
  const auto start = Clock::now();
  Deadline idle = Deadline::Idle(200, 200);
  EXPECT_EQ(WriteFrame(stuck.a.get(), big, idle), IoStatus::kTimeout);
  EXPECT_EQ(errno, ETIMEDOUT);
  EXPECT_LT(SecondsSince(start), 3.0);
  Deadline now = Deadline::NoWait();
  EXPECT_EQ(WriteExact(stuck.a.get(), "z", 1, now), IoStatus::kTimeout);
}

TEST(WireTest, ConnectFailsWithATellingErrno) {
  test::TempDir dir;
  EXPECT_FALSE(Connect(dir.Path("none.sock"), 1000).valid());
  EXPECT_EQ(errno, ENOENT);
  EXPECT_FALSE(Connect("/" + std::string(200, 'a'), 1000).valid());
  EXPECT_EQ(errno, ENAMETOOLONG);

  // Nobody accepts: fill the backlog with non-blocking connections until one is refused.
  const std::string path = dir.Path("full.sock");
  UniqueFd listener(socket(AF_UNIX, SOCK_STREAM, 0));
  struct sockaddr_un addr;
  std::memset(&addr, 0, sizeof(addr));
  addr.sun_family = AF_UNIX;
  std::strcpy(addr.sun_path, path.c_str());
  ASSERT_EQ(bind(listener.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  ASSERT_EQ(listen(listener.get(), 0), 0);
  std::vector<UniqueFd> pending;
  for (int i = 0; i < 64; ++i) {
    UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0));
    if (connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) break;
    pending.push_back(std::move(fd));
  }
  ASSERT_LT(pending.size(), 64u);
  const auto start = Clock::now();
  EXPECT_FALSE(Connect(path, 300).valid());
  EXPECT_EQ(errno, ETIMEDOUT);
  EXPECT_GE(SecondsSince(start), 0.2);
  EXPECT_LT(SecondsSince(start), 5.0);
}

// Ten interrupted calls are tolerated per transfer (not per call), the eleventh is not; a closed
// peer is read again ten times and then fails; no call moves more than a chunk.
TEST(WireTest, BlockingTransfersHaveBudgets) {
  Pair p;
  int interrupts_left = 0;
  int reads = 0;
  size_t largest = 0;
  bool odd = false;
  // Interrupts every other call, until the budget of the test runs out.
  auto interrupt = [&] {
    odd = !odd;
    if (!odd || interrupts_left == 0) return false;
    --interrupts_left;
    errno = EINTR;
    return true;
  };
  IoCalls calls;
  calls.write = [&](int fd, const void* buf, size_t size) -> ssize_t {
    largest = std::max(largest, size);
    return interrupt() ? -1 : write(fd, buf, size);
  };
  calls.read = [&](int fd, void* buf, size_t size) -> ssize_t {
    ++reads;
    return interrupt() ? -1 : read(fd, buf, size);
  };
  const IoCalls previous = SetIoCalls(calls);
  const std::vector<unsigned char> out(20 * 1024, 'z');
  std::vector<unsigned char> in(out.size());
  interrupts_left = 10;
  EXPECT_TRUE(WriteBlocking(p.a.get(), out.data(), out.size(), kCommandTransfer));
  EXPECT_EQ(largest, 1024u);
  interrupts_left = 10;
  EXPECT_TRUE(ReadBlocking(p.b.get(), in.data(), in.size(), kCommandTransfer));
  EXPECT_EQ(in, out);

  interrupts_left = 11;
  EXPECT_FALSE(WriteBlocking(p.a.get(), out.data(), out.size(), kCommandTransfer));
  EXPECT_EQ(errno, EINTR);
  // The 10 KiB that went out before the failure are what the ten reads between the eleven
  // interruptions take, so the read never waits.
  odd = false;
  interrupts_left = 11;
  EXPECT_FALSE(ReadBlocking(p.b.get(), in.data(), in.size(), kCommandTransfer));
  EXPECT_EQ(errno, EINTR);

  Pair closed;  // a peer that sends "ab" and closes
  ASSERT_EQ(write(closed.a.get(), "ab", 2), 2);
  closed.a.Reset();
  reads = 0;
  unsigned char buf[4];
  EXPECT_FALSE(ReadBlocking(closed.b.get(), buf, sizeof(buf), kCommandTransfer));
  EXPECT_EQ(errno, ECONNRESET);
  EXPECT_EQ(reads, 12);  // the two bytes, the first end of stream and ten more tries
  EXPECT_EQ(std::string(buf, buf + 2), "ab");
  SetIoCalls(previous);
}

}  // namespace
}  // namespace wire
}  // namespace orvane
