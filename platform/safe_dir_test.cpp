#include "platform/safe_dir.hpp"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

using ::testing::HasSubstr;

mode_t Mode(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

// What `path` itself is, links not followed.
bool IsDir(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}
bool IsFile(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

// The folder of a path the test made (absolute, with no trailing "/").
std::string Dirname(const std::string& path) { return path.substr(0, path.rfind('/')); }

// `fn` run as nobody; true when it returned 0.
bool AsNobody(const std::function<int()>& fn) { return test::RunAsUser("nobody", fn) == 0; }

TEST(SafeDirTest, MakesRootOnlyFoldersAndFilesAndNarrowsOlderOnes) {
  test::TempDir dir;
  const std::string share = test::MakeOpenShare(dir, "share");
  const std::string fi = share + "/@eaDir/@fileindex";
  ASSERT_TRUE(SafeDir::Open(fi, true).OpenFile("queue", O_WRONLY | O_CREAT).valid());
  EXPECT_EQ(Mode(share), 0777u);  // the share itself is the administrator's
  EXPECT_EQ(Mode(share + "/@eaDir"), 0700u);
  EXPECT_EQ(Mode(fi), 0700u);
  EXPECT_EQ(Mode(fi + "/queue"), 0600u);

  // What an older installation left: folders 0755, files 0644 or writable by everyone.
  ASSERT_EQ(mkdir((fi + "/db").c_str(), 0755), 0);
  dir.Write("share/@eaDir/@fileindex/db/index.db", "x");
  struct Older {
    std::string path;
    mode_t mode;
    mode_t narrowed;
  };
  const Older older[] = {{share + "/@eaDir", 0755, 0700},
                         {fi, 0755, 0700},
                         {fi + "/db", 0755, 0700},
                         {fi + "/queue", 0644, 0600},
                         {fi + "/db/index.db", 0666, 0600}};
  for (const Older& entry : older) ASSERT_EQ(chmod(entry.path.c_str(), entry.mode), 0);
  const SafeDir db = SafeDir::Open(fi + "/db", false);
  ASSERT_TRUE(db.valid());
  EXPECT_TRUE(db.CheckEntry("index.db", false));
  EXPECT_FALSE(db.CheckEntry("index.db-wal", false));
  EXPECT_TRUE(SafeDir::Open(fi, false).CheckEntry("queue", false));
  for (const Older& entry : older) EXPECT_EQ(Mode(entry.path), entry.narrowed) << entry.path;

  // A folder outside "@eaDir" is the administrator's: used as it is, never narrowed.
  const std::string plain = dir.Write("plain/file", "x");
  ASSERT_EQ(chmod(Dirname(plain).c_str(), 0755), 0);
  EXPECT_TRUE(SafeDir::Open(Dirname(plain), true).OpenFile("file", O_RDONLY).valid());
  EXPECT_EQ(Mode(Dirname(plain)), 0755u);
  EXPECT_EQ(Mode(plain), 0644u);
}

// Links and a FIFO planted by nobody in a folder an older installation left open to everyone:
// the folder is narrowed, the entries refused with their paths, nothing is written where they
// point, and the FIFO does not block the open. A planted "@eaDir" is refused where the indexer,
// the watcher and the engine meet it.
TEST(SafeDirTest, PlantedEntriesAreRefusedWithTheirPath) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as nobody";
  test::TempDir dir;
  const std::string share = test::MakeOpenShare(dir, "share");
  const std::string secret = dir.Write("secret/file", "root only\n");
  const std::string fi = share + "/@eaDir/@fileindex";
  ASSERT_TRUE(SafeDir::Open(fi, true).valid());
  ASSERT_EQ(chmod((share + "/@eaDir").c_str(), 0755), 0);
  ASSERT_EQ(chmod(fi.c_str(), 0777), 0);
  ASSERT_TRUE(AsNobody([&] {
    return symlink(secret.c_str(), (fi + "/queue").c_str()) |
           mkfifo((fi + "/queue.tmp").c_str(), 0666) |
           symlink(Dirname(secret).c_str(), (fi + "/db").c_str());
  }));
  const SafeDir folder = SafeDir::Open(fi, false);
  EXPECT_EQ(Mode(share + "/@eaDir"), 0700u);
  EXPECT_EQ(Mode(fi), 0700u);
  EXPECT_THAT(
      test::ErrorOf([&] { folder.OpenFile("queue", O_WRONLY | O_APPEND | O_CREAT); }).message,
      HasSubstr(fi + "/queue: it is a symbolic link"));
  EXPECT_THAT(test::ErrorOf([&] { folder.CheckEntry("queue.tmp", false); }).message,
              HasSubstr(fi + "/queue.tmp: it is a special file"));
  EXPECT_THROW(folder.Sub("db", true), Error);
  EXPECT_EQ(test::ReadFile(secret), "root only\n");
  EXPECT_EQ(Mode(secret), 0644u);
}

// A folder swapped away after it was opened: the holder keeps writing to the real one, and the
// next open meets the swapped-in folder and refuses it.
TEST(SafeDirTest, AnExchangedFolderIsNeverWrittenThrough) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as nobody";
  test::TempDir dir;
  const std::string share = test::MakeOpenShare(dir, "share");
  const SafeDir held = SafeDir::Open(share + "/@eaDir/@fileindex", true);
  ASSERT_TRUE(AsNobody([&] {
    return mkdir((share + "/bait").c_str(), 0777) |
           mkdir((share + "/bait/@fileindex").c_str(), 0777) |
           test::RenameExchange(share + "/@eaDir", share + "/bait");
  }));
  EXPECT_TRUE(held.OpenFile("queue", O_WRONLY | O_CREAT).valid());
  EXPECT_TRUE(IsFile(share + "/bait/@fileindex/queue"));  // the real folder, moved
  EXPECT_FALSE(IsFile(share + "/@eaDir/@fileindex/queue"));
  EXPECT_EQ(test::ErrorOf([&] { SafeDir::Open(share + "/@eaDir/@fileindex", true); }).code,
            kErrUnsafePath);
}

TEST(SafeDirTest, RemoveTreeNeverFollowsALink) {
  test::TempDir dir;
  const std::string keep = dir.Write("outside/keep", "k");
  const std::string db = Dirname(dir.Write("share/@eaDir/@fileindex/db/index.db", "x"));
  ASSERT_EQ(symlink(Dirname(keep).c_str(), (db + "/escape").c_str()), 0);
  const SafeDir folder = SafeDir::Open(Dirname(db), false);
  ASSERT_TRUE(folder.valid());
  EXPECT_EQ(folder.RemoveTree("db"), 0);
  EXPECT_EQ(folder.RemoveTree("db"), 0);  // gone already
  EXPECT_FALSE(IsDir(db));
  EXPECT_EQ(test::ReadFile(keep), "k");
}

}  // namespace
}  // namespace platform
}  // namespace orvane
