// A scratch root whose platform configuration lists shares on a scratch volume, for tests of the
// share lookups. Owns both directories; one per test, not thread-safe.
#ifndef ORVANE_TEST_SHARE_FIXTURE_HPP_
#define ORVANE_TEST_SHARE_FIXTURE_HPP_

#include <gtest/gtest.h>

#include <string>

#include "common/root.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace test {

class ShareFixture : public ::testing::Test {
 protected:
  // `entries` is the text inside the configuration's share array.
  void WriteShares(const std::string& entries) {
    WritePlatformConfig(root_.path(), R"({"shares": [)" + entries + "]}");
  }

  TempDir root_;
  ScopedRoot scoped_{root_.path()};
  TempDir volume_;
  const std::string vol_ = volume_.path();
};

}  // namespace test
}  // namespace orvane

#endif  // ORVANE_TEST_SHARE_FIXTURE_HPP_
