// The library's own index commands against the real daemon: real files on a configured share,
// extracted by the library and indexed through the daemon's socket. The other document commands
// are checked by effect through the indexing daemon's worker, which runs them against this
// daemon.
#include <sqlite3.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/sdk/share.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "fileindex/elastic_control.hpp"
#include "test/engine_client.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

namespace el = ::orvane::fileindex::elastic;
using ::testing::ElementsAre;

using test::ThrowsCode;

class LibraryTest : public ::testing::Test {
 protected:
  LibraryTest() : root_(dir_.path()) {
    test::WritePlatformConfig(dir_.path(), R"({"shares": [
      {"name": "photo", "path": ")" + volume_.Path("photo") +
                                               R"("},
      {"name": "pics", "path": ")" + volume_.Path("pics") +
                                               R"("}]})");
  }
  void SetUp() override {
    daemon_ = std::make_unique<tc::DaemonProcess>(dir_.path());
    ASSERT_TRUE(daemon_->WaitReady());
  }
  // A real file on the share, indexed with its file-system attributes.
  std::string AddFile(const std::string& rel) {
    const std::string path = volume_.Write("photo/" + rel, "content of " + rel);
    el::IndexUpsert("photo", path, false);
    return path;
  }
  Json::Value Ask(const std::string& request) {
    return tc::Request(daemon_->socket(), tc::Parse(request));
  }

  test::TempDir dir_;
  test::TempDir volume_;
  test::ScopedRoot root_;
  test::LogCapture log_;
  test::FakeEnv env_;  // a not-ready index is asked again at once
  std::unique_ptr<tc::DaemonProcess> daemon_;
};

TEST_F(LibraryTest, IndexLifecycleSearchAndSuggestions) {
  el::ShareIndexCreate("photo");
  el::ShareIndexCreate("photo");  // sent again on every folder change: the index stays
  const std::string a = AddFile("sunset beach.jpg");
  el::ShareIndexPause("photo");
  EXPECT_THAT([&] { AddFile("trip/b.jpg"); }, ThrowsCode(kCodeIndexPaused));
  el::ShareIndexResume("photo");
  const std::string b = AddFile("trip/b.jpg");
  std::vector<std::string> paths;
  el::IndexGetByPrefixPath("fileindex_photo", volume_.Path("photo"), paths);
  EXPECT_THAT(paths, ::testing::UnorderedElementsAre(a, b));
  // What people find: the library's documents carry what search needs.
  const Json::Value found = Ask(R"({"command": "search", "data": {"name": "set be"}})");
  ASSERT_EQ(found["data"]["total"], 1) << JsonToString(found);
  EXPECT_EQ(found["data"]["hits"][0]["path"], a);

  // Share renamed: the index is re-keyed and moved with its documents.
  const std::string new_db = sdk::SDKShare("pics").GetDBPath();
  el::ShareIndexRename("photo", "pics", new_db);
  EXPECT_TRUE(el::IsDocumentExists("pics", a));
  EXPECT_THAT([&] { el::IsDocumentExists("photo", a); }, ThrowsCode(kCodeIndexNotFound));
  el::ShareIndexMigrate("pics", volume_.Path("elsewhere/db"));
  EXPECT_FALSE(IsFileExist(new_db + "/index.db"));
  // The registry brings it back after a restart, in its new place under its new name.
  daemon_.reset();
  SetUp();
  EXPECT_TRUE(el::IsDocumentExists("pics", a));

  // The suggestions marked unavailable behind the daemon's back, as a lost table would be; the
  // library's rebuild makes them available again.
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(volume_.Path("elsewhere/db/index.db").c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(db, "UPDATE meta SET value='unavail' WHERE key='term_sugg'", nullptr,
                         nullptr, nullptr),
            SQLITE_OK);
  sqlite3_close(db);
  std::vector<std::string> unavailable;
  el::ListUnAvailTermSuggDB(unavailable);
  EXPECT_THAT(unavailable, ElementsAre("fileindex_pics"));
  el::UpdateTermSuggestion("fileindex_pics", {a});
  el::IndexCommit("pics");
  EXPECT_EQ(JsonToString(Ask(R"({"command": "suggest", "data": {"prefix": "suns"}})")["data"]),
            "{\"suggestions\":[\"sunset\"]}");

  el::ShareIndexDelete("pics");
  el::ShareIndexDelete("pics");
  EXPECT_THAT([&] { el::IsDocumentExists("pics", a); }, ThrowsCode(kCodeIndexNotFound));
}

// More documents than one rename pass (then all of them emptied out), and a sibling whose name only
// begins like the renamed folder's (with a quote and a newline in it, which the wire must carry as
// they are).
TEST_F(LibraryTest, RenameAndEmptyingAFolderReachEveryDocumentBelowIt) {
  el::ShareIndexCreate("photo");
  const std::string big = Dirname(Dirname(AddFile("big/s0/real.txt")));
  el::IndexUpsert("photo", big, false);
  std::vector<Json::Value> bulk;
  for (unsigned i = 0; i < el::kRenameBatchSize + 5; ++i) {
    bulk.push_back(
        tc::Upsert(volume_.Path("photo/big/s" + std::to_string(i % 3) + "/f") + std::to_string(i),
                   "fileindex_photo"));
  }
  ASSERT_EQ(tc::Request(daemon_->socket(), tc::Compound(bulk))["has_fail"], false);
  const std::string sibling = AddFile("big \"q\"\n.txt");
  el::IndexRename("photo", volume_.Path("photo/moved"), big);
  el::IndexCommit("photo");
  // Counted a sub-folder at a time: one query returns at most a page of the rename's size.
  auto count = [&](const std::string& prefix) {
    Json::Value req = tc::OnIndex("document_get_by_query", "fileindex_photo");
    req["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"] = prefix;
    req["data"]["query"]["size"] = el::kRenameBatchSize;
    return tc::Request(daemon_->socket(), req)["data"].size();
  };
  EXPECT_EQ(count(big + "/"), 0u);
  EXPECT_EQ(count(volume_.Path("photo/moved/s0/")) + count(volume_.Path("photo/moved/s1/")) +
                count(volume_.Path("photo/moved/s2/")),
            el::kRenameBatchSize + 5 + 1);
  EXPECT_TRUE(el::IsDocumentExists("photo", volume_.Path("photo/moved/s0/real.txt")));
  EXPECT_TRUE(el::IsDocumentExists("photo", sibling));

  // Emptying the folder keeps its own document and a file whose name begins like it.
  const std::string neighbour = AddFile("moved.txt");
  el::IndexDelDir("photo", volume_.Path("photo/moved"));
  el::IndexCommit("photo");
  EXPECT_EQ(count(volume_.Path("photo/moved/")), 0u);
  EXPECT_TRUE(el::IsDocumentExists("photo", volume_.Path("photo/moved")));
  EXPECT_TRUE(el::IsDocumentExists("photo", neighbour));
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
