#include "common/lock_file.hpp"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <memory>

#include "common/error.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace {

TEST(LockFileTest, ExcludesWithinOneProcessAndFailsAtOnceOnAMissingFolder) {
  test::FakeEnv env;
  test::LogCapture log;
  test::TempDir dir;
  const std::string missing = dir.Path("no/such/lock");
  try {
    LockFile lock(missing, true);
    FAIL();
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrLockFile);
    EXPECT_EQ(std::string(e.what()), "Orvane error, code=506, reason=[open failed, path=" +
                                         missing + ", reason=No such file or directory]");
  }
  EXPECT_TRUE(env.sleeps().empty());
  EXPECT_TRUE(log.Contains("Failed [0 > (fd_ = open(path_.c_str(), O_RDONLY | O_CREAT, 0644))]"));

  const std::string path = dir.Path("lock");
  auto first = std::make_unique<LockFile>(path, true);
  EXPECT_THROW(LockFile(path, true), Error);
  first.reset();
  {
    LockFile s1(path, false);
    LockFile s2(path, false);  // shared locks coexist
    EXPECT_THROW(LockFile(path, true), Error);
  }
  LockFile again(path, true);
}

TEST(LockFileTest, BusyLockHeldByAnotherProcessGivesUpAfter64Attempts) {
  test::TempDir dir;
  const std::string path = dir.Path("lock");
  int ready[2];
  int release[2];
  ASSERT_EQ(pipe(ready), 0);
  ASSERT_EQ(pipe(release), 0);
  pid_t pid = fork();
  if (pid == 0) {
    LockFile held(path, true);
    char c = 'x';
    (void)!write(ready[1], &c, 1);
    (void)!read(release[0], &c, 1);
    _exit(0);
  }
  char c;
  ASSERT_EQ(read(ready[0], &c, 1), 1);
  {
    test::FakeEnv env;
    env.QueueRand({3, 19});
    try {
      LockFile lock(path, true);
      FAIL();
    } catch (const Error& e) {
      EXPECT_EQ(std::string(e.what()),
                "Orvane error, code=506, reason=[Exceed max retry, path=" + path + "]");
    }
    ASSERT_EQ(env.sleeps().size(), 64u);
    EXPECT_EQ(env.sleeps()[0], 300000);
    EXPECT_EQ(env.sleeps()[1], 900000);
    EXPECT_EQ(env.sleeps()[2], 0);
  }
  ASSERT_EQ(write(release[1], "x", 1), 1);
  int status;
  waitpid(pid, &status, 0);
  // Released with its holder: the next attempt succeeds at once.
  test::FakeEnv env;
  LockFile lock(path, true);
  EXPECT_TRUE(env.sleeps().empty());
}

}  // namespace
}  // namespace orvane
