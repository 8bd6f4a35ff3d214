#include "fileindex/folder_mgr.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/unicode.hpp"
#include "test/admin_env.hpp"

namespace orvane {
namespace fileindex {
namespace {

using testenv::ErrorOf;
using testenv::Strings;

class FolderMgrTest : public testenv::AdminTestEnv {
 protected:
  static std::vector<std::string> Names(const std::vector<std::shared_ptr<Folder>>& folders) {
    std::vector<std::string> names;
    for (const auto& f : folders) names.push_back(f->GetName());
    return names;
  }
};

TEST_F(FolderMgrTest, LoadSaveAndDamagedFiles) {
  FolderMgr().Save();
  EXPECT_EQ(ReadJson(FoldersPath()), Json::Value(Json::arrayValue));
  struct stat st;
  ASSERT_EQ(stat(FoldersPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);

  for (const std::string text : {"[{\"path\": ", "42"}) {
    ReplaceFile(FoldersPath(), text);
    EXPECT_EQ(ErrorOf([] { FolderMgr mgr; }).message,
              "Orvane error, code=504, reason=[Cannot load json: " + FoldersPath() + "]")
        << text;
    EXPECT_EQ(test::ReadFile(FoldersPath()), text);
  }
  // A hand-edited record of the wrong shape fails the whole load.
  ReplaceFile(FoldersPath(), R"([{"path": "/photo", "name": "P", "document": "yes",
                                 "audio": true, "video": true, "photo": true}])");
  EXPECT_EQ(ErrorOf([] { FolderMgr mgr; }).code, kErrInvalidParam);

  // A file that cannot be replaced: 505 naming the path.
  ASSERT_EQ(unlink(FoldersPath().c_str()), 0);
  FolderMgr mgr;
  ASSERT_EQ(mkdir(FoldersPath().c_str(), 0755), 0);
  EXPECT_EQ(ErrorOf([&] { mgr.Save(); }).message,
            "Orvane error, code=505, reason=[" + FoldersPath() + "]");
}

TEST_F(FolderMgrTest, MostSuitableFolderIsTheDeepestThenTheEarliest) {
  WriteFolders({FolderJson("/photo/trips", "A", true, false, false, false),
                FolderJson("/photo/trips/2024", "B", false, true, false, false),
                FolderJson("/photo/trips/", "C", false, false, true, false),
                FolderJson("/music", "M", true, true, true, true),
                FolderJson("/music", "M2", false, false, false, false)});
  FolderMgr mgr;
  const std::string t = vol_ + "/photo/trips";
  const std::vector<std::pair<std::string, std::string>> governing = {
      {t + "/2024/c", "B"},
      {t + "/2024x", "A"},
      {t, "A"},
      {t + "/", "C"},  // only a spelling with the slash matches "/photo/trips/"
      {vol_ + "/photo", ""},
      {vol_ + "/music/a.mp3", "M"}};  // equal paths: the earlier one
  for (const auto& c : governing) {
    auto f = mgr.GetMostSuitableCfg(c.first);
    EXPECT_EQ(f ? f->GetName() : "", c.second) << c.first;
    EXPECT_EQ(mgr.IsFullPathIndexed(c.first), !c.second.empty()) << c.first;
  }
  EXPECT_TRUE(mgr.IsFullPathHasOwnCfg(t + "/2024"));
  EXPECT_FALSE(mgr.IsFullPathHasOwnCfg(t + "/2024/c"));

  // Metadata by file kind under A (document only) and B (audio only); other kinds always.
  for (const auto& c :
       std::vector<std::pair<std::string, bool>>{{t + "/a.pdf", true},
                                                 {t + "/a.mp3", false},
                                                 {t + "/2024/a.mp3", true},
                                                 {t + "/2024/a.jpg", false},
                                                 {t + "/2024/a.zzqq", true},
                                                 {vol_ + "/photo/family/a.pdf", false}}) {
    EXPECT_EQ(mgr.IsFullPathNeedMeta(c.first), c.second) << c.first;
  }
  EXPECT_EQ(mgr.GetIndexedShares(), (std::set<std::string>{"music", "photo"}));
  std::shared_ptr<Folder> got;
  EXPECT_EQ(ErrorOf([&] { mgr.Get(got, "/Music"); }).message,
            "Orvane error, code=902, reason=[/Music]");
}

TEST_F(FolderMgrTest, ListFiltersSortsAndPages) {
  std::vector<Json::Value> list = {FolderJson("/photo/b", "beta", true, false, false, false),
                                   FolderJson("/photo/A", "Alpha trips", false, 0, 0, 0),
                                   FolderJson("/music/c", "Émile", false, 0, 0, 0),
                                   FolderJson("/photo/D", "delta TRIPS", true, 0, 0, 0),
                                   FolderJson("/music/e", "echo", false, 0, 0, 0)};
  list[1]["group"] = list[3]["group"] = "staff";
  WriteFolders(list);
  FolderMgr mgr;
  EXPECT_EQ(mgr.GetGroups(), (std::set<std::string>{"staff"}));
  std::vector<std::shared_ptr<Folder>> out;
  unsigned int total = 0;
  auto names = [&](unsigned int offset, unsigned int limit, const char* sort_by,
                   const char* direction, const char* group, const char* keyword) {
    mgr.List(out, total, offset, limit, sort_by, direction, group, keyword);
    return Names(out);
  };
  EXPECT_EQ(names(0, 100, "name", "DESC", "all", ""),
            (Strings{"Émile", "echo", "delta TRIPS", "beta", "Alpha trips"}));
  EXPECT_EQ(names(1, 2, "name", "asc", "all", ""), (Strings{"beta", "delta TRIPS"}));
  EXPECT_EQ(total, 5u);
  // The group filter is exact; an empty group keeps the folders without one.
  EXPECT_EQ(names(0, 10, "path", "asc", "", ""), (Strings{"Émile", "echo", "beta"}));
  EXPECT_TRUE(names(0, 10, "path", "asc", "Staff", "").empty());
  // The keyword is trimmed and case-blind, and only names are searched.
  EXPECT_EQ(names(0, 10, "path", "asc", "staff", "  trips "),
            (Strings{"Alpha trips", "delta TRIPS"}));
  EXPECT_TRUE(names(0, 10, "path", "asc", "all", "photo").empty());
  ASSERT_EQ(names(0, 10, "document", "asc", "all", "").size(), 5u);
  for (size_t i = 0; i < out.size(); ++i) EXPECT_EQ(out[i]->IsDocument(), i >= 3) << i;
  // The key is case-sensitive: an unknown one sorts by name.
  EXPECT_EQ(names(0, 10, "Document", "desc", "all", "").front(), "Émile");
}

TEST(CaseBlindCompareTest, Utf8TextsOrderWithoutCaseByCodePoint) {
  auto cmp = [](const char* a, const char* b) {
    return platform::QLIBCUnicodeUTF8StrCaseCmp(a, b);
  };
  EXPECT_EQ(cmp("ÉCOLE Ünïcode Ωmega", "école ünÏcode ωMEGA"), 0);
  EXPECT_LT(cmp("ab", "AbC"), 0);  // a prefix first
  EXPECT_GT(cmp("é", "z"), 0);     // by code point, not by any collation
  // Bytes that begin no valid sequence sort after every character, and never read past the end.
  EXPECT_GT(cmp("a\xff", "a\xf4\x8f\xbf\xbf"), 0);
  EXPECT_GT(cmp("\xc3", "z"), 0);
  EXPECT_GT(cmp("\xe0\x80\xaf", "z"), 0);  // overlong "/"
  EXPECT_EQ(cmp(nullptr, ""), 0);
}

TEST_F(FolderMgrTest, UnprivilegedWriterGetsAnErrorAndTheFileStays) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to run a process as nobody";
  WriteFolders({FolderJson("/music", "M", true, true, true, true)});
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
