#include "fileindex/index_mgr.hpp"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <map>
#include <set>

#include "fileindex/folder_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/platform_error.hpp"
#include "test/admin_env.hpp"
#include "test/faults.hpp"

namespace orvane {
namespace fileindex {
namespace {

using IndexMgrTest = testenv::AdminOpsTest;
using platform::Fault;
using platform::ScopedFaults;
using testenv::ErrorOf;
using testenv::Strings;

TEST_F(IndexMgrTest, AddSetAndDeleteKeepIndexRegistrationQueueAndServicesInStep) {
  FolderAdd(List({FolderJson("/photo/trips", "Trips", true, true, true, true),
                  FolderJson("/music", "Music", true, true, false, false),
                  FolderJson("/photo/family", "Family", true, false, false, false)}),
            false);
  EXPECT_EQ(FolderPaths(), (Strings{"/photo/trips", "/music", "/photo/family"}));
  EXPECT_EQ(NewEngine(), (Strings{"index_create fileindex_music", "index_create fileindex_photo"}));
  EXPECT_EQ(Registrations(), (Strings{"music: /music", "photo: /photo/trips /photo/family"}));
  EXPECT_EQ(NewIndexd(), (Strings{Notify("music", true), Notify("photo", true)}));
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
  EXPECT_TRUE(NewEngine().empty());
  const std::string audio_only = R"({"audio":true,"document":false,"photo":false,"video":false})";
  const std::string video_only = R"({"audio":false,"document":false,"photo":false,"video":true})";
  EXPECT_EQ(Events("photo").back(), "131072 /photo/trips " + audio_only);
  EXPECT_EQ(Events("music").size(), 1u);

  // A sub-folder differs from its parent only in video, and so does its removal.
  FolderAdd(List({FolderJson("/photo/trips/2024", "2024", true, false, false, true)}), false);
  EXPECT_EQ(Events("photo").back(), "131072 /photo/trips/2024 " + video_only);
  NewIndexd();
  FolderDelete(Parse(R"(["/photo/trips/2024"])"));
  EXPECT_EQ(Events("photo").back(), "131072 /photo/trips/2024 " + video_only);
  EXPECT_EQ(Registrations(), (Strings{"music: /music", "photo: /photo/family /photo/trips"}));
  EXPECT_EQ(NewIndexd(), (Strings{Notify("photo", false)}));

  // The last folder of a share takes its index and registration with it, and no event; the
  // last folder of all stops the indexing daemon.
  FolderDelete(Parse(R"(["/music"])"));
  EXPECT_EQ(NewEngine(), (Strings{"index_delete fileindex_music"}));
  EXPECT_EQ(Events("music").size(), 1u);
  FolderDelete(Parse(R"(["/photo/trips", "/photo/family"])"));
  EXPECT_EQ(NewEngine(), (Strings{"index_delete fileindex_photo"}));
  EXPECT_TRUE(Registrations().empty());
  EXPECT_EQ(Actions(), "start-ce\nstart-fi\nstart-ce\nstart-fi\nstart-ce\nstart-fi\nstop-fi\n");

  // Setting a path of a share that had no folder adds it; only an add creates the index.
  FolderSet(List({FolderJson("/homes/bob", "Bob", true, true, true, true)}), false);
  EXPECT_TRUE(NewEngine().empty());
  EXPECT_EQ(FolderPaths(), (Strings{"/homes/bob"}));
}

TEST_F(IndexMgrTest, RefusedRequestsChangeNothing) {
  FolderAdd(List({FolderJson("/photo/trips", "Trips", true, true, true, true)}), false);
  const std::string folders = test::ReadFile(FoldersPath());
  const std::string queue = test::ReadFile(Queue("photo"));
  const Strings regs = Registrations();
  NewEngine();
  NewIndexd();
  const Json::Value good = FolderJson("/music", "Music", true, true, true, true);

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
  // A bad record after a good one: the good one is not kept either.
  refused(List({good, FolderJson("/photo/trips", "T", true, true, true, true)}), true, 901,
          "Duplicated ID: /photo/trips");
  refused(List({good, FolderJson("/photo/#recycle", "Bin", true, true, true, true)}), false, 903,
          "Path cannot index: /photo/#recycle");
  refused(List({FolderJson("/ro/x", "RO", true, true, true, true)}), true, 903,
          "Path cannot index: /ro/x");
  refused(List({FolderJson("/nosuch/x", "N", true, true, true, true)}), true, 800, "");
  refused(List({good, FolderJson("music", "N", true, true, true, true)}), true, 120, "");
  {
    ScopedFaults faults;
    faults.Arm("QUIXQuotaIsEnough", Fault{0, 0, platform::kQErrVolumeFull});
    refused(List({good}), true, 1003, "Share (music) space not enough");
  }
  EXPECT_EQ(ErrorOf([] { FolderDelete(Parse(R"("/photo/trips")")); }).code, kErrInvalidParam);
  EXPECT_EQ(ErrorOf([] { FolderDelete(Parse(R"(["/photo/trips", "/music"])")); }).message,
            "Orvane error, code=902, reason=[/music]");
  EXPECT_EQ(ErrorOf([] { FolderDelete(Parse(R"(["/photo/trips", "/photo/trips"])")); }).code,
            kErrFolderNotFound);
  EXPECT_EQ(test::ReadFile(FoldersPath()), folders);
  EXPECT_EQ(test::ReadFile(Queue("photo")), queue);
  EXPECT_FALSE(IsFileExist(Queue("music")));
  EXPECT_TRUE(NewEngine().empty());
  EXPECT_TRUE(NewIndexd().empty());
  EXPECT_EQ(Registrations(), regs);

  // The updater re-applies stored records without the indexability test or events.
  FolderAdd(List({FolderJson("/photo/#recycle", "Bin", true, true, true, true)}), true);
  EXPECT_EQ(FolderPaths().back(), "/photo/#recycle");
  EXPECT_EQ(test::ReadFile(Queue("photo")), queue);
}

TEST_F(IndexMgrTest, FreshSystemAnswersWithoutAnyFileAndAnEmptyAddOnlyStartsServices) {
  EXPECT_EQ(FolderSummary(), Parse(R"({"folder_count": 0, "resume_time": -1, "paused": false,
                                      "shares": []})"));
  EXPECT_EQ(FolderList(Parse("{}")), Parse(R"({"folders": [], "total": 0})"));
  EXPECT_EQ(ErrorOf([] { FolderGetProcessingStatus("/music"); }).code, kErrFolderNotFound);
  EXPECT_FALSE(IsFileExist(FoldersPath()));

  FolderAdd(Json::Value(Json::arrayValue), false);
  EXPECT_EQ(Folders(), Json::Value(Json::arrayValue));
  EXPECT_EQ(Actions(), "start-ce\nstart-fi\n");
  EXPECT_TRUE(NewEngine().empty());
  EXPECT_TRUE(NewIndexd().empty());
  EXPECT_TRUE(Registrations().empty());
}

TEST_F(IndexMgrTest, FailuresAfterTheChecksAreNotRolledBack) {
  const Json::Value music = List({FolderJson("/music", "M", true, true, true, true)});
  // The engine refuses the index: nothing is saved, the services are already on.
  StartEngine({R"({"success":false,"error":{"code":700}})"});
  EXPECT_NE(ErrorOf([&] { FolderAdd(music, false); }).code, 0);
  EXPECT_FALSE(IsFileExist(FoldersPath()));
  StartDaemons();

  // The registration fails after the index was made: the index stays, nothing is saved.
  {
    ScopedFaults faults;
    faults.Arm("MonitorQueue::Upsert", Fault{0, EIO});
    EXPECT_EQ(ErrorOf([&] { FolderAdd(music, false); }).code, kErrSystem);
  }
  EXPECT_EQ(NewEngine(), (Strings{"index_create fileindex_music"}));
  EXPECT_FALSE(IsFileExist(FoldersPath()));

  // A folder in the queue's place is refused: the configuration is saved and the error out.
  ASSERT_TRUE(MakeParentDirs(Queue("music") + "/x"));
  EXPECT_EQ(ErrorOf([&] { FolderAdd(music, false); }).code, kErrUnsafePath);
  EXPECT_EQ(FolderPaths(), (Strings{"/music"}));

  // With the indexing daemon gone the change is saved and the failure reaches the caller.
  test::FakeEnv env;  // the connect attempts sleep on the fake clock
  indexd_.reset();
  EXPECT_EQ(ErrorOf([] { FolderDelete(Parse(R"(["/music"])")); }).code, kErrSystem);
  EXPECT_EQ(Folders(), Json::Value(Json::arrayValue));
}

TEST_F(IndexMgrTest, ReindexRebuildsOnlyWholeShares) {
  FolderAdd(List({FolderJson("/photo/trips", "Trips", true, true, true, true),
                  FolderJson("/photo/family", "Family", true, true, true, true),
                  FolderJson("/music", "Music", true, true, true, true)}),
            false);
  StatusMgr().SetShareStatus("photo", kShareStatusNeedReindex | 4);
  NewEngine();
  NewIndexd();
  FolderReindex(Parse(R"(["/photo/trips"])"));
  EXPECT_EQ(Events("photo").back(), "65536 /photo/trips");
  EXPECT_TRUE(NewEngine().empty());

  FolderReindex(Parse(R"(["/photo/family", "/photo/trips", "/music"])"));
  EXPECT_EQ(NewEngine(), (Strings{"index_delete fileindex_music", "index_create fileindex_music",
                                  "index_delete fileindex_photo", "index_create fileindex_photo"}));
  EXPECT_EQ(NewIndexd(),
            (Strings{Worker("worker_create", "music"), Worker("worker_create", "photo")}));
  // The trips' re-index is still queued, so only the family is added.
  const Strings photo = Events("photo");
  EXPECT_EQ(Strings(photo.end() - 2, photo.end()),
            (Strings{"65536 /photo/trips", "65536 /photo/family"}));
  EXPECT_EQ(Events("music").back(), "65536 /music");
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 4);
  EXPECT_EQ(ErrorOf([] { FolderReindex(Parse(R"(["/photo"])")); }).code, kErrFolderNotFound);
  EXPECT_EQ(ErrorOf([] { FolderReindex(Parse(R"({})")); }).code, kErrInvalidParam);
}

TEST_F(IndexMgrTest, ListingSummaryAndProcessingStatus) {
  Json::Value staff = FolderJson("/photo/trips", "Trips", true, true, true, true);
  staff["group"] = "staff";
  FolderAdd(List({staff, FolderJson("/photo/family", "family", true, true, true, true),
                  FolderJson("/music", "Music", true, true, true, true)}),
            false);
  Json::Value list = FolderList(Parse(R"({"sort_by": "name", "sort_direction": "desc",
      "offset": 1, "limit": 1, "group": "all", "keyword": "", "additional": ["status"]})"));
  EXPECT_EQ(list["total"], 3);
  ASSERT_EQ(list["folders"].size(), 1u);
  EXPECT_EQ(list["folders"][0]["name"], "Music");
  // Every new folder has its folder-settings event waiting, and nothing is paused.
  EXPECT_EQ(list["folders"][0]["additional"]["status"]["text"], "processing");
  for (const char* bad :
       {R"({"offset": -1})", R"({"limit": "2"})", R"({"additional": ["size"], "keyword": "none"})",
        "[]"}) {
    EXPECT_EQ(ErrorOf([&] { FolderList(Parse(bad)); }).code, kErrInvalidParam) << bad;
  }
  EXPECT_EQ(FolderListGroups(), Parse(R"(["staff"])"));

  StatusMgr().Pause(0);
  EXPECT_EQ(FolderGetProcessingStatus("/photo/family"),
            Parse(R"({"path": "/photo/family", "text": "paused", "pending": true})"));
  StatusMgr().SetShareStatus("music", kShareStatusNeedReindex);
  StatusMgr().SetShareStatus("photo", kShareStatusQueueNoSpace | kShareStatusWatchLimit);
  EXPECT_EQ(FolderSummary(), Parse(R"({"folder_count": 3, "resume_time": 0, "paused": true,
      "shares": [{"share": "music", "folder_count": 1, "queue_length": 1, "status": 1,
                  "need_reindex": true, "volume_paused": false, "queue_no_space": false,
                  "watch_limit": false},
                 {"share": "photo", "folder_count": 2, "queue_length": 2, "status": 12,
                  "need_reindex": false, "volume_paused": false, "queue_no_space": true,
                  "watch_limit": true}]})"));
}

TEST_F(IndexMgrTest, ConcurrentAdministratorsLoseNothing) {
  // Each process adds its own folders one by one, renames some and deletes others; the folder
  // file must end up as exactly what each was told succeeded.
  constexpr int kProcs = 4;
  constexpr int kFolders = 6;
  auto path_of = [](int p, int i) {
    return "/music/p" + std::to_string(p) + "/f" + std::to_string(i);
  };
  for (int p = 0; p < kProcs; ++p) {
    for (int i = 0; i < kFolders; ++i) ASSERT_TRUE(MakeParentDirs(vol_ + path_of(p, i) + "/x"));
  }
  // A fork copies only the calling thread, so a lock a daemon thread held at that moment (the
  // allocator's, even while the thread is still starting) would stay held in the child for ever.
  // The daemons are stopped while the children are forked and started again before the children
  // are let go, all at once.
  indexd_.reset();
  engine_.reset();
  int start[2];
  ASSERT_EQ(pipe(start), 0);
  std::vector<pid_t> children;
  for (int p = 0; p < kProcs; ++p) {
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      close(start[1]);
      char c;
      while (read(start[0], &c, 1) < 0 && errno == EINTR) {
      }
      int failed = 0;  // a bit per folder whose operations were told they failed
      for (int i = 0; i < kFolders; ++i) {
        const std::string path = path_of(p, i);
        try {
          FolderAdd(List({FolderJson(path, "n", true, true, true, true)}), false);
          if (i % 3 == 1)
            FolderSet(List({FolderJson(path, "set", true, false, true, true)}), false);
          if (i % 3 == 2) FolderDelete(List({Json::Value(path)}));
        } catch (const Error&) {
          failed |= 1 << i;
        }
      }
      _exit(failed);
    }
    children.push_back(pid);
  }
  StartDaemons();
  close(start[0]);
  close(start[1]);  // the children read end-of-file and start together
  std::map<std::string, std::string> expected;  // path -> name
  std::set<std::string> uncertain;  // what a failed call left is not held against it
  for (int p = 0; p < kProcs; ++p) {
    int status = 0;
    ASSERT_EQ(waitpid(children[p], &status, 0), children[p]);
    ASSERT_TRUE(WIFEXITED(status));
    for (int i = 0; i < kFolders; ++i) {
      if (WEXITSTATUS(status) & (1 << i)) {
        uncertain.insert(path_of(p, i));
      } else if (i % 3 != 2) {
        expected[path_of(p, i)] = i % 3 == 0 ? "n" : "set";
      }
    }
  }
  FolderMgr folders;  // parses, so the file is valid
  std::map<std::string, std::string> actual;
  for (const auto& f : folders.folders()) {
    EXPECT_TRUE(actual.emplace(f->GetPath(), f->GetName()).second) << f->GetPath();
  }
  for (const auto& path : uncertain) actual.erase(path);
  EXPECT_EQ(actual, expected);
  EXPECT_GE(expected.size(), static_cast<size_t>(kProcs * kFolders / 3));
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
