#include "fileindex/elastic_control.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <stdexcept>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "platform/platform_error.hpp"
#include "test/fake_daemon.hpp"
#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace elastic {
namespace {

using test::FakeDaemon;
using ::testing::ElementsAre;
using ::testing::ThrowsMessage;

Json::Value Parse(const std::string& text) { return FakeDaemon::Parse(text); }

Json::Value Ok() { return Parse(R"({"success":true})"); }
Json::Value Hits(const Json::Value& hits) {
  Json::Value res = Ok();
  res["data"] = hits;
  return res;
}
Json::Value Hits(const char* hits) { return Hits(Parse(hits)); }
Json::Value Fail(int code) {
  Json::Value res = Parse(R"({"success":false,"error":{"msg":"broken"}})");
  res["error"]["code"] = code;
  return res;
}

using test::ThrowsCode;

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
  // Each request as its command and index id, or "compound <size>".
  std::vector<std::string> shape() const {
    std::vector<std::string> out;
    for (const Json::Value& req : requests()) {
      out.push_back(req.isMember("compound")
                        ? "compound " + std::to_string(req["compound"].size())
                        : req["command"].asString() + " " + req["data"]["id"].asString());
    }
    return out;
  }

 private:
  FakeDaemon daemon_;
};

class ElasticControlTest : public ::testing::Test {
 protected:
  ElasticControlTest() {
    std::string shares;
    for (const char* share : {"photo", "a", "b", "c"}) {
      shares += std::string(shares.empty() ? "" : ",") + R"({"name": ")" + share +
                R"(", "path": ")" + volume_.path() + "/" + share + R"("})";
    }
    test::WritePlatformConfig(dir_.path(), R"({"shares": [)" + shares + "]}");
  }
  std::string Sock() const { return dir_.Path("var/run/quixelasticd.sock"); }

  test::TempDir dir_;
  test::TempDir volume_;
  test::ScopedRoot root_{dir_.path()};
  test::FakeEnv env_;
  test::LogCapture log_;
};

// The other lifecycle commands are checked by their effect in the engine's library test.
TEST_F(ElasticControlTest, CreateCarriesSchemaAndHandlerAndRenameKeysByTheOldId) {
  Engine engine(Sock(), [](const Json::Value&) { return Ok(); });
  ShareIndexCreate("photo");
  ShareIndexRename("photo", "Photo New", "/new/db");
  // An unknown share fails before anything is sent.
  EXPECT_THAT([] { ShareIndexCreate("nope"); }, ThrowsCode(kErrShareGet));
  Json::Value create = Parse(R"({"command":"index_create","data":{"id":"fileindex_photo",
                                 "settings":{}}})");
  create["data"]["path"] = volume_.path() + "/photo/@eaDir/@fileindex/db";
  create["data"]["mappings"] = GetFileIndexMappings();
  create["data"]["event_handler"]["lib_path"] =
      "/var/packages/Orvane/target/handler/fileindex_event_handler.so";
  EXPECT_THAT(engine.requests(),
              ElementsAre(create, Parse(R"({"command":"index_config_set","data":{"id":"fileindex_photo",
                  "data":{"id":"fileindex_Photo New","path":"/new/db"}}})")));
}

TEST_F(ElasticControlTest, DocumentCommandsCarryTheExtractedDocument) {
  const std::string file = volume_.Write("photo/trip/\"odd\" name\\\n\xC3\xA9.JPG", "jpeg");
  bool exists = false;
  Engine engine(Sock(), [&](const Json::Value& req) {
    return req["command"] == "document_get_by_query" ? Hits(exists ? "[{}]" : "[]") : Ok();
  });
  IndexUpsert("photo", file, false);
  EXPECT_THAT([&] { IndexAttr("photo", file); }, ThrowsMessage<Error>("Orvane error, code=917"));
  exists = true;
  IndexAttr("photo", file);

  // The refused attribute update sent only its question, before any extraction.
  EXPECT_THAT(engine.shape(),
              ElementsAre("document_upsert_by_id fileindex_photo",
                          "document_get_by_query fileindex_photo",
                          "document_get_by_query fileindex_photo",
                          "document_set_by_id fileindex_photo"));
  const std::vector<Json::Value> sent = engine.requests();
  EXPECT_EQ(sent[0]["data"]["doc_id"], file);
  const Json::Value& doc = sent[0]["data"]["data"];
  EXPECT_EQ(doc["QUIXMDFSName"], "\"odd\" name\\\n\xC3\xA9.JPG");
  EXPECT_EQ(doc["QUIXMDSearchFileName"], doc["QUIXMDFSName"]);
  EXPECT_EQ(doc["QUIXMDParent"], volume_.path() + "/photo/trip");
  EXPECT_EQ(doc["QUIXMDSearchAncestor"], doc["QUIXMDParent"]);
  EXPECT_EQ(sent[3]["data"]["data"]["QUIXMDSearchFileName"], doc["QUIXMDFSName"]);

  // Extraction is asked for metadata only on an upsert that wants it; its failure is 914 and
  // sends nothing.
  std::vector<Json::Value> configs;
  const ParseFileFn previous =
      SetParseFile([&](const std::string&, const Json::Value& config, Json::Value&) {
        configs.push_back(config);
        if (configs.size() == 3) throw std::runtime_error("not an Error");
      });
  IndexUpsert("photo", "/p/n", true);
  IndexAttr("photo", "/p/n");
  EXPECT_THAT([] { IndexUpsert("photo", "/p/n", true); },
              ThrowsMessage<Error>("Orvane error, code=914, reason=[Parse failed, path=/p/n]"));
  SetParseFile(previous);
  EXPECT_THAT(configs, ElementsAre(Parse(R"({"need_meta":true})"), Parse(R"({"need_meta":false})"),
                                   Parse(R"({"need_meta":true})")));
  EXPECT_EQ(engine.requests().size(), 7u);
}

TEST_F(ElasticControlTest, QueryRepliesWithoutADataArrayAre916AndBadHitsAreSkipped) {
  for (const Json::Value& reply : {Ok(), Hits(R"({"a":1})"), Hits(Json::Value("x"))}) {
    Engine engine(Sock(), [&](const Json::Value&) { return reply; });
    EXPECT_THAT(
        [] { IsDocumentExists("photo", "/p"); },
        ThrowsMessage<Error>("Orvane error, code=916, reason=[" + JsonToString(reply) + "]"));
    std::vector<std::string> paths;
    EXPECT_THAT([&] { IndexGetByPrefixPath("db", "/d", paths); }, ThrowsCode(kErrNoQueryData));
    EXPECT_THAT([] { IndexRename("photo", "/n", "/o"); }, ThrowsCode(kErrNoQueryData));
  }
  // Hits without a usable path are skipped; earlier entries stay.
  Engine engine(Sock(), [](const Json::Value&) {
    return Hits(R"([{"QUIXMDPath":"/d/1"},{"other":1},{"QUIXMDPath":"/d/2"},{"QUIXMDPath":{}}])");
  });
  std::vector<std::string> paths = {"kept"};
  IndexGetByPrefixPath("fileindex_raw db", "/d", paths);
  EXPECT_THAT(paths, ElementsAre("kept", "/d/1", "/d/2"));
}

// An engine whose prefix queries return, pass by pass, the given numbers of documents below
// /v/s/a/x; the document itself always exists.
Engine::Answer RenamePasses(std::vector<int> passes) {
  auto next = std::make_shared<size_t>(0);
  return [passes, next](const Json::Value& req) {
    if (req.isMember("compound") || req["command"] != "document_get_by_query") return Ok();
    if (req["data"]["query"]["qsl"].isMember("term")) return Hits("[{}]");
    Json::Value hits(Json::arrayValue);
    for (int i = 0; *next < passes.size() && i < passes[*next]; ++i) {
      Json::Value& hit = hits.append(Json::Value());
      hit["QUIXMDPath"] = "/v/s/a/x/f" + std::to_string(i);
      hit["QUIXMDParent"] = "/v/s/a/x";
      hit["QUIXMDFSName"] = "f" + std::to_string(i);
    }
    ++*next;
    return Hits(hits);
  };
}

TEST_F(ElasticControlTest, RenameRepathsDescendantsInBatchesWithCommitsBetween) {
  Engine engine(Sock(), RenamePasses({10000, 5000}));
  IndexRename("s", "/v/s/bb.Dir", "/v/s/a");
  EXPECT_THAT(engine.shape(),
              ElementsAre("document_get_by_query fileindex_s", "document_set_by_id fileindex_s",
                          "document_get_by_query fileindex_s", "compound 10000",
                          "commit fileindex_s", "document_get_by_query fileindex_s",
                          "compound 5000"));
  const std::vector<Json::Value> sent = engine.requests();
  EXPECT_EQ(sent[1], Parse(R"({"command":"document_set_by_id","data":{"id":"fileindex_s",
      "doc_id":"/v/s/a","data":{"QUIXMDPath":"/v/s/bb.Dir","QUIXMDParent":"/v/s",
      "QUIXMDFSName":"bb.Dir","QUIXMDSearchFileName":"bb.Dir","QUIXMDSearchAncestor":"/v/s",
      "QUIXMDDisplayName":"bb.Dir","QUIXMDKind":"dir","QUIXMDExtension":"dir"}}})"));
  const Json::Value& query = sent[5]["data"]["query"];
  EXPECT_EQ(query["qsl"], Parse(R"({"prefix":{"QUIXMDPath":"/v/s/a/"}})"));
  EXPECT_EQ(query["from"].asInt(), 0);  // re-pathed documents no longer match once committed
  const Json::Value& sub = sent[3]["compound"][7];
  EXPECT_EQ(sub["command"].asString() + " " + sub["data"]["id"].asString() + " " +
                sub["data"]["doc_id"].asString(),
            "document_set_by_id fileindex_s /v/s/a/x/f7");
  EXPECT_EQ(sub["data"]["data"], Parse(R"({"QUIXMDParent":"/v/s/bb.Dir/x",
      "QUIXMDPath":"/v/s/bb.Dir/x/f7","QUIXMDSearchFileName":"f7",
      "QUIXMDSearchAncestor":"/v/s/bb.Dir/x"})"));
}

// A rename of what was never indexed is refused before anything changes.
TEST_F(ElasticControlTest, RenameRefusesWhatItCannotMove) {
  Engine engine(Sock(), [](const Json::Value& req) {
    if (req["data"]["query"]["qsl"].isMember("term")) {
      return Hits(req["data"]["query"]["qsl"]["term"]["QUIXMDPath"] == "/v/s/none" ? "[]" : "[{}]");
    }
    return Hits(R"([{"QUIXMDPath":"/v/s/q/z"}])");
  });
  EXPECT_THAT([] { IndexRename("s", "/v/s/y", "/v/s/none"); },
              ThrowsMessage<Error>("Orvane error, code=917"));
  EXPECT_EQ(engine.requests().size(), 1u);
  // A hit without its name is the JSON helper's error.
  EXPECT_THAT([] { IndexRename("s", "/v/s/y", "/v/s/q"); }, ThrowsCode(kErrInvalidParam));
}

TEST_F(ElasticControlTest, FailedCommitOnAFullShareRecordsItsStatus) {
  Engine engine(Sock(), [](const Json::Value&) { return Fail(5); });
  const std::string status =
      dir_.Write("var/packages/Orvane/etc/fileindex.status", R"({"share":{"photo":2}})");
  // Space enough: the commit's own error.
  EXPECT_THAT([] { IndexCommit("photo"); }, ThrowsCode(5));
  EXPECT_EQ(Parse(test::ReadFile(status)), Parse(R"({"share":{"photo":2}})"));

  platform::ScopedFaults faults;
  faults.Arm("QUIXQuotaIsEnough", platform::Fault{0, 0, platform::kQErrVolumeFull});
  EXPECT_THAT(
      [] { IndexCommit("photo"); },
      ThrowsMessage<Error>("Orvane error, code=1003, reason=[Share (photo) space not enough]"));
  EXPECT_EQ(Parse(test::ReadFile(status)), Parse(R"({"share":{"photo":3}})"));
}

class TermSuggestionDriverTest : public ElasticControlTest {
 protected:
  TermSuggestionDriverTest() {
    Folders({"/c/docs", "/b", "/a/x", "/a/y"});
    for (const char* share : {"a", "b", "c"}) EXPECT_TRUE(MakeParentDirs(Marker(share)));
  }
  void Folders(const std::vector<std::string>& paths) {
    std::string text;
    for (const std::string& path : paths) {
      text += std::string(text.empty() ? "[" : ",") + R"({"path":")" + path + R"(","name":")" +
              path + R"(","document":true,"audio":true,"video":true,"photo":true})";
    }
    dir_.Write("var/packages/Orvane/etc/fileindex.folders", text + "]");
  }
  std::string Marker(const std::string& share) const {
    return volume_.path() + "/" + share + "/@eaDir/@fileindex/db/term.sugg.running";
  }
};

TEST_F(TermSuggestionDriverTest, RebuildsUnavailableSharesInNameOrderUnderTheirMarker) {
  std::vector<std::string> markers_seen;
  Engine engine(Sock(), [&](const Json::Value& req) {
    if (req["command"] == "list_term_sugg_db") {
      return Hits(R"({"unavail":["fileindex_c","fileindex_zzz","fileindex_a"]})");
    }
    if (req.isMember("compound")) {
      const std::string db = req["compound"][0]["data"]["db_name"].asString();
      markers_seen.push_back(db +
                             (access(Marker(db.substr(10)).c_str(), F_OK) == 0 ? " marked" : ""));
    }
    if (req["command"] != "document_get_by_query") return Ok();
    Json::Value hits = Parse(R"([{}])");
    hits[0]["QUIXMDPath"] = req["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"].asString() + "doc";
    return Hits(hits);
  });
  fileindex::UpdateTermSuggestion();

  EXPECT_THAT(engine.shape(),
              ElementsAre("list_term_sugg_db ", "document_get_by_query fileindex_a", "compound 1",
                          "commit fileindex_a", "document_get_by_query fileindex_c", "compound 1",
                          "commit fileindex_c"));
  EXPECT_THAT(markers_seen, ElementsAre("fileindex_a marked", "fileindex_c marked"));
  EXPECT_EQ(engine.requests()[2]["compound"][0]["data"]["doc_id_field"],
            volume_.path() + "/a/doc");
  EXPECT_EQ(access(Marker("a").c_str(), F_OK), -1);
  EXPECT_EQ(access(Marker("c").c_str(), F_OK), -1);
  EXPECT_TRUE(log_.Contains("Start building term sugg [fileindex_c]"));
}

TEST_F(TermSuggestionDriverTest, AFailureLeavesTheMarkerAndAnUnwritableMarkerIsOnlyLogged) {
  {
    Engine engine(Sock(), [](const Json::Value& req) {
      if (req["command"] == "list_term_sugg_db")
        return Hits(R"({"unavail":["fileindex_a","fileindex_b"]})");
      return req.isMember("compound") ? Fail(42) : Hits("[]");
    });
    EXPECT_THAT([] { fileindex::UpdateTermSuggestion(); }, ThrowsCode(42));
    EXPECT_EQ(access(Marker("a").c_str(), F_OK), 0);
    EXPECT_EQ(access(Marker("b").c_str(), F_OK), -1);  // the remaining shares are not started
  }
  // The share "photo" has no database folder to hold its marker.
  Engine engine(Sock(), [](const Json::Value& req) {
    if (req["command"] == "list_term_sugg_db") return Hits(R"({"unavail":["fileindex_photo"]})");
    return Hits("[]");
  });
  Folders({"/photo"});
  fileindex::UpdateTermSuggestion();
  EXPECT_TRUE(log_.Contains("(UpdateTermSuggestion) Failed [!db_dir.valid() ||"));
  EXPECT_TRUE(log_.Contains("Done building term sugg [fileindex_photo]"));
  EXPECT_EQ(engine.requests().size(), 4u);
}

}  // namespace
}  // namespace elastic
}  // namespace fileindex
}  // namespace orvane
