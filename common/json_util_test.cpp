#include "common/json_util.hpp"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cmath>
#include <csignal>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>

#include "test/test_util.hpp"

namespace orvane {
namespace {

JsonValue Parse(const std::string& text) {
  JsonValue v;
  EXPECT_TRUE(v.fromString(text)) << text;
  return v;
}

// Required members that are missing or of the wrong type throw one fixed text; optional ones
// leave the output as it was.
TEST(JsonUtilTest, GetJsonValueTypeRulesAndFailureTexts) {
  const JsonValue obj = Parse(R"({"s":"12","n":5,"r":3.0,"z":null,"b":true,"neg":-1})");
  int i = 7;
  GetJsonValue(i, obj, "s", false);
  GetJsonValue(i, obj, "missing", false);
  EXPECT_EQ(i, 7);
  GetJsonValue(i, obj, "r", true);
  EXPECT_EQ(i, 3);
  std::string s;
  GetJsonValue(s, obj, "n", true);
  EXPECT_EQ(s, "5");
  long long ll = 9;
  GetJsonValue(ll, obj, "r", false);  // a real is not an integer type here
  EXPECT_EQ(ll, 9);
  bool b = true;
  GetJsonValue(b, obj, "z", true);
  EXPECT_FALSE(b);
  unsigned int u = 3;
  GetJsonValue(u, obj, "neg", false);
  EXPECT_EQ(u, 3u);

  auto failure = [](const std::function<void()>& get) { return test::ErrorOf(get).message; };
  const JsonValue small = Parse(R"({"a":1,"b":true})");
  EXPECT_EQ(failure([&] { GetJsonValue(ll, small, "b", true); }),
            R"(Orvane error, code=120, reason=[Not a string, data={"a":1,"b":true}])");
  EXPECT_EQ(failure([&] { GetJsonValue(s, small, "c", true); }),
            R"(Orvane error, code=120, reason=[Missing property: c, data={"a":1,"b":true}])");
  Json::Value any;  // not an object throws even when the member is optional
  EXPECT_EQ(failure([&] { GetJsonValue(any, Parse("[1,2]"), "a", false); }),
            "Orvane error, code=120, reason=[Not an object, data=[1,2]]");
}

TEST(JsonUtilTest, ApplyChangesAndArrayConversions) {
  Json::Value dst = Parse(R"({"a":1,"b":2,"l":[1,2],"o":{"x":1,"y":2}})");
  JsonApplyChanges(dst,
                   Parse(R"({"a":null,"gone":null,"c":{"d":1},"l":[1],"o":{"y":null,"z":3}})"));
  EXPECT_EQ(JsonToString(dst), R"({"b":2,"c":{"d":1},"l":[1],"o":{"x":1,"z":3}})");

  EXPECT_EQ(JsonToString(Vec2JsonArr<std::string>({})), "[]");
  EXPECT_EQ(JsonToString(Vec2JsonArr<std::string>({"a", "b"})), R"(["a","b"])");
  EXPECT_EQ(JsonArr2Vec<std::string>(Parse(R"(["x",1,null,{}])")),
            (std::vector<std::string>{"x", "1", ""}));
  EXPECT_EQ(JsonArr2Vec<std::string>(Parse(R"({"b":"2","a":"1"})")),
            (std::vector<std::string>{"1", "2"}));
  EXPECT_TRUE(JsonArr2Vec<std::string>(Parse("7")).empty());
}

// The text must stay byte for byte what the library's compact writer produces: stored
// documents and queue lines written before are compared and re-read as text.
TEST(JsonUtilTest, WriterMatchesTheLibraryWriter) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  Json::Value v = Parse(
      "{\"path\":\"/v/caf\xc3\xa9 \xe6\x97\xa5/a \\\"q\\\" \\\\ n\",\"\xc3\xa9\\\"key\\n\":\"\","
      "\"controls\":\"tab\\there\\nline\\u0001\\u001f\x7f end\",\"nul\":\"a\\u0000b\","
      "\"min\":-9223372036854775808,\"max\":18446744073709551615,\"reals\":[0.1,1e300,3.0],"
      "\"flags\":[true,null],\"nested\":{\"empty_array\":[],\"list\":[{\"k\":1}]}}");
  v["reals"].append(std::nan(""));
  v["reals"].append(-std::numeric_limits<double>::infinity());
  EXPECT_EQ(JsonToString(v), Json::writeString(builder, v));
}

// The general reader with the settings the system has always parsed with. Random texts are
// compared by the fuzz harness; these are the corners it may take long to reach.
void ExpectSameAsLibrary(const std::string& text) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["failIfExtra"] = true;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value expected;
  bool expected_ok = false;
  try {
    expected_ok = reader->parse(text.data(), text.data() + text.size(), &expected, nullptr);
  } catch (const std::exception&) {
  }
  JsonValue got;
  ASSERT_EQ(got.fromString(text), expected_ok) << text;
  if (!expected_ok) {
    EXPECT_TRUE(got.isNull()) << text;
    return;
  }
  // Types too: an integer read as a real, or signed as unsigned, would change later output.
  ASSERT_EQ(JsonToString(got), JsonToString(expected)) << text;
  ASSERT_EQ(got, expected) << text;
}

TEST(JsonUtilTest, ReaderAgreesWithTheLibraryReader) {
  for (const char* text :
       {// Strings: escapes, surrogates paired and lone, raw control and non-UTF-8 bytes.
        "\"\\u00e9\\u0000z\"", "\"\\ud83d\\ude00\"", "\"\\udc00\"", "\"\\ud800x\"",
        "\"\\/\\b\\f\\n\\r\\t\\\"\\\\\"", "\"\\q\"", "\"raw\x01\ttab\xff\"",
        "{\"p\":\"caf\xc3\xa9\"}", "'single'", "\"unterminated",
        // Numbers at the edges of their types and of the grammar.
        "-0", "01", "1.", ".5", "1E+05", "2e-3", "9223372036854775807", "9223372036854775808",
        "18446744073709551615", "18446744073709551616", "-9223372036854775808",
        "-9223372036854775809", "1e400", "-1e400", "1e-400", "4.9e-324", "0.1",
        "123456789012345678901234567890.5", "NaN", "-Infinity", "+1", "0x10", "1e+",
        // Structure: trailing commas and text, comments, a byte-order mark, repeated keys.
        " {\"a\" : [1, -2, 3.5, true, false, null, \"x\"]} ", "[1,]", "{\"a\":1,}",
        "{\"a\":1 \"b\":2}", "{\"a\":1}x", "{\"a\":1}\n", "// c\n{}", "{/*c*/}", "\xef\xbb\xbf{}",
        "{\"a\":{\"x\":1},\"a\":{\"y\":2}}", "tru", "{\"a\"}", "{1:2}", "", "   "}) {
    ExpectSameAsLibrary(text);
  }
  // Nesting is bounded: deep texts fail like the library's rather than overflow the stack.
  for (size_t depth : {300, 1200, 5000}) {
    ExpectSameAsLibrary(std::string(depth, '[') + std::string(depth, ']'));
  }
  ExpectSameAsLibrary(std::string("{\"k\\u0000\":1}"));
  ExpectSameAsLibrary(std::string("{\"a\":1}\0garbage", 15));
}

// A file-size limit makes the write come up short exactly as a full disk does.
TEST(JsonUtilTest, FilesRoundTripAndAFullDiskKeepsTheOldFile) {
  test::TempDir dir;
  const std::string path = dir.Path("etc/sub/cfg.json");
  const JsonValue old = Parse(R"({"k":[1,2,3]})");
  ASSERT_TRUE(old.toFile(path));  // parents are created
  struct stat st;
  ASSERT_EQ(stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  JsonValue back;
  EXPECT_FALSE(back.fromFile(dir.Path("missing.json")));
  EXPECT_FALSE(back.fromFile(dir.Write("bad.json", "{\"k\":")));

  pid_t pid = fork();
  if (pid == 0) {
    signal(SIGXFSZ, SIG_IGN);
    struct rlimit lim = {16, 16};
    setrlimit(RLIMIT_FSIZE, &lim);
    JsonValue big;
    big["data"] = std::string(4096, 'x');
    _exit(big.toFile(path) ? 1 : 0);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  ASSERT_TRUE(back.fromFile(path));
  EXPECT_EQ(back, old);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.Path("etc/sub")), {}),
            1);  // no temporary
}

}  // namespace
}  // namespace orvane
