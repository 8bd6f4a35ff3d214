#include "common/error.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>

#include "test/test_util.hpp"

namespace orvane {
namespace {

using ::testing::MatchesRegex;

TEST(ErrorTest, MessageCarriesCodeAndOptionalReasonVerbatim) {
  EXPECT_STREQ(Error(kErrSystem).what(), "Orvane error, code=502");
  EXPECT_STREQ(Error(kErrSystem, "").what(), "Orvane error, code=502");
  Error e(kErrMalformedEvent, "bad ] line [x]");
  EXPECT_STREQ(e.what(), "Orvane error, code=906, reason=[bad ] line [x]]");
  EXPECT_EQ(e.code, kErrMalformedEvent);
  Error copy(e);
  EXPECT_EQ(copy.code, e.code);
  EXPECT_STREQ(copy.what(), e.what());
  EXPECT_STREQ(static_cast<const std::runtime_error&>(copy).what(), e.what());
}

void ThrowWhenNegative(int v) { ORVANE_THROW_IF(0 > v, kErrSystem, "negative"); }

TEST(ErrorTest, ThrowSiteLogsConditionAndWholeMessage) {
  test::LogCapture log;
  errno = 0;
  try {
    ThrowWhenNegative(-1);
    FAIL() << "no throw";
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrSystem);
    EXPECT_STREQ(e.what(), "Orvane error, code=502, reason=[negative]");
  }
  const std::string prefix = "error_test.cpp:[0-9]+ \\(" + std::to_string(getpid()) + ", " +
                             std::to_string(geteuid()) + "\\) \\(ThrowWhenNegative\\) ";
  ASSERT_EQ(log.Lines().size(), 1u);
  EXPECT_THAT(log.Lines()[0],
              MatchesRegex(prefix + "Failed \\[0 > v\\], reason: Orvane error, code=502, "
                                    "reason=\\[negative\\]"));

  log.Clear();
  errno = ENOENT;
  EXPECT_THROW(ThrowWhenNegative(-2), Error);
  EXPECT_EQ(errno, 0);
  ASSERT_EQ(log.Lines().size(), 1u);
  EXPECT_THAT(log.Lines()[0], MatchesRegex(prefix + ".*reason=\\[negative\\] \\[err: No such "
                                                    "file or directory\\]"));
  log.Clear();
  ThrowWhenNegative(1);
  EXPECT_TRUE(log.Lines().empty());
}

TEST(ErrorTest, LoggedOnlyFormHasNoReason) {
  test::LogCapture log;
  errno = 0;
  EXPECT_TRUE(ORVANE_LOG_IF(1 + 1 == 2));
  EXPECT_FALSE(ORVANE_LOG_IF(1 + 1 == 3));
  errno = EACCES;
  ORVANE_LOG_IF(true);
  EXPECT_EQ(errno, 0);
  auto lines = log.Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_THAT(lines[0], MatchesRegex(".*\\(TestBody\\) Failed \\[1 \\+ 1 == 2\\]"));
  EXPECT_THAT(lines[1], MatchesRegex(".*Failed \\[true\\] \\[err: Permission denied\\]"));
}

}  // namespace
}  // namespace orvane
