#include "common/lock_file.hpp"

#include <gtest/gtest.h>

#include <memory>

#include "common/error.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace {

std::string LockError(const std::string& path) {
  return test::ErrorOf([&] { LockFile lock(path, true); }).message;
}

// flock works per open file, so a second lock in the same process contends like another
// process would.
TEST(LockFileTest, ContendedLocksRetry64TimesAndAMissingFolderFailsAtOnce) {
  test::FakeEnv env;
  test::TempDir dir;
  const std::string missing = dir.Path("no/such/lock");
  EXPECT_EQ(LockError(missing), "Orvane error, code=506, reason=[open failed, path=" + missing +
                                    ", reason=No such file or directory]");
  EXPECT_TRUE(env.sleeps().empty());

  const std::string path = dir.Path("lock");
  auto first = std::make_unique<LockFile>(path, true);
  env.QueueRand({3, 19});
  EXPECT_EQ(LockError(path),
            "Orvane error, code=506, reason=[Exceed max retry, path=" + path + "]");
  ASSERT_EQ(env.sleeps().size(), 64u);
  EXPECT_EQ(env.sleeps()[0], 300000);
  EXPECT_EQ(env.sleeps()[1], 900000);
  first.reset();
  {
    LockFile s1(path, false);
    LockFile s2(path, false);  // shared locks coexist
    EXPECT_NE(LockError(path), "");
  }
  // Released with its holder: the next attempt succeeds at once.
  const size_t slept = env.sleeps().size();
  LockFile again(path, true);
  EXPECT_EQ(env.sleeps().size(), slept);
}

}  // namespace
}  // namespace orvane
