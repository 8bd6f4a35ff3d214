#include "fileindex/communication.hpp"

#include <gmock/gmock.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

using test::FakeDaemon;
using ::testing::StartsWith;

// The text of the Error that `fn` throws, "" when it throws none.
template <typename Fn>
std::string ErrorText(Fn fn) {
  try {
    fn();
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrSystem);
    return e.what();
  }
  return "";
}

std::string LengthBytes(uint32_t length) {
  return std::string(reinterpret_cast<const char*>(&length), sizeof(length));
}

class CommandChannelTest : public ::testing::Test {
 protected:
  std::string SockPath() const { return dir_.Path("var/run/fileindexd.sock"); }
  std::string Command(const std::string& cmd) {
    return ErrorText([&] { SendCommandToDaemon(cmd, Json::Value()); });
  }

  test::TempDir dir_;
  test::ScopedRoot root_{dir_.path()};
  test::FakeEnv env_;
};

TEST_F(CommandChannelTest, CommandIsOneFrameOfJsonTextAndNul) {
  FakeDaemon daemon(SockPath(), FakeDaemon::Replies({"", std::string(5000, 'r')}));
  Json::Value data;
  data["share_name"] = "photo \"x\"\n\xC3\xA9\xFF";
  data["is_upsert"] = true;
  SendCommandToDaemon("notify_setting_changed", data);
  EXPECT_EQ(Command("resume"), "");

  const std::vector<std::string> frames = daemon.raw_frames();
  ASSERT_EQ(frames.size(), 2u);
  const std::string resume_text = R"({"data":null,"type":"resume"})";
  EXPECT_EQ(frames[1], LengthBytes(resume_text.size() + 1) + resume_text + std::string(1, '\0'));
  const std::vector<Json::Value> sent = daemon.json_requests();
  EXPECT_EQ(sent[0]["type"].asString(), "notify_setting_changed");
  EXPECT_EQ(sent[0]["data"], data);  // every byte of the share name survives
  EXPECT_TRUE(env_.sleeps().empty());
  // A daemon that goes away mid-write must fail the call, not kill the caller.
  struct sigaction action;
  ASSERT_EQ(sigaction(SIGPIPE, nullptr, &action), 0);
  EXPECT_EQ(action.sa_handler, SIG_IGN);
}

TEST_F(CommandChannelTest, TheReplyOnlyKeepsTheExchangeInStep) {
  const std::string refusal =
      R"({"success":false,"error":{"code":103,"msg":"not permitted"}})" + std::string(1, '\0');
  FakeDaemon daemon(SockPath(), FakeDaemon::Replies({refusal, R"({"success":"no"})"}));
  EXPECT_EQ(Command("pause"), "");
  EXPECT_EQ(Command("resume"), "");
}

TEST_F(CommandChannelTest, OnlyAMissingSocketIsWaitedFor) {
  EXPECT_THAT(Command("worker_create"),
              StartsWith("Orvane error, code=502, reason=[write failed, reason="));
  EXPECT_EQ(env_.sleeps(), std::vector<int64_t>(4, 1000000));
  // A path nobody listens on (the file a dead daemon left behind) refuses at once.
  dir_.Write("var/run/fileindexd.sock", "");
  EXPECT_THAT(Command("pause"), StartsWith("Orvane error, code=502, reason=[write failed"));
  EXPECT_EQ(env_.sleeps().size(), 4u);
}

TEST_F(CommandChannelTest, BrokenRepliesFailQuicklyWithoutAllocatingTheAnnouncedSize) {
  const std::string reset =
      "Orvane error, code=502, reason=[read failed, reason=Connection reset by peer]";
  const std::vector<std::pair<FakeDaemon::Handler, std::string>> cases = {
      {[](int, const std::string&) {}, reset},
      {[](int fd, const std::string&) { FakeDaemon::WriteAll(fd, LengthBytes(100) + "abc"); },
       reset},
      {[](int fd, const std::string&) {
         FakeDaemon::WriteAll(fd, LengthBytes(0xFFFFFFFFu));
         FakeDaemon::WaitForPeerClose(fd, 5000);
       },
       "Orvane error, code=502, reason=[read failed, reason=Message too long]"},
  };
  for (const auto& [handler, error] : cases) {
    FakeDaemon daemon(SockPath(), handler);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(Command("resume"), error);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(3));
  }
}

// Ten interrupted calls are tolerated per transfer (not per call), the eleventh is not; a closed
// peer is read again ten times and then fails.
TEST(BufferTransferTest, InterruptionsAndClosedPeersHaveABudget) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  UniqueFd a(fds[0]), b(fds[1]);
  int interrupts_left = 0;
  int reads = 0;
  bool odd = false;
  // Interrupts every other call, until the budget of the test runs out.
  auto interrupt = [&] {
    odd = !odd;
    if (!odd || interrupts_left == 0) return false;
    --interrupts_left;
    errno = EINTR;
    return true;
  };
  BufferIo io;
  io.write = [&](int fd, const void* buf, size_t size) -> ssize_t {
    return interrupt() ? -1 : write(fd, buf, size);
  };
  io.read = [&](int fd, void* buf, size_t size) -> ssize_t {
    ++reads;
    return interrupt() ? -1 : read(fd, buf, size);
  };
  const BufferIo previous = SetBufferIo(io);
  const std::vector<unsigned char> out(20 * 1024, 'z');
  std::vector<unsigned char> in(out.size());
  interrupts_left = 10;
  BufferWrite(a.get(), out.size(), out.data());
  interrupts_left = 10;
  BufferRead(b.get(), in.size(), in.data());
  EXPECT_EQ(in, out);

  interrupts_left = 11;
  EXPECT_EQ(ErrorText([&] { BufferWrite(a.get(), out.size(), out.data()); }),
            "Orvane error, code=502, reason=[write failed, reason=Interrupted system call]");
  // The 10 KiB that went out before the failure are what the ten reads between the eleven
  // interruptions take, so the read never waits.
  odd = false;
  interrupts_left = 11;
  EXPECT_EQ(ErrorText([&] { BufferRead(b.get(), in.size(), in.data()); }),
            "Orvane error, code=502, reason=[read failed, reason=Interrupted system call]");

  // A peer that sends "ab" and closes.
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  a.Reset(fds[0]);
  b.Reset(fds[1]);
  ASSERT_EQ(write(a.get(), "ab", 2), 2);
  a.Reset();
  reads = 0;
  unsigned char buf[4];
  EXPECT_EQ(ErrorText([&] { BufferRead(b.get(), sizeof(buf), buf); }),
            "Orvane error, code=502, reason=[read failed, reason=Connection reset by peer]");
  EXPECT_EQ(reads, 12);  // the two bytes, the first end of stream and ten more tries
  EXPECT_EQ(std::string(buf, buf + 2), "ab");
  SetBufferIo(previous);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
