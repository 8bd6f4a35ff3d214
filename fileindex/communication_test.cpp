#include "fileindex/communication.hpp"

#include <gmock/gmock.h>
#include <signal.h>

#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/wire.hpp"
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

// The reply only keeps the exchange in step: whatever it holds, the call succeeds.
TEST_F(CommandChannelTest, CommandIsOneFrameOfJsonTextAndNul) {
  const std::string refusal =
      R"({"success":false,"error":{"code":103,"msg":"not permitted"}})" + std::string(1, '\0');
  FakeDaemon daemon(SockPath(), FakeDaemon::Replies({"", refusal, std::string(5000, 'r')}));
  Json::Value data;
  data["share_name"] = "photo \"x\"\n\xC3\xA9\xFF";
  data["is_upsert"] = true;
  SendCommandToDaemon("notify_setting_changed", data);
  EXPECT_EQ(Command("resume"), "");
  EXPECT_EQ(Command("pause"), "");

  const std::vector<std::string> frames = daemon.raw_frames();
  ASSERT_EQ(frames.size(), 3u);
  const std::string resume_text = R"({"data":null,"type":"resume"})";
  EXPECT_EQ(frames[1], wire::EncodeFrame(resume_text + '\0'));
  const std::vector<Json::Value> sent = daemon.json_requests();
  EXPECT_EQ(sent[0]["type"].asString(), "notify_setting_changed");
  EXPECT_EQ(sent[0]["data"], data);  // every byte of the share name survives
  EXPECT_TRUE(env_.sleeps().empty());
  // A daemon that goes away mid-write must fail the call, not kill the caller.
  struct sigaction action;
  ASSERT_EQ(sigaction(SIGPIPE, nullptr, &action), 0);
  EXPECT_EQ(action.sa_handler, SIG_IGN);
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

TEST_F(CommandChannelTest, ADaemonThatClosesWithoutAnsweringFailsTheCall) {
  FakeDaemon daemon(SockPath(), [](int, const std::string&) {});
  EXPECT_EQ(Command("resume"),
            "Orvane error, code=502, reason=[read failed, reason=Connection reset by peer]");
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
