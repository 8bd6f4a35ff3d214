#include "common/error.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>

#include "test/test_util.hpp"

namespace orvane {
namespace {

using ::testing::MatchesRegex;

void ThrowWhenNegative(int v) { ORVANE_THROW_IF(0 > v, kErrSystem, "negative"); }

// The throw site logs where, who and why; errno, when set, is named and then cleared.
TEST(ErrorTest, ThrowSiteAndLoggedOnlyFormsLogOneLine) {
  test::LogCapture log;
  errno = 0;
  ThrowWhenNegative(1);
  try {
    ThrowWhenNegative(-1);
    FAIL() << "no throw";
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrSystem);
    EXPECT_STREQ(e.what(), "Orvane error, code=502, reason=[negative]");
  }
  errno = ENOENT;
  EXPECT_THROW(ThrowWhenNegative(-2), Error);
  EXPECT_EQ(errno, 0);
  errno = 0;
  EXPECT_FALSE(ORVANE_LOG_IF(1 + 1 == 3));
  EXPECT_TRUE(ORVANE_LOG_IF(1 + 1 == 2));
  errno = EACCES;
  ORVANE_LOG_IF(true);
  EXPECT_EQ(errno, 0);

  const std::string prefix = "error_test.cpp:[0-9]+ \\(" + std::to_string(getpid()) + ", " +
                             std::to_string(geteuid()) + "\\) ";
  const std::string reason = "reason: Orvane error, code=502, reason=\\[negative\\]";
  const auto lines = log.Lines();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_THAT(lines[0],
              MatchesRegex(prefix + "\\(ThrowWhenNegative\\) Failed \\[0 > v\\], " + reason));
  EXPECT_THAT(lines[1],
              MatchesRegex(prefix + ".*" + reason + " \\[err: No such file or directory\\]"));
  EXPECT_THAT(lines[2], MatchesRegex(prefix + "\\(TestBody\\) Failed \\[1 \\+ 1 == 2\\]"));
  EXPECT_THAT(lines[3], MatchesRegex(".*Failed \\[true\\] \\[err: Permission denied\\]"));
}

}  // namespace
}  // namespace orvane
