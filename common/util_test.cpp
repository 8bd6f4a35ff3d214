#include "common/util.hpp"

#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/root.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace {

TEST(UtilTest, FileAndDirectoryTestsDoNotFollowLinksUnlessAsked) {
  test::TempDir dir;
  const std::string file = dir.Write("f", "x");
  ASSERT_EQ(mkdir(dir.Path("d").c_str(), 0755), 0);
  ASSERT_EQ(symlink(file.c_str(), dir.Path("lf").c_str()), 0);
  ASSERT_EQ(symlink(dir.Path("d").c_str(), dir.Path("ld").c_str()), 0);
  ASSERT_EQ(symlink(dir.Path("loop2").c_str(), dir.Path("loop1").c_str()), 0);
  ASSERT_EQ(symlink(dir.Path("loop1").c_str(), dir.Path("loop2").c_str()), 0);

  EXPECT_TRUE(IsFileExist(file));
  EXPECT_FALSE(IsFileExist(dir.Path("lf")));
  EXPECT_FALSE(IsFileExist(dir.Path("d")));
  EXPECT_TRUE(IsDirExist(dir.Path("d"), false));
  EXPECT_FALSE(IsDirExist(dir.Path("ld"), false));
  EXPECT_TRUE(IsDirExist(dir.Path("ld"), true));
  EXPECT_FALSE(IsDirExist(dir.Path("loop1"), true));
  EXPECT_FALSE(IsDirExist(file, true));

  EXPECT_TRUE(Unlink(file));
  EXPECT_TRUE(Unlink(file));  // already gone counts as removed
  EXPECT_FALSE(Unlink(dir.Path("d")));
  EXPECT_EQ(RealPath(dir.Path("ld")), RealPath(dir.Path("d")));
  EXPECT_EQ(RealPath(dir.Path("missing")), "");
}

TEST(UtilTest, PathAndStringPieces) {
  EXPECT_EQ(Basename("/a/b"), "b");
  EXPECT_EQ(Basename("/a/"), "");
  EXPECT_EQ(Dirname("b"), "b");
  EXPECT_EQ(Dirname("/x"), "");
  EXPECT_EQ(GetFileExtension("/home/.profile.TXT", false), "TXT");
  EXPECT_TRUE(StringStartWith("abc", ""));
  EXPECT_FALSE(StringStartWith("/a", "/a/"));
  EXPECT_EQ(Trim(" \t\n "), "");
  EXPECT_EQ(Trim("\t a b \n"), "a b");
  EXPECT_EQ(ToLower("ÄbC.JPG"), "Äbc.jpg");
}

// The copy itself, and the access bits, are checked with the platform calls these wrap.
TEST(UtilTest, RootedPathsAndPlatformBackedFileHelpers) {
  {
    test::ScopedRoot root("");
    EXPECT_EQ(RootedPath("/var/run/fileindexd.sock"), "/var/run/fileindexd.sock");
  }
  test::TempDir dir;
  test::ScopedRoot root(dir.path() + "/");
  EXPECT_EQ(RootedPath("/var/run/fileindexd.sock"), dir.path() + "/var/run/fileindexd.sock");
  const std::string p = RootedPathForWrite("/var/packages/Orvane/etc/fileindex.folders");
  EXPECT_TRUE(IsDirExist(Dirname(p), false));
  EXPECT_FALSE(IsFileExist(p));

  const std::string src = dir.Write("a", "content");
  EXPECT_TRUE(CPFile(src, dir.Path("b")));
  EXPECT_TRUE(MVFile(dir.Path("b"), dir.Path("c")));
  EXPECT_EQ(test::ReadFile(src) + test::ReadFile(dir.Path("b")), "content");
  // Any one of the asked bits is enough.
  ASSERT_EQ(chmod(src.c_str(), 0400), 0);
  EXPECT_TRUE(CheckACLPerm(src, platform::QUIX_ACL_READ | platform::QUIX_ACL_EXECUTE));
  EXPECT_FALSE(CheckACLPerm(src, platform::QUIX_ACL_EXECUTE));
}

TEST(UtilTest, ChownOrvaneNeedsThePackageAccount) {
  test::TempDir dir;
  const std::string file = dir.Write("f", "x");
  if (getpwnam("Orvane") != nullptr) {
    EXPECT_EQ(ChownOrvane(file), geteuid() == 0);
    return;
  }
  EXPECT_EQ(test::ErrorOf([&] { ChownOrvane(file); }).message,
            "Orvane error, code=801, reason=[QUIXUserGet failed, user=Orvane]");
}

}  // namespace
}  // namespace orvane
