#include "fileindex/status_mgr.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/util.hpp"
#include "fileindex/notify.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

using ::testing::HasSubstr;

class StatusMgrTest : public ::testing::Test {
 protected:
  StatusMgrTest() : root_(dir_.path()) {}
  std::string StatusPath() const { return dir_.Path("var/packages/Orvane/etc/fileindex.status"); }
  Json::Value StatusFile() const {
    JsonValue value;
    EXPECT_TRUE(value.fromFile(StatusPath()));
    return value;
  }

  test::TempDir dir_;
  test::ScopedRoot root_;
};

TEST_F(StatusMgrTest, SetShareStatusAddsBitsAndKeepsTheRest) {
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

TEST_F(StatusMgrTest, MissingOrMalformedFile) {
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
  EXPECT_TRUE(log.Contains("Failed [IsFileExist(kFileIndexStatusCfgPath) && "
                           "!data_.fromFile(kFileIndexStatusCfgPath)]"));
}

TEST_F(StatusMgrTest, NotificationsRunTheNotifierWithTheirArguments) {
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
