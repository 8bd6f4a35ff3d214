#include "fileindex/notifyd_cfg.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fileindex/optree.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/monitor_queue.hpp"
#include "platform/platform_error.hpp"
#include "test/admin_env.hpp"
#include "test/faults.hpp"

namespace orvane {
namespace fileindex {
namespace {

using platform::Fault;
using platform::ScopedFaults;
using QUIX::QUIXNOTIFYD::MonitorQueue;
using testenv::ErrorOf;
using testenv::Strings;

using NotifydCfgTest = testenv::AdminTestEnv;

TEST_F(NotifydCfgTest, RegistrationHoldsEveryFolderOfTheShare) {
  WriteFolders({FolderJson("/photo/trips", "T", true, true, true, true),
                FolderJson("/music", "M", true, true, true, true),
                FolderJson("/photo/family", "F", true, true, true, true)});
  FolderMgr folders;
  UpsertQUIXNotifydCfg("photo", folders);
  ASSERT_EQ(MonitorQueue::List().size(), 1u);
  EXPECT_EQ(MonitorQueue::List()[0], Parse(R"({"queue": ")" + Queue("photo") + R"(",
      "app": "fileindex", "type": 2, "config": [
      {"path": ")" + vol_ + R"(/photo/trips", "mask": 65484, "ignore": ["@eaDir"]},
      {"path": ")" + vol_ + R"(/photo/family", "mask": 65484, "ignore": ["@eaDir"]}]})"));

  ScopedFaults faults;
  faults.Arm("MonitorQueue::Upsert", Fault{0, EIO}).Arm("MonitorQueue::Delete", Fault{0, EIO});
  EXPECT_EQ(ErrorOf([&] { UpsertQUIXNotifydCfg("photo", folders); }).message,
            "Orvane error, code=502, reason=[MonitorQueue::Upsert failed, share=photo]");
  EXPECT_EQ(ErrorOf([&] { DeleteQUIXNotifydCfg("photo"); }).message,
            "Orvane error, code=502, reason=[MonitorQueue::Delete failed, share=photo]");
  EXPECT_EQ(MonitorQueue::List().size(), 1u);
  EXPECT_EQ(ErrorOf([&] { DeleteQUIXNotifydCfg("nosuch"); }).code, kErrShareGet);
}

TEST_F(NotifydCfgTest, EventsAreWrittenPerShareUnlessAQueuedReindexCoversThem) {
  StatusMgr::CreateIfMissing();
  const std::string trips = vol_ + "/photo/trips";
  AddCustomEvent(0x100, trips + "/new \"q\"", trips + "/old", Json::Value());
  EXPECT_EQ(test::ReadFile(Queue("photo")), R"({"data":null,"event":256,"path":")" + trips +
                                                R"(/new \"q\"","path_old":")" + trips +
                                                "/old\"}\n");
  AddCustomEvent(0x10000, trips + "/2024", "", Json::Value());
  AddCustomEvents({{0x20000, trips + "/2024/a", "", Json::Value(1)},  // below the queued one
                   {0x10000, trips, "", Json::Value()},
                   {0x20000, vol_ + "/music/live", "", Json::Value(2)},
                   {0x20000, trips + "/x", "", Json::Value(3)},  // below the batch's own
                   {0x10000, trips, "", Json::Value()},
                   {0x10000, vol_ + "/ro/x", "", Json::Value()},  // a share that cannot index
                   {0x100, vol_ + "/photo/family", vol_ + "/photo/f", Json::Value()}});
  const Strings photo = Events("photo");
  EXPECT_EQ(
      Strings(photo.begin() + 1, photo.end()),
      (Strings{"65536 /photo/trips/2024", "65536 /photo/trips", "256 /photo/family <- /photo/f"}));
  EXPECT_FALSE(IsFileExist(Queue("ro")));

  // A queued reconciliation covers nothing: a full re-index of its folder is still written.
  Json::Value reconcile(Json::objectValue);
  reconcile[kReconcileKey] = true;
  AddCustomEvents({{0x10000, vol_ + "/photo/family", "", reconcile},
                   {0x10000, vol_ + "/photo/family", "", Json::Value()},
                   {0x10000, trips + "/z", "", reconcile}});  // below a full one
  const Strings later = Events("photo");
  EXPECT_EQ(Strings(later.begin() + 4, later.end()),
            (Strings{"65536 /photo/family {\"reconcile\":true}", "65536 /photo/family"}));

  // A path in no share ends the batch: what came before it is written, the rest is not.
  EXPECT_EQ(ErrorOf([&] {
              AddCustomEvents({{0x20000, vol_ + "/music/a", "", Json::Value()},
                               {0x20000, scratch_.path(), "", Json::Value()},
                               {0x20000, vol_ + "/music/b", "", Json::Value()}});
            }).code,
            kErrSystem);
  EXPECT_EQ(Events("music"), (Strings{"131072 /music/live 2", "131072 /music/a"}));
}

// A reconciliation only sends the differences: a plain re-index asked after it, and what lies
// below it, must still be written.
TEST_F(NotifydCfgTest, AQueuedReconciliationStandsInForNoReindex) {
  StatusMgr::CreateIfMissing();
  const std::string trips = vol_ + "/photo/trips";
  Json::Value reconcile(Json::objectValue);
  reconcile["reconcile"] = true;
  AddCustomEvents({{0x10000, trips, "", reconcile}, {0x20000, trips + "/a", "", Json::Value(1)}});
  AddCustomEvent(0x10000, trips, "", Json::Value());
  AddCustomEvent(0x20000, trips + "/b", "", Json::Value(2));
  EXPECT_EQ(Events("photo"), (Strings{R"(65536 /photo/trips {"reconcile":true})",
                                      "131072 /photo/trips/a 1", "65536 /photo/trips"}));
  EXPECT_TRUE(QueueLines("photo")[0]["is_dir"].asBool());
}

TEST_F(NotifydCfgTest, FailedEventFlagsTheShareAndIsThrownOn) {
  StatusMgr::CreateIfMissing();
  // A folder in the queue's place is refused: nothing is appended and the share is flagged.
  ASSERT_TRUE(MakeParentDirs(Queue("music") + "/x"));
  test::LogCapture log;
  Error e = ErrorOf([&] { AddCustomEvent(0x10000, vol_ + "/music/live", "", Json::Value()); });
  EXPECT_EQ(e.code, kErrUnsafePath);
  EXPECT_THAT(e.message, ::testing::HasSubstr("unsafe index file " + Queue("music") +
                                              ": it is a folder, not a regular file"));
  EXPECT_EQ(log.Count("(AddCustomEvent) AddCustomEvent failed, code=507, reason=" + e.message +
                      ". Set [music] need reindex"),
            1);

  // A path in no share: the lookup's error, and no share to flag.
  EXPECT_EQ(ErrorOf([&] { AddCustomEvent(0x10000, scratch_.path(), "", Json::Value()); }).code,
            kErrSystem);
  EXPECT_EQ(ReadJson(Rooted(kFileIndexStatusCfgPath)), Parse(R"({"share": {"music": 1}})"));

  // A share the platform cannot open: flagged by name.
  ScopedFaults faults;
  faults.Arm("QUIXShareGet", Fault{-1, ENOENT, platform::kQErrNoSuchShare});
  e = ErrorOf([&] { AddCustomEvent(0x10000, vol_ + "/Photos/a", "", Json::Value()); });
  EXPECT_EQ(e.code, kErrShareGet);
  EXPECT_EQ(StatusMgr().GetShareStatus("Photos"), kShareStatusNeedReindex);
}

TEST_F(NotifydCfgTest, ServicesFollowTheFolderFileAndFailuresAreOnlyLogged) {
  const std::string smb = scratch_.Write("smb.conf", "[global]\n\tworkgroup = WG\n");
  PrepareServices();  // no folders
  WriteFolders({FolderJson("/music", "M", true, true, true, true)});
  PrepareServices();
  EXPECT_NE(test::ReadFile(smb).find("spotlight = yes"), std::string::npos);
  SetupRelatedServices(true);  // already on: no restart of file sharing
  SetupRelatedServices(false);
  EXPECT_EQ(Actions(),
            "stop-fi\nrestart-smb\nstart-ce\nstart-fi\nstart-ce\nstart-fi\n"
            "restart-smb\nstop-fi\n");
  EXPECT_EQ(test::ReadFile(smb).find("spotlight = yes"), std::string::npos);

  const std::string before = Actions();
  test::LogCapture log;
  ScopedFaults faults;
  faults.Arm("QUIXSMBSetSpotlight", Fault{-1, EACCES, platform::kQErrSystem})
      .Arm("QLIBServiceStart", Fault{-1, 0, platform::kQErrNotSupported})
      .Arm("QLIBServicectlStart", Fault{-1, ENOENT, platform::kQErrNotSupported});
  SetupRelatedServices(true);
  EXPECT_EQ(Actions(), before);  // no restart of file sharing without the setting changed
  EXPECT_TRUE(log.Contains("(SetupRelatedServices) QUIXSMBSetSpotlight failed: err=[0x0200 "));
  EXPECT_EQ(log.Count("(SetupRelatedServices) Failed [0 > "), 2);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
