// The daemon binary on its real socket: its commands, who may send them, following a queue
// without being told, the pause, re-reading the folder file on SIGHUP, and a clean stop.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/test_system.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/notifyd_cfg.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/queue_file.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindexd {
namespace {

using test::Command;
using test::System;
using test::WaitFor;

std::string CreateLine(const std::string& path) {
  return R"({"event": 64, "is_dir": false, "path": ")" + path + "\"}\n";
}

Json::Value Share(const std::string& name) {
  Json::Value d(Json::objectValue);
  d["share_name"] = name;
  return d;
}

Json::Value Status() { return Command("status", Json::Value())["data"]; }

std::set<std::string> Running() {
  std::set<std::string> shares;
  const Json::Value status = Status();  // a range over a temporary's member would dangle
  for (const auto& s : status["shares"]) shares.insert(s["share"].asString());
  return shares;
}

// The reply to a frame of `payload` behind a length of `length`.
std::string RawFrame(uint32_t length, const std::string& payload) {
  return test::RawCommand(std::string(reinterpret_cast<const char*>(&length), 4) + payload);
}

class DaemonTest : public ::testing::Test {
 protected:
  DaemonTest() : sys_({"docs", "music"}) {}

  void SetUp() override {
    setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
    Json::Value paused = System::Folder("/music", false);
    paused["paused"] = true;
    sys_.WriteFolders({System::Folder("/docs/a", false), paused});
    MakeParentDirs(V("a/x"));
    engine_ = sys_.StartEngine();
    fileindex::elastic::ShareIndexCreate("docs");
  }
  std::string V(const std::string& rel) const { return sys_.Vol("docs/" + rel); }
  bool Indexed(const std::string& rel) const { return sys_.Documents("docs").count(V(rel)) > 0; }
  // Writes a file of the share and queues its creation.
  void Create(const std::string& rel) {
    std::ofstream(V(rel)) << rel;
    ASSERT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), CreateLine(V(rel))));
  }

  System sys_;
  std::unique_ptr<test::ChildProcess> engine_;
};

TEST_F(DaemonTest, FollowsTheQueueAndAnswersItsCommands) {
  // The scratch root must be reachable for another user to reach the socket at all.
  for (const std::string& dir : {sys_.root(), sys_.root() + "/var", sys_.root() + "/var/run"}) {
    MakeParentDirs(dir + "/x");
    chmod(dir.c_str(), 0755);
  }
  auto indexd = sys_.StartIndexd();
  // Only the share whose folders are not all paused has a worker.
  EXPECT_EQ(std::set<std::string>{"docs"}, Running());
  Create("a/one.txt");
  EXPECT_TRUE(WaitFor([&] { return Indexed("a/one.txt"); }, 5000));

  // Paused with no end: the queue waits; resumed: it is drained.
  Json::Value pause(Json::objectValue);
  pause["resume_time"] = 0;
  EXPECT_TRUE(Command("pause", pause)["success"].asBool());
  EXPECT_TRUE(Status()["paused"].asBool());
  Create("a/two.txt");
  EXPECT_FALSE(WaitFor([&] { return Indexed("a/two.txt"); }, 1500));
  EXPECT_EQ(1u, Status()["shares"][0]["queue_length"].asUInt());
  EXPECT_TRUE(Command("resume", Json::Value())["success"].asBool());
  EXPECT_TRUE(WaitFor([&] { return Indexed("a/two.txt"); }, 5000));

  // The pass counts its operations once it has finished, which is after the commit that made
  // the document visible.
  Json::Value report;
  EXPECT_TRUE(
      WaitFor([&] { return (report = Status()["shares"][0])["ops_done"].asUInt() == 2; }, 5000))
      << report;
  EXPECT_EQ("docs", report["share"].asString());
  for (const char* key :
       {"queue_length", "ops_pending", "documents_written", "last_pass", "errors", "paused"}) {
    EXPECT_TRUE(report.isMember(key)) << key;
  }

  // Bad input gets an error reply, never a crash; a frame cut short is closed without one.
  EXPECT_EQ(101, Command("reboot", Json::Value())["error"]["code"].asInt());
  EXPECT_EQ(120, Command("worker_create", Json::Value())["error"]["code"].asInt());
  EXPECT_EQ(120, Command("pause", Json::Value(Json::objectValue))["error"]["code"].asInt());
  EXPECT_NE(std::string::npos, RawFrame(8, "not json").find("\"code\":100"));
  EXPECT_NE(std::string::npos, RawFrame(1u << 30, "").find("104"));
  EXPECT_EQ("", test::RawCommand("ab"));

  // Anyone may ask how it is doing; only root and its own user may control it.
  EXPECT_EQ(1, orvane::test::RunAsUser("nobody", [] {
              return Command("status", Json::Value())["success"].asBool() ? 1 : 0;
            }));
  EXPECT_EQ(103, orvane::test::RunAsUser("nobody", [] {
              return Command("worker_delete", Share("docs"))["error"]["code"].asInt();
            }));
  EXPECT_EQ(std::set<std::string>{"docs"}, Running());

  // A second daemon refuses to start beside it; a clean stop removes the socket and the pid
  // file. (A batch left by a killed daemon is proven end to end.)
  test::ChildProcess second(sys_.root(), {FILEINDEXD_BIN});
  EXPECT_TRUE(second.Exited(5000));
  const int wstatus = indexd->Signal(SIGTERM);
  EXPECT_TRUE(WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == 0) << wstatus;
  EXPECT_FALSE(IsFileExist(RootedPath("/var/run/fileindexd.sock")));
  EXPECT_FALSE(IsFileExist(RootedPath("/var/run/fileindexd.pid")));
}

// A start after a kill queues a reconciliation of every indexed folder, paused ones included;
// a start after a clean stop queues nothing. With the engine down the lines stay in the queue
// (or the side file of the pass that failed) to be read.
TEST_F(DaemonTest, AStartAfterAnUncleanStopReconcilesEveryFolder) {
  engine_->Signal(SIGTERM);
  const auto reconciled = [&] {
    std::set<std::string> paths;
    for (const std::string& share : {"docs", "music"}) {
      for (const std::string& file : {sys_.Queue(share), sys_.Queue(share) + ".tmp"}) {
        std::istringstream lines(orvane::test::ReadFile(file));
        for (std::string line; std::getline(lines, line);) {
          const fileindex::Event e(line);
          if (e.event == fileindex::kEventReindex && e.data["reconcile"].asBool()) {
            paths.insert(e.path);
          }
        }
      }
    }
    return paths;
  };
  auto indexd = sys_.StartIndexd();
  EXPECT_TRUE(WIFEXITED(indexd->Signal(SIGTERM)));
  indexd = sys_.StartIndexd();
  EXPECT_EQ(std::set<std::string>(), reconciled());

  indexd->Signal(SIGKILL);
  indexd = sys_.StartIndexd();
  EXPECT_EQ((std::set<std::string>{V("a"), sys_.Vol("music")}), reconciled());
}

TEST_F(DaemonTest, SighupReReadsTheFolderConfiguration) {
  auto indexd = sys_.StartIndexd();
  ASSERT_EQ(std::set<std::string>{"docs"}, Running());
  const std::string music = sys_.Vol("music");
  MakeParentDirs(music + "/album/x");
  std::ofstream(music + "/album/song.txt") << "la";

  // The folder file changed behind the daemon's back (/music resumed, /docs/a gone) with the
  // re-index adding a folder queues; only the signal tells the daemon.
  Json::Value folders(Json::arrayValue);
  folders.append(System::Folder("/music", false));
  sys_.WriteFolders(folders);
  fileindex::elastic::ShareIndexCreate("music");
  fileindex::AddCustomEvent(fileindex::kEventReindex, music, "", Json::Value());
  ASSERT_EQ(0, kill(indexd->pid(), SIGHUP));
  EXPECT_TRUE(WaitFor([] { return Running() == std::set<std::string>{"music"}; }, 5000));
  const std::set<std::string> want = {music, music + "/album", music + "/album/song.txt"};
  EXPECT_TRUE(WaitFor([&] { return sys_.Documents("music") == want; }, 5000));

  // A folder file broken by hand is reported and changes nothing: the daemon lives on with the
  // workers it had.
  std::ofstream(RootedPath(fileindex::kFileIndexFoldersCfgPath)) << R"([{"path": "/docs/a")";
  EXPECT_EQ(kErrLoadConfig,
            Command("notify_setting_changed", Share("docs"))["error"]["code"].asInt());
  ASSERT_EQ(0, kill(indexd->pid(), SIGHUP));
  EXPECT_FALSE(indexd->Exited(500));
  EXPECT_EQ(std::set<std::string>{"music"}, Running());

  // Indexed again: the worker comes back. (A queue kept while a share has no worker, and
  // drained when it has one again, is proven end to end.)
  folders.append(System::Folder("/docs/a", false));
  sys_.WriteFolders(folders);
  ASSERT_EQ(0, kill(indexd->pid(), SIGHUP));
  EXPECT_TRUE(WaitFor([] { return Running() == std::set<std::string>{"docs", "music"}; }, 5000));
  EXPECT_EQ(want, sys_.Documents("music"));

  // All of a share's folders paused: its worker stops, as it would not have started.
  folders[0]["paused"] = true;
  sys_.WriteFolders(folders);
  ASSERT_EQ(0, kill(indexd->pid(), SIGHUP));
  EXPECT_TRUE(WaitFor([] { return Running() == std::set<std::string>{"docs"}; }, 5000));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
