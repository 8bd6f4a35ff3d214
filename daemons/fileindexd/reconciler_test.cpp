// The merge of a folder on disk with the index's documents of it: the disk and the path rules
// are real (a scratch system), the index is a list of documents and the sink records what it is
// asked to do. The commands that follow are checked against a real engine in the worker test.
#include "daemons/fileindexd/reconciler.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include "test/daemon_system.hpp"

namespace orvane {
namespace fileindexd {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class ListedEntries : public IndexedEntries {
 public:
  explicit ListedEntries(std::vector<IndexedEntry> docs) : docs_(std::move(docs)) {
    std::sort(docs_.begin(), docs_.end(),
              [](const IndexedEntry& a, const IndexedEntry& b) { return a.path < b.path; });
  }
  bool Next(IndexedEntry* entry) override {
    if (next_ >= docs_.size()) return false;
    *entry = docs_[next_++];
    return true;
  }

 private:
  std::vector<IndexedEntry> docs_;
  size_t next_ = 0;
};

// Records each call with the path relative to the share.
class Recorder : public ReconcileSink {
 public:
  explicit Recorder(std::string base) : base_(std::move(base)) {}
  void Add(const std::string& path, bool is_dir) override {
    Record("add " + Rel(path) + (is_dir ? "/" : ""));
  }
  void Refresh(const std::string& path, bool is_dir, bool contents) override {
    Record("refresh " + Rel(path) + (is_dir ? "/" : "") + (contents ? "" : " attributes"));
  }
  void Remove(const std::string& path, bool subtree) override {
    Record("remove " + Rel(path) + (subtree ? " and below" : ""));
  }
  std::function<void()> on_call;
  std::vector<std::string> calls;

 private:
  std::string Rel(const std::string& path) const { return path.substr(base_.size()); }
  void Record(const std::string& call) {
    calls.push_back(call);
    if (on_call) on_call();
  }
  std::string base_;
};

class ReconcilerTest : public ::testing::Test {
 protected:
  ReconcilerTest() : sys_({"docs"}), recorder_(sys_.Vol("docs")) {
    sys_.WriteFolders({test::System::Folder("/docs/a", false)});
  }

  std::string V(const std::string& rel) const { return sys_.Vol("docs/" + rel); }
  // The document the indexer would have written for `rel` as it is now.
  IndexedEntry Doc(const std::string& rel) const {
    struct stat st;
    EXPECT_EQ(0, lstat(V(rel).c_str(), &st)) << rel;
    IndexedEntry e;
    e.path = V(rel);
    e.is_dir = S_ISDIR(st.st_mode);
    e.size = st.st_size;
    e.mtime = st.st_mtim.tv_sec;
    e.ctime = st.st_ctim.tv_sec;
    return e;
  }
  IndexedEntry Gone(const std::string& rel, bool is_dir = false) const {
    IndexedEntry e;
    e.path = V(rel);
    e.is_dir = is_dir;
    e.size = 1;
    e.mtime = 1;
    e.ctime = 1;
    return e;
  }
  bool Run(std::vector<IndexedEntry> docs, const std::atomic<bool>* stop = nullptr) {
    fileindex::FolderMgr folders;
    ListedEntries index(std::move(docs));
    Reconciler reconciler(folders, stop, nullptr);
    const bool done = reconciler.Run(V("a"), index, recorder_);
    counts_ = reconciler.counts();
    return done;
  }

  test::System sys_;
  Recorder recorder_;
  ReconcileCounts counts_;
};

TEST_F(ReconcilerTest, SendsExactlyTheDifferencesInPathOrder) {
  // Names on both sides of "/" in byte order ("d-x", "d.txt" < "d/in.txt" < "d0.txt") and a
  // nested tree, all unchanged, with every kind of difference between them.
  for (const char* rel :
       {"a/same.txt", "a/grown.txt", "a/touched.txt", "a/chowned.txt", "a/old-doc.txt", "a/d-x",
        "a/d.txt", "a/d/in.txt", "a/d0.txt", "a/sub/deep/x.txt", "a/was-dir", "a/@eaDir/thumb.txt",
        "a/new.txt", "a/was-file/n.txt"}) {
    test::WriteFile(V(rel), rel);
  }
  ASSERT_EQ(0, symlink(V("a/same.txt").c_str(), V("a/link.txt").c_str()));
  std::vector<IndexedEntry> docs;
  for (const char* rel : {"a", "a/same.txt", "a/d-x", "a/d.txt", "a/d", "a/d/in.txt", "a/d0.txt",
                          "a/sub", "a/sub/deep", "a/sub/deep/x.txt"}) {
    docs.push_back(Doc(rel));
  }
  docs.push_back(Doc("a/grown.txt"));
  docs.back().size -= 1;
  docs.push_back(Doc("a/touched.txt"));
  docs.back().mtime -= 10;
  docs.push_back(Doc("a/chowned.txt"));
  docs.back().ctime -= 10;
  docs.push_back(Doc("a/old-doc.txt"));
  docs.back().ctime = -1;
  for (const IndexedEntry& gone :
       {Gone("a/gone.txt"), Gone("a/gone-dir", true), Gone("a/gone-dir/f"),
        Gone("a/gone-dir/g", true), Gone("a/gone-dir/g/h"), Gone("a/was-dir", true),
        Gone("a/was-dir/1"), Gone("a/was-dir/2"), Gone("a/was-file"), Gone("a/@eaDir/thumb.txt"),
        Gone("a/link.txt")}) {
    docs.push_back(gone);
  }
  ASSERT_TRUE(Run(docs));
  EXPECT_THAT(
      recorder_.calls,
      ElementsAre("remove /a/@eaDir/thumb.txt", "refresh /a/chowned.txt attributes",
                  "remove /a/gone-dir and below", "remove /a/gone.txt", "refresh /a/grown.txt",
                  "remove /a/link.txt", "add /a/new.txt", "refresh /a/old-doc.txt attributes",
                  "refresh /a/touched.txt", "remove /a/was-dir and below", "refresh /a/was-dir",
                  "refresh /a/was-file/", "add /a/was-file/n.txt"));
  EXPECT_EQ(counts_.compared, 18u);
  EXPECT_EQ(counts_.added, 2u);
  EXPECT_EQ(counts_.removed, 9u);
  EXPECT_EQ(counts_.refreshed, 6u);
}

TEST_F(ReconcilerTest, AnUnchangedTreeCostsNothingAndAStopRemovesNothingUnreached) {
  auto rel = [](int i) { return "a/dir" + std::to_string(i % 3) + "/f" + std::to_string(i); };
  for (int i = 0; i < 30; ++i) test::WriteFile(V(rel(i)), "x");
  test::WriteFile(V("a/dir0/new.txt"), "n");
  std::vector<IndexedEntry> docs = {Doc("a"), Doc("a/dir0/new.txt")};
  for (int i = 0; i < 3; ++i) docs.push_back(Doc("a/dir" + std::to_string(i)));
  for (int i = 0; i < 30; ++i) docs.push_back(Doc(rel(i)));
  ASSERT_TRUE(Run(docs));
  EXPECT_THAT(recorder_.calls, IsEmpty());
  EXPECT_EQ(counts_.compared, 35u);

  // The walk stops at the first difference it hands over: the documents it has not reached yet
  // are not judged gone, and the caller is told.
  docs.erase(docs.begin() + 1);
  docs.push_back(Gone("a/zz-gone.txt"));
  std::atomic<bool> stop{false};
  recorder_.on_call = [&stop] { stop = true; };
  EXPECT_FALSE(Run(docs, &stop));
  EXPECT_THAT(recorder_.calls, ElementsAre("add /a/dir0/new.txt"));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
