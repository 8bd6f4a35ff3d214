#include "fileindex/status_mgr.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "fileindex/admin_test_env.hpp"
#include "fileindex/notify.hpp"

namespace orvane {
namespace fileindex {
namespace {

using testenv::ErrorOf;

class StatusMgrTest : public testenv::AdminTestEnv {
 protected:
  std::string StatusPath() const { return Rooted(kFileIndexStatusCfgPath); }
};

TEST_F(StatusMgrTest, NoFileRefusesQuestionsUntilCreated) {
  StatusMgr empty;
  EXPECT_TRUE(empty.data().isNull());
  for (auto fn : std::vector<std::function<void()>>{
           [&] { empty.GetPauseInfo(); }, [&] { empty.GetShareStatus("photo"); },
           [&] { empty.SetShareStatus("photo", 1); }, [&] { empty.ClearShareStatus("photo"); }}) {
    const Error e = ErrorOf(fn);
    EXPECT_EQ(e.code, kErrInvalidParam);
    EXPECT_EQ(e.message, "Orvane error, code=120, reason=[Not an object, data=null]");
  }
  EXPECT_FALSE(IsFileExist(StatusPath()));

  StatusMgr::CreateIfMissing();
  struct stat st;
  ASSERT_EQ(stat(StatusPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_EQ(ReadJson(StatusPath()), Parse(R"({"share": {}})"));
  StatusMgr status;
  EXPECT_EQ(status.GetPauseInfo(), -1);
  EXPECT_EQ(status.GetShareStatus("photo"), 0);

  // An existing file is never replaced.
  ASSERT_TRUE(JsonValue(Parse(R"({"resume_time": 0, "share": {"a": 4}})")).toFile(StatusPath()));
  StatusMgr::CreateIfMissing();
  EXPECT_EQ(StatusMgr().GetShareStatus("a"), 4);
}

TEST_F(StatusMgrTest, ShareFlagsAccumulateClearAndPersist) {
  StatusMgr::CreateIfMissing();
  StatusMgr().SetShareStatus("photo", 1);
  StatusMgr().SetShareStatus("photo", 2);
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 3);
  StatusMgr().UnsetShareStatus("photo", 1);
  StatusMgr().UnsetShareStatus("music", 4);  // unknown share: kept with 0
  EXPECT_EQ(ReadJson(StatusPath()), Parse(R"({"share": {"photo": 2, "music": 0}})"));
  StatusMgr().ClearShareStatus("photo");
  StatusMgr after;
  EXPECT_EQ(after.GetShareStatus("photo"), 0);
  EXPECT_FALSE(after.data()["share"].isMember("photo"));
  EXPECT_TRUE(after.data()["share"].isMember("music"));

  // Each writer changes the document it loaded: a stale manager overwrites a newer flag.
  StatusMgr stale;
  StatusMgr().SetShareStatus("photo", 1);
  stale.SetShareStatus("music", 8);
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 0);
  EXPECT_EQ(StatusMgr().GetShareStatus("music"), 8);
}

TEST_F(StatusMgrTest, DamagedFilesAreRefusedAndLeftAlone) {
  test::LogCapture log;
  for (const std::string text : {"", "{\"share\": {", "not json", "{} {}"}) {
    ASSERT_TRUE(MakeParentDirs(StatusPath()));
    volume_.Write("status", text);
    ASSERT_EQ(rename(volume_.Path("status").c_str(), StatusPath().c_str()), 0);
    const Error e = ErrorOf([] { StatusMgr status; });
    EXPECT_EQ(e.code, kErrLoadConfig) << text;
    EXPECT_EQ(e.message, "Orvane error, code=504, reason=[Cannot load json: " + StatusPath() + "]");
    EXPECT_EQ(test::ReadFile(StatusPath()), text);
  }
  EXPECT_TRUE(log.Contains(
      "Failed [IsFileExist(kFileIndexStatusCfgPath) && !data_.fromFile(kFileIndexStatusCfgPath)]"));

  // Parsable but of the wrong shape: questions fail with 120, odd member types read as unset.
  const std::string array_text = "[1, 2]\n";
  volume_.Write("status", array_text);
  ASSERT_EQ(rename(volume_.Path("status").c_str(), StatusPath().c_str()), 0);
  StatusMgr array;
  EXPECT_EQ(ErrorOf([&] { array.GetPauseInfo(); }).code, kErrInvalidParam);
  EXPECT_EQ(ErrorOf([&] { array.GetShareStatus("photo"); }).code, kErrInvalidParam);
  EXPECT_EQ(ErrorOf([&] { array.SetShareStatus("photo", 1); }).code, kErrInvalidParam);
  EXPECT_EQ(test::ReadFile(StatusPath()), array_text);

  ASSERT_TRUE(JsonValue(Parse(R"({"resume_time": "soon", "share": {"photo": "x", "music": -3}})"))
                  .toFile(StatusPath()));
  StatusMgr odd;
  EXPECT_EQ(odd.GetPauseInfo(), -1);
  EXPECT_EQ(odd.GetShareStatus("photo"), 0);
  EXPECT_EQ(odd.GetShareStatus("music"), -3);
  odd.SetShareStatus("music", 1);  // -3 is no unsigned number: read as 0
  EXPECT_EQ(StatusMgr().GetShareStatus("music"), 1);
}

TEST_F(StatusMgrTest, SaveFailureIs505AndKeepsTheOldFile) {
  StatusMgr::CreateIfMissing();
  StatusMgr status;
  // A folder in the file's place cannot be replaced by the rename.
  ASSERT_EQ(unlink(StatusPath().c_str()), 0);
  ASSERT_EQ(mkdir(StatusPath().c_str(), 0755), 0);
  test::LogCapture log;
  const Error e = ErrorOf([&] { status.SetShareStatus("photo", 1); });
  EXPECT_EQ(e.code, kErrSaveConfig);
  EXPECT_EQ(e.message,
            "Orvane error, code=505, reason=[Failed to save json: " + StatusPath() + "]");
  EXPECT_TRUE(log.Contains("status_mgr.cpp"));
  EXPECT_TRUE(log.Contains("Failed [!data_.toFile(kFileIndexStatusCfgPath)]"));
  EXPECT_TRUE(IsDirExist(StatusPath(), false));
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane

namespace orvane {
namespace fileindex {
namespace {

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
  test::LogCapture log;
  const std::string before = test::ReadFile(StatusPath());
  const Error e = ErrorOf([] { StatusMgr().Pause(-1); });
  EXPECT_EQ(e.message, "Orvane error, code=120, reason=[Pause length should NOT be negative]");
  EXPECT_TRUE(log.Contains("status_mgr.cpp"));
  EXPECT_EQ(test::ReadFile(StatusPath()), before);
  EXPECT_EQ(IndexdCommands().size(), 4u);

  // The resume time wraps in 32 bits the way it always has.
  env.Advance((0x7FFFFFFFLL - now - 1800) * 1000000);
  StatusMgr().Pause(1);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), 0x7FFFFFFFLL + 1800 - 0x100000000LL);

  // With the daemon gone, the new state stays on disk and the failure reaches the caller.
  indexd_.reset();
  const Error down = ErrorOf([] { StatusMgr().Pause(0); });
  EXPECT_EQ(down.code, kErrSystem);
  EXPECT_EQ(StatusMgr().GetPauseInfo(), 0);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane

namespace orvane {
namespace fileindex {
namespace {

using ::testing::HasSubstr;

class StatusFileTest : public ::testing::Test {
 protected:
  StatusFileTest() : root_(dir_.path()) {}
  std::string StatusPath() const { return dir_.Path("var/packages/Orvane/etc/fileindex.status"); }
  Json::Value StatusFile() const {
    JsonValue value;
    EXPECT_TRUE(value.fromFile(StatusPath()));
    return value;
  }

  test::TempDir dir_;
  test::ScopedRoot root_;
};

TEST_F(StatusFileTest, SetShareStatusAddsBitsAndKeepsTheRest) {
  dir_.Write("var/packages/Orvane/etc/fileindex.status",
             R"({"resume_time": 0, "share": {"photo": 2, "music": 8}})");
  chmod(StatusPath().c_str(), 0600);
  StatusMgr status;
  EXPECT_EQ(status.GetShareStatus("photo"), 2);
  EXPECT_EQ(status.GetShareStatus("none"), 0);
  status.SetShareStatus("photo", 1);
  status.SetShareStatus("new share", 1);
  status.SetShareStatus("photo", 1);
  EXPECT_EQ(status.GetShareStatus("photo"), 3);

  const Json::Value saved = StatusFile();
  EXPECT_EQ(saved["resume_time"].asInt(), 0);
  EXPECT_EQ(saved["share"]["photo"].asUInt(), 3u);
  EXPECT_EQ(saved["share"]["music"].asUInt(), 8u);
  EXPECT_EQ(saved["share"]["new share"].asUInt(), 1u);
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 3);
  struct stat st;
  ASSERT_EQ(stat(StatusPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_TRUE(IsFileExist(dir_.Path("tmp/orvane_cfg_fi_status.lock")));
}

TEST_F(StatusFileTest, MissingOrMalformedFile) {
  // No file, or one without a "share" object: flags cannot be read or set, nothing is written.
  for (const char* text : {"", R"({"resume_time": -1})"}) {
    if (text[0] != '\0') dir_.Write("var/packages/Orvane/etc/fileindex.status", text);
    StatusMgr status;
    try {
      status.SetShareStatus("photo", 1);
      ADD_FAILURE() << "no Error";
    } catch (const Error& e) {
      EXPECT_EQ(e.code, kErrInvalidParam);
      EXPECT_THAT(e.what(), HasSubstr("Not an object, data=null"));
    }
    EXPECT_THROW(status.GetShareStatus("photo"), Error);
    EXPECT_EQ(test::ReadFile(StatusPath()), text);
  }

  dir_.Write("var/packages/Orvane/etc/fileindex.status", "{\"share\": ");
  test::LogCapture log;
  try {
    StatusMgr status;
    ADD_FAILURE() << "no Error";
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrLoadConfig);
    EXPECT_EQ(std::string(e.what()),
              "Orvane error, code=504, reason=[Cannot load json: " + StatusPath() + "]");
  }
  EXPECT_TRUE(
      log.Contains("Failed [IsFileExist(kFileIndexStatusCfgPath) && "
                   "!data_.fromFile(kFileIndexStatusCfgPath)]"));
}

TEST_F(StatusFileTest, NotificationsRunTheNotifierWithTheirArguments) {
  const std::string notifier = dir_.Write(
      "usr/quix/bin/quixzrmnotify",
      "#!/bin/sh\nfor a in \"$@\"; do printf '[%s]' \"$a\"; done >> \"$(dirname \"$0\")/calls\"\n"
      "echo >> \"$(dirname \"$0\")/calls\"\n");
  chmod(notifier.c_str(), 0755);
  SendZRMNotify();
  NotifyLackOfMemory();
  EXPECT_EQ(test::ReadFile(dir_.Path("usr/quix/bin/calls")),
            "[-c][QUIX.Orvane.Application][-b][true][-e][false][@administrators]"
            "[app:displayname][error:index_no_space]"
            "[<a data-quix-app=\"QUIX.Orvane.Application\" data-quix-fn=\"preference\">][</a>]\n"
            "[-c][QUIX.Orvane.Application][@administrators][app:displayname]"
            "[error:lack_of_memory]\n");
  // A missing notifier is no error.
  unlink(notifier.c_str());
  errno = 0;
  NotifyLackOfMemory();
  EXPECT_EQ(errno, 0);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
