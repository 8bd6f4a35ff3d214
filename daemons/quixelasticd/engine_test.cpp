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

const char kId[] = "fileindex_share";

Json::Value Obj(const std::string& text) {
  JsonValue v;
  EXPECT_TRUE(v.fromString(text)) << text;
  return v;
}

Json::Value Doc(const std::string& path) {
  const size_t slash = path.find_last_of('/');
  Json::Value d;
  d["QUIXMDPath"] = path;
  d["QUIXMDFSName"] = path.substr(slash + 1);
  d["QUIXMDParent"] = path.substr(0, slash);
  d["QUIXMDSearchFileName"] = path.substr(slash + 1);
  d["QUIXMDSearchAncestor"] = path.substr(0, slash);
  return d;
}

Json::Value Upsert(const std::string& path, const std::string& id = kId) {
  Json::Value data;
  data["id"] = id;
  data["doc_id"] = path;
  data["data"] = Doc(path);
  return Cmd("document_upsert_by_id", data);
}

Json::Value Query(const std::string& form, const std::string& value,
                  const std::string& id = kId) {
  Json::Value data;
  data["id"] = id;
  data["query"]["qsl"][form]["QUIXMDPath"] = value;
  data["query"]["load_field"].append("QUIXMDPath");
  return Cmd("document_get_by_query", data);
}

std::vector<std::string> HitPaths(const Json::Value& reply) {
  std::vector<std::string> out;
  for (const Json::Value& h : reply["data"]) out.push_back(h["QUIXMDPath"].asString());
  return out;
}

class EngineTest : public ::testing::Test {
 protected:
  EngineTest() { root_caller_.privileged = true; }
  void SetUp() override { StartEngine(); }

  void StartEngine(EngineOptions options = EngineOptions()) {
    options.registry_file = dir_.Path("state/indexes.json");
    options.running_marker = dir_.Path("state/running");
    engine_ = std::make_unique<Engine>(options);
    engine_->Start();
    engine_->WaitOpened();
  }
  Json::Value Send(const Json::Value& request) { return engine_->HandleValue(request, root_caller_); }
  int CodeOf(const Json::Value& reply) {
    return reply["success"].asBool() ? 0 : reply["error"]["code"].asInt();
  }
  Json::Value Create(const std::string& id = kId, const std::string& rel = "db") {
    Json::Value data;
    data["id"] = id;
    data["path"] = dir_.Path(rel);
    data["settings"] = Json::Value(Json::objectValue);
    data["mappings"] = tc::FileMappings();
    data["event_handler"]["lib_path"] = "/handler.so";
    return Send(Cmd("index_create", data));
  }
  Json::Value IdOnly(const std::string& command, const std::string& id = kId) {
    Json::Value data;
    data["id"] = id;
    return Send(Cmd(command, data));
  }

  orvane::test::TempDir dir_;
  orvane::test::LogCapture logs_;
  Caller root_caller_;
  std::unique_ptr<Engine> engine_;
};

TEST_F(EngineTest, MalformedRequestsGetErrorReplies) {
  const Caller root = root_caller_;
  EXPECT_EQ(CodeOf(engine_->Handle("{", root)), kCodeMalformed);
  EXPECT_EQ(CodeOf(engine_->Handle("[1]", root)), kCodeMalformed);
  EXPECT_EQ(CodeOf(engine_->Handle("{\"data\":{}}", root)), kCodeMalformed);
  EXPECT_EQ(CodeOf(engine_->Handle("{\"command\":7}", root)), kCodeMalformed);
  EXPECT_EQ(CodeOf(engine_->Handle("{\"command\":\"commit\",\"data\":[]}", root)), kCodeMalformed);
  EXPECT_EQ(CodeOf(engine_->Handle("{\"compound\":{}}", root)), kCodeMalformed);
  EXPECT_EQ(CodeOf(engine_->Handle("{\"command\":\"nope\",\"data\":{}}", root)),
            kCodeUnknownCommand);
  // A trailing NUL, as the library sends it, is not part of the JSON text.
  const Json::Value ok = engine_->Handle(std::string("{\"command\":\"index_list\"}\0", 25), root);
  EXPECT_TRUE(ok["success"].asBool()) << JsonToString(ok);
  const Json::Value r = engine_->Handle("{\"command\":\"commit\",\"data\":{}}", root);
  EXPECT_EQ(r["success"], false);
  EXPECT_EQ(CodeOf(r), kCodeInvalidParam);
  EXPECT_TRUE(r["error"]["msg"].isString());
  EXPECT_EQ(CodeOf(IdOnly("commit", "fileindex_missing")), kCodeIndexNotFound);
}

TEST_F(EngineTest, IndexLifecycle) {
  EXPECT_EQ(CodeOf(Create()), 0);
  // Creating it again where it is keeps it and its documents; elsewhere is a conflict.
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  EXPECT_EQ(CodeOf(Create()), 0);
  EXPECT_EQ(HitPaths(Send(Query("term", "/v/share/a.txt"))).size(), 1u);
  EXPECT_EQ(CodeOf(Create(kId, "elsewhere")), kCodeIndexExists);
  EXPECT_EQ(CodeOf(Create("fileindex_other", "db")), kCodeIndexExists);

  EXPECT_EQ(CodeOf(IdOnly("index_pause")), 0);
  EXPECT_EQ(CodeOf(Send(Upsert("/v/share/b.txt"))), kCodeIndexPaused);
  EXPECT_EQ(CodeOf(IdOnly("index_resume")), 0);
  EXPECT_EQ(CodeOf(Send(Upsert("/v/share/b.txt"))), 0);

  // Re-key and move: the documents follow.
  Json::Value data;
  data["id"] = kId;
  data["data"]["id"] = "fileindex_renamed";
  data["data"]["path"] = dir_.Path("moved/db");
  EXPECT_EQ(CodeOf(Send(Cmd("index_config_set", data))), 0);
  EXPECT_EQ(CodeOf(Send(Query("term", "/v/share/a.txt"))), kCodeIndexNotFound);
  EXPECT_EQ(HitPaths(Send(Query("prefix", "/v/share/", "fileindex_renamed"))).size(), 2u);
  EXPECT_TRUE(IsFileExist(dir_.Path("moved/db/index.db")));
  EXPECT_FALSE(IsFileExist(dir_.Path("db/index.db")));

  // The registry brings it back after a restart, in its new place.
  engine_.reset();
  StartEngine();
  EXPECT_EQ(HitPaths(Send(Query("prefix", "/v/share/", "fileindex_renamed"))).size(), 2u);

  const Json::Value deleted = IdOnly("index_delete", "fileindex_renamed");
  EXPECT_EQ(deleted["data"]["deleted"], true) << JsonToString(deleted);
  EXPECT_FALSE(IsFileExist(dir_.Path("moved/db/index.db")));
  // Deleting what is not there succeeds: the caller wanted it gone.
  EXPECT_EQ(IdOnly("index_delete", "fileindex_renamed")["data"]["deleted"], false);
}

TEST_F(EngineTest, CompoundAnswersEachInOrderAndSeesItsOwnWrites) {
  ASSERT_EQ(CodeOf(Create()), 0);
  Json::Value bad_doc = Upsert("/v/share/bad");
  bad_doc["data"]["data"].removeMember("QUIXMDPath");
  bad_doc["data"]["doc_id"] = Json::Value();
  Json::Value req;
  req["compound"].append(Upsert("/v/share/a"));
  req["compound"].append(Query("term", "/v/share/a"));
  req["compound"].append(bad_doc);
  req["compound"].append(Obj(R"({"compound": []})"));
  req["compound"].append(Cmd("no_such_command", Json::Value()));
  req["compound"].append(Upsert("/v/share/b"));
  const Json::Value r = Send(req);
  ASSERT_EQ(r["success"], true);
  EXPECT_EQ(r["has_fail"], true);
  ASSERT_EQ(r["data"].size(), 6u);
  EXPECT_EQ(r["data"][0]["success"], true);
  EXPECT_THAT(HitPaths(r["data"][1]), ::testing::ElementsAre("/v/share/a"));
  EXPECT_EQ(CodeOf(r["data"][2]), kCodeDocInvalid);
  EXPECT_EQ(CodeOf(r["data"][3]), kCodeMalformed);
  EXPECT_EQ(CodeOf(r["data"][4]), kCodeUnknownCommand);
  EXPECT_EQ(r["data"][5]["success"], true);
  // The failed entry was rolled back alone.
  EXPECT_THAT(HitPaths(Send(Query("prefix", "/v/share/"))),
              ::testing::ElementsAre("/v/share/a", "/v/share/b"));

  // Commands that need the index's lock, or read committed data, follow a batch's writes
  // without waiting on the batch itself, and see them.
  Json::Value mixed;
  mixed["compound"].append(Upsert("/v/share/c"));
  mixed["compound"].append(Cmd("list_term_sugg_db", Json::Value(Json::objectValue)));
  mixed["compound"].append(Cmd("index_list", Json::Value(Json::objectValue)));
  mixed["compound"].append(Upsert("/v/share/d"));
  mixed["compound"].append(Obj(R"({"command":"search","data":{"name":"d"}})"));
  const Json::Value m = Send(mixed);
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
  Json::Value rekey = Cmd("document_set_by_id", Json::Value(Json::objectValue));
  rekey["data"]["id"] = "fileindex_share";
  rekey["data"]["doc_id"] = "/v/share/a";
  rekey["data"]["data"]["QUIXMDPath"] = "/v/share/a2";
  Json::Value missing = rekey;
  missing["data"]["doc_id"] = "/v/share/none";
  Json::Value del = Cmd("document_del_by_id", Json::Value(Json::objectValue));
  del["data"]["id"] = "fileindex_share";
  del["data"]["doc_id"] = "/v/share/e";

  Json::Value req;
  req["compound"].append(Upsert("/v/share/a"));
  req["compound"].append(rekey);
  req["compound"].append(del);
  req["compound"].append(bad_doc);
  req["compound"].append(missing);
  req["compound"].append(Query("prefix", "/v/share/"));
  req["compound"].append(Upsert("/v/share/b"));
  const Json::Value r = Send(req);
  ASSERT_EQ(r["data"].size(), 7u) << JsonToString(r);
  EXPECT_EQ(r["has_fail"], true);
  EXPECT_EQ(r["data"][1]["success"], true);
  // Had the first run's delete stood, the second would have found nothing to delete.
  EXPECT_EQ(r["data"][2]["data"]["deleted"], 1);
  EXPECT_EQ(CodeOf(r["data"][3]), kCodeDocInvalid);
  EXPECT_EQ(CodeOf(r["data"][4]), kCodeDocNotFound);
  EXPECT_THAT(HitPaths(r["data"][5]), ::testing::ElementsAre("/v/share/a2"));
  EXPECT_THAT(HitPaths(Send(Query("prefix", "/v/share/"))),
              ::testing::ElementsAre("/v/share/a2", "/v/share/b"));
}

// The library's directory rename: one query per pass, then a batch of set_by_id requests that
// still carry the query's members and a load_field list that grows on every pass.
TEST_F(EngineTest, RenameLoopRequestsWithLeftoverMembersWork) {
  ASSERT_EQ(CodeOf(Create()), 0);
  Json::Value batch;
  for (int i = 0; i < 30; ++i) batch["compound"].append(Upsert("/v/share/a/x/f" + std::to_string(i)));
  ASSERT_EQ(Send(batch)["has_fail"], false);
  Json::Value req = Query("prefix", "/v/share/a/");
  req["data"]["doc_id"] = "/v/share/a";
  req["data"]["data"]["QUIXMDPath"] = "/v/share/bb";
  int passes = 0;
  for (;;) {
    ++passes;
    req["command"] = "document_get_by_query";
    for (const char* f : {"QUIXMDPath", "QUIXMDFSName", "QUIXMDParent"}) {
      req["data"]["query"]["load_field"].append(f);
    }
    req["data"]["query"]["from"] = 0;
    req["data"]["query"]["size"] = 10;
    const Json::Value hits = Send(req);
    ASSERT_EQ(CodeOf(hits), 0) << JsonToString(hits);
    if (hits["data"].empty()) break;
    Json::Value compound;
    for (const Json::Value& h : hits["data"]) {
      const std::string parent = "/v/share/bb" + h["QUIXMDParent"].asString().substr(10);
      req["command"] = "document_set_by_id";
      req["data"]["doc_id"] = h["QUIXMDPath"];
      req["data"]["data"] = Json::Value(Json::objectValue);
      req["data"]["data"]["QUIXMDParent"] = parent;
      req["data"]["data"]["QUIXMDPath"] = parent + "/" + h["QUIXMDFSName"].asString();
      req["data"]["data"]["QUIXMDSearchAncestor"] = parent;
      compound["compound"].append(req);
    }
    ASSERT_EQ(Send(compound)["has_fail"], false);
    ASSERT_EQ(CodeOf(IdOnly("commit")), 0);
    ASSERT_LT(passes, 10);
  }
  EXPECT_EQ(passes, 4);
  const Json::Value moved = Send(Query("prefix", "/v/share/bb/"));
  EXPECT_EQ(moved["data"].size(), 30u);
  EXPECT_EQ(moved["data"][0]["QUIXMDPath"], "/v/share/bb/x/f0");
  // Without "size" a page holds the documented default.
  EXPECT_EQ(Send(Query("prefix", "/v/share/bb/x/"))["data"].size(), 30u);
}

TEST_F(EngineTest, SearchMergesIndexesAndRefusesBadParameters) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Create("fileindex_two", "db2")), 0);
  Json::Value batch;
  int64_t size = 1;
  for (const char* p : {"/v/share/song.mp3", "/v/share/talk.mp3", "/v/share/notes.txt"}) {
    Json::Value req = Upsert(p);
    req["data"]["data"]["QUIXMDFSSize"] = static_cast<Json::Int64>(size *= 10);
    req["data"]["data"]["QUIXMDExtension"] = std::string(p).substr(std::string(p).size() - 3);
    batch["compound"].append(req);
  }
  Json::Value other = Upsert("/v/two/tune.mp3", "fileindex_two");
  other["data"]["data"]["QUIXMDFSSize"] = 500;
  other["data"]["data"]["QUIXMDExtension"] = "mp3";
  batch["compound"].append(other);
  ASSERT_EQ(Send(batch)["has_fail"], false);

  const Json::Value r = Send(Obj(
      R"({"command":"search","data":{"file_type":"audio","sort":"size","order":"desc","size":2}})"));
  ASSERT_EQ(CodeOf(r), 0) << JsonToString(r);
  EXPECT_EQ(r["data"]["total"], 3);
  ASSERT_EQ(r["data"]["hits"].size(), 2u);
  EXPECT_EQ(r["data"]["hits"][0]["name"], "tune.mp3");
  EXPECT_EQ(r["data"]["hits"][1]["name"], "talk.mp3");
  const Json::Value one = Send(Obj(R"({"command":"search","data":{"id":"fileindex_two","ext":"MP3"}})"));
  EXPECT_EQ(one["data"]["total"], 1);

  for (const char* bad : {R"({"command":"search","data":{}})",
                          R"({"command":"search","data":{"name":"a","sort":"colour"}})",
                          R"({"command":"search","data":{"name":"a","file_type":"spreadsheet"}})",
                          R"({"command":"search","data":{"name":"a","size_range":{"gte":"1"}}})",
                          R"({"command":"search","data":{"name":"a","from":-1}})",
                          R"({"command":"search","data":{"name":"a","from":9223372036854775807}})",
                          R"({"command":"search","data":{"name":7}})",
                          R"({"command":"suggest","data":{}})"}) {
    EXPECT_EQ(CodeOf(Send(Obj(bad))), kCodeInvalidParam) << bad;
  }
  EXPECT_EQ(CodeOf(Send(Obj(R"({"command":"search","data":{"id":"fileindex_none","name":"a"}})"))),
            kCodeIndexNotFound);
}

TEST_F(EngineTest, OnlyPrivilegedCallersChangeIndexes) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  Caller user;
  user.uid = 1234;
  user.gid = 1234;
  EXPECT_EQ(CodeOf(engine_->HandleValue(Upsert("/v/share/x"), user)), kCodePermissionDenied);
  EXPECT_EQ(CodeOf(engine_->HandleValue(Query("term", "/v/share/a.txt"), user)),
            kCodePermissionDenied);
  Json::Value compound;
  compound["compound"].append(Upsert("/v/share/y"));
  EXPECT_EQ(CodeOf(engine_->HandleValue(compound, user)["data"][0]), kCodePermissionDenied);
  // Searching is open, but /v/share does not exist on this machine, so nothing is visible.
  const Json::Value found = engine_->HandleValue(Obj(R"({"command":"search","data":{"name":"a.t"}})"), user);
  EXPECT_EQ(found["success"], true);
  EXPECT_EQ(found["data"]["total"], 0);
  const Json::Value as_root = Send(Obj(R"({"command":"search","data":{"name":"a.t"}})"));
  EXPECT_EQ(as_root["data"]["total"], 1);
}

TEST_F(EngineTest, RefusesWorkBeyondItsLimits) {
  EngineOptions options;
  options.max_write_backlog = 0;
  options.memory_limit_bytes = 8 << 20;
  engine_.reset();
  StartEngine(options);
  EXPECT_EQ(CodeOf(IdOnly("commit")), kCodeOverloaded);
  // People's searches are not writes and still pass.
  EXPECT_EQ(CodeOf(Send(Obj(R"({"command":"search","data":{"name":"abc"}})"))), 0);
  EXPECT_EQ(engine_->AdmitFrame(3 << 20), kCodeOutOfMemory);
  EXPECT_EQ(engine_->AdmitFrame(1000), 0);
  engine_->ReleaseFrame(1000);
}

TEST_F(EngineTest, TermSuggestionStoreRebuild) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/holiday.jpg"))), 0);
  EXPECT_EQ(Send(Cmd("list_term_sugg_db", Json::Value(Json::objectValue)))["data"]["unavail"].size(),
            0u);
  // Mark the store's suggestions unavailable behind the engine's back, as a lost table would.
  {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(dir_.Path("db/index.db").c_str(), &db), SQLITE_OK);
    const int rc = sqlite3_exec(db, "UPDATE meta SET value='unavail' WHERE key='term_sugg'",
                                nullptr, nullptr, nullptr);
    sqlite3_close(db);
    ASSERT_EQ(rc, SQLITE_OK);
  }
  const Json::Value listed = Send(Cmd("list_term_sugg_db", Json::Value(Json::objectValue)));
  ASSERT_EQ(listed["data"]["unavail"].size(), 1u);
  EXPECT_EQ(listed["data"]["unavail"][0], kId);
  Json::Value req;
  req["compound"].append(Obj(R"({"command":"update_term_suggestion",
      "data":{"doc_id_field":"/v/share/holiday.jpg","db_name":"fileindex_share"}})"));
  req["compound"].append(Obj(R"({"command":"update_term_suggestion",
      "data":{"doc_id_field":"/v/share/gone.jpg","db_name":"fileindex_share"}})"));
  const Json::Value r = Send(req);
  EXPECT_EQ(r["data"][0]["success"], true);
  EXPECT_EQ(CodeOf(r["data"][1]), kCodeDocNotFound);
  ASSERT_EQ(CodeOf(IdOnly("commit")), 0);
  EXPECT_EQ(Send(Cmd("list_term_sugg_db", Json::Value(Json::objectValue)))["data"]["unavail"].size(),
            0u);
  const Json::Value s = Send(Obj(R"({"command":"suggest","data":{"prefix":"hol"}})"));
  EXPECT_EQ(s["data"]["suggestions"][0], "holiday");
}

TEST_F(EngineTest, DamagedStoreIsSetAsideAndRebuilt) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  ASSERT_EQ(CodeOf(IdOnly("commit")), 0);
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
  EXPECT_EQ(CodeOf(Send(Obj(R"({"command":"search","data":{"id":"fileindex_share","name":"abc"}})"))),
            kCodeIndexDamaged);
  // The rebuild the library runs: delete, then create.
  ASSERT_EQ(CodeOf(IdOnly("index_delete")), 0);
  ASSERT_EQ(CodeOf(Create()), 0);
  EXPECT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
