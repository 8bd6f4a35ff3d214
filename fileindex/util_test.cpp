#include "fileindex/util.hpp"

#include <gmock/gmock.h>
#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "common/error.hpp"
#include "common/root.hpp"
#include "platform/fs.hpp"
#include "test/faults.hpp"
#include "test/share_fixture.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

using platform::Fault;
using platform::ScopedFaults;
using ::testing::ThrowsMessage;

using test::ThrowsCode;

TEST(PathPiecesTest, ShareNamesShareRenamesAndPreservedNames) {
  EXPECT_EQ(GetShareNameByPath("/my music é/x"), "my music é");
  EXPECT_EQ(GetShareNameByPath("//x"), "");
  EXPECT_THAT([] { GetShareNameByPath("music/a"); },
              ThrowsMessage<Error>("Orvane error, code=120, reason=[music/a]"));

  EXPECT_EQ(ReplacePathShare("/s/old/x", "new", "old"), "/s/new/x");  // first match anywhere
  EXPECT_THAT([] { ReplacePathShare("/ab/c", "x", "a"); },
              ThrowsMessage<Error>("Orvane error, code=120, reason=[Cannot find share: a]"));

  EXPECT_TRUE(IsSystemPreservedFileName(".HFS+ Private Directory Data"));
  for (const char* name : {"thumbs.db", ".git2"})  // case matters, whole names only
    EXPECT_FALSE(IsSystemPreservedFileName(name)) << name;
}

// The search filter and the crawl ask for a kind's extensions and its setting's name; both must
// say what the lookup by name says, or a search by kind finds files the kind's switch never
// extracts.
TEST(FileTypeTest, LookupsListsAndSettingNamesAgree) {
  const struct {
    const char* path;
    FileType type;
  } cases[] = {
      {"/v/s/Report.PDF", kDocument}, {"/v/s/README", kDocument}, {"/v/s.d/file", kDocument},
      {"/v/s/x.tar.gz", kDocument},   {"/v/s/x.heic", kPhoto},    {"/v/s/movie.dvr-ms", kVideo},
      {"/v/s/a.TX?", kDocument},      {"/v/s/.bashrc", kOther},   {"/v/s/a.Ä", kOther},
      {"/v/s/b.Opus", kAudio},        {"/v/s/c.oga", kAudio},     {"/v/s/d.webp", kPhoto},
  };
  for (const auto& c : cases) EXPECT_EQ(GetFileTypeByFullPath(c.path), c.type) << c.path;

  size_t listed = 0;
  for (FileType type : {kDocument, kAudio, kVideo, kPhoto}) {
    const std::vector<std::string>& exts = GetExtensionsOfType(type);
    EXPECT_TRUE(std::is_sorted(exts.begin(), exts.end()));
    for (const std::string& ext : exts) EXPECT_EQ(GetFileTypeByExtension(ext), type) << ext;
    listed += exts.size();
    EXPECT_EQ(GetFileTypeBySetting(GetFileTypeSetting(type)), type);
  }
  EXPECT_EQ(listed, FileTypeTable().size());
  EXPECT_EQ(GetFileTypeBySetting("Photo"), kOther);
}

// Real folders in real shares on this machine's file system.
class IndexRulesTest : public test::ShareFixture {
 protected:
  void SetUp() override {
    for (const char* dir : {"music/live", "music/#recycle/old", "music/.git/objects",
                            "music/@eaDir/x", "music/#snapshot/daily", "homes/nobody/#recycle/f",
                            "homes/nobody/docs", "ro", "vault/inner", "open/sub"}) {
      ASSERT_TRUE(MakeParentDirs(vol_ + "/" + dir + "/x"));
    }
    volume_.Write("music/a.flac", "x");
    volume_.Write("music/live/Thumbs.db", "x");
    WriteConfig();
  }

  void WriteConfig() {
    WriteShares(R"(
      {"name": "music", "path": ")" + vol_ + R"(/music", "recycle_bin": true},
      {"name": "homes", "path": ")" + vol_ + R"(/homes", "recycle_bin": true},
      {"name": "ro", "path": ")" + vol_ + R"(/ro", "readonly": true},
      {"name": "vault", "path": ")" + vol_ + R"(/vault", "encrypted": true, "encryption": true},
      {"name": "open", "path": ")" + vol_ + R"(/open", "encryption": true})");
  }

  // Mounts a small tmpfs on `dir` (read-only when asked); false when the machine refuses.
  bool MountTmpfs(const std::string& dir, bool read_only) {
    const bool ok =
        mount("fileindex-test", dir.c_str(), "tmpfs", read_only ? MS_RDONLY : 0, "size=1m") == 0;
    if (ok) mounts_.push_back(dir);
    return ok;
  }

  void TearDown() override {
    for (auto it = mounts_.rbegin(); it != mounts_.rend(); ++it) umount2(it->c_str(), MNT_DETACH);
  }

  std::vector<std::string> mounts_;
};

TEST_F(IndexRulesTest, EachRuleRefusesItsPaths) {
  for (const char* rel : {"music/a.flac", "homes/nobody/docs", "open/sub"})
    EXPECT_TRUE(CanFullPathBeIndexed(vol_ + "/" + rel)) << rel;
  EXPECT_FALSE(CanPathBeIndexed("/music/.git"));

  // Share flags, recycle bins, preserved names; then every spelling but the one realpath
  // prints, and vanished paths.
  ASSERT_EQ(symlink((vol_ + "/music/live").c_str(), (vol_ + "/music/link").c_str()), 0);
  std::string long_path = "music";
  while (long_path.size() <= PATH_MAX) long_path += "/abcdefghijklmnopqrstuvwxyz";
  const std::string refused[] = {
      "ro",
      "vault/inner",
      "music/#recycle/old",
      "music/.git/objects",
      "music/live/Thumbs.db",
      "music/./live",
      "music/link",
      "music/gone.mp3",
      long_path,
  };
  for (const std::string& rel : refused) {
    EXPECT_FALSE(CanFullPathBeIndexed(vol_ + "/" + rel)) << rel;
  }

  // A path in no share, or in a share that vanished from the configuration, is an error.
  EXPECT_THAT(
      [&] { CanFullPathBeIndexed(vol_); },
      ThrowsMessage<Error>(
          "Orvane error, code=502, reason=[QUIXShareNamePathGet failed, full_path=" + vol_ + "]"));
  EXPECT_THAT([] { CanPathBeIndexed("/gone/x"); }, ThrowsCode(kErrShareGet));
  // With the recycle bin switched off, "#recycle" is an ordinary folder.
  test::WritePlatformConfig(root_.path(), R"({"shares": [
    {"name": "music", "path": ")" + vol_ + R"(/music"}]})");
  EXPECT_TRUE(CanFullPathBeIndexed(vol_ + "/music/#recycle/old"));
}

TEST_F(IndexRulesTest, PlatformAnswersDecideSnapshotsAndFileSystems) {
  ScopedFaults faults;
  const std::string daily = vol_ + "/music/#snapshot/daily";
  const std::string live = vol_ + "/music/live";
  // A writable folder named "#snapshot" is no snapshot: the other rules judge it.
  EXPECT_TRUE(CanFullPathBeIndexed(daily));
  faults.Arm("QLIBFhsPathInSnapshot", Fault{0, 0, 0, 1, true});
  EXPECT_FALSE(CanFullPathBeIndexed(daily));
  // A failing call does not refuse.
  faults.Arm("QLIBFhsPathInSnapshot", Fault{-1, EIO, 0, 1, true});
  EXPECT_TRUE(CanFullPathBeIndexed(daily));
  EXPECT_TRUE(CanFullPathBeIndexed(live));
  EXPECT_EQ(platform::CallCount("QLIBFhsPathInSnapshot"), 3);  // only asked for "#snapshot" paths

  faults.Arm("QUIXGetFSType", Fault{-1, EIO});
  EXPECT_FALSE(CanFullPathBeIndexed(live));
  faults.Arm("QUIXGetFSType", Fault{platform::FS_TYPE_NFS, 0});
  EXPECT_FALSE(CanFullPathBeIndexed(live));
  faults.Arm("QUIXGetFSType", Fault{platform::FS_TYPE_BTRFS, 0});
  EXPECT_TRUE(CanFullPathBeIndexed(live));

  faults.Arm("QLIBShareIsReadOnlyGet", Fault{-1, EIO});
  EXPECT_THAT([&] { CanFullPathBeIndexed(live); }, ThrowsCode(kErrSystem));
  faults.Arm("QUIXFSDirIsMntPoint", Fault{1, 0});
  EXPECT_FALSE(CanFullPathBeIndexed(live));
  faults.Arm("QUIXFSDirIsMntPoint", Fault{1, 0});
  EXPECT_TRUE(
      CanFullPathBeIndexed(vol_ + "/open/sub"));  // an encryption share's mounts are its own
}

TEST_F(IndexRulesTest, RealMountPointsAndSnapshots) {
  if (geteuid() != 0) GTEST_SKIP() << "mounting needs root; running as " << geteuid();
  if (!MountTmpfs(vol_ + "/music/live", false))
    GTEST_SKIP() << "this machine refuses a tmpfs mount";
  EXPECT_FALSE(CanFullPathBeIndexed(vol_ + "/music/live"));
  ASSERT_TRUE(MountTmpfs(vol_ + "/open", false));
  EXPECT_TRUE(CanFullPathBeIndexed(vol_ + "/open"));  // the unlocked encryption share's root
  // A read-only view below "#snapshot" is a snapshot.
  ASSERT_TRUE(MountTmpfs(vol_ + "/music/#snapshot/daily", true));
  int in_snapshot = -1;
  EXPECT_EQ(
      platform::QLIBFhsPathInSnapshot((vol_ + "/music/#snapshot/daily").c_str(), &in_snapshot), 0);
  EXPECT_EQ(in_snapshot, 1);
}

TEST_F(IndexRulesTest, ConcurrentJudgementsWhileTheConfigurationIsRewritten) {
  std::atomic<int> refused{0};
  std::vector<std::thread> readers;
  for (int t = 0; t < 3; ++t) {
    readers.emplace_back([&] {
      for (int i = 0; i < 150; ++i) {
        refused += !CanFullPathBeIndexed(vol_ + "/music/live");
        refused += CanFullPathBeIndexed(vol_ + "/music/.git/objects");
      }
    });
  }
  for (int i = 0; i < 40; ++i) WriteConfig();  // same shares, a new file each time
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(refused, 0);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
