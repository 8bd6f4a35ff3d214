#include "fileindex/folder.hpp"

#include <gtest/gtest.h>

#include "fileindex/status_mgr.hpp"
#include "test/admin_env.hpp"

namespace orvane {
namespace fileindex {
namespace {

using testenv::ErrorOf;

using FolderTest = testenv::AdminTestEnv;

TEST_F(FolderTest, RecordsFromJsonAndTheirPaths) {
  Folder minimal(FolderJson("/photo/trips", "Trips", true, false, true, false));
  EXPECT_EQ(minimal.GetData(), Parse(R"({"path": "/photo/trips", "name": "Trips",
      "document": true, "audio": false, "video": true, "photo": false, "paused": false,
      "owner": "", "group": "", "privileged": false, "volume_to_be_clean": ""})"));
  Json::Value full = FolderJson("/photo", "P", false, true, false, true);
  full["owner"] = "bob";
  full["group"] = "All";  // only the exact "all" is reserved
  full["privileged"] = true;
  full["paused"] = "yes";  // optional members of the wrong type keep their defaults
  full["volume_to_be_clean"] = "/volume2";
  Json::Value expected = full;
  expected["paused"] = false;
  EXPECT_EQ(Folder(full).GetData(), expected);

  full["group"] = "all";
  EXPECT_EQ(ErrorOf([&] { Folder f(full); }).message,
            "Orvane error, code=120, reason=[\"all\" is reserved group name]");

  // Only the leading share component is renamed, and a new path forgets the cached share.
  Folder deep(FolderJson("/photo/trips/photo", "P", true, true, true, true));
  EXPECT_EQ(deep.GetFullPath(), vol_ + "/photo/trips/photo");
  deep.SetShare("Photos");
  EXPECT_EQ(deep.GetPath(), "/Photos/trips/photo");
  EXPECT_EQ(deep.GetShare(), "Photos");
  deep.SetPath("/music/live");
  EXPECT_EQ(deep.GetShare(), "music");
  EXPECT_EQ(deep.GetFullPath(), vol_ + "/music/live");
}

TEST_F(FolderTest, StatusRulesInOrderAndAsAdditionalMember) {
  test::FakeEnv env;
  const long long now = env.Now();
  StatusMgr::CreateIfMissing();
  Folder trips(FolderJson("/photo/trips", "Trips", true, true, true, true));
  auto status_of = [](const Folder& f) {
    Json::Value out(Json::objectValue);
    f.GetStatus(out);
    return JsonToString(out);
  };
  EXPECT_EQ(status_of(trips), R"({"text":"finished"})");

  // Work queued below the folder: running unless paused.
  ASSERT_TRUE(MakeParentDirs(Queue("photo")));
  volume_.Write("photo/@eaDir/@fileindex/queue",
                R"({"event": 8, "path": ")" + vol_ + "/photo/trips/2024/a.jpg\"}\n");
  EXPECT_TRUE(trips.IsIndexing());
  EXPECT_EQ(status_of(trips), R"({"text":"processing"})");
  for (const long long resume_time : {0LL, now + 1, now}) {
    Json::Value data = Parse(R"({"share": {}})");
    data["resume_time"] = Json::Int64(resume_time);
    ASSERT_TRUE(JsonValue(data).toFile(Rooted(kFileIndexStatusCfgPath)));
    EXPECT_EQ(status_of(trips),
              resume_time == now ? R"({"text":"processing"})" : R"({"text":"paused"})")
        << resume_time;
  }

  // The share's re-index flag beats the pause; an invalid path beats both.
  StatusMgr().SetShareStatus("photo", 3);
  EXPECT_EQ(status_of(trips), R"({"text":"need_reindex"})");
  Folder bin(FolderJson("/photo/#recycle", "Bin", true, true, true, true));
  EXPECT_EQ(status_of(bin), R"({"desc":"invalid_path","text":"error"})");
  StatusMgr().UnsetShareStatus("photo", 1);
  Folder family(FolderJson("/photo/family", "Family", true, true, true, true));
  EXPECT_EQ(status_of(family), R"({"text":"finished"})");

  Json::Value with_status = family.GetDataWithAdditional(Parse(R"(["status", "status"])"));
  EXPECT_EQ(JsonToString(with_status["additional"]), R"({"status":{"text":"finished"}})");
  with_status.removeMember("additional");
  EXPECT_EQ(with_status, family.GetData());
  for (const char* bad : {R"({"a": 1})", R"(["status", 7])"}) {
    EXPECT_EQ(ErrorOf([&] { family.GetDataWithAdditional(Parse(bad)); }).code, kErrInvalidParam);
  }
  EXPECT_EQ(ErrorOf([&] { family.GetDataWithAdditional(Parse(R"(["size"])")); }).message,
            "Orvane error, code=120, reason=[Unknown additioal: size]");
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
