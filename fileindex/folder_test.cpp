#include "fileindex/folder.hpp"

#include <gtest/gtest.h>

#include "fileindex/admin_test_env.hpp"
#include "fileindex/status_mgr.hpp"

namespace orvane {
namespace fileindex {
namespace {

using testenv::ErrorOf;

class FolderTest : public testenv::AdminTestEnv {};

TEST_F(FolderTest, RecordFromJsonWithDefaultsAndRefusals) {
  Folder minimal(FolderJson("/photo/trips", "Trips", true, false, true, false));
  EXPECT_EQ(minimal.GetData(), Parse(R"({"path": "/photo/trips", "name": "Trips",
      "document": true, "audio": false, "video": true, "photo": false, "paused": false,
      "owner": "", "group": "", "privileged": false, "volume_to_be_clean": ""})"));
  EXPECT_EQ(minimal.GetIndexCfg(),
            Parse(R"({"document": true, "audio": false, "video": true, "photo": false})"));

  Json::Value full = FolderJson("/photo", "P", false, true, false, true);
  full["owner"] = "bob";
  full["group"] = "All";  // only the exact "all" is reserved
  full["privileged"] = 1;
  full["paused"] = true;
  full["volume_to_be_clean"] = "/volume2";
  Folder stored(full);
  EXPECT_EQ(stored.GetData(), [&] {
    Json::Value expected = full;
    expected["privileged"] = true;
    return expected;
  }());

  // Optional members of the wrong type keep their defaults.
  Json::Value odd = FolderJson("/photo", "P", true, true, true, true);
  odd["paused"] = "yes";
  odd["owner"] = Json::Value(Json::arrayValue);
  Folder lenient(odd);
  EXPECT_FALSE(lenient.IsPaused());
  EXPECT_EQ(lenient.GetOwner(), "");

  Json::Value bad_switch = FolderJson("/photo", "P", true, true, true, true);
  bad_switch["document"] = "yes";
  Error e = ErrorOf([&] { Folder f(bad_switch); });
  EXPECT_EQ(e.code, kErrInvalidParam);
  EXPECT_EQ(e.message,
            "Orvane error, code=120, reason=[Not a string, data=" + JsonToString(bad_switch) + "]");
  Json::Value no_name = FolderJson("/photo", "P", true, true, true, true);
  no_name.removeMember("name");
  e = ErrorOf([&] { Folder f(no_name); });
  EXPECT_EQ(e.message, "Orvane error, code=120, reason=[Missing property: name, data=" +
                           JsonToString(no_name) + "]");
  EXPECT_EQ(ErrorOf([] { Folder f(Json::Value("x")); }).message,
            "Orvane error, code=120, reason=[Not an object, data=\"x\"]");

  test::LogCapture log;
  Json::Value all = FolderJson("/photo", "P", true, true, true, true);
  all["group"] = "all";
  e = ErrorOf([&] { Folder f(all); });
  EXPECT_EQ(e.message, "Orvane error, code=120, reason=[\"all\" is reserved group name]");
  EXPECT_TRUE(log.Contains("Failed [kAll == group_]"));

  // The positional constructor drops the group.
  Folder positional("/music", "M", "alice", "staff", true, false, false, false, true, true);
  EXPECT_EQ(positional.GetGroup(), "");
  EXPECT_EQ(positional.GetOwner(), "alice");
  EXPECT_TRUE(positional.IsPrivileged());
  EXPECT_TRUE(positional.IsPaused());
}

TEST_F(FolderTest, ShareAndFullPathFollowRenames) {
  Folder root(FolderJson("/photo", "P", true, true, true, true));
  EXPECT_EQ(root.GetShare(), "photo");
  EXPECT_EQ(root.GetFullPath(), vol_ + "/photo");
  root.SetShare("pics");
  EXPECT_EQ(root.GetPath(), "/pics");
  EXPECT_EQ(root.GetShare(), "pics");

  Folder deep(FolderJson("/photo/trips/photo", "P", true, true, true, true));
  deep.SetShare("Photos");  // only the leading share component changes
  EXPECT_EQ(deep.GetPath(), "/Photos/trips/photo");

  deep.SetPath("/music/live");
  EXPECT_EQ(deep.GetShare(), "music");
  EXPECT_EQ(deep.GetFullPath(), vol_ + "/music/live");

  Folder unknown(FolderJson("/nosuch/x", "N", true, true, true, true));
  EXPECT_EQ(ErrorOf([&] { unknown.GetFullPath(); }).code, kErrShareGet);
}

TEST_F(FolderTest, StatusRulesInOrder) {
  test::FakeEnv env;
  const long long now = env.Now();
  StatusMgr::CreateIfMissing();
  Folder trips(FolderJson("/photo/trips", "Trips", true, true, true, true));
  Folder bin(FolderJson("/photo/#recycle", "Bin", true, true, true, true));

  auto status_of = [](const Folder& f) {
    Json::Value out(Json::objectValue);
    out["keep"] = 1;
    f.GetStatus(out);
    EXPECT_EQ(out["keep"], 1);  // other members are left alone
    out.removeMember("keep");
    return out;
  };
  EXPECT_EQ(status_of(trips), Parse(R"({"text": "finished"})"));

  // Work queued below the folder: running unless paused.
  ASSERT_TRUE(MakeParentDirs(Queue("photo")));
  volume_.Write("photo/@eaDir/@fileindex/queue",
                R"({"event": 8, "path": ")" + vol_ + "/photo/trips/2024/a.jpg\"}\n");
  EXPECT_TRUE(trips.IsIndexing());
  EXPECT_EQ(status_of(trips), Parse(R"({"text": "processing"})"));

  auto write_pause = [&](long long resume_time) {
    Json::Value data = Parse(R"({"share": {}})");
    data["resume_time"] = Json::Int64(resume_time);
    ASSERT_TRUE(JsonValue(data).toFile(Rooted(kFileIndexStatusCfgPath)));
  };
  write_pause(0);
  EXPECT_EQ(status_of(trips), Parse(R"({"text": "paused"})"));
  write_pause(now + 1);
  EXPECT_EQ(status_of(trips), Parse(R"({"text": "paused"})"));
  write_pause(now);
  EXPECT_EQ(status_of(trips), Parse(R"({"text": "processing"})"));

  // The share's re-index flag beats the pause; an invalid path beats both.
  StatusMgr().SetShareStatus("photo", 3);
  EXPECT_EQ(status_of(trips), Parse(R"({"text": "need_reindex"})"));
  EXPECT_EQ(status_of(bin), Parse(R"({"text": "error", "desc": "invalid_path"})"));

  // Another folder of the share without queued work is finished.
  StatusMgr().UnsetShareStatus("photo", 1);
  Folder family(FolderJson("/photo/family", "Family", true, true, true, true));
  EXPECT_EQ(status_of(family), Parse(R"({"text": "finished"})"));
}

TEST_F(FolderTest, AdditionalMembers) {
  StatusMgr::CreateIfMissing();
  Folder trips(FolderJson("/photo/trips", "Trips", true, true, true, true));
  EXPECT_EQ(trips.GetDataWithAdditional(Json::Value(Json::arrayValue)), trips.GetData());
  Json::Value with_status = trips.GetDataWithAdditional(Parse(R"(["status", "status"])"));
  EXPECT_EQ(with_status["additional"], Parse(R"({"status": {"text": "finished"}})"));
  with_status.removeMember("additional");
  EXPECT_EQ(with_status, trips.GetData());

  test::LogCapture log;
  Error e = ErrorOf([&] { trips.GetDataWithAdditional(Parse(R"({"a": 1})")); });
  EXPECT_EQ(e.message, "Orvane error, code=120, reason=[{\"a\":1}]");
  EXPECT_TRUE(log.Contains("Failed [!addiitionals.isArray()]"));
  e = ErrorOf([&] { trips.GetDataWithAdditional(Parse(R"(["status", 7])")); });
  EXPECT_EQ(e.message, "Orvane error, code=120, reason=[7]");
  EXPECT_TRUE(log.Contains("Failed [!it.isString()]"));
  e = ErrorOf([&] { trips.GetDataWithAdditional(Parse(R"(["size"])")); });
  EXPECT_EQ(e.message, "Orvane error, code=120, reason=[Unknown additioal: size]");
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
