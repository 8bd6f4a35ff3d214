#include "fileindex/queue_mgr.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <set>

#include "common/error.hpp"
#include "common/lock_file.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

std::string Line(uint32_t bits, const std::string& path, const std::string& extra = "") {
  return "{\"event\":" + std::to_string(bits) + ",\"path\":\"" + path + "\"" + extra + "}\n";
}

std::vector<std::string> Paths(QueueMgr& mgr, bool tmp, size_t* count = nullptr) {
  std::vector<std::string> out;
  size_t n = mgr.ProcessOP(
      [&out](std::shared_ptr<OP> op) { out.push_back(op->node.lock()->GetPath()); }, tmp);
  if (count != nullptr) *count = n;
  return out;
}

class QueueMgrTest : public ::testing::Test {
 protected:
  test::TempDir dir_;
  test::ScopedRoot root_{dir_.path()};
  std::string queue_ = dir_.Path("share/@eaDir/@fileindex/queue");
};

TEST_F(QueueMgrTest, NoFilesMeansNothingToDo) {
  QueueMgr mgr(queue_);
  size_t count = 7;
  EXPECT_TRUE(Paths(mgr, true, &count).empty());
  EXPECT_EQ(count, 0u);
  EXPECT_TRUE(Paths(mgr, false, &count).empty());
  EXPECT_EQ(count, 0u);
  EXPECT_FALSE(mgr.IsFullPathProcessing("/v/s"));
  EXPECT_FALSE(mgr.IsFullPathHasReindex("/v/s"));
}

TEST_F(QueueMgrTest, PassTakesTheLiveQueueAndNewEventsStartAFreshFile) {
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/a"));
  QueueMgr mgr(queue_);
  EXPECT_EQ(Paths(mgr, true), std::vector<std::string>{"/v/s/a"});
  EXPECT_FALSE(IsFileExist(queue_));
  EXPECT_TRUE(IsFileExist(queue_ + ".tmp"));
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/b"));
  mgr.DeleteTmp();
  EXPECT_FALSE(IsFileExist(queue_ + ".tmp"));

  QueueMgr next(queue_);
  EXPECT_EQ(Paths(next, true), std::vector<std::string>{"/v/s/b"});
}

TEST_F(QueueMgrTest, LeftoverSideFileGoesFirstAndLiveQueueWaits) {
  dir_.Write("share/@eaDir/@fileindex/queue.tmp", Line(2, "/v/s/old"));
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/new"));
  QueueMgr mgr(queue_);
  EXPECT_EQ(Paths(mgr, true), std::vector<std::string>{"/v/s/old"});
  EXPECT_EQ(test::ReadFile(queue_), Line(2, "/v/s/new"));
  // Reading the live queue in place neither renames nor locks it away.
  EXPECT_EQ(Paths(mgr, false), std::vector<std::string>{"/v/s/new"});
  EXPECT_TRUE(IsFileExist(queue_));
}

// An unprivileged daemon meeting a folder it may read but not change.
TEST_F(QueueMgrTest, RenameFailureIs502AndLeavesTheQueue) {
  const std::string folder = dir_.Path("share/@eaDir/@fileindex");
  dir_.Write("share/@eaDir/@fileindex/queue", Line(2, "/v/s/a"));
  ASSERT_EQ(chmod(dir_.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod(folder.c_str(), 0555), 0);
  const int result = test::RunAsUser("nobody", [this] {
    test::LogCapture log;
    QueueMgr mgr(queue_);
    try {
      mgr.PrepareTmpQueue();
      return 1;
    } catch (const Error& e) {
      if (std::string(e.what()) !=
          "Orvane error, code=502, reason=[rename failed, reason=Permission denied]") {
        return 2;
      }
    }
    return log.Contains("Failed [0 > rename(queue_path_.c_str(), queue_path_tmp_.c_str())]") ? 0
                                                                                             : 3;
  });
  chmod(folder.c_str(), 0755);
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(IsFileExist(queue_));
  EXPECT_FALSE(IsFileExist(queue_ + ".tmp"));
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

TEST_F(QueueMgrTest, UnreadableQueueIs502) {
  dir_.Write("share/@eaDir/@fileindex/queue.tmp", Line(2, "/v/s/a"));
  ASSERT_EQ(chmod(dir_.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod((queue_ + ".tmp").c_str(), 0), 0);
  const int result = test::RunAsUser("nobody", [this] {
    test::LogCapture log;
    const std::string expected =
        "Orvane error, code=502, reason=[Failed to open queue, reason=Permission denied]";
    QueueMgr mgr(queue_);
    try {
      mgr.ProcessOP([](std::shared_ptr<OP>) {}, true);
      return 1;
    } catch (const Error& e) {
      if (e.what() != expected) return 2;
    }
    try {
      mgr.IsFullPathProcessing("/v/s/a");
      return 3;
    } catch (const Error& e) {
      if (e.what() != expected) return 4;
    }
    return log.Count("Failed [!input_stream]") == 2 ? 0 : 5;
  });
  EXPECT_EQ(result, 0);
}

TEST_F(QueueMgrTest, PendingPathQuestions) {
  dir_.Write("share/@eaDir/@fileindex/queue",
             Line(2, "/v/s/a/x") + Line(0x100, "/v/s/new", ",\"path_old\":\"/v/s/old\"") +
                 Line(0x10000 | 0x2, "/v/s/both"));
  dir_.Write("share/@eaDir/@fileindex/queue.tmp", Line(0x10000, "/v/s/r"));
  QueueMgr mgr(queue_);
  EXPECT_TRUE(mgr.IsFullPathProcessing("/v/s/a"));
  EXPECT_TRUE(mgr.IsFullPathProcessing("/v/s/a/x"));
  EXPECT_TRUE(mgr.IsFullPathProcessing("/v/s/old"));
  EXPECT_TRUE(mgr.IsFullPathProcessing("/v/s/r"));  // found in the side file
  EXPECT_TRUE(mgr.IsFullPathProcessing("/v/s"));
  EXPECT_FALSE(mgr.IsFullPathProcessing("/v/s/r/deep"));
  EXPECT_FALSE(mgr.IsFullPathProcessing("/v/s/a/x/y"));
  EXPECT_FALSE(mgr.IsFullPathProcessing("/v/s/ab"));

  EXPECT_TRUE(mgr.IsFullPathHasReindex("/v/s/r"));
  EXPECT_TRUE(mgr.IsFullPathHasReindex("/v/s/r/a/b"));
  EXPECT_FALSE(mgr.IsFullPathHasReindex("/v/s/rx"));
  EXPECT_FALSE(mgr.IsFullPathHasReindex("/v/s"));
  EXPECT_FALSE(mgr.IsFullPathHasReindex("/v/s/both"));  // other bits besides re-index

  // A malformed line is not skipped here: the question cannot be answered.
  dir_.Write("share/@eaDir/@fileindex/queue", "garbage\n");
  try {
    mgr.IsFullPathHasReindex("/v/s/zzz");
    FAIL();
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrMalformedEvent);
  }
}

TEST_F(QueueMgrTest, BrokenFolderConfigurationFailsTheProcessingQuestion) {
  dir_.Write("var/packages/Orvane/etc/fileindex.folders", "[{");
  QueueMgr mgr(queue_);
  try {
    mgr.IsFullPathProcessing("/v/s");
    FAIL();
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrLoadConfig);
  }
  dir_.Write("var/packages/Orvane/etc/fileindex.folders", "[]");
  EXPECT_FALSE(mgr.IsFullPathProcessing("/v/s"));
}

// The indexing daemon's whole pass, with a writer appending from another process meanwhile:
// every line ends up in exactly one batch.
TEST_F(QueueMgrTest, ConcurrentWriterLosesNothing) {
  const int kLines = 2000;
  ASSERT_TRUE(MakeParentDirs(queue_));
  pid_t pid = fork();
  if (pid == 0) {
    for (int i = 0; i < kLines; ++i) {
      for (;;) {
        // The descriptor locked must still be the live queue: it may just have become the
        // side file, in which case the line would land in a batch already read.
        int fd = open(queue_.c_str(), O_WRONLY | O_APPEND | O_CREAT, 0644);
        if (fd < 0 || flock(fd, LOCK_EX) != 0) _exit(2);
        struct stat locked, current;
        if (fstat(fd, &locked) != 0 || stat(queue_.c_str(), &current) != 0 ||
            locked.st_ino != current.st_ino) {
          close(fd);
          continue;
        }
        const std::string line = Line(2, "/v/s/f" + std::to_string(i));
        if (write(fd, line.data(), line.size()) != static_cast<ssize_t>(line.size())) _exit(3);
        close(fd);
        break;
      }
    }
    _exit(0);
  }
  std::set<std::string> seen;
  int status = 0;
  bool writer_done = false;
  while (!writer_done || IsFileExist(queue_) || IsFileExist(queue_ + ".tmp")) {
    writer_done = writer_done || waitpid(pid, &status, WNOHANG) == pid;
    QueueMgr mgr(queue_);
    for (const std::string& p : Paths(mgr, true)) EXPECT_TRUE(seen.insert(p).second) << p;
    mgr.DeleteTmp();
  }
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(seen.size(), static_cast<size_t>(kLines));
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
