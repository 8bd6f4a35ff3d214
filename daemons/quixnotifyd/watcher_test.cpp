#include "daemons/quixnotifyd/watcher.hpp"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <sstream>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/status_mgr.hpp"
#include "platform/monitor_queue.hpp"
#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace quixnotifyd {
namespace {

using QUIX::QUIXNOTIFYD::MONITOR_QUEUE_TYPE_APPLICATION;
using QUIX::QUIXNOTIFYD::MonitorQueue;
using ::testing::ElementsAre;

// "bits path" or "bits old -> new" per queue line, paths relative to the share, with
// " reconcile" for a reconciliation.
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
    if (e.data.isObject() && e.data["reconcile"].asBool()) s << " reconcile";
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
    Register({"/docs"});
    // The share, for the flags in the status file, and a notifier that records its calls.
    test::WritePlatformConfig(dir_.path(),
                              R"({"shares": [{"name": "share", "path": ")" + share_ + "\"}]})");
    const std::string notifier = dir_.Write(
        "usr/libexec/fileindex/quixzrmnotify", "#!/bin/sh\necho \"$*\" >> \"$(dirname \"$0\")/notified\"\n");
    chmod(notifier.c_str(), 0755);
  }
  std::string Notified() const { return test::ReadFile(dir_.Path("usr/libexec/fileindex/notified")); }
  // How many queue lines read `line`.
  long LinesOf(const std::string& line) const {
    const std::vector<std::string> lines = QueueLines(queue_, share_);
    return std::count(lines.begin(), lines.end(), line);
  }
  long NotifiedCount() const {
    const std::string notified = Notified();
    return std::count(notified.begin(), notified.end(), '\n');
  }
  void Register(const std::vector<std::string>& rels) {
    std::vector<std::string> folders;
    for (const std::string& rel : rels) folders.push_back(share_ + rel);
    ASSERT_TRUE(MonitorQueue::Upsert(Record(queue_, folders), "fileindex",
                                     MONITOR_QUEUE_TYPE_APPLICATION));
  }
  int ShareFlags() const { return fileindex::StatusMgr().GetShareStatus("share"); }

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

TEST_F(WatcherTest, FolderShortOfWatchesIsMarkedAndReconciledUntilTheyFit) {
  for (const char* rel : {"/docs/a", "/docs/a/b", "/docs/c"}) Mkdir(rel);
  test::FakeEnv env;
  test::LogCapture log;
  platform::ScopedFaults faults;
  // The folder gets its watch; the table is full for every directory below it.
  faults.Arm("inotify_add_watch", platform::Fault{-1, ENOSPC}, 1, -1);
  WatcherOptions options;
  options.limit_retry_micros = 60 * 1000000LL;
  Watcher w(options);
  EXPECT_EQ(w.watch_count(), 1u);
  EXPECT_THAT(w.limited_folders(), ElementsAre(share_ + "/docs"));
  // The limit in force: the machine's, or a lower one of a user namespace the test runs in.
  long long limit = 0, own = 0;
  std::ifstream("/proc/sys/fs/inotify/max_user_watches") >> limit;
  std::ifstream("/proc/sys/user/max_inotify_watches") >> own;
  const bool user = own > 0 && own < limit;
  const std::string setting = user ? "user.max_inotify_watches" : "fs.inotify.max_user_watches";
  const std::string now = std::to_string(user ? own : limit);
  const std::string raise = std::to_string((user ? own : limit) + 3);
  EXPECT_TRUE(log.Contains("3 directories below " + share_ + "/docs are not watched"));
  EXPECT_TRUE(log.Contains("Raise " + setting + " (now " + now + ") to at least " + raise));
  EXPECT_EQ(ShareFlags(), fileindex::kShareStatusWatchLimit);
  EXPECT_EQ(Notified(), "-c QUIX.Orvane.Application @administrators app:displayname "
                        "error:watch_limit " + share_ + "/docs " + setting + " " + raise + "\n");

  // Reconciled when the interval is over, however the retry goes; told only once.
  w.RunOnce(20);
  EXPECT_FALSE(IsFileExist(queue_));
  env.Advance(61 * 1000000LL);
  w.RunOnce(20);
  EXPECT_THAT(QueueLines(queue_, share_), ElementsAre("10000 dir /docs reconcile"));
  EXPECT_EQ(ShareFlags(), fileindex::kShareStatusWatchLimit);

  // The limit raised: the next retry watches everything, reconciles once more and clears the
  // mark. (Changes deep below seen again are proven under a real limit.)
  platform::ClearFaults();
  env.Advance(61 * 1000000LL);
  w.RunOnce(20);
  EXPECT_EQ(w.watch_count(), 4u);
  EXPECT_EQ(ShareFlags(), 0);
  EXPECT_TRUE(log.Contains(share_ + "/docs is no longer short of watches"));
  EXPECT_EQ(NotifiedCount(), 1);
}

// A small ext4 image mounted on `dir` for its lifetime, unmounted and removed in all cases.
// Mounted only for root with a loop device at hand.
class LoopVolume {
 public:
  LoopVolume(const std::string& image, const std::string& dir) : image_(image), dir_(dir) {
    // No journal: freed blocks are then free at once, not after the next commit.
    const std::string mkfs =
        "truncate -s 8M '" + image + "' && mkfs.ext4 -q -F -O ^has_journal '" + image + "'";
    if (geteuid() != 0 || std::system((mkfs + " >/dev/null 2>&1").c_str()) != 0) return;
    const std::string mount = "mount -o loop '" + image + "' '" + dir + "' 2>/dev/null";
    mounted_ = std::system(mount.c_str()) == 0;
  }
  ~LoopVolume() {
    if (mounted_ && umount(dir_.c_str()) != 0) umount2(dir_.c_str(), MNT_DETACH);
    unlink(image_.c_str());
  }
  LoopVolume(const LoopVolume&) = delete;
  LoopVolume& operator=(const LoopVolume&) = delete;

  bool mounted() const { return mounted_; }
  // Writes files until the volume has no block (or inode) left; false if it never said so. The
  // large file leaves what the file system keeps in reserve for its growth, small files then
  // take the rest.
  bool Fill() const {
    for (int i = 0; i < 100000; ++i) {
      const UniqueFd fd(open(Filler(i).c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
      if (!fd.valid()) return errno == ENOSPC;
      const std::string chunk(i == 0 ? 4096 : 1024, 'f');
      ssize_t n = 0;
      while ((n = write(fd.get(), chunk.data(), chunk.size())) > 0 && i == 0) {
      }
      if (n < 0 && errno != ENOSPC) return false;
    }
    return false;
  }
  void Free() const {
    for (int i = 0; unlink(Filler(i).c_str()) == 0; ++i) {
    }
  }

 private:
  std::string Filler(int i) const { return dir_ + "/filler" + std::to_string(i); }

  std::string image_;
  std::string dir_;
  bool mounted_ = false;
};

TEST_F(WatcherTest, FullVolumeFlagsTheShareOnceAndReconcilesWhenThereIsRoom) {
  Mkdir("/@eaDir");
  LoopVolume volume(dir_.Path("queue-volume.img"), share_ + "/@eaDir");
  if (!volume.mounted()) GTEST_SKIP() << "needs root, mkfs.ext4 and a loop device";
  Mkdir("/@eaDir/@fileindex");
  ASSERT_TRUE(volume.Fill());
  test::LogCapture log;
  Watcher w;
  // Changes while the volume is full: each pass tries again, the administrator is told once.
  for (int i = 0; i < 3; ++i) {
    Touch("/docs/lost" + std::to_string(i) + ".txt");
    w.RunOnce(50);
  }
  EXPECT_THAT(QueueLines(queue_, share_), ElementsAre());
  EXPECT_EQ(ShareFlags(), fileindex::kShareStatusQueueNoSpace);
  EXPECT_EQ(log.Count("cannot append to queue " + queue_), 1);
  EXPECT_TRUE(log.Contains("free space on its volume"));
  EXPECT_THAT(Notified(), ::testing::HasSubstr("error:index_no_space"));
  EXPECT_EQ(NotifiedCount(), 1);

  // Room again: the reconciliation, written first, stands for everything not queued (what
  // changes before it is written is on the disk it reads); then lines as before.
  volume.Free();
  Touch("/docs/meanwhile.txt");
  EXPECT_THAT(Drain(w, 1), ElementsAre("10000 dir /docs reconcile"));
  EXPECT_EQ(ShareFlags(), 0);
  EXPECT_TRUE(log.Contains("queue " + queue_ + " can be written again"));
  Touch("/docs/after.txt");
  EXPECT_THAT(Drain(w, 3),
              ElementsAre("10000 dir /docs reconcile", "40 /docs/after.txt", "8 /docs/after.txt"));
}

TEST_F(WatcherTest, FollowsRegistrationChangesAndWritesOneLinePerQueue) {
  Watcher w;
  // What changed just before the registrations are read again is still reported.
  Touch("/docs/before-reload.txt");
  w.Reload();
  EXPECT_THAT(Drain(w, 2), ElementsAre("40 /docs/before-reload.txt", "8 /docs/before-reload.txt"));
  Unlink(queue_);

  // Two nested folders of one share: still one line per change.
  Register({"/docs", ""});
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

TEST_F(WatcherTest, UnwritableQueueKeepsLinesUntilItCanBeWrittenOrTooManyAreHeld) {
  Register({"/docs", "/other"});
  WatcherOptions options;
  options.max_pending_bytes = 1024;
  Watcher w(options);
  // A file where the queue's folder should be is refused, once, with what to do about it.
  Mkdir("/@eaDir");
  Touch("/@eaDir/@fileindex", "in the way");
  test::LogCapture log;
  Touch("/docs/kept.txt");
  w.RunOnce(200);
  w.RunOnce(200);
  EXPECT_EQ(log.Count("unsafe index file " + share_ + "/@eaDir/@fileindex: it is a file, not a "
                      "folder; move it aside or remove it"),
            1);
  ASSERT_EQ(unlink((share_ + "/@eaDir/@fileindex").c_str()), 0);
  EXPECT_THAT(Drain(w, 2), ElementsAre("40 /docs/kept.txt", "8 /docs/kept.txt"));
  Unlink(queue_);

  // Past the bound, the lines held give way to a reconciliation of both folders (the lines
  // dropped may have been of either), followed by the lines held since.
  ASSERT_EQ(rmdir((share_ + "/@eaDir/@fileindex").c_str()), 0);
  Touch("/@eaDir/@fileindex", "in the way");
  for (int i = 0; i < 20; ++i) Touch("/docs/f" + std::to_string(i) + ".txt");
  w.RunOnce(200);
  EXPECT_TRUE(log.Contains("too many changes held, dropped for a reconciliation of its folders"));
  ASSERT_EQ(unlink((share_ + "/@eaDir/@fileindex").c_str()), 0);
  const std::vector<std::string> lines = Drain(w, 2);
  ASSERT_GE(lines.size(), 2u);
  EXPECT_THAT(std::vector<std::string>(lines.begin(), lines.begin() + 2),
              ElementsAre("10000 dir /docs reconcile", "10000 dir /other reconcile"));
  EXPECT_LT(lines.size(), 20u);
}

// What a stored record holds is checked where the library writes it; here, what is refused.
TEST(MonitorQueueTest, RegistrationRecordsAreCheckedAndReplacedPerQueue) {
  test::TempDir dir;
  test::ScopedRoot root(dir.path());
  const Json::Value good = Record("/v/s/@eaDir/@fileindex/queue", {"/v/s/a", "/v/s/b"});
  const auto upsert = [](const Json::Value& v, const char* app = "fileindex") {
    return MonitorQueue::Upsert(v, app, MONITOR_QUEUE_TYPE_APPLICATION);
  };
  ASSERT_TRUE(upsert(good) && upsert(good));
  EXPECT_EQ(MonitorQueue::List().size(), 1u);

  for (const char* bad : {R"({"queue":"relative","config":[]})", R"({"queue":"/q"})",
                          R"({"queue":"/q","config":[{"path":"/p","mask":-1,"ignore":[]}]})",
                          R"({"queue":"/q","config":[{"path":"/p","mask":1,"ignore":[3]}]})"}) {
    JsonValue v;
    ASSERT_TRUE(v.fromString(bad));
    errno = 0;
    EXPECT_FALSE(upsert(v)) << bad;
    EXPECT_EQ(errno, EINVAL) << bad;
  }
  EXPECT_FALSE(upsert(good, "../escape"));
  // Deleting twice succeeds: the caller wanted it gone.
  const auto drop = [&] {
    return MonitorQueue::Delete(good["queue"].asString(), "fileindex",
                                MONITOR_QUEUE_TYPE_APPLICATION);
  };
  EXPECT_TRUE(drop() && drop());
  EXPECT_TRUE(MonitorQueue::List().empty());
}

// The real daemon under a real limit: in a user namespace of its own whose watch limit leaves
// most directories unwatched, raised while it runs. Skipped where user namespaces are refused.
TEST_F(WatcherTest, DaemonUnderARealWatchLimitMarksTheShareUntilTheLimitIsRaised) {
  for (int i = 0; i < 6; ++i) Mkdir("/docs/d" + std::to_string(i));
  int ready[2], go[2];
  ASSERT_EQ(0, pipe2(ready, O_CLOEXEC) | pipe2(go, O_CLOEXEC));
  const pid_t pid = fork();
  if (pid == 0) {
    // Every id maps to itself, so the daemon is root as before, under a limit of its own of
    // three watches: the registrations folder, the share's folder and one directory of six.
    char c = 0;
    if (unshare(CLONE_NEWUSER) != 0 || write(ready[1], "u", 1) != 1 || read(go[0], &c, 1) != 1) {
      _exit(126);
    }
    const int limit = open("/proc/sys/user/max_inotify_watches", O_WRONLY | O_CLOEXEC);
    if (limit < 0 || write(limit, "3\n", 2) != 2) _exit(126);
    const int null = open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (null >= 0 && getenv("WATCHER_TEST_STDERR") == nullptr) dup2(null, 2);
    execl(QUIXNOTIFYD_BIN, "quixnotifyd", "--limit-retry", "1", static_cast<char*>(nullptr));
    _exit(127);
  }
  for (const int fd : {ready[1], go[0]}) close(fd);
  char c = 0;
  const bool unshared = read(ready[0], &c, 1) == 1;
  for (const char* map : {"uid_map", "gid_map"}) {
    std::ofstream("/proc/" + std::to_string(pid) + "/" + map) << "0 0 4294967295\n";
  }
  EXPECT_EQ(1, write(go[1], "g", 1));
  for (const int fd : {ready[0], go[1]}) close(fd);
  // Killed whatever way the test ends, unless it ended by itself.
  struct Reaper {
    pid_t pid;
    int status = 0;
    bool Exited() { return pid < 0 || (waitpid(pid, &status, WNOHANG) == pid && (pid = -1)); }
    ~Reaper() { (void)(pid > 0 && kill(pid, SIGKILL) == 0 && waitpid(pid, nullptr, 0)); }
  } daemon{pid};
  const auto flags = [this] {
    try {
      return ShareFlags();
    } catch (const Error&) {  // no status file yet
      return -1;
    }
  };
  const auto wait_for = [](const std::function<bool()>& pred) {
    for (int i = 0; i < 500 && !pred(); ++i) usleep(20000);
    return pred();
  };
  wait_for([&] { return flags() == fileindex::kShareStatusWatchLimit || daemon.Exited(); });
  if (!unshared || (daemon.Exited() && WEXITSTATUS(daemon.status) == 126)) {
    GTEST_SKIP() << "no user namespace with a watch limit of its own here";
  }
  ASSERT_EQ(flags(), fileindex::kShareStatusWatchLimit) << "the share was never marked";
  // Told after the mark is set.
  const std::string told = "error:watch_limit " + share_ + "/docs user.max_inotify_watches 8\n";
  EXPECT_TRUE(wait_for([&] { return Notified().find(told) != std::string::npos; })) << Notified();
  // Reconciled at start and again every second while the limit holds.
  EXPECT_TRUE(wait_for([&] { return LinesOf("10000 dir /docs reconcile") >= 3; }));

  ASSERT_EQ(0, std::system(("nsenter -U -t " + std::to_string(pid) +
                            " sh -c 'echo 100 > /proc/sys/user/max_inotify_watches'")
                               .c_str()));
  EXPECT_TRUE(wait_for([&] { return flags() == 0; }));
  Touch("/docs/d5/late.txt");
  EXPECT_TRUE(wait_for([&] { return LinesOf("40 /docs/d5/late.txt") == 1; }));
  EXPECT_EQ(NotifiedCount(), 1);
}

}  // namespace
}  // namespace quixnotifyd
}  // namespace orvane
