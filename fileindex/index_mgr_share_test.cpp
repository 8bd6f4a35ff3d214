#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <set>

#include "fileindex/index_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/platform_error.hpp"
#include "test/admin_env.hpp"
#include "test/faults.hpp"

namespace orvane {
namespace fileindex {
namespace {

using platform::Fault;
using platform::ScopedFaults;
using testenv::ErrorOf;
using testenv::Strings;

class ShareOpsTest : public testenv::AdminOpsTest {
 protected:
  void SetUp() override {
    AdminOpsTest::SetUp();
    FolderAdd(List({FolderJson("/photo/trips", "Trips", true, true, true, true),
                    FolderJson("/music", "Music", true, true, false, false),
                    FolderJson("/photo/family", "Family", true, false, false, false)}),
              false);
    NewEngine();
    NewIndexd();
  }
};

TEST_F(ShareOpsTest, PauseAndResumeSharesAndVolumes) {
  SharePause("photo");
  EXPECT_EQ(NewIndexd(), (Strings{Worker("worker_delete", "photo")}));
  EXPECT_EQ(NewEngine(), (Strings{"index_pause fileindex_photo"}));
  EXPECT_EQ(Registrations(), (Strings{"music: /music"}));
  EXPECT_EQ(Paused(), (std::vector<bool>{true, false, true}));

  // The registration comes back from the configuration as it is now.
  FolderDelete(Parse(R"(["/photo/family"])"));
  NewEngine();
  NewIndexd();
  ShareResume("photo");
  EXPECT_EQ(NewEngine(), (Strings{"index_resume fileindex_photo"}));
  EXPECT_EQ(NewIndexd(), (Strings{Worker("worker_create", "photo")}));
  EXPECT_EQ(Registrations(), (Strings{"music: /music", "photo: /photo/trips"}));
  EXPECT_EQ(Paused(), (std::vector<bool>{false, false}));
  SharePause("Photos");  // a share without folders: nothing at all
  ShareResume("Photos");
  VolumePause(scratch_.path());  // no share there
  EXPECT_TRUE(NewEngine().empty());
  EXPECT_TRUE(NewIndexd().empty());

  // A volume's shares are paused each and flagged in the status file until resumed.
  VolumePause(vol_);
  EXPECT_EQ(NewIndexd(),
            (Strings{Worker("worker_delete", "music"), Worker("worker_delete", "photo")}));
  EXPECT_TRUE(FolderSummary()["shares"][1]["volume_paused"].asBool());
  VolumeResume(vol_);
  EXPECT_EQ(Paused(), (std::vector<bool>{false, false}));
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 0);
  VolumePause(vol_);
  VolumeClearPaused(vol_);
  EXPECT_EQ(Folders(), Json::Value(Json::arrayValue));
  EXPECT_FALSE(StatusMgr().data()["share"].isMember("photo"));
  EXPECT_EQ(Actions(), "start-ce\nstart-fi\nstop-fi\n");
}

TEST_F(ShareOpsTest, RenameMovesFoldersIndexAndDocuments) {
  // The platform has renamed the share before the hook runs.
  ASSERT_EQ(rename((vol_ + "/photo").c_str(), (vol_ + "/pics").c_str()), 0);
  WritePlatform(DefaultShares() + R"(, {"name": "pics", "path": ")" + vol_ + R"(/pics"})");
  ShareRename("photo", "pics");
  EXPECT_EQ(FolderPaths(), (Strings{"/pics/trips", "/music", "/pics/family"}));
  EXPECT_EQ(EngineRequests().back(), Parse(R"({"command": "index_config_set", "data": {
      "id": "fileindex_photo", "data": {"id": "fileindex_pics", "path": ")" +
                                           vol_ + R"(/pics/@eaDir/@fileindex/db"}}})"));
  EXPECT_EQ(Events("pics").back(), "256 /pics <- /photo");
  EXPECT_TRUE(NewIndexd().empty());
  EXPECT_EQ(NewEngine().size(), 1u);

  // A share that no folder uses is renamed in the index all the same.
  ShareRename("Photos", "music");
  EXPECT_EQ(NewEngine(), (Strings{"index_config_set fileindex_Photos"}));
  EXPECT_EQ(Events("music").back(), "256 /music <- /Photos");
}

TEST_F(ShareOpsTest, RebuildAndRecycleCheckQueueReindexes) {
  ShareRebuild("photo");
  EXPECT_EQ(NewEngine(), (Strings{"index_delete fileindex_photo", "index_create fileindex_photo"}));
  EXPECT_EQ(Events("photo").back(), "65536 /photo");
  EXPECT_EQ(NewIndexd(), (Strings{Worker("worker_create", "photo")}));
  EXPECT_EQ(Registrations(), (Strings{"music: /music", "photo: /photo/trips /photo/family"}));

  // The recycle bin lies under the queued share re-index: nothing more to write.
  const size_t events = Events("photo").size();
  ShareCheckRecycle("photo");
  EXPECT_EQ(Events("photo").size(), events);
  ShareCheckRecycle("music");  // no bin
  ASSERT_TRUE(MakeParentDirs(vol_ + "/music/#recycle/x"));
  ShareCheckRecycle("music");
  EXPECT_EQ(Events("music").back(), "65536 /music/#recycle");
  ShareRebuild("Photos");  // no folder: nothing
  EXPECT_TRUE(NewEngine().empty());
}

TEST_F(ShareOpsTest, ClearPausedAndAutoCleanRemoveOnlyIndexData) {
  const std::string idx = vol_ + "/photo/@eaDir/@fileindex";
  volume_.Write("photo/@eaDir/@fileindex/queue.tmp", "x\n");
  volume_.Write("photo/@eaDir/@fileindex/db/index/seg", "data");
  volume_.Write("photo/@eaDir/@fileindex/keep", "mine");
  ASSERT_EQ(symlink((vol_ + "/music").c_str(), (idx + "/db/link").c_str()), 0);
  SharePause("photo");
  NewEngine();
  ShareClearPaused("photo", vol_ + "/photo");
  EXPECT_EQ(NewEngine(), (Strings{"index_delete fileindex_photo"}));
  EXPECT_EQ(FolderPaths(), (Strings{"/music"}));
  for (const char* gone : {"/queue", "/queue.tmp", "/db"}) {
    EXPECT_FALSE(IsFileExist(idx + gone) || IsDirExist(idx + gone, false)) << gone;
  }
  EXPECT_EQ(test::ReadFile(idx + "/keep"), "mine");
  EXPECT_TRUE(IsDirExist(vol_ + "/music/live", false));  // the link was not followed
  EXPECT_EQ(Actions(), "start-ce\nstart-fi\n");          // folders are left: services stay on

  // Auto clean: a share with a folder is left alone, one without loses index and registration.
  ShareAutoClean("music");
  EXPECT_TRUE(NewEngine().empty());
  EXPECT_TRUE(IsFileExist(Queue("music")));
  ASSERT_TRUE(JsonValue(Json::Value(Json::arrayValue)).toFile(FoldersPath()));
  ShareAutoClean("music");
  EXPECT_EQ(NewEngine(), (Strings{"index_delete fileindex_music"}));
  EXPECT_TRUE(Registrations().empty());
  EXPECT_FALSE(IsFileExist(Queue("music")));
}

TEST_F(ShareOpsTest, DaemonOrPlatformFailuresStopBeforeLaterSteps) {
  test::FakeEnv env;  // the connect attempts sleep on the fake clock
  indexd_.reset();
  EXPECT_EQ(ErrorOf([] { SharePause("photo"); }).code, kErrSystem);
  EXPECT_EQ(Paused(), (std::vector<bool>{false, false, false}));
  EXPECT_EQ(Registrations(), (Strings{"music: /music", "photo: /photo/trips /photo/family"}));
  EXPECT_TRUE(NewEngine().empty());

  // The index locations cannot be composed: nothing is removed.
  volume_.Write("music/@eaDir/@fileindex/db/seg", "data");
  ScopedFaults faults;
  faults.Arm("FILEIDXQueuePathCompose", Fault{-1, ENAMETOOLONG});
  EXPECT_EQ(ErrorOf([&] { CleanShareIndexData("music", vol_ + "/music"); }).code, kErrSystem);
  EXPECT_EQ(test::ReadFile(vol_ + "/music/@eaDir/@fileindex/db/seg"), "data");
}

TEST_F(ShareOpsTest, MigrateFollowsTheShareToItsNewFolder) {
  test::TempDir volume2;
  const std::string old_path = vol_ + "/photo";
  const std::string new_path = volume2.path() + "/photo";
  ASSERT_EQ(rename(old_path.c_str(), new_path.c_str()), 0);
  std::string shares = DefaultShares();
  WritePlatform(shares.replace(shares.find(old_path), old_path.size(), new_path));

  ShareMigrate("photo", old_path);
  EXPECT_EQ(EngineRequests().back(), Parse(R"({"command": "index_config_set", "data": {
      "id": "fileindex_photo", "data": {"path": ")" +
                                           new_path + R"(/@eaDir/@fileindex/db"}}})"));
  std::set<std::string> queues;
  for (const Json::Value& r : QUIX::QUIXNOTIFYD::MonitorQueue::List()) {
    queues.insert(r["queue"].asString());
  }
  EXPECT_EQ(queues, (std::set<std::string>{Queue("music"), new_path + "/@eaDir/@fileindex/queue"}));
  EXPECT_NE(test::ReadFile(new_path + "/@eaDir/@fileindex/queue")
                .find(R"({"data":null,"event":256,"path":")" + new_path + R"(","path_old":")" +
                      old_path + "\"}\n"),
            std::string::npos);
  EXPECT_EQ(NewIndexd(), (Strings{Worker("worker_create", "photo")}));
}

TEST_F(ShareOpsTest, MissingArgumentsAreRefused) {
  const std::vector<std::pair<std::function<void()>, std::string>> cases = {
      {[] { SharePause(""); }, "Missing share name"},
      {[] { ShareRename("", "x"); }, "Missing share_from"},
      {[] { ShareClearPaused("music", ""); }, "Missing share path"},
      {[] { CleanShareIndexData("music", "music"); }, "Bad share path of music: music"},
      {[] { VolumePause(""); }, "Missing volume path"},
      {[] { UserRename("", "x"); }, "Missing user_from"}};
  const std::string folders = test::ReadFile(FoldersPath());
  for (const auto& c : cases) {
    EXPECT_EQ(ErrorOf(c.first).message, "Orvane error, code=120, reason=[" + c.second + "]");
  }
  // The share is opened before the argument is looked at.
  EXPECT_EQ(ErrorOf([] { ShareRebuild(""); }).code, kErrShareGet);
  EXPECT_EQ(test::ReadFile(FoldersPath()), folders);
  EXPECT_TRUE(NewEngine().empty());
  EXPECT_TRUE(NewIndexd().empty());
}

using UserOpsTest = testenv::AdminOpsTest;

TEST_F(UserOpsTest, RenameMovesHomeFoldersOnly) {
  FolderAdd(List({FolderJson("/homes/bob", "Bob", true, true, true, true),
                  FolderJson("/homes/bobby", "Bobby", true, true, true, true),
                  FolderJson("/homes/bob/docs", "Docs", true, false, false, false)}),
            false);
  test::LogCapture log;
  UserRename("bob", "rob");
  EXPECT_EQ(FolderPaths(), (Strings{"/homes/rob", "/homes/bobby", "/homes/rob/docs"}));
  EXPECT_EQ(Folders()[2]["name"], "Docs");
  EXPECT_TRUE(log.Contains("Update homes rule: [/homes/bob/docs] -> [/homes/rob/docs]"));
  EXPECT_EQ(log.Count("Update homes rule"), 2);
  EXPECT_EQ(Events("homes").back(), "256 /homes/rob <- /homes/bob");
}

TEST_F(UserOpsTest, RememberThenDeleteRemovesTheHomeFolders) {
  ASSERT_TRUE(MakeParentDirs(vol_ + "/homes/nobody/docs/x"));
  ASSERT_TRUE(MakeParentDirs(vol_ + "/homes/nobodyx/x"));
  const unsigned int uid = 65534;
  UserRemember(uid);
  const std::string infos = Rooted(kFileIndexUserInfosPath);
  EXPECT_EQ(ReadJson(infos), Parse(R"({"65534": {"home_path": "/homes/nobody"}})"));
  FolderAdd(List({FolderJson("/homes/nobody/docs", "D", true, true, true, true),
                  FolderJson("/homes/nobodyx", "X", true, true, true, true),
                  FolderJson("/homes/nobody", "N", true, true, true, true)}),
            false);
  UserDelete(uid);
  EXPECT_EQ(FolderPaths(), (Strings{"/homes/nobodyx"}));
  EXPECT_EQ(ReadJson(infos), Json::Value(Json::objectValue));

  EXPECT_EQ(ErrorOf([&] { UserDelete(uid); }).message,
            "Orvane error, code=120, reason=[Missing property: 65534, data={}]");
  ReplaceFile(infos, "{\"1\": ");
  EXPECT_EQ(ErrorOf([&] { UserDelete(uid); }).message,
            "Orvane error, code=504, reason=[Cannot load json: " + infos + "]");
  EXPECT_EQ(ErrorOf([&] { UserRemember(uid); }).code, kErrLoadConfig);
  EXPECT_EQ(test::ReadFile(infos), "{\"1\": ");
  EXPECT_EQ(FolderPaths(), (Strings{"/homes/nobodyx"}));
}

TEST_F(UserOpsTest, HomeServiceChangesReindexHomeRecycleBins) {
  FolderAdd(List({FolderJson("/homes", "Homes", true, true, true, true)}), false);
  ASSERT_TRUE(MakeParentDirs(vol_ + "/homes/nobody/#recycle/x"));
  ASSERT_TRUE(MakeParentDirs(vol_ + "/homes/root/#recycle/x"));
  HomeEnable(platform::AUTH_ALL);
  Strings events = Events("homes");
  EXPECT_EQ(Strings(events.end() - 2, events.end()),
            (Strings{"65536 /homes/nobody/#recycle", "65536 /homes/root/#recycle"}));
  HomeDisable(platform::AUTH_LOCAL);  // already queued: nothing more
  EXPECT_EQ(Events("homes").size(), events.size());

  test::LogCapture log;
  ScopedFaults faults;
  faults.Arm("QUIXRecycleHomeEnumRecyclePath", Fault{-1, EIO, platform::kQErrSystem});
  HomeEnable(platform::AUTH_ALL);  // logged, never thrown
  EXPECT_TRUE(
      log.Contains("(ReindexHomeRecycleBins) QUIXRecycleHomeEnumRecyclePath failed. "
                   "auth: 7 [err: Input/output error]"));
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
