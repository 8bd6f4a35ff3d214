// Test-only: the fixture of the end-to-end tests: a scratch System on the given shares with no
// folders yet, and the engine, the file-change daemon and the indexer started as real processes
// before each test. The fixture owns the processes; they are killed when it goes.
#ifndef ORVANE_TEST_E2E_FIXTURE_HPP_
#define ORVANE_TEST_E2E_FIXTURE_HPP_

#include <gtest/gtest.h>
#include <json/json.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "test/daemon_system.hpp"

namespace orvane {
namespace fileindexd {
namespace test {

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

#endif  // ORVANE_TEST_E2E_FIXTURE_HPP_
