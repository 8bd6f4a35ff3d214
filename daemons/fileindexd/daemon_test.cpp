// The daemon binary on its real socket: its commands, who may send them, following a queue
// without being told, the pause, re-reading the folder file on SIGHUP, and a clean stop; many
// clients at once, what the status shows to whom, a damaged index and paths too long to index.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <climits>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <tuple>
#include <vector>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/sdk/share.hpp"
#include "common/util.hpp"
#include "common/wire.hpp"
#include "daemons/fileindexd/index_daemon.hpp"
#include "daemons/fileindexd/server.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/notifyd_cfg.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/queue_file.hpp"
#include "test/daemon_system.hpp"
#include "test/fake_daemon.hpp"
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

// Waits until the first share's status meets `pred`; `report` is the last one read.
bool WaitForShare(const std::function<bool(const Json::Value&)>& pred, int timeout_ms,
                  Json::Value* report) {
  return WaitFor([&] { return pred(*report = Status()["shares"][0]); }, timeout_ms);
}

Json::Value PauseForever() {
  Json::Value pause(Json::objectValue);
  pause["resume_time"] = 0;
  return Command("pause", pause);
}

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

// A connection to the daemon's socket that sends nothing (or `bytes`) and waits.
UniqueFd Connect(const std::string& bytes = "") {
  UniqueFd fd = wire::Connect(RootedPath(kFileIndexdSockPath), 10000);
  if (fd.valid() && !bytes.empty()) (void)!send(fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
  return fd;
}

// Whether the daemon closed the connection: an end of stream within `timeout_ms`.
bool ClosedByDaemon(int fd, int timeout_ms) {
  return WaitFor(
      [fd] {
        char byte;
        return recv(fd, &byte, 1, MSG_DONTWAIT) == 0;
      },
      timeout_ms);
}

// The reply the daemon sends on `fd` without being asked (a refusal); null when it sends none
// within `timeout_ms` or closes the connection.
Json::Value UnaskedReply(int fd, int timeout_ms) {
  wire::Deadline deadline = wire::Deadline::Idle(timeout_ms, timeout_ms);
  std::string payload;
  if (wire::ReadFrame(fd, wire::kMaxCommandFrame, &payload, deadline) != wire::IoStatus::kOk) {
    return Json::Value();
  }
  return orvane::test::FakeDaemon::Parse(std::string(wire::PayloadText(payload)));
}

// Runs fileindexctl with `args`; its standard output and error together, and its exit status.
std::pair<std::string, int> Ctl(const std::vector<std::string>& args) {
  const orvane::test::ProgramResult r = orvane::test::RunProgram(FILEINDEXCTL_BIN, args);
  return {r.out + r.err, r.status};
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
    // The socket's folder reachable for other users.
    for (const std::string& dir : {sys_.root(), sys_.root() + "/var", sys_.root() + "/var/run"}) {
      MakeParentDirs(dir + "/x");
      chmod(dir.c_str(), 0755);
    }
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
  auto indexd = sys_.StartIndexd();
  // Only the share whose folders are not all paused has a worker.
  EXPECT_EQ(std::set<std::string>{"docs"}, Running());
  Create("a/one.txt");
  EXPECT_TRUE(WaitFor([&] { return Indexed("a/one.txt"); }, 5000));

  // Paused with no end: the queue waits; resumed: it is drained.
  EXPECT_TRUE(PauseForever()["success"].asBool());
  EXPECT_TRUE(Status()["paused"].asBool());
  Create("a/two.txt");
  EXPECT_FALSE(WaitFor([&] { return Indexed("a/two.txt"); }, 1500));
  EXPECT_EQ(1u, Status()["shares"][0]["queue_length"].asUInt());
  EXPECT_TRUE(Command("resume", Json::Value())["success"].asBool());
  EXPECT_TRUE(WaitFor([&] { return Indexed("a/two.txt"); }, 5000));

  // The pass counts its operations once it has finished, which is after the commit that made
  // the document visible.
  Json::Value report;
  EXPECT_TRUE(WaitForShare([](const Json::Value& r) { return r["ops_done"].asUInt() == 2; }, 5000,
                           &report))
      << report;

  // Bad input gets an error reply, never a crash.
  EXPECT_EQ(kCodeUnknownCommand, Command("reboot", Json::Value())["error"]["code"].asInt());
  EXPECT_EQ(kErrInvalidParam, Command("worker_create", Json::Value())["error"]["code"].asInt());
  EXPECT_NE(std::string::npos,
            RawFrame(8, "not json").find("\"code\":" + std::to_string(kCodeMalformed)));
  EXPECT_NE(std::string::npos, RawFrame(1u << 30, "").find(std::to_string(kCodeTooLarge)));

  // Anyone may ask how it is doing; only root and its own user may control it.
  EXPECT_EQ(1, orvane::test::RunAsUser("nobody", [] {
              return Command("status", Json::Value())["success"].asBool() ? 1 : 0;
            }));
  EXPECT_EQ(kCodePermissionDenied, orvane::test::RunAsUser("nobody", [] {
              return Command("worker_delete", Share("docs"))["error"]["code"].asInt();
            }));
  EXPECT_EQ(std::set<std::string>{"docs"}, Running());

  // A clean stop removes the socket. (The pid file's lock and removal are the shared start-up's,
  // tested with it; a batch left by a killed daemon is proven end to end.)
  const int wstatus = indexd->Signal(SIGTERM);
  EXPECT_TRUE(WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == 0) << wstatus;
  EXPECT_FALSE(IsFileExist(RootedPath("/var/run/fileindexd.sock")));
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
}

TEST_F(DaemonTest, ClientsHoldingTheSocketDoNotHoldOffOthers) {
  auto indexd = sys_.StartIndexd();
  // Root's connections are never turned away: twenty idle ones and one stopped half-way through
  // its frame hold the socket...
  std::vector<UniqueFd> idle;
  for (int i = 0; i < 20; ++i) idle.push_back(Connect());
  idle.push_back(Connect(std::string("\x40\0\0\0{\"type\"", 11)));
  for (const UniqueFd& fd : idle) ASSERT_TRUE(fd.valid());
  // ... while another client's pause is applied before its reply, and the reply says so. (One
  // client at a time, each given seconds to speak, would take most of a minute here.)
  const auto start = std::chrono::steady_clock::now();
  const Json::Value reply = PauseForever();
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
  EXPECT_TRUE(reply["success"].asBool()) << reply;
  EXPECT_TRUE(Status()["paused"].asBool());
  // Those that send no whole command within the daemon's short wait are let go.
  for (const UniqueFd& fd : idle) EXPECT_TRUE(ClosedByDaemon(fd.get(), 10000));

  // Any other user gets a few connections at a time; the next is refused at once, with a
  // reason, and the user is served again once one is let go. The refusal comes unasked, as the
  // connection is taken. A round in which the daemon's short wait let a held connection go
  // before the next came (a loaded machine) proves nothing and is played again.
  EXPECT_EQ(kCodeTooManyConnections, orvane::test::RunAsUser("nobody", [] {
              for (int round = 0; round < 5; ++round) {
                std::vector<UniqueFd> held;
                for (int i = 0; i < kMaxConnectionsPerUser; ++i) held.push_back(Connect());
                const UniqueFd next = Connect();
                const Json::Value refused = UnaskedReply(next.get(), 3000);
                if (refused.isNull()) continue;
                if (refused["error"]["msg"].asString().find("too many") == std::string::npos) {
                  return 1;
                }
                held.pop_back();
                if (!WaitFor([] { return Command("status", Json::Value())["success"].asBool(); },
                             5000)) {
                  return 2;
                }
                return refused["error"]["code"].asInt();
              }
              return 3;
            }));
}

TEST_F(DaemonTest, StatusShowsFileDetailsOnlyToAdministrators) {
  // An engine that refuses one document, which the real one cannot be made to do, stands in for
  // it: after its retries the worker records the operation, path and all, as its last error.
  engine_->Signal(SIGTERM);
  const std::string secret = V("a/secret-plan.txt");
  orvane::test::FakeDaemon engine(
      RootedPathForWrite("/var/run/quixelasticd.sock"),
      orvane::test::FakeDaemon::EngineReplies([secret](const Json::Value& req) {
        return req["data"]["doc_id"] == secret ? kCodeDocInvalid : 0;
      }));
  auto indexd = sys_.StartIndexd();
  Create("a/secret-plan.txt");
  Json::Value report;
  ASSERT_TRUE(WaitForShare([](const Json::Value& r) { return r["errors"].asUInt() > 0; }, 30000,
                           &report))
      << report;
  EXPECT_NE(std::string::npos, report["last_error"].asString().find(secret)) << report;

  // 0: the counts without the path; 1: the path; 2: no counts.
  const auto what_nobody_sees = [] {
    const Json::Value status = Command("status", Json::Value());
    if (status["data"]["shares"][0]["errors"].asUInt() == 0) return 2;
    return JsonToString(status).find("secret-plan") != std::string::npos ? 1 : 0;
  };
  EXPECT_EQ(0, orvane::test::RunAsUser("nobody", what_nobody_sees));
  // A member of the platform's administrators group sees what root sees.
  const std::string shares = R"([{"name": "docs", "path": ")" + sys_.Vol("docs") +
                             R"(", "recycle_bin": true}, {"name": "music", "path": ")" +
                             sys_.Vol("music") + R"(", "recycle_bin": true}])";
  orvane::test::WritePlatformConfig(sys_.root(),
                                    R"({"admin_group": "nogroup", "shares": )" + shares + "}");
  EXPECT_EQ(1, orvane::test::RunAsUser("nobody", what_nobody_sees));
}

TEST_F(DaemonTest, ADamagedIndexIsReportedWithTheCommandThatRebuildsIt) {
  auto indexd = sys_.StartIndexd();
  Create("a/one.txt");
  ASSERT_TRUE(WaitFor([&] { return Indexed("a/one.txt"); }, 5000));
  // The engine stopped, the index's database overwritten with garbage, the engine started again.
  engine_->Signal(SIGTERM);
  const std::string db = sdk::SDKShare("docs").GetDBPath() + "/index.db";
  ASSERT_TRUE(IsFileExist(db)) << db;
  unlink((db + "-wal").c_str());
  unlink((db + "-shm").c_str());
  test::WriteFile(db, std::string(64 << 10, 'x'));
  engine_ = sys_.StartEngine();

  // A search of the share names it and the command, and does not blame an engine out of reach.
  std::string out;
  int status = 0;
  std::tie(out, status) = Ctl({"search", "one", "--share", "docs"});
  EXPECT_EQ(1, status) << out;
  EXPECT_NE(std::string::npos, out.find("a share's search index is damaged (error 609): the index "
                                        "of share docs cannot be read and was set aside; "
                                        "\"fileindexctl share rebuild docs\" builds it again"))
      << out;
  EXPECT_EQ(std::string::npos, out.find("cannot be reached")) << out;

  // Changes meanwhile are kept, not skipped, and the status says why and what to do.
  Create("a/two.txt");
  const std::string note = "notes:\n  docs: the search index cannot be read and was set aside; "
                           "\"fileindexctl share rebuild docs\" builds it again\n";
  EXPECT_TRUE(WaitFor([&] { return (out = Ctl({"status"}).first).find(note) != out.npos; }, 10000))
      << out;
  EXPECT_GE(Status()["shares"][0]["queue_length"].asUInt(), 1u);

  // The command given does it: both files are found again.
  std::tie(out, status) = Ctl({"share", "rebuild", "docs"});
  EXPECT_EQ(0, status) << out;
  EXPECT_TRUE(WaitFor([&] { return Indexed("a/one.txt") && Indexed("a/two.txt"); }, 30000));
}

TEST_F(DaemonTest, PathsTooLongToIndexAreCountedAndShown) {
  // Folders nested by descriptor until the next name would reach PATH_MAX; inside the last one
  // a file whose path is one byte short of it (indexed), one that reaches it, and a folder that
  // does (each counted, the folder once for all below it).
  const std::string top = V("a/deep");
  ASSERT_EQ(0, mkdir(top.c_str(), 0755));
  std::string path = top;
  UniqueFd dir(open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const std::string segment(200, 'd');
  while (path.size() + 1 + segment.size() + 1 + 100 < PATH_MAX) {
    ASSERT_EQ(0, mkdirat(dir.get(), segment.c_str(), 0755));
    dir = UniqueFd(openat(dir.get(), segment.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(dir.valid());
    path += "/" + segment;
  }
  const size_t room = PATH_MAX - 1 - path.size() - 1;  // the longest name: the NUL and "/" left
  const std::string fits = std::string(room, 'f');
  for (const std::string& name : {fits, std::string(room + 1, 'g')}) {
    UniqueFd file(openat(dir.get(), name.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    ASSERT_TRUE(file.valid()) << name.size();
  }
  ASSERT_EQ(0, mkdirat(dir.get(), std::string(room + 1, 'h').c_str(), 0755));
  ASSERT_EQ(PATH_MAX - 1, static_cast<int>((path + "/" + fits).size()));

  auto indexd = sys_.StartIndexd();
  // Crawled twice: the same paths are not counted again.
  Json::Value report;
  for (uint64_t ops = 0; ops < 2; ops = report["ops_done"].asUInt64()) {
    ASSERT_TRUE(fileindex::QueueFileAppend(
        sys_.Queue("docs"), R"({"event": 64, "is_dir": true, "path": ")" + top + "\"}\n"));
    ASSERT_TRUE(WaitForShare([ops](const Json::Value& r) { return r["ops_done"].asUInt64() > ops; },
                             10000, &report))
        << report;
  }
  EXPECT_EQ(2u, report["long_paths"].asUInt()) << report;
  EXPECT_TRUE(WaitFor([&] { return sys_.Documents("docs").count(path + "/" + fits) > 0; }, 5000));
  EXPECT_NE(std::string::npos,
            Ctl({"status"}).first.find("docs: 2 path(s) of 4096 bytes or more cannot be indexed"));

  // rm walks by descriptors, so the deepest names need not be given whole.
  ASSERT_EQ(0, system(("rm -r " + top).c_str()));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
