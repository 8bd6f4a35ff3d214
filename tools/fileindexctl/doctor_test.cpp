#include "tools/fileindexctl/doctor.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "test/daemon_system.hpp"
#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace ctl {
namespace {

using fileindexd::test::RunningSystemTest;
using fileindexd::test::System;
using ::testing::HasSubstr;

// The message of the first finding of `check` at `level`; "" when there is none.
std::string Finding(const Json::Value& diagnosis, const std::string& check,
                    const std::string& level) {
  for (const Json::Value& f : diagnosis["findings"]) {
    if (f["check"].asString() == check && f["level"].asString() == level) {
      return f["message"].asString() + " | " + f["action"].asString();
    }
  }
  return "";
}

class DoctorTest : public RunningSystemTest {
 protected:
  DoctorTest() : RunningSystemTest({"docs"}) {}

  test::ProgramResult Ctl(const std::vector<std::string>& args) {
    return test::RunProgram(FILEINDEXCTL_BIN, args, sys_.root());
  }
};

// A share that only Samba's file names is indexed and searched; then the doctor, all well at
// first, finds a stopped daemon and a vanished folder, each with what to do.
TEST_F(DoctorTest, SambaShareIsIndexedThenStoppedDaemonAndMissingFolderAreFound) {
  test::WriteFile(sys_.Vol("docs/reports/q3 summary.txt"), "quarterly figures\n");
  test::WriteFile(sys_.root() + "/etc/samba/smb.conf",
                  "[global]\n  workgroup = WG\n  spotlight = yes\n[Docs]\n  path = " + sys_.Vol("docs") +
                      "\n  read only = yes\n[scratch]\n  path = /tmp/%U\n");
  test::WriteFile(sys_.root() + "/etc/orvane/fileindex.conf", "admin_group = root\n");
  ASSERT_EQ(unlink((sys_.root() + "/etc/orvane/platform.json").c_str()), 0);

  const test::ProgramResult add = Ctl({"folder", "add", "/docs", "--document", "on"});
  ASSERT_EQ(add.status, 0) << add.err;
  ASSERT_EQ(Ctl({"status", "--wait", "--timeout", "120"}).status, 0);
  EXPECT_THAT(Ctl({"search", "--name", "summary"}).out, HasSubstr("q3 summary.txt"));

  const test::ProgramResult well = Ctl({"doctor"});
  EXPECT_EQ(well.status, 0) << well.out << well.err;
  EXPECT_THAT(well.out, HasSubstr("note     shares: " + sys_.root() +
                                  "/etc/samba/smb.conf:8: share [scratch]: path /tmp/%U depends"));
  EXPECT_THAT(well.out, HasSubstr("ok       shares: 1 share(s) from " + sys_.root()));
  EXPECT_THAT(well.out, HasSubstr("\nnothing stops indexing\n"));

  ASSERT_GE(notifyd_->Signal(SIGTERM), 0);
  const test::ProgramResult down = Ctl({"doctor"});
  EXPECT_EQ(down.status, 1);
  EXPECT_THAT(down.out, HasSubstr("PROBLEM  daemons: quixnotifyd does not answer: no running "
                                  "process in " + sys_.root() + "/var/run/quixnotifyd.pid"));
  EXPECT_THAT(down.out, HasSubstr("\n         what to do: start it (systemctl start quixnotifyd)"));

  ASSERT_EQ(rename(sys_.Vol("docs").c_str(), sys_.Vol("moved").c_str()), 0);
  const test::ProgramResult gone = Ctl({"--json", "doctor"});
  EXPECT_EQ(gone.status, 1);
  Json::Value diagnosis;
  std::string errors;
  ASSERT_TRUE(JsonParseChecked(gone.out, &diagnosis, &errors)) << gone.out;
  EXPECT_FALSE(diagnosis["ok"].asBool());
  EXPECT_EQ(Finding(diagnosis, "folders", "problem"),
            "indexed folder /docs (" + sys_.Vol("docs") + ") is missing: No such file or "
            "directory | mount or restore it, or stop indexing it: fileindexctl folder delete /docs");
}

// The watch limit and the free space come through the platform seam, as a real limit cannot be
// lowered nor a volume filled here without disturbing the machine.
TEST(DoctorSeamTest, WatchLimitAndFreeSpaceAreJudgedAgainstTheIndexedTrees) {
  System sys({"docs"});
  for (int i = 0; i < 5; ++i) MakeParentDirs(sys.Vol("docs/d" + std::to_string(i) + "/sub/x"));
  MakeParentDirs(sys.Vol("docs/@eaDir/@fileindex/x"));  // the system's own: never watched
  sys.WriteFolders({System::Folder("/docs", false), System::Folder("/docs/d0", false)});
  test::WriteFile(RootedPath("/var/packages/Orvane/etc/fileindex.status"), R"({"share": {}})");

  const struct {
    int limit;
    const char* level;
    const char* text;
  } cases[] = {
      {8, "problem", "the indexed trees hold more than 8 folders, more than"},
      {12, "note", "the indexed trees hold 11 folders, close to fs.inotify.max_user_watches (12)"},
      {1000, "ok", "11 folder(s) to watch, limit 1000"},
  };
  for (const auto& c : cases) {
    platform::ScopedFaults faults;
    faults.Arm("InotifyMaxUserWatches", platform::Fault{0, 0, 0, c.limit, true}, 0, -1);
    const Json::Value diagnosis = Diagnose();
    EXPECT_THAT(Finding(diagnosis, "watches", c.level), HasSubstr(c.text)) << c.limit;
  }

  EXPECT_EQ(Finding(Diagnose(), "space", "ok"), "every indexed share's volume has room | ");
  platform::ScopedFaults faults;
  faults.Arm("QUIXQuotaIsEnough", platform::Fault{0, ENOSPC, 0, 0, false}, 0, -1);
  const Json::Value full = Diagnose();
  EXPECT_FALSE(full["ok"].asBool());
  EXPECT_THAT(Finding(full, "space", "problem"),
              HasSubstr("share docs (its files and its index): the volume of " + sys.Vol("docs") +
                        " has "));
  EXPECT_THAT(Finding(full, "space", "problem"), HasSubstr("free, less than 100.0 MiB | free space"));
}

}  // namespace
}  // namespace ctl
}  // namespace orvane
