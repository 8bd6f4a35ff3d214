#include "fileindex/notifyd_cfg.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "fileindex/admin_test_env.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/fault.hpp"
#include "platform/monitor_queue.hpp"
#include "platform/platform_error.hpp"

namespace orvane {
namespace fileindex {
namespace {

using platform::Fault;
using platform::ScopedFaults;
using QUIX::QUIXNOTIFYD::MonitorQueue;
using testenv::ErrorOf;

class NotifydCfgTest : public testenv::AdminTestEnv {
 protected:
  void WriteFolders(const std::vector<Json::Value>& folders) {
    Json::Value list(Json::arrayValue);
    for (const auto& f : folders) list.append(f);
    ASSERT_TRUE(JsonValue(list).toFile(Rooted(kFileIndexFoldersCfgPath)));
  }
  // The stored registration of `share`'s queue, null when none.
  Json::Value Registration(const std::string& share) const {
    for (const Json::Value& r : MonitorQueue::List()) {
      if (r["queue"] == Queue(share)) return r;
    }
    return Json::Value();
  }
};

TEST_F(NotifydCfgTest, RegistrationHoldsEveryFolderOfTheShare) {
  WriteFolders({FolderJson("/photo/trips", "T", true, true, true, true),
                FolderJson("/music", "M", true, true, true, true),
                FolderJson("/photo/family", "F", true, true, true, true)});
  FolderMgr folders;
  UpsertQUIXNotifydCfg("photo", folders);
  const Json::Value reg = Registration("photo");
  EXPECT_EQ(reg["queue"], Queue("photo"));
  EXPECT_EQ(reg["app"], "fileindex");
  EXPECT_EQ(reg["config"], Parse(R"([
      {"path": ")" + vol_ + R"(/photo/trips", "mask": 65484, "ignore": ["@eaDir"]},
      {"path": ")" + vol_ + R"(/photo/family", "mask": 65484, "ignore": ["@eaDir"]}])"));
  EXPECT_TRUE(Registration("music").isNull());

  UpsertQUIXNotifydCfg("Photos", folders);  // no folder: an empty list
  EXPECT_EQ(Registration("Photos")["config"], Json::Value(Json::arrayValue));
  DeleteQUIXNotifydCfg("Photos");
  EXPECT_TRUE(Registration("Photos").isNull());
  EXPECT_FALSE(Registration("photo").isNull());

  test::LogCapture log;
  ScopedFaults faults;
  faults.Arm("MonitorQueue::Upsert", Fault{0, EIO}).Arm("MonitorQueue::Delete", Fault{0, EIO});
  Error e = ErrorOf([&] { UpsertQUIXNotifydCfg("photo", folders); });
  EXPECT_EQ(e.message, "Orvane error, code=502, reason=[MonitorQueue::Upsert failed, share=photo]");
  EXPECT_TRUE(log.Contains(
      "Failed [!MonitorQueue::Upsert(monitor_queue, kAppName, MONITOR_QUEUE_TYPE_APPLICATION)]"));
  e = ErrorOf([&] { DeleteQUIXNotifydCfg("photo"); });
  EXPECT_EQ(e.message, "Orvane error, code=502, reason=[MonitorQueue::Delete failed, share=photo]");
  EXPECT_TRUE(
      log.Contains("Failed [!MonitorQueue::Delete(share.GetQueuePath(), kAppName, "
                   "MONITOR_QUEUE_TYPE_APPLICATION)]"));
  EXPECT_FALSE(Registration("photo").isNull());
  EXPECT_EQ(ErrorOf([&] { DeleteQUIXNotifydCfg("nosuch"); }).code, kErrShareGet);
}

TEST_F(NotifydCfgTest, CustomEventsAreAppendedOrDropped) {
  StatusMgr::CreateIfMissing();
  const std::string trips = vol_ + "/photo/trips";
  Json::Value data = Parse(R"({"document": true, "audio": false, "video": false, "photo": true})");
  AddCustomEvent(0x20000, trips, "", data);
  AddCustomEvent(0x100, trips + "/new \"q\"", trips + "/old", Json::Value());
  EXPECT_EQ(test::ReadFile(Queue("photo")),
            R"({"data":{"audio":false,"document":true,"photo":true,"video":false},"event":131072,)"
            R"("path":")" +
                trips +
                R"(","path_old":""})"
                "\n"
                R"({"data":null,"event":256,"path":")" +
                trips + R"(/new \"q\"","path_old":")" + trips +
                R"(/old"})"
                "\n");

  // Below a queued re-index, and in a share that cannot be indexed, nothing is written.
  AddCustomEvent(0x10000, trips, "", Json::Value());
  const std::string before = test::ReadFile(Queue("photo"));
  AddCustomEvent(0x20000, trips + "/2024", "", data);
  AddCustomEvent(0x10000, trips, "", Json::Value());
  EXPECT_EQ(test::ReadFile(Queue("photo")), before);
  AddCustomEvent(0x10000, vol_ + "/ro/x", "", Json::Value());
  EXPECT_FALSE(IsFileExist(Queue("ro")));
  AddCustomEvent(0x10000, vol_ + "/photo/family", "", Json::Value());
  EXPECT_EQ(QueueLines("photo").size(), 4u);
  EXPECT_EQ(StatusMgr().GetShareStatus("photo"), 0);
}

TEST_F(NotifydCfgTest, BatchesReadEachQueueOnceAndKeepTheRules) {
  StatusMgr::CreateIfMissing();
  const std::string trips = vol_ + "/photo/trips";
  AddCustomEvent(0x10000, trips + "/2024", "", Json::Value());
  AddCustomEvents({{0x20000, trips + "/2024/a", "", Json::Value(1)},  // below the queued one
                   {0x10000, trips, "", Json::Value()},
                   {0x20000, vol_ + "/music/live", "", Json::Value(2)},
                   {0x20000, trips + "/x", "", Json::Value(3)},  // below the batch's own
                   {0x10000, vol_ + "/ro/x", "", Json::Value()},
                   {0x100, vol_ + "/photo/family", vol_ + "/photo/f", Json::Value()}});
  std::vector<std::string> photo;
  for (const auto& line : QueueLines("photo")) photo.push_back(JsonToString(line));
  EXPECT_EQ(photo,
            (std::vector<std::string>{
                R"({"data":null,"event":65536,"path":")" + trips + R"(/2024","path_old":""})",
                R"({"data":null,"event":65536,"path":")" + trips + R"(","path_old":""})",
                R"({"data":null,"event":256,"path":")" + vol_ +
                    R"(/photo/family",)"
                    R"("path_old":")" +
                    vol_ + R"(/photo/f"})"}));
  EXPECT_EQ(QueueLines("music").size(), 1u);
  EXPECT_FALSE(IsFileExist(Queue("ro")));

  // A path in no share ends the batch: what came before it is written, the rest is not.
  EXPECT_EQ(ErrorOf([&] {
              AddCustomEvents({{0x20000, vol_ + "/music/a", "", Json::Value()},
                               {0x20000, scratch_.path(), "", Json::Value()},
                               {0x20000, vol_ + "/music/b", "", Json::Value()}});
            }).code,
            kErrSystem);
  EXPECT_EQ(QueueLines("music").size(), 2u);
  EXPECT_EQ(QueueLines("music").back()["path"], vol_ + "/music/a");
}

TEST_F(NotifydCfgTest, FailedEventFlagsTheShareAndIsThrownOn) {
  StatusMgr::CreateIfMissing();
  // A folder in the queue's place cannot be opened for appending.
  ASSERT_EQ(mkdir((vol_ + "/music/@eaDir").c_str(), 0755), 0);
  ASSERT_EQ(mkdir((vol_ + "/music/@eaDir/@fileindex").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(Queue("music").c_str(), 0755), 0);
  test::LogCapture log;
  Error e = ErrorOf([&] { AddCustomEvent(0x10000, vol_ + "/music/live", "", Json::Value()); });
  EXPECT_EQ(e.code, kErrSystem);
  EXPECT_EQ(e.message,
            "Orvane error, code=502, reason=[Cannot append to queue: " + Queue("music") + "]");
  EXPECT_EQ(log.Count("(AddCustomEvent) AddCustomEvent failed, code=502, reason=" + e.message +
                      ". Set [music] need reindex"),
            1);
  EXPECT_EQ(StatusMgr().GetShareStatus("music"), kShareStatusNeedReindex);

  // A path in no share: the lookup's error, and no share to flag.
  log.Clear();
  e = ErrorOf([&] { AddCustomEvent(0x10000, scratch_.path(), "", Json::Value()); });
  EXPECT_EQ(e.code, kErrSystem);
  EXPECT_TRUE(log.Contains("AddCustomEvent failed, code=502, reason=" + e.message +
                           ". Set [] need reindex"));
  EXPECT_EQ(ReadJson(Rooted(kFileIndexStatusCfgPath)), Parse(R"({"share": {"music": 1}})"));

  // An unknown share in the platform's eyes (the share lookup fails): flagged by name.
  ScopedFaults faults;
  faults.Arm("QUIXShareGet", Fault{-1, ENOENT, platform::kQErrNoSuchShare});
  e = ErrorOf([&] { AddCustomEvent(0x10000, vol_ + "/Photos/a", "", Json::Value()); });
  EXPECT_EQ(e.code, kErrShareGet);
  EXPECT_EQ(StatusMgr().GetShareStatus("Photos"), kShareStatusNeedReindex);
}

TEST_F(NotifydCfgTest, ServiceSwitch) {
  const std::string smb = scratch_.Write("smb.conf", "[global]\n\tworkgroup = WG\n");
  SetupRelatedServices(true);
  EXPECT_EQ(Actions(), "restart-smb\nstart-ce\nstart-fi\n");
  EXPECT_NE(test::ReadFile(smb).find("spotlight = yes"), std::string::npos);
  SetupRelatedServices(true);  // already on: no restart of file sharing
  EXPECT_EQ(Actions(), "restart-smb\nstart-ce\nstart-fi\nstart-ce\nstart-fi\n");
  SetupRelatedServices(false);
  EXPECT_EQ(Actions(),
            "restart-smb\nstart-ce\nstart-fi\nstart-ce\nstart-fi\nrestart-smb\nstop-fi\n");
  EXPECT_EQ(test::ReadFile(smb).find("spotlight = yes"), std::string::npos);

  // Failures are logged with the platform's error and never thrown.
  test::LogCapture log;
  {
    ScopedFaults faults;
    faults.Arm("QUIXSMBSetSpotlight", Fault{-1, EACCES, platform::kQErrSystem})
        .Arm("QLIBServiceStart", Fault{-1, 0, platform::kQErrNotSupported})
        .Arm("QLIBServicectlStart", Fault{-1, ENOENT, platform::kQErrNotSupported});
    SetupRelatedServices(true);
  }
  EXPECT_TRUE(log.Contains("(SetupRelatedServices) QUIXSMBSetSpotlight failed: err=[0x0200 "));
  EXPECT_TRUE(log.Contains("] [err: Permission denied]"));
  EXPECT_TRUE(log.Contains(
      "(SetupRelatedServices) Failed [0 > QLIBServiceStart(\"quixcontentextractd\", TRUE)]"));
  EXPECT_TRUE(
      log.Contains("Failed [0 > QLIBServicectlStart(\"pkg-Orvane-fileindexd\", "
                   "QLIB_SERVICECTL_UPSTART)] [err: No such file or directory]"));
  EXPECT_EQ(log.Count("restart-smb"), 0);
  {
    ScopedFaults faults;
    faults.Arm("QLIBServiceRestart", Fault{-1, 0, platform::kQErrSystem})
        .Arm("QLIBServicectlStop", Fault{-1, 0, platform::kQErrSystem});
    SetupRelatedServices(true);
    SetupRelatedServices(false);
  }
  EXPECT_TRUE(log.Contains("QLIBServiceRestart failed: err=[0x0200 "));
  EXPECT_TRUE(log.Contains(
      "Failed [0 > QLIBServicectlStop(\"pkg-Orvane-fileindexd\", QLIB_SERVICECTL_UPSTART)]"));

  // The switch follows the folder file.
  const std::string before = Actions();
  PrepareServices();
  EXPECT_EQ(Actions(), before + "stop-fi\n");
  ASSERT_TRUE(JsonValue(Parse("[" + JsonToString(FolderJson("/music", "M", 1, 1, 1, 1)) + "]"))
                  .toFile(Rooted(kFileIndexFoldersCfgPath)));
  PrepareServices();
  EXPECT_EQ(Actions(), before + "stop-fi\nrestart-smb\nstart-ce\nstart-fi\n");
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
