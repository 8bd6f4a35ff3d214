// The search-index commands against the real search-engine daemon, run from its binary under a
// scratch root: what the scripted engine checks by shape is checked here by effect.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <string>
#include <vector>

#include "common/comm.hpp"
#include "common/error.hpp"
#include "daemons/quixelasticd/test_client.hpp"
#include "fileindex/elastic_control.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace elastic {
namespace {

using ::testing::UnorderedElementsAre;

class RealEngineTest : public ::testing::Test {
 protected:
  RealEngineTest() : root_(dir_.path()) {
    chmod(dir_.path().c_str(), 0755);
    share_ = volume_.path() + "/photo";
    test::WritePlatformConfig(dir_.path(),
                              R"({"shares": [{"name": "photo", "path": ")" + share_ + R"("}]})");
  }
  void SetUp() override {
    daemon_ = std::make_unique<elasticd::tc::DaemonProcess>(dir_.path());
    ASSERT_TRUE(daemon_->WaitReady());
  }

  std::vector<std::string> Below(const std::string& dir) {
    std::vector<std::string> paths;
    IndexGetByPrefixPath("fileindex_photo", dir, paths);
    return paths;
  }

  test::TempDir dir_;
  test::TempDir volume_;
  test::ScopedRoot root_;
  test::FakeEnv env_;  // a not-ready engine is retried at once
  std::string share_;
  std::unique_ptr<elasticd::tc::DaemonProcess> daemon_;
};

TEST_F(RealEngineTest, DocumentsAreUpsertedRenamedAndDeleted) {
  const std::string trip = share_ + "/trip";
  const std::vector<std::string> files = {volume_.Write("photo/trip/a.JPG", "jpeg"),
                                          volume_.Write("photo/trip/sub/b \"q\"\n.txt", "t"),
                                          volume_.Write("photo/tripx.txt", "x")};
  ShareIndexCreate("photo");
  IndexUpsert("photo", trip, false);
  IndexUpsert("photo", trip + "/sub", false);
  for (const std::string& file : files) IndexUpsert("photo", file, true);
  IndexCommit("photo");
  EXPECT_TRUE(IsDocumentExists("photo", files[0]));
  EXPECT_FALSE(IsDocumentExists("photo", share_ + "/none"));
  EXPECT_THAT(Below(trip), UnorderedElementsAre(files[0], trip + "/sub", files[1]));
  IndexAttr("photo", files[0]);

  IndexRename("photo", share_ + "/journey", trip);
  IndexCommit("photo");
  EXPECT_TRUE(Below(trip).empty());
  const std::string journey = share_ + "/journey";
  EXPECT_THAT(Below(journey), UnorderedElementsAre(journey + "/a.JPG", journey + "/sub",
                                                   journey + "/sub/b \"q\"\n.txt"));
  EXPECT_THAT(Below(share_), ::testing::Contains(share_ + "/tripx.txt"));

  IndexDelDir("photo", journey);
  IndexDel("photo", files[2]);
  IndexCommit("photo");
  EXPECT_TRUE(Below(journey).empty());
  EXPECT_FALSE(IsDocumentExists("photo", files[2]));
  EXPECT_TRUE(IsDocumentExists("photo", journey));  // the directory's own document stays

  try {
    IndexAttr("photo", share_ + "/never");
    FAIL() << "no Error";
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrNoDocument);
  }

  std::vector<std::string> dbs;
  ListUnAvailTermSuggDB(dbs);
  UpdateTermSuggestion("fileindex_photo", {journey});
  ShareIndexPause("photo");
  ShareIndexResume("photo");
  ShareIndexDelete("photo");
}

TEST_F(RealEngineTest, RenameOfMoreThanOneBatchMovesEverything) {
  ShareIndexCreate("photo");
  const std::string dir = share_ + "/big";
  Json::Value batch;
  batch["compound"] = Json::Value(Json::arrayValue);
  for (int i = 0; i <= static_cast<int>(kRenameBatchSize) + 4; ++i) {
    const std::string parent = dir + (i % 3 ? "" : "/deeper");
    const std::string name = "f" + std::to_string(i);
    Json::Value req;
    req["command"] = "document_upsert_by_id";
    req["data"]["id"] = "fileindex_photo";
    req["data"]["doc_id"] = parent + "/" + name;
    req["data"]["data"]["QUIXMDPath"] = parent + "/" + name;
    req["data"]["data"]["QUIXMDFSName"] = name;
    req["data"]["data"]["QUIXMDParent"] = parent;
    batch["compound"].append(req);
  }
  SendRequest(batch);
  IndexUpsert("photo", volume_.Write("photo/big/real.txt", "r"), false);
  IndexUpsert("photo", dir, false);
  IndexCommit("photo");

  IndexRename("photo", share_ + "/moved", dir);
  IndexCommit("photo");
  EXPECT_TRUE(Below(dir).empty());
  // The engine pages at 10000 at most, so count the moved documents in two parts.
  auto count = [](const std::string& prefix) {
    Json::Value req;
    req["command"] = "document_get_by_query";
    req["data"]["id"] = "fileindex_photo";
    req["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"] = prefix;
    req["data"]["query"]["size"] = kRenameBatchSize;
    Json::Value res;
    SendRequest(res, req);
    return res["data"].size();
  };
  const unsigned deeper = (kRenameBatchSize + 5 + 2) / 3;  // every third of 10005 documents
  EXPECT_EQ(count(share_ + "/moved/deeper/"), deeper);
  EXPECT_EQ(count(share_ + "/moved/f"), kRenameBatchSize + 5 - deeper);
  EXPECT_EQ(count(share_ + "/moved/real"), 1u);
}

}  // namespace
}  // namespace elastic
}  // namespace fileindex
}  // namespace orvane
