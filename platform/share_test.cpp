#include "platform/share.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include "common/root.hpp"
#include "platform/fileidx.hpp"
#include "platform/platform_error.hpp"
#include "platform/quota.hpp"
#include "test/faults.hpp"
#include "test/share_fixture.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

using ShareRecord = std::unique_ptr<QUIXSHARE, void (*)(PQUIXSHARE)>;

ShareRecord GetShare(const char* name) {
  PQUIXSHARE share = nullptr;
  EXPECT_EQ(QUIXShareGet(name, &share), 0) << name;
  return ShareRecord(share, QUIXShareFree);
}

class PlatformShareTest : public test::ShareFixture {
 protected:
  void SetUp() override {
    chmod(vol_.c_str(), 0755);
    WriteShares(R"(
      {"name": "music", "path": ")" + vol_ + R"(/music", "recycle_bin": true},
      {"name": "live", "path": ")" + vol_ + R"(/music/live"},
      {"name": "mu", "path": ")" + vol_ + R"(/mu", "readonly": true},
      {"name": "homes", "path": ")" + vol_ + R"(/homes", "recycle_bin": true},
      {"name": "open", "path": ")" + vol_ + R"(/open"},
      {"name": "acl", "path": ")" + vol_ + R"(/acl",
       "access": {"users": {"nobody": "ro", "daemon": "na"}, "groups": {"root": "rw"}}})");
  }
};

// The flags themselves are read through the share objects built on these records.
TEST_F(PlatformShareTest, LookUpsFindTheDeepestShareOnWholeComponentsAndEnumListsAll) {
  PQUIXSHARE missing = nullptr;
  EXPECT_EQ(QUIXShareGet("Music", &missing), -1);
  EXPECT_EQ(missing, nullptr);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(QLIBCErrGet(), kQErrNoSuchShare);

  char name[492];
  char path[4096];
  auto find = [&](const std::string& p) -> std::string {
    if (QUIXShareNamePathGet(p.c_str(), name, sizeof(name), path, sizeof(path)) != 0) return "-";
    return std::string(name) + " " + path;
  };
  EXPECT_EQ(find(vol_ + "/music"), "music " + vol_ + "/music");
  EXPECT_EQ(find(vol_ + "/music/live/x"), "live " + vol_ + "/music/live");
  EXPECT_EQ(find(vol_ + "/music/lively"), "music " + vol_ + "/music");
  EXPECT_EQ(find(vol_ + "/musicbox/a"), "-");
  EXPECT_EQ(find(vol_), "-");
  EXPECT_EQ(find("relative/music"), "-");
  EXPECT_EQ(errno, EINVAL);
  char tiny[4];
  EXPECT_EQ(
      QUIXShareNamePathGet((vol_ + "/music/x").c_str(), tiny, sizeof(tiny), path, sizeof(path)),
      -1);
  EXPECT_EQ(errno, ERANGE);
  EXPECT_STREQ(tiny, "");

  PSZLIST list = QLIBCSzListAlloc(4);  // grows as needed
  std::unique_ptr<QLIBSZLIST, void (*)(PSZLIST)> owned(list, QLIBCSzListFree);
  EXPECT_EQ(QLIBShareEnum(&list, nullptr), 6);
  EXPECT_STREQ(QLIBCSzListGet(list, 5), "acl");
  EXPECT_EQ(QLIBCSzListGet(list, 6), nullptr);
}

TEST_F(PlatformShareTest, UserPrivilegeFollowsTheAccessMapThenTheFolderBits) {
  ASSERT_EQ(mkdir((vol_ + "/open").c_str(), 0755), 0);
  ShareRecord open = GetShare("open");
  ShareRecord acl = GetShare("acl");
  EXPECT_EQ(QUIXShareUserPrivCalc("root", open.get()), SHARE_READWRITE);
  // No entry for nobody on "open": the folder (root's, 0755) lets others read only.
  EXPECT_EQ(QUIXShareUserPrivCalc("nobody", open.get()), SHARE_READONLY);
  ASSERT_EQ(chmod((vol_ + "/open").c_str(), 0750), 0);
  EXPECT_EQ(QUIXShareUserPrivCalc("nobody", open.get()), SHARE_NOACCESS);
  ASSERT_EQ(chmod((vol_ + "/open").c_str(), 0777), 0);
  EXPECT_EQ(QUIXShareUserPrivCalc("nobody", open.get()), SHARE_READWRITE);

  // Map entries decide, the folder (which does not even exist) is not asked.
  EXPECT_EQ(QUIXShareUserPrivCalc("nobody", acl.get()), SHARE_READONLY);
  EXPECT_EQ(QUIXShareUserPrivCalc("daemon", acl.get()), SHARE_NOACCESS);
  EXPECT_EQ(QUIXShareUserPrivCalc("bin", acl.get()), SHARE_NOACCESS);
  EXPECT_EQ(QUIXShareUserPrivCalc("no such user é", acl.get()), -1);
  EXPECT_EQ(QLIBCErrGet(), kQErrNoSuchUser);
}

// The bins of shares and homes refused for indexing, and the homes' bins queued when the home
// service changes, are checked where the indexer asks.
TEST_F(PlatformShareTest, RecycleBins) {
  EXPECT_EQ(QUIXShareIsShareRecycle((vol_ + "/music/#recycled").c_str()), 0);
  EXPECT_EQ(QUIXShareIsShareRecycle((vol_ + "/music/a/#recycle").c_str()), 0);
  // "live" nests in "music" but has no recycle bin of its own.
  EXPECT_EQ(QUIXShareIsShareRecycle((vol_ + "/music/live/#recycle").c_str()), 0);

  const std::string bin = vol_ + "/homes/nobody/#recycle";
  const int kFlags =
      RECYCLE_HOME_CHECK_PATH | RECYCLE_HOME_CHECK_EXIST | RECYCLE_HOME_CHECK_ENABLED;
  EXPECT_EQ(QUIXRecycleUserHomePathIsExist((bin + "/x").c_str(), kFlags), 0);  // not there yet
  EXPECT_EQ(QUIXRecycleUserHomePathIsExist((bin + "/x").c_str(), RECYCLE_HOME_CHECK_PATH), 1);

  // Folders of names that are no users are left out.
  ASSERT_TRUE(MakeParentDirs(bin + "/x"));
  ASSERT_TRUE(MakeParentDirs(vol_ + "/homes/no-such-user-x/#recycle/x"));
  PSZLIST list = QLIBCSzListAlloc(4);
  std::unique_ptr<QLIBSZLIST, void (*)(PSZLIST)> owned(list, QLIBCSzListFree);
  EXPECT_EQ(QUIXRecycleHomeEnumRecyclePathForAuthType(&list, AUTH_LOCAL), 1);
  EXPECT_STREQ(QLIBCSzListGet(list, 0), bin.c_str());
  EXPECT_EQ(QUIXRecycleHomeEnumRecyclePathForAuthType(&list, AUTH_LDAP), 0);
}

// The composed locations themselves are read through the share objects.
TEST(PlatformIndexLocationTest, BufferBoundsAndBadInput) {
  char buf[4096];
  char small[10];
  EXPECT_EQ(FILEIDXQueuePathCompose("/v/music", small, sizeof(small)), -1);
  EXPECT_EQ(errno, ENAMETOOLONG);
  EXPECT_EQ(FILEIDXGetIndexID("abc", small, sizeof(small)), -1);
  EXPECT_EQ(FILEIDXGetIndexID("", buf, sizeof(buf)), -1);
  EXPECT_EQ(FILEIDXDBPathCompose("relative", buf, sizeof(buf)), -1);
  EXPECT_EQ(errno, EINVAL);
}

TEST(PlatformQuotaTest, FreeSpaceDecides) {
  test::TempDir dir;
  EXPECT_EQ(QUIXQuotaIsEnough(0, dir.path().c_str(), 1), 1);
  EXPECT_EQ(QLIBCErrGet(), kQErrNone);
  EXPECT_EQ(QUIXQuotaIsEnough(0, dir.path().c_str(), UINT64_MAX / 2), 0);
  EXPECT_EQ(QLIBCErrGet(), kQErrVolumeFull);
  EXPECT_EQ(QUIXQuotaIsEnough(0, (dir.path() + "/missing").c_str(), 1), -1);
  EXPECT_EQ(errno, ENOENT);
}

TEST(PlatformFaultTest, ArmedFaultsFireOnTheNthCallOnly) {
  ScopedFaults faults;
  faults.Arm("FILEIDXGetIndexID", Fault{-7, EIO, 0x4242}, /*skip=*/1, /*times=*/2);
  char buf[64];
  EXPECT_EQ(FILEIDXGetIndexID("a", buf, sizeof(buf)), 0);
  EXPECT_EQ(FILEIDXGetIndexID("a", buf, sizeof(buf)), -7);
  EXPECT_EQ(errno, EIO);
  EXPECT_EQ(QLIBCErrGet(), 0x4242u);
  EXPECT_EQ(FILEIDXGetIndexID("a", buf, sizeof(buf)), -7);
  EXPECT_EQ(FILEIDXGetIndexID("a", buf, sizeof(buf)), 0);
  EXPECT_EQ(CallCount("FILEIDXGetIndexID"), 4);
}

}  // namespace
}  // namespace platform
}  // namespace orvane
