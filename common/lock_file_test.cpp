#include "common/lock_file.hpp"

#include <gtest/gtest.h>

#include <memory>

#include "common/error.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace {

std::string LockError(const std::string& path, bool exclusive) {
  try {
    LockFile lock(path, exclusive);
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrLockFile);
    return e.what();
  }
  return "no error";
}

// flock works per open file, so a second lock in the same process contends like another
// process would.
TEST(LockFileTest, ContendedLocksRetry64TimesAndAMissingFolderFailsAtOnce) {
  test::FakeEnv env;
  test::LogCapture log;
  test::TempDir dir;
  const std::string missing = dir.Path("no/such/lock");
  EXPECT_EQ(LockError(missing, true), "Orvane error, code=506, reason=[open failed, path=" +
                                          missing + ", reason=No such file or directory]");
  EXPECT_TRUE(env.sleeps().empty());
  EXPECT_TRUE(log.Contains("Failed [0 > (fd_ = open(path_.c_str(), O_RDONLY | O_CREAT, 0644))]"));

  const std::string path = dir.Path("lock");
  auto first = std::make_unique<LockFile>(path, true);
  env.QueueRand({3, 19});
  EXPECT_EQ(LockError(path, true),
            "Orvane error, code=506, reason=[Exceed max retry, path=" + path + "]");
  ASSERT_EQ(env.sleeps().size(), 64u);
  EXPECT_EQ(env.sleeps()[0], 300000);
  EXPECT_EQ(env.sleeps()[1], 900000);
  EXPECT_EQ(env.sleeps()[2], 0);
  first.reset();
  {
    LockFile s1(path, false);
    LockFile s2(path, false);  // shared locks coexist
    EXPECT_NE(LockError(path, true), "no error");
  }
  // Released with its holder: the next attempt succeeds at once.
  const size_t slept = env.sleeps().size();
  LockFile again(path, true);
  EXPECT_EQ(env.sleeps().size(), slept);
}

}  // namespace
}  // namespace orvane
