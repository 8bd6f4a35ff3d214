#include "fileindex/elastic_control.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "platform/fault.hpp"
#include "platform/platform_error.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace elastic {
namespace {

using test::FakeDaemon;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

Json::Value Parse(const std::string& text) { return FakeDaemon::Parse(text); }

Json::Value Ok() { return Parse(R"({"success":true})"); }
Json::Value Hits(const Json::Value& hits) {
  Json::Value res = Ok();
  res["data"] = hits;
  return res;
}
Json::Value ArrayOf(const Json::Value& element) {
  Json::Value array(Json::arrayValue);
  array.append(element);
  return array;
}
Json::Value Fail(int code, const std::string& msg) {
  Json::Value res;
  res["success"] = false;
  res["error"]["code"] = code;
  res["error"]["msg"] = msg;
  return res;
}

// A scripted search engine on the real socket path: `answer` maps each parsed request to its
// reply.
class Engine {
 public:
  using Answer = std::function<Json::Value(const Json::Value& req)>;
  Engine(const std::string& sock, Answer answer)
      : daemon_(sock, [answer](int fd, const std::string& raw) {
          FakeDaemon::WriteFrame(fd, JsonToString(answer(FakeDaemon::Parse(raw))));
        }) {}
  std::vector<Json::Value> requests() const { return daemon_.json_requests(); }

 private:
  FakeDaemon daemon_;
};

class ElasticControlTest : public ::testing::Test {
 protected:
  ElasticControlTest() : root_(dir_.path()) {
    test::WritePlatformConfig(dir_.path(), R"({"shares": [
      {"name": "photo", "path": ")" + volume_.path() +
                                               R"(/photo"},
      {"name": "a", "path": ")" + volume_.path() +
                                               R"(/a"},
      {"name": "b", "path": ")" + volume_.path() +
                                               R"(/b"},
      {"name": "c", "path": ")" + volume_.path() +
                                               R"(/c"}]})");
  }
  std::string Sock() const { return dir_.Path("var/run/quixelasticd.sock"); }

  test::TempDir dir_;
  test::TempDir volume_;
  test::ScopedRoot root_;
  test::FakeEnv env_;
  test::LogCapture log_;
};

template <typename Fn>
Error ErrorOf(Fn fn) {
  try {
    fn();
  } catch (const Error& e) {
    return e;
  }
  ADD_FAILURE() << "no Error";
  return Error(kErrInvalidParam, "none");
}

TEST(SchemaTest, FiftyFiveFieldsOverTheDefaults) {
  const Json::Value mappings = GetFileIndexMappings();
  EXPECT_EQ(mappings.size(), 3u);
  EXPECT_EQ(mappings["property_id"].asString(), "QUIXMDPath");
  EXPECT_EQ(
      mappings["default"],
      Parse(
          R"({"type":"string","analyzer":"quixstandard","required":false,"stored":true,"_all":true})"));
  const Json::Value& props = mappings["properties"];
  const std::vector<std::string> have = props.getMemberNames();
  EXPECT_EQ(have.size(), 55u);
  // The fields the library and the engine read by name.
  for (const char* name : {"QUIXMDPath", "QUIXMDFSName", "QUIXMDParent", "QUIXMDExtension",
                           "QUIXMDFSSize", "QUIXMDFSContentChangeDate", "QUIXMDTextContent",
                           "QUIXMDSearchFileName", "QUIXMDSearchAncestor", "_QUIXMDUserTags"}) {
    EXPECT_TRUE(props.isMember(name)) << name;
  }
  for (const std::string& name : have) {
    EXPECT_FALSE(props[name].isMember("stored")) << name;
    EXPECT_EQ(props[name].isMember("required"), name == "QUIXMDPath") << name;
  }
  EXPECT_EQ(props["QUIXMDPath"], Parse(R"({"analyzer":"keyword","required":true,"_all":false})"));
  EXPECT_EQ(props["QUIXMDSearchFileName"],
            Parse(R"({"type":"text","analyzer":"white space","preprocess":["tolower","ngram"]})"));
  EXPECT_EQ(
      props["QUIXMDSearchAncestor"],
      Parse(
          R"({"type":"text","analyzer":"white space escaped","_all":false,"preprocess":["list_ancestor"]})"));
  EXPECT_EQ(props["QUIXMDKeywords"], Json::Value(Json::objectValue));
  EXPECT_EQ(props["QUIXMDDurationSecond"], Parse(R"({"type":"double"})"));
  EXPECT_EQ(props["QUIXMDIsEncrypted"], Parse(R"({"type":"bool","_all":false})"));
  EXPECT_EQ(props["QUIXMDExposureTimeString"], Parse(R"({"analyzer":"keyword"})"));

  EXPECT_EQ(GetFileIndexSettings(), Json::Value(Json::objectValue));
  EXPECT_EQ(
      GetFileIndexEventHandler(),
      Parse(R"({"lib_path":"/var/packages/Orvane/target/handler/fileindex_event_handler.so"})"));
  EXPECT_EQ(GetFileIndexID("photo"), "fileindex_photo");
  EXPECT_EQ(GetFileIndexID("My Share"), "fileindex_My Share");
}

TEST_F(ElasticControlTest, LifecycleCommandsHaveTheirExactShapes) {
  Engine engine(Sock(), [](const Json::Value&) { return Ok(); });
  ShareIndexCreate("photo");
  ShareIndexDelete("photo");
  ShareIndexPause("photo");
  ShareIndexResume("photo");
  ShareIndexRename("photo", "Photo New", "/new/db");
  ShareIndexMigrate("photo", "/vol2/db");
  const std::vector<Json::Value> sent = engine.requests();
  ASSERT_EQ(sent.size(), 6u);

  Json::Value create;
  create["command"] = "index_create";
  create["data"]["id"] = "fileindex_photo";
  create["data"]["path"] = volume_.path() + "/photo/@eaDir/@fileindex/db";
  create["data"]["settings"] = Json::Value(Json::objectValue);
  create["data"]["mappings"] = GetFileIndexMappings();
  create["data"]["event_handler"] = GetFileIndexEventHandler();
  EXPECT_EQ(sent[0], create);
  EXPECT_EQ(sent[1], Parse(R"({"command":"index_delete","data":{"id":"fileindex_photo"}})"));
  EXPECT_EQ(sent[2], Parse(R"({"command":"index_pause","data":{"id":"fileindex_photo"}})"));
  EXPECT_EQ(sent[3], Parse(R"({"command":"index_resume","data":{"id":"fileindex_photo"}})"));
  EXPECT_EQ(sent[4], Parse(R"({"command":"index_config_set","data":{"id":"fileindex_photo",
                               "data":{"id":"fileindex_Photo New","path":"/new/db"}}})"));
  EXPECT_EQ(sent[5], Parse(R"({"command":"index_config_set","data":{"id":"fileindex_photo",
                               "data":{"path":"/vol2/db"}}})"));

  // An unknown share fails before anything is sent.
  EXPECT_EQ(ErrorOf([] { ShareIndexCreate("nope"); }).code, kErrShareGet);
  EXPECT_EQ(engine.requests().size(), 6u);
}

TEST_F(ElasticControlTest, DocumentCommandsCarryTheExtractedDocument) {
  const std::string file = volume_.Write("photo/trip/\"odd\" name\\\n\xC3\xA9.JPG", "jpeg");
  bool exists = false;
  Engine engine(Sock(), [&](const Json::Value& req) {
    if (req["command"] == "document_get_by_query") {
      return Hits(exists ? Parse(R"([{"QUIXMDPath":"x"}])") : Json::Value(Json::arrayValue));
    }
    return Ok();
  });

  IndexUpsert("photo", file, false);
  IndexDel("photo", file);
  IndexDelDir("photo", "/v/s/a");
  EXPECT_EQ(ErrorOf([&] { IndexAttr("photo", file); }).what(),
            std::string("Orvane error, code=917"));
  exists = true;
  IndexAttr("photo", file);

  const std::vector<Json::Value> sent = engine.requests();
  ASSERT_EQ(sent.size(), 6u);
  EXPECT_EQ(sent[0]["command"], "document_upsert_by_id");
  EXPECT_EQ(sent[0]["data"]["id"], "fileindex_photo");
  EXPECT_EQ(sent[0]["data"]["doc_id"], file);
  const Json::Value& doc = sent[0]["data"]["data"];
  EXPECT_EQ(doc["QUIXMDPath"], file);
  EXPECT_EQ(doc["QUIXMDFSName"], "\"odd\" name\\\n\xC3\xA9.JPG");
  EXPECT_EQ(doc["QUIXMDSearchFileName"], doc["QUIXMDFSName"]);
  EXPECT_EQ(doc["QUIXMDParent"], volume_.path() + "/photo/trip");
  EXPECT_EQ(doc["QUIXMDSearchAncestor"], doc["QUIXMDParent"]);
  EXPECT_EQ(doc["QUIXMDExtension"], "jpg");
  EXPECT_EQ(doc["QUIXMDFSSize"].asInt(), 4);

  Json::Value del = Parse(R"({"command":"document_del_by_id","data":{"id":"fileindex_photo"}})");
  del["data"]["doc_id"] = file;
  EXPECT_EQ(sent[1], del);
  // The prefix ends in "/": /v/s/ab is not below /v/s/a.
  EXPECT_EQ(sent[2], Parse(R"({"command":"document_del_by_query","data":{"id":"fileindex_photo",
                               "query":{"qsl":{"prefix":{"QUIXMDPath":"/v/s/a/"}}}}})"));
  Json::Value exists_query = Parse(R"({"command":"document_get_by_query","data":{
      "id":"fileindex_photo","query":{"qsl":{"term":{"QUIXMDPath":""}}}}})");
  exists_query["data"]["query"]["qsl"]["term"]["QUIXMDPath"] = file;
  EXPECT_EQ(sent[3], exists_query);  // refused with 917 before any extraction
  EXPECT_EQ(sent[4], exists_query);
  EXPECT_EQ(sent[5]["command"], "document_set_by_id");
  EXPECT_EQ(sent[5]["data"]["doc_id"], file);
  EXPECT_EQ(sent[5]["data"]["data"]["QUIXMDSearchFileName"], doc["QUIXMDFSName"]);
}

TEST_F(ElasticControlTest, ExtractionIsAskedForMetadataOnlyOnUpsertRequest) {
  Engine engine(Sock(), [](const Json::Value&) { return Hits(Parse(R"([{"QUIXMDPath":"x"}])")); });
  std::vector<Json::Value> configs;
  bool fail = false;
  const ParseFileFn previous =
      SetParseFile([&](const std::string& path, const Json::Value& config, Json::Value& doc) {
        configs.push_back(config);
        if (fail) throw std::runtime_error("not an Error");
        doc["QUIXMDFSName"] = "n";
        doc["QUIXMDParent"] = "/p";
      });
  IndexUpsert("photo", "/p/n", false);
  IndexUpsert("photo", "/p/n", true);
  IndexAttr("photo", "/p/n");
  fail = true;
  EXPECT_STREQ(ErrorOf([] { IndexUpsert("photo", "/p/n", true); }).what(),
               "Orvane error, code=914, reason=[Parse failed, path=/p/n]");
  SetParseFile(previous);

  EXPECT_THAT(configs,
              ElementsAre(Parse(R"({"need_meta":false})"), Parse(R"({"need_meta":true})"),
                          Parse(R"({"need_meta":false})"), Parse(R"({"need_meta":true})")));
  const std::vector<Json::Value> sent = engine.requests();
  ASSERT_EQ(sent.size(), 4u);  // the failed upsert sent nothing
  EXPECT_EQ(sent[0], Parse(R"({"command":"document_upsert_by_id","data":{"id":"fileindex_photo",
      "doc_id":"/p/n","data":{"QUIXMDFSName":"n","QUIXMDParent":"/p",
      "QUIXMDSearchFileName":"n","QUIXMDSearchAncestor":"/p"}}})"));
  EXPECT_EQ(sent[1]["command"], "document_upsert_by_id");
  EXPECT_EQ(sent[3]["command"], "document_set_by_id");
}

TEST_F(ElasticControlTest, QueryRepliesWithoutADataArrayAre916) {
  const std::vector<Json::Value> replies = {Ok(), Hits(Parse(R"({"a":1})")), Hits("x")};
  for (const Json::Value& reply : replies) {
    Engine engine(Sock(), [&](const Json::Value&) { return reply; });
    log_.Clear();
    const Error e = ErrorOf([] { IsDocumentExists("photo", "/p"); });
    EXPECT_EQ(e.code, kErrNoQueryData);
    EXPECT_EQ(std::string(e.what()),
              "Orvane error, code=916, reason=[" + JsonToString(reply) + "]");
    EXPECT_TRUE(log_.Contains(
        "(IsDocumentExists) Failed [!res.isMember(\"data\") || !res[\"data\"].isArray()]"));
    std::vector<std::string> paths;
    EXPECT_EQ(ErrorOf([&] { IndexGetByPrefixPath("db", "/d", paths); }).code, kErrNoQueryData);
    EXPECT_EQ(ErrorOf([] { IndexRename("photo", "/n", "/o"); }).code, kErrNoQueryData);
  }
}

TEST_F(ElasticControlTest, PrefixListingKeepsEarlierPathsAndSkipsHitsWithoutOne) {
  Engine engine(Sock(), [](const Json::Value&) {
    return Hits(
        Parse(R"([{"QUIXMDPath":"/d/1"},{"other":1},{"QUIXMDPath":"/d/2"},{"QUIXMDPath":{}}])"));
  });
  std::vector<std::string> paths = {"kept"};
  IndexGetByPrefixPath("fileindex_raw db", "/d", paths);
  EXPECT_THAT(paths, ElementsAre("kept", "/d/1", "/d/2"));
  EXPECT_EQ(engine.requests()[0],
            Parse(R"({"command":"document_get_by_query","data":{"id":"fileindex_raw db",
                     "query":{"qsl":{"prefix":{"QUIXMDPath":"/d/"}},"load_field":["QUIXMDPath"]}}})"));
}

// An engine holding documents, enough to rename against: queries see committed paths only, set
// requests are staged until the next commit, as in the real engine.
class DocumentStore {
 public:
  void Add(const std::string& path, const std::string& parent, const std::string& name) {
    Json::Value doc;
    doc["QUIXMDPath"] = path;
    doc["QUIXMDParent"] = parent;
    doc["QUIXMDFSName"] = name;
    docs_[path] = doc;
  }

  Json::Value Answer(const Json::Value& req) {
    if (req.isMember("compound")) {
      for (const Json::Value& sub : req["compound"]) staged_.push_back(sub);
      return Ok();
    }
    const std::string command = req["command"].asString();
    if (command == "commit") {
      for (const Json::Value& sub : staged_) {
        Json::Value& doc = docs_[sub["data"]["doc_id"].asString()];
        for (const std::string& key : sub["data"]["data"].getMemberNames()) {
          doc[key] = sub["data"]["data"][key];
        }
      }
      staged_.clear();
      ++commits_;
      return Ok();
    }
    if (command != "document_get_by_query") return Ok();
    const Json::Value& qsl = req["data"]["query"]["qsl"];
    Json::Value hits(Json::arrayValue);
    const unsigned size = req["data"]["query"].get("size", 100000).asUInt();
    for (const auto& [id, doc] : docs_) {
      const std::string path = doc["QUIXMDPath"].asString();
      const bool match = qsl.isMember("term")
                             ? path == qsl["term"]["QUIXMDPath"].asString()
                             : path.rfind(qsl["prefix"]["QUIXMDPath"].asString(), 0) == 0;
      if (match && hits.size() < size) hits.append(doc);
    }
    return Hits(hits);
  }
  int commits() const { return commits_; }
  const std::map<std::string, Json::Value>& docs() const { return docs_; }

 private:
  std::map<std::string, Json::Value> docs_;
  std::vector<Json::Value> staged_;
  int commits_ = 0;
};

TEST_F(ElasticControlTest, RenameRepathsDescendantsInBatchesWithCommitsBetween) {
  DocumentStore store;
  store.Add("/v/s/a", "/v/s", "a");
  for (int i = 0; i < 25000; ++i) {
    const std::string parent = i % 2 ? "/v/s/a" : "/v/s/a/x";
    store.Add(parent + "/f" + std::to_string(i), parent, "f" + std::to_string(i));
  }
  store.Add("/v/s/ab", "/v/s", "ab");  // a sibling sharing the prefix's letters stays put
  Engine engine(Sock(), [&](const Json::Value& req) { return store.Answer(req); });

  IndexRename("s", "/v/s/bb.Dir", "/v/s/a");

  const std::vector<Json::Value> sent = engine.requests();
  std::vector<std::string> shape;
  for (const Json::Value& req : sent) {
    shape.push_back(req.isMember("compound") ? "compound " + std::to_string(req["compound"].size())
                                             : req["command"].asString());
  }
  EXPECT_THAT(shape,
              ElementsAre("document_get_by_query", "document_set_by_id", "document_get_by_query",
                          "compound 10000", "commit", "document_get_by_query", "compound 10000",
                          "commit", "document_get_by_query", "compound 5000"));
  EXPECT_EQ(sent[1], Parse(R"({"command":"document_set_by_id","data":{"id":"fileindex_s",
      "doc_id":"/v/s/a","data":{"QUIXMDPath":"/v/s/bb.Dir","QUIXMDParent":"/v/s",
      "QUIXMDFSName":"bb.Dir","QUIXMDSearchFileName":"bb.Dir","QUIXMDSearchAncestor":"/v/s",
      "QUIXMDDisplayName":"bb.Dir","QUIXMDKind":"dir","QUIXMDExtension":"dir"}}})"));
  // The one request object grows: earlier members stay and "load_field" gains three names a pass.
  const Json::Value& query = sent[8]["data"]["query"];
  EXPECT_EQ(query["qsl"], Parse(R"({"prefix":{"QUIXMDPath":"/v/s/a/"}})"));
  EXPECT_EQ(query["from"].asInt(), 0);
  EXPECT_EQ(query["size"].asUInt(), 10000u);
  EXPECT_EQ(query["load_field"].size(), 9u);
  EXPECT_EQ(sent[2]["data"]["query"]["load_field"],
            Parse(R"(["QUIXMDPath","QUIXMDFSName","QUIXMDParent"])"));
  EXPECT_EQ(sent[2]["data"]["doc_id"], "/v/s/a");
  EXPECT_EQ(sent[5]["data"]["data"].size(), 4u);  // the last hit's fields of the pass before

  const Json::Value& sub = sent[3]["compound"][0];
  EXPECT_EQ(sub["command"], "document_set_by_id");
  EXPECT_EQ(sub["data"]["id"], "fileindex_s");
  EXPECT_TRUE(sub["data"].isMember("query"));
  const std::string old_path = sub["data"]["doc_id"].asString();
  const Json::Value& fields = sub["data"]["data"];
  ASSERT_EQ(fields.size(), 4u);
  const std::string name = old_path.substr(old_path.rfind('/') + 1);
  const std::string new_parent =
      old_path.find("/a/x/") != std::string::npos ? "/v/s/bb.Dir/x" : "/v/s/bb.Dir";
  EXPECT_EQ(fields["QUIXMDParent"], new_parent);
  EXPECT_EQ(fields["QUIXMDPath"], new_parent + "/" + name);
  EXPECT_EQ(fields["QUIXMDSearchFileName"], name);
  EXPECT_EQ(fields["QUIXMDSearchAncestor"], new_parent);

  // Everything below moved, except what the last, uncommitted pass staged.
  EXPECT_EQ(store.commits(), 2);
  int moved = 0;
  for (const auto& [id, doc] : store.docs())
    moved += StringStartWith(doc["QUIXMDPath"].asString(), "/v/s/bb.Dir/");
  EXPECT_EQ(moved, 20000);
  EXPECT_EQ(store.docs().at("/v/s/ab")["QUIXMDPath"], "/v/s/ab");
}

TEST_F(ElasticControlTest, RenameOfExactlyOneBatchEndsWithAnEmptyPass) {
  DocumentStore store;
  store.Add("/v/s/a", "/v/s", "a");
  for (int i = 0; i < 10000; ++i)
    store.Add("/v/s/a/f" + std::to_string(i), "/v/s/a", "f" + std::to_string(i));
  Engine engine(Sock(), [&](const Json::Value& req) { return store.Answer(req); });
  IndexRename("s", "/v/s/b", "/v/s/a");
  EXPECT_EQ(engine.requests().size(), 6u);  // exists, set, query, compound, commit, empty query
  EXPECT_EQ(store.commits(), 1);
  EXPECT_EQ(store.docs().at("/v/s/a/f7")["QUIXMDPath"], "/v/s/b/f7");

  // A rename of what was never indexed is refused before anything changes.
  EXPECT_STREQ(ErrorOf([] { IndexRename("s", "/v/s/y", "/v/s/none"); }).what(),
               "Orvane error, code=917");
  EXPECT_EQ(engine.requests().size(), 7u);
  // A hit without its name is the JSON helper's error.
  store.Add("/v/s/q", "/v/s", "q");
  Json::Value bad;
  bad["QUIXMDPath"] = "/v/s/q/z";
  Engine broken(Sock(), [&](const Json::Value& req) {
    return req["data"]["query"]["qsl"].isMember("term") ? Hits(Parse("[{}]")) : Hits(ArrayOf(bad));
  });
  EXPECT_EQ(ErrorOf([] { IndexRename("s", "/v/s/y", "/v/s/q"); }).code, kErrInvalidParam);
}

TEST_F(ElasticControlTest, FailedCommitOnAFullShareRecordsItsStatus) {
  Engine engine(Sock(), [](const Json::Value&) { return Fail(5, "disk"); });
  const std::string status_path = dir_.Path("var/packages/Orvane/etc/fileindex.status");
  dir_.Write("var/packages/Orvane/etc/fileindex.status", R"({"share":{"photo":2}})");

  // Space enough: the commit's own error.
  Error e = ErrorOf([] { IndexCommit("photo"); });
  EXPECT_EQ(static_cast<int>(e.code), 5);
  EXPECT_EQ(Parse(test::ReadFile(status_path)), Parse(R"({"share":{"photo":2}})"));

  platform::ScopedFaults faults;
  platform::Fault full;
  full.result = 0;
  full.platform_err = platform::kQErrVolumeFull;
  faults.Arm("QUIXQuotaIsEnough", full);
  e = ErrorOf([] { IndexCommit("photo"); });
  EXPECT_EQ(e.code, kErrSpaceNotEnough);
  EXPECT_STREQ(e.what(), "Orvane error, code=1003, reason=[Share (photo) space not enough]");
  EXPECT_EQ(Parse(test::ReadFile(status_path)), Parse(R"({"share":{"photo":3}})"));
  EXPECT_TRUE(log_.Contains("(IndexCommit) Failed [!share.IsSpaceEnough()]"));
}

TEST_F(ElasticControlTest, TermSuggestionRequests) {
  Engine engine(Sock(), [](const Json::Value& req) {
    if (req["command"] == "list_term_sugg_db") {
      return Hits(Parse(R"({"unavail":["fileindex_a","fileindex_b"]})"));
    }
    return Ok();
  });
  std::vector<std::string> dbs = {"x"};
  ListUnAvailTermSuggDB(dbs);
  EXPECT_THAT(dbs, ElementsAre("x", "fileindex_a", "fileindex_b"));
  UpdateTermSuggestion("fileindex_a", {"/p/1", "/p/2"});
  UpdateTermSuggestion("fileindex_a", {});
  const std::vector<Json::Value> sent = engine.requests();
  EXPECT_EQ(sent[0], Parse(R"({"command":"list_term_sugg_db","data":{}})"));
  EXPECT_EQ(sent[1], Parse(R"({"compound":[
      {"command":"update_term_suggestion","data":{"doc_id_field":"/p/1","db_name":"fileindex_a"}},
      {"command":"update_term_suggestion","data":{"doc_id_field":"/p/2","db_name":"fileindex_a"}}]})"));
  EXPECT_EQ(sent[2], Parse(R"({"compound":[]})"));
}

class TermSuggestionDriverTest : public ElasticControlTest {
 protected:
  TermSuggestionDriverTest() {
    dir_.Write("var/packages/Orvane/etc/fileindex.folders", R"([
      {"path":"/c/docs","name":"c","document":true,"audio":true,"video":true,"photo":true},{"path":"/b","name":"b","document":true,"audio":true,"video":true,"photo":true},
      {"path":"/a/x","name":"a1","document":true,"audio":true,"video":true,"photo":true},{"path":"/a/y","name":"a2","document":true,"audio":true,"video":true,"photo":true}])");
    for (const char* share : {"a", "b", "c"}) EXPECT_TRUE(MakeParentDirs(Marker(share)));
  }
  std::string Marker(const std::string& share) const {
    return volume_.path() + "/" + share + "/@eaDir/@fileindex/db/term.sugg.running";
  }
};

TEST_F(TermSuggestionDriverTest, RebuildsUnavailableSharesInNameOrderUnderTheirMarker) {
  std::vector<std::string> markers_seen;
  Engine engine(Sock(), [&](const Json::Value& req) {
    if (req["command"] == "list_term_sugg_db") {
      return Hits(Parse(R"({"unavail":["fileindex_c","fileindex_zzz","fileindex_a"]})"));
    }
    if (req.isMember("compound")) {
      const std::string db = req["compound"][0]["data"]["db_name"].asString();
      markers_seen.push_back(db +
                             (access(Marker(db.substr(10)).c_str(), F_OK) == 0 ? " marked" : ""));
    }
    if (req["command"] == "document_get_by_query") {
      const std::string dir = req["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"].asString();
      Json::Value hit;
      hit["QUIXMDPath"] = dir + "doc";
      return Hits(ArrayOf(hit));
    }
    return Ok();
  });
  fileindex::UpdateTermSuggestion();

  std::vector<std::string> shape;
  for (const Json::Value& req : engine.requests()) {
    shape.push_back(req.isMember("compound")
                        ? "compound"
                        : req["command"].asString() + " " + req["data"]["id"].asString());
  }
  EXPECT_THAT(shape,
              ElementsAre("list_term_sugg_db ", "document_get_by_query fileindex_a", "compound",
                          "commit fileindex_a", "document_get_by_query fileindex_c", "compound",
                          "commit fileindex_c"));
  EXPECT_THAT(markers_seen, ElementsAre("fileindex_a marked", "fileindex_c marked"));
  const Json::Value update = engine.requests()[2]["compound"][0];
  EXPECT_EQ(update["data"]["doc_id_field"], volume_.path() + "/a/doc");
  EXPECT_EQ(access(Marker("a").c_str(), F_OK), -1);
  EXPECT_EQ(access(Marker("c").c_str(), F_OK), -1);
  EXPECT_EQ(log_.Count("Start building term sugg [fileindex_"), 2);
  EXPECT_TRUE(log_.Contains("Done building term sugg [fileindex_c]"));
}

TEST_F(TermSuggestionDriverTest, NothingUnavailableTouchesNothingAndAFailureLeavesTheMarker) {
  {
    Engine engine(Sock(), [](const Json::Value&) { return Hits(Parse(R"({"unavail":[]})")); });
    fileindex::UpdateTermSuggestion();
    EXPECT_EQ(engine.requests().size(), 1u);
  }
  EXPECT_EQ(access(Marker("a").c_str(), F_OK), -1);

  Engine engine(Sock(), [](const Json::Value& req) {
    if (req["command"] == "list_term_sugg_db")
      return Hits(Parse(R"({"unavail":["fileindex_a","fileindex_b"]})"));
    if (req.isMember("compound")) return Fail(42, "broken");
    return Hits(Json::Value(Json::arrayValue));
  });
  EXPECT_EQ(static_cast<int>(ErrorOf([] { fileindex::UpdateTermSuggestion(); }).code), 42);
  EXPECT_EQ(access(Marker("a").c_str(), F_OK), 0);
  EXPECT_EQ(access(Marker("b").c_str(), F_OK), -1);  // the remaining shares are not started

  // A marker that cannot be written is logged and the rebuild goes on.
  test::TempDir other;
  Engine ok(Sock(), [](const Json::Value& req) {
    if (req["command"] == "list_term_sugg_db")
      return Hits(Parse(R"({"unavail":["fileindex_photo"]})"));
    return Hits(Json::Value(Json::arrayValue));
  });
  dir_.Write("var/packages/Orvane/etc/fileindex.folders", R"([{"path":"/photo","name":"p")"
             R"(,"document":true,"audio":true,"video":true,"photo":true}])");
  log_.Clear();
  fileindex::UpdateTermSuggestion();
  EXPECT_TRUE(log_.Contains("(UpdateTermSuggestion) Failed [!ofs]"));
  EXPECT_TRUE(log_.Contains("Done building term sugg [fileindex_photo]"));
  EXPECT_EQ(ok.requests().size(), 4u);
}

}  // namespace
}  // namespace elastic
}  // namespace fileindex
}  // namespace orvane
