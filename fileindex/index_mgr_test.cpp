#include "fileindex/index_mgr.hpp"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include "fileindex/admin_test_env.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/fault.hpp"
#include "platform/monitor_queue.hpp"
#include "platform/platform_error.hpp"

namespace orvane {
namespace fileindex {
namespace {

using IndexMgrTest = testenv::AdminOpsTest;
using platform::Fault;
using platform::ScopedFaults;
using testenv::ErrorOf;
using testenv::Strings;

TEST_F(IndexMgrTest, AddThenSetKeepsIndexRegistrationAndQueueInStep) {
  FolderAdd(List({FolderJson("/photo/trips", "Trips", true, true, true, true),
                  FolderJson("/music", "Music", true, true, false, false),
                  FolderJson("/photo/family", "Family", true, false, false, false)}),
            false);
  EXPECT_EQ(FolderPaths(), (Strings{"/photo/trips", "/music", "/photo/family"}));
  EXPECT_EQ(EngineCommands(),
            (Strings{"index_create fileindex_music", "index_create fileindex_photo"}));
  EXPECT_EQ(Registrations(), (Strings{"music: /music", "photo: /photo/trips /photo/family"}));
  EXPECT_EQ(IndexdCommands(), (Strings{Notify("music", true), Notify("photo", true)}));
  EXPECT_EQ(Events("photo"), (Strings{std::string("131072 /photo/trips ") + kAll,
                                      std::string("131072 /photo/family ") + kAll}));
  EXPECT_EQ(Events("music"), (Strings{std::string("131072 /music ") + kAll}));
  EXPECT_EQ(Actions(), "start-ce\nstart-fi\n");
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 0);  // the status file now exists

  // Audio off for the trips: one event with only audio, the record moved to the end, no index
  // created again. A record that changes nothing but its name queues nothing.
  FolderSet(List({FolderJson("/photo/trips", "Trips", true, false, true, true),
                  FolderJson("/music", "Tunes", true, true, false, false)}),
            false);
  EXPECT_EQ(FolderPaths(), (Strings{"/photo/family", "/photo/trips", "/music"}));
  EXPECT_EQ(Folders()[2]["name"], "Tunes");
  EXPECT_EQ(EngineCommands().size(), 2u);
  EXPECT_EQ(Events("photo").back(),
            R"(131072 /photo/trips {"audio":true,"document":false,"photo":false,"video":false})");
  EXPECT_EQ(Events("music").size(), 1u);
  EXPECT_EQ(IndexdCommands().size(), 4u);

  // A sub-folder differs from its parent only in video; in updater mode nothing is queued.
  FolderAdd(List({FolderJson("/photo/trips/2024", "2024", true, false, false, true)}), false);
  EXPECT_EQ(
      Events("photo").back(),
      R"(131072 /photo/trips/2024 {"audio":false,"document":false,"photo":false,"video":true})");
  const size_t events = Events("photo").size();
  FolderSet(List({FolderJson("/photo/family", "F", false, false, false, false)}), true);
  EXPECT_EQ(Events("photo").size(), events);
  EXPECT_EQ(Registrations(),
            (Strings{"music: /music", "photo: /photo/trips /photo/trips/2024 /photo/family"}));

  // Setting a path of a share that had no folder adds it; only an add creates the index.
  FolderSet(List({FolderJson("/homes/bob", "Bob", true, true, true, true)}), false);
  EXPECT_EQ(EngineCommands().size(), 2u);
  EXPECT_EQ(FolderPaths().back(), "/homes/bob");
}

TEST_F(IndexMgrTest, RefusedRequestsChangeNothing) {
  FolderAdd(List({FolderJson("/photo/trips", "Trips", true, true, true, true)}), false);
  const std::string folders = test::ReadFile(FoldersPath());
  const std::string queue = test::ReadFile(Queue("photo"));
  const size_t engine = EngineCommands().size();
  const size_t indexd = IndexdCommands().size();
  const Strings registrations = Registrations();
  const Json::Value good = FolderJson("/music", "Music", true, true, true, true);

  test::LogCapture log;
  auto refused = [&](const Json::Value& request, bool create, int code, const std::string& reason) {
    const Error e =
        ErrorOf([&] { create ? FolderAdd(request, false) : FolderSet(request, false); });
    EXPECT_EQ(e.code, code) << JsonToString(request);
    if (!reason.empty()) {
      EXPECT_EQ(e.message,
                "Orvane error, code=" + std::to_string(code) + ", reason=[" + reason + "]");
    }
  };
  refused(Parse(R"({"path": "/music"})"), true, 120, R"({"path":"/music"})");
  EXPECT_TRUE(log.Contains("Failed [!folder_list.isArray()]"));
  refused(List({good, Json::Value("x")}), true, 120, "Not an object, data=\"x\"");
  Json::Value all = good;
  all["group"] = "all";
  refused(List({good, all}), false, 120, "\"all\" is reserved group name");
  Json::Value no_photo = good;
  no_photo.removeMember("photo");
  refused(List({no_photo}), true, 120, "Missing property: photo, data=" + JsonToString(no_photo));
  refused(List({good, FolderJson("/photo/trips", "T", true, true, true, true)}), true, 901,
          "Duplicated ID: /photo/trips");
  EXPECT_TRUE(log.Contains("Failed [create && folder_mgr.HasFolder(folder_new->GetPath())]"));
  refused(List({good, FolderJson("/photo/#recycle", "Bin", true, true, true, true)}), false, 903,
          "Path cannot index: /photo/#recycle");
  EXPECT_TRUE(log.Contains("Failed [!CanPathBeIndexed(folder_new->GetPath()) && !updater_mode]"));
  refused(List({FolderJson("/ro/x", "RO", true, true, true, true)}), true, 903, "");
  refused(List({FolderJson("/nosuch/x", "N", true, true, true, true)}), true, 800, "");
  refused(List({FolderJson("music", "N", true, true, true, true)}), true, 120, "");
  {
    ScopedFaults faults;
    faults.Arm("QUIXQuotaIsEnough", Fault{0, 0, platform::kQErrVolumeFull});
    refused(List({good}), true, 1003, "Share (music) space not enough");
    EXPECT_TRUE(log.Contains("Failed [!share.IsSpaceEnough()]"));
  }

  EXPECT_EQ(test::ReadFile(FoldersPath()), folders);
  EXPECT_EQ(test::ReadFile(Queue("photo")), queue);
  EXPECT_FALSE(IsFileExist(Queue("music")));
  EXPECT_EQ(EngineCommands().size(), engine);
  EXPECT_EQ(IndexdCommands().size(), indexd);
  EXPECT_EQ(Registrations(), registrations);

  // The updater re-applies stored records without the indexability test or events.
  FolderAdd(List({FolderJson("/photo/#recycle", "Bin", true, true, true, true)}), true);
  EXPECT_EQ(FolderPaths().back(), "/photo/#recycle");
  EXPECT_EQ(test::ReadFile(Queue("photo")), queue);
}

TEST_F(IndexMgrTest, EmptyRequestOnlySwitchesServicesOn) {
  FolderAdd(Json::Value(Json::arrayValue), false);
  EXPECT_EQ(Folders(), Json::Value(Json::arrayValue));
  EXPECT_EQ(Actions(), "start-ce\nstart-fi\n");
  EXPECT_TRUE(EngineCommands().empty());
  EXPECT_TRUE(IndexdCommands().empty());
  EXPECT_TRUE(Registrations().empty());
}

TEST_F(IndexMgrTest, FailuresAfterTheChecksAreNotRolledBack) {
  // The engine refuses the index: nothing is saved, the services are already on.
  StartEngine({R"({"success":false,"error":{"code":700}})"});
  EXPECT_NE(ErrorOf([&] {
              FolderAdd(List({FolderJson("/music", "M", true, true, true, true)}), false);
            }).code,
            0);
  EXPECT_FALSE(IsFileExist(FoldersPath()));
  StartDaemons();

  // The registration fails after the index was made: the index stays, nothing is saved.
  {
    ScopedFaults faults;
    faults.Arm("MonitorQueue::Upsert", Fault{0, EIO});
    EXPECT_EQ(ErrorOf([&] {
                FolderAdd(List({FolderJson("/music", "M", true, true, true, true)}), false);
              }).code,
              kErrSystem);
  }
  EXPECT_EQ(EngineCommands(), (Strings{"index_create fileindex_music"}));
  EXPECT_FALSE(IsFileExist(FoldersPath()));

  // The queue cannot be written: the configuration is saved, the share flagged, the error out.
  ASSERT_TRUE(MakeParentDirs(Queue("music") + "/x"));
  EXPECT_EQ(ErrorOf([&] {
              FolderAdd(List({FolderJson("/music", "M", true, true, true, true)}), false);
            }).code,
            kErrSystem);
  EXPECT_EQ(FolderPaths(), (Strings{"/music"}));
  EXPECT_EQ(StatusMgr().GetShareStatus("music"), kShareStatusNeedReindex);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
