#include "daemons/quixelasticd/store.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/pg_backend.hpp"
#include "test/engine_client.hpp"
#include "test/pg_server.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using ::testing::ElementsAre;

using tc::FileDoc;

int CodeOf(const std::function<void()>& fn) {
  try {
    fn();
  } catch (const EngineError& e) {
    return e.code;
  }
  return 0;
}

using Spoil = std::function<void(Json::Value&)>;

// What the schema's attributes mean is checked through the store's behaviour below; here, what
// it must refuse.
TEST(SchemaTest, RefusesUnknownMappingsAndValidatesDocuments) {
  for (const Spoil& spoil : std::vector<Spoil>{
           [](Json::Value& m) { m["properties"]["QUIXMDFSSize"]["type"] = "integer"; },
           [](Json::Value& m) { m["properties"]["QUIXMDTitle"]["preprocess"].append("stem"); },
           [](Json::Value& m) { m.removeMember("property_id"); }}) {
    Json::Value m = tc::FileMappings();
    spoil(m);
    EXPECT_EQ(CodeOf([&] { Schema::Parse(m); }), kCodeInvalidParam) << m;
  }
  const Schema s = Schema::Parse(tc::FileMappings());
  const std::vector<std::pair<Spoil, int>> docs = {
      {[](Json::Value&) {}, 0},
      {[](Json::Value& d) { d.removeMember("QUIXMDPath"); }, kCodeDocInvalid},
      {[](Json::Value& d) { d["QUIXMDFSSize"] = "12"; }, kCodeDocInvalid},
      {[](Json::Value& d) { d["QUIXMDTitle"]["nested"] = 1; }, kCodeDocInvalid},
      // Lists of values are fine, and an integral double is an integer.
      {[](Json::Value& d) {
         d["QUIXMDTitle"].append("one");
         d["QUIXMDTitle"].append(2);
         d["QUIXMDFSSize"] = 3.0;
       },
       0}};
  for (const auto& [spoil, code] : docs) {
    Json::Value doc = FileDoc("/v/s/a.txt");
    spoil(doc);
    EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), code) << doc;
  }
}

// The names a search by (part of) a name finds.
std::vector<std::string> NamesFound(Store& store, const std::string& name) {
  SearchParams p;
  p.name = name;
  std::vector<std::string> out;
  for (const Json::Value& hit : store.Search(p, nullptr).hits) {
    out.push_back(hit["name"].asString());
  }
  return out;
}

// The store's behaviour that both kinds of store share: the SQLite file of each index, and a
// PostgreSQL database of the test's own (one server for the whole suite, an index per test).
class StoreTest : public ::testing::TestWithParam<std::string> {
 protected:
  static void TearDownTestSuite() { pg_.reset(); }

  void SetUp() override {
    if (GetParam() == "postgres") {
      if (!pg_) pg_ = std::make_unique<orvane::test::PgServer>();
      backend_ = PgBackend(pg_->conninfo(), "s1");
    } else {
      backend_ = SqliteBackend();
    }
    const std::string test = ::testing::UnitTest::GetInstance()->current_test_info()->name();
    id_ = "fileindex_" + test.substr(0, 40);
    for (char& c : id_) {
      if (!isalnum(static_cast<unsigned char>(c))) c = '_';
    }
    store_ = backend_->Create(dir_.Path("db"), id_, tc::FileMappings(), {}, {});
  }
  void TearDown() override {
    store_.reset();
    backend_->Remove(dir_.Path("db"), id_);
  }
  void Put(const Json::Value& doc) {
    std::unique_ptr<StoreTxn> txn = store_->Begin();
    store_->Upsert(doc["QUIXMDPath"].asString(), doc);
    txn->Commit();
  }
  std::vector<std::string> Paths(const DocQuery& q) {
    std::vector<std::string> out;
    for (const Json::Value& hit : store_->GetByQuery(q, {"QUIXMDPath"}, 0, 100)) {
      out.push_back(hit["QUIXMDPath"].asString());
    }
    return out;
  }
  std::vector<std::string> NamesLike(const std::string& name) { return NamesFound(*store_, name); }

  static std::unique_ptr<orvane::test::PgServer> pg_;
  orvane::test::TempDir dir_;
  std::shared_ptr<StoreBackend> backend_;
  std::string id_;
  std::shared_ptr<Store> store_;
};

std::unique_ptr<orvane::test::PgServer> StoreTest::pg_;

INSTANTIATE_TEST_SUITE_P(BothStores, StoreTest, ::testing::Values("sqlite", "postgres"),
                         [](const ::testing::TestParamInfo<std::string>& info) {
                           return info.param;
                         });

// What only the SQLite file shows: its tables' contents and a full disk.
class SqliteStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    store_ = IndexStore::Create(dir_.Path("db"), "fileindex_s", tc::FileMappings(), {}, {});
  }
  void Put(const Json::Value& doc) {
    WriteTxn txn(*store_);
    store_->Upsert(doc["QUIXMDPath"].asString(), doc);
    txn.Commit();
  }
  std::vector<std::string> NamesLike(const std::string& name) { return NamesFound(*store_, name); }

  orvane::test::TempDir dir_;
  std::shared_ptr<IndexStore> store_;
};

TEST_P(StoreTest, PrefixQueriesStopAtTheFolderBoundary) {
  for (const char* p : {"/v/s/a", "/v/s/a/x.txt", "/v/s/a/y/z.txt", "/v/s/ab", "/v/s/ab/c.txt"}) {
    Put(FileDoc(p));
  }
  using K = DocQuery::Kind;
  EXPECT_THAT(Paths({K::kPrefix, "QUIXMDPath", "/v/s/a/"}),
              ElementsAre("/v/s/a/x.txt", "/v/s/a/y/z.txt"));
  // Any keyword field answers term queries, not only the identifier; the ancestor field matches
  // a folder and everything below it.
  EXPECT_THAT(Paths({K::kTerm, "QUIXMDParent", "/v/s/a"}), ElementsAre("/v/s/a/x.txt"));
  EXPECT_THAT(Paths({K::kTerm, "QUIXMDSearchAncestor", "/v/s/a"}),
              ElementsAre("/v/s/a/x.txt", "/v/s/a/y/z.txt"));

  std::unique_ptr<StoreTxn> txn = store_->Begin();
  EXPECT_EQ(store_->DeleteByQuery({K::kPrefix, "QUIXMDPath", "/v/s/a/"}), 2);
  txn->Commit();
  EXPECT_THAT(Paths(DocQuery()), ElementsAre("/v/s/a", "/v/s/ab", "/v/s/ab/c.txt"));
  // Deleted documents leave nothing behind in the name index or the suggestions.
  EXPECT_TRUE(NamesLike("z.t").empty());
  EXPECT_TRUE(store_->Suggest("x", 10, nullptr).empty());
}

TEST_P(StoreTest, ListingPagesThroughOneFolderInIdentifierOrder) {
  for (const char* p : {"/v/s/a", "/v/s/a.txt", "/v/s/a/x.txt", "/v/s/a/y", "/v/s/a/y/z.txt",
                        "/v/s/a0", "/v/s/ab"}) {
    Json::Value doc = FileDoc(p, 7, 1000);
    if (std::string(p) == "/v/s/a/y") {
      doc["QUIXMDIsDir"] = true;
      doc["QUIXMDAttributeChangeDate"] = 2000;
    }
    Put(doc);
  }
  std::vector<std::string> paths;
  std::string after;
  for (int page = 0; page < 4; ++page) {
    const Json::Value hits = store_->List("/v/s/a", after, {"QUIXMDAttributeChangeDate"}, 2);
    for (const Json::Value& hit : hits) {
      const std::string p = hit[0].asString();
      paths.push_back(p);
      EXPECT_EQ(JsonToString(hit),
                "[\"" + p + "\",7,1000," + (p == "/v/s/a/y" ? "true,2000]" : "false,null]"));
    }
    if (hits.size() < 2) break;
    after = paths.back();
  }
  // Names that only begin like the folder are not below it, wherever they sort.
  EXPECT_THAT(paths, ElementsAre("/v/s/a", "/v/s/a/x.txt", "/v/s/a/y", "/v/s/a/y/z.txt"));
}

TEST_P(StoreTest, SetFieldsRekeysAndReplacesTheDocumentAtTheNewPath) {
  Json::Value old_doc = FileDoc("/v/s/old.txt", 10);
  old_doc["QUIXMDSecret"] = "not stored";
  Put(old_doc);
  Put(FileDoc("/v/s/new.txt", 20));
  std::unique_ptr<StoreTxn> txn = store_->Begin();
  store_->SetFields("/v/s/old.txt", tc::Parse(R"({"QUIXMDPath": "/v/s/new.txt",
      "QUIXMDFSName": "new.txt", "QUIXMDSearchFileName": "new.txt"})"));
  txn->Commit();
  const Json::Value hits =
      store_->GetByQuery(DocQuery(), {"QUIXMDSecret", "QUIXMDPath", "QUIXMDFSSize"}, 0, 10);
  ASSERT_EQ(hits.size(), 1u);
  EXPECT_EQ(hits[0]["QUIXMDPath"], "/v/s/new.txt");
  EXPECT_EQ(hits[0]["QUIXMDFSSize"], 10);  // the moved file's own attributes are kept
  EXPECT_FALSE(hits[0].isMember("QUIXMDSecret"));
  EXPECT_TRUE(NamesLike("old").empty());
  EXPECT_THAT(NamesLike("new"), ElementsAre("new.txt"));
}

// Which suggestions a caller sees is checked against real permissions through the daemon.
TEST_P(StoreTest, SuggestsTermsMostUsedFirst) {
  Put(FileDoc("/v/s/beach.jpg"));
  Put(FileDoc("/v/s/bear one.jpg"));
  Put(FileDoc("/v/s/sub/bear two.jpg"));
  Put(FileDoc("/v/s/2024 a a4.jpg"));
  // Numbers and single characters are not offered.
  EXPECT_THAT(store_->Suggest("a", 10, nullptr), ElementsAre("a4"));
  EXPECT_TRUE(store_->Suggest("2", 10, nullptr).empty());
  EXPECT_THAT(store_->Suggest("Be", 10, nullptr), ElementsAre("bear", "beach"));
  EXPECT_THAT(store_->Suggest("be", 1, nullptr), ElementsAre("bear"));
}

// Names on disk may be any bytes. The full-text tables and the stored documents hold valid
// UTF-8, so the tokenizers see every valid part of a name; what comes back is the real bytes.
// Searches by names, folders and words, and renames below such folders, are checked end to end
// with the other daemons.
TEST_F(SqliteStoreTest, NamesThatAreNotUtf8AreFoundByTheirValidParts) {
  for (const char* p : {"/v/s/caf\xE9 menu.txt", "/v/s/\xFF\xFEreport.pdf",
                        "/v/s/dir\xFF/inner.txt", "/v/s/\xE6\x97\xA5\xE6\x9C\xAC.txt"}) {
    Put(FileDoc(p));
  }
  for (const char* sql :
       {"SELECT name FROM fts_name", "SELECT text FROM fts_all", "SELECT rest FROM docs WHERE rest NOT NULL"}) {
    Stmt st(store_->writer(), sql);
    while (st.Step()) EXPECT_TRUE(IsValidUtf8(st.Text(0))) << sql << ": " << st.Text(0);
  }
  // Names too short for the trigram index in characters, however long in bytes, scan the names.
  EXPECT_THAT(NamesLike("\xE6\x97\xA5\xE6\x9C\xAC"), ElementsAre("\xE6\x97\xA5\xE6\x9C\xAC.txt"));
  for (const std::string& term : store_->Suggest("caf", 10, nullptr)) {
    EXPECT_FALSE(NameNeedsEncoding(term) && IsValidUtf8(term)) << "not decoded: " << term;
  }
}

// Documents are kept as columns plus the fields the columns cannot give back; what comes back
// must be what was sent, whatever the values' types and however they differ from the columns.
TEST_P(StoreTest, DocumentsComeBackAsTheyWereSent) {
  std::vector<Json::Value> docs;
  docs.push_back(FileDoc("/v/s/plain.txt", 12, 1600000000));
  for (const Spoil& spoil : std::vector<Spoil>{
           [](Json::Value& d) {
             d["QUIXMDFSSize"] = 3.0;
             d["QUIXMDIsDir"] = 1;
             d["QUIXMDExtension"] = "TXT";
             d["QUIXMDKind"] = "document";
             d["QUIXMDAttributeChangeDate"] = 1.5;
             d["QUIXMDFSCreationDate"] = Json::UInt64(18000000000000000000ull);
           },
           [](Json::Value& d) {
             d["QUIXMDParent"] = "/elsewhere";
             d["QUIXMDSearchAncestor"] = "/v";
             d["QUIXMDDisplayName"] = "Shown name";
             d["QUIXMDOwnerUserID"] = "1026";
             d["QUIXMDOwnerGroupID"] = Json::Value(Json::nullValue);
             d["QUIXMDTitle"].append("one");
             d["QUIXMDTitle"].append(2);
           },
           [](Json::Value& d) {
             d["QUIXMDIsDir"] = true;
             d["QUIXMDDisplayName"] = d["QUIXMDFSName"];
             d["QUIXMDKind"] = d["QUIXMDExtension"];
             d["QUIXMDAttributeChangeDate"] = -7;
             d["QUIXMDFSCreationDate"] = 0;
             d["QUIXMDOwnerGroupID"] = "";
             d.removeMember("QUIXMDParent");
             d.removeMember("QUIXMDFSContentChangeDate");
           }}) {
    Json::Value d = FileDoc("/v/s/f" + std::to_string(docs.size()) + "/caf\xE9.Txt", 5, 9);
    spoil(d);
    docs.push_back(d);
  }
  Json::Value odd = FileDoc("noslash");
  odd["QUIXMDFSName"] = "noslash";
  docs.push_back(odd);
  std::vector<std::pair<size_t, std::string>> refused;
  {
    std::unique_ptr<StoreTxn> txn = store_->Begin();
    Json::Value bad = FileDoc("/v/s/bad.txt");
    bad["QUIXMDFSSize"] = "twelve";
    docs.push_back(bad);
    EXPECT_EQ(store_->UpsertMany(docs, &refused), docs.size() - 1);
    docs.pop_back();
    txn->Commit();
  }
  ASSERT_EQ(refused.size(), 1u);
  EXPECT_EQ(refused[0].first, docs.size());
  const Schema schema = Schema::Parse(tc::FileMappings());
  for (const Json::Value& d : docs) {
    const std::string path = d["QUIXMDPath"].asString();
    const Json::Value hits =
        store_->GetByQuery({DocQuery::Kind::kTerm, "QUIXMDPath", path}, {}, 0, 10);
    ASSERT_EQ(hits.size(), 1u) << path;
    EXPECT_EQ(JsonToString(hits[0]), JsonToString(schema.Load(d, {})));
  }
  // Fields without a column of their own still answer queries.
  using K = DocQuery::Kind;
  EXPECT_THAT(Paths({K::kTerm, "QUIXMDOwnerUserID", "1026"}),
              ElementsAre("/v/s/f2/caf\xE9.Txt"));
  EXPECT_THAT(Paths({K::kPrefix, "QUIXMDDisplayName", "Shown"}),
              ElementsAre("/v/s/f2/caf\xE9.Txt"));
  EXPECT_THAT(Paths({K::kTerm, "QUIXMDParent", "/elsewhere"}), ElementsAre("/v/s/f2/caf\xE9.Txt"));
}

// Names are compared folded, as words are: any case, with or without diacritics, in either
// Unicode form; characters that mean something to a pattern are matched as themselves.
TEST_P(StoreTest, NamesMatchInAnyCaseWithOrWithoutDiacritics) {
  for (const char* p : {"/v/s/Caf\xC3\xA9 Menu.txt", "/v/s/cafe.txt", "/v/s/CAFE\xCC\x81-noir.pdf",
                        "/v/s/a[1]?.txt", "/v/s/a*b.txt", "/v/s/acb.txt", "/v/s/\xC3\x85ngstr\xC3\xB6m.doc"}) {
    Put(FileDoc(p));
  }
  const std::vector<std::pair<std::string, std::vector<std::string>>> cases = {
      {"cafe", {"Caf\xC3\xA9 Menu.txt", "cafe.txt", "CAFE\xCC\x81-noir.pdf"}},
      {"CAF\xC3\x89", {"Caf\xC3\xA9 Menu.txt", "cafe.txt", "CAFE\xCC\x81-noir.pdf"}},
      {"e m", {"Caf\xC3\xA9 Menu.txt"}},
      {"angstrom", {"\xC3\x85ngstr\xC3\xB6m.doc"}},
      {"[1]?", {"a[1]?.txt"}},
      {"a*b", {"a*b.txt"}},
      {"fe", {"Caf\xC3\xA9 Menu.txt", "cafe.txt", "CAFE\xCC\x81-noir.pdf"}}};
  for (const auto& [pattern, names] : cases) {
    std::vector<std::string> found = NamesLike(pattern);
    std::sort(found.begin(), found.end());
    std::vector<std::string> want = names;
    std::sort(want.begin(), want.end());
    EXPECT_EQ(found, want) << pattern;
  }
}

// A store written before documents were split into columns (each whole as JSON, positions in
// the name index) is rewritten when opened, in one transaction: if the rewrite fails, the old
// store is left as it was.
TEST(StoreUpgradeTest, AnOldStoreIsRewrittenAtOpenOrLeftWhole) {
  orvane::test::TempDir dir;
  const std::string folder = dir.Path("db");
  const Schema schema = Schema::Parse(tc::FileMappings());
  std::vector<Json::Value> docs = {FileDoc("/v/s/Caf\xC3\xA9.txt", 3, 7),
                                   FileDoc("/v/s/sub/notes.md", 4, 8)};
  docs[1]["QUIXMDTitle"] = "quarterly plans";
  IndexStore::Create(folder, "fileindex_s", tc::FileMappings(), {}, {}).reset();
  {
    Db db;
    db.Open(folder + "/" + IndexStore::kDbFile, false, false);
    db.Exec(
        "DROP TABLE docs; DROP TABLE fts_name; UPDATE meta SET value = '1' WHERE key = 'format';"
        "CREATE TABLE docs(rowid INTEGER PRIMARY KEY, path TEXT NOT NULL UNIQUE, parent TEXT,"
        " name TEXT, ext TEXT, size INTEGER, mtime INTEGER, is_dir INTEGER, ancestor TEXT,"
        " body TEXT NOT NULL);"
        "CREATE VIRTUAL TABLE fts_name USING fts5(name, tokenize='trigram');");
    Stmt put(db, "INSERT INTO docs(rowid, path, parent, name, ext, size, mtime, is_dir, ancestor,"
                 " body) VALUES(?, ?, ?, ?, ?, ?, ?, 0, ?, ?)");
    Stmt all(db, "INSERT INTO fts_all(rowid, text) VALUES(?, ?)");
    Stmt name(db, "INSERT INTO fts_name(rowid, name) VALUES(?, ?)");
    for (size_t i = 0; i < docs.size(); ++i) {
      const DerivedDoc d = schema.Derive(docs[i]);
      const int64_t row = static_cast<int64_t>(i) + 1;
      put.Reset();
      put.Bind(1, row).Bind(2, d.path).Bind(3, d.parent).Bind(4, d.name).Bind(5, d.ext);
      put.Bind(6, d.size).Bind(7, d.mtime).Bind(8, d.ancestor).Bind(9, JsonToString(docs[i]));
      put.Run();
      all.Reset();
      all.Bind(1, row).Bind(2, EncodeName(d.all_text)).Run();
      name.Reset();
      name.Bind(1, row).Bind(2, EncodeName(d.name_text)).Run();
    }
    db.Exec("INSERT INTO docs(path, body) VALUES('/v/s/broken', 'not json')");
  }
  EXPECT_THROW(IndexStore::Open(folder), StoreError);
  {
    Db db;
    db.Open(folder + "/" + IndexStore::kDbFile, false, false);
    Stmt rows(db, "SELECT count(*) FROM docs WHERE body NOT NULL");
    ASSERT_TRUE(rows.Step());
    EXPECT_EQ(rows.Int(0), 3);
    db.Exec("DELETE FROM docs WHERE path = '/v/s/broken'");
  }
  std::shared_ptr<IndexStore> store = IndexStore::Open(folder);
  EXPECT_EQ(store->Meta("format"), "2");
  for (const Json::Value& d : docs) {
    const Json::Value hits = store->GetByQuery(
        {DocQuery::Kind::kTerm, "QUIXMDPath", d["QUIXMDPath"].asString()}, {}, 0, 10);
    ASSERT_EQ(hits.size(), 1u);
    EXPECT_EQ(JsonToString(hits[0]), JsonToString(d));
  }
  SearchParams p;
  p.name = "CAFE";
  ASSERT_EQ(store->Search(p, nullptr).hits.size(), 1u);
  p.name.clear();
  p.keywords = "quarterly";
  EXPECT_EQ(store->Search(p, nullptr).hits.size(), 1u);
  std::string detail;
  EXPECT_TRUE(store->QuickCheck(&detail)) << detail;
}

TEST_F(SqliteStoreTest, AFullDiskFailsTheWriteAndKeepsWhatWasThere) {
  Put(FileDoc("/v/s/kept.txt"));
  // The page limit stands in for a full disk: SQLite answers SQLITE_FULL the same way.
  {
    Stmt pages(store_->writer(), "PRAGMA page_count");
    pages.Step();
    store_->writer().Exec("PRAGMA max_page_count = " + std::to_string(pages.Int(0)));
  }
  bool full = false;
  try {
    WriteTxn txn(*store_);
    for (int i = 0; i < 2000; ++i) {
      Json::Value doc = FileDoc("/v/s/new" + std::to_string(i) + ".txt");
      doc["QUIXMDTextContent"] = std::string(2000, 'x');
      store_->Upsert(doc["QUIXMDPath"].asString(), doc);
    }
    txn.Commit();
  } catch (const StoreError& e) {
    full = (e.sqlite_code & 0xff) == SQLITE_FULL;
    EXPECT_FALSE(e.IsCorruption());
  }
  EXPECT_TRUE(full);
  EXPECT_EQ(store_->DocCount(), 1);
  store_->writer().Exec("PRAGMA max_page_count = 1073741823");
  Put(FileDoc("/v/s/after.txt"));
  EXPECT_EQ(store_->DocCount(), 2);
  std::string detail;
  EXPECT_TRUE(store_->QuickCheck(&detail)) << detail;
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
