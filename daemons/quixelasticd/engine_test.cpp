#include "daemons/quixelasticd/engine.hpp"

#include <sqlite3.h>

#include <fstream>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/json_util.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/test_client.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using tc::Cmd;
using tc::Compound;
using tc::OnIndex;
using tc::Parse;
using tc::Upsert;
using ::testing::ElementsAre;

const char kId[] = "fileindex_share";

Json::Value Query(const std::string& form, const std::string& value,
                  const std::string& id = kId) {
  Json::Value r = OnIndex("document_get_by_query", id);
  r["data"]["query"]["qsl"][form]["QUIXMDPath"] = value;
  r["data"]["query"]["load_field"].append("QUIXMDPath");
  return r;
}

std::vector<std::string> HitPaths(const Json::Value& reply) {
  std::vector<std::string> out;
  for (const Json::Value& h : reply["data"]) out.push_back(h["QUIXMDPath"].asString());
  return out;
}

class EngineTest : public ::testing::Test {
 protected:
  EngineTest() { root_.privileged = true; }
  void SetUp() override { StartEngine(); }

  void StartEngine(EngineOptions options = EngineOptions()) {
    options.registry_file = dir_.Path("state/indexes.json");
    options.running_marker = dir_.Path("state/running");
    engine_ = std::make_unique<Engine>(options);
    engine_->Start();
    engine_->WaitOpened();
  }
  Json::Value Send(const Json::Value& request) { return engine_->HandleValue(request, root_); }
  static int CodeOf(const Json::Value& reply) {
    return reply["success"].asBool() ? 0 : reply["error"]["code"].asInt();
  }
  Json::Value Create(const std::string& id = kId, const std::string& rel = "db") {
    Json::Value r = OnIndex("index_create", id);
    r["data"]["path"] = dir_.Path(rel);
    r["data"]["settings"] = Json::Value(Json::objectValue);
    r["data"]["mappings"] = tc::FileMappings();
    r["data"]["event_handler"]["lib_path"] = "/handler.so";
    return Send(r);
  }

  orvane::test::TempDir dir_;
  orvane::test::LogCapture logs_;
  Caller root_;
  std::unique_ptr<Engine> engine_;
};

TEST_F(EngineTest, MalformedRequestsGetErrorReplies) {
  const std::vector<std::pair<std::string, int>> cases = {
      {"{", kCodeMalformed},
      {"[1]", kCodeMalformed},
      {R"({"data":{}})", kCodeMalformed},
      {R"({"command":7})", kCodeMalformed},
      {R"({"command":"commit","data":[]})", kCodeMalformed},
      {R"({"compound":{}})", kCodeMalformed},
      {R"({"command":"nope","data":{}})", kCodeUnknownCommand},
      {R"({"command":"commit","data":{}})", kCodeInvalidParam},
      {R"({"command":"commit","data":{"id":"fileindex_missing"}})", kCodeIndexNotFound},
      // A trailing NUL, as the library sends it, is not part of the JSON text.
      {std::string("{\"command\":\"index_list\"}\0", 25), 0}};
  for (const auto& [text, code] : cases) {
    const Json::Value r = engine_->Handle(text, root_);
    EXPECT_EQ(CodeOf(r), code) << text;
    EXPECT_EQ(r["success"], code == 0) << text;
    EXPECT_EQ(r["error"]["msg"].isString(), code != 0) << text;
  }
}

TEST_F(EngineTest, IndexLifecycle) {
  EXPECT_EQ(CodeOf(Create()), 0);
  // Creating it again where it is keeps it and its documents; elsewhere is a conflict.
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  EXPECT_EQ(CodeOf(Create()), 0);
  EXPECT_EQ(HitPaths(Send(Query("term", "/v/share/a.txt"))).size(), 1u);
  EXPECT_EQ(CodeOf(Create(kId, "elsewhere")), kCodeIndexExists);
  EXPECT_EQ(CodeOf(Create("fileindex_other", "db")), kCodeIndexExists);

  // Re-keyed and moved, the documents follow, and the registry brings the index back after a
  // restart in its new place.
  Json::Value rekey = OnIndex("index_config_set");
  rekey["data"]["data"]["id"] = "fileindex_renamed";
  rekey["data"]["data"]["path"] = dir_.Path("moved/db");
  EXPECT_EQ(CodeOf(Send(rekey)), 0);
  EXPECT_EQ(CodeOf(Send(Query("term", "/v/share/a.txt"))), kCodeIndexNotFound);
  EXPECT_TRUE(IsFileExist(dir_.Path("moved/db/index.db")));
  EXPECT_FALSE(IsFileExist(dir_.Path("db/index.db")));
  engine_.reset();
  StartEngine();
  EXPECT_EQ(HitPaths(Send(Query("prefix", "/v/share/", "fileindex_renamed"))).size(), 1u);

  const Json::Value deleted = Send(OnIndex("index_delete", "fileindex_renamed"));
  EXPECT_EQ(deleted["data"]["deleted"], true) << JsonToString(deleted);
  EXPECT_FALSE(IsFileExist(dir_.Path("moved/db/index.db")));
  // Deleting what is not there succeeds: the caller wanted it gone.
  EXPECT_EQ(Send(OnIndex("index_delete", "fileindex_renamed"))["data"]["deleted"], false);
}

TEST_F(EngineTest, CompoundAnswersEachInOrderAndSeesItsOwnWrites) {
  ASSERT_EQ(CodeOf(Create()), 0);
  Json::Value bad_doc = Upsert("/v/share/bad");
  bad_doc["data"]["data"].removeMember("QUIXMDPath");
  bad_doc["data"]["doc_id"] = Json::Value();
  const Json::Value r =
      Send(Compound({Upsert("/v/share/a"), Query("term", "/v/share/a"), bad_doc,
                     Parse(R"({"compound": []})"), Cmd("no_such_command", Json::Value()),
                     Upsert("/v/share/b")}));
  ASSERT_EQ(r["success"], true);
  EXPECT_EQ(r["has_fail"], true);
  ASSERT_EQ(r["data"].size(), 6u);
  EXPECT_EQ(r["data"][0]["success"], true);
  EXPECT_THAT(HitPaths(r["data"][1]), ElementsAre("/v/share/a"));
  EXPECT_EQ(CodeOf(r["data"][2]), kCodeDocInvalid);
  EXPECT_EQ(CodeOf(r["data"][3]), kCodeMalformed);
  EXPECT_EQ(CodeOf(r["data"][4]), kCodeUnknownCommand);
  EXPECT_EQ(r["data"][5]["success"], true);
  // The failed entry was rolled back alone.
  EXPECT_THAT(HitPaths(Send(Query("prefix", "/v/share/"))),
              ElementsAre("/v/share/a", "/v/share/b"));

  // Commands that need the index's lock, or read committed data, follow a batch's writes
  // without waiting on the batch itself, and see them.
  const Json::Value m = Send(Compound(
      {Upsert("/v/share/c"), Cmd("list_term_sugg_db", Json::Value(Json::objectValue)),
       Cmd("index_list", Json::Value(Json::objectValue)), Upsert("/v/share/d"),
       Parse(R"({"command":"search","data":{"name":"d"}})")}));
  EXPECT_EQ(m["has_fail"], false) << JsonToString(m);
  EXPECT_EQ(m["data"][4]["data"]["total"], 1);
}

// A batch on one index runs first without a savepoint per command; a failure anywhere in it
// must undo that run completely before the commands run again one by one.
TEST_F(EngineTest, FailedCommandInAOneIndexBatchLeavesTheOthersDoneOnce) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(Send(Upsert("/v/share/e"))["success"], true);
  Json::Value bad_doc = Upsert("/v/share/bad");
  bad_doc["data"]["data"]["QUIXMDFSSize"] = "not a number";
  Json::Value rekey = OnIndex("document_set_by_id");
  rekey["data"]["doc_id"] = "/v/share/a";
  rekey["data"]["data"]["QUIXMDPath"] = "/v/share/a2";
  Json::Value missing = rekey;
  missing["data"]["doc_id"] = "/v/share/none";
  Json::Value del = OnIndex("document_del_by_id");
  del["data"]["doc_id"] = "/v/share/e";

  const Json::Value r = Send(Compound({Upsert("/v/share/a"), rekey, del, bad_doc, missing,
                                       Query("prefix", "/v/share/"), Upsert("/v/share/b")}));
  ASSERT_EQ(r["data"].size(), 7u) << JsonToString(r);
  EXPECT_EQ(r["has_fail"], true);
  EXPECT_EQ(r["data"][1]["success"], true);
  // Had the first run's delete stood, the second would have found nothing to delete.
  EXPECT_EQ(r["data"][2]["data"]["deleted"], 1);
  EXPECT_EQ(CodeOf(r["data"][3]), kCodeDocInvalid);
  EXPECT_EQ(CodeOf(r["data"][4]), kCodeDocNotFound);
  EXPECT_THAT(HitPaths(r["data"][5]), ElementsAre("/v/share/a2"));
  EXPECT_THAT(HitPaths(Send(Query("prefix", "/v/share/"))),
              ElementsAre("/v/share/a2", "/v/share/b"));
}

TEST_F(EngineTest, SearchMergesIndexesAndRefusesBadParameters) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Create("fileindex_two", "db2")), 0);
  std::vector<Json::Value> upserts = {Upsert("/v/share/song.mp3"), Upsert("/v/share/talk.mp3"),
                                      Upsert("/v/share/notes.txt"),
                                      Upsert("/v/two/tune.mp3", "fileindex_two")};
  for (int i = 0; i < 4; ++i) upserts[i]["data"]["data"]["QUIXMDFSSize"] = (i + 1) * 10;
  ASSERT_EQ(Send(Compound(upserts))["has_fail"], false);

  const Json::Value r = Send(Parse(
      R"({"command":"search","data":{"file_type":"audio","sort":"size","order":"desc","size":2}})"));
  ASSERT_EQ(CodeOf(r), 0) << JsonToString(r);
  EXPECT_EQ(r["data"]["total"], 3);
  ASSERT_EQ(r["data"]["hits"].size(), 2u);
  EXPECT_EQ(r["data"]["hits"][0]["name"], "tune.mp3");
  EXPECT_EQ(r["data"]["hits"][1]["name"], "talk.mp3");
  const Json::Value one =
      Send(Parse(R"({"command":"search","data":{"id":"fileindex_two","ext":"MP3"}})"));
  EXPECT_EQ(one["data"]["total"], 1);

  for (const char* bad : {R"({"command":"search","data":{}})",
                          R"({"command":"search","data":{"name":"a","sort":"colour"}})",
                          R"({"command":"search","data":{"name":"a","file_type":"spreadsheet"}})",
                          R"({"command":"search","data":{"name":"a","size_range":{"gte":"1"}}})",
                          R"({"command":"search","data":{"name":"a","from":-1}})",
                          R"({"command":"search","data":{"name":"a","from":9223372036854775807}})",
                          R"({"command":"search","data":{"name":7}})",
                          R"({"command":"suggest","data":{}})"}) {
    EXPECT_EQ(CodeOf(Send(Parse(bad))), kCodeInvalidParam) << bad;
  }
  EXPECT_EQ(CodeOf(Send(Parse(R"({"command":"search","data":{"id":"fileindex_none","name":"a"}})"))),
            kCodeIndexNotFound);
}

// What ordinary users may see is checked against real files through the daemon.
TEST_F(EngineTest, OnlyPrivilegedCallersChangeOrReadIndexes) {
  ASSERT_EQ(CodeOf(Create()), 0);
  Caller user;
  user.uid = 1234;
  user.gid = 1234;
  EXPECT_EQ(CodeOf(engine_->HandleValue(Upsert("/v/share/x"), user)), kCodePermissionDenied);
  EXPECT_EQ(CodeOf(engine_->HandleValue(Query("term", "/v/share/x"), user)),
            kCodePermissionDenied);
  EXPECT_EQ(CodeOf(engine_->HandleValue(Compound({Upsert("/v/share/y")}), user)["data"][0]),
            kCodePermissionDenied);
}

TEST_F(EngineTest, RefusesWorkBeyondItsLimits) {
  EngineOptions options;
  options.max_write_backlog = 0;
  options.memory_limit_bytes = 8 << 20;
  engine_.reset();
  StartEngine(options);
  EXPECT_EQ(CodeOf(Send(OnIndex("commit"))), kCodeOverloaded);
  // People's searches are not writes and still pass.
  EXPECT_EQ(CodeOf(Send(Parse(R"({"command":"search","data":{"name":"abc"}})"))), 0);
  EXPECT_EQ(engine_->AdmitFrame(3 << 20), kCodeOutOfMemory);
  EXPECT_EQ(engine_->AdmitFrame(1000), 0);
  engine_->ReleaseFrame(1000);
}

TEST_F(EngineTest, TermSuggestionStoreRebuild) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/holiday.jpg"))), 0);
  const Json::Value list = Cmd("list_term_sugg_db", Json::Value(Json::objectValue));
  EXPECT_EQ(Send(list)["data"]["unavail"].size(), 0u);
  // Mark the store's suggestions unavailable behind the engine's back, as a lost table would.
  {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(dir_.Path("db/index.db").c_str(), &db), SQLITE_OK);
    const int rc = sqlite3_exec(db, "UPDATE meta SET value='unavail' WHERE key='term_sugg'",
                                nullptr, nullptr, nullptr);
    sqlite3_close(db);
    ASSERT_EQ(rc, SQLITE_OK);
  }
  EXPECT_EQ(JsonToString(Send(list)["data"]["unavail"]), "[\"fileindex_share\"]");
  const Json::Value r = Send(Compound(
      {Parse(R"({"command":"update_term_suggestion",
          "data":{"doc_id_field":"/v/share/holiday.jpg","db_name":"fileindex_share"}})"),
       Parse(R"({"command":"update_term_suggestion",
          "data":{"doc_id_field":"/v/share/gone.jpg","db_name":"fileindex_share"}})")}));
  EXPECT_EQ(r["data"][0]["success"], true);
  EXPECT_EQ(CodeOf(r["data"][1]), kCodeDocNotFound);
  ASSERT_EQ(CodeOf(Send(OnIndex("commit"))), 0);
  EXPECT_EQ(Send(list)["data"]["unavail"].size(), 0u);
  const Json::Value s = Send(Parse(R"({"command":"suggest","data":{"prefix":"hol"}})"));
  EXPECT_EQ(s["data"]["suggestions"][0], "holiday");
}

TEST_F(EngineTest, DamagedStoreIsSetAsideAndRebuilt) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  ASSERT_EQ(CodeOf(Send(OnIndex("commit"))), 0);
  engine_.reset();
  // An unclean stop (the running marker stays) and a store whose pages were overwritten.
  std::ofstream(dir_.Path("state/running")) << "\n";
  {
    std::fstream f(dir_.Path("db/index.db"), std::ios::in | std::ios::out | std::ios::binary);
    f.seekp(4096);
    const std::string junk(8192, '\x5a');
    f.write(junk.data(), static_cast<std::streamsize>(junk.size()));
  }
  StartEngine();
  EXPECT_EQ(CodeOf(Send(Query("term", "/v/share/a.txt"))), kCodeIndexDamaged);
  EXPECT_FALSE(IsFileExist(dir_.Path("db/index.db")));
  EXPECT_TRUE(logs_.Contains("is damaged"));
  EXPECT_EQ(CodeOf(Send(Parse(R"({"command":"search","data":{"id":"fileindex_share","name":"abc"}})"))),
            kCodeIndexDamaged);
  // The rebuild the library runs: delete, then create.
  ASSERT_EQ(CodeOf(Send(OnIndex("index_delete"))), 0);
  ASSERT_EQ(CodeOf(Create()), 0);
  EXPECT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
