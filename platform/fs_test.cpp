#include "platform/fs.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>

#include "platform/platform_error.hpp"
#include "platform/user.hpp"
#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

QUIXCOPYARGS CopyArgs(bool remove_source) {
  QUIXCOPYARGS args = {};
  args.fCopy = 1;
  args.fRemoveSrc = remove_source ? 1 : 0;
  return args;
}

TEST(PlatformFileCopyTest, CopiesKeepModeOwnerAndTimesAndFailuresKeepTheSource) {
  test::TempDir dir;
  const std::string src = dir.Write("src", std::string(300000, 'x') + "end");
  ASSERT_EQ(chmod(src.c_str(), 0640), 0);
  if (geteuid() == 0) ASSERT_EQ(chown(src.c_str(), 65534, 65534), 0);
  const struct timespec times[2] = {{1000000000, 5}, {1200000000, 7}};
  ASSERT_EQ(utimensat(AT_FDCWD, src.c_str(), times, 0), 0);
  const QUIXCOPYARGS copy = CopyArgs(false);
  const QUIXCOPYARGS move = CopyArgs(true);
  const std::string dst = dir.Write("dst", "old content");
  ASSERT_EQ(QUIXFileCopy(src.c_str(), dst.c_str(), &copy), 0);
  EXPECT_EQ(test::ReadFile(dst), test::ReadFile(src));
  struct stat st = {};
  ASSERT_EQ(stat(dst.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  EXPECT_EQ(st.st_mtim.tv_sec, 1200000000);
  if (geteuid() == 0) EXPECT_EQ(st.st_uid, 65534u);

  // Neither a link nor a folder is copied, and what is not a regular file in the destination's
  // place is never replaced; the source stays each time.
  ASSERT_EQ(symlink(src.c_str(), dir.Path("link").c_str()), 0);
  ASSERT_EQ(mkdir(dir.Path("folder").c_str(), 0755), 0);
  EXPECT_EQ(QUIXFileCopy(dir.Path("link").c_str(), dst.c_str(), &move), -1);
  EXPECT_EQ(QUIXFileCopy(dir.path().c_str(), dst.c_str(), &move), -1);
  EXPECT_EQ(errno, EISDIR);
  EXPECT_EQ(QUIXFileCopy(src.c_str(), "/dev/null", &move), -1);
  EXPECT_EQ(errno, EEXIST);
  EXPECT_EQ(QUIXFileCopy(src.c_str(), dir.Path("folder").c_str(), &move), -1);
  EXPECT_EQ(test::ReadFile(src).size(), 300003u);
  EXPECT_EQ(test::ReadFile(dst).size(), 300003u);
}

TEST(PlatformFileCopyTest, AFullFileSystemLeavesNoPartialCopy) {
  if (geteuid() != 0) GTEST_SKIP() << "mounting a small file system needs root";
  test::TempDir dir;
  const std::string src = dir.Write("src", std::string(256 * 1024, 'x'));
  ASSERT_EQ(mkdir(dir.Path("small").c_str(), 0755), 0);
  if (mount("fileindex-test", dir.Path("small").c_str(), "tmpfs", 0, "size=64k") != 0) {
    GTEST_SKIP() << "this machine refuses a tmpfs mount: " << strerror(errno);
  }
  const QUIXCOPYARGS move = CopyArgs(true);
  EXPECT_EQ(QUIXFileCopy(src.c_str(), dir.Path("small/dst").c_str(), &move), -1);
  EXPECT_EQ(errno, ENOSPC);
  EXPECT_EQ(QLIBCErrGet(), kQErrVolumeFull);
  EXPECT_EQ(test::ReadFile(src).size(), 256u * 1024);
  EXPECT_TRUE(std::filesystem::is_empty(dir.Path("small")));
  umount2(dir.Path("small").c_str(), MNT_DETACH);
}

TEST(PlatformAccessTest, EffectiveAccessIncludesAcls) {
  test::TempDir dir;
  ASSERT_EQ(chmod(dir.path().c_str(), 0755), 0);
  const std::string file = dir.Write("f", "x");
  ASSERT_EQ(chmod(file.c_str(), 0600), 0);
  int perm = -1;
  ASSERT_EQ(QUIXACLPermGet(file.c_str(), &perm), 0);
  EXPECT_EQ(perm & (QUIX_ACL_READ | QUIX_ACL_WRITE), QUIX_ACL_READ | QUIX_ACL_WRITE);
  EXPECT_EQ(QUIXACLPermGet(dir.Path("missing").c_str(), &perm), -1);
  if (geteuid() != 0) GTEST_SKIP() << "judging another user's access needs root";

  acl_t acl = acl_from_text("u::rw-,u:nobody:r--,g::---,m::r--,o::---");
  ASSERT_NE(acl, nullptr);
  const int set = acl_set_file(file.c_str(), ACL_TYPE_ACCESS, acl);
  acl_free(acl);
  if (set != 0) GTEST_SKIP() << "this file system refuses POSIX ACLs: " << strerror(errno);
  const std::string plain = dir.Write("plain", "x");
  ASSERT_EQ(chmod(plain.c_str(), 0600), 0);

  ASSERT_TRUE(ResetCredentialsByName("nobody", true));
  int on_acl = -1;
  int on_plain = -1;
  const int rc_acl = QUIXACLPermGet(file.c_str(), &on_acl);
  const int rc_plain = QUIXACLPermGet(plain.c_str(), &on_plain);
  ASSERT_TRUE(ResetCredentialsByName("root", true));
  EXPECT_EQ(rc_acl, 0);
  EXPECT_EQ(on_acl, QUIX_ACL_READ);
  EXPECT_EQ(rc_plain, 0);
  EXPECT_EQ(on_plain, 0);
}

}  // namespace
}  // namespace platform
}  // namespace orvane
