// For the tests of single extractors: a scratch folder, and one extractor run on a file in it as
// the dispatch would run it. Test-only; not thread-safe.
#ifndef ORVANE_EXTRACT_EXTRACTOR_TEST_UTIL_HPP_
#define ORVANE_EXTRACT_EXTRACTOR_TEST_UTIL_HPP_

#include <gtest/gtest.h>
#include <json/json.h>

#include <string>

#include "extract/extractor.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace extract {

class ExtractorTest : public ::testing::Test {
 protected:
  // The fields `extract` sets for the file at `path`; throws as the extractor does.
  static Json::Value Run(Extractor extract, const std::string& path) {
    Json::Value fields(Json::objectValue);
    extract(OpenedFile(path), fields);
    return fields;
  }

  test::TempDir dir_;
};

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_EXTRACTOR_TEST_UTIL_HPP_
