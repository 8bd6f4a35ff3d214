#include "extract/extract_runner.hpp"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>
#include <thread>
#include <vector>

#include "common/fd.hpp"
#include "common/util.hpp"
#include "extract/content_extract.hpp"
#include "test/test_util.hpp"

#if defined(__SANITIZE_ADDRESS__)
#define TEST_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define TEST_ASAN 1
#endif
#endif
#ifndef TEST_ASAN
#define TEST_ASAN 0
#endif

namespace orvane {
namespace extract {
namespace {

// True once `pid` is gone and reaped (a zombie still answers kill(pid, 0)).
bool Reaped(pid_t pid) { return kill(pid, 0) != 0 && errno == ESRCH; }

// The soft limit of `name` ("Max open files", ...) in /proc/PID/limits.
std::string SoftLimit(pid_t pid, const std::string& name) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/limits");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind(name + " ", 0) != 0) continue;
    std::istringstream values(line.substr(name.size()));
    std::string soft;
    values >> soft;
    return soft;
  }
  return "";
}

// A line of /proc/PID/status ("SigBlk", ...), without its name.
std::string Status(pid_t pid, const std::string& name) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind(name + ":", 0) == 0) return Trim(line.substr(name.size() + 1));
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
  bool RunWith(const std::string& program, const std::string& path, Json::Value* fields,
               std::string* error, ExtractLimits limits = ExtractLimits()) {
    setenv("FILEINDEX_EXTRACT_HELPER", program.c_str(), 1);
    return RunExtractHelper(path, fields, error, limits);
  }
  std::string Script(const std::string& name, const std::string& body) {
    const std::string path = dir_.Write(name, "#!/bin/bash\n" + body + "\n");
    chmod(path.c_str(), 0755);
    return path;
  }
  // A script that stands in for a helper keeping to the protocol: it answers each request with
  // its pid, and hangs, crashes or answers twice on the files named for that.
  std::string ServingScript() {
    return Script("serving", R"(
while IFS= read -r -d '' path; do
  case "$path" in
    *hang*) exec sleep 30 ;;
    *crash*) kill -SEGV $$ ;;
    *twice*) printf '{"fields":{}}\n{"fields":{}}\n'; touch "$path" ;;
    *) printf '{"fields":{"pid":%d}}\n' $$ ;;
  esac
done)");
  }
  test::TempDir dir_;
};

TEST_F(ExtractRunnerTest, RealHelperServesFileAfterFileAndIsRetiredAfterAFailure) {
  Json::Value fields;
  std::string error;
  ASSERT_TRUE(RunWith(EXTRACT_HELPER_BINARY, dir_.Write("a.txt", "hello helper"), &fields, &error))
      << error;
  EXPECT_EQ(fields["QUIXMDTextContent"], "hello helper");
  const std::vector<pid_t> first = IdleExtractHelpers();
  ASSERT_EQ(first.size(), 1u);
  ASSERT_TRUE(RunWith(EXTRACT_HELPER_BINARY, dir_.Write("b.txt", "second file"), &fields, &error))
      << error;
  EXPECT_EQ(fields["QUIXMDTextContent"], "second file");
  EXPECT_EQ(IdleExtractHelpers(), first);

  const uint64_t failures = ExtractFailureCount();
  EXPECT_FALSE(RunWith(EXTRACT_HELPER_BINARY, dir_.Path("missing.txt"), &fields, &error));
  EXPECT_EQ(error, "cannot open: No such file or directory");
  EXPECT_EQ(ExtractFailureCount(), failures + 1);
  EXPECT_TRUE(IdleExtractHelpers().empty());
  EXPECT_TRUE(Reaped(first[0]));

  ASSERT_TRUE(RunWith(EXTRACT_HELPER_BINARY, dir_.Write("c.txt", "third"), &fields, &error))
      << error;
  EXPECT_EQ(fields["QUIXMDTextContent"], "third");
  ASSERT_EQ(IdleExtractHelpers().size(), 1u);
  EXPECT_NE(IdleExtractHelpers()[0], first[0]);

  const pid_t last = IdleExtractHelpers()[0];
  CloseIdleExtractHelpers();
  EXPECT_TRUE(Reaped(last));
}

// The protocol seen from outside: a name may hold a newline, a reply never does, and the end
// of the requests ends the helper.
TEST_F(ExtractRunnerTest, RealHelperAnswersEachRequestOnOneLine) {
  const std::string odd = dir_.Write("two\nlines.txt", "odd name");
  dir_.Write("requests", dir_.Write("a.txt", "first\nsecond") + '\0' + dir_.Path("missing") + '\0' +
                             odd + '\0');
  // Read through a pipe: the helper may not write files, its replies included.
  FILE* helper =
      popen((std::string(EXTRACT_HELPER_BINARY) + " < " + dir_.Path("requests")).c_str(), "r");
  ASSERT_NE(helper, nullptr);
  std::vector<std::string> lines;
  std::string line;
  for (int c; (c = std::fgetc(helper)) != EOF;) {
    if (c != '\n') {
      line += static_cast<char>(c);
    } else {
      lines.push_back(line);
      line.clear();
    }
  }
  EXPECT_EQ(pclose(helper), 0);
  EXPECT_EQ(line, "");
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0], R"({"fields":{"QUIXMDTextContent":"first\nsecond"}})");
  EXPECT_EQ(lines[1], R"({"error":"cannot open: No such file or directory"})");
  EXPECT_EQ(lines[2], R"({"fields":{"QUIXMDTextContent":"odd name"}})");
}

// The caller's thread blocks signals, its process ignores SIGPIPE and holds a descriptor open
// across exec: none of that reaches the helper, which runs in a process group of its own under
// its limits.
TEST_F(ExtractRunnerTest, RealHelperStartsCleanUnderItsLimits) {
  const std::string leak_path = dir_.Write("leak", "");
  UniqueFd leak(open(leak_path.c_str(), O_RDONLY));  // no O_CLOEXEC, on purpose
  ASSERT_TRUE(leak.valid());
  sigset_t block;
  sigset_t old_mask;
  sigemptyset(&block);
  sigaddset(&block, SIGXCPU);
  sigaddset(&block, SIGTERM);
  ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &block, &old_mask), 0);
  struct sigaction ignore = {};
  struct sigaction old_pipe = {};
  ignore.sa_handler = SIG_IGN;
  ASSERT_EQ(sigaction(SIGPIPE, &ignore, &old_pipe), 0);
  Json::Value fields;
  std::string error;
  const bool ok = RunWith(EXTRACT_HELPER_BINARY, dir_.Write("a.txt", "limits"), &fields, &error);
  pthread_sigmask(SIG_SETMASK, &old_mask, nullptr);
  sigaction(SIGPIPE, &old_pipe, nullptr);
  ASSERT_TRUE(ok) << error;
  ASSERT_EQ(IdleExtractHelpers().size(), 1u);
  const pid_t pid = IdleExtractHelpers()[0];

  EXPECT_EQ(getpgid(pid), pid);
  const unsigned long long blocked = std::stoull(Status(pid, "SigBlk"), nullptr, 16);
  const unsigned long long ignored = std::stoull(Status(pid, "SigIgn"), nullptr, 16);
  for (int sig : {SIGPIPE, SIGXCPU, SIGXFSZ, SIGTERM}) {
    EXPECT_EQ(blocked & (1ull << (sig - 1)), 0u) << strsignal(sig);
    EXPECT_EQ(ignored & (1ull << (sig - 1)), 0u) << strsignal(sig);
  }

  // Standard input, output and error, and the two private copies of the request channel.
  const std::string fd_dir = "/proc/" + std::to_string(pid) + "/fd";
  std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(fd_dir.c_str()), closedir);
  ASSERT_NE(dir, nullptr);
  int open_fds = 0;
  while (struct dirent* entry = readdir(dir.get())) {
    if (entry->d_name[0] == '.') continue;
    ++open_fds;
    char target[4096] = {};
    readlink((fd_dir + "/" + entry->d_name).c_str(), target, sizeof(target) - 1);
    EXPECT_NE(std::string(target), leak_path);
  }
  EXPECT_LE(open_fds, 5);

  // The CPU limit is one file's allowance beyond what the helper has used so far.
  const int cpu = std::stoi(SoftLimit(pid, "Max cpu time"));
  EXPECT_GE(cpu, 31);
  EXPECT_LE(cpu, 40);
  EXPECT_EQ(SoftLimit(pid, "Max file size"), "0");
  EXPECT_EQ(SoftLimit(pid, "Max core file size"), "0");
  EXPECT_EQ(SoftLimit(pid, "Max open files"), "64");
  if (!TEST_ASAN) {
    EXPECT_EQ(SoftLimit(pid, "Max address space"), "1073741824");
  }
}

// A hostile file is a helper that hangs, floods, crashes or talks nonsense: the indexer gets a
// reason and goes on.
TEST_F(ExtractRunnerTest, MisbehavingHelpersAreContained) {
  Json::Value fields;
  std::string error;
  ExtractLimits quick;
  quick.timeout_ms = 300;
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(RunWith(Script("hang", "exec sleep 30"), "/x", &fields, &error, quick));
  EXPECT_EQ(error, "timed out after 300 ms");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));

  ExtractLimits small;
  small.max_output = 4096;
  EXPECT_FALSE(RunWith(Script("flood", "exec cat /dev/zero"), "/x", &fields, &error, small));
  EXPECT_EQ(error, "printed more than 4096 bytes");
  EXPECT_FALSE(RunWith(Script("long", "printf '%*s\\n' 5000 ''; exec sleep 5"), "/x", &fields,
                       &error, small));
  EXPECT_EQ(error, "printed more than 4096 bytes");

  EXPECT_FALSE(RunWith(Script("crash", "kill -SEGV $$"), "/x", &fields, &error));
  EXPECT_EQ(error, "killed by Segmentation fault");

  EXPECT_FALSE(RunWith(Script("fail", "echo 'no luck here' >&2; exit 3"), "/x", &fields, &error));
  EXPECT_EQ(error, "exited with status 3: no luck here");

  EXPECT_FALSE(RunWith(Script("garbage", "echo '[1,2'"), "/x", &fields, &error));
  EXPECT_EQ(error, "printed something that is not a reply");
  EXPECT_FALSE(RunWith(Script("wrong", "echo '{\"fields\":[]}'"), "/x", &fields, &error));
  EXPECT_EQ(error, "printed something that is not a reply");

  const std::string two = dir_.Write("two-replies", "{\"fields\":{}}\n{\"fields\":{}}\n");
  EXPECT_FALSE(RunWith(Script("twice", "cat " + two + "; exec sleep 5"), "/x", &fields, &error));
  EXPECT_EQ(error, "printed more than one reply");

  EXPECT_FALSE(RunWith(dir_.Path("no-such-helper"), "/x", &fields, &error));
  EXPECT_NE(error.find("cannot start"), std::string::npos);

  // Refused before any helper sees it.
  EXPECT_FALSE(RunWith(Script("unused", "exit 9"), std::string("/a\0b", 4), &fields, &error));
  EXPECT_EQ(error, "the path holds a NUL byte");
  EXPECT_TRUE(IdleExtractHelpers().empty());
}

TEST_F(ExtractRunnerTest, AHelperThatFailsMidStreamCostsThatFileOnly) {
  const std::string helper = ServingScript();
  ExtractLimits quick;
  quick.timeout_ms = 500;
  Json::Value fields;
  std::string error;
  const uint64_t failures = ExtractFailureCount();
  ASSERT_TRUE(RunWith(helper, "/a", &fields, &error, quick)) << error;
  const pid_t first = fields["pid"].asInt();
  ASSERT_TRUE(RunWith(helper, "/b", &fields, &error, quick)) << error;
  EXPECT_EQ(fields["pid"].asInt(), first);

  EXPECT_FALSE(RunWith(helper, "/crash", &fields, &error, quick));
  EXPECT_EQ(error, "killed by Segmentation fault");
  EXPECT_TRUE(Reaped(first));
  ASSERT_TRUE(RunWith(helper, "/c", &fields, &error, quick)) << error;
  const pid_t second = fields["pid"].asInt();
  EXPECT_NE(second, first);

  EXPECT_FALSE(RunWith(helper, "/hang", &fields, &error, quick));
  EXPECT_EQ(error, "timed out after 500 ms");
  EXPECT_TRUE(Reaped(second));
  ASSERT_TRUE(RunWith(helper, "/d", &fields, &error, quick)) << error;
  const pid_t third = fields["pid"].asInt();
  EXPECT_NE(third, second);
  EXPECT_EQ(ExtractFailureCount(), failures + 2);

  // One that died while idle is replaced without failing the next file.
  ASSERT_EQ(kill(third, SIGKILL), 0);
  siginfo_t info;
  ASSERT_EQ(waitid(P_PID, third, &info, WEXITED | WNOWAIT), 0);  // dead, not yet reaped
  ASSERT_TRUE(RunWith(helper, "/e", &fields, &error, quick)) << error;
  EXPECT_NE(fields["pid"].asInt(), third);
  EXPECT_TRUE(Reaped(third));
  EXPECT_EQ(ExtractFailureCount(), failures + 2);

  // One that answers twice is out of step: whether the second line comes with the first or
  // after it, the next file goes to a fresh helper.
  const pid_t fourth = fields["pid"].asInt();
  RunWith(helper, dir_.Path("twice"), &fields, &error, quick);
  for (int i = 0; i < 500 && access(dir_.Path("twice").c_str(), F_OK) != 0; ++i) usleep(10000);
  usleep(50000);  // the touch comes after both lines
  ASSERT_TRUE(RunWith(helper, "/g", &fields, &error, quick)) << error;
  EXPECT_NE(fields["pid"].asInt(), fourth);
  EXPECT_TRUE(Reaped(fourth));

  // A helper of another program is not given the file.
  ASSERT_TRUE(RunWith(Script("other", "read -r -d '' p; echo '{\"fields\":{\"other\":true}}'"),
                      "/f", &fields, &error, quick))
      << error;
  EXPECT_TRUE(fields["other"].asBool());
}

// Callers never wait for one another: each of four helpers answers only once all four hold a
// request, which a pool handing out one helper at a time would never see.
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
  printf '{"fields":{"pid":%d,"seen":%d}}\n' $$ ${#arrived[@]}
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
  for (const Json::Value& r : results) {
    EXPECT_EQ(r["seen"], kCallers) << r.toStyledString();
    pids.insert(r["pid"].asInt());
  }
  EXPECT_EQ(pids.size(), static_cast<size_t>(kCallers));

  // At most one idle helper per CPU is kept; the others were ended and reaped.
  const std::vector<pid_t> idle = IdleExtractHelpers();
  EXPECT_LE(idle.size(), std::max(1u, std::thread::hardware_concurrency()));
  for (pid_t pid : pids) {
    if (std::find(idle.begin(), idle.end(), pid) == idle.end()) {
      EXPECT_TRUE(Reaped(pid)) << pid;
    }
  }
  CloseIdleExtractHelpers();
  for (pid_t pid : idle) EXPECT_TRUE(Reaped(pid)) << pid;
}

TEST_F(ExtractRunnerTest, RealHelpersServeConcurrentCallers) {
  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BINARY, 1);
  constexpr int kCallers = 3;
  constexpr int kFiles = 8;
  std::vector<std::string> wrong(kCallers);
  std::vector<std::thread> threads;
  for (int t = 0; t < kCallers; ++t) {
    threads.emplace_back([this, &wrong, t] {
      for (int i = 0; i < kFiles; ++i) {
        const std::string text = "caller " + std::to_string(t) + " file " + std::to_string(i);
        const std::string path =
            dir_.Write("t" + std::to_string(t) + "/f" + std::to_string(i) + ".txt", text);
        Json::Value fields;
        std::string error;
        if (!RunExtractHelper(path, &fields, &error)) {
          wrong[t] += path + ": " + error + "\n";
        } else if (fields["QUIXMDTextContent"] != text) {
          wrong[t] += path + ": " + fields.toStyledString();
        }
      }
    });
  }
  for (auto& t : threads) t.join();
  for (const std::string& w : wrong) EXPECT_EQ(w, "");
  EXPECT_GE(IdleExtractHelpers().size(), 1u);
}

TEST_F(ExtractRunnerTest, ParseFileAddsContentOnlyWhenAsked) {
  namespace ce = QUIX::CONTENT_EXTRACT;
  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BINARY, 1);
  const std::string path = dir_.Write("notes.txt", "meeting notes");
  Json::Value need_meta;
  need_meta[ce::kKeyNeedMeta] = true;
  Json::Value doc;
  ce::ParseFile(path, need_meta, doc);
  EXPECT_EQ(doc["QUIXMDTextContent"], "meeting notes");
  EXPECT_EQ(doc[ce::QUIXMDFSName], "notes.txt");
  ce::ParseFile(path, Json::Value(Json::objectValue), doc);
  EXPECT_FALSE(doc.isMember("QUIXMDTextContent"));

  // A helper that fails leaves the name and attributes indexed, logged and counted.
  setenv("FILEINDEX_EXTRACT_HELPER", Script("fail", "exit 3").c_str(), 1);
  test::LogCapture log;
  const uint64_t failures = ExtractFailureCount();
  ce::ParseFile(path, need_meta, doc);
  EXPECT_EQ(doc[ce::QUIXMDFSSize].asUInt64(), 13u);
  EXPECT_FALSE(doc.isMember("QUIXMDTextContent"));
  EXPECT_EQ(ExtractFailureCount(), failures + 1);
  EXPECT_TRUE(log.Contains("content of " + path + " not extracted: exited with status 3"));
}

}  // namespace
}  // namespace extract
}  // namespace orvane
