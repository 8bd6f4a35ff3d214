#include "fileindex/status_mgr.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "fileindex/notify.hpp"
#include "test/admin_env.hpp"

namespace orvane {
namespace fileindex {
namespace {

using testenv::ErrorOf;

class StatusMgrTest : public testenv::AdminTestEnv {
 protected:
  std::string StatusPath() const { return Rooted(kFileIndexStatusCfgPath); }
  void ReplaceStatus(const std::string& text) { ReplaceFile(StatusPath(), text); }
};

TEST_F(StatusMgrTest, MissingDamagedOrMisshapenFilesAreRefusedAndLeftAlone) {
  StatusMgr none;
  for (auto fn : std::vector<std::function<void()>>{
           [&] { none.GetPauseInfo(); }, [&] { none.GetShareStatus("photo"); },
           [&] { none.SetShareStatus("photo", 1); }, [&] { none.ClearShareStatus("photo"); }}) {
    EXPECT_EQ(ErrorOf(fn).message, "Orvane error, code=120, reason=[Not an object, data=null]");
  }
  EXPECT_FALSE(IsFileExist(StatusPath()));

  for (const std::string text : {"{\"share\": {", "{} {}"}) {
    ReplaceStatus(text);
    EXPECT_EQ(ErrorOf([] { StatusMgr status; }).message,
              "Orvane error, code=504, reason=[Cannot load json: " + StatusPath() + "]")
        << text;
    EXPECT_EQ(test::ReadFile(StatusPath()), text);
  }

  // Parsable but no object: refused too, and never replaced by the creation.
  ReplaceStatus("[1, 2]\n");
  StatusMgr::CreateIfMissing();
  StatusMgr array;
  EXPECT_EQ(ErrorOf([&] { array.SetShareStatus("photo", 1); }).code, kErrInvalidParam);
  EXPECT_EQ(test::ReadFile(StatusPath()), "[1, 2]\n");
}

TEST_F(StatusMgrTest, ShareFlagsAccumulateClearPersistAndFailToSaveWith505) {
  StatusMgr::CreateIfMissing();
  EXPECT_EQ(ReadJson(StatusPath()), Parse(R"({"share": {}})"));
  ASSERT_TRUE(JsonValue(Parse(R"({"resume_time": 0, "share": {"photo": 2, "ro": 8}})"))
                  .toFile(StatusPath()));
  ASSERT_EQ(chmod(StatusPath().c_str(), 0600), 0);
  StatusMgr().SetShareStatus("photo", 1);
  StatusMgr().SetShareStatus("photo", 1);
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 3);
  StatusMgr().UnsetShareStatus("photo", 2);
  StatusMgr().UnsetShareStatus("music", 4);  // unknown share: kept with 0
  EXPECT_EQ(ReadJson(StatusPath()),
            Parse(R"({"resume_time": 0, "share": {"photo": 1, "ro": 8, "music": 0}})"));
  struct stat st;
  ASSERT_EQ(stat(StatusPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  StatusMgr status;
  status.ClearShareStatus("photo");
  EXPECT_FALSE(StatusMgr().data()["share"].isMember("photo"));

  // A folder in the file's place cannot be replaced by the rename.
  ASSERT_EQ(unlink(StatusPath().c_str()), 0);
  ASSERT_EQ(mkdir(StatusPath().c_str(), 0755), 0);
  EXPECT_EQ(ErrorOf([&] { status.SetShareStatus("photo", 1); }).message,
            "Orvane error, code=505, reason=[Failed to save json: " + StatusPath() + "]");
  EXPECT_TRUE(IsDirExist(StatusPath(), false));
}

TEST_F(StatusMgrTest, PauseAndResumeTellTheIndexingDaemon) {
  StartDaemons();
  test::FakeEnv env;
  const long long now = env.Now();
  StatusMgr::CreateIfMissing();
  StatusMgr().SetShareStatus("photo", 2);
  StatusMgr().Pause(2);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), now + 7200);
  StatusMgr().Pause(0);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), 0);
  StatusMgr().Resume();
  StatusMgr().Resume();  // not paused: written and told again
  EXPECT_EQ(ReadJson(StatusPath()), Parse(R"({"resume_time": -1, "share": {"photo": 2}})"));
  EXPECT_EQ(IndexdCommands(),
            (std::vector<std::string>{
                R"({"data":{"resume_time":)" + std::to_string(now + 7200) + R"(},"type":"pause"})",
                R"({"data":{"resume_time":0},"type":"pause"})", R"({"data":null,"type":"resume"})",
                R"({"data":null,"type":"resume"})"}));

  // A negative length changes nothing and tells nobody.
  const std::string before = test::ReadFile(StatusPath());
  EXPECT_EQ(ErrorOf([] { StatusMgr().Pause(-1); }).message,
            "Orvane error, code=120, reason=[Pause length should NOT be negative]");
  EXPECT_EQ(test::ReadFile(StatusPath()), before);
  EXPECT_EQ(IndexdCommands().size(), 4u);

  // The resume time wraps in 32 bits the way it always has.
  env.Advance((0x7FFFFFFFLL - now - 1800) * 1000000);
  StatusMgr().Pause(1);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), 0x7FFFFFFFLL + 1800 - 0x100000000LL);

  // With the daemon gone, the new state stays on disk and the failure reaches the caller.
  indexd_.reset();
  EXPECT_EQ(ErrorOf([] { StatusMgr().Pause(0); }).code, kErrSystem);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), 0);
}

// The memory notification's arguments are checked with the engine channel that sends it.
TEST_F(StatusMgrTest, NoSpaceNotificationRunsTheNotifierWithItsArguments) {
  const std::string notifier = root_.Write(
      "usr/libexec/fileindex/quixzrmnotify",
      "#!/bin/sh\nfor a in \"$@\"; do printf '[%s]' \"$a\"; done >> \"$(dirname \"$0\")/calls\"\n"
      "echo >> \"$(dirname \"$0\")/calls\"\n");
  ASSERT_EQ(chmod(notifier.c_str(), 0755), 0);
  SendZRMNotify();
  EXPECT_EQ(test::ReadFile(root_.Path("usr/libexec/fileindex/calls")),
            "[-c][QUIX.Orvane.Application][-b][true][-e][false][@administrators]"
            "[app:displayname][error:index_no_space]"
            "[<a data-quix-app=\"QUIX.Orvane.Application\" data-quix-fn=\"preference\">][</a>]\n");
  // A missing notifier is no error, and leaves nothing in errno for the caller's next log line.
  unlink(notifier.c_str());
  errno = 0;
  SendZRMNotify();
  NotifyLackOfMemory();
  EXPECT_EQ(errno, 0);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
