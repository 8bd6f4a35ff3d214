// The search-index commands against the real search-engine daemon, run from its binary under a
// scratch root: what the scripted engine checks by shape is checked here by effect.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "common/comm.hpp"
#include "daemons/quixelasticd/test_client.hpp"
#include "fileindex/elastic_control.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace elastic {
namespace {

namespace tc = elasticd::tc;

class RealEngineTest : public ::testing::Test {
 protected:
  RealEngineTest() {
    chmod(dir_.path().c_str(), 0755);
    test::WritePlatformConfig(dir_.path(),
                              R"({"shares": [{"name": "photo", "path": ")" + share_ + R"("}]})");
  }
  void SetUp() override {
    daemon_ = std::make_unique<tc::DaemonProcess>(dir_.path());
    ASSERT_TRUE(daemon_->WaitReady());
  }
  // The number of documents below `prefix`, counted in one query of the engine's largest page.
  unsigned Count(const std::string& prefix) {
    Json::Value req = tc::OnIndex("document_get_by_query", "fileindex_photo");
    req["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"] = prefix;
    req["data"]["query"]["size"] = kRenameBatchSize;
    Json::Value res;
    SendRequest(res, req);
    return res["data"].size();
  }

  test::TempDir dir_;
  test::TempDir volume_;
  test::ScopedRoot root_{dir_.path()};
  test::FakeEnv env_;  // a not-ready engine is retried at once
  std::string share_ = volume_.path() + "/photo";
  std::unique_ptr<tc::DaemonProcess> daemon_;
};

// More documents than one rename pass, real extracted files among them (one with a quote and a
// newline in its name), and a sibling whose name only begins like the renamed folder's. The
// library test of the engine checks the other commands against it.
TEST_F(RealEngineTest, EveryDocumentMovesAcrossRenamePasses) {
  ShareIndexCreate("photo");
  const std::string dir = share_ + "/big";
  std::vector<Json::Value> bulk;
  for (unsigned i = 0; i < kRenameBatchSize + 5; ++i)
    bulk.push_back(
        tc::Upsert(dir + (i % 3 ? "" : "/deeper") + "/f" + std::to_string(i), "fileindex_photo"));
  SendRequest(tc::Compound(bulk));
  const std::string odd = volume_.Write("photo/big/sub/b \"q\"\n.txt", "t");
  const std::string sibling = volume_.Write("photo/bigx.txt", "x");
  for (const std::string& path : {dir, dir + "/sub", odd, sibling})
    IndexUpsert("photo", path, true);
  IndexCommit("photo");
  EXPECT_TRUE(IsDocumentExists("photo", odd));
  IndexAttr("photo", odd);

  const std::string moved = share_ + "/moved";
  IndexRename("photo", moved, dir);
  IndexCommit("photo");
  EXPECT_EQ(Count(dir + "/"), 0u);
  const unsigned deeper = (kRenameBatchSize + 5 + 2) / 3;  // every third document
  EXPECT_EQ(Count(moved + "/deeper/"), deeper);
  EXPECT_EQ(Count(moved + "/f"), kRenameBatchSize + 5 - deeper);
  EXPECT_TRUE(IsDocumentExists("photo", moved + "/sub/b \"q\"\n.txt"));
  EXPECT_TRUE(IsDocumentExists("photo", sibling));

  // Deleting a folder's documents keeps the folder's own.
  IndexDelDir("photo", moved);
  IndexCommit("photo");
  EXPECT_EQ(Count(moved + "/"), 0u);
  EXPECT_TRUE(IsDocumentExists("photo", moved));
}

}  // namespace
}  // namespace elastic
}  // namespace fileindex
}  // namespace orvane
