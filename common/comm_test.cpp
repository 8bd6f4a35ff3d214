#include "common/comm.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace {

using test::FakeDaemon;
using ::testing::HasSubstr;

// A scratch ORVANE_ROOT with a fake clock, a log capture and a recording notifier program.
class CommTest : public ::testing::Test {
 protected:
  CommTest() : root_(dir_.path()) {
    const std::string notifier = dir_.Write(
        "usr/libexec/fileindex/quixzrmnotify", "#!/bin/sh\necho \"$*\" >> \"$(dirname \"$0\")/notified\"\n");
    chmod(notifier.c_str(), 0755);
  }

  std::string SockPath() const { return dir_.Path("var/run/quixelasticd.sock"); }
  std::string Notified() const { return test::ReadFile(dir_.Path("usr/libexec/fileindex/notified")); }

  // The Error SendRequestImpl throws.
  Error ImplError(const Json::Value& req) {
    Json::Value res;
    return test::ErrorOf([&] { SendRequestImpl(res, req); });
  }

  test::TempDir dir_;
  test::ScopedRoot root_;
  test::FakeEnv env_;
  test::LogCapture log_;
};

Json::Value Req(const std::string& command) {
  Json::Value req;
  req["command"] = command;
  req["data"]["id"] = "fileindex_photo";
  return req;
}

TEST_F(CommTest, MissingSocketIsWaitedForThirtyOneSecondsThenConnectFails) {
  const Error e = ImplError(Req("commit"));
  EXPECT_EQ(e.code, kErrElastic);
  EXPECT_STREQ(e.what(), "Orvane error, code=913, reason=[Connect failed]");
  EXPECT_EQ(env_.sleeps(), std::vector<int64_t>(31, 1000000));
  const std::vector<std::string> lines = log_.Lines();
  ASSERT_EQ(lines.size(), 32u);
  EXPECT_THAT(lines[30], ::testing::EndsWith("elastic socket is not ready, retry ... 31"));
  EXPECT_THAT(lines[31],
              HasSubstr("(SendRequestImpl) Failed [!conn.Connect(kElasticdConnectTimeout)], "
                        "reason: Orvane error, code=913, reason=[Connect failed]"));
}

TEST_F(CommTest, SuccessfulExchangeReturnsTheWholeReplyAndKeepsEveryByteOfTheRequest) {
  FakeDaemon engine(SockPath(), FakeDaemon::Replies({R"({"success":true,"data":[{"a":1}]})"}));
  Json::Value req = Req("document_del_by_id");
  // Quotes, backslashes, a newline, non-ASCII text and bytes that are not UTF-8 at all.
  const std::string path = "/v/s/\"q\"\\b\nl\xC3\xA9\xE6\x97\xA5/\xFF\xC3(\x80";
  req["data"]["doc_id"] = path;
  Json::Value res;
  SendRequestImpl(res, req);
  EXPECT_EQ(res["data"][0]["a"].asInt(), 1);
  ASSERT_EQ(engine.json_requests().size(), 1u);
  EXPECT_EQ(engine.json_requests()[0], req);
  EXPECT_TRUE(env_.sleeps().empty());
  EXPECT_TRUE(log_.Lines().empty());
}

// Malformed replies and a daemon that closes without answering end in Error 913 with the text
// as parsed; the ways a frame can break are the wire's own to tell apart.
TEST_F(CommTest, BrokenRepliesAreError913) {
  const std::vector<std::pair<FakeDaemon::Handler, std::string>> cases = {
      {FakeDaemon::Replies({"{}"}), "{}"},
      {FakeDaemon::Replies({R"({"success":"yes"})"}), R"({"success":"yes"})"},
      {[](int, const std::string&) {}, "null"},
  };
  for (const auto& [handler, parsed] : cases) {
    SCOPED_TRACE(parsed);
    FakeDaemon engine(SockPath(), handler);
    log_.Clear();
    const Error e = ImplError(Req("commit"));
    EXPECT_EQ(e.code, kErrElastic);
    EXPECT_EQ(std::string(e.what()),
              "Orvane error, code=913, reason=[Recv failed, res=" + parsed + "]");
    ASSERT_EQ(log_.Lines().size(), 1u);
    EXPECT_THAT(log_.Lines()[0],
                HasSubstr("Failed [!conn.Recv(resp_raw) || !res.fromString(resp_raw) || "
                          "!res.isMember(\"success\") || !res[\"success\"].isBool()]"));
  }
}

// Replies whose parts have unexpected types end in an Error or are passed over, never in a
// crash or a JSON library exception.
TEST_F(CommTest, OddlyTypedRepliesAreHandled) {
  Json::Value compound_req;
  compound_req["compound"].append(Req("sub"));
  FakeDaemon engine(
      SockPath(), FakeDaemon::Replies(
                      {R"({"success":false,"error":"x"})",
                       R"({"success":false,"error":{"code":"1400","msg":"m"}})",
                       R"({"success":true,"has_fail":true,"data":{"a":1}})",
                       R"({"success":true,"has_fail":"yes","data":[{"success":false}]})",
                       R"({"success":true,"has_fail":true,"data":[1,{"success":"no"}]})",
                       R"({"success":true,"has_fail":true,"data":[{"success":false,"error":{}}]})",
                       R"({"success":false,"error":{"code":609}})"}));
  EXPECT_THAT(ImplError(Req("commit")).what(), HasSubstr("Not an object, data=\"x\""));
  EXPECT_THAT(ImplError(Req("commit")).what(), HasSubstr("Not a string"));
  Json::Value res;
  for (int i = 0; i < 3; ++i) SendRequestImpl(res, compound_req);
  EXPECT_THAT(ImplError(compound_req).what(), HasSubstr("Missing property: code"));
  const Error e = ImplError(Req("commit"));
  EXPECT_EQ(e.code, kErrInvalidParam);
  EXPECT_THAT(e.what(), HasSubstr("Missing property: msg, data={\"code\":609}"));
}

TEST_F(CommTest, CompoundFailuresAreLoggedUnlessTheDaemonWasBusy) {
  Json::Value req;
  for (int i = 0; i < 3; ++i) req["compound"].append(Req("sub" + std::to_string(i)));
  FakeDaemon engine(
      SockPath(),
      FakeDaemon::Replies(
          {R"({"success":true,"has_fail":true,"data":[{"success":false,"error":{"code":5,"msg":"m0"}},
               {"success":true},{"success":false,"error":{"code":7,"msg":"m2"}}]})",
           R"({"success":true,"has_fail":true,"data":[{"success":false,"error":{"code":5,"msg":"m0"}},
               {"success":false,"error":{"code":1401,"msg":"full"}},
               {"success":false,"error":{"code":7,"msg":"m2"}}]})",
           R"({"success":true,"has_fail":true,"data":[{"success":false,"error":{"code":5,"msg":"m0"}}]})"}));
  Json::Value res;
  errno = 0;  // the line gains " [err: ...]" only when errno is set
  SendRequestImpl(res, req);
  EXPECT_EQ(res["data"].size(), 3u);
  ASSERT_EQ(log_.Lines().size(), 2u);
  EXPECT_THAT(log_.Lines()[0], ::testing::EndsWith("(SendRequestImpl) Compound failed: " +
                                                   JsonToString(req["compound"][0]) + " (5) m0"));
  EXPECT_THAT(log_.Lines()[1],
              HasSubstr("Compound failed: " + JsonToString(req["compound"][2]) + " (7) m2"));

  log_.Clear();
  const Error e = ImplError(req);  // entry 0 logged, entry 1 stops the walk
  EXPECT_EQ(static_cast<int>(e.code), kCodeOverloaded);
  EXPECT_STREQ(e.what(), "Orvane error, code=1401, reason=[full]");
  EXPECT_EQ(log_.Lines().size(), 1u);

  // "has_fail" means nothing for a request that is not compound.
  log_.Clear();
  SendRequestImpl(res, Req("commit"));
  EXPECT_TRUE(log_.Lines().empty());
}

TEST_F(CommTest, NotReadyIsRetriedEveryThirtySecondsButNot609) {
  FakeDaemon engine(SockPath(),
                    FakeDaemon::Replies({R"({"success":false,"error":{"code":607,"msg":"a"}})",
                                         R"({"success":false,"error":{"code":608,"msg":"b"}})",
                                         R"({"success":false,"error":{"code":610,"msg":"c"}})",
                                         R"({"success":true,"data":7})",
                                         R"({"success":false,"error":{"code":609,"msg":"d"}})"}));
  Json::Value res;
  fileindex::elastic::SendRequest(res, Req("commit"));
  EXPECT_EQ(res["data"].asInt(), 7);
  EXPECT_EQ(env_.sleeps(), std::vector<int64_t>(3, 30000000));
  EXPECT_EQ(log_.Count("DB is not good yet, retry... (Error Code: 60"), 2);
  EXPECT_EQ(log_.Count("DB is not good yet, retry... (Error Code: 610)"), 1);
  ASSERT_EQ(engine.requests().size(), 4u);
  for (const Json::Value& sent : engine.json_requests()) EXPECT_EQ(sent, Req("commit"));

  const Error e = test::ErrorOf([] { fileindex::elastic::SendRequest(Req("commit")); });
  EXPECT_EQ(static_cast<int>(e.code), kCodeIndexDamaged);
  EXPECT_STREQ(e.what(), "Orvane error, code=609, reason=[Request failed, msg=d]");
  EXPECT_EQ(log_.Lines().size(), 3u);  // the daemon's own failure is not logged here
  EXPECT_EQ(env_.sleeps().size(), 3u);
  EXPECT_EQ(engine.requests().size(), 5u);
}

TEST_F(CommTest, BusyIsRetriedForFifteenToNineteenMinutesAndNotifiesOncePerCall) {
  const std::string busy = R"({"success":false,"error":{"code":1400,"msg":"oom"}})";
  std::vector<std::string> replies(12, busy);  // twelve busy answers, then success
  replies.push_back(R"({"success":true})");
  replies.insert(replies.end(), 11, busy);  // the next call: eleven busy answers
  replies.push_back(R"({"success":true})");
  FakeDaemon engine(SockPath(), FakeDaemon::Replies(replies));
  env_.QueueRand({0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11});

  fileindex::elastic::SendRequest(Req("document_upsert_by_id"));
  ASSERT_EQ(env_.sleeps().size(), 12u);
  for (int i = 0; i < 12; ++i) EXPECT_EQ(env_.sleeps()[i], (900 + 60 * (i % 5)) * 1000000LL);
  EXPECT_EQ(log_.Count("] since quixelasticd is busy. Command: document_upsert_by_id, "
                       "db: fileindex_photo"),
            12);
  const std::string notice =
      "-c QUIX.Orvane.Application @administrators app:displayname error:lack_of_memory\n";
  EXPECT_EQ(Notified(), notice);

  // A new call counts from 0 again and notifies on its own eleventh busy answer.
  fileindex::elastic::SendRequest(Req("document_upsert_by_id"));
  EXPECT_EQ(env_.sleeps().size(), 23u);
  EXPECT_EQ(Notified(), notice + notice);
}

}  // namespace
}  // namespace orvane
