#include "daemons/quixelasticd/bulk_codec.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <vector>

#include "common/json_util.hpp"
#include "daemons/quixelasticd/engine.hpp"
#include "extract/content_extract.hpp"
#include "test/engine_client.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

namespace ce = QUIX::CONTENT_EXTRACT;

struct statx StatOf(const std::string& path) {
  struct statx st;
  EXPECT_EQ(0, statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW,
                     STATX_BASIC_STATS | STATX_BTIME, &st))
      << path;
  return st;
}

std::vector<Json::Value> Decoded(const std::string& text) {
  std::vector<Json::Value> docs;
  std::string error;
  EXPECT_TRUE(DecodeBulk(text, [&](const BulkDoc& d) { docs.push_back(d.ToJson()); }, &error))
      << error;
  return docs;
}

// Names that a record's framing could trip over, folders switched back and forth: each document
// read back is byte for byte the one the JSON upsert of the same file carries.
TEST(BulkCodecTest, RealFilesComeBackAsTheirJsonDocuments) {
  test::TempDir dir;
  std::vector<std::string> paths;
  for (const char* rel :
       {"plain.txt", "UPPER.PDF", "no_extension", ".dotfile", "tab\tand\nnewline.x",
        "bytes\xff\xfe.bin", "P12:looks like a record\n", "space name .md", "123", "sub",
        "sub/inner.TaR", "a.b.c.", "last"}) {
    const std::string path = dir.Path(rel);
    if (std::string(rel) == "sub") {
      ASSERT_EQ(0, mkdir(path.c_str(), 0755));
    } else {
      dir.Write(rel, rel);
    }
    paths.push_back(path);
  }
  BulkEncoder encoder;
  std::vector<Json::Value> expected;
  for (const std::string& path : paths) {
    ASSERT_TRUE(encoder.Add(path, StatOf(path)));
    Json::Value doc;
    ce::ParseFile(path, Json::Value(), doc);
    doc[ce::QUIXMDSearchFileName] = doc[ce::QUIXMDFSName];
    doc[ce::QUIXMDSearchAncestor] = doc[ce::QUIXMDParent];
    expected.push_back(doc);
  }
  EXPECT_EQ(paths.size(), encoder.count());
  const std::vector<Json::Value> docs = Decoded(encoder.Take());
  ASSERT_EQ(expected.size(), docs.size());
  for (size_t i = 0; i < docs.size(); ++i) {
    EXPECT_EQ(JsonToString(expected[i]), JsonToString(docs[i])) << paths[i];
  }
  EXPECT_EQ(0u, encoder.count());

  // A file system that keeps no birth time gives no creation date; a name without its folder
  // is not the encoder's to write.
  struct statx st = StatOf(paths[0]);
  st.stx_mask &= ~STATX_BTIME;
  ASSERT_TRUE(encoder.Add("/v/x", st));
  EXPECT_FALSE(encoder.Add("relative", st));
  const std::vector<Json::Value> again = Decoded(encoder.Take());
  ASSERT_EQ(1u, again.size());
  EXPECT_FALSE(again[0].isMember(ce::QUIXMDFSCreationDate));
  EXPECT_EQ("/v/x", again[0][ce::QUIXMDPath].asString());
  EXPECT_EQ("/v", again[0][ce::QUIXMDParent].asString());
}

TEST(BulkCodecTest, AFaultyTextStopsAtItsFirstBadRecord) {
  const std::string kFolder = "P2:/v\n";
  const std::string kFile = "F1:a 1 2 3 - 4 5\n";
  struct Case {
    std::string text;
    size_t docs;  // given to the callback before the fault
    const char* error;
  } cases[] = {
      {"", 0, nullptr},
      {kFolder + kFile + "D1:b 0 2 3 9 4 5\n", 2, nullptr},
      {kFile, 0, "bulk record 0 at byte 0 is before any folder"},
      {kFolder + kFile + "X\n", 1, "bulk record 2 at byte 23 is of no known kind"},
      {kFolder + "F9:a 1 2 3 - 4 5\n", 0, "is malformed"},   // a name past the end
      {kFolder + "F1:a 1 2 x - 4 5\n", 0, "is malformed"},   // not a number
      {kFolder + "F1:a -1 2 3 - 4 5\n", 0, "is malformed"},  // a negative size
      {kFolder + "F1:a 1 2 3 - 4 5", 0, "is malformed"},     // cut short
      {kFolder + "F3:a/b 1 2 3 - 4 5\n", 0, "is malformed"}, // a path for a name
      {kFolder + "F0: 1 2 3 - 4 5\n", 0, "is malformed"},    // no name
      {"P9:/v\n" + kFile, 0, "bulk record 0 at byte 0 is malformed"},
  };
  for (const Case& c : cases) {
    size_t docs = 0;
    std::string error;
    const bool ok = DecodeBulk(c.text, [&](const BulkDoc&) { ++docs; }, &error);
    EXPECT_EQ(c.error == nullptr, ok) << c.text;
    if (c.error != nullptr) EXPECT_NE(std::string::npos, error.find(c.error)) << error;
    EXPECT_EQ(c.docs, docs) << c.text;
  }
}

// Through the engine: the bulk command keeps its place among the JSON commands of a batch, and
// a faulty one is refused whole, the documents before its fault included.
TEST(BulkCodecTest, TheEngineWritesBulkDocumentsInTheirPlaceOrNoneOfThem) {
  test::TempDir dir;
  EngineOptions options;
  options.registry_file = dir.Path("state/indexes.json");
  options.running_marker = dir.Path("state/running");
  Engine engine(options);
  engine.Start();
  engine.WaitOpened();
  Caller root;
  root.privileged = true;
  Json::Value create = tc::OnIndex("index_create");
  create["data"]["path"] = dir.Path("db");
  create["data"]["mappings"] = tc::FileMappings();
  ASSERT_TRUE(engine.HandleValue(create, root)["success"].asBool());
  const auto bulk = [](const std::string& docs) {
    Json::Value r = tc::OnIndex(kBulkUpsertCommand);
    r["data"]["docs"] = docs;
    return r;
  };
  const auto paths = [&] {
    Json::Value q = tc::OnIndex("document_get_by_query");
    q["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"] = "/v/";
    q["data"]["query"]["load_field"].append("QUIXMDPath");
    std::vector<std::string> out;
    const Json::Value r = engine.HandleValue(q, root);
    EXPECT_TRUE(r["success"].asBool()) << r;
    for (const Json::Value& h : r["data"]) {
      out.push_back(h["QUIXMDPath"].asString());
    }
    return out;
  };

  Json::Value del = tc::OnIndex("document_del_by_id");
  del["data"]["doc_id"] = "/v/a";
  const Json::Value reply = engine.HandleValue(
      tc::Compound({tc::Upsert("/v/c"), bulk("P2:/v\nF1:a 1 2 3 - 4 5\nF1:b 1 2 3 - 4 5\n"), del}),
      root);
  EXPECT_FALSE(reply["has_fail"].asBool()) << reply;
  EXPECT_EQ(2, reply["data"][1]["data"]["upserted"].asInt());
  EXPECT_EQ((std::vector<std::string>{"/v/b", "/v/c"}), paths());

  const Json::Value refused = engine.HandleValue(bulk("P2:/v\nF1:d 1 2 3 - 4 5\nF1:e x\n"), root);
  EXPECT_EQ(kCodeInvalidParam, refused["error"]["code"].asInt()) << refused;
  EXPECT_NE(std::string::npos,
            refused["error"]["msg"].asString().find("bulk record 2 at byte 23 is malformed"));
  EXPECT_EQ((std::vector<std::string>{"/v/b", "/v/c"}), paths());
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
