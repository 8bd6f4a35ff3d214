#include "fileindex/communication.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

using test::FakeDaemon;
using ::testing::ElementsAre;

class CommandChannelTest : public ::testing::Test {
 protected:
  CommandChannelTest() : root_(dir_.path()) {}
  std::string SockPath() const { return dir_.Path("var/run/fileindexd.sock"); }

  // Runs SendCommandToDaemon and returns the text of the Error it throws.
  std::string CommandError(const std::string& cmd, const Json::Value& data) {
    try {
      SendCommandToDaemon(cmd, data);
    } catch (const Error& e) {
      EXPECT_EQ(e.code, kErrSystem);
      return e.what();
    }
    ADD_FAILURE() << "no Error";
    return "";
  }

  test::TempDir dir_;
  test::ScopedRoot root_;
  test::FakeEnv env_;
};

std::string LengthBytes(uint32_t length) {
  return std::string(reinterpret_cast<const char*>(&length), sizeof(length));
}

TEST_F(CommandChannelTest, CommandIsOneFrameOfJsonTextAndNul) {
  FakeDaemon daemon(SockPath(), FakeDaemon::Replies({"", std::string(5000, 'r')}));
  Json::Value data;
  data["share_name"] = "photo \"x\"\n\xC3\xA9\xFF";
  data["is_upsert"] = true;
  SendCommandToDaemon("notify_setting_changed", data);
  SendCommandToDaemon("resume", Json::Value());

  const std::vector<std::string> frames = daemon.raw_frames();
  ASSERT_EQ(frames.size(), 2u);
  const std::string resume_text = R"({"data":null,"type":"resume"})";
  EXPECT_EQ(frames[1], LengthBytes(resume_text.size() + 1) + resume_text + std::string(1, '\0'));
  const std::vector<Json::Value> sent = daemon.json_requests();
  EXPECT_EQ(sent[0]["type"].asString(), "notify_setting_changed");
  EXPECT_EQ(sent[0]["data"], data);  // every byte of the share name survives
  EXPECT_EQ(frames[0].substr(0, 4), LengthBytes(frames[0].size() - 4));
  EXPECT_EQ(frames[0].back(), '\0');
  EXPECT_TRUE(env_.sleeps().empty());

  struct sigaction action;
  ASSERT_EQ(sigaction(SIGPIPE, nullptr, &action), 0);
  EXPECT_EQ(action.sa_handler, SIG_IGN);
}

TEST_F(CommandChannelTest, MissingSocketIsTriedFiveTimesThenTheWriteFails) {
  const std::string text = CommandError("worker_create", Json::Value());
  EXPECT_THAT(text, ::testing::StartsWith("Orvane error, code=502, reason=[write failed, reason="));
  EXPECT_EQ(env_.sleeps(), std::vector<int64_t>(4, 1000000));
}

TEST_F(CommandChannelTest, StaleSocketFileIsNotWaitedFor) {
  // A socket file that nobody listens on (a daemon that died) refuses at once.
  MakeParentDirs(SockPath());
  {
    UniqueFd fd(socket(AF_UNIX, SOCK_STREAM, 0));
    struct sockaddr_un addr;
    std::memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    std::strcpy(addr.sun_path, SockPath().c_str());
    ASSERT_EQ(bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  }
  EXPECT_THAT(CommandError("pause", Json::Value()),
              ::testing::StartsWith("Orvane error, code=502, reason=[write failed, reason="));
  EXPECT_TRUE(env_.sleeps().empty());
}

TEST_F(CommandChannelTest, BrokenRepliesFailQuicklyWithoutAllocatingTheAnnouncedSize) {
  struct Case {
    FakeDaemon::Handler handler;
    std::string error;
  };
  const std::vector<Case> cases = {
      {[](int, const std::string&) {},
       "Orvane error, code=502, reason=[read failed, reason=Connection reset by peer]"},
      {[](int fd, const std::string&) { FakeDaemon::WriteAll(fd, LengthBytes(100) + "abc"); },
       "Orvane error, code=502, reason=[read failed, reason=Connection reset by peer]"},
      {[](int fd, const std::string&) {
         FakeDaemon::WriteAll(fd, LengthBytes(0xFFFFFFFFu));
         FakeDaemon::WaitForPeerClose(fd, 5000);
       },
       "Orvane error, code=502, reason=[read failed, reason=Message too long]"},
  };
  for (const Case& c : cases) {
    FakeDaemon daemon(SockPath(), c.handler);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(CommandError("resume", Json::Value()), c.error);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(3));
  }
}

TEST(BufferTransferTest, WritesGoOutInChunksOf1024) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_SEQPACKET, 0, fds), 0);
  UniqueFd writer(fds[0]), reader(fds[1]);
  std::vector<unsigned char> payload(3000);
  for (size_t i = 0; i < payload.size(); ++i) payload[i] = static_cast<unsigned char>(i * 7);
  BufferWrite(writer.get(), 3000, payload.data());
  BufferWrite(writer.get(), 0, nullptr);
  writer.Reset();

  std::vector<size_t> records;
  std::vector<unsigned char> received;
  unsigned char buf[4096];
  for (ssize_t n; (n = read(reader.get(), buf, sizeof(buf))) > 0;) {
    records.push_back(static_cast<size_t>(n));
    received.insert(received.end(), buf, buf + n);
  }
  EXPECT_THAT(records, ElementsAre(1024, 1024, 952));
  EXPECT_EQ(received, payload);
}

TEST(BufferTransferTest, TenInterruptionsPerTransferAreToleratedNotEleven) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  UniqueFd a(fds[0]), b(fds[1]);
  int interrupts_left = 0;
  // Interrupts every other call, until the budget of the test runs out.
  bool odd = false;
  BufferIo io;
  io.write = [&](int fd, const void* buf, size_t size) -> ssize_t {
    odd = !odd;
    if (odd && interrupts_left > 0) {
      --interrupts_left;
      errno = EINTR;
      return -1;
    }
    return write(fd, buf, size);
  };
  io.read = [&](int fd, void* buf, size_t size) -> ssize_t {
    odd = !odd;
    if (odd && interrupts_left > 0) {
      --interrupts_left;
      errno = EINTR;
      return -1;
    }
    return read(fd, buf, size);
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
  try {
    BufferWrite(a.get(), out.size(), out.data());
    ADD_FAILURE() << "the eleventh interruption was retried";
  } catch (const Error& e) {
    EXPECT_STREQ(e.what(),
                 "Orvane error, code=502, reason=[write failed, reason=Interrupted system call]");
  }
  std::vector<unsigned char> drain(10 * 1024);  // what went out before the failure
  BufferRead(b.get(), drain.size(), drain.data());
  interrupts_left = 0;
  BufferWrite(a.get(), out.size(), out.data());
  interrupts_left = 11;
  EXPECT_THROW(BufferRead(b.get(), in.size(), in.data()), Error);
  SetBufferIo(previous);
}

TEST(BufferTransferTest, ReadFromAClosedPeerEndsAfterAFewTries) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  UniqueFd a(fds[0]), b(fds[1]);
  ASSERT_EQ(write(a.get(), "ab", 2), 2);
  a.Reset();
  int reads = 0;
  BufferIo io;
  io.read = [&](int fd, void* buf, size_t size) {
    ++reads;
    return read(fd, buf, size);
  };
  const BufferIo previous = SetBufferIo(io);
  unsigned char buf[4];
  try {
    BufferRead(b.get(), sizeof(buf), buf);
    ADD_FAILURE() << "no Error";
  } catch (const Error& e) {
    EXPECT_STREQ(e.what(),
                 "Orvane error, code=502, reason=[read failed, reason=Connection reset by peer]");
  }
  EXPECT_EQ(reads, 12);  // the two bytes, the first end of stream and ten more tries
  EXPECT_EQ(std::string(buf, buf + 2), "ab");
  SetBufferIo(previous);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
