#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"
#include "tools/fileindexctl/cli.hpp"

namespace orvane {
namespace ctl {
namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

using Result = test::ProgramResult;

class CtlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(mkdir(dir_.Path("vol").c_str(), 0755), 0);
    ASSERT_EQ(mkdir(docs_.c_str(), 0755), 0);
    ASSERT_EQ(mkdir((docs_ + "/reports").c_str(), 0755), 0);
    test::WritePlatformConfig(dir_.path(), R"({"shares": [{"name": "docs", "path": ")" + docs_ +
                                               R"("}], "admin_group": "root"})");
    MakeParentDirs(dir_.Path("var/run/x"));
  }
  Result Run(std::vector<std::string> args) {
    return test::RunProgram(FILEINDEXCTL_BIN, args, dir_.path());
  }

  test::TempDir dir_;
  std::string docs_ = dir_.Path("vol/docs");
};

using Case = std::pair<std::vector<std::string>, std::string>;

TEST_F(CtlTest, HelpAndCommandLineMistakes) {
  for (const auto& [args, text] :
       std::vector<Case>{{{"--help"}, "\n  folder add "},
                         {{"folder", "--help"}, "\n  folder reindex "},
                         {{"search", "--help"}, "usage: fileindexctl search [KEYWORDS...]"}}) {
    const Result r = Run(args);
    EXPECT_EQ(r.status, 0) << text;
    EXPECT_THAT(r.out, HasSubstr(text));
  }
  EXPECT_THAT(Run({"folder", "--help"}).out, ::testing::Not(HasSubstr("share rename")));
  // A mistake is one line on the error stream, then the usage.
  for (const auto& [args, text] : std::vector<Case>{
           {{}, ""},
           {{"frobnicate"}, "fileindexctl: unknown command \"frobnicate\""},
           {{"folder", "get"}, "fileindexctl: missing PATH\nusage: fileindexctl folder get"},
           {{"folder", "list", "--colour", "red"}, "fileindexctl: unknown option --colour\n"},
           {{"folder", "add", "/docs/reports", "--audio", "maybe"},
            "fileindexctl: --audio takes on or off\n"},
           {{"search"}, "fileindexctl: give keywords"}}) {
    const Result r = Run(args);
    EXPECT_EQ(r.status, 2) << text;
    EXPECT_THAT(r.err, StartsWith(text));
  }
}

// The administration road end to end through the program, with stand-ins for the two daemons
// that answer every command with success.
TEST_F(CtlTest, FolderLifecycleWithHumanAndJsonOutput) {
  const std::string ok = R"({"success":true,"data":{}})";
  test::FakeDaemon engine(dir_.Path("var/run/quixelasticd.sock"), test::FakeDaemon::Replies({ok}));
  test::FakeDaemon indexer(dir_.Path("var/run/fileindexd.sock"), test::FakeDaemon::Replies({ok}));

  // A folder named by its place on disk is stored by its share path.
  Result r = Run({"folder", "add", docs_ + "/reports", "--name", "Reports", "--photo", "on"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("added 1 folder(s)"));

  r = Run({"folder", "list"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, AllOf(HasSubstr("/docs/reports"), HasSubstr("document,photo"),
                           HasSubstr("1 of 1 folder(s)")));

  JsonValue json;
  ASSERT_TRUE(json.fromString(Run({"--json", "folder", "list"}).out));
  EXPECT_EQ(json["total"].asUInt(), 1u);
  EXPECT_EQ(json["folders"][0]["name"], "Reports");

  ASSERT_EQ(Run({"folder", "set", "/docs/reports", "--document", "off"}).status, 0);
  ASSERT_TRUE(json.fromString(Run({"--json", "folder", "get", "/docs/reports"}).out));
  EXPECT_FALSE(json["document"].asBool());
  EXPECT_TRUE(json["photo"].asBool());

  ASSERT_EQ(Run({"folder", "delete", "/docs/reports"}).status, 0);
  // A failure is one line: what it means, the library's reason, and what to do.
  r = Run({"folder", "get", "/docs/reports"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.err, "fileindexctl: the folder is not indexed (error 902): /docs/reports; "
                   "\"fileindexctl folder list\" shows indexed folders\n");
}

TEST_F(CtlTest, SearchSendsTheFiltersAndShowsHits) {
  const std::string reply =
      R"({"success":true,"data":{"total":1,"total_exact":true,"hits":[{"path":")" + docs_ +
      R"(/reports/q3.pdf","name":"q3.pdf","ext":"pdf","size":1536,"mtime":1700000000,)"
      R"("is_dir":false,"snippet":"the <b>revenue</b> grew","score":1.5}]}})";
  test::FakeDaemon engine(dir_.Path("var/run/quixelasticd.search.sock"),
                          test::FakeDaemon::Replies({reply}));
  Result r = Run({"search", "revenue", "growth", "--name", "q3", "--ext", "PDF,docx", "--min-size",
                  "1k", "--folder", "/docs/reports", "--sort", "size", "--desc"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, AllOf(HasSubstr("q3.pdf"), HasSubstr("1.5 KiB"),
                           HasSubstr("the *revenue* grew"), HasSubstr("showing 1-1 of 1 file(s)")));
  const Json::Value req = engine.json_requests().at(0);
  EXPECT_EQ(req["command"], "search");
  JsonValue want;
  ASSERT_TRUE(want.fromString(R"({"keyword": "revenue growth", "name": "q3", "ext": ["pdf", "docx"],
      "size_range": {"gte": 1024}, "sort": "size", "order": "desc"})"));
  want["folder"] = docs_ + "/reports";  // the share path, searched on disk
  for (const std::string& key : want.getMemberNames()) {
    EXPECT_EQ(req["data"][key], want[key]) << key;
  }
  EXPECT_FALSE(req["data"].isMember("servers"));
}

// Over every file server sharing the engine's database, each hit shows where it lives.
TEST_F(CtlTest, SearchOverAllServersShowsEachHitsServer) {
  const std::string reply =
      R"({"success":true,"data":{"total":1,"total_exact":true,"hits":[{"path":"/srv/docs/q3.pdf",)"
      R"("name":"q3.pdf","size":1536,"mtime":1700000000,"is_dir":false,"server":"fs2"}]}})";
  test::FakeDaemon engine(dir_.Path("var/run/quixelasticd.search.sock"),
                          test::FakeDaemon::Replies({reply}));
  Result r = Run({"search", "--name", "q3", "--all-servers"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, AllOf(HasSubstr("SERVER"), HasSubstr("fs2"), HasSubstr("/srv/docs")));
  EXPECT_EQ(engine.json_requests().at(0)["data"]["servers"], "all");
}

TEST_F(CtlTest, StatusShowsEachShareFromBothDaemonsOrDashesWithoutThem) {
  Result r = Run({"status"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, AllOf(HasSubstr("quixelasticd"), HasSubstr("stopped"),
                           HasSubstr("no indexed folders")));
  r = Run({"status", "--wait", "--timeout", "5"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("indexing is idle"));

  // Each stand-in answers the one question status asks it, and success to anything else.
  auto answering = [](const std::string& key, const std::string& reply) {
    return [key, reply](int fd, const std::string& request) {
      test::FakeDaemon::WriteFrame(
          fd, request.find(key) != std::string::npos ? reply : R"({"success":true,"data":{}})");
    };
  };
  auto engine = std::make_unique<test::FakeDaemon>(
      dir_.Path("var/run/quixelasticd.sock"),
      answering("index_list", R"({"success":true,"data":[{"id":"fileindex_docs",)"
                              R"("state":"damaged","documents":1234}]})"));
  test::FakeDaemon indexer(
      dir_.Path("var/run/fileindexd.sock"),
      answering("\"status\"", R"({"success":true,"data":{"paused":false,"shares":[{"share":)"
                              R"("docs","ops_pending":7,"ops_done":42,"errors":2,"last_pass":0,)"
                              R"("last_error":"skipped upsert of /x: disk said no",)"
                              R"("documents_written":99,"out_of_space":true}]}})"));
  ASSERT_EQ(Run({"folder", "add", "/docs/reports"}).status, 0);
  r = Run({"status"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("SHARE  FOLDERS  QUEUED  PENDING  DONE  DOCUMENTS  ERRORS  "
                               "LAST PASS  STATE\n"
                               "docs   1        1       7        42    1234       2       -    "
                               "      out of space, index damaged\n"));
  EXPECT_THAT(r.out, HasSubstr("last errors:\n  docs: skipped upsert of /x: disk said no\n"));
  JsonValue json;
  ASSERT_TRUE(json.fromString(Run({"--json", "status"}).out));
  EXPECT_EQ(json["indexes"][0]["documents"], 1234);

  // Without the engine its column cannot be known; nor can a finished wait be told apart from
  // a queue that never drains, which --timeout ends with exit status 1 and a line on each stream.
  engine.reset();
  r = Run({"status", "--wait", "--timeout", "1"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.out, HasSubstr("1 change(s) queued, 99 document(s) written\n"));
  EXPECT_THAT(r.err, HasSubstr("still 1 change(s) queued after 1 s"));
  EXPECT_THAT(Run({"status"}).out, HasSubstr("42    -          2"));
}

TEST_F(CtlTest, PauseSaysWhetherTheIndexingDaemonTookIt) {
  // Not running: the status file holds the pause, which the daemon reads when it starts.
  Result r = Run({"pause"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("(fileindexd is not running: it applies when fileindexd starts)"));
  // Running (its pid file names a live process): what it holds afterwards decides.
  dir_.Write("var/run/fileindexd.pid", std::to_string(getpid()) + "\n");
  const std::string refusal = R"({"success":false,"error":{"code":105,"msg":"too many"}})";
  test::FakeDaemon indexer(dir_.Path("var/run/fileindexd.sock"),
                           test::FakeDaemon::Replies({refusal, R"({"data":{"resume_time":0}})",
                                                      "{}", R"({"data":{"resume_time":-1}})"}));
  r = Run({"resume"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.err, HasSubstr("recorded, but the running fileindexd did not take it: it holds "
                               "resume time 0 instead of -1"));
  r = Run({"resume"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("indexing resumed"));
}

TEST_F(CtlTest, FolderCheckQueuesAReconciliationAndReportsWhatItFixed) {
  {
    const std::string ok = R"({"success":true,"data":{}})";
    test::FakeDaemon engine(dir_.Path("var/run/quixelasticd.sock"),
                            test::FakeDaemon::Replies({ok}));
    test::FakeDaemon indexer(dir_.Path("var/run/fileindexd.sock"), test::FakeDaemon::Replies({ok}));
    ASSERT_EQ(Run({"folder", "add", "/docs/reports"}).status, 0);
  }
  const std::string queue = docs_ + "/@eaDir/@fileindex/queue";
  const std::string folder = docs_ + "/reports";

  // Without the indexing daemon the check is queued for later, and said so.
  Result r = Run({"folder", "check", folder});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("queued a check of /docs/reports; fileindexd is not indexing "
                               "share docs now (stopped or paused)"));
  const std::string line = R"({"data":{"reconcile":true},"event":65536,"is_dir":true,"path":")" +
                           folder + R"(","path_old":""})";
  EXPECT_THAT(test::ReadFile(queue), HasSubstr(line + "\n"));

  // The daemon's worker: the pass after the ones it had begun brings the folder's result, and
  // while it runs the status shows how far it got.
  std::atomic<int> asked{0};
  test::FakeDaemon indexer(
      dir_.Path("var/run/fileindexd.sock"), [&asked, &folder](int fd, const std::string&) {
        const std::string f = R"({"folder":")" + folder;
        test::FakeDaemon::WriteFrame(
            fd, R"({"success":true,"data":{"shares":[{"share":"docs","queue_length":1,)" +
                    (++asked > 2 ? R"("passes":4,"reconciliations":[)" + f +
                                       R"(","pass":4,"finished":0,"compared":10,"added":1,)"
                                       R"("removed":2,"refreshed":3,"duration_ms":250}])"
                                 : R"("passes":3,"reconciling":)" + f +
                                       R"(","compared":1500},"reconciliations":[)" + f +
                                       R"(","pass":3,"added":9}])") +
                    "}]}}");
      });
  r = Run({"folder", "check", "/docs/reports"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out,
            "checked /docs/reports in 0.25 s: 10 entries compared, 1 added, 2 removed, "
            "3 refreshed\n");
  asked = 0;
  EXPECT_THAT(Run({"status"}).out, HasSubstr("reconciling /docs/reports, 1500 entries compared"));
  asked = 10;
  EXPECT_THAT(Run({"status"}).out,
              HasSubstr("RECONCILED FOLDER  FINISHED  COMPARED  ADDED  REMOVED  REFRESHED\n"
                        "/docs/reports      -         10        1      2        3\n"));
  asked = 0;
  JsonValue json;
  ASSERT_TRUE(json.fromString(Run({"--json", "folder", "check", "/docs/reports"}).out));
  EXPECT_EQ(json["refreshed"].asUInt(), 3u);
  EXPECT_TRUE(json["finished"].asBool());

  // A full re-index queued already covers the check.
  std::ofstream(queue, std::ios::app) << R"({"event":65536,"path":")" << folder << "\"}\n";
  r = Run({"folder", "check", "/docs/reports"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("a full re-index of /docs/reports is already queued"));
}

TEST(CliTest, ValuesPeopleType) {
  EXPECT_THROW(ParseSize("lots"), UsageError);
  EXPECT_EQ(ParseTime("1700000000"), 1700000000);
  EXPECT_GT(ParseTime("2024-05-06"), 1700000000);
  EXPECT_THROW(ParseTime("yesterday"), UsageError);
  EXPECT_EQ(HumanSize(912), "912 B");
  Args args({"a", "--size", "3", "--desc", "--name=x", "--", "--literal"}, {"desc"});
  EXPECT_EQ(args.positional(), (std::vector<std::string>{"a", "--literal"}));
  EXPECT_EQ(args.Get("name"), "x");
  EXPECT_TRUE(args.Has("desc"));
}

}  // namespace
}  // namespace ctl
}  // namespace orvane
