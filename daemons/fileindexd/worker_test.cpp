// The operation-to-command mapping and the pass, against a real search engine in a scratch
// system; the faults that a real engine cannot be made to show (a refused document, a dropped
// connection, a full volume) come from a scripted engine.
#include "daemons/fileindexd/worker.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <thread>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "common/wire.hpp"
#include "daemons/fileindexd/indexer.hpp"
#include "extract/extract_runner.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/queue_file.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/platform_error.hpp"
#include "test/daemon_system.hpp"
#include "test/fake_daemon.hpp"
#include "test/faults.hpp"

namespace orvane {
namespace fileindexd {
namespace {

using test::System;

// A scratch system with the share "docs" and its worker.
class ShareTest : public ::testing::Test {
 protected:
  ShareTest() : sys_({"docs"}), worker_("docs", sys_.Queue("docs"), Worker::PauseGate()) {}

  std::string V(const std::string& rel) const { return sys_.Vol("docs/" + rel); }
  void Write(const std::string& rel, const std::string& text = "x") {
    test::WriteFile(V(rel), text);
  }
  // One queue line, its paths relative to the share.
  std::string Line(unsigned mask, const std::string& rel, bool is_dir = false,
                   const std::string& old_rel = "") {
    Json::Value e(Json::objectValue);
    e["event"] = mask;
    e["is_dir"] = is_dir;
    e["path"] = V(rel);
    if (!old_rel.empty()) e["path_old"] = V(old_rel);
    return JsonToString(e) + "\n";
  }

  System sys_;
  Worker worker_;
};

class WorkerTest : public ShareTest {
 protected:
  void SetUp() override {
    setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
    sys_.WriteFolders({System::Folder("/docs/a", false), System::Folder("/docs/b", false)});
    engine_ = sys_.StartEngine();
    fileindex::elastic::ShareIndexCreate("docs");
  }

  void Move(const std::string& from, const std::string& to) {
    ASSERT_EQ(0, rename(V(from).c_str(), V(to).c_str())) << from;
  }
  // Queues `lines`, runs one pass and returns the documents it leaves.
  std::set<std::string> Pass(const std::string& lines) {
    EXPECT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), lines));
    EXPECT_TRUE(worker_.RunPass());
    EXPECT_FALSE(IsFileExist(sys_.Queue("docs") + ".tmp"));
    return sys_.Documents("docs");
  }
  std::set<std::string> Expect(std::initializer_list<const char*> rels) const {
    std::set<std::string> out;
    for (const char* rel : rels) out.insert(V(rel));
    return out;
  }

  std::unique_ptr<test::ChildProcess> engine_;
};

// Renames, moves in and out and trees deleted are followed end to end; here, what the rules
// keep out or let in that the disk alone does not say.
TEST_F(WorkerTest, EventsFollowTheDiskWithinTheRules) {
  for (const char* rel : {"a/x.txt", "a/sub/y.txt", "a/sub/@eaDir/thumb.txt", "a/sub/.DS_Store",
                          "a/d/f1.txt", "a/dx.txt", "c/not-under-a-folder.txt"}) {
    Write(rel, rel);
  }
  ASSERT_EQ(0, symlink(V("a/x.txt").c_str(), V("a/sub/link.txt").c_str()));
  EXPECT_EQ(Expect({"a/x.txt", "a/sub", "a/sub/y.txt", "a/d", "a/d/f1.txt", "a/dx.txt"}),
            Pass(Line(0x40, "a/x.txt") + Line(0x8, "a/x.txt") + Line(0x40, "a/sub", true) +
                 Line(0x40, "c/not-under-a-folder.txt") + Line(0x40, "a/gone.txt") +
                 Line(0x40, "a/d", true) + Line(0x40, "a/dx.txt")));
  const Json::Value report = worker_.Report();
  EXPECT_EQ(0u, report["errors"].asUInt() + report["queue_length"].asUInt()) << report;
  EXPECT_GT(report["last_pass"].asInt64(), 0);

  // A directory renamed leaves its sibling whose name only begins the same; an attribute change
  // of a file never indexed indexes it.
  Move("a/d", "a/e");
  Write("a/new.txt", "n");
  EXPECT_EQ(
      Expect({"a/x.txt", "a/sub", "a/sub/y.txt", "a/e", "a/e/f1.txt", "a/dx.txt", "a/new.txt"}),
      Pass(Line(0x100, "a/e", true, "a/d") + Line(0x4, "a/new.txt")));
}

TEST_F(WorkerTest, ReindexCrashAndFolderChangesSettleTheIndexWithTheDisk) {
  for (const char* rel : {"a/keep.txt", "a/old.txt", "b/other.txt"}) Write(rel);
  EXPECT_EQ(Expect({"a", "a/keep.txt", "a/old.txt"}), Pass(Line(0x10000, "a")));

  // Changes nobody reported: a re-index finds them, only below its own path.
  ASSERT_EQ(0, unlink(V("a/old.txt").c_str()));
  Write("a/sub/new.txt", "n");
  EXPECT_EQ(Expect({"a", "a/keep.txt", "a/old.txt", "a/sub", "a/sub/new.txt"}),
            Pass(Line(0x10000, "a/sub")));
  EXPECT_EQ(Expect({"a", "a/keep.txt", "a/sub", "a/sub/new.txt"}), Pass(Line(0x10000, "a")));

  // A crashed queue: the events after the crash mark are not read; every folder is crawled.
  ASSERT_EQ(0, unlink(V("a/keep.txt").c_str()));
  EXPECT_EQ(Expect({"a", "a/sub", "a/sub/new.txt", "b", "b/other.txt"}),
            Pass(Line(0x40, "a/ignored.txt") + Line(0x200, "a") + Line(0x80, "a/sub", true)));

  // Folder settings changed: a folder removed loses its documents; a sub-folder of an unindexed
  // folder, added on its own, is the only part of it indexed. (Switching a kind of metadata on
  // is proven end to end.)
  sys_.WriteFolders({System::Folder("/docs/b", false)});
  EXPECT_EQ(Expect({"b", "b/other.txt"}), Pass(Line(0x20000, "a", true)));
  sys_.WriteFolders({System::Folder("/docs/b", false), System::Folder("/docs/a/sub", false)});
  EXPECT_EQ(Expect({"a/sub", "a/sub/new.txt", "b", "b/other.txt"}),
            Pass(Line(0x20000, "a/sub", true)));
}

// A crawl writes each document exactly as the library's single upsert of the same file does,
// whatever its name holds, and a crawl larger than one request keeps every file.
TEST_F(WorkerTest, ACrawlWritesWhatSingleUpsertsWouldWrite) {
  const std::vector<std::string> odd = {
      "a/plain.txt", "a/UPPER.PDF", "a/no_extension", "a/.dotfile", "a/tab\tand\nnewline.x",
      "a/bytes\xff\xfe.bin", "a/P12:like a record", "a/sub/inner.TaR", "a/empty.unknownkind",
      "a/text.unknownkind"};
  for (const std::string& rel : odd) Write(rel, rel.find("empty") == std::string::npos ? rel : "");
  constexpr int kMany = kBulkBatchSize + 100;
  for (int i = 0; i < kMany; ++i) Write("a/many/f" + std::to_string(i));
  EXPECT_EQ(odd.size() + kMany + 3, Pass(Line(0x10000, "a")).size());

  const auto stored = [&](const std::string& path) {
    Json::Value q(Json::objectValue);
    q["id"] = fileindex::elastic::GetFileIndexID("docs");
    q["query"]["qsl"]["term"]["QUIXMDPath"] = path;
    const Json::Value hits = System::Engine("document_get_by_query", q)["data"];
    EXPECT_EQ(1u, hits.size()) << path;
    return JsonToString(hits[0]);
  };
  fileindex::FolderMgr folders;
  for (const std::string& rel : odd) {
    const std::string crawled = stored(V(rel));
    fileindex::elastic::IndexUpsert("docs", V(rel), folders.IsFullPathNeedMeta(V(rel)));
    EXPECT_EQ(stored(V(rel)), crawled) << rel;
  }
}

// Whatever takes an indexed name without being indexable itself takes the name's document with
// it, whatever the event says: a link where a file was whose change is an attribute one, a link
// where a folder was. (A link renamed over a file and a FIFO made in a file's place are proven
// end to end.)
TEST_F(WorkerTest, ANameTakenByWhatIsNotIndexedLosesItsDocument) {
  Write("a/attr.txt");
  Write("a/d/inner.txt");
  Write("b/public.txt");
  EXPECT_EQ(Expect({"a", "a/attr.txt", "a/d", "a/d/inner.txt"}), Pass(Line(0x10000, "a")));
  ASSERT_EQ(0, unlink(V("a/attr.txt").c_str()));
  ASSERT_EQ(0, symlink(V("b/public.txt").c_str(), V("a/attr.txt").c_str()));
  ASSERT_EQ(0, system(("rm -r " + V("a/d")).c_str()));
  ASSERT_EQ(0, symlink(V("b").c_str(), V("a/d").c_str()));
  EXPECT_EQ(Expect({"a"}), Pass(Line(0x4, "a/attr.txt") + Line(0x40, "a/d")));
}

// A file whose extraction takes long (the helper answers for it only once a release file exists,
// or after 30 s) holds one extraction thread; the rest of a crawl and the operations queued after
// it are sent meanwhile, but an operation on its path waits for it.
TEST_F(WorkerTest, ASlowFileHoldsBackOnlyWhatConcernsIt) {
  sys_.WriteFolders({System::Folder("/docs/a", true)});
  const std::string release = sys_.root() + "/release";
  const std::string helper = sys_.root() + "/slow-helper";
  test::WriteFile(helper, "#!/bin/bash\nrelease=" + release + "\n" + R"(
while IFS= read -r -d '' path; do
  case "$path" in *slow*)
    for i in $(seq 600); do [ -e "$release" ] && break; sleep 0.05; done ;;
  esac
  printf '{"fields":{}}\n'
done)");
  ASSERT_EQ(0, chmod(helper.c_str(), 0755));
  setenv("FILEINDEX_EXTRACT_HELPER", helper.c_str(), 1);
  const auto has = [](const std::set<std::string>& docs, const std::set<std::string>& some) {
    return std::includes(docs.begin(), docs.end(), some.begin(), some.end());
  };
  // Runs a pass on a thread; once `others` are in the index, records whether `held` are too,
  // then lets the slow file go and waits for the pass.
  const auto held_back = [&](const std::string& lines, const std::set<std::string>& others,
                             const std::set<std::string>& held) {
    EXPECT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), lines));
    bool done = false;
    std::thread pass([&] { done = worker_.RunPass(); });
    EXPECT_TRUE(test::WaitFor([&] { return has(sys_.Documents("docs"), others); }, 30000));
    const bool held_in = has(sys_.Documents("docs"), held);
    test::WriteFile(release, "");
    pass.join();
    EXPECT_TRUE(done);
    EXPECT_EQ(0, unlink(release.c_str()));
    return held_in;
  };

  // A crawl; files of a folder are crawled before its sub-folders, so the slow one comes first.
  for (const char* rel : {"a/d/slow.txt", "a/d/sub/f0.txt", "a/d/sub/f1.txt"}) Write(rel);
  EXPECT_FALSE(held_back(Line(0x10000, "a"), Expect({"a/d/sub/f0.txt", "a/d/sub/f1.txt"}),
                         Expect({"a/d/slow.txt"})));
  EXPECT_EQ(Expect({"a", "a/d", "a/d/slow.txt", "a/d/sub", "a/d/sub/f0.txt", "a/d/sub/f1.txt"}),
            sys_.Documents("docs"));

  // Queued operations: the slow file changed, then new files, then its folder renamed. The new
  // files go in while the slow one is read; the rename waits for it, so the old names stay.
  Write("a/d/slow.txt", "changed");
  for (const char* rel : {"a/g1.txt", "a/g2.txt"}) Write(rel);
  Move("a/d", "a/e");
  EXPECT_TRUE(held_back(Line(0x2, "a/d/slow.txt") + Line(0x40, "a/g1.txt") +
                            Line(0x40, "a/g2.txt") + Line(0x100, "a/e", true, "a/d"),
                        Expect({"a/g1.txt", "a/g2.txt"}), Expect({"a/d", "a/d/slow.txt"})));
  extract::CloseIdleExtractHelpers();
  EXPECT_EQ(Expect({"a", "a/e", "a/e/slow.txt", "a/e/sub", "a/e/sub/f0.txt", "a/e/sub/f1.txt",
                    "a/g1.txt", "a/g2.txt"}),
            sys_.Documents("docs"));
}

TEST_F(WorkerTest, AReconciliationWritesOnlyWhatChangedAndReportsIt) {
  // A Latin-1 name is compared by its bytes, like any other.
  for (const char* rel : {"a/same.txt", "a/caf\xe9.txt", "a/grows.txt", "a/old.txt", "a/sub/x.txt",
                          "a/gone/1.txt", "a/gone/2/3.txt", "b/other.txt"}) {
    Write(rel);
  }
  const std::string reconcile = R"({"event": 65536, "is_dir": true, "path": ")" + V("a") +
                                R"(", "data": {"reconcile": true}})"
                                "\n";
  Pass(Line(0x10000, "a"));
  // The index keeps whole seconds: the changes below must fall in a later one to be seen.
  const time_t indexed = time(nullptr);
  while (time(nullptr) == indexed) usleep(20000);

  ASSERT_EQ(0, unlink(V("a/old.txt").c_str()));
  ASSERT_EQ(0, system(("rm -r " + V("a/gone")).c_str()));
  Write("a/grows.txt", "longer");
  Write("a/sub/new.txt");
  ASSERT_EQ(0, chmod(V("a/sub/x.txt").c_str(), 0600));
  const uint64_t written = worker_.Report()["documents_written"].asUInt64();
  EXPECT_EQ(Expect({"a", "a/same.txt", "a/caf\xe9.txt", "a/grows.txt", "a/sub", "a/sub/x.txt",
                    "a/sub/new.txt"}),
            Pass(reconcile));
  const Json::Value report = worker_.Report();
  const Json::Value& last = report["last_reconcile"];
  EXPECT_TRUE(last["folder"] == V("a") && report["state"] == "idle" &&
              report["reconciling"].isNull() && report["reconciliations"].size() == 1)
      << report;
  // Added the new file; removed the file and the folder of four documents; refreshed the file
  // that grew, the one whose mode changed and the two folders whose entries changed. What the
  // engine holds unchanged (seconds, modes, Latin-1 names) is neither re-read nor written.
  EXPECT_EQ("+1 -5 ~4 =7 w5", "+" + last["added"].asString() + " -" + last["removed"].asString() +
                                  " ~" + last["refreshed"].asString() + " =" +
                                  last["compared"].asString() + " w" +
                                  std::to_string(report["documents_written"].asUInt64() - written))
      << report;
}

// The engine replaced by a scripted one: every write succeeds except those `fail` picks, which
// are answered with `code`; queries find nothing.
class ScriptedEngineTest : public ShareTest {
 protected:
  ScriptedEngineTest() { sys_.WriteFolders({System::Folder("/docs/a", false)}); }

  void StartEngine(std::function<int(const Json::Value&)> fail, bool hang_up = false) {
    engine_.reset();  // it removes the socket file when it goes
    engine_ = std::make_unique<orvane::test::FakeDaemon>(
        RootedPathForWrite("/var/run/quixelasticd.sock"),
        hang_up ? [](int, const std::string&) {} : orvane::test::FakeDaemon::EngineReplies(fail));
  }
  std::string Tmp() const { return sys_.Queue("docs") + ".tmp"; }
  // Writes the files and queues their creation.
  void Create(std::initializer_list<const char*> rels) {
    for (const char* rel : rels) {
      Write(rel, rel);
      ASSERT_TRUE(fileindex::QueueFileAppend(sys_.Queue("docs"), Line(0x40, rel)));
    }
  }

  std::unique_ptr<orvane::test::FakeDaemon> engine_;
  orvane::test::FakeEnv env_;
};

TEST_F(ScriptedEngineTest, AFailingOperationIsRetriedWithBackoffThenSkipped) {
  StartEngine([this](const Json::Value& req) {
    return req["data"]["doc_id"] == V("a/bad.txt") ? kCodeDocInvalid : 0;
  });
  Create({"a/bad.txt", "a/good.txt"});
  ASSERT_TRUE(worker_.RunPass());
  EXPECT_FALSE(IsFileExist(Tmp()));
  // Four attempts with one, two and four seconds between them, on the fake clock.
  EXPECT_EQ(7000000, env_.slept_micros());
  const Json::Value report = worker_.Report();
  EXPECT_TRUE(report["errors"].asUInt() == 1 && report["ops_done"].asUInt() == 2) << report;
  EXPECT_THAT(report["last_error"].asString(), ::testing::HasSubstr("bad.txt"));
  int good = 0, commits = 0;
  for (const auto& req : engine_->json_requests()) {
    good += req["data"]["doc_id"] == V("a/good.txt");
    commits += req["command"] == "commit";
  }
  EXPECT_EQ(1, good);
  EXPECT_EQ(1, commits);
}

// Failures of the engine or the volume skip nothing: the batch waits for a later pass.
TEST_F(ScriptedEngineTest, AnEngineThatDropsTheConnectionOrAFullVolumeKeepsTheBatch) {
  StartEngine([](const Json::Value&) { return 0; }, /*hang_up=*/true);
  Create({"a/x.txt"});
  EXPECT_FALSE(worker_.RunPass());
  EXPECT_TRUE(IsFileExist(Tmp()));

  // The volume full at the commit: the share is flagged, the administrator told once.
  StartEngine([](const Json::Value& req) { return req["command"] == "commit" ? kCodeStorage : 0; });
  platform::ScopedFaults faults;
  faults.Arm("QUIXQuotaIsEnough", platform::Fault{0, 0, platform::kQErrVolumeFull}, 0, -1);
  fileindex::StatusMgr::CreateIfMissing();  // as the daemon does at its start
  EXPECT_FALSE(worker_.RunPass());
  EXPECT_FALSE(worker_.RunPass());
  EXPECT_TRUE(IsFileExist(Tmp()));
  EXPECT_TRUE(worker_.Report()["out_of_space"].asBool()) << worker_.Report();
  EXPECT_EQ(1, platform::CallCount("QLIBCExecl"));
  // The share's flag in the status file is the library's commit's to set, and checked there.

  // The engine back: the same batch is done; a line queued meanwhile waits for its own pass.
  platform::ClearFaults();
  StartEngine([](const Json::Value&) { return 0; });
  Create({"a/later.txt"});
  EXPECT_TRUE(worker_.RunPass());
  EXPECT_FALSE(IsFileExist(Tmp()));
  EXPECT_TRUE(IsFileExist(sys_.Queue("docs")));
  EXPECT_FALSE(worker_.Report()["out_of_space"].asBool());
}

// "@eaDir" planted in a share open to everyone as a link to a root-only folder: the worker's
// report says why the share is not indexed, naming the entry, until the link is removed; then
// the worker makes the queue's folders itself, root-only.
TEST_F(ShareTest, APlantedQueueFolderIsReportedUntilItIsGone) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as nobody";
  const std::string share = sys_.Vol("docs");
  ASSERT_EQ(chmod(Dirname(share).c_str(), 0711), 0);
  ASSERT_EQ(chmod(share.c_str(), 0777), 0);
  orvane::test::TempDir secret;
  ASSERT_EQ(0, orvane::test::RunAsUser("nobody", [&] {
    return symlink(secret.path().c_str(), (share + "/@eaDir").c_str());
  }));
  worker_.Start();
  const Json::Value report = worker_.Report();
  EXPECT_THAT(report["unsafe"].asString(),
              ::testing::HasSubstr(share + "/@eaDir: it is a symbolic link"));
  EXPECT_TRUE(report["last_error"] == report["unsafe"] && report["errors"].asUInt() >= 1) << report;

  ASSERT_EQ(unlink((share + "/@eaDir").c_str()), 0);
  EXPECT_TRUE(test::WaitFor([&] { return worker_.Report()["unsafe"].asString().empty(); },
                            20000));
  struct stat st;
  ASSERT_EQ(lstat(Dirname(sys_.Queue("docs")).c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
  EXPECT_FALSE(IsDirExist(secret.Path("@fileindex"), false));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
