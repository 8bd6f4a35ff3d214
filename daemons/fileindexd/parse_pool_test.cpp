// The extraction pool with real helper processes: the helper here is a script that answers at
// once, except for files named "slow", which it answers only once a release file exists (or
// after 30 s, so that it never outlives the test for long).
#include "daemons/fileindexd/parse_pool.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <cstdlib>
#include <set>

#include "extract/content_extract.hpp"
#include "extract/extract_runner.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindexd {
namespace {

class ParsePoolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    const std::string helper = dir_.Write("helper", "#!/bin/bash\nrelease=" + Release() + R"(
while IFS= read -r -d '' path; do
  case "$path" in *slow*)
    for i in $(seq 600); do [ -e "$release" ] && break; sleep 0.05; done ;;
  esac
  printf '{"fields":{"QUIXMDTextContent":"read"}}\n'
done)");
    ASSERT_EQ(0, chmod(helper.c_str(), 0755));
    setenv("FILEINDEX_EXTRACT_HELPER", helper.c_str(), 1);
  }
  void TearDown() override {
    // The helper still reading the slow file ends before its folder goes.
    dir_.Write("release", "");
    extract::CloseIdleExtractHelpers();
    unsetenv("FILEINDEX_EXTRACT_HELPER");
  }
  std::string Release() const { return dir_.Path("release"); }

  test::TempDir dir_;
};

TEST_F(ParsePoolTest, DocumentsComeOutAsTheyAreDoneAndASlowOneHoldsOneThread) {
  namespace ce = QUIX::CONTENT_EXTRACT;
  ParsePool pool(2);
  pool.Submit(dir_.Write("slow.txt", "s"), true);
  pool.Submit(dir_.Write("a.txt", "a"), true);
  pool.Submit(dir_.Write("b.txt", "b"), false);
  pool.Submit(dir_.Path("gone.txt"), true);
  std::set<std::string> names;
  ParsePool::Result result;
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(pool.Next(&result, true));
    names.insert(result.doc[ce::QUIXMDFSName].asString());
    if (result.path == dir_.Path("gone.txt")) {
      EXPECT_FALSE(result.ok);
      EXPECT_NE(result.error.find("statx failed, path=" + result.path), std::string::npos);
    } else {
      EXPECT_TRUE(result.ok) << result.error;
      // Contents only when asked for.
      EXPECT_EQ(result.doc.isMember("QUIXMDTextContent"), result.path == dir_.Path("a.txt"));
    }
  }
  EXPECT_EQ(names, (std::set<std::string>{"", "a.txt", "b.txt"}));
  EXPECT_FALSE(pool.Next(&result, false));
  EXPECT_EQ(pool.outstanding(), 1u);
  dir_.Write("release", "");
  ASSERT_TRUE(pool.Next(&result, true));
  EXPECT_EQ(result.doc["QUIXMDTextContent"], "read");
  EXPECT_EQ(pool.outstanding(), 0u);
  EXPECT_FALSE(pool.Next(&result, true));  // nothing left to wait for
}

// A worker told to stop does not wait for an extraction in progress: the pool goes at once and
// the thread ends on its own once the helper answers (or is killed at its time limit).
TEST_F(ParsePoolTest, APoolGoesAwayWithoutWaitingForAFileStillBeingRead) {
  const auto start = std::chrono::steady_clock::now();
  {
    ParsePool pool(1);
    pool.Submit(dir_.Write("slow.txt", "s"), true);
    pool.Submit(dir_.Write("never.txt", "n"), true);
    ParsePool::Result result;
    EXPECT_FALSE(pool.Next(&result, false));
  }
  // The helper's own limit is a minute; a pool that waited would take that long.
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(30));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
