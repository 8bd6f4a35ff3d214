#include "common/sdk/credentials.hpp"

#include <gtest/gtest.h>
#include <unistd.h>

#include "common/error.hpp"
#include "platform/user.hpp"
#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace sdk {
namespace {

using platform::Fault;
using platform::ScopedFaults;

constexpr uid_t kNobody = 65534;

// Real switches of the process's identity: only root can make them.
class SDKCredentialsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "credential switches need root; running as " << geteuid();
    test::WritePlatformConfig(root_.path(), R"({"shares": [], "admin_group": "fi-no-such-group"})");
  }
  void TearDown() override {
    // Whatever a test did, the next one starts as root.
    if (getuid() == 0 && geteuid() != 0)
      ASSERT_TRUE(platform::ResetCredentialsByName("root", true));
  }

  test::TempDir root_;
  test::ScopedRoot scoped_{root_.path()};
};

TEST_F(SDKCredentialsTest, SwitchToAUserAndBackTakesTheUsersGroupsOnly) {
  {
    SDKCredentials saved;  // root, restored at scope end
    saved.AsUser("nobody");
    EXPECT_EQ(geteuid(), kNobody);
    EXPECT_EQ(getegid(), static_cast<gid_t>(65534));
    // Root's supplementary groups would otherwise open what nobody must not read.
    gid_t groups[8];
    ASSERT_EQ(getgroups(8, groups), 1);
    EXPECT_EQ(groups[0], static_cast<gid_t>(65534));
  }
  EXPECT_EQ(geteuid(), 0u);
  EXPECT_EQ(getegid(), 0u);

  // An administrator runs as root.
  test::WritePlatformConfig(root_.path(), R"({"shares": [], "admin_group": "nogroup"})");
  SDKCredentials saved;
  saved.AsUser("nobody");  // nobody's primary group is the administrators group now
  EXPECT_EQ(geteuid(), 0u);
}

TEST_F(SDKCredentialsTest, ANamedScopeReappliesItsNameAndOnlyYourselfIsReachableWithoutRoot) {
  test::LogCapture log;
  {
    SDKCredentials as_nobody("nobody");
    EXPECT_EQ(geteuid(), kNobody);
    SDKCredentials inner;  // remembers nobody
    try {
      inner.AsUser("daemon");
      ADD_FAILURE() << "nobody became daemon";
    } catch (const Error& e) {
      EXPECT_EQ(e.message, "Orvane error, code=503");
    }
    EXPECT_TRUE(log.Contains("Failed [!ResetCredentialsByName(target_username)]"));
    EXPECT_EQ(geteuid(), kNobody);
  }
  // The named scope went back to "nobody", not to the root it found at construction.
  EXPECT_EQ(geteuid(), kNobody);
  ASSERT_TRUE(platform::ResetCredentialsByName("root", true));
}

TEST_F(SDKCredentialsTest, FailedLookupsAndSwitchesAreErrorsOrLogLines) {
  ScopedFaults faults;
  test::LogCapture log;
  // The failure text loses as many leading characters as the platform error number says.
  auto failure = [] {
    try {
      SDKCredentials saved;
    } catch (const Error& e) {
      return e.message;
    }
    return std::string("no error");
  };
  faults.Arm("QUIXUserGetByUID", Fault{-1, ENOENT, 8});
  EXPECT_EQ(failure(), "Orvane error, code=503, reason=[GetByUID failed, err=]");
  EXPECT_TRUE(log.Contains("Failed [0 > QUIXUserGetByUID(euid_, &user_info) || !user_info]"));
  // A number past the end of the text gives an empty reason rather than a read outside it.
  faults.Arm("QUIXUserGetByUID", Fault{-1, ENOENT, 0x1700});
  EXPECT_EQ(failure(), "Orvane error, code=503");

  faults.Arm("ResetCredentialsByName", Fault{0, EPERM});
  EXPECT_THROW(SDKCredentials("nobody"), Error);
  EXPECT_EQ(geteuid(), 0u);

  // The destructor only logs: the switch back fails and the process stays nobody.
  {
    SDKCredentials saved;
    saved.AsUser("nobody");
    faults.Arm("ResetCredentialsByName", Fault{0, EPERM});
  }
  EXPECT_TRUE(
      log.Contains("Failed [!ResetCredentialsByName(username_)] [err: Operation not permitted]"));
  EXPECT_EQ(geteuid(), kNobody);
}

}  // namespace
}  // namespace sdk
}  // namespace orvane
