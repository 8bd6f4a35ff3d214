#include "common/json_util.hpp"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>

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
