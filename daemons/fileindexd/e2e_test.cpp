// The whole system in a scratch root: the search engine, the file-change daemon and the
// indexing daemon as real processes, folders added through the administration operations, and
// real work on disk, daemons killed or stopped half-way. After each round the index must hold
// exactly what a walk of the disk says is indexable, with the right names, parents and sizes.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <tuple>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/indexer.hpp"
#include "fileindex/index_mgr.hpp"
#include "fileindex/util.hpp"
#include "test/daemon_system.hpp"

namespace orvane {
namespace fileindexd {
namespace {

using test::System;
using test::WaitFor;
using test::WriteFile;

// What a document must say about its file: name, parent and size (-1 for a directory).
using Entry = std::tuple<std::string, std::string, int64_t>;
using Listing = std::map<std::string, Entry>;

int Shell(const std::string& cmd) { return std::system(cmd.c_str()); }

// What the disk says an index must hold below the folder `root`.
Listing Walk(const std::string& root) {
  Listing out;
  auto add = [&out](const std::string& path) {
    struct stat st;
    if (lstat(path.c_str(), &st) != 0 || !(S_ISDIR(st.st_mode) || S_ISREG(st.st_mode))) {
      return false;
    }
    out[path] = Entry{Basename(path), Dirname(path), S_ISDIR(st.st_mode) ? -1 : st.st_size};
    return true;
  };
  add(root);
  namespace fs = std::filesystem;
  std::error_code ec;
  for (fs::recursive_directory_iterator it(root, ec), end; !ec && it != end; it.increment(ec)) {
    const std::string name = it->path().filename();
    if (fileindex::IsSystemPreservedFileName(name) || name == "#recycle" || !add(it->path())) {
      it.disable_recursion_pending();
    }
  }
  return out;
}

// What the index of `share` holds.
Listing Index(const std::string& share) {
  Listing out;
  Json::Value q(Json::objectValue);
  q["id"] = "fileindex_" + share;
  q["query"]["qsl"]["match_all"] = Json::Value(Json::objectValue);
  for (const char* f :
       {"QUIXMDPath", "QUIXMDFSName", "QUIXMDParent", "QUIXMDFSSize", "QUIXMDIsDir"}) {
    q["query"]["load_field"].append(f);
  }
  q["size"] = 10000;  // the most one page holds, more than any of these tests makes
  Json::Value res;
  try {
    res = System::Engine("document_get_by_query", q);
  } catch (const std::exception&) {
    return out;
  }
  for (const auto& hit : res["data"]) {
    out[hit["QUIXMDPath"].asString()] =
        Entry{hit["QUIXMDFSName"].asString(), hit["QUIXMDParent"].asString(),
              hit["QUIXMDIsDir"].asBool() ? -1 : hit["QUIXMDFSSize"].asInt64()};
  }
  return out;
}

int64_t EngineCount(const std::string& share) {
  const Json::Value list = System::Engine("index_list", Json::Value());
  for (const auto& index : list["data"]) {
    if (index["id"] == "fileindex_" + share) return index["documents"].asInt64();
  }
  return -1;
}

Json::Value Folder(const std::string& path, bool meta) {
  Json::Value list(Json::arrayValue);
  list.append(System::Folder(path, meta));
  return list;
}

int Search(const std::string& word) {
  Json::Value q(Json::objectValue);
  q["keyword"] = word;
  return System::Engine("search", q)["data"]["total"].asInt();
}

class EndToEndTest : public test::RunningSystemTest {
 protected:
  EndToEndTest() : RunningSystemTest({"docs", "media"}) {}

  std::string D(const std::string& rel) const { return sys_.Vol("docs/" + rel); }
  std::string M(const std::string& rel) const { return sys_.Vol("media/" + rel); }

  // Waits until the index of `share` matches the walk of `root`, then checks it.
  void ExpectSettled(const std::string& share, const std::string& root, int timeout_ms = 30000) {
    WaitFor([&] { return Index(share) == Walk(root); }, timeout_ms);
    const Listing got = Index(share);
    EXPECT_EQ(Walk(root), got);
    EXPECT_EQ(int64_t(got.size()), EngineCount(share)) << "a document is doubled";
  }
};

TEST_F(EndToEndTest, TheIndexFollowsRealWorkOnDisk) {
  // Files there before the folders are added, and files no folder covers.
  WriteFile(D("proj/readme.txt"), "hello");
  WriteFile(D("proj/src/main.c"), "int main() { return 0; }");
  WriteFile(D("proj/src/util.h"), "void f(void);");
  WriteFile(D("proj/old name.txt"), "renamed later");
  WriteFile(D("proj/leaving.txt"), "moved out later");
  WriteFile(D("proj/@eaDir/thumb.jpg"), "not ours");
  WriteFile(D("outside/notes.txt"), "not indexed");
  WriteFile(M("song.mp3"), "not really audio");
  WriteFile(M("#recycle/deleted.txt"), "in the recycle bin");
  fileindex::FolderAdd(Folder("/docs/proj", false), false);
  fileindex::FolderAdd(Folder("/media", false), false);
  ExpectSettled("docs", D("proj"));
  ExpectSettled("media", sys_.Vol("media"));

  // Creates, writes, renames of indexed files and directories (their documents must carry the
  // new names and parents), deletes, moves in and out.
  WriteFile(D("proj/new.txt"), "new");
  WriteFile(D("proj/readme.txt"), "hello again, now longer");
  ASSERT_EQ(0, rename(D("proj/old name.txt").c_str(), D("proj/new name.txt").c_str()));
  ASSERT_EQ(0, rename(D("proj/src").c_str(), D("proj/source").c_str()));
  WriteFile(D("proj/source/lib/util.c"), "void f(void) {}");
  ASSERT_EQ(0, unlink(D("proj/source/main.c").c_str()));
  WriteFile(D("outside/incoming/a.txt"), "moved in");
  ASSERT_EQ(0, rename(D("outside/incoming").c_str(), D("proj/incoming").c_str()));
  ASSERT_EQ(0, rename(D("proj/leaving.txt").c_str(), D("outside/left.txt").c_str()));
  ASSERT_EQ(0, chmod(D("proj/readme.txt").c_str(), 0600));
  ExpectSettled("docs", D("proj"));

  // A tar archive extracted into the folder, then a tree removed with rm -rf.
  const std::string src = sys_.root() + "/tarsrc";
  for (int i = 0; i < 40; ++i) {
    WriteFile(src + "/pkg/dir" + std::to_string(i % 5) + "/f" + std::to_string(i) + ".txt",
              std::string(i, 'x'));
  }
  ASSERT_EQ(0, Shell("tar -C " + src + " -cf " + sys_.root() + "/pkg.tar pkg"));
  ASSERT_EQ(0, Shell("tar -C " + D("proj") + " -xf " + sys_.root() + "/pkg.tar"));
  ExpectSettled("docs", D("proj"));
  ASSERT_EQ(0, Shell("rm -rf " + D("proj/pkg")));
  ExpectSettled("docs", D("proj"));

  // A re-index, and a setting change that switches document contents on.
  Json::Value reindex(Json::arrayValue);
  reindex.append("/docs/proj");
  fileindex::FolderReindex(reindex);
  ExpectSettled("docs", D("proj"));
  EXPECT_EQ(0, Search("hello"));
  fileindex::FolderSet(Folder("/docs/proj", true), false);
  EXPECT_TRUE(WaitFor([] { return Search("hello") == 1; }, 20000));
  ExpectSettled("docs", D("proj"));
  ExpectSettled("media", sys_.Vol("media"));
}

// What compressed files and archives hold is searchable through the real daemons: a compressed
// text by its words, an archive by its members' names and texts.
TEST_F(EndToEndTest, CompressedFilesAndArchivesAreFoundByWhatTheyHold) {
  WriteFile(D("pkg/notes.txt"), "zgrepword inside a tarball");
  WriteFile(D("pkg/log/changelog"), "fixed zcatword handling");
  ASSERT_EQ(0, Shell("cd '" + D("pkg") + "' && gzip log/changelog && mkdir t && " +
                     "mv notes.txt t/membername.txt && tar czf bundle.tar.gz t && rm -r t"));
  fileindex::FolderAdd(Folder("/docs/pkg", true), false);
  ExpectSettled("docs", D("pkg"));
  EXPECT_TRUE(WaitFor([] { return Search("zcatword") == 1; }, 20000));
  EXPECT_EQ(1, Search("zgrepword"));
  EXPECT_EQ(1, Search("membername"));
}

// A link renamed over a root-only file takes its words away; a FIFO made where a file was leaves
// no document; a name toggled between file and folder 21 times ends with the folder's document.
TEST_F(EndToEndTest, NamesTakenByLinksFifosAndFoldersEndWithWhatIsThere) {
  WriteFile(D("team/boss_plan.txt"), "confidential merger plans");
  ASSERT_EQ(0, chmod(D("team/boss_plan.txt").c_str(), 0600));
  WriteFile(D("team/swap.txt"), "swapped");
  WriteFile(D("team/toggle"), "a file first");
  WriteFile(D("pub/readable.txt"), "public words");
  fileindex::FolderAdd(Folder("/docs/team", true), false);
  ExpectSettled("docs", D("team"));
  ASSERT_TRUE(WaitFor([] { return Search("merger") == 1; }, 20000));

  ASSERT_EQ(0, symlink(D("pub/readable.txt").c_str(), D("team/.t").c_str()));
  ASSERT_EQ(0, rename(D("team/.t").c_str(), D("team/boss_plan.txt").c_str()));
  ASSERT_EQ(0, unlink(D("team/swap.txt").c_str()));
  ASSERT_EQ(0, mkfifo(D("team/swap.txt").c_str(), 0644));
  for (int i = 0; i < 21; ++i) {
    const std::string t = D("team/toggle");
    if (i % 2 == 0) {
      ASSERT_EQ(0, unlink(t.c_str()));
      ASSERT_EQ(0, mkdir(t.c_str(), 0755));
    } else {
      ASSERT_EQ(0, rmdir(t.c_str()));
      WriteFile(t, "a file again");
    }
  }
  ExpectSettled("docs", D("team"));
  EXPECT_EQ(0, Search("merger"));
  EXPECT_EQ(-1, std::get<2>(Index("docs")[D("team/toggle")]));
}

TEST_F(EndToEndTest, AKilledIndexerLosesNothingAndDoublesNothing) {
  WriteFile(D("proj/seed.txt"), "s");
  fileindex::FolderAdd(Folder("/docs/proj", false), false);
  ExpectSettled("docs", D("proj"));

  // A large batch; the indexing daemon is killed while it works on it.
  for (int i = 0; i < 3000; ++i) {
    WriteFile(D("proj/big/d" + std::to_string(i % 30) + "/f" + std::to_string(i) + ".txt"), "b");
  }
  WaitFor([&] { return IsFileExist(sys_.Queue("docs") + ".tmp"); }, 10000);
  indexd_->Signal(SIGKILL);
  indexd_ = sys_.StartIndexd();
  ExpectSettled("docs", D("proj"), 60000);
}

// Whatever changed while a daemon was away is in the index once it is back: the file-change
// daemon killed (and watching again once started), stopped cleanly, all three stopped, the
// engine down.
TEST_F(EndToEndTest, ChangesMadeWhileDaemonsAreAwayAreFoundWhenTheyAreBack) {
  WriteFile(D("proj/keep.txt"), "k");
  for (int i = 0; i < 4; ++i) {
    for (int j = 0; j < 50; ++j) {
      WriteFile(D("proj/doomed" + std::to_string(i) + "/f" + std::to_string(j) + ".txt"), "d");
    }
  }
  fileindex::FolderAdd(Folder("/docs/proj", false), false);
  ExpectSettled("docs", D("proj"));
  // A tree deleted, one created, a file grown, one renamed: each round its own.
  int round = 0;
  const auto change = [&] {
    const std::string n = std::to_string(round++);
    ASSERT_EQ(0, Shell("rm -rf " + D("proj/doomed" + n)));
    WriteFile(D("proj/new" + n + "/sub/f.txt"), "new");
    WriteFile(D("proj/keep.txt"), std::string(10 + round, 'g'));  // a new size each round
    ASSERT_EQ(
        0, rename(D("proj/new" + n + "/sub/f.txt").c_str(), D("proj/new" + n + "/g.txt").c_str()));
  };

  for (const int sig : {SIGKILL, SIGTERM}) {
    const int status = notifyd_->Signal(sig);
    if (sig == SIGTERM) EXPECT_TRUE(WIFEXITED(status));  // a clean stop
    change();
    notifyd_ = sys_.StartNotifyd();
    ExpectSettled("docs", D("proj"));
    // Started again, it goes on watching.
    WriteFile(D("proj/live" + std::to_string(sig) + ".txt"), "l");
    ExpectSettled("docs", D("proj"));
  }

  EXPECT_TRUE(WIFEXITED(indexd_->Signal(SIGTERM)));
  EXPECT_TRUE(WIFEXITED(notifyd_->Signal(SIGTERM)));
  engine_->Signal(SIGTERM);
  change();
  engine_ = sys_.StartEngine();
  notifyd_ = sys_.StartNotifyd();
  indexd_ = sys_.StartIndexd();
  ExpectSettled("docs", D("proj"));

  // The changes wait in the queue while the engine is down; the indexer's back-off after its
  // failed passes is what the generous bound allows for.
  engine_->Signal(SIGTERM);
  change();
  engine_ = sys_.StartEngine();
  ExpectSettled("docs", D("proj"), 90000);
}

// Changes beyond what the kernel holds for a reader that is late: the events are lost, the
// folders are reconciled instead.
TEST_F(EndToEndTest, AfterTheKernelLostEventsTheIndexEqualsTheDisk) {
  WriteFile(D("proj/seed.txt"), "s");
  for (int i = 0; i < 100; ++i) WriteFile(D("proj/old/f" + std::to_string(i) + ".txt"), "o");
  fileindex::FolderAdd(Folder("/docs/proj", false), false);
  ExpectSettled("docs", D("proj"));
  int kernel_queue = 0;
  std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> kernel_queue;
  ASSERT_GT(kernel_queue, 0);
  // The index listing compared holds 10,000 documents at most.
  if (kernel_queue >= 18000) GTEST_SKIP() << "the kernel holds too many events for this test";
  // A create and a close per file, while the watcher cannot read.
  kill(notifyd_->pid(), SIGSTOP);
  ASSERT_EQ(0, Shell("rm -rf " + D("proj/old")));
  for (int i = 0; i < kernel_queue / 2 + 100; ++i) {
    WriteFile(D("proj/burst/d" + std::to_string(i % 20) + "/f" + std::to_string(i)), "");
  }
  kill(notifyd_->pid(), SIGCONT);
  ExpectSettled("docs", D("proj"), 90000);
}

TEST_F(EndToEndTest, StoppedMidCrawlItFinishesLaterWithNothingLostOrDoubled) {
  // Most files in one directory, so that a stop must land inside it, and a few below.
  constexpr int kFlat = 4 * kBulkBatchSize;
  for (int i = 0; i < kFlat + 500; ++i) {
    const std::string dir = i < kFlat ? "big" : "big/d" + std::to_string(i % 5);
    WriteFile(D(dir + "/f" + std::to_string(i) + ".txt"), "x");
  }
  const std::string side_file = sys_.Queue("docs") + ".tmp";
  // Stops the crawl with `stop` once its first documents are in, and checks that it ends
  // promptly, within a request or two of being asked (the one on its way, and one more should
  // this process be slow to ask), and leaves its batch queued as it was.
  const auto stop_mid_crawl = [&](const std::function<void()>& stop) {
    ASSERT_TRUE(WaitFor([] { return EngineCount("docs") >= int64_t(kBulkBatchSize); }, 20000));
    const std::string batch = orvane::test::ReadFile(side_file);
    const int64_t asked_at = EngineCount("docs");
    const auto start = std::chrono::steady_clock::now();
    stop();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
    EXPECT_LE(EngineCount("docs"), asked_at + 2 * int64_t(kBulkBatchSize));
    EXPECT_FALSE(batch.empty());
    EXPECT_EQ(batch, orvane::test::ReadFile(side_file));
  };
  Json::Value docs(Json::objectValue);
  docs["share_name"] = "docs";

  // The worker deleted while it crawls a folder just added.
  fileindex::FolderAdd(Folder("/docs/big", false), false);
  stop_mid_crawl([&] { EXPECT_TRUE(test::Command("worker_delete", docs)["success"].asBool()); });
  EXPECT_EQ(0u, test::Command("status", Json::Value())["data"]["shares"].size());
  // The disk changes while no worker runs; created again, the worker settles both.
  ASSERT_EQ(0, Shell("rm -rf " + D("big/d3")));
  WriteFile(D("big/late.txt"), "late");
  EXPECT_TRUE(test::Command("worker_create", docs)["success"].asBool());
  ExpectSettled("docs", D("big"));

  // The daemon stopped with SIGTERM while it re-indexes.
  Json::Value reindex(Json::arrayValue);
  reindex.append("/docs/big");
  fileindex::FolderReindex(reindex);
  int status = -1;
  stop_mid_crawl([&] { status = indexd_->Signal(SIGTERM); });
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  WriteFile(D("big/d1/later.txt"), "later");
  indexd_ = sys_.StartIndexd();
  ExpectSettled("docs", D("big"));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
