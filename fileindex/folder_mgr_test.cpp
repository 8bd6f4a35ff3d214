#include "fileindex/folder_mgr.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "fileindex/admin_test_env.hpp"
#include "platform/unicode.hpp"

namespace orvane {
namespace fileindex {
namespace {

using testenv::ErrorOf;

class FolderMgrTest : public testenv::AdminTestEnv {
 protected:
  std::string FoldersPath() const { return Rooted(kFileIndexFoldersCfgPath); }
  void WriteFolders(const Json::Value& folders) {
    ASSERT_TRUE(JsonValue(folders).toFile(FoldersPath()));
  }
  static std::vector<std::string> Paths(const std::vector<std::shared_ptr<Folder>>& folders) {
    std::vector<std::string> paths;
    for (const auto& f : folders) paths.push_back(f->GetPath());
    return paths;
  }
};

TEST_F(FolderMgrTest, LoadSaveAndDamagedFiles) {
  {
    FolderMgr empty;
    EXPECT_TRUE(empty.folders().empty());
    empty.Save();
  }
  EXPECT_EQ(ReadJson(FoldersPath()), Json::Value(Json::arrayValue));
  struct stat st;
  ASSERT_EQ(stat(FoldersPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);

  Json::Value two(Json::arrayValue);
  two.append(FolderJson("/photo/trips", "Trips", true, false, false, true));
  two.append(FolderJson("/music", "Music", false, true, false, false));
  WriteFolders(two);
  {
    FolderMgr mgr;
    ASSERT_EQ(mgr.folders().size(), 2u);
    mgr.Save();
  }
  Json::Value expected(Json::arrayValue);
  for (const auto& f : two) expected.append(Folder(f).GetData());
  EXPECT_EQ(ReadJson(FoldersPath()), expected);

  test::LogCapture log;
  for (const std::string text : {"", "[{\"path\": ", "{\"path\": \"/photo\"}", "42"}) {
    volume_.Write("f", text);
    ASSERT_EQ(rename(volume_.Path("f").c_str(), FoldersPath().c_str()), 0);
    const Error e = ErrorOf([] { FolderMgr mgr; });
    EXPECT_EQ(e.code, kErrLoadConfig) << text;
    EXPECT_EQ(e.message,
              "Orvane error, code=504, reason=[Cannot load json: " + FoldersPath() + "]");
    EXPECT_EQ(test::ReadFile(FoldersPath()), text);
  }
  EXPECT_TRUE(
      log.Contains("Failed [IsFileExist(kFileIndexFoldersCfgPath) && "
                   "!folders.fromFile(kFileIndexFoldersCfgPath)]"));
  // A hand-edited record of the wrong shape fails the whole load.
  volume_.Write("f", R"([{"path": "/photo", "name": "P", "document": "yes", "audio": true,
                         "video": true, "photo": true}])");
  ASSERT_EQ(rename(volume_.Path("f").c_str(), FoldersPath().c_str()), 0);
  EXPECT_EQ(ErrorOf([] { FolderMgr mgr; }).code, kErrInvalidParam);

  // A file that cannot be replaced: 505 naming the path, the file left as it was.
  ASSERT_EQ(unlink(FoldersPath().c_str()), 0);
  FolderMgr mgr;
  ASSERT_EQ(mkdir(FoldersPath().c_str(), 0755), 0);
  const Error e = ErrorOf([&] { mgr.Save(); });
  EXPECT_EQ(e.message, "Orvane error, code=505, reason=[" + FoldersPath() + "]");
  EXPECT_TRUE(log.Contains("Failed [!folders.toFile(kFileIndexFoldersCfgPath)]"));
}

TEST_F(FolderMgrTest, MostSuitableFolderIsTheDeepestThenTheEarliest) {
  Json::Value list(Json::arrayValue);
  list.append(FolderJson("/photo/trips", "A", true, false, false, false));
  list.append(FolderJson("/photo/trips/2024", "B", false, true, false, false));
  list.append(FolderJson("/photo/trips/", "C", false, false, true, false));
  list.append(FolderJson("/music", "M", true, true, true, true));
  list.append(FolderJson("/music", "M2", false, false, false, false));
  WriteFolders(list);
  FolderMgr mgr;
  const std::string t = vol_ + "/photo/trips";
  auto name_of = [&](const std::string& full) {
    auto f = mgr.GetMostSuitableCfg(full);
    return f ? f->GetName() : std::string("null");
  };
  EXPECT_EQ(name_of(t + "/2024/c"), "B");
  EXPECT_EQ(name_of(t + "/2024"), "B");
  EXPECT_EQ(name_of(t + "/2024x"), "A");
  EXPECT_EQ(name_of(t), "A");
  EXPECT_EQ(name_of(t + "/"), "C");  // only a spelling with the slash matches "/photo/trips/"
  EXPECT_EQ(name_of(vol_ + "/photo"), "null");
  EXPECT_EQ(name_of(vol_ + "/photos/trips"), "null");
  EXPECT_EQ(name_of(vol_ + "/music/a.mp3"), "M");  // equal paths: the earlier one
  EXPECT_EQ(name_of(""), "null");

  EXPECT_TRUE(mgr.IsFullPathIndexed(t + "/x"));
  EXPECT_FALSE(mgr.IsFullPathIndexed(vol_ + "/photo/family"));
  EXPECT_TRUE(mgr.IsFullPathHasOwnCfg(t + "/2024"));
  EXPECT_FALSE(mgr.IsFullPathHasOwnCfg(t + "/2024/c"));

  // Metadata by file kind under A (document only) and B (audio only); other kinds always.
  EXPECT_TRUE(mgr.IsFullPathNeedMeta(t + "/a.pdf"));
  EXPECT_FALSE(mgr.IsFullPathNeedMeta(t + "/a.mp3"));
  EXPECT_TRUE(mgr.IsFullPathNeedMeta(t + "/2024/a.mp3"));
  EXPECT_FALSE(mgr.IsFullPathNeedMeta(t + "/2024/a.jpg"));
  EXPECT_FALSE(mgr.IsFullPathNeedMeta(t + "/2024/a.pdf"));
  EXPECT_FALSE(mgr.IsFullPathNeedMeta(vol_ + "/photo/family/a.pdf"));

  EXPECT_TRUE(mgr.IsShareIndexed("photo"));
  EXPECT_FALSE(mgr.IsShareIndexed("Photos"));
  EXPECT_EQ(mgr.GetIndexedShares(), (std::set<std::string>{"music", "photo"}));
  EXPECT_TRUE(mgr.HasFolder("/photo/trips/"));
  EXPECT_FALSE(mgr.HasFolder("/photo/trips/2024/"));
  std::shared_ptr<Folder> got;
  mgr.Get(got, "/music");
  EXPECT_EQ(got->GetName(), "M");
  test::LogCapture log;
  const Error e = ErrorOf([&] { mgr.Get(got, "/Music"); });
  EXPECT_EQ(e.message, "Orvane error, code=902, reason=[/Music]");
  EXPECT_TRUE(log.Contains("Failed [it == folders_.end()]"));
}

TEST_F(FolderMgrTest, UpsertDeleteAndTheirDiffs) {
  FolderMgr mgr;
  std::shared_ptr<Folder> diff;
  mgr.Upsert(diff, std::make_shared<Folder>(FolderJson("/photo", "P", true, true, false, false)));
  EXPECT_EQ(diff->GetIndexCfg(),
            Parse(R"({"document": true, "audio": true, "video": true, "photo": true})"));
  EXPECT_EQ(diff->GetPath(), "/photo");
  mgr.Upsert(diff, std::make_shared<Folder>(FolderJson("/music", "M", true, true, true, true)));

  // Audio off for the photo share's root: only audio flips, and the record moves to the end.
  mgr.Upsert(diff, std::make_shared<Folder>(FolderJson("/photo", "P2", true, false, false, false)));
  EXPECT_EQ(diff->GetIndexCfg(),
            Parse(R"({"document": false, "audio": true, "video": false, "photo": false})"));
  EXPECT_EQ(diff->GetName(), "P2");
  EXPECT_EQ(Paths(mgr.folders()), (std::vector<std::string>{"/music", "/photo"}));
  EXPECT_EQ(mgr.GetMostSuitableCfg(vol_ + "/photo/x")->GetName(), "P2");

  // A sub-folder against its parent, then deleted again.
  mgr.Upsert(diff,
             std::make_shared<Folder>(FolderJson("/photo/trips", "T", false, false, true, false)));
  EXPECT_EQ(diff->GetIndexCfg(),
            Parse(R"({"document": true, "audio": false, "video": true, "photo": false})"));
  mgr.Delete(diff, "/photo/trips");
  EXPECT_EQ(diff->GetIndexCfg(),
            Parse(R"({"document": true, "audio": false, "video": true, "photo": false})"));
  EXPECT_EQ(mgr.GetMostSuitableCfg(vol_ + "/photo/trips")->GetName(), "P2");
  EXPECT_EQ(ErrorOf([&] { mgr.Delete(diff, "/homes/bob"); }).code, kErrFolderNotFound);

  // The last folder of a share: everything it indexed goes.
  mgr.Upsert(diff, std::make_shared<Folder>(FolderJson("/homes/bob", "B", true, true, true, true)));
  mgr.Upsert(diff,
             std::make_shared<Folder>(FolderJson("/homes/bob/docs", "D", true, true, true, true)));
  mgr.Delete(diff, "/photo");
  EXPECT_EQ(diff->GetIndexCfg(),
            Parse(R"({"document": true, "audio": true, "video": true, "photo": true})"));
  EXPECT_EQ(diff->GetPath(), "/photo");

  mgr.DeleteByShare("homes");
  EXPECT_EQ(Paths(mgr.folders()), (std::vector<std::string>{"/music"}));
  EXPECT_FALSE(mgr.IsFullPathIndexed(vol_ + "/homes/bob/docs"));
}

TEST_F(FolderMgrTest, ListFiltersSortsAndPages) {
  Json::Value list(Json::arrayValue);
  auto add = [&](const std::string& path, const std::string& name, const std::string& group,
                 bool document) {
    Json::Value f = FolderJson(path, name, document, false, false, false);
    if (!group.empty()) f["group"] = group;
    list.append(f);
  };
  add("/photo/b", "beta", "", true);
  add("/photo/A", "Alpha trips", "staff", false);
  add("/music/c", "Émile", "", false);
  add("/photo/D", "delta TRIPS", "staff", true);
  add("/music/e", "echo", "", false);
  WriteFolders(list);
  FolderMgr mgr;
  EXPECT_EQ(mgr.GetGroups(), (std::set<std::string>{"staff"}));

  std::vector<std::shared_ptr<Folder>> out;
  unsigned int total = 0;
  auto names = [&] {
    std::vector<std::string> n;
    for (const auto& f : out) n.push_back(f->GetName());
    return n;
  };
  mgr.List(out, total, 0, 100, "name", "DESC", "all", "");
  EXPECT_EQ(total, 5u);
  EXPECT_EQ(names(),
            (std::vector<std::string>{"Émile", "echo", "delta TRIPS", "beta", "Alpha trips"}));
  mgr.List(out, total, 1, 2, "name", "asc", "all", "");
  EXPECT_EQ(total, 5u);
  EXPECT_EQ(names(), (std::vector<std::string>{"beta", "delta TRIPS"}));
  mgr.List(out, total, 0, 0, "name", "asc", "all", "");
  EXPECT_TRUE(out.empty());
  EXPECT_EQ(total, 5u);
  mgr.List(out, total, 9, 10, "name", "asc", "all", "");
  EXPECT_TRUE(out.empty());

  // The group filter is exact; an empty group keeps the folders without one.
  mgr.List(out, total, 0, 10, "path", "asc", "", "");
  EXPECT_EQ(total, 3u);
  EXPECT_EQ(names(), (std::vector<std::string>{"Émile", "echo", "beta"}));
  mgr.List(out, total, 0, 10, "path", "asc", "Staff", "");
  EXPECT_EQ(total, 0u);

  // The keyword is trimmed and case-blind, and only names are searched.
  mgr.List(out, total, 0, 10, "path", "asc", "staff", "  trips ");
  EXPECT_EQ(names(), (std::vector<std::string>{"Alpha trips", "delta TRIPS"}));
  mgr.List(out, total, 0, 10, "path", "asc", "all", "photo");
  EXPECT_EQ(total, 0u);

  mgr.List(out, total, 0, 10, "document", "asc", "all", "");
  ASSERT_EQ(out.size(), 5u);
  for (size_t i = 0; i < out.size(); ++i) EXPECT_EQ(out[i]->IsDocument(), i >= 3) << i;
  mgr.List(out, total, 0, 10, "Document", "desc", "all", "");  // the key is case-sensitive
  EXPECT_EQ(names().front(), "Émile");
}

TEST(CaseBlindCompareTest, Utf8TextsOrderWithoutCase) {
  auto cmp = [](const char* a, const char* b) {
    return platform::QLIBCUnicodeUTF8StrCaseCmp(a, b);
  };
  EXPECT_EQ(cmp("ÉCOLE Ünïcode", "école ünÏcode"), 0);
  EXPECT_LT(cmp("abc", "ABD"), 0);
  EXPECT_LT(cmp("ab", "AbC"), 0);  // a prefix first
  EXPECT_GT(cmp("é", "z"), 0);     // by code point, not by any collation
  EXPECT_LT(cmp("Ωmega", "ωMEGA2"), 0);
  // Bytes that begin no valid sequence sort after every character, and never read past the end.
  EXPECT_GT(cmp("a\xff", "a\xf4\x8f\xbf\xbf"), 0);
  EXPECT_GT(cmp("\xc3", "z"), 0);
  EXPECT_GT(cmp("\xe0\x80\xaf", "z"), 0);  // overlong "/"
  EXPECT_NE(cmp("\xc3", "\xc4"), 0);
  EXPECT_EQ(cmp(nullptr, ""), 0);
}

TEST_F(FolderMgrTest, UnprivilegedWriterGetsAnErrorAndTheFileStays) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to run a process as nobody";
  WriteFolders(Parse("[" + JsonToString(FolderJson("/music", "M", true, true, true, true)) + "]"));
  const std::string before = test::ReadFile(FoldersPath());
  ASSERT_EQ(chmod(root_.path().c_str(), 0755), 0);
  // Saving needs root; a process that cannot become root is refused before writing anything.
  const int code = test::RunAsUser("nobody", [] {
    try {
      FolderMgr mgr;
      if (mgr.folders().size() != 1) return 1;
      std::shared_ptr<Folder> diff;
      mgr.Upsert(diff, std::make_shared<Folder>(FolderJson("/photo", "P", true, true, true, true)));
      mgr.Save();
    } catch (const Error& e) {
      return e.code == kErrCredentials ? 0 : 2;
    }
    return 3;
  });
  EXPECT_EQ(code, 0);
  EXPECT_EQ(test::ReadFile(FoldersPath()), before);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
