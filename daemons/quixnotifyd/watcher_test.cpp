#include "daemons/quixnotifyd/watcher.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <sstream>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "fileindex/optree.hpp"
#include "platform/monitor_queue.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace quixnotifyd {
namespace {

using QUIX::QUIXNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION;
using QUIX::QUIXNOTIFYD::MonitorQueue;
using ::testing::ElementsAre;

// "bits path" or "bits old -> new" per queue line, paths relative to the share.
std::vector<std::string> QueueLines(const std::string& queue, const std::string& share) {
  std::vector<std::string> out;
  std::istringstream in(test::ReadFile(queue));
  auto rel = [&share](const std::string& p) {
    return StringStartWith(p, share) ? p.substr(share.size()) : p;
  };
  for (std::string line; std::getline(in, line);) {
    fileindex::Event e(line);
    std::ostringstream s;
    s << std::hex << e.event << std::dec << (e.is_dir ? " dir " : " ");
    if (!e.path_old.empty()) s << rel(e.path_old) << " -> ";
    s << rel(e.path);
    out.push_back(s.str());
  }
  return out;
}

Json::Value Record(const std::string& queue, const std::vector<std::string>& folders) {
  Json::Value record;
  record["queue"] = queue;
  record["config"] = Json::Value(Json::arrayValue);
  for (const std::string& f : folders) {
    Json::Value entry;
    entry["path"] = f;
    entry["mask"] = 65484;
    entry["ignore"].append("@eaDir");
    record["config"].append(entry);
  }
  return record;
}

class WatcherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const char* rel : {"", "/docs", "/other"}) Mkdir(rel);
    ASSERT_TRUE(MonitorQueue::Upsert(Record(queue_, {share_ + "/docs"}), "fileindex",
                                     MONITOR_QUEUE_TYPE_APPLICATION));
  }

  // Runs the watcher until the queue holds at least `n` lines (or a generous bound passes).
  std::vector<std::string> Drain(Watcher& w, size_t n) {
    for (int i = 0; i < 50 && QueueLines(queue_, share_).size() < n; ++i) w.RunOnce(100);
    w.RunOnce(50);
    return QueueLines(queue_, share_);
  }
  void Touch(const std::string& rel, const std::string& text = "x") {
    std::ofstream(share_ + rel) << text;
  }
  void Mkdir(const std::string& rel) { ASSERT_EQ(mkdir((share_ + rel).c_str(), 0755), 0) << rel; }
  void Move(const std::string& from, const std::string& to) {
    ASSERT_EQ(rename((share_ + from).c_str(), (share_ + to).c_str()), 0) << from;
  }

  test::TempDir dir_;
  test::ScopedRoot root_{dir_.path()};
  std::string share_ = dir_.Path("share");
  std::string queue_ = share_ + "/@eaDir/@fileindex/queue";
};

TEST_F(WatcherTest, ChangesBecomeQueueLines) {
  Watcher w;
  EXPECT_EQ(w.watch_count(), 1u);
  Touch("/docs/a.txt");
  Mkdir("/docs/sub");
  ASSERT_EQ(chmod((share_ + "/docs/a.txt").c_str(), 0600), 0);
  w.RunOnce(50);
  Move("/docs/a.txt", "/docs/sub/b.txt");
  // Content modification alone is not in the registered mask; the close after writing is.
  EXPECT_THAT(Drain(w, 5), ElementsAre("40 /docs/a.txt", "8 /docs/a.txt", "40 dir /docs/sub",
                                       "4 /docs/a.txt", "100 /docs/a.txt -> /docs/sub/b.txt"));
  EXPECT_EQ(w.watch_count(), 2u);
  Unlink(queue_);

  // A renamed folder keeps its watches under the new name.
  Move("/docs/sub", "/docs/moved");
  Touch("/docs/moved/c.txt");
  ASSERT_EQ(unlink((share_ + "/docs/moved/b.txt").c_str()), 0);
  EXPECT_THAT(Drain(w, 4), ElementsAre("100 dir /docs/sub -> /docs/moved", "40 /docs/moved/c.txt",
                                       "8 /docs/moved/c.txt", "80 /docs/moved/b.txt"));
  EXPECT_EQ(w.watch_count(), 2u);
  Unlink(queue_);

  // Moves across the watched boundary are creates and deletes; ignored names make no lines.
  Touch("/other/in.txt");
  Mkdir("/docs/@eaDir");
  Touch("/docs/@eaDir/thumb");
  Move("/other/in.txt", "/docs/in.txt");
  Mkdir("/docs/d");
  w.RunOnce(50);
  Move("/docs/d", "/other/d");
  w.RunOnce(50);
  Touch("/other/d/not-watched");
  EXPECT_THAT(Drain(w, 3), ElementsAre("40 /docs/in.txt", "40 dir /docs/d", "80 dir /docs/d"));
  EXPECT_EQ(w.watch_count(), 2u);
}

TEST_F(WatcherTest, LostChangesBecomeOneOverflowLine) {
  Watcher w;
  // More changes than the kernel holds for a reader that is late.
  int kernel_queue = 0;
  std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> kernel_queue;
  ASSERT_GT(kernel_queue, 0);
  for (int i = 0; i < kernel_queue / 2 + 100; ++i) Touch("/docs/f" + std::to_string(i), "");
  for (int i = 0; i < 20; ++i) w.RunOnce(50);
  const std::vector<std::string> lines = QueueLines(queue_, share_);
  EXPECT_EQ(std::count(lines.begin(), lines.end(), "200 dir /docs"), 1);
}

TEST_F(WatcherTest, FollowsRegistrationChangesAndWritesOneLinePerQueue) {
  Watcher w;
  // Two nested folders of one share: still one line per change.
  ASSERT_TRUE(MonitorQueue::Upsert(Record(queue_, {share_ + "/docs", share_}), "fileindex",
                                   MONITOR_QUEUE_TYPE_APPLICATION));
  w.RunOnce(100);
  EXPECT_EQ(w.watch_count(), 3u);
  Touch("/docs/o.txt");
  EXPECT_THAT(Drain(w, 2), ElementsAre("40 /docs/o.txt", "8 /docs/o.txt"));
  Unlink(queue_);

  ASSERT_TRUE(MonitorQueue::Delete(queue_, "fileindex", MONITOR_QUEUE_TYPE_APPLICATION));
  w.RunOnce(100);
  EXPECT_EQ(w.watch_count(), 0u);
  Touch("/docs/late.txt");
  w.RunOnce(100);
  EXPECT_FALSE(IsFileExist(queue_));
}

TEST_F(WatcherTest, UnwritableQueueKeepsLinesUntilItCanBeWritten) {
  Watcher w;
  // A file where the queue's folder should be makes every append fail.
  Mkdir("/@eaDir");
  Touch("/@eaDir/@fileindex", "in the way");
  test::LogCapture log;
  Touch("/docs/kept.txt");
  w.RunOnce(200);
  EXPECT_TRUE(log.Contains("cannot append to queue " + queue_));
  ASSERT_EQ(unlink((share_ + "/@eaDir/@fileindex").c_str()), 0);
  EXPECT_THAT(Drain(w, 2), ElementsAre("40 /docs/kept.txt", "8 /docs/kept.txt"));
}

// What a stored record holds is checked where the library writes it; here, what is refused.
TEST(MonitorQueueTest, RegistrationRecordsAreCheckedAndReplacedPerQueue) {
  test::TempDir dir;
  test::ScopedRoot root(dir.path());
  Json::Value good = Record("/v/s/@eaDir/@fileindex/queue", {"/v/s/a", "/v/s/b"});
  for (int i = 0; i < 2; ++i) {
    ASSERT_TRUE(MonitorQueue::Upsert(good, "fileindex", MONITOR_QUEUE_TYPE_APPLICATION));
  }
  EXPECT_EQ(MonitorQueue::List().size(), 1u);

  for (const char* bad : {R"({"queue":"relative","config":[]})", R"({"queue":"/q"})",
                          R"({"queue":"/q","config":[{"path":"/p","mask":-1,"ignore":[]}]})",
                          R"({"queue":"/q","config":[{"path":"/p","mask":1,"ignore":[3]}]})"}) {
    JsonValue v;
    ASSERT_TRUE(v.fromString(bad));
    errno = 0;
    EXPECT_FALSE(MonitorQueue::Upsert(v, "fileindex", MONITOR_QUEUE_TYPE_APPLICATION)) << bad;
    EXPECT_EQ(errno, EINVAL);
  }
  EXPECT_FALSE(MonitorQueue::Upsert(good, "../escape", MONITOR_QUEUE_TYPE_APPLICATION));
  // Deleting twice succeeds: the caller wanted it gone.
  for (int i = 0; i < 2; ++i) {
    EXPECT_TRUE(MonitorQueue::Delete(good["queue"].asString(), "fileindex",
                                     MONITOR_QUEUE_TYPE_APPLICATION));
  }
  EXPECT_TRUE(MonitorQueue::List().empty());
}

// The real daemon, started as a program: it writes its pid file and stops cleanly on SIGTERM.
// That it turns changes into queue lines, and goes on after a kill -9, is proven end to end.
TEST_F(WatcherTest, DaemonRunsAndStops) {
  const pid_t pid = fork();
  if (pid == 0) {
    execl(QUIXNOTIFYD_BIN, "quixnotifyd", static_cast<char*>(nullptr));
    _exit(127);
  }
  const std::string pid_file = dir_.Path("var/run/quixnotifyd.pid");
  for (int i = 0; i < 100 && !IsFileExist(pid_file); ++i) usleep(50000);
  ASSERT_TRUE(IsFileExist(pid_file));
  kill(pid, SIGTERM);
  int status = 0;
  waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_FALSE(IsFileExist(pid_file));
}

}  // namespace
}  // namespace quixnotifyd
}  // namespace orvane
