#include "fileindex/queue_mgr.hpp"

#include <gmock/gmock.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <set>

#include "common/error.hpp"
#include "common/lock_file.hpp"
#include "common/util.hpp"
#include "fileindex/queue_file.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

std::string Line(uint32_t bits, const std::string& path, const std::string& extra = "") {
  return "{\"event\":" + std::to_string(bits) + ",\"path\":\"" + path + "\"" + extra + "}\n";
}

std::vector<std::string> Paths(QueueMgr& mgr) {
  std::vector<std::string> out;
  mgr.ProcessOP([&out](std::shared_ptr<OP> op) { out.push_back(op->node.lock()->GetPath()); },
                true);
  return out;
}

using test::ThrowsCode;

class QueueMgrTest : public ::testing::Test {
 protected:
  test::TempDir dir_;
  test::ScopedRoot root_{dir_.path()};
  std::string queue_ = dir_.Path("share/@eaDir/@fileindex/queue");
};

// A side file left by an interrupted pass goes first and the live queue waits; the next pass
// takes the live queue, so that new events start a fresh file.
TEST_F(QueueMgrTest, LeftoverSideFileGoesFirstThenTheLiveQueueIsTaken) {
  QueueMgr idle(queue_);
  EXPECT_TRUE(Paths(idle).empty());

  dir_.Write("share/@eaDir/@fileindex/queue.tmp", Line(2, "/v/s/old"));
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/new"));
  QueueMgr mgr(queue_);
  EXPECT_EQ(Paths(mgr), std::vector<std::string>{"/v/s/old"});
  EXPECT_EQ(test::ReadFile(queue_), Line(2, "/v/s/new"));
  mgr.DeleteTmp();
  EXPECT_FALSE(IsFileExist(queue_ + ".tmp"));
  QueueMgr next(queue_);
  EXPECT_EQ(Paths(next), std::vector<std::string>{"/v/s/new"});
  EXPECT_FALSE(IsFileExist(queue_));
  EXPECT_TRUE(IsFileExist(queue_ + ".tmp"));
}

// An unprivileged daemon meeting a queue folder it may read but not change, and a side file it
// may not read.
TEST_F(QueueMgrTest, RenameAndOpenFailuresAre502AndLeaveTheFiles) {
  const std::string folder = dir_.Path("share/@eaDir/@fileindex");
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/a"));
  const std::string unreadable = dir_.Write("other.tmp", Line(2, "/v/s/a"));
  ASSERT_EQ(chmod(dir_.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod(folder.c_str(), 0555), 0);
  ASSERT_EQ(chmod(unreadable.c_str(), 0), 0);
  const int result = test::RunAsUser("nobody", [this] {
    auto fails = [](const std::function<void()>& fn, const std::string& message) {
      return !::testing::Value(fn, ::testing::ThrowsMessage<Error>(message));
    };
    const std::string open_failed =
        "Orvane error, code=502, reason=[Failed to open queue, reason=Permission denied]";
    QueueMgr mgr(queue_);
    QueueMgr other(dir_.Path("other"));
    // A bit per failed check.
    return fails([&] { mgr.PrepareTmpQueue(); }, "Orvane error, code=502, reason=[cannot rename " +
                                                     queue_ + " to " + queue_ +
                                                     ".tmp: Permission denied]") +
           2 * fails([&] { other.ProcessOP([](std::shared_ptr<OP>) {}, true); }, open_failed) +
           4 * fails([&] { other.IsFullPathProcessing("/v/s/a"); }, open_failed);
  });
  chmod(folder.c_str(), 0755);
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(IsFileExist(queue_));
  EXPECT_FALSE(IsFileExist(queue_ + ".tmp"));
}

// A user who may write the share root plants the queue's folders with the queue a link to a
// root-only file: neither the watcher's append nor the indexer's batch goes through it. How the
// system then makes its own folders, root-only, is checked with the safe folders themselves.
TEST_F(QueueMgrTest, APlantedQueueIsNeitherWrittenNorRead) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as nobody";
  const std::string share = test::MakeOpenShare(dir_, "share");
  const std::string secret = dir_.Write("secret", "root only\n");
  ASSERT_EQ(chmod(secret.c_str(), 0600), 0);
  ASSERT_EQ(0, test::RunAsUser("nobody", [&] {
              return mkdir((share + "/@eaDir").c_str(), 0777) |
                     mkdir((share + "/@eaDir/@fileindex").c_str(), 0777) |
                     symlink(secret.c_str(), queue_.c_str());
            }));
  EXPECT_THAT([&] { QueueFileAppend(queue_, Line(2, "/v/s/a")); }, ThrowsCode(kErrUnsafePath));
  QueueMgr mgr(queue_);
  EXPECT_THAT([&] { mgr.PrepareTmpQueue(); }, ThrowsCode(kErrUnsafePath));
  EXPECT_THAT([&] { QueueFileReader reader(queue_); }, ThrowsCode(kErrUnsafePath));
  EXPECT_EQ(test::ReadFile(secret), "root only\n");
}

TEST_F(QueueMgrTest, RenameWaitsForTheWritersLock) {
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/a"));
  test::FakeEnv env;
  LockFile writer(queue_, true);
  QueueMgr mgr(queue_);
  EXPECT_THROW(mgr.PrepareTmpQueue(), Error);
  EXPECT_EQ(env.sleeps().size(), static_cast<size_t>(LockFile::kMaxAttempts));
  EXPECT_TRUE(IsFileExist(queue_));
  EXPECT_FALSE(IsFileExist(queue_ + ".tmp"));
}

TEST_F(QueueMgrTest, PendingPathQuestions) {
  dir_.Write("share/@eaDir/@fileindex/queue",
             Line(2, "/v/s/a/x") + Line(0x100, "/v/s/new", ",\"path_old\":\"/v/s/old\"") +
                 Line(0x10000 | 0x2, "/v/s/both"));
  dir_.Write("share/@eaDir/@fileindex/queue.tmp", Line(0x10000, "/v/s/r"));
  QueueMgr mgr(queue_);
  // The side file counts too; a path matches itself and its ancestors, by whole components.
  for (const char* path : {"/v/s/a", "/v/s/a/x", "/v/s/old", "/v/s/r", "/v/s"})
    EXPECT_TRUE(mgr.IsFullPathProcessing(path)) << path;
  for (const char* path : {"/v/s/r/deep", "/v/s/a/x/y", "/v/s/ab"})
    EXPECT_FALSE(mgr.IsFullPathProcessing(path)) << path;
  // A re-index covers what is below it, but not a sibling sharing letters or an ancestor, and a
  // line with other bits besides re-index is no plain re-index.
  EXPECT_TRUE(mgr.IsFullPathHasReindex("/v/s/r") && mgr.IsFullPathHasReindex("/v/s/r/a/b"));
  for (const char* path : {"/v/s/rx", "/v/s", "/v/s/both"})
    EXPECT_FALSE(mgr.IsFullPathHasReindex(path)) << path;

  // A malformed line is not skipped here: the question cannot be answered.
  dir_.Write("share/@eaDir/@fileindex/queue", "garbage\n");
  EXPECT_THAT([&] { mgr.IsFullPathHasReindex("/v/s/zzz"); }, ThrowsCode(kErrMalformedEvent));
  // Nor can it with a broken folder configuration.
  dir_.Write("var/packages/Orvane/etc/fileindex.folders", "[{");
  EXPECT_THAT([&] { mgr.IsFullPathProcessing("/v/s"); }, ThrowsCode(kErrLoadConfig));
}

// The indexing daemon's whole pass, with a writer appending from another process meanwhile:
// every line ends up in exactly one batch.
TEST_F(QueueMgrTest, ConcurrentWriterLosesNothing) {
  const int kLines = 2000;
  pid_t pid = fork();
  if (pid == 0) {
    for (int i = 0; i < kLines; ++i) {
      if (!QueueFileAppend(queue_, Line(2, "/v/s/f" + std::to_string(i)))) _exit(2);
    }
    _exit(0);
  }
  std::set<std::string> seen;
  int status = 0;
  bool writer_done = false;
  while (!writer_done || IsFileExist(queue_) || IsFileExist(queue_ + ".tmp")) {
    writer_done = writer_done || waitpid(pid, &status, WNOHANG) == pid;
    QueueMgr mgr(queue_);
    for (const std::string& p : Paths(mgr)) EXPECT_TRUE(seen.insert(p).second) << p;
    mgr.DeleteTmp();
  }
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(seen.size(), static_cast<size_t>(kLines));
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
