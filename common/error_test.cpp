#include "common/error.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>

#include "common/log.hpp"
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

#define ORVANE_TEST_NEGATIVE(v) (0 > (v))

void FailOnBehalfOf(const char* func) {
  ORVANE_THROW_IF_IN(func, ORVANE_TEST_NEGATIVE(-1), kErrElastic, "busy");
}

// The other sources and function names, the condition as written (its macros unexpanded), and
// the plain and failure log forms.
TEST(ErrorTest, NamedVariantsAndLogForms) {
  test::LogCapture log;
  errno = 0;
  EXPECT_THROW(FailOnBehalfOf("IndexRename"), Error);
  ORVANE_LOG_IF_FROM("lock_mutex", ORVANE_TEST_NEGATIVE(-2));
  ORVANE_LOG(LOG_ERR, "Start building [%s] %d%%", "db", 5);
  ORVANE_LOG_FAILED("%s failed. auth: %d", "Enum", 3);
  errno = ENOENT;
  ORVANE_LOG_FAILED_IN("AddCustomEvent", "share %s", "s%m");
  EXPECT_EQ(errno, 0);

  const std::string who = "\\(" + std::to_string(getpid()) + ", " +
                          std::to_string(geteuid()) + "\\) ";
  const auto lines = log.Lines();
  ASSERT_EQ(lines.size(), 5u);
  EXPECT_THAT(lines[0], MatchesRegex("error_test.cpp:[0-9]+ " + who +
                                     "\\(IndexRename\\) Failed \\[ORVANE_TEST_NEGATIVE\\(-1\\)\\], "
                                     "reason: Orvane error, code=913, reason=\\[busy\\]"));
  EXPECT_THAT(lines[1], MatchesRegex("lock_mutex:[0-9]+ " + who +
                                     "\\(TestBody\\) Failed \\[ORVANE_TEST_NEGATIVE\\(-2\\)\\]"));
  EXPECT_THAT(lines[2], MatchesRegex("error_test.cpp:[0-9]+ Start building \\[db\\] 5%"));
  EXPECT_THAT(lines[3], MatchesRegex("error_test.cpp:[0-9]+ " + who +
                                     "\\(TestBody\\) Enum failed. auth: 3"));
  // An argument's "%m" is text, not a directive.
  EXPECT_THAT(lines[4], MatchesRegex(".*\\(AddCustomEvent\\) share s%m \\[err: No such file or "
                                     "directory\\]"));
}

}  // namespace
}  // namespace orvane
