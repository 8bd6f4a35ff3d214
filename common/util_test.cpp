#include "common/util.hpp"

#include <gtest/gtest.h>
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
  ASSERT_EQ(symlink(dir.Path("ld").c_str(), dir.Path("lld").c_str()), 0);
  ASSERT_EQ(symlink(dir.Path("loop2").c_str(), dir.Path("loop1").c_str()), 0);
  ASSERT_EQ(symlink(dir.Path("loop1").c_str(), dir.Path("loop2").c_str()), 0);

  EXPECT_TRUE(IsFileExist(file));
  EXPECT_FALSE(IsFileExist(dir.Path("lf")));
  EXPECT_FALSE(IsFileExist(dir.Path("d")));
  EXPECT_TRUE(IsDirExist(dir.Path("d"), false));
  EXPECT_FALSE(IsDirExist(dir.Path("ld"), false));
  EXPECT_TRUE(IsDirExist(dir.Path("ld"), true));
  EXPECT_TRUE(IsDirExist(dir.Path("lld"), true));
  EXPECT_FALSE(IsDirExist(dir.Path("loop1"), true));
  EXPECT_FALSE(IsDirExist(dir.Path("missing"), true));
  EXPECT_FALSE(IsDirExist(file, true));

  struct dirent entry = {};
  entry.d_type = DT_DIR;
  EXPECT_TRUE(IsDirentDir(entry, "/nonexistent"));
  entry.d_type = DT_REG;
  EXPECT_FALSE(IsDirentDir(entry, dir.Path("d")));
  entry.d_type = DT_UNKNOWN;
  EXPECT_FALSE(IsDirentDir(entry, dir.Path("d")));
  EXPECT_FALSE(IsDirentDir(entry, "/nonexistent"));

  EXPECT_TRUE(Unlink(file));
  EXPECT_TRUE(Unlink(file));
  EXPECT_FALSE(Unlink(dir.Path("d")));
  EXPECT_EQ(RealPath(dir.Path("ld")), RealPath(dir.Path("d")));
  EXPECT_EQ(RealPath(dir.Path("missing")), "");
}

TEST(UtilTest, PathPieces) {
  EXPECT_EQ(Basename("/a/b"), "b");
  EXPECT_EQ(Basename("b"), "b");
  EXPECT_EQ(Basename("/a/"), "");
  EXPECT_EQ(Dirname("/a/b"), "/a");
  EXPECT_EQ(Dirname("b"), "b");
  EXPECT_EQ(Dirname("/x"), "");
  EXPECT_EQ(GetFileExtension("/a/b.d/file", true), "");
  EXPECT_EQ(GetFileExtension("x.TXT", true), "txt");
  EXPECT_EQ(GetFileExtension("x.TXT", false), "TXT");
  EXPECT_EQ(GetFileExtension("archive.", false), "");
  EXPECT_EQ(GetFileExtension("/home/.profile", false), "profile");
  EXPECT_EQ(GetFileExtension("a.tar.gz", false), "gz");
}

TEST(UtilTest, Strings) {
  EXPECT_TRUE(StringStartWith("/a/b/", "/a/"));
  EXPECT_TRUE(StringStartWith("abc", ""));
  EXPECT_FALSE(StringStartWith("/a", "/a/"));
  EXPECT_FALSE(StringStartWith("x/a", "/a"));
  EXPECT_EQ(Trim(" \t\n "), "");
  EXPECT_EQ(Trim("\t a b \n"), "a b");
  EXPECT_EQ(LTrim("  a "), "a ");
  EXPECT_EQ(RTrim("  a "), "  a");
  EXPECT_EQ(ToLower("ÄbC.JPG"), "Äbc.jpg");
}

TEST(UtilTest, RootedPaths) {
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
}

}  // namespace
}  // namespace orvane
