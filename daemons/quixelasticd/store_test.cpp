#include "daemons/quixelasticd/store.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/json_util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/test_client.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using ::testing::ElementsAre;

Json::Value FileDoc(const std::string& path, int64_t size = 1, int64_t mtime = 0) {
  const size_t slash = path.find_last_of('/');
  const std::string name = path.substr(slash + 1);
  const std::string parent = path.substr(0, slash);
  const size_t dot = name.find_last_of('.');
  Json::Value d;
  d["QUIXMDPath"] = path;
  d["QUIXMDFSName"] = name;
  d["QUIXMDParent"] = parent;
  d["QUIXMDSearchFileName"] = name;
  d["QUIXMDSearchAncestor"] = parent;
  d["QUIXMDExtension"] = dot == std::string::npos ? "" : name.substr(dot + 1);
  d["QUIXMDFSSize"] = static_cast<Json::Int64>(size);
  d["QUIXMDFSContentChangeDate"] = static_cast<Json::Int64>(mtime);
  return d;
}

int CodeOf(const std::function<void()>& fn) {
  try {
    fn();
  } catch (const EngineError& e) {
    return e.code;
  }
  return 0;
}

TEST(SchemaTest, ReadsAttributesAndRefusesWhatItDoesNotKnow) {
  const Schema s = Schema::Parse(tc::FileMappings());
  EXPECT_EQ(s.property_id(), "QUIXMDPath");
  EXPECT_TRUE(s.Field("QUIXMDPath").required);
  EXPECT_EQ(s.Field("QUIXMDPath").analyzer, "keyword");
  EXPECT_TRUE(s.Field("QUIXMDSearchFileName").ngram);
  EXPECT_TRUE(s.Field("QUIXMDSearchFileName").tolower);
  EXPECT_TRUE(s.Field("QUIXMDSearchAncestor").list_ancestor);
  // Fields the schema does not list take the default.
  EXPECT_TRUE(s.Field("QUIXMDKind").all);
  EXPECT_EQ(s.Field("QUIXMDKind").type, FieldType::kString);

  Json::Value bad = tc::FileMappings();
  bad["properties"]["QUIXMDFSSize"]["type"] = "integer";
  EXPECT_EQ(CodeOf([&] { Schema::Parse(bad); }), kCodeInvalidParam);
  bad = tc::FileMappings();
  bad["properties"]["QUIXMDTitle"]["preprocess"] = Json::Value(Json::arrayValue);
  bad["properties"]["QUIXMDTitle"]["preprocess"].append("stem");
  EXPECT_EQ(CodeOf([&] { Schema::Parse(bad); }), kCodeInvalidParam);
  bad = tc::FileMappings();
  bad.removeMember("property_id");
  EXPECT_EQ(CodeOf([&] { Schema::Parse(bad); }), kCodeInvalidParam);
}

TEST(SchemaTest, ValidatesRequiredFieldsAndValueTypes) {
  const Schema s = Schema::Parse(tc::FileMappings());
  Json::Value doc = FileDoc("/v/s/a.txt");
  EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), 0);
  doc.removeMember("QUIXMDPath");
  EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), kCodeDocInvalid);
  doc = FileDoc("/v/s/a.txt");
  doc["QUIXMDFSSize"] = "12";
  EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), kCodeDocInvalid);
  doc = FileDoc("/v/s/a.txt");
  doc["QUIXMDIsDir"] = 2;
  EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), kCodeDocInvalid);
  doc = FileDoc("/v/s/a.txt");
  doc["QUIXMDTitle"]["nested"] = 1;
  EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), kCodeDocInvalid);
  doc = FileDoc("/v/s/a.txt");
  doc["QUIXMDTitle"] = Json::Value(Json::arrayValue);
  doc["QUIXMDTitle"].append("one");
  doc["QUIXMDTitle"].append(2);
  doc["QUIXMDFSSize"] = 3.0;  // an integral double is an integer
  EXPECT_EQ(CodeOf([&] { s.Validate(doc); }), 0);
}

TEST(PrefixUpperBoundTest, IncrementsTheLastByteThatCan) {
  EXPECT_EQ(*PrefixUpperBound("/v/s/"), "/v/s0");
  EXPECT_EQ(*PrefixUpperBound(std::string("a\xff", 2)), "b");
  EXPECT_FALSE(PrefixUpperBound("").has_value());
  EXPECT_FALSE(PrefixUpperBound(std::string("\xff\xff", 2)).has_value());
}

TEST(SuggestionTest, OffersWordsNotNumbersOrSingleCharacters) {
  EXPECT_TRUE(IsSuggestible("beach"));
  EXPECT_FALSE(IsSuggestible("2024"));
  EXPECT_FALSE(IsSuggestible("a"));
  EXPECT_TRUE(IsSuggestible("a4"));
}

class StoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    store_ = IndexStore::Create(dir_.Path("db"), "fileindex_s", tc::FileMappings(),
                                Json::Value(Json::objectValue), Json::Value());
  }
  void Put(const Json::Value& doc) {
    WriteTxn txn(*store_);
    store_->Upsert(doc["QUIXMDPath"].asString(), doc);
    txn.Commit();
  }
  std::vector<std::string> Paths(const DocQuery& q) {
    std::vector<std::string> out;
    for (const Json::Value& hit : store_->GetByQuery(q, {"QUIXMDPath"}, 0, 100)) {
      out.push_back(hit["QUIXMDPath"].asString());
    }
    return out;
  }
  std::vector<std::string> Names(const SearchParams& p, const VisibleFn& visible = nullptr) {
    std::vector<std::string> out;
    for (const Json::Value& hit : store_->Search(p, visible).hits) {
      out.push_back(hit["name"].asString());
    }
    return out;
  }
  DocQuery Prefix(const std::string& v) {
    DocQuery q;
    q.kind = DocQuery::Kind::kPrefix;
    q.field = "QUIXMDPath";
    q.value = v;
    return q;
  }

  orvane::test::TempDir dir_;
  std::shared_ptr<IndexStore> store_;
};

TEST_F(StoreTest, PrefixQueriesStopAtTheFolderBoundary) {
  for (const char* p : {"/v/s/a", "/v/s/a/x.txt", "/v/s/a/y/z.txt", "/v/s/ab", "/v/s/ab/c.txt"}) {
    Put(FileDoc(p));
  }
  EXPECT_THAT(Paths(Prefix("/v/s/a/")), ElementsAre("/v/s/a/x.txt", "/v/s/a/y/z.txt"));
  DocQuery term = Prefix("/v/s/ab");
  term.kind = DocQuery::Kind::kTerm;
  EXPECT_THAT(Paths(term), ElementsAre("/v/s/ab"));
  // Any keyword field answers term and prefix queries, not only the identifier.
  DocQuery by_parent = Prefix("/v/s/a");
  by_parent.field = "QUIXMDParent";
  by_parent.kind = DocQuery::Kind::kTerm;
  EXPECT_THAT(Paths(by_parent), ElementsAre("/v/s/a/x.txt"));
  // The ancestor field matches a folder and everything below it.
  DocQuery by_ancestor = by_parent;
  by_ancestor.field = "QUIXMDSearchAncestor";
  EXPECT_THAT(Paths(by_ancestor), ElementsAre("/v/s/a/x.txt", "/v/s/a/y/z.txt"));

  WriteTxn txn(*store_);
  EXPECT_EQ(store_->DeleteByQuery(Prefix("/v/s/a/")), 2);
  txn.Commit();
  EXPECT_THAT(Paths(DocQuery()), ElementsAre("/v/s/a", "/v/s/ab", "/v/s/ab/c.txt"));
  // Deleted documents leave nothing behind in the name index or the suggestions.
  SearchParams p;
  p.name = "z.t";
  EXPECT_TRUE(Names(p).empty());
  EXPECT_TRUE(store_->Suggest("x", 10, nullptr).empty());
}

TEST_F(StoreTest, SetFieldsRekeysAndReplacesTheDocumentAtTheNewPath) {
  Put(FileDoc("/v/s/old.txt", 10));
  Put(FileDoc("/v/s/new.txt", 20));
  WriteTxn txn(*store_);
  Json::Value fields;
  fields["QUIXMDPath"] = "/v/s/new.txt";
  fields["QUIXMDFSName"] = "new.txt";
  fields["QUIXMDSearchFileName"] = "new.txt";
  store_->SetFields("/v/s/old.txt", fields);
  EXPECT_EQ(CodeOf([&] { store_->SetFields("/v/s/old.txt", fields); }), kCodeDocNotFound);
  txn.Commit();
  const Json::Value hits = store_->GetByQuery(DocQuery(), {}, 0, 10);
  ASSERT_EQ(hits.size(), 1u);
  EXPECT_EQ(hits[0]["QUIXMDPath"], "/v/s/new.txt");
  EXPECT_EQ(hits[0]["QUIXMDFSSize"], 10);  // the moved file's own attributes are kept
  SearchParams p;
  p.name = "old";
  EXPECT_TRUE(Names(p).empty());
  p.name = "new";
  EXPECT_THAT(Names(p), ElementsAre("new.txt"));
}

TEST_F(StoreTest, UnstoredFieldsAreNotLoaded) {
  Json::Value doc = FileDoc("/v/s/a.txt");
  doc["QUIXMDSecret"] = "hidden";
  Put(doc);
  const Json::Value hit = store_->GetByQuery(DocQuery(), {"QUIXMDSecret", "QUIXMDPath"}, 0, 1)[0];
  EXPECT_FALSE(hit.isMember("QUIXMDSecret"));
  EXPECT_EQ(hit["QUIXMDPath"], "/v/s/a.txt");
}

TEST_F(StoreTest, SearchesNamesWordsFoldersAndRanges) {
  Json::Value report = FileDoc("/v/s/docs/Annual_Report.PDF", 5000, 200);
  report["QUIXMDExtension"] = "pdf";
  report["QUIXMDTextContent"] = "the quarterly revenue grew strongly in the north";
  Put(report);
  Put(FileDoc("/v/s/docs/report draft.txt", 100, 100));
  Put(FileDoc("/v/s/music/100%_hits.mp3", 9000, 300));
  Put(FileDoc("/v/s/music/sub/a_b.mp3", 50, 50));
  Put(FileDoc("/v/s/musical.txt", 1, 1));

  SearchParams p;
  p.name = "REPORT";  // the name index is case-insensitive
  EXPECT_THAT(Names(p), ElementsAre("Annual_Report.PDF", "report draft.txt"));
  p.name = "t d";  // substrings span word boundaries
  EXPECT_THAT(Names(p), ElementsAre("report draft.txt"));
  p.name = "0%";  // short substrings scan, and LIKE wildcards are literal
  EXPECT_THAT(Names(p), ElementsAre("100%_hits.mp3"));
  p.name = "_b";
  EXPECT_THAT(Names(p), ElementsAre("a_b.mp3"));

  p = SearchParams();
  p.keywords = "revenue north";
  const SearchPage page = store_->Search(p, nullptr);
  ASSERT_EQ(page.hits.size(), 1u);
  EXPECT_THAT(page.hits[0]["snippet"].asString(), ::testing::HasSubstr("<b>revenue</b>"));

  p = SearchParams();
  p.folder = "/v/s/music/";
  p.sort = SearchParams::Sort::kSize;
  p.desc = true;
  EXPECT_THAT(Names(p), ElementsAre("100%_hits.mp3", "a_b.mp3"));  // not /v/s/musical.txt

  p = SearchParams();
  p.exts = {"pdf", "mp3"};
  p.size_min = 100;
  p.mtime_max = 250;
  EXPECT_THAT(Names(p), ElementsAre("Annual_Report.PDF"));

  p = SearchParams();
  p.folder = "/v/s";
  p.sort = SearchParams::Sort::kMtime;
  p.from = 1;
  p.size = 2;
  const SearchPage paged = store_->Search(p, nullptr);
  EXPECT_EQ(paged.total, 5);
  ASSERT_EQ(paged.hits.size(), 2u);
  EXPECT_EQ(paged.hits[0]["name"], "a_b.mp3");
  EXPECT_EQ(paged.hits[1]["name"], "report draft.txt");

  // A filtered search counts and pages only what the user may see.
  p.from = 0;
  auto no_music = [](const std::string& path) { return path.find("/music/") == std::string::npos; };
  const SearchPage filtered = store_->Search(p, no_music);
  EXPECT_EQ(filtered.total, 3);
  EXPECT_EQ(filtered.hits[0]["name"], "musical.txt");
}

TEST_F(StoreTest, SuggestsTermsOfVisibleFilesMostUsedFirst) {
  Put(FileDoc("/v/s/beach one.jpg"));
  Put(FileDoc("/v/s/beach two.jpg"));
  Put(FileDoc("/v/s/private/bear.jpg"));
  EXPECT_THAT(store_->Suggest("Be", 10, nullptr), ElementsAre("beach", "bear"));
  auto public_only = [](const std::string& p) { return p.find("private") == std::string::npos; };
  EXPECT_THAT(store_->Suggest("be", 10, public_only), ElementsAre("beach"));
  EXPECT_THAT(store_->Suggest("be", 1, nullptr), ElementsAre("beach"));
}

TEST_F(StoreTest, AFullDiskFailsTheWriteAndKeepsWhatWasThere) {
  Put(FileDoc("/v/s/kept.txt"));
  // The page limit stands in for a full disk: SQLite answers SQLITE_FULL the same way.
  store_->writer().Exec("PRAGMA max_page_count = " + std::to_string([&] {
    Stmt st(store_->writer(), "PRAGMA page_count");
    st.Step();
    return st.Int(0);
  }()));
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

TEST_F(StoreTest, ReopensWithItsSchemaAndDocuments) {
  Put(FileDoc("/v/s/a.txt"));
  store_->Sync();
  store_.reset();
  store_ = IndexStore::Open(dir_.Path("db"));
  EXPECT_EQ(store_->DocCount(), 1);
  EXPECT_EQ(store_->Meta("id"), "fileindex_s");
  std::string detail;
  EXPECT_TRUE(store_->QuickCheck(&detail)) << detail;
  EXPECT_EQ(CodeOf([&] {
              IndexStore::Create(dir_.Path("db"), "x", tc::FileMappings(), Json::Value(),
                                 Json::Value());
            }),
            kCodeIndexExists);
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
