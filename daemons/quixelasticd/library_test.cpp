// The library's own search-index commands against the real daemon: real files on a configured
// share, extracted by the library, indexed, re-pathed and deleted through the daemon's socket.
#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/sdk/share.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/test_client.hpp"
#include "fileindex/elastic_control.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

namespace el = ::orvane::fileindex::elastic;
using ::testing::ElementsAre;

auto ThrowsCode(int code) {
  return ::testing::Throws<Error>(::testing::Field(&Error::code, static_cast<ErrorCode>(code)));
}

class LibraryTest : public ::testing::Test {
 protected:
  LibraryTest() : root_(dir_.path()) {
    share_ = volume_.Path("photo");
    test::WritePlatformConfig(dir_.path(), R"({"shares": [
      {"name": "photo", "path": ")" + share_ + R"("},
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
  std::string AddDir(const std::string& rel) {
    const std::string path = share_ + "/" + rel;
    ::mkdir(path.c_str(), 0755);
    el::IndexUpsert("photo", path, false);
    return path;
  }
  std::vector<std::string> Below(const std::string& dir,
                                 const std::string& db = "fileindex_photo") {
    std::vector<std::string> paths;
    el::IndexGetByPrefixPath(db, dir, paths);
    std::sort(paths.begin(), paths.end());
    return paths;
  }

  test::TempDir dir_;
  test::TempDir volume_;
  test::ScopedRoot root_;
  test::LogCapture log_;
  test::FakeEnv env_;  // a not-ready index is asked again at once
  std::string share_;
  std::unique_ptr<tc::DaemonProcess> daemon_;
};

// The rename passes, attribute updates and odd names are checked against the engine by the
// library's own real-engine test; here, the commands people's searches depend on.
TEST_F(LibraryTest, DocumentCommandsFollowTheFiles) {
  el::ShareIndexCreate("photo");
  const std::string dir = AddDir("trip");
  const std::string a = AddFile("trip/a.jpg");
  const std::string b = AddFile("trip/day2/b.jpg");
  AddFile("trip2/c.jpg");
  EXPECT_FALSE(el::IsDocumentExists("photo", share_ + "/nothing"));
  // /trip/ does not reach /trip2.
  EXPECT_THAT(Below(dir), ElementsAre(a, b));

  el::IndexRename("photo", share_ + "/holiday", dir);
  EXPECT_THAT(Below(share_ + "/holiday"),
              ElementsAre(share_ + "/holiday/a.jpg", share_ + "/holiday/day2/b.jpg"));
  EXPECT_TRUE(Below(dir).empty());
  el::IndexDelDir("photo", share_ + "/holiday");
  el::IndexDel("photo", share_ + "/holiday");
  el::IndexCommit("photo");
  EXPECT_THAT(Below(share_), ElementsAre(share_ + "/trip2/c.jpg"));

  // What people find: the library's documents carry what search and suggest need.
  Json::Value search = tc::Parse(R"({"command": "search", "data": {"name": "c.j"}})");
  search["data"]["folder"] = share_;
  const Json::Value found = tc::Request(daemon_->socket(), search);
  ASSERT_EQ(found["data"]["total"], 1) << JsonToString(found);
  EXPECT_EQ(found["data"]["hits"][0]["path"], share_ + "/trip2/c.jpg");
}

TEST_F(LibraryTest, IndexLifecycleAndSuggestions) {
  el::ShareIndexCreate("photo");
  const std::string a = AddFile("sunset beach.jpg");
  el::ShareIndexPause("photo");
  EXPECT_THAT([&] { AddFile("b.jpg"); }, ThrowsCode(kCodeIndexPaused));
  el::ShareIndexResume("photo");
  AddFile("b.jpg");

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

  auto unavailable = [] {
    std::vector<std::string> dbs;
    el::ListUnAvailTermSuggDB(dbs);
    return dbs;
  };
  // The suggestions marked unavailable behind the daemon's back, as a lost table would be; the
  // library's rebuild makes them available again.
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(volume_.Path("elsewhere/db/index.db").c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(db, "UPDATE meta SET value='unavail' WHERE key='term_sugg'", nullptr,
                         nullptr, nullptr),
            SQLITE_OK);
  sqlite3_close(db);
  EXPECT_THAT(unavailable(), ElementsAre("fileindex_pics"));
  el::UpdateTermSuggestion("fileindex_pics", {a});
  el::IndexCommit("pics");
  EXPECT_TRUE(unavailable().empty());
  const Json::Value suggest = tc::Parse(R"({"command": "suggest", "data": {"prefix": "suns"}})");
  EXPECT_EQ(JsonToString(tc::Request(daemon_->socket(), suggest)["data"]["suggestions"]),
            "[\"sunset\"]");

  el::ShareIndexDelete("pics");
  el::ShareIndexDelete("pics");
  EXPECT_THAT([&] { el::IsDocumentExists("pics", a); }, ThrowsCode(kCodeIndexNotFound));
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
