// The operation-to-command mapping and the pass, against a real search engine in a scratch
// system; the faults that a real engine cannot be made to show (a refused document, a dropped
// connection, a full volume) come from a scripted engine.
#include "daemons/fileindexd/worker.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/test_system.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/queue_file.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/fault.hpp"
#include "platform/platform_error.hpp"
#include "test/fake_daemon.hpp"

namespace orvane {
namespace fileindexd {
namespace {

using test::System;

std::string Line(unsigned mask, const std::string& path, bool is_dir = false,
                 const std::string& old_path = "", const Json::Value& data = Json::Value()) {
  Json::Value e(Json::objectValue);
  e["event"] = mask;
  e["is_dir"] = is_dir;
  e["path"] = path;
  if (!old_path.empty()) e["path_old"] = old_path;
  if (!data.isNull()) e["data"] = data;
  return JsonToString(e) + "\n";
}

Json::Value Kinds(bool on) {
  Json::Value k(Json::objectValue);
  for (const char* kind : {"document", "audio", "video", "photo"}) k[kind] = on;
  return k;
}

void Write(const std::string& path, const std::string& text) {
  MakeParentDirs(path);
  std::ofstream(path) << text;
}

class WorkerTest : public ::testing::Test {
 protected:
  WorkerTest() : sys_({"docs"}), worker_("docs", sys_.Queue("docs"), Worker::PauseGate()) {}

  void SetUp() override {
    setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
    Json::Value folders(Json::arrayValue);
    folders.append(System::Folder("/docs/a", false));
    folders.append(System::Folder("/docs/b", false));
    sys_.WriteFolders(folders);
    engine_ = sys_.StartEngine();
    fileindex::elastic::ShareIndexCreate("docs");
  }

  std::string V(const std::string& rel) const { return sys_.Vol("docs/" + rel); }
  void Queue(const std::string& lines) {
    ASSERT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), lines));
  }
  void Pass() {
    ASSERT_TRUE(worker_.RunPass());
    EXPECT_FALSE(IsFileExist(sys_.Queue("docs") + ".tmp"));
  }
  std::set<std::string> Docs() const { return sys_.Documents("docs"); }
  std::set<std::string> Expect(std::initializer_list<const char*> rels) const {
    std::set<std::string> out;
    for (const char* rel : rels) out.insert(V(rel));
    return out;
  }

  System sys_;
  std::unique_ptr<test::ChildProcess> engine_;
  Worker worker_;
};

TEST_F(WorkerTest, CreatedFilesAndDirectoriesAreIndexedWithinTheRules) {
  Write(V("a/x.txt"), "x");
  Write(V("a/sub/y.txt"), "y");
  Write(V("a/sub/deeper/z.txt"), "z");
  Write(V("a/sub/@eaDir/thumb.txt"), "t");
  Write(V("a/sub/.DS_Store"), "t");
  Write(V("c/out.txt"), "not under an indexed folder");
  ASSERT_EQ(0, symlink(V("a/x.txt").c_str(), V("a/sub/link.txt").c_str()));
  Queue(Line(0x40, V("a/x.txt")) + Line(0x8, V("a/x.txt")) + Line(0x40, V("a/sub"), true) +
        Line(0x40, V("c/out.txt")) + Line(0x40, V("a/gone.txt")));
  Pass();
  EXPECT_EQ(Expect({"a/x.txt", "a/sub", "a/sub/y.txt", "a/sub/deeper", "a/sub/deeper/z.txt"}),
            Docs());
  const Json::Value report = worker_.Report();
  EXPECT_EQ(0u, report["errors"].asUInt());
  EXPECT_EQ(0u, report["queue_length"].asUInt());
  EXPECT_GT(report["last_pass"].asInt64(), 0);
}

TEST_F(WorkerTest, RenamesDeletesAndAttributeChangesFollowTheDisk) {
  Write(V("a/d/f1.txt"), "1");
  Write(V("a/d/f2.txt"), "2");
  Write(V("a/dx.txt"), "x");
  Write(V("a/ex.txt"), "x");
  Queue(Line(0x10000, V("a")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/d", "a/d/f1.txt", "a/d/f2.txt", "a/dx.txt", "a/ex.txt"}), Docs());

  // A directory renamed, then deleted: the sibling whose name only begins the same stays.
  ASSERT_EQ(0, rename(V("a/d").c_str(), V("a/e").c_str()));
  Queue(Line(0x100, V("a/e"), true, V("a/d")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/e", "a/e/f1.txt", "a/e/f2.txt", "a/dx.txt", "a/ex.txt"}), Docs());
  ASSERT_EQ(0, unlink(V("a/e/f1.txt").c_str()));
  ASSERT_EQ(0, unlink(V("a/e/f2.txt").c_str()));
  ASSERT_EQ(0, rmdir(V("a/e").c_str()));
  Queue(Line(0x80, V("a/e"), true));
  Pass();
  EXPECT_EQ(Expect({"a", "a/dx.txt", "a/ex.txt"}), Docs());

  // An attribute change of a file never indexed indexes it; a move in from an unindexed place
  // (no old document) crawls the new name; a move out deletes the old one.
  Write(V("a/new.txt"), "n");
  Write(V("c/m/inner.txt"), "i");
  ASSERT_EQ(0, rename(V("c/m").c_str(), V("a/m").c_str()));
  ASSERT_EQ(0, rename(V("a/dx.txt").c_str(), V("c/dx.txt").c_str()));
  Queue(Line(0x4, V("a/new.txt")) + Line(0x100, V("a/m"), true, V("c/m")) +
        Line(0x100, V("c/dx.txt"), false, V("a/dx.txt")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/ex.txt", "a/new.txt", "a/m", "a/m/inner.txt"}), Docs());

  // A file renamed in its folder keeps its document under the new name, with the new name.
  ASSERT_EQ(0, rename(V("a/ex.txt").c_str(), V("a/why.txt").c_str()));
  Queue(Line(0x100, V("a/why.txt"), false, V("a/ex.txt")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/why.txt", "a/new.txt", "a/m", "a/m/inner.txt"}), Docs());
  Json::Value q(Json::objectValue);
  q["id"] = "fileindex_docs";
  q["query"]["qsl"]["term"]["QUIXMDPath"] = V("a/why.txt");
  const Json::Value hit = System::Engine("document_get_by_query", q)["data"][0];
  EXPECT_EQ("why.txt", hit["QUIXMDFSName"].asString());
  EXPECT_EQ(V("a"), hit["QUIXMDParent"].asString());
}

TEST_F(WorkerTest, ReindexAndCrashSettleTheIndexWithTheDisk) {
  Write(V("a/keep.txt"), "k");
  Write(V("a/old.txt"), "o");
  Write(V("b/other.txt"), "b");
  Queue(Line(0x10000, V("a")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/keep.txt", "a/old.txt"}), Docs());

  // Changes nobody reported: a re-index finds them, only below its own path.
  ASSERT_EQ(0, unlink(V("a/old.txt").c_str()));
  Write(V("a/sub/new.txt"), "n");
  Queue(Line(0x10000, V("a/sub")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/keep.txt", "a/old.txt", "a/sub", "a/sub/new.txt"}), Docs());
  Queue(Line(0x10000, V("a")));
  Pass();
  EXPECT_EQ(Expect({"a", "a/keep.txt", "a/sub", "a/sub/new.txt"}), Docs());

  // A crashed queue: the events after the crash mark are not read; every folder is crawled.
  ASSERT_EQ(0, unlink(V("a/keep.txt").c_str()));
  Queue(Line(0x40, V("a/ignored.txt")) + Line(0x200, V("a")) + Line(0x80, V("a/sub"), true));
  Pass();
  EXPECT_EQ(Expect({"a", "a/sub", "a/sub/new.txt", "b", "b/other.txt"}), Docs());
}

TEST_F(WorkerTest, FolderSettingChangesAddStripAndRemove) {
  Write(V("a/notes.txt"), "zebra crossing");
  Write(V("a/sub/more.txt"), "more");
  Queue(Line(0x10000, V("a")));
  Pass();
  auto search = [](const std::string& word) {
    Json::Value q(Json::objectValue);
    q["keyword"] = word;
    q["id"] = "fileindex_docs";
    return System::Engine("search", q)["data"]["total"].asInt();
  };
  EXPECT_EQ(0, search("zebra"));  // names and attributes only

  // Documents switched on for the folder: its text files are extracted again.
  Json::Value folders(Json::arrayValue);
  folders.append(System::Folder("/docs/a", true));
  folders.append(System::Folder("/docs/b", false));
  sys_.WriteFolders(folders);
  Json::Value switched(Json::objectValue);
  switched["document"] = true;
  Queue(Line(0x20000, V("a"), true, "", switched));
  Pass();
  EXPECT_EQ(1, search("zebra"));

  // The folder removed: no folder covers its documents any more.
  folders = Json::Value(Json::arrayValue);
  folders.append(System::Folder("/docs/b", false));
  sys_.WriteFolders(folders);
  Queue(Line(0x20000, V("a"), true, "", Kinds(true)));
  Pass();
  EXPECT_TRUE(Docs().empty());

  // A sub-folder of an unindexed folder added on its own: only it is indexed.
  folders.append(System::Folder("/docs/a/sub", false));
  sys_.WriteFolders(folders);
  Queue(Line(0x20000, V("a/sub"), true, "", Kinds(true)));
  Pass();
  EXPECT_EQ(Expect({"a/sub", "a/sub/more.txt"}), Docs());
}

// The engine replaced by a scripted one: every write succeeds except those `fail` picks, which
// are answered with `code`; queries find nothing.
class ScriptedEngineTest : public ::testing::Test {
 protected:
  ScriptedEngineTest() : sys_({"docs"}), worker_("docs", sys_.Queue("docs"), Worker::PauseGate()) {
    Json::Value folders(Json::arrayValue);
    folders.append(System::Folder("/docs/a", false));
    sys_.WriteFolders(folders);
  }

  void StartEngine(std::function<int(const Json::Value&)> fail, bool hang_up = false) {
    engine_.reset();  // it removes the socket file when it goes
    engine_ = std::make_unique<orvane::test::FakeDaemon>(
        RootedPathForWrite("/var/run/quixelasticd.sock"),
        [fail, hang_up](int fd, const std::string& request) {
          if (hang_up) return;
          const Json::Value req = orvane::test::FakeDaemon::Parse(request);
          const int code = fail(req);
          Json::Value reply(Json::objectValue);
          reply["success"] = code == 0;
          if (code != 0) reply["error"]["code"] = code;
          if (req["command"] == "document_get_by_query") reply["data"] = Json::arrayValue;
          orvane::test::FakeDaemon::WriteFrame(fd, JsonToString(reply));
        });
  }
  std::string V(const std::string& rel) const { return sys_.Vol("docs/" + rel); }
  std::string Tmp() const { return sys_.Queue("docs") + ".tmp"; }

  System sys_;
  Worker worker_;
  std::unique_ptr<orvane::test::FakeDaemon> engine_;
  orvane::test::FakeEnv env_;
};

TEST_F(ScriptedEngineTest, AFailingOperationIsRetriedWithBackoffThenSkipped) {
  StartEngine([this](const Json::Value& req) {
    return req["data"]["doc_id"] == V("a/bad.txt") ? 604 : 0;
  });
  Write(V("a/bad.txt"), "b");
  Write(V("a/good.txt"), "g");
  ASSERT_TRUE(fileindex::QueueFileAppend(
      sys_.Queue("docs"), Line(0x40, V("a/bad.txt")) + Line(0x40, V("a/good.txt"))));
  ASSERT_TRUE(worker_.RunPass());
  EXPECT_FALSE(IsFileExist(Tmp()));
  // Four attempts with one, two and four seconds between them, on the fake clock.
  EXPECT_EQ(7000000, env_.slept_micros());
  const Json::Value report = worker_.Report();
  EXPECT_EQ(1u, report["errors"].asUInt());
  EXPECT_NE(std::string::npos, report["last_error"].asString().find("bad.txt"));
  EXPECT_EQ(2u, report["ops_done"].asUInt());
  int good = 0, commits = 0;
  for (const auto& req : engine_->json_requests()) {
    good += req["data"]["doc_id"] == V("a/good.txt");
    commits += req["command"] == "commit";
  }
  EXPECT_EQ(1, good);
  EXPECT_EQ(1, commits);
}

TEST_F(ScriptedEngineTest, AnEngineThatDropsTheConnectionKeepsTheBatch) {
  StartEngine([](const Json::Value&) { return 0; }, /*hang_up=*/true);
  Write(V("a/x.txt"), "x");
  ASSERT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), Line(0x40, V("a/x.txt"))));
  EXPECT_FALSE(worker_.RunPass());
  EXPECT_TRUE(IsFileExist(Tmp()));
  // Nothing was skipped: the next pass (engine back) does the same batch.
  StartEngine([](const Json::Value&) { return 0; });
  ASSERT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), Line(0x40, V("a/later.txt"))));
  EXPECT_TRUE(worker_.RunPass());
  EXPECT_FALSE(IsFileExist(Tmp()));
  EXPECT_TRUE(IsFileExist(sys_.Queue("docs")));  // the later line waits for its own pass
  EXPECT_EQ(1u, worker_.Report()["errors"].asUInt());
}

TEST_F(ScriptedEngineTest, AFullVolumeFlagsTheShareAndNotifiesOnce) {
  StartEngine([](const Json::Value& req) { return req["command"] == "commit" ? 605 : 0; });
  platform::ScopedFaults faults;
  platform::Fault full;
  full.result = 0;
  full.platform_err = platform::kQErrVolumeFull;
  faults.Arm("QUIXQuotaIsEnough", full, 0, -1);
  fileindex::StatusMgr::CreateIfMissing();  // as the daemon does at its start
  Write(V("a/x.txt"), "x");
  ASSERT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), Line(0x40, V("a/x.txt"))));
  EXPECT_FALSE(worker_.RunPass());
  EXPECT_FALSE(worker_.RunPass());
  EXPECT_TRUE(IsFileExist(Tmp()));
  EXPECT_TRUE(worker_.Report()["out_of_space"].asBool()) << worker_.Report();
  EXPECT_EQ(1, platform::CallCount("QLIBCExecl"));
  JsonValue status;
  ASSERT_TRUE(status.fromFile(RootedPath("/var/packages/Orvane/etc/fileindex.status")));
  EXPECT_EQ(1u, status["share"]["docs"].asUInt() & 1u);
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
