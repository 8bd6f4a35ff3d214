#include "common/json_util.hpp"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <functional>
#include <cmath>
#include <limits>
#include <memory>
#include <random>

#include "test/test_util.hpp"

namespace orvane {
namespace {

JsonValue Parse(const std::string& text) {
  JsonValue v;
  EXPECT_TRUE(v.fromString(text)) << text;
  return v;
}

template <typename T>
std::string RequiredFailure(const std::string& text, const std::string& key) {
  T out{};
  try {
    GetJsonValue<T>(out, Parse(text), key, true);
  } catch (const Error& e) {
    EXPECT_EQ(e.code, kErrInvalidParam);
    return e.what();
  }
  return "no error";
}

TEST(JsonUtilTest, GetJsonValueFailureTexts) {
  EXPECT_EQ(RequiredFailure<int>(R"({"n":"12"})", "n"),
            R"(Orvane error, code=120, reason=[Not a string, data={"n":"12"}])");
  EXPECT_EQ(RequiredFailure<std::string>(R"({"a":1})", "b"),
            R"(Orvane error, code=120, reason=[Missing property: b, data={"a":1}])");
  // Not an object, whether required or not.
  Json::Value out;
  try {
    GetJsonValue<Json::Value>(out, Parse("[1,2]"), "a", false);
    FAIL();
  } catch (const Error& e) {
    EXPECT_STREQ(e.what(), "Orvane error, code=120, reason=[Not an object, data=[1,2]]");
  }
}

TEST(JsonUtilTest, GetJsonValueTypeRules) {
  const JsonValue obj = Parse(R"({"s":"12","n":5,"r":3.0,"z":null,"b":true,"neg":-1})");
  int i = 7;
  GetJsonValue(i, obj, "s", false);  // wrong type, not required: untouched
  EXPECT_EQ(i, 7);
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
  GetJsonValue(ll, obj, "n", true);
  EXPECT_EQ(ll, 5);
  bool b = true;
  GetJsonValue(b, obj, "z", true);
  EXPECT_FALSE(b);
  unsigned int u = 3;
  GetJsonValue(u, obj, "neg", false);
  EXPECT_EQ(u, 3u);
  double d = 0;
  GetJsonValue(d, obj, "n", true);
  EXPECT_EQ(d, 5.0);
  Json::Value any;
  GetJsonValue(any, obj, "z", true);
  EXPECT_TRUE(any.isNull());
  EXPECT_THROW(GetJsonValue(ll, obj, "b", true), Error);
}

TEST(JsonUtilTest, ApplyChangesDeletesDescendsAndReplaces) {
  Json::Value dst = Parse(R"({"a":1,"b":2,"l":[1,2],"o":{"x":1,"y":2}})");
  JsonApplyChanges(dst,
                   Parse(R"({"a":null,"gone":null,"c":{"d":1},"l":[1],"o":{"y":null,"z":3}})"));
  EXPECT_EQ(JsonToString(dst), R"({"b":2,"c":{"d":1},"l":[1],"o":{"x":1,"z":3}})");
  JsonApplyChanges(dst, Parse("{}"));
  EXPECT_EQ(JsonToString(dst), R"({"b":2,"c":{"d":1},"l":[1],"o":{"x":1,"z":3}})");
}

TEST(JsonUtilTest, ArrayConversions) {
  EXPECT_EQ(JsonToString(Vec2JsonArr<std::string>({})), "[]");
  EXPECT_EQ(JsonToString(Vec2JsonArr<std::string>({"a", "b"})), R"(["a","b"])");
  EXPECT_EQ(JsonArr2Vec<std::string>(Parse(R"(["x",1,null,{}])")),
            (std::vector<std::string>{"x", "1", ""}));
  EXPECT_EQ(JsonArr2Vec<std::string>(Parse(R"({"b":"2","a":"1"})")),
            (std::vector<std::string>{"1", "2"}));
  EXPECT_TRUE(JsonArr2Vec<std::string>(Parse("7")).empty());
}

TEST(JsonUtilTest, ParsingRejectsWhatIsNotOneJsonText) {
  JsonValue v;
  EXPECT_FALSE(v.fromString(""));
  EXPECT_FALSE(v.fromString("{\"a\":1} trailing"));
  EXPECT_FALSE(v.fromString(std::string(5000, '[')));  // nesting bounded, no stack overflow
  EXPECT_TRUE(v.isNull());
  EXPECT_TRUE(v.fromString("{\"p\":\"caf\xc3\xa9\"}"));
  EXPECT_EQ(v.toString(), "{\"p\":\"caf\xc3\xa9\"}");
}

// The text must stay byte for byte what the library's compact writer produces: stored
// documents and queue lines written before are compared and re-read as text.
TEST(JsonUtilTest, WriterMatchesTheLibraryWriter) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  Json::Value v;
  v["path"] = "/volume1/share/caf\xc3\xa9 \xe6\x97\xa5\xe6\x9c\xac/a \"quoted\" \\ name";
  v["controls"] = "tab\there\nline\x01\x1f\x7f end";
  v["nul"] = Json::Value(std::string("a\0b", 3));
  v["min"] = static_cast<Json::Int64>(std::numeric_limits<int64_t>::min());
  v["max"] = static_cast<Json::UInt64>(std::numeric_limits<uint64_t>::max());
  v["reals"].append(0.1);
  v["reals"].append(1e300);
  v["reals"].append(3.0);
  v["reals"].append(std::nan(""));
  v["reals"].append(-std::numeric_limits<double>::infinity());
  v["flags"].append(true);
  v["flags"].append(Json::Value());
  v["nested"]["empty_array"] = Json::Value(Json::arrayValue);
  v["nested"]["list"].append(Json::Value(Json::objectValue))["k"] = 1;
  v["\xc3\xa9\"key\n"] = "";
  EXPECT_EQ(JsonToString(v), Json::writeString(builder, v));
  EXPECT_EQ(JsonToString(Json::Value("x")), "\"x\"");
}

// The general reader with the settings the system has always parsed with.
bool LibraryParse(const std::string& text, Json::Value* out) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["failIfExtra"] = true;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  try {
    return reader->parse(text.data(), text.data() + text.size(), out, nullptr);
  } catch (const std::exception&) {
    return false;
  }
}

void ExpectSameAsLibrary(const std::string& text) {
  Json::Value expected;
  const bool expected_ok = LibraryParse(text, &expected);
  JsonValue got;
  const bool ok = got.fromString(text);
  ASSERT_EQ(ok, expected_ok) << text;
  if (!ok) return;
  // Types too: an integer read as a real, or signed as unsigned, would change later output.
  ASSERT_EQ(JsonToString(got), JsonToString(expected)) << text;
  ASSERT_EQ(got, expected) << text;
}

TEST(JsonUtilTest, ReaderAgreesWithTheLibraryReader) {
  for (const char* text :
       {"{}", "[]", " {\"a\" : [1, -2, 3.5, true, false, null, \"x\"]} ", "\"\\u00e9\\u0000z\"",
        "\"\\ud83d\\ude00\"", "\"\\udc00\"", "\"\\ud800x\"", "\"\\/\\b\\f\\n\\r\\t\\\"\\\\\"",
        "\"\\q\"", "\"raw\x01\ttab\xff\"", "0", "-0", "01", "1.", ".5", "-", "1e5", "1E+05", "2e-3",
        "9223372036854775807", "9223372036854775808", "18446744073709551615",
        "18446744073709551616", "-9223372036854775808", "-9223372036854775809", "1e400",
        "-1e400", "1e-400", "4.9e-324", "0.1", "123456789012345678901234567890.5", "[1,]",
        "{\"a\":1,}", "{\"a\":1 \"b\":2}", "{\"a\":1}x", "{\"a\":1}\n", "// c\n{}", "{/*c*/}", "\xef\xbb\xbf{}", "{\"a\":{\"x\":1},\"a\":{\"y\":2}}", "tru", "nul",
        "[[[[[[]]]]]]", "{\"a\"}", "{1:2}", "[1 2]", "", "   ", "\"unterminated", "'single'",
        "NaN", "Infinity", "-Infinity", "+1", "0x10", "1e", "1e+", "[\"a\",]"}) {
    ExpectSameAsLibrary(text);
  }
  ExpectSameAsLibrary(std::string(300, '[') + std::string(300, ']'));
  ExpectSameAsLibrary(std::string(1200, '[') + std::string(1200, ']'));
  ExpectSameAsLibrary(std::string("{\"k\\u0000\":1}"));
  ExpectSameAsLibrary(std::string("{\"a\":1}\0garbage", 15));
}

// Random documents in random spacing, then the same texts damaged byte by byte.
TEST(JsonUtilTest, ReaderAgreesWithTheLibraryReaderOnRandomTexts) {
  std::mt19937 rng(20261122);
  const char* const kAtoms[] = {"0", "-0", "7", "-12", "3.25", "-1e-7", "6.02E23", "1e308",
                                "18446744073709551615", "-9223372036854775808", "true", "false",
                                "null", "\"\"", "\"a b\"", "\"\\u20ac\\n\\\"\"", "\"\xc3\xa9\""};
  const char* const kSpace[] = {"", " ", "\n", "\t ", "\r\n"};
  std::function<std::string(int)> gen = [&](int depth) -> std::string {
    const unsigned kind = depth > 4 ? 0 : rng() % 4;
    auto sp = [&] { return std::string(kSpace[rng() % 5]); };
    if (kind < 2) return kAtoms[rng() % (sizeof(kAtoms) / sizeof(kAtoms[0]))];
    std::string s(1, kind == 2 ? '[' : '{');
    const unsigned n = rng() % 4;
    for (unsigned i = 0; i < n; ++i) {
      if (i > 0) s += sp() + "," + sp();
      if (kind == 3) s += "\"k" + std::to_string(rng() % 3) + "\"" + sp() + ":" + sp();
      s += gen(depth + 1);
    }
    return s + sp() + (kind == 2 ? ']' : '}');
  };
  const char kBytes[] = "{}[],:\"\\ue0-.+9/\x01\x80 ";
  for (int i = 0; i < 4000; ++i) {
    std::string text = gen(0);
    ExpectSameAsLibrary(text);
    for (int m = 0; m < 3 && !text.empty(); ++m) {
      const size_t at = rng() % text.size();
      switch (rng() % 3) {
        case 0: text[at] = kBytes[rng() % (sizeof(kBytes) - 1)]; break;
        case 1: text.erase(at, 1); break;
        default: text.insert(at, 1, kBytes[rng() % (sizeof(kBytes) - 1)]);
      }
      ExpectSameAsLibrary(text);
    }
  }
}

TEST(JsonUtilTest, FileRoundTripIsAtomicAndCreatesParents) {
  test::TempDir dir;
  const std::string path = dir.Path("etc/sub/cfg.json");
  JsonValue v = Parse(R"({"k":[1,2,3]})");
  ASSERT_TRUE(v.toFile(path));
  struct stat st;
  ASSERT_EQ(stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  JsonValue back;
  ASSERT_TRUE(back.fromFile(path));
  EXPECT_EQ(back, v);

  // A write that cannot complete leaves the old file whole and no temporary behind.
  ASSERT_EQ(chmod(dir.Path("etc/sub").c_str(), 0555), 0);
  if (geteuid() != 0) {
    EXPECT_FALSE(Parse("{}").toFile(path));
    ASSERT_TRUE(back.fromFile(path));
    EXPECT_EQ(back, v);
  }
  chmod(dir.Path("etc/sub").c_str(), 0755);
  EXPECT_FALSE(back.fromFile(dir.Path("missing.json")));
  dir.Write("bad.json", "{\"k\":");
  EXPECT_FALSE(back.fromFile(dir.Path("bad.json")));
}

TEST(JsonUtilTest, WriteToFullDiskFailsCleanly) {
  // A file-size limit makes the write come up short exactly as a full disk does.
  test::TempDir dir;
  const std::string path = dir.Path("cfg.json");
  ASSERT_TRUE(Parse(R"({"old":true})").toFile(path));
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
  JsonValue back;
  ASSERT_TRUE(back.fromFile(path));
  EXPECT_TRUE(back["old"].asBool());
}

}  // namespace
}  // namespace orvane
