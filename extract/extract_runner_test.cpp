#include "extract/extract_runner.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <thread>
#include <vector>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "extract/content_extract.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace extract {
namespace {

// True once `pid` is gone and reaped (a zombie still answers kill(pid, 0)).
bool Reaped(pid_t pid) { return kill(pid, 0) != 0 && errno == ESRCH; }

// The first word after `name` on its line of /proc/PID/`file` ("status", "limits").
std::string ProcField(pid_t pid, const std::string& file, const std::string& name) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/" + file);
  for (std::string line; std::getline(in, line);) {
    if (line.rfind(name, 0) != 0) continue;
    std::istringstream rest(line.substr(name.size()));
    std::string word;
    rest >> word;
    return word;
  }
  return "";
}

class ExtractRunnerTest : public ::testing::Test {
 protected:
  void SetUp() override { CloseIdleExtractHelpers(); }
  void TearDown() override {
    CloseIdleExtractHelpers();
    unsetenv("FILEINDEX_EXTRACT_HELPER");
  }

  // Runs with `program` standing in for the helper.
  bool RunWith(const std::string& program, const std::string& path,
               ExtractLimits limits = ExtractLimits()) {
    setenv("FILEINDEX_EXTRACT_HELPER", program.c_str(), 1);
    return RunExtractHelper(path, &fields_, &error_, limits);
  }
  std::string Script(const std::string& name, const std::string& body) {
    const std::string path = dir_.Write(name, "#!/bin/bash\n" + body + "\n");
    chmod(path.c_str(), 0755);
    return path;
  }

  test::TempDir dir_;
  Json::Value fields_;
  std::string error_;
};

// The caller's thread blocks signals, its process ignores SIGPIPE and holds a descriptor open
// across exec: none of that reaches the helper, which runs in a process group of its own under
// its limits and serves file after file, names with a newline included.
TEST_F(ExtractRunnerTest, RealHelperStartsCleanUnderItsLimitsAndServesFileAfterFile) {
  const std::string leak_path = dir_.Write("leak", "");
  UniqueFd leak(open(leak_path.c_str(), O_RDONLY));  // no O_CLOEXEC, on purpose
  ASSERT_TRUE(leak.valid());
  sigset_t block, old_mask;
  sigemptyset(&block);
  sigaddset(&block, SIGXCPU);
  ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &block, &old_mask), 0);
  const auto old_pipe = signal(SIGPIPE, SIG_IGN);
  const bool ok = RunWith(EXTRACT_HELPER_BINARY, dir_.Write("a.txt", "limits"));
  pthread_sigmask(SIG_SETMASK, &old_mask, nullptr);
  signal(SIGPIPE, old_pipe);
  ASSERT_TRUE(ok) << error_;
  ASSERT_EQ(IdleExtractHelpers().size(), 1u);
  const pid_t pid = IdleExtractHelpers()[0];

  EXPECT_EQ(getpgid(pid), pid);
  const unsigned long long held = std::stoull(ProcField(pid, "status", "SigBlk:"), nullptr, 16) |
                                 std::stoull(ProcField(pid, "status", "SigIgn:"), nullptr, 16);
  for (int sig : {SIGPIPE, SIGXCPU}) EXPECT_EQ(held & (1ull << (sig - 1)), 0u) << strsignal(sig);
  // Standard input, output and error, and the two private copies of the request channel.
  int open_fds = 0;
  for (const auto& fd :
       std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/fd")) {
    ++open_fds;
    std::error_code ec;
    EXPECT_NE(std::filesystem::read_symlink(fd.path(), ec).string(), leak_path);
  }
  EXPECT_LE(open_fds, 5);

  // The CPU limit is one file's allowance beyond what the helper has used so far.
  const int cpu = std::stoi(ProcField(pid, "limits", "Max cpu time "));
  EXPECT_TRUE(cpu >= 31 && cpu <= 40) << cpu;
  EXPECT_EQ(ProcField(pid, "limits", "Max file size "), "0");

  ASSERT_TRUE(RunWith(EXTRACT_HELPER_BINARY, dir_.Write("two\nlines.txt", "odd name"))) << error_;
  EXPECT_EQ(JsonToString(fields_), R"({"QUIXMDTextContent":"odd name"})");
  EXPECT_EQ(IdleExtractHelpers(), std::vector<pid_t>{pid});
}

// A hostile file is a helper that floods, fails or talks nonsense: the indexer gets a reason and
// goes on.
TEST_F(ExtractRunnerTest, MisbehavingHelpersAreContained) {
  ExtractLimits small;
  small.max_output = 4096;
  EXPECT_FALSE(RunWith(Script("flood", "exec cat /dev/zero"), "/x", small));
  EXPECT_EQ(error_, "printed more than 4096 bytes");

  const struct {
    const char* body;
    const char* error;
  } cases[] = {
      {"echo 'no luck here' >&2; exit 3", "exited with status 3: no luck here"},
      {"echo '{\"fields\":[]}'", "printed something that is not a reply"},
      // cat writes both lines at once
      {"cat <<< $'{\"fields\":{}}\\n{\"fields\":{}}'; exec sleep 5", "printed more than one reply"},
  };
  for (const auto& c : cases) {
    EXPECT_FALSE(RunWith(Script("bad", c.body), "/x"));
    EXPECT_EQ(error_, c.error) << c.body;
  }
  EXPECT_FALSE(RunWith(dir_.Path("no-such-helper"), "/x"));
  EXPECT_NE(error_.find("cannot start"), std::string::npos);

  // Refused before any helper sees it.
  EXPECT_FALSE(RunWith(Script("unused", "exit 9"), std::string("/a\0b", 4)));
  EXPECT_EQ(error_, "the path holds a NUL byte");
  EXPECT_TRUE(IdleExtractHelpers().empty());
}

// A helper keeping to the protocol answers each request with its pid; it hangs, crashes or
// reports an error on the files named for that. Whatever fails costs that
// file only, and the failed helper is never given another.
TEST_F(ExtractRunnerTest, AHelperThatFailsMidStreamCostsThatFileOnly) {
  const std::string helper = Script("serving", R"(
while IFS= read -r -d '' path; do
  case "$path" in
    *hang*) exec sleep 30 ;;
    *crash*) kill -SEGV $$ ;;
    *error*) printf '{"error":"cannot open"}\n' ;;
    *) printf '{"fields":{"pid":%d}}\n' $$ ;;
  esac
done)");
  ExtractLimits quick;
  quick.timeout_ms = 500;
  const uint64_t failures = ExtractFailureCount();
  ASSERT_TRUE(RunWith(helper, "/a", quick)) << error_;
  pid_t last = fields_["pid"].asInt();
  ASSERT_TRUE(RunWith(helper, "/b", quick)) << error_;
  EXPECT_EQ(fields_["pid"].asInt(), last);
  const std::pair<const char*, const char*> failing[] = {{"/crash", "killed by Segmentation fault"},
                                                         {"/hang", "timed out after 500 ms"},
                                                         {"/error", "cannot open"}};
  for (const auto& [path, error] : failing) {
    EXPECT_FALSE(RunWith(helper, path, quick));
    EXPECT_EQ(error_, error);
    EXPECT_TRUE(Reaped(last)) << path;
    ASSERT_TRUE(RunWith(helper, "/next", quick)) << error_;
    EXPECT_NE(fields_["pid"].asInt(), last) << path;
    last = fields_["pid"].asInt();
  }
  EXPECT_EQ(ExtractFailureCount(), failures + 3);

  // One that died while idle is replaced without failing the next file.
  ASSERT_EQ(kill(last, SIGKILL), 0);
  siginfo_t info;
  ASSERT_EQ(waitid(P_PID, last, &info, WEXITED | WNOWAIT), 0);  // dead, not yet reaped
  ASSERT_TRUE(RunWith(helper, "/e", quick)) << error_;
  EXPECT_NE(fields_["pid"].asInt(), last);
  EXPECT_TRUE(Reaped(last));
  EXPECT_EQ(ExtractFailureCount(), failures + 3);
}

// Callers never wait for one another: each of four helpers answers only once all four hold a
// request, which a pool handing out one helper at a time would never see; and each caller gets
// the reply to its own file.
TEST_F(ExtractRunnerTest, ConcurrentCallersEachGetAHelper) {
  constexpr int kCallers = 4;
  const std::string helper =
      Script("barrier",
             "marks=" + dir_.Path("arrived") + "\ncallers=" + std::to_string(kCallers) + "\n" + R"(
while IFS= read -r -d '' path; do
  touch "$marks.$$"
  for i in $(seq 200); do
    arrived=("$marks".*)
    [ ${#arrived[@]} -ge $callers ] && break
    sleep 0.05
  done
  printf '{"fields":{"pid":%d,"seen":%d,"path":"%s"}}\n' $$ ${#arrived[@]} "$path"
done)");
  setenv("FILEINDEX_EXTRACT_HELPER", helper.c_str(), 1);
  std::vector<Json::Value> results(kCallers);
  std::vector<std::thread> threads;
  for (int i = 0; i < kCallers; ++i) {
    threads.emplace_back([&results, i] {
      std::string error;
      if (!RunExtractHelper("/f" + std::to_string(i), &results[i], &error)) {
        results[i]["error"] = error;
      }
    });
  }
  for (auto& t : threads) t.join();
  std::set<pid_t> pids;
  for (int i = 0; i < kCallers; ++i) {
    EXPECT_EQ(results[i]["seen"], kCallers) << results[i].toStyledString();
    EXPECT_EQ(results[i]["path"], "/f" + std::to_string(i));
    pids.insert(results[i]["pid"].asInt());
  }
  EXPECT_EQ(pids.size(), static_cast<size_t>(kCallers));

  // At most one idle helper per CPU is kept; the others were ended and reaped.
  const std::vector<pid_t> idle = IdleExtractHelpers();
  EXPECT_LE(idle.size(), std::max(1u, std::thread::hardware_concurrency()));
  for (pid_t pid : pids) {
    if (std::find(idle.begin(), idle.end(), pid) == idle.end()) EXPECT_TRUE(Reaped(pid)) << pid;
  }
  CloseIdleExtractHelpers();
  for (pid_t pid : idle) EXPECT_TRUE(Reaped(pid)) << pid;
}

// A name that was a file when the indexer looked may be something else when the helper opens
// it: a FIFO held open by a writer that never writes, or a link to a readable file. The helper
// refuses each at once (its own time limit is a minute), and the next real file is read as usual.
TEST_F(ExtractRunnerTest, WhatIsNoLongerARegularFileIsRefusedAtOnce) {
  const std::string held = dir_.Path("held.txt");
  ASSERT_EQ(mkfifo(held.c_str(), 0644), 0);
  // O_RDWR opens a FIFO without waiting for a reader: a writer that never writes.
  UniqueFd writer(open(held.c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_TRUE(writer.valid());
  const std::string link = dir_.Path("boss_plan.txt");
  ASSERT_EQ(symlink(dir_.Write("readable.txt", "public words").c_str(), link.c_str()), 0);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(RunWith(EXTRACT_HELPER_BINARY, held));
  EXPECT_EQ(error_, "not a regular file (a FIFO)");
  EXPECT_FALSE(RunWith(EXTRACT_HELPER_BINARY, link));
  EXPECT_EQ(error_, "a symbolic link, not read");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
  ASSERT_TRUE(RunWith(EXTRACT_HELPER_BINARY, dir_.Write("after.txt", "still served"))) << error_;
  EXPECT_EQ(fields_["QUIXMDTextContent"], "still served");
}

// The file-system fields of a file and a link (described as itself, its target unread);
// contents only of a regular file and only when asked; a helper that fails costs the contents.
TEST_F(ExtractRunnerTest, ParseFileFillsFileSystemFieldsAndAddsContentOnlyWhenAsked) {
  namespace ce = QUIX::CONTENT_EXTRACT;
  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BINARY, 1);
  const std::string path = dir_.Write("docs/Notes.Final.TXT", "meeting notes");
  ASSERT_EQ(chown(path.c_str(), 1234, 567), 0);
  struct stat st;
  ASSERT_EQ(lstat(path.c_str(), &st), 0);
  Json::Value doc(Json::objectValue);
  doc["stale"] = 1;
  ce::ParseFile(path, Json::Value(), doc);
  auto take = [&doc](const char* key) {
    Json::Value value;
    doc.removeMember(key, &value);
    return value.asInt64();
  };
  EXPECT_EQ(take(ce::QUIXMDFSContentChangeDate), st.st_mtime);
  EXPECT_EQ(take(ce::QUIXMDAttributeChangeDate), st.st_ctime);
  EXPECT_LE(take(ce::QUIXMDFSCreationDate), st.st_ctime);  // 0 where no birth time is kept
  EXPECT_EQ(JsonToString(doc),
            R"({"QUIXMDExtension":"txt","QUIXMDFSName":"Notes.Final.TXT","QUIXMDFSSize":13,)"
            R"("QUIXMDIsDir":false,"QUIXMDOwnerGroupID":"567","QUIXMDOwnerUserID":"1234",)"
            R"("QUIXMDParent":")" + dir_.Path("docs") + R"(","QUIXMDPath":")" + path + R"("})");

  Json::Value need_meta;
  need_meta[ce::kKeyNeedMeta] = true;
  ce::ParseFile(path, need_meta, doc);
  EXPECT_EQ(doc["QUIXMDTextContent"], "meeting notes");
  ASSERT_EQ(symlink(path.c_str(), dir_.Path("link.mp3").c_str()), 0);
  ce::ParseFile(dir_.Path("link.mp3"), need_meta, doc);
  EXPECT_EQ(doc[ce::QUIXMDExtension], "mp3");
  EXPECT_FALSE(doc[ce::QUIXMDIsDir].asBool() || doc.isMember("QUIXMDTextContent"));

  Json::Value untouched;
  const Error missing = test::ErrorOf([&] { ce::ParseFile(dir_.Path("missing"), {}, untouched); });
  EXPECT_EQ(missing.code, kErrSystem);
  EXPECT_NE(std::string(missing.what()).find("No such file or directory"), std::string::npos);
  EXPECT_TRUE(untouched.isNull());

  test::LogCapture log;

  // A helper that fails leaves the name and attributes indexed, logged and counted.
  setenv("FILEINDEX_EXTRACT_HELPER", Script("fail", "exit 3").c_str(), 1);
  const uint64_t failures = ExtractFailureCount();
  ce::ParseFile(path, need_meta, doc);
  EXPECT_EQ(doc[ce::QUIXMDFSSize].asUInt64(), 13u);
  EXPECT_FALSE(doc.isMember("QUIXMDTextContent"));
  EXPECT_EQ(ExtractFailureCount(), failures + 1);
  EXPECT_TRUE(log.Contains("content of " + path + " not extracted: exited with status 3"));

  // An empty file, whatever its kind, has no contents: the helper is not asked at all.
  const std::string empty = dir_.Path("empty.unknownkind");
  test::WriteFile(empty, "");
  ce::ParseFile(empty, need_meta, doc);
  EXPECT_EQ(doc[ce::QUIXMDFSSize].asUInt64(), 0u);
  EXPECT_EQ(ExtractFailureCount(), failures + 1);
}

}  // namespace
}  // namespace extract
}  // namespace orvane
