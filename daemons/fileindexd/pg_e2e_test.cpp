// The whole system with the engine on a PostgreSQL database of the test's own: the database
// crashing and coming back in the middle of a folder's first indexing.
#include <signal.h>
#include <unistd.h>

#include <filesystem>
#include <set>

#include <gtest/gtest.h>

#include "fileindex/index_mgr.hpp"
#include "test/daemon_system.hpp"
#include "test/pg_server.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindexd {
namespace {

// Every entry below `root`, and `root`, as the disk names them.
std::set<std::string> Disk(const std::string& root) {
  std::set<std::string> out = {root};
  for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
    out.insert(entry.path().string());
  }
  return out;
}

class PgEndToEndTest : public ::testing::Test {
 protected:
  PgEndToEndTest() : sys_({"docs"}) {}

  void SetUp() override {
    setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
    sys_.WriteFolders(Json::Value(Json::arrayValue));
    engine_ = sys_.StartEngine({"--postgres", db_.conninfo(), "--server-name", "alpha"});
    notifyd_ = sys_.StartNotifyd();
    indexd_ = sys_.StartIndexd();
  }

  // The share's documents; none while the engine cannot reach the database.
  std::set<std::string> Documents() const {
    try {
      return sys_.Documents("docs");
    } catch (const std::exception&) {
      return {};
    }
  }

  // The documents of the share's index as the engine counts them.
  int64_t Counted() const {
    const Json::Value list = test::System::Engine("index_list", Json::Value());
    for (const Json::Value& index : list["data"]) {
      if (index["id"] == "fileindex_docs") return index["documents"].asInt64();
    }
    return -1;
  }

  // The database outlives the daemons that use it.
  orvane::test::PgServer db_;
  test::System sys_;
  std::unique_ptr<orvane::test::ChildProcess> engine_, notifyd_, indexd_;
};

// Batches refused while the database is down are kept by the indexer and sent again: in the
// end the index holds every entry of the disk, each once.
TEST_F(PgEndToEndTest, TheDatabaseCrashingInTheMiddleOfTheFirstIndexingLosesAndDoublesNothing) {
  const std::string folder = sys_.Vol("docs/tree");
  for (int d = 0; d < 40; ++d) {
    for (int f = 0; f < 500; ++f) {
      test::WriteFile(folder + "/d" + std::to_string(d) + "/file" + std::to_string(f) + ".txt",
                      "");
    }
  }
  Json::Value add(Json::arrayValue);
  add.append(test::System::Folder("/docs/tree", false));
  fileindex::FolderAdd(add, false);
  ASSERT_TRUE(test::WaitFor([&] { return Documents().size() > 500; }, 60000));
  db_.Stop(SIGQUIT);  // as a crash of the database server would
  ::sleep(2);
  db_.Start();

  const std::set<std::string> disk = Disk(folder);
  test::WaitFor([&] { return Documents() == disk; }, 180000);
  EXPECT_EQ(sys_.Documents("docs"), disk);
  // The engine's own count: a document written twice would show here.
  EXPECT_EQ(Counted(), static_cast<int64_t>(sys_.Documents("docs").size()));
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
