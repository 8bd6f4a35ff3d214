#include "daemons/quixelasticd/pg_store.hpp"

#include <signal.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "common/json_util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "test/engine_client.hpp"
#include "test/pg_server.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using tc::Parse;

// A file document of the library's form; `title` adds words to its catch-all text.
Json::Value FileDoc(const std::string& path, int64_t size = 10, const std::string& title = "") {
  Json::Value d = tc::FileDoc(path, size, 1700000000 + size);
  d["QUIXMDIsDir"] = false;
  if (!title.empty()) d["QUIXMDTitle"] = title;
  return d;
}

std::vector<std::string> Paths(const SearchPage& page) {
  std::vector<std::string> out;
  for (const Json::Value& h : page.hits) out.push_back(h["path"].asString());
  return out;
}

class PgStoreTest : public ::testing::Test {
 protected:
  PgStoreTest() : pool_(std::make_shared<PgPool>(server_.conninfo(), 4)) {}

  std::shared_ptr<PgStore> Make(const std::string& server = "s1", const std::string& id = "docs") {
    return PgStore::Create(pool_, server, id, tc::FileMappings(), Json::Value(Json::objectValue),
                           Json::Value(Json::objectValue));
  }

  void Put(PgStore& s, const std::vector<Json::Value>& docs) {
    PgWriteTxn txn(s);
    for (const Json::Value& d : docs) s.Upsert(d["QUIXMDPath"].asString(), d);
    txn.Commit();
  }

  SearchPage Find(PgStore& s, SearchParams p, const VisibleFn& visible = nullptr) {
    return s.Search(p, visible);
  }

  test::PgServer server_;
  std::shared_ptr<PgPool> pool_;
};

TEST_F(PgStoreTest, IndexesAreKeptPerServerAndSurviveReopening) {
  auto a = Make("s1", "docs");
  auto b = Make("s2", "docs");  // the same id of another server is another index
  EXPECT_THROW(Make("s1", "docs"), EngineError);
  Put(*a, {FileDoc("/v/a.txt")});
  EXPECT_EQ(a->DocCount(), 1);
  EXPECT_EQ(b->DocCount(), 0);

  a = PgStore::Open(pool_, "s1", "docs");
  EXPECT_EQ(a->DocCount(), 1);
  EXPECT_EQ(a->schema().property_id(), "QUIXMDPath");
  EXPECT_EQ(a->Meta("term_sugg"), "ready");

  // One search over both servers: each hit names its server; a caller with a permission
  // filter only gets this server's files, which the filter can check.
  Put(*b, {FileDoc("/w/a.txt"), FileDoc("/w/b.txt")});
  SearchParams p;
  p.name = "a.txt";
  p.sort = SearchParams::Sort::kName;
  SearchPage all = b->SearchEverywhere(p, nullptr);
  ASSERT_EQ(all.hits.size(), 2u);
  EXPECT_EQ(all.hits[0]["server"], "s1");
  EXPECT_EQ(all.hits[0]["path"], "/v/a.txt");
  EXPECT_EQ(all.hits[1]["server"], "s2");
  EXPECT_EQ(Paths(b->SearchEverywhere(p, [](const std::string&) { return true; })),
            std::vector<std::string>{"/w/a.txt"});
  EXPECT_EQ(Paths(b->Search(p, nullptr)), std::vector<std::string>{"/w/a.txt"});

  a->Rename("docs2");
  EXPECT_EQ(PgStore::Open(pool_, "s1", "docs2")->DocCount(), 1);
  EXPECT_THROW(Make("s1", "docs2"), EngineError);
  b->Rename("docs2");  // a name taken on another server only
  b = Make("s2", "docs");
  EXPECT_THROW(b->Rename("docs2"), EngineError);
}

TEST_F(PgStoreTest, LifecycleErrors) {
  try {
    PgStore::Open(pool_, "s1", "nope");
    FAIL();
  } catch (const EngineError& e) {
    EXPECT_EQ(e.code, kCodeIndexNotFound);
  }
  auto a = Make();
  Put(*a, {FileDoc("/v/a.txt")});
  EXPECT_TRUE(PgStore::Exists(*pool_, "s1", "docs"));
  EXPECT_TRUE(PgStore::Drop(*pool_, "s1", "docs"));
  EXPECT_FALSE(PgStore::Drop(*pool_, "s1", "docs"));
  EXPECT_FALSE(PgStore::Exists(*pool_, "s1", "docs"));
  // Made again, it starts empty.
  EXPECT_EQ(Make()->DocCount(), 0);
  EXPECT_THROW(PgStore::Create(pool_, "s1", "bad", Parse(R"({"property_id": 3})"), Json::Value(),
                               Json::Value()),
               EngineError);
}

TEST_F(PgStoreTest, DocumentCommands) {
  auto s = Make();
  const std::string raw = std::string("/v/d/bad\xff\xfe name.txt");
  {
    PgWriteTxn txn(*s);
    // The identifying field is filled from the id when missing.
    Json::Value no_id = FileDoc("/v/d/a.txt", 5);
    no_id.removeMember("QUIXMDPath");
    s->Upsert("/v/d/a.txt", no_id);
    s->Upsert(raw, FileDoc(raw, 6));
    s->Upsert("", FileDoc("/v/d/sub/b.txt", 7));
    s->Upsert("", FileDoc("/v/d.txt", 8));
    s->Upsert("", FileDoc("/v/e/c.txt", 9));
    // Writes of the open transaction are read back through the same connection.
    EXPECT_EQ(s->DocCount(), 5);
    txn.Commit();
  }
  auto get = [&](const std::string& qsl, int64_t from = 0, int64_t size = 100) {
    Json::Value hits = s->GetByQuery(DocQuery::Parse(Parse(qsl)), {"QUIXMDPath"}, from, size);
    std::vector<std::string> out;
    for (const Json::Value& h : hits) out.push_back(h["QUIXMDPath"].asString());
    return out;
  };
  EXPECT_EQ(get(R"({"qsl": {"term": {"QUIXMDPath": "/v/d/a.txt"}}})"),
            std::vector<std::string>{"/v/d/a.txt"});
  EXPECT_EQ(get(R"({"qsl": {"prefix": {"QUIXMDPath": "/v/d/"}}})"),
            (std::vector<std::string>{"/v/d/a.txt", raw, "/v/d/sub/b.txt"}));
  EXPECT_EQ(get(R"({"qsl": {"match_all": {}}})", 1, 2),
            (std::vector<std::string>{"/v/d/a.txt", raw}));
  // The ancestor field stands for every folder above the document.
  EXPECT_EQ(get(R"({"qsl": {"term": {"QUIXMDSearchAncestor": "/v/d"}}})").size(), 3u);
  // A field without a column is read from the documents.
  EXPECT_EQ(get(R"({"qsl": {"term": {"QUIXMDFSSize": 9}}})"), std::vector<std::string>());
  EXPECT_EQ(get(R"({"qsl": {"prefix": {"QUIXMDFSName": "c."}}})"),
            std::vector<std::string>{"/v/e/c.txt"});
  const Json::Value whole = s->GetByQuery(
      DocQuery::Parse(Parse(R"({"qsl": {"term": {"QUIXMDPath": "/v/d/a.txt"}}})")), {}, 0, 1);
  EXPECT_EQ(whole[0], FileDoc("/v/d/a.txt", 5)) << "the document comes back member for member";
  // Members a column could stand for but whose values differ from it stay as they were.
  Json::Value odd = FileDoc("/v/e/Odd.TXT", 3);
  odd["QUIXMDFSName"] = "other name";
  odd["QUIXMDDisplayName"] = "Odd.TXT";
  odd["QUIXMDExtension"] = "TXT";
  odd["QUIXMDKind"] = "txt";
  odd["QUIXMDParent"] = "/elsewhere";
  odd["QUIXMDIsDir"] = 0;
  odd["QUIXMDAttributeChangeDate"] = 1.5;
  odd["QUIXMDFSCreationDate"] = 7;
  odd["QUIXMDOwnerUserID"] = "1026";
  odd["QUIXMDOwnerGroupID"] = 100;
  Put(*s, {odd});
  EXPECT_EQ(s->GetByQuery(DocQuery::Parse(Parse(R"({"qsl": {"term": {"QUIXMDPath":
            "/v/e/Odd.TXT"}}})")),
                          {}, 0, 1)[0],
            odd);
  EXPECT_TRUE(s->Delete("/v/e/Odd.TXT"));

  // The folder and its subtree, in path order, paged; "d.txt" only begins like the folder.
  const Json::Value page1 = s->List("/v/d", "", {"QUIXMDTitle", "QUIXMDIsDir"}, 2);
  ASSERT_EQ(page1.size(), 2u);
  EXPECT_EQ(page1[0], Parse(R"(["/v/d/a.txt", 5, 1700000005, false, null, 0])"));
  const Json::Value page2 = s->List("/v/d", page1[1][0].asString(), {}, 10);
  ASSERT_EQ(page2.size(), 1u);
  EXPECT_EQ(page2[0][0], "/v/d/sub/b.txt");

  {
    PgWriteTxn txn(*s);
    // Re-keying onto an existing document replaces it; fields set to null go.
    Json::Value change = FileDoc("/v/e/c.txt", 5);
    change["QUIXMDTitle"] = Json::Value();
    s->SetFields("/v/d/a.txt", change);
    EXPECT_THROW(s->SetFields("/v/nope", change), EngineError);
    EXPECT_TRUE(s->Delete(raw));
    EXPECT_FALSE(s->Delete(raw));
    EXPECT_EQ(s->DeleteByQuery(DocQuery::Parse(Parse(R"({"qsl": {"prefix": {"QUIXMDPath":
              "/v/d/"}}})"))),
              1);
    txn.Commit();
  }
  EXPECT_EQ(get(R"({"qsl": {"match_all": {}}})"),
            (std::vector<std::string>{"/v/d.txt", "/v/e/c.txt"}));
  EXPECT_EQ(s->GetByQuery(DocQuery::Parse(Parse(R"({"qsl": {"match_all": {}}})")), {}, 1,
                          1)[0]["QUIXMDFSSize"],
            5);

  // A transaction not committed leaves nothing behind.
  {
    PgWriteTxn txn(*s);
    s->Upsert("", FileDoc("/v/lost.txt"));
  }
  EXPECT_EQ(s->DocCount(), 2);
}

TEST_F(PgStoreTest, BulkUpsertSkipsRefusedAndKeepsTheLastOfAPath) {
  auto s = Make();
  std::vector<Json::Value> docs;
  for (int i = 0; i < 2500; ++i) docs.push_back(FileDoc("/v/bulk/f" + std::to_string(i), i));
  docs.push_back(FileDoc("/v/bulk/f7", 99999));
  Json::Value bad = FileDoc("/v/bulk/bad");
  bad["QUIXMDFSSize"] = "big";
  docs.insert(docs.begin() + 3, bad);
  std::vector<std::pair<size_t, std::string>> refused;
  {
    PgWriteTxn txn(*s);
    EXPECT_EQ(s->UpsertMany(docs, &refused), 2501u);
    txn.Commit();
  }
  ASSERT_EQ(refused.size(), 1u);
  EXPECT_EQ(refused[0].first, 3u);
  EXPECT_EQ(s->DocCount(), 2500);
  SearchParams p;
  p.size_min = 99999;
  EXPECT_EQ(Paths(Find(*s, p)), std::vector<std::string>{"/v/bulk/f7"});

  // Writes of one transaction wait in the store: later ones see earlier ones, and a re-keyed
  // document leaves nothing at its old path.
  {
    PgWriteTxn txn(*s);
    s->Upsert("", FileDoc("/v/chain/a"));
    s->SetFields("/v/chain/a", Parse(R"({"QUIXMDPath": "/v/chain/b"})"));
    s->SetFields("/v/chain/b", Parse(R"({"QUIXMDPath": "/v/chain/c", "QUIXMDFSSize": 5})"));
    EXPECT_THROW(s->SetFields("/v/chain/a", Json::Value(Json::objectValue)), EngineError);
    s->Upsert("/v/bulk/f1", FileDoc("/v/chain/a"));
    s->SetFields("/v/bulk/f2", Parse(R"({"QUIXMDPath": "/v/chain/d"})"));
    txn.Commit();
  }
  const Json::Value chain = s->GetByQuery(
      DocQuery::Parse(Parse(R"({"qsl": {"prefix": {"QUIXMDPath": "/v/chain/"}}})")), {}, 0, 10);
  ASSERT_EQ(chain.size(), 3u);
  EXPECT_EQ(chain[1]["QUIXMDPath"], "/v/chain/c");
  EXPECT_EQ(chain[1]["QUIXMDFSSize"], 5);
  EXPECT_EQ(chain[2]["QUIXMDFSSize"], 2) << "the document of f2, re-keyed";
  EXPECT_EQ(s->DocCount(), 2501);  // c added; f1 and f2 moved to a and d
}

TEST_F(PgStoreTest, SearchesByNameFolderAndFilters) {
  auto s = Make();
  Put(*s, {FileDoc("/v/docs/Café Report.PDF", 300), FileDoc("/v/docs/cafe notes.txt", 200),
           FileDoc("/v/docs/old/report 2023.pdf", 100), FileDoc("/v/docsx/report.pdf", 50),
           FileDoc("/v/other/ab.txt", 10), FileDoc("/v/other/100%_done.txt", 20)});
  auto names = [&](SearchParams p) { return Paths(Find(*s, p)); };
  SearchParams p;
  p.name = "CAFÉ";  // any case, with or without accents
  p.sort = SearchParams::Sort::kSize;
  EXPECT_EQ(names(p),
            (std::vector<std::string>{"/v/docs/cafe notes.txt", "/v/docs/Café Report.PDF"}));
  p = SearchParams();
  p.name = "%_";  // wildcards of the server's pattern language are plain characters
  EXPECT_EQ(names(p), std::vector<std::string>{"/v/other/100%_done.txt"});
  p.name = "b";  // under three characters the names are scanned
  EXPECT_EQ(names(p), std::vector<std::string>{"/v/other/ab.txt"});

  p = SearchParams();
  p.name = "report";
  p.folder = "/v/docs/";
  p.sort = SearchParams::Sort::kSize;
  p.desc = true;
  EXPECT_EQ(names(p),
            (std::vector<std::string>{"/v/docs/Café Report.PDF", "/v/docs/old/report 2023.pdf"}));
  p.exts = {"PDF"};
  p.size_max = 150;
  EXPECT_EQ(names(p), std::vector<std::string>{"/v/docs/old/report 2023.pdf"});

  // Paging and totals, without and with a permission filter.
  p = SearchParams();
  p.name = "t";
  p.sort = SearchParams::Sort::kName;
  p.size = 2;
  p.from = 1;
  SearchPage all = Find(*s, p);
  EXPECT_EQ(all.total, 6);
  EXPECT_EQ(all.hits.size(), 2u);
  SearchPage mine = Find(*s, p, [](const std::string& path) { return path.find("/v/docs/") == 0; });
  EXPECT_EQ(mine.total, 3);
  ASSERT_EQ(mine.hits.size(), 2u);
  EXPECT_EQ(mine.hits[0]["name"], "Café Report.PDF");
  EXPECT_EQ(mine.hits[1]["ext"], "pdf");
  EXPECT_EQ(mine.hits[1]["size"], 100);
}

TEST_F(PgStoreTest, SearchesWordsAndSuggests) {
  auto s = Make();
  Put(*s, {FileDoc("/v/a.txt", 1, "Quarterly revenue of the holiday season"),
           FileDoc("/v/b.txt", 2, "holiday photos holiday"),
           FileDoc("/v/secret/c.txt", 3, "holistic holiday plans 2024"),
           FileDoc("/v/d.txt", 4, "Crème brûlée recipe")});
  SearchParams p;
  p.keywords = "HOLIDAY";
  SearchPage page = Find(*s, p);
  EXPECT_EQ(page.total, 3);
  ASSERT_EQ(page.hits.size(), 3u);
  EXPECT_EQ(page.hits[0]["path"], "/v/b.txt") << "the document with the word twice ranks first";
  EXPECT_NE(page.hits[0]["snippet"].asString().find("<b>holiday</b>"), std::string::npos);
  EXPECT_GT(page.hits[0]["score"].asDouble(), page.hits[2]["score"].asDouble());

  p.keywords = "creme brul*";
  EXPECT_EQ(Paths(Find(*s, p)), std::vector<std::string>{"/v/d.txt"});
  p.keywords = "revenue-quarterly";  // the words of one keyword as a phrase, in order
  EXPECT_TRUE(Find(*s, p).hits.empty());
  p.keywords = "quarterly-revenue";
  EXPECT_EQ(Find(*s, p).hits.size(), 1u);
  p.keywords = "--";
  EXPECT_TRUE(Find(*s, p).hits.empty());

  // Most used first; digits-only words are never offered; hidden documents lend no words.
  EXPECT_EQ(s->Suggest("Hol", 10, nullptr), (std::vector<std::string>{"holiday", "holistic"}));
  EXPECT_EQ(
      s->Suggest("hol", 10, [](const std::string& path) { return path.find("/v/secret") != 0; }),
      std::vector<std::string>{"holiday"});
  EXPECT_TRUE(s->Suggest("20", 10, nullptr).empty());
}

// Both stores hold the same documents and must find the same ones, whatever the search.
TEST_F(PgStoreTest, FindsWhatTheEmbeddedStoreFinds) {
  test::TempDir dir;
  auto lite = IndexStore::Create(dir.Path("idx"), "docs", tc::FileMappings(),
                                 Json::Value(Json::objectValue), Json::Value(Json::objectValue));
  auto pg = Make();
  std::vector<Json::Value> docs = {
      FileDoc("/v/Music/Été 2024.mp3", 4000000, "summer holiday mix"),
      FileDoc("/v/Music/old/track01.flac", 30000000),
      FileDoc("/v/Docs/Quarterly Report.docx", 20000, "quarterly revenue report"),
      FileDoc("/v/Docs/report-draft.txt", 300, "draft of the quarterly report"),
      FileDoc("/v/Docs.txt", 10),
      FileDoc("/v/Photos/IMG_0001.JPG", 2000000),
      FileDoc("/v/Photos/100%[x]?.png", 500),
      FileDoc(std::string("/v/raw/ÿþ.bin"), 7),
  };
  Json::Value folder = FileDoc("/v/Docs", 0);
  folder["QUIXMDIsDir"] = true;
  docs.push_back(folder);
  docs[5]["QUIXMDTitle"] = "beach";
  docs[5]["QUIXMDAttributeChangeDate"] = 1600000000;
  {
    WriteTxn txn(*lite);
    for (const Json::Value& d : docs) lite->Upsert("", d);
    txn.Commit();
  }
  Put(*pg, docs);

  const char* trees[] = {
      R"({"match": "name", "pattern": "*report*"})",
      R"({"match": "name", "pattern": "REPORT*"})",
      R"({"match": "name", "pattern": "*ete*"})",
      R"({"match": "name", "pattern": "*%[x]?*"})",
      R"({"match": "name", "pattern": "*"})",
      R"({"match": "name", "pattern": "*y r*.do*"})",
      R"({"match": "content", "pattern": "quarterly report"})",
      R"({"match": "content", "pattern": "*quart*"})",
      R"({"match": "content", "pattern": "holi*"})",
      R"({"match": "any", "pattern": "draft"})",
      R"({"match": "title", "pattern": "revenue"})",
      R"({"match": "path", "pattern": "/v/Docs/*"})",
      R"({"range": "size", "gte": 1000, "lt": 5000000})",
      R"({"range": "ctime", "gt": 0})",
      R"({"not": {"range": "ctime", "gt": 0}})",
      R"({"in": "ext", "values": ["JPG", "png"]})",
      R"({"in": "kind", "values": ["audio", "folder"]})",
      R"({"in": "kind", "values": ["other"]})",
      R"({"under": "/v/Docs"})",
      R"({"or": [{"under": "/v/Music/"}, {"not": {"match": "content", "pattern": "report"}}]})",
      R"({"and": [{"under": "/v"}, {"match": "name", "pattern": "*.t*"}, {"all": true}]})",
  };
  auto sorted = [](SearchPage page) {
    std::vector<std::string> paths = Paths(page);
    std::sort(paths.begin(), paths.end());
    return paths;
  };
  for (const char* tree : trees) {
    SearchParams p;
    p.size = 100;
    p.query = CompileQueryTree(Parse(tree));
    p.server_query = CompileQueryTreeForServer(Parse(tree));
    const std::vector<std::string> want = sorted(lite->Search(p, nullptr));
    EXPECT_EQ(sorted(pg->Search(p, nullptr)), want) << tree;
    EXPECT_FALSE(want.empty() && std::string(tree).find("not") == std::string::npos &&
                 std::string(tree).find("other") == std::string::npos)
        << tree << " finds nothing: the case proves little";
  }
  for (const char* keywords :
       {"report", "REPORT quarterly", "holi*", "ete", "revenue-report", "img_0001"}) {
    SearchParams p;
    p.keywords = keywords;
    EXPECT_EQ(sorted(pg->Search(p, nullptr)), sorted(lite->Search(p, nullptr))) << keywords;
  }
  for (const char* name : {"rep", "é", "0001.j", "s.t", "é 2", "g_0", "t.d", "%["}) {
    SearchParams p;
    p.name = name;
    EXPECT_EQ(sorted(pg->Search(p, nullptr)), sorted(lite->Search(p, nullptr))) << name;
  }
}

TEST_F(PgStoreTest, ServerGoingAwayFailsRequestsUntilItIsBack) {
  auto s = Make();
  Put(*s, {FileDoc("/v/kept.txt")});
  s->Sync();
  // Stopped as by a crash: what was synced is there after recovery.
  server_.Stop(SIGQUIT);
  EXPECT_THROW(
      {
        PgWriteTxn txn(*s);
        s->Upsert("", FileDoc("/v/lost.txt"));
        txn.Commit();
      },
      StoreUnavailableError);
  // Until the back-off has passed, nobody waits on a dead server.
  EXPECT_THROW(s->DocCount(), StoreUnavailableError);
  SearchParams p;
  p.name = "txt";
  EXPECT_THROW(s->Search(p, nullptr), StoreUnavailableError);

  server_.Start();
  ASSERT_TRUE(test::WaitFor(
      [&] {
        try {
          return s->DocCount() == 1;
        } catch (const StoreUnavailableError&) {
          return false;
        }
      },
      30000));
  Put(*s, {FileDoc("/v/again.txt")});
  EXPECT_EQ(Find(*s, p).total, 2);
}

std::string CoordConninfo(const test::PgServer& server) {
  return "host=" + server.socket_dir() + " port=5432 dbname=coord user=fileindex";
}

// The coordinator of a database spread over several servers: its documents table has no rows
// of its own, each partition is an index's partition on one of the servers (`shards`: a
// server's socket folder and its indexes' numbers), reached through postgres_fdw; the index
// list and their settings are the servers' own, read through views.
std::string CoordinatorSql(const std::vector<std::pair<std::string, std::vector<int>>>& shards) {
  std::string sql =
      "CREATE EXTENSION postgres_fdw; CREATE EXTENSION pg_trgm;"
      "CREATE TABLE fi_docs(part int NOT NULL, path bytea NOT NULL, fname text NOT NULL,"
      " nkey text NOT NULL,"
      " ext text NOT NULL, size bigint NOT NULL, mtime bigint NOT NULL, is_dir smallint NOT NULL,"
      " ctime bigint, crtime bigint, owner text, grp text, anc bytea NOT NULL, kept int NOT NULL,"
      " words tsvector, doc text) PARTITION BY LIST (part);";
  std::string indexes, meta;
  for (size_t i = 0; i < shards.size(); ++i) {
    const std::string n = std::to_string(i + 1);
    sql += "CREATE SERVER shard" + n + " FOREIGN DATA WRAPPER postgres_fdw OPTIONS (host '" +
           shards[i].first +
           "', port '5432', dbname 'postgres');"
           "CREATE USER MAPPING FOR CURRENT_USER SERVER shard" +
           n +
           " OPTIONS (user 'fileindex');"
           "CREATE FOREIGN TABLE fi_indexes_" +
           n +
           "(part int, server text, id text) SERVER"
           " shard" +
           n +
           " OPTIONS (table_name 'fi_indexes');"
           "CREATE FOREIGN TABLE fi_meta_" +
           n +
           "(part int, key text, value text) SERVER"
           " shard" +
           n + " OPTIONS (table_name 'fi_meta');";
    for (int part : shards[i].second) {
      const std::string p = std::to_string(part);
      sql += "CREATE FOREIGN TABLE fi_docs_" + p + " PARTITION OF fi_docs FOR VALUES IN (" + p +
             ") SERVER shard" + n + " OPTIONS (table_name 'fi_docs_" + p + "');";
    }
    indexes += (i == 0 ? "" : " UNION ALL ") + std::string("SELECT * FROM fi_indexes_") + n;
    meta += (i == 0 ? "" : " UNION ALL ") + std::string("SELECT * FROM fi_meta_") + n;
  }
  return sql + "CREATE VIEW fi_indexes AS " + indexes + "; CREATE VIEW fi_meta AS " + meta + ";";
}

TEST_F(PgStoreTest, ACoordinatorSearchesIndexesOnTwoServersAsOne) {
  test::PgServer second;
  auto pool2 = std::make_shared<PgPool>(second.conninfo(), 2);
  PgStore::PrepareDatabase(*pool2);
  // Index numbers of servers that meet in a coordinator must not overlap.
  PgConn(second.conninfo()).Script("ALTER SEQUENCE fi_indexes_part_seq RESTART WITH 1001");
  auto a = Make("s1", "docs");
  auto b = PgStore::Create(pool2, "s2", "docs", tc::FileMappings(), Json::Value(Json::objectValue),
                           Json::Value(Json::objectValue));
  Put(*a, {FileDoc("/v/one/report.txt", 1, "quarterly figures"), FileDoc("/v/one/x.txt")});
  Put(*b, {FileDoc("/w/two/Report.pdf", 2, "quarterly plans"), FileDoc("/w/two/y.pdf")});

  PgConn(server_.conninfo()).Script("CREATE DATABASE coord");
  PgConn(CoordConninfo(server_))
      .Script(CoordinatorSql({{server_.socket_dir(), {1}}, {second.socket_dir(), {1001}}}));
  auto coord = PgStore::Open(std::make_shared<PgPool>(CoordConninfo(server_), 2), "s1", "docs");
  SearchParams p;
  p.keywords = "quarterly";
  p.sort = SearchParams::Sort::kName;
  SearchPage page = coord->SearchEverywhere(p, nullptr);
  EXPECT_EQ(page.total, 2);
  ASSERT_EQ(page.hits.size(), 2u);
  EXPECT_EQ(page.hits[0]["path"], "/w/two/Report.pdf");  // names in folded order
  EXPECT_EQ(page.hits[0]["server"], "s2");
  EXPECT_EQ(page.hits[1]["path"], "/v/one/report.txt");
  EXPECT_EQ(page.hits[1]["server"], "s1");
  EXPECT_NE(page.hits[0]["snippet"].asString().find("<b>quarterly</b>"), std::string::npos);
  p = SearchParams();
  p.name = "repo";
  EXPECT_EQ(coord->SearchEverywhere(p, nullptr).total, 2);
}

// The indexer's way with a batch the store could not take: it keeps it and sends it again. A
// server crashing and coming back in the middle of a bulk load then loses nothing and doubles
// nothing.
TEST_F(PgStoreTest, BulkLoadThroughACrashOfTheServer) {
  auto s = Make();
  constexpr int kBatches = 40;
  int failures = 0;
  std::thread crash;
  for (int b = 0; b < kBatches; ++b) {
    std::vector<Json::Value> docs;
    for (int i = 0; i < 250; ++i) {
      docs.push_back(FileDoc("/v/load/" + std::to_string(b) + "/f" + std::to_string(i), i));
    }
    if (b == 10) {
      crash = std::thread([&] {
        server_.Stop(SIGQUIT);
        server_.Start();
      });
    }
    for (;;) {
      try {
        PgWriteTxn txn(*s);
        s->UpsertMany(docs, nullptr);
        // Single writes of the same batch wait in the store until the commit.
        s->Upsert("", FileDoc("/v/load/" + std::to_string(b) + "/single"));
        txn.Commit();
        break;
      } catch (const StoreUnavailableError&) {
        ++failures;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
      }
    }
  }
  crash.join();
  EXPECT_GT(failures, 0) << "the crash came after the load: the test proves little";
  s->Sync();
  const Json::Value all = s->List("/v/load", "", {}, 100000);
  ASSERT_EQ(all.size(), static_cast<size_t>(kBatches * 251));
  for (int b = 0; b < kBatches; ++b) {
    SearchParams p;
    p.folder = "/v/load/" + std::to_string(b);
    p.size = 1;
    EXPECT_EQ(s->Search(p, nullptr).total, 251) << b;
  }
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
