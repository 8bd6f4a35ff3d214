// Searches by a query tree on a small real index: each node kind, the trees refused, paging
// totals, and what an ordinary user is shown of real files.
#include "daemons/quixelasticd/query_tree.hpp"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/json_util.hpp"
#include "daemons/quixelasticd/engine.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "test/engine_client.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using tc::Cmd;
using tc::Parse;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

const char kId[] = "fileindex_share";

class QueryTreeTest : public ::testing::Test {
 protected:
  QueryTreeTest() {
    root_.privileged = true;
    EngineOptions options;
    options.registry_file = dir_.Path("state/indexes.json");
    options.running_marker = dir_.Path("state/running");
    engine_ = std::make_unique<Engine>(options);
    engine_->Start();
    engine_->WaitOpened();
    Json::Value create = tc::OnIndex("index_create", kId);
    create["data"]["path"] = dir_.Path("db");
    create["data"]["settings"] = Json::Value(Json::objectValue);
    create["data"]["mappings"] = tc::FileMappings();
    EXPECT_EQ(Send(create)["success"], true);
  }

  Json::Value Send(const Json::Value& request, const Caller* caller = nullptr) {
    return engine_->HandleValue(request, caller != nullptr ? *caller : root_);
  }
  void Add(Json::Value doc) {
    Json::Value data;
    data["id"] = kId;
    data["doc_id"] = doc["QUIXMDPath"];
    data["data"] = std::move(doc);
    ASSERT_EQ(Send(Cmd("document_upsert_by_id", data))["success"], true);
  }
  Json::Value Search(const std::string& data, const Caller* caller = nullptr) {
    return Send(Cmd("search", Parse(data)), caller);
  }
  // The names a search finds, sorted.
  std::vector<std::string> Names(const Json::Value& reply) {
    std::vector<std::string> names;
    for (const Json::Value& h : reply["data"]["hits"]) names.push_back(h["name"].asString());
    std::sort(names.begin(), names.end());
    return names;
  }

  orvane::test::TempDir dir_;
  orvane::test::LogCapture logs_;
  Caller root_;
  std::unique_ptr<Engine> engine_;
};

TEST_F(QueryTreeTest, EachNodeKindFindsItsDocuments) {
  Json::Value report = tc::FileDoc("/v/share/docs/Annual_Report.PDF", 5000, 200);
  report["QUIXMDTextContent"] = "the quarterly revenue grew in the north";
  report["QUIXMDAttributeChangeDate"] = 150;
  report["QUIXMDFSCreationDate"] = 100;
  report["QUIXMDTitle"] = "Annual figures";
  Json::Value tune = tc::FileDoc("/v/share/music/sub/tune.flac", 50, 50);
  tune["QUIXMDTextContent"] = "revenues of a song, in figures";
  tune["QUIXMDAlbum"] = "Greatest Hits";
  tune["QUIXMDAuthors"] = "The Band";
  tune["QUIXMDDurationSecond"] = 183.5;
  Json::Value beach = tc::FileDoc("/v/share/photos/beach.JPG", 700, 400);
  beach["QUIXMDPixelWidth"] = 4000;
  beach["QUIXMDPixelHeight"] = 3000;
  Json::Value photos = tc::FileDoc("/v/share/photos", 0, 5);
  photos["QUIXMDIsDir"] = true;
  for (Json::Value doc : {report, tune, photos, tc::FileDoc("/v/share/docs/report draft.txt", 100, 100),
                          tc::FileDoc("/v/share/music/100%_hits.mp3", 9000, 300),
                          beach,
                          tc::FileDoc("/v/share/misc/data.qqq", 10, 10)}) {
    Add(doc);
  }
  const std::vector<std::string> all = {"100%_hits.mp3", "Annual_Report.PDF", "beach.JPG",
                                        "data.qqq", "photos", "report draft.txt", "tune.flac"};
  struct Row {
    const char* tree;
    std::vector<std::string> names;
  };
  const std::vector<Row> rows = {
      // Names: '*' anywhere, whole-name otherwise, any case; LIKE's own wildcards are literal.
      {R"({"match": "name", "pattern": "*REPORT*"})", {"Annual_Report.PDF", "report draft.txt"}},
      {R"({"match": "name", "pattern": "Report Draft.TXT"})", {"report draft.txt"}},
      {R"({"match": "name", "pattern": "report"})", {}},
      {R"({"match": "name", "pattern": "*.mp3"})", {"100%_hits.mp3"}},
      {R"({"match": "name", "pattern": "1%*"})", {}},
      {R"({"match": "name", "pattern": "a*l_r*t.pdf"})", {"Annual_Report.PDF"}},
      {R"({"match": "name", "pattern": "*"})", all},
      // Contents: words, all required, any case; a '*' makes a prefix of the word.
      {R"({"match": "content", "pattern": "Quarterly NORTH"})", {"Annual_Report.PDF"}},
      {R"({"match": "content", "pattern": "revenue"})", {"Annual_Report.PDF"}},
      {R"({"match": "content", "pattern": "*revenue*"})", {"Annual_Report.PDF", "tune.flac"}},
      {R"({"match": "content", "pattern": "\"or\" NOT"})", {}},
      // Either: the whole name "beach" is no file's, but the word is in the catch-all text.
      {R"({"match": "any", "pattern": "beach"})", {"beach.JPG"}},
      {R"({"range": "size", "gte": 700, "lt": 9000})", {"Annual_Report.PDF", "beach.JPG"}},
      {R"({"range": "mtime", "gt": 300})", {"beach.JPG"}},
      {R"({"range": "ctime", "lte": 150.5})", {"Annual_Report.PDF"}},
      // A document without the value is outside the range and inside its negation.
      {R"({"not": {"range": "ctime", "gte": 0}})",
       {"100%_hits.mp3", "beach.JPG", "data.qqq", "photos", "report draft.txt", "tune.flac"}},
      {R"({"in": "ext", "values": ["PDF", "flac"]})", {"Annual_Report.PDF", "tune.flac"}},
      {R"({"in": "kind", "values": ["photo", "folder"]})", {"beach.JPG", "photos"}},
      {R"({"in": "kind", "values": ["other"]})", {"data.qqq"}},
      {R"({"under": "/v/share/music"})", {"100%_hits.mp3", "tune.flac"}},
      {R"({"under": "/v/share/photos/"})", {"beach.JPG", "photos"}},
      {R"({"under": "/v/share/mus"})", {}},
      {R"({"and": [{"match": "name", "pattern": "*report*"}, {"range": "size", "gte": 1000}]})",
       {"Annual_Report.PDF"}},
      // The first pattern every hit must match is joined, the others are looked up.
      {R"({"and": [{"match": "name", "pattern": "*rep*"}, {"match": "name", "pattern": "* d*"}]})",
       {"report draft.txt"}},
      {R"({"and": [{"match": "content", "pattern": "revenue*"}, {"match": "content",
           "pattern": "song"}]})", {"tune.flac"}},
      // A pattern within a small folder reads only the span of the folder's rows, which the
      // folder's own row (added before its files) widens.
      {R"({"and": [{"match": "name", "pattern": "*h*"}, {"under": "/v/share/photos"}]})",
       {"beach.JPG", "photos"}},
      {R"({"and": [{"match": "content", "pattern": "song"}, {"under": "/v/none"}]})", {}},
      {R"({"or": [{"in": "ext", "values": ["pdf"]}, {"under": "/v/share/music"}]})",
       {"100%_hits.mp3", "Annual_Report.PDF", "tune.flac"}},
      {R"({"not": {"or": [{"under": "/v/share/docs"}, {"under": "/v/share/photos"}]}})",
       {"100%_hits.mp3", "data.qqq", "tune.flac"}},
      {R"({"all": true})", all},
      // Members of the document: a text holds each word (the title, not the contents, here),
      // a number is compared, a document without the member matches neither.
      {R"({"match": "title", "pattern": "FIGURES"})", {"Annual_Report.PDF"}},
      {R"({"match": "album", "pattern": "*hits*"})", {"tune.flac"}},
      {R"({"match": "authors", "pattern": "*"})", {"tune.flac"}},
      {R"({"not": {"match": "album", "pattern": "greatest"}})",
       {"100%_hits.mp3", "Annual_Report.PDF", "beach.JPG", "data.qqq", "photos",
        "report draft.txt"}},
      {R"({"range": "duration", "gt": 180})", {"tune.flac"}},
      {R"({"and": [{"range": "pixel_height", "gte": 3000}, {"range": "pixel_width", "lt": 5000}]})",
       {"beach.JPG"}},
      // Whole paths, '*' anywhere, cases as they are.
      {R"({"match": "path", "pattern": "/v/share/music/*.flac"})", {"tune.flac"}},
      {R"({"match": "path", "pattern": "*/sub/*"})", {"tune.flac"}},
      {R"({"match": "path", "pattern": "/v/share/Music/*"})", {}},
  };
  for (const Row& row : rows) {
    // Confined to a folder that holds every document, a tree finds the same.
    for (const std::string& tree :
         {std::string(row.tree), R"({"and": [)" + std::string(row.tree) + R"(, {"under": "/v"}]})"}) {
      const Json::Value r = Search(R"({"size": 100, "query": )" + tree + "}");
      EXPECT_EQ(r["success"], true) << tree << JsonToString(r);
      EXPECT_EQ(Names(r), row.names) << tree;
      EXPECT_EQ(r["data"]["total"].asUInt(), row.names.size()) << tree;
    }
  }
  // The tree narrows the other members of the search.
  EXPECT_THAT(Names(Search(R"({"ext": "txt", "query": {"all": true}})")),
              ElementsAre("report draft.txt"));
  EXPECT_THAT(Names(Search(R"({"keyword": "revenue", "query": {"under": "/v/share/music"}})")),
              ElementsAre());
  // Both on the same full-text row as the name and keyword members.
  EXPECT_THAT(Names(Search(R"({"name": "rep", "query": {"match": "name", "pattern": "*.txt"}})")),
              ElementsAre("report draft.txt"));
  EXPECT_THAT(Names(Search(R"({"keyword": "revenue*", "query": {"match": "content",
                               "pattern": "north"}})")),
              ElementsAre("Annual_Report.PDF"));
}

TEST_F(QueryTreeTest, BadTreesAreRefusedNamingTheFault) {
  std::string deep = R"({"all": true})";
  for (int i = 0; i < kMaxQueryDepth; ++i) deep = R"({"not": )" + deep + "}";
  std::string wide = R"({"or": [{"all": true})";
  for (int i = 1; i < kMaxQueryNodes; ++i) wide += R"(, {"all": true})";
  wide += "]}";
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"5", "must be an object"},
      {"{}", "no known operator"},
      {R"({"near": 1})", "no known operator"},
      {R"({"and": [], "or": []})", "two operators"},
      {R"({"and": []})", "non-empty array"},
      {R"({"and": [7]})", "must be an object"},
      {R"({"match": "subtitle", "pattern": "x"})", "unknown \"match\" field"},
      {R"({"match": "name"})", "\"pattern\""},
      {R"({"match": "name", "pattern": ""})", "\"pattern\""},
      {R"({"match": "name", "pattern": "x", "fuzzy": true})", "unknown member \"fuzzy\""},
      {R"({"range": "atime", "gte": 1})", "unknown \"range\" field"},
      {R"({"range": "size"})", "needs"},
      {R"({"range": "size", "gte": "1"})", "must be a number"},
      {R"({"in": "kind", "values": ["spreadsheet"]})", "unknown kind"},
      {R"({"in": "ext", "values": "pdf"})", "non-empty array"},
      {R"({"in": "ext", "values": [1]})", "must hold strings"},
      {R"({"under": "docs"})", "absolute"},
      {R"({"all": false})", "must be true"},
      {deep, "deeper than 32"},
      {wide, "more than 256"},
  };
  for (const auto& [tree, fault] : cases) {
    const Json::Value r = Search(R"({"query": )" + tree + "}");
    EXPECT_EQ(r["error"]["code"], kCodeInvalidParam) << tree;
    EXPECT_THAT(r["error"]["msg"].asString(), HasSubstr(fault)) << tree;
  }
  // The limits themselves are allowed.
  deep = deep.substr(std::string(R"({"not": )").size());
  deep.pop_back();
  EXPECT_EQ(Search(R"({"query": )" + deep + "}")["success"], true);
}

// Pages of a tree search add up to its total, for root and for a user who may open only some
// of the files: those it may not are neither shown nor counted.
TEST_F(QueryTreeTest, PagesAndTotalsHoldWhatTheCallerMaySee) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to search as nobody";
  ASSERT_EQ(::chmod(dir_.path().c_str(), 0755), 0);
  for (const char* name : {"a.txt", "b.txt", "c.txt", "secret.txt", "z.bin"}) {
    const std::string path = dir_.Write(std::string("files/") + name, "x");
    ASSERT_EQ(::chmod(path.c_str(), std::string(name) == "secret.txt" ? 0600 : 0644), 0);
    Add(tc::FileDoc(path, 1, 1));
  }
  const struct passwd* pw = ::getpwnam("nobody");
  ASSERT_NE(pw, nullptr);
  Caller nobody;
  nobody.uid = pw->pw_uid;
  nobody.gid = pw->pw_gid;
  const std::string query = R"({"match": "name", "pattern": "*.txt"})";
  for (const auto& [caller, expected] :
       {std::pair<const Caller*, std::vector<std::string>>{
            &root_, {"a.txt", "b.txt", "c.txt", "secret.txt"}},
        {&nobody, {"a.txt", "b.txt", "c.txt"}}}) {
    std::vector<std::string> seen;
    for (int from = 0; from < 6; from += 2) {
      const Json::Value r = Search(R"({"sort": "name", "size": 2, "from": )" +
                                       std::to_string(from) + R"(, "query": )" + query + "}",
                                   caller);
      ASSERT_EQ(r["success"], true) << JsonToString(r);
      EXPECT_EQ(r["data"]["total"].asUInt(), expected.size());
      for (const Json::Value& h : r["data"]["hits"]) seen.push_back(h["name"].asString());
    }
    EXPECT_EQ(seen, expected) << caller->uid;
  }
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
