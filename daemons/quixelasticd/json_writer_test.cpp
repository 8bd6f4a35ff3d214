#include "daemons/quixelasticd/json_writer.hpp"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

#include "common/json_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

// The stored documents and replies must read back exactly as the common writer's text did.
TEST(CompactJsonTest, WritesWhatTheCommonWriterWrites) {
  Json::Value v;
  v["path"] = "/volume1/share/caf\xc3\xa9 \xe6\x97\xa5\xe6\x9c\xac/a \"quoted\" \\ name";
  v["controls"] = "tab\there\nline\x01\x1f\x7f end";
  v["nul"] = Json::Value(std::string("a\0b", 3));
  v["empty"] = "";
  v["min"] = static_cast<Json::Int64>(std::numeric_limits<int64_t>::min());
  v["max"] = static_cast<Json::UInt64>(std::numeric_limits<uint64_t>::max());
  v["neg"] = -42;
  v["real"] = 0.1;
  v["big"] = 1e300;
  v["whole"] = 3.0;
  v["flags"].append(true);
  v["flags"].append(false);
  v["flags"].append(Json::Value());
  v["nested"]["empty_array"] = Json::Value(Json::arrayValue);
  v["nested"]["empty_object"] = Json::Value(Json::objectValue);
  v["nested"]["list"].append(Json::Value(Json::objectValue))["k"] = 1;
  v["\xc3\xa9\"key\n"] = "unusual key";

  const std::string text = CompactJson(v);
  EXPECT_EQ(text, JsonToString(v));
  JsonValue back;
  ASSERT_TRUE(back.fromString(text)) << text;
  EXPECT_EQ(back["path"], v["path"]);
  EXPECT_EQ(back["nul"].asString(), std::string("a\0b", 3));
  EXPECT_EQ(back["max"].asLargestUInt(), std::numeric_limits<uint64_t>::max());

  for (const Json::Value& scalar : {Json::Value(), Json::Value("x"), Json::Value(7),
                                    Json::Value(Json::arrayValue), Json::Value(std::nan("")),
                                    Json::Value(-std::numeric_limits<double>::infinity())}) {
    EXPECT_EQ(CompactJson(scalar), JsonToString(scalar));
  }
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
