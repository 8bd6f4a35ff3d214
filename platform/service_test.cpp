#include "platform/service.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "platform/notifier.hpp"
#include "platform/platform_error.hpp"
#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

TEST(PlatformExeclTest, RunsProgramsWithoutAShell) {
  test::TempDir dir;
  const std::string out = dir.Path("out");
  EXPECT_EQ(QLIBCExecl("/bin/sh", QLIBC_EXEC_WAIT, "-c", "printf '%s|' \"$@\" > \"$0\"",
                       out.c_str(), "a b", "$HOME", "*", nullptr),
            0);
  EXPECT_EQ(test::ReadFile(out), "a b|$HOME|*|");
  EXPECT_EQ(QLIBCExecl("/bin/sh", QLIBC_EXEC_WAIT, "-c", "exit 3", nullptr), 3);
  EXPECT_EQ(QLIBCExecl("/bin/sh", QLIBC_EXEC_WAIT, "-c", "kill -9 $$", nullptr), 128 + 9);
  EXPECT_EQ(QLIBCExecl(dir.Path("missing").c_str(), QLIBC_EXEC_WAIT, nullptr), -1);
  EXPECT_EQ(errno, ENOENT);

  // An inheritable descriptor reaches the child unless the flags close it.
  const int fd = open(dir.Path("f").c_str(), O_CREAT | O_WRONLY, 0644);
  ASSERT_GE(fd, 0);
  const std::string probe = "test -e /proc/self/fd/" + std::to_string(fd);
  EXPECT_EQ(QLIBCExecl("/bin/sh", QLIBC_EXEC_WAIT, "-c", probe.c_str(), nullptr), 0);
  EXPECT_EQ(QLIBCExecl("/bin/sh", 187, "-c", probe.c_str(), nullptr), 1);
  close(fd);
}

class PlatformServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    log_ = dir_.Path("actions");
    const std::string record = R"(["/bin/sh", "-c", "echo $0 >> )" + log_ + R"(", )";
    test::WritePlatformConfig(root_.path(), R"({"samba_conf": ")" + dir_.Path("smb.conf") +
                                                R"(", "services": {
      "quixcontentextractd": {"start": )" + record +
                                                R"("start-ce"]},
      "pkg-Orvane-fileindexd": {"start": )" + record +
                                                R"("start-fi"], "stop": )" + record +
                                                R"("stop-fi"]},
      "samba": {"start": )" + record + R"("start-smb"], "restart": ["/bin/false"]}
    }})");
  }

  test::TempDir root_;
  test::ScopedRoot scoped_{root_.path()};
  test::TempDir dir_;
  std::string log_;
};

// The order a daemon's services are driven in is checked with the configuration that drives it.
TEST_F(PlatformServiceTest, ConfiguredCommandsWithoutSystemd) {
  EXPECT_EQ(QLIBServiceRestart("pkg-Orvane-fileindexd"), 0);  // no restart command: stop, start
  EXPECT_EQ(test::ReadFile(log_), "stop-fi\nstart-fi\n");
  EXPECT_EQ(QLIBServiceRestart("samba"), -1);  // its restart command fails
  EXPECT_EQ(QLIBCErrGet(), kQErrSystem);
  EXPECT_EQ(QLIBServicectlStop("quixcontentextractd", 0), -1);  // no stop command
  EXPECT_EQ(QLIBCErrGet(), kQErrNotSupported);
  EXPECT_EQ(QLIBServiceStart("unknown", TRUE), -1);
  EXPECT_EQ(errno, ENOENT);
}

// systemd does not run on this machine; a script in systemctl's place under the root stands in
// for it and records how it was called.
TEST_F(PlatformServiceTest, SystemctlWhenSystemdRuns) {
  ASSERT_TRUE(MakeParentDirs(root_.path() + "/run/systemd/system/x"));
  const std::string systemctl = root_.Write(
      "usr/bin/systemctl", "#!/bin/sh\necho \"$@\" >> " + log_ + "\n[ \"$2\" != bad ]\n");
  ASSERT_EQ(chmod(systemctl.c_str(), 0755), 0);
  EXPECT_EQ(QLIBServicectlStart("pkg-Orvane-fileindexd", QLIB_SERVICECTL_UPSTART), 0);
  EXPECT_EQ(QLIBServiceRestart("samba"), 0);
  EXPECT_EQ(QLIBServicectlStop("bad", 0), -1);
  EXPECT_EQ(test::ReadFile(log_), "start pkg-Orvane-fileindexd\nrestart samba\nstop bad\n");
}

// Switching it on and off in a plain [global] is checked with the configuration that drives it.
TEST_F(PlatformServiceTest, SpotlightSettingOfSamba) {
  // Samba not installed: off, and it cannot be switched on.
  EXPECT_EQ(QUIXSMBIsEnableSpotlight(), 0);
  EXPECT_EQ(QUIXSMBSetSpotlight(1), -1);
  EXPECT_EQ(QLIBCErrGet(), kQErrNotSupported);

  const std::string conf = dir_.Write("smb.conf",
                                      "# spotlight = yes\n[global]\n\tworkgroup = WG\n"
                                      "[music]\n\tspotlight = yes\n");
  ASSERT_EQ(chmod(conf.c_str(), 0640), 0);
  EXPECT_EQ(QUIXSMBIsEnableSpotlight(), 0);  // only [global] counts
  EXPECT_EQ(QUIXSMBSetSpotlight(1), 0);
  EXPECT_EQ(test::ReadFile(conf),
            "# spotlight = yes\n[global]\n\tspotlight = yes\n\tworkgroup = WG\n"
            "[music]\n\tspotlight = yes\n");
  struct stat st;
  ASSERT_EQ(stat(conf.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);

  dir_.Write("smb.conf", "[ Global ]\n  Spot Light = True\n");
  EXPECT_EQ(QUIXSMBIsEnableSpotlight(), 1);
  dir_.Write("smb.conf", "[homes]\n");
  EXPECT_EQ(QUIXSMBSetSpotlight(1), 0);
  EXPECT_EQ(test::ReadFile(conf), "[global]\n\tspotlight = yes\n[homes]\n");
}

// The arguments the daemons pass are checked with a stand-in notifier where they are sent.
TEST_F(PlatformServiceTest, NotifierProgramRecordsNotifications) {
  const std::string notifier = RootedPathForWrite(kNotifierPath);
  ASSERT_EQ(symlink(QUIXZRMNOTIFY_BINARY, notifier.c_str()), 0);
  EXPECT_EQ(QLIBCExecl(notifier.c_str(), 187, "-c", "QUIX.Orvane.Application", "-b", "true",
                       "@administrators", "app:displayname", "error:index_no_space", "<a>", "</a>",
                       nullptr),
            0);
  EXPECT_EQ(QLIBCExecl(notifier.c_str(), 187, "-c", nullptr), 2);
  std::vector<Json::Value> all = ReadNotifications();
  ASSERT_EQ(all.size(), 1u);
  EXPECT_TRUE(all[0]["time"].isIntegral());
  all[0].removeMember("time");
  EXPECT_EQ(
      JsonToString(all[0]),
      R"({"app":"QUIX.Orvane.Application","args":["<a>","</a>"],"b":"true",)"
      R"("message":"error:index_no_space","title":"app:displayname","to":"@administrators"})");
}

}  // namespace
}  // namespace platform
}  // namespace orvane
