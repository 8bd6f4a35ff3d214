#include "daemons/quixelasticd/engine.hpp"

#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "test/engine_client.hpp"
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
using ::testing::HasSubstr;

const char kId[] = "fileindex_share";

Json::Value Query(const std::string& form, const std::string& value) {
  Json::Value r = OnIndex("document_get_by_query", kId);
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

  // The names a search with `data` finds, in order; its whole reply in `reply` when asked.
  std::vector<std::string> Found(const std::string& data, Json::Value* reply = nullptr) {
    const Json::Value r = Send(Cmd("search", Parse(data)));
    EXPECT_EQ(CodeOf(r), 0) << data << JsonToString(r);
    std::vector<std::string> names;
    for (const Json::Value& h : r["data"]["hits"]) names.push_back(h["name"].asString());
    if (reply != nullptr) *reply = r;
    return names;
  }

  // The index is listed as refused, naming the share's index folder.
  void ExpectRefused(const std::string& share) {
    const Json::Value list = Send(Cmd("index_list", Json::Value(Json::objectValue)));
    ASSERT_EQ(list["data"].size(), 1u);
    EXPECT_EQ(list["data"][0]["state"], "refused");
    EXPECT_THAT(list["data"][0]["error"].asString(), HasSubstr(share + "/@eaDir"));
  }

  orvane::test::TempDir dir_;
  orvane::test::LogCapture logs_;
  Caller root_;
  std::unique_ptr<Engine> engine_;
};

TEST_F(EngineTest, MalformedRequestsGetErrorReplies) {
  const std::vector<std::pair<std::string, int>> cases = {
      {"{", kCodeMalformed},
      {R"({"command":7})", kCodeMalformed},
      {R"({"compound":{}})", kCodeMalformed},
      {R"({"command":"commit","data":[]})", kCodeMalformed},
      {R"({"command":"nope","data":{}})", kCodeUnknownCommand},
      {R"({"command":"commit","data":{}})", kCodeInvalidParam},
      {R"({"command":"commit","data":{"id":"fileindex_missing"}})", kCodeIndexNotFound},
      {R"({"command":"search","data":{}})", kCodeInvalidParam},
      {R"({"command":"search","data":{"name":"a","sort":"colour"}})", kCodeInvalidParam},
      {R"({"command":"search","data":{"name":"a","size_range":{"gte":"1"}}})", kCodeInvalidParam},
      {R"({"command":"search","data":{"name":"a","from":9223372036854775807}})", kCodeInvalidParam},
      {R"({"command":"search","data":{"id":"fileindex_none","name":"a"}})", kCodeIndexNotFound},
      // A trailing NUL, as the library sends it, is not part of the JSON text.
      {std::string("{\"command\":\"index_list\"}\0", 25), 0}};
  for (const auto& [text, code] : cases) {
    const Json::Value r = engine_->Handle(text, root_);
    EXPECT_EQ(CodeOf(r), code) << text;
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

  EXPECT_EQ(Send(OnIndex("index_delete"))["data"]["deleted"], true);
  EXPECT_FALSE(IsFileExist(dir_.Path("db/index.db")));
}

// A batch on one index runs first without a savepoint per command; a failure anywhere in it
// must undo that run completely before the commands run again one by one.
TEST_F(EngineTest, CompoundAnswersEachInOrderAndUndoesOnlyWhatFailed) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(Send(Upsert("/v/share/e"))["success"], true);
  Json::Value bad_doc = Upsert("/v/share/bad");
  bad_doc["data"]["data"]["QUIXMDFSSize"] = "not a number";
  auto on_doc = [](const char* command, const char* doc_id, const char* new_path = nullptr) {
    Json::Value r = OnIndex(command);
    r["data"]["doc_id"] = doc_id;
    if (new_path != nullptr) r["data"]["data"]["QUIXMDPath"] = new_path;
    return r;
  };
  const std::vector<std::pair<Json::Value, int>> steps = {
      {Upsert("/v/share/a"), 0},
      {on_doc("document_set_by_id", "/v/share/a", "/v/share/a2"), 0},
      {on_doc("document_del_by_id", "/v/share/e"), 0},
      {bad_doc, kCodeDocInvalid},
      {on_doc("document_set_by_id", "/v/share/none", "/v/share/x"), kCodeDocNotFound},
      {Query("prefix", "/v/share/"), 0},
      {Parse(R"({"compound": []})"), kCodeMalformed},
      {Cmd("no_such_command", Json::Value()), kCodeUnknownCommand},
      {Parse(R"({"command": "update_term_suggestion",
           "data": {"doc_id_field": "/v/share/gone", "db_name": "fileindex_share"}})"),
       kCodeDocNotFound},
      {Upsert("/v/share/b"), 0}};
  std::vector<Json::Value> batch;
  for (const auto& step : steps) batch.push_back(step.first);
  const Json::Value r = Send(Compound(batch));
  ASSERT_EQ(r["data"].size(), steps.size()) << JsonToString(r);
  EXPECT_TRUE(r["success"].asBool() && r["has_fail"].asBool());
  for (Json::ArrayIndex i = 0; i < steps.size(); ++i) {
    EXPECT_EQ(CodeOf(r["data"][i]), steps[i].second) << JsonToString(steps[i].first);
  }
  // Had the first run's delete stood, the second would have found nothing to delete.
  EXPECT_EQ(r["data"][2]["data"]["deleted"], 1);
  EXPECT_THAT(HitPaths(r["data"][5]), ElementsAre("/v/share/a2"));
  EXPECT_THAT(HitPaths(Send(Query("prefix", "/v/share/"))),
              ElementsAre("/v/share/a2", "/v/share/b"));

  // Commands that need the index's lock, or read committed data, follow a batch's writes
  // without waiting on the batch itself, and see them.
  const Json::Value m =
      Send(Compound({Upsert("/v/share/c"), Cmd("list_term_sugg_db", Json::Value(Json::objectValue)),
                     Cmd("index_list", Json::Value(Json::objectValue)), Upsert("/v/share/d"),
                     Parse(R"({"command":"search","data":{"name":"d"}})")}));
  EXPECT_EQ(m["has_fail"], false) << JsonToString(m);
  EXPECT_EQ(m["data"][4]["data"]["total"], 1);
}

TEST_F(EngineTest, SearchFindsNamesWordsFoldersAndRangesAcrossIndexes) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Create("fileindex_two", "db2")), 0);
  Json::Value report = Upsert("/v/share/docs/Annual_Report.PDF", kId, 5000, 200);
  report["data"]["data"]["QUIXMDTextContent"] = "the quarterly revenue grew strongly in the north";
  ASSERT_EQ(Send(Compound({report, Upsert("/v/share/docs/report draft.txt", kId, 100, 100),
                           Upsert("/v/share/music/100%_hits.mp3", kId, 9000, 300),
                           Upsert("/v/share/music/sub/a_b.mp3", kId, 50, 50),
                           Upsert("/v/share/musical.txt", kId, 1, 1),
                           Upsert("/v/two/tune.mp3", "fileindex_two", 500, 0)}))["has_fail"],
            false);
  Json::Value r;
  // The name index is case-insensitive, its substrings span word boundaries, short ones scan,
  // and LIKE wildcards are literal.
  EXPECT_THAT(Found(R"({"name": "REPORT"})"), ElementsAre("Annual_Report.PDF", "report draft.txt"));
  EXPECT_THAT(Found(R"({"name": "t d"})"), ElementsAre("report draft.txt"));
  EXPECT_THAT(Found(R"({"name": "_b"})"), ElementsAre("a_b.mp3"));
  EXPECT_THAT(Found(R"({"keyword": "revenue north"})"), ElementsAre("Annual_Report.PDF"));
  // A folder is not a prefix of a name: /v/share/musical.txt is not in /v/share/music/.
  EXPECT_THAT(Found(R"({"folder": "/v/share/music/", "sort": "size", "order": "desc"})"),
              ElementsAre("100%_hits.mp3", "a_b.mp3"));
  EXPECT_THAT(Found(R"({"ext": ["PDF", "mp3"], "size_range": {"gte": 100},
                        "mtime_range": {"lte": 250}})"),
              ElementsAre("Annual_Report.PDF", "tune.mp3"));
  EXPECT_THAT(Found(R"({"folder": "/v/share", "sort": "mtime", "from": 1, "size": 2})", &r),
              ElementsAre("a_b.mp3", "report draft.txt"));
  EXPECT_EQ(r["data"]["total"], 5);
  // Pages of several indexes merge in the asked order.
  EXPECT_THAT(Found(R"({"file_type": "audio", "sort": "size", "order": "desc", "size": 2})", &r),
              ElementsAre("100%_hits.mp3", "tune.mp3"));
  EXPECT_EQ(r["data"]["total"], 3);
}

// Frames beyond the memory limit are refused by the daemon itself, checked through its socket.
TEST_F(EngineTest, RefusesWritesBeyondItsBacklog) {
  EngineOptions options;
  options.max_write_backlog = 0;
  engine_.reset();
  StartEngine(options);
  EXPECT_EQ(CodeOf(Send(OnIndex("commit"))), kCodeOverloaded);
  // People's searches are not writes and still pass.
  EXPECT_TRUE(Found(R"({"name": "abc"})").empty());
}

TEST_F(EngineTest, DamagedStoreIsSetAsideAndRebuilt) {
  ASSERT_EQ(CodeOf(Create()), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  ASSERT_EQ(CodeOf(Send(OnIndex("commit"))), 0);
  engine_.reset();
  // An unclean stop (the running marker stays) and a store whose pages were overwritten.
  std::ofstream(dir_.Path("state/running")) << "\n";
  std::fstream(dir_.Path("db/index.db"), std::ios::in | std::ios::out | std::ios::binary)
          .seekp(4096)
      << std::string(8192, '\x5a');
  StartEngine();
  EXPECT_EQ(CodeOf(Send(Query("term", "/v/share/a.txt"))), kCodeIndexDamaged);
  EXPECT_FALSE(IsFileExist(dir_.Path("db/index.db")));
  EXPECT_TRUE(logs_.Contains("is damaged"));
  // The rebuild the library runs: delete, then create.
  ASSERT_EQ(CodeOf(Send(OnIndex("index_delete"))), 0);
  ASSERT_EQ(CodeOf(Create()), 0);
  EXPECT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
}

// One word 200,000 times in one document: ranking and the snippet cost one pass over it, and
// the snippet still finds the rare word near its end.
TEST_F(EngineTest, HugeRepetitionIsRankedAndSnippedInOnePass) {
  ASSERT_EQ(CodeOf(Create()), 0);
  std::string text;
  for (int i = 0; i < 200000; ++i) text += "hello ";
  text += "the quarterly figures";
  Json::Value big = Upsert("/v/share/big.txt");
  big["data"]["data"]["QUIXMDTextContent"] = text;
  Json::Value small = Upsert("/v/share/small.txt");
  small["data"]["data"]["QUIXMDTextContent"] = "hello world, quarterly";
  ASSERT_EQ(Send(Compound({big, small}))["has_fail"], false);

  Json::Value r;
  EXPECT_THAT(Found(R"({"keyword": "quarterly hello", "size": 5, "sort": "name"})", &r),
              ElementsAre("big.txt", "small.txt"));
  const std::string snippet = r["data"]["hits"][0]["snippet"].asString();
  EXPECT_THAT(snippet, HasSubstr("<b>hello</b> the <b>quarterly</b>"));
  EXPECT_EQ(snippet.rfind("...", 0), 0u) << snippet;
  EXPECT_LT(snippet.size(), 400u) << snippet;
  // The catch-all text begins with the file's name.
  EXPECT_EQ(r["data"]["hits"][1]["snippet"].asString(),
            "small.txt\n<b>hello</b> world, <b>quarterly</b>");
}

// A search is stopped, and nothing of it left running, when its time budget is spent or its
// client hangs up; a client that only closed its writing side still gets the answer.
TEST_F(EngineTest, SearchStopsAtItsBudgetOrWhenItsClientHangsUp) {
  ASSERT_EQ(CodeOf(Create()), 0);
  // Enough rows that the query runs well past one look of the progress handler.
  std::vector<Json::Value> docs(2000);
  for (size_t i = 0; i < docs.size(); ++i) {
    docs[i] = Upsert("/v/share/f" + std::to_string(i) + ".txt");
    docs[i]["data"]["data"]["QUIXMDTextContent"] = "budget words";
  }
  ASSERT_EQ(Send(Compound(docs))["has_fail"], false);
  const Json::Value search = Cmd("search", Parse(R"({"keyword": "budget", "sort": "name"})"));
  int pair[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
  UniqueFd server_end(pair[0]);
  UniqueFd client_end(pair[1]);
  Caller caller = root_;
  caller.peer_fd = server_end.get();

  // Half-closed after the request: still waiting for the reply.
  ASSERT_EQ(::shutdown(client_end.get(), SHUT_WR), 0);
  EXPECT_EQ(engine_->HandleValue(search, caller)["data"]["total"], 2000);
  client_end.Close();
  Json::Value r = engine_->HandleValue(search, caller);
  EXPECT_EQ(CodeOf(r), kCodeCallerGone) << JsonToString(r);
  // In a batch the stop answers the search, not the batch.
  r = engine_->HandleValue(Compound({search, OnIndex("commit")}), caller);
  EXPECT_EQ(CodeOf(r["data"][0]), kCodeCallerGone);
  EXPECT_EQ(CodeOf(r["data"][1]), 0);

  EngineOptions options;
  options.search_budget_micros = 1;
  engine_.reset();
  StartEngine(options);
  r = Send(search);
  EXPECT_EQ(CodeOf(r), kCodeSearchTooLong);
  EXPECT_EQ(r["error"]["msg"].asString().rfind("the search took longer than 1 s", 0), 0u)
      << JsonToString(r);
}

bool IsEmptyDir(const std::string& path) {
  return std::system(("ls -A '" + path + "' | grep -q .").c_str()) != 0;
}

mode_t Mode(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

const char kShareDb[] = "share/@eaDir/@fileindex/db";

// A user who may write the share root plants the index folder as a link to a root-only folder
// before the share is indexed: the index is refused with the path, nothing is made where the
// link points, and the index is made root-only once the planted folders are gone.
TEST_F(EngineTest, APlantedIndexFolderIsRefusedUntilItIsGone) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as nobody";
  const std::string share = orvane::test::MakeOpenShare(dir_, "share");
  const std::string secret = dir_.Path("secret");
  ASSERT_EQ(mkdir(secret.c_str(), 0700), 0);
  ASSERT_EQ(0, orvane::test::RunAsUser("nobody", [&] {
    return mkdir((share + "/@eaDir").c_str(), 0777) |
           mkdir((share + "/@eaDir/@fileindex").c_str(), 0777) |
           symlink(secret.c_str(), dir_.Path(kShareDb).c_str());
  }));
  const Json::Value refused = Create(kId, kShareDb);
  EXPECT_EQ(CodeOf(refused), kCodeStorage);
  EXPECT_THAT(refused["error"]["msg"].asString(),
              HasSubstr("unsafe index file " + share + "/@eaDir: it is owned by uid 65534"));
  ExpectRefused(share);
  EXPECT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), kCodeStorage);
  EXPECT_TRUE(IsEmptyDir(secret));

  ASSERT_EQ(std::system(("rm -rf '" + share + "/@eaDir'").c_str()), 0);
  ASSERT_EQ(CodeOf(Create(kId, kShareDb)), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/a.txt"))), 0);
  ASSERT_EQ(CodeOf(Send(OnIndex("commit"))), 0);
  const std::string db = dir_.Path(kShareDb);
  for (const std::string& rel : {"/@eaDir", "/@eaDir/@fileindex", "/@eaDir/@fileindex/db"}) {
    EXPECT_EQ(Mode(share + rel), 0700u) << rel;
  }
  for (const char* file : {"/index.db", "/index.db-wal", "/index.db-shm"}) {
    EXPECT_EQ(Mode(db + file), 0600u) << file;
  }
}

// The index folder's path swapped under a running engine (renameat2 RENAME_EXCHANGE of
// "@eaDir" by a user who may write the share root): the engine keeps working in its own
// folder, readers opened after the swap included, and writes nothing into the swapped-in one.
// At the next start the swapped-in folder is refused.
TEST_F(EngineTest, TheIndexFollowsItsFolderNotItsPath) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as nobody";
  const std::string share = orvane::test::MakeOpenShare(dir_, "share");
  ASSERT_EQ(CodeOf(Create(kId, kShareDb)), 0);
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/before.txt"))), 0);
  ASSERT_EQ(CodeOf(Send(OnIndex("commit"))), 0);
  ASSERT_EQ(0, orvane::test::RunAsUser("nobody", [&] {
    return mkdir((share + "/bait").c_str(), 0777) |
           mkdir((share + "/bait/@fileindex").c_str(), 0777) |
           mkdir((share + "/bait/@fileindex/db").c_str(), 0777) |
           orvane::test::RenameExchange(share + "/@eaDir", share + "/bait");
  }));
  EXPECT_THAT(Found(R"({"name": "before"})"), ElementsAre("before.txt"));
  ASSERT_EQ(CodeOf(Send(Upsert("/v/share/after.txt"))), 0);
  ASSERT_EQ(CodeOf(Send(OnIndex("commit"))), 0);
  EXPECT_THAT(Found(R"({"name": "after"})"), ElementsAre("after.txt"));
  EXPECT_TRUE(IsEmptyDir(dir_.Path(kShareDb)));
  EXPECT_TRUE(IsFileExist(share + "/bait/@fileindex/db/index.db"));

  engine_.reset();
  StartEngine();
  ExpectRefused(share);
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
