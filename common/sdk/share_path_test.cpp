#include "common/sdk/share_path.hpp"

#include <gtest/gtest.h>

#include "common/error.hpp"
#include "common/util.hpp"
#include "test/faults.hpp"
#include "test/share_fixture.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace sdk {
namespace {

class SharePathTest : public test::ShareFixture {
 protected:
  void SetUp() override {
    WriteShares(R"({"name": "music", "path": "/v1/music"}, {"name": "homes", "path": "/v1/homes"})");
  }
};

TEST_F(SharePathTest, ShareFormAndHomeForm) {
  const User nobody("nobody", 65534, 65534, true);
  EXPECT_EQ(nobody.GetHomePath(), "/v1/homes/nobody");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/music", nobody, false), "/music");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/music/a b/é.flac", nobody, true), "/music/a b/é.flac");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/homes/nobody/docs", nobody, true), "/home/docs");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/homes/nobody", nobody, true), "/home");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/homes/nobody/docs", nobody, false),
            "/homes/nobody/docs");
  // Another user's home, and a name that merely starts like the user's, stay in share form.
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/homes/bob/docs", nobody, true), "/homes/bob/docs");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/homes/nobodyelse/x", nobody, true),
            "/homes/nobodyelse/x");
  // Home service off for the user: share form.
  const User off("nobody", 65534, 65534, false);
  EXPECT_EQ(off.GetHomePath(), "");
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/homes/nobody/docs", off, true), "/homes/nobody/docs");
}

TEST_F(SharePathTest, PathsInNoShareAndFailingHomeLookups) {
  test::LogCapture log;
  const User nobody("nobody", 65534, 65534, true);
  EXPECT_EQ(SharePathMgr::GetSharePath("/v1/musicbox/a", nobody, false), "");
  EXPECT_TRUE(log.Contains(
      "(GetSharePath) QUIXShareNamePathGet failed, vol_path=/v1/musicbox/a [err: No such file or directory]"));
  EXPECT_EQ(errno, 0);
  EXPECT_EQ(SharePathMgr::GetSharePath("", nobody, false), "");

  platform::ScopedFaults faults;
  faults.Arm("QUIXServiceHomePathGet", platform::Fault{-1, EIO});
  try {
    SharePathMgr::GetSharePath("/v1/homes/nobody/docs", nobody, true);
    ADD_FAILURE();
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrSystem);
    EXPECT_EQ(e.message, "Orvane error, code=502, reason=[QUIXServiceHomePathGet failed, user=nobody]");
  }
  EXPECT_TRUE(log.Contains("Failed [0 > QUIXServiceHomePathGet(name_.c_str(), path, sizeof(path))]"));
}

TEST_F(SharePathTest, UsersAreBuiltFromThePlatform) {
  auto nobody = GetUser("nobody");
  EXPECT_EQ(nobody->GetUID(), 65534u);
  EXPECT_TRUE(nobody->IsHomeEnabled());
  EXPECT_EQ(GetUserByUID(0)->GetName(), "root");
  try {
    GetUser("no such user");
    ADD_FAILURE();
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrChown);
  }
  test::WritePlatformConfig(root_.path(), R"({"shares": []})");
  EXPECT_FALSE(GetUser("nobody")->IsHomeEnabled());
}

}  // namespace
}  // namespace sdk
}  // namespace orvane
