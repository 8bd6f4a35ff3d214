// A scratch system for the tests and benchmarks of the indexing daemon: its own ORVANE_ROOT, a
// volume folder with shares, the platform and folder files, and the daemons as real child
// processes, and the fixture that runs all three. Not thread-safe.
#ifndef ORVANE_TEST_DAEMON_SYSTEM_HPP_
#define ORVANE_TEST_DAEMON_SYSTEM_HPP_

#include <gtest/gtest.h>
#include <json/json.h>

#include <cstdlib>
#include <initializer_list>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "test/test_util.hpp"

namespace orvane {
namespace fileindexd {
namespace test {

using orvane::test::ChildProcess;
using orvane::test::WaitFor;
using orvane::test::WriteFile;

class System {
 public:
  // Makes the volume with the folders of `shares` and writes the platform file.
  explicit System(const std::vector<std::string>& shares);
  System(const System&) = delete;
  System& operator=(const System&) = delete;

  const std::string& root() const { return root_.path(); }
  // <volume>/<rel>.
  std::string Vol(const std::string& rel) const { return volume_.Path(rel); }
  std::string Queue(const std::string& share) const;
  // Replaces the folder file with these folders ({"path", "name", "document", ...} each).
  void WriteFolders(const Json::Value& folders) const;
  void WriteFolders(std::initializer_list<Json::Value> folders) const;
  static Json::Value Folder(const std::string& share_path, bool meta);

  // The search engine (waits until it answers), with these options, and the two other daemons.
  std::unique_ptr<ChildProcess> StartEngine(const std::vector<std::string>& options = {}) const;
  std::unique_ptr<ChildProcess> StartNotifyd() const;
  // Waits until the daemon's socket answers "status".
  std::unique_ptr<ChildProcess> StartIndexd() const;

  // The paths of every document of `share`'s index below its path (the share folder included).
  std::set<std::string> Documents(const std::string& share) const;
  // One request to the engine, its reply.
  static Json::Value Engine(const std::string& command, const Json::Value& data);

 private:
  orvane::test::TempDir root_;
  orvane::test::TempDir volume_;
  orvane::test::ScopedRoot scoped_root_;
};

// {"type": type, "data": data} to the daemon's socket, as the calling process; the reply, null
// when the daemon closed the connection without one.
Json::Value Command(const std::string& type, const Json::Value& data);
// Raw bytes to the daemon's socket; the raw reply payload.
std::string RawCommand(const std::string& bytes);

// A scratch System on the given shares with no folders yet, and the engine, the file-change
// daemon and the indexer started as real processes before each test; they are killed when the
// fixture goes.
class RunningSystemTest : public ::testing::Test {
 protected:
  explicit RunningSystemTest(const std::vector<std::string>& shares) : sys_(shares) {}

  void SetUp() override {
    setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
    sys_.WriteFolders(Json::Value(Json::arrayValue));
    engine_ = sys_.StartEngine();
    notifyd_ = sys_.StartNotifyd();
    indexd_ = sys_.StartIndexd();
  }

  System sys_;
  std::unique_ptr<ChildProcess> engine_;
  std::unique_ptr<ChildProcess> notifyd_;
  std::unique_ptr<ChildProcess> indexd_;
};

}  // namespace test
}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_TEST_DAEMON_SYSTEM_HPP_
