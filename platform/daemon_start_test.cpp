#include "platform/daemon_start.hpp"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <thread>

#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

using ::testing::HasSubstr;

std::string PidLine(pid_t pid) { return std::to_string(pid) + "\n"; }

TEST(PidFileTest, HeldForTheLifeOfTheProcessAndRemovedAtACleanStop) {
  test::TempDir dir;
  const std::string path = dir.Path("d.pid");
  {
    const PidFile held(path);
    EXPECT_FALSE(held.left_behind());
    EXPECT_EQ(test::ReadFile(path), PidLine(getpid()));
    // A second start is refused with the file and the holder named, and leaves the file as it
    // was. (flock locks of two opens conflict within one process as between two.)
    const Error refused = test::ErrorOf([&] { PidFile second(path); });
    EXPECT_EQ(refused.code, kErrLockFile);
    EXPECT_THAT(refused.what(), HasSubstr(path + " is held by a running daemon (pid " +
                                          std::to_string(getpid()) + ")"));
    EXPECT_EQ(test::ReadFile(path), PidLine(getpid()));
  }
  EXPECT_NE(access(path.c_str(), F_OK), 0);
  // A folder that cannot hold it is named too.
  EXPECT_THAT(test::ErrorOf([&] { PidFile(dir.Path("none/d.pid")); }).what(),
              HasSubstr("cannot open the pid file " + dir.Path("none/d.pid")));
  // A link planted at the path is refused, and what it points to is left untouched.
  const std::string target = dir.Write("victim", "keep");
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EXPECT_THAT(test::ErrorOf([&] { PidFile planted(path); }).what(),
              HasSubstr("cannot open the pid file " + path));
  EXPECT_EQ(test::ReadFile(target), "keep");
}

TEST(PidFileTest, TheFileOfAKilledHolderIsTakenOverAndSaysTheRunDidNotStopCleanly) {
  test::TempDir dir;
  const std::string path = dir.Path("d.pid");
  int ready[2];
  ASSERT_EQ(0, pipe2(ready, O_CLOEXEC));
  const pid_t child = fork();
  if (child == 0) {
    const PidFile held(path);
    if (write(ready[1], "r", 1) != 1) _exit(1);
    pause();
    _exit(0);
  }
  close(ready[1]);
  char c = 0;
  ASSERT_EQ(1, read(ready[0], &c, 1));
  close(ready[0]);
  kill(child, SIGKILL);
  ASSERT_EQ(child, waitpid(child, nullptr, 0));
  ASSERT_EQ(test::ReadFile(path), PidLine(child));

  {
    // A failed write keeps the old pid, so the next start still sees the unclean stop.
    ScopedFaults faults;
    faults.Arm("PidFileWrite", Fault{-1, ENOSPC});
    EXPECT_THAT(test::ErrorOf([&] { PidFile failed(path); }).what(),
                HasSubstr("cannot write the pid file " + path + ": No space left on device"));
    EXPECT_EQ(test::ReadFile(path), PidLine(child));
  }
  {
    const PidFile taken(path);
    EXPECT_TRUE(taken.left_behind());
    EXPECT_EQ(test::ReadFile(path), PidLine(getpid()));
  }
  // An empty file (a start killed before it wrote its pid) is no mark of an unclean stop.
  dir.Write("d.pid", "");
  EXPECT_FALSE(PidFile(path).left_behind());
}

bool Blocked(int sig) {
  sigset_t mask;
  pthread_sigmask(SIG_SETMASK, nullptr, &mask);
  return sigismember(&mask, sig) == 1;
}

TEST(DaemonSignalsTest, StopAndReloadReachTheWaitOnlyAndSigpipeIsIgnored) {
  {
    DaemonSignals signals(true);
    // Threads started from here on leave the signals to the waits.
    bool thread_blocks = false;
    std::thread([&] { thread_blocks = Blocked(SIGTERM) && Blocked(SIGHUP); }).join();
    EXPECT_TRUE(thread_blocks);

    EXPECT_EQ(signals.Wait(10), 0);
    pthread_kill(pthread_self(), SIGHUP);
    EXPECT_EQ(signals.Wait(10000), SIGHUP);
    EXPECT_EQ(signals.Wait(10), 0);  // one reload asked, one taken
    pthread_kill(pthread_self(), SIGTERM);
    EXPECT_EQ(signals.Wait(10000), SIGTERM);
    EXPECT_EQ(signals.Wait(), SIGTERM);  // once stopping, for good
    EXPECT_TRUE(signals.stop().load());

    // A main thread that polls on its own has its wait cut short.
    signals.Unblock();
    pthread_kill(pthread_self(), SIGINT);
    EXPECT_EQ(signals.Wait(10000), SIGINT);

    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    close(fds[0]);
    errno = 0;
    EXPECT_EQ(-1, write(fds[1], "x", 1));
    EXPECT_EQ(errno, EPIPE);
    close(fds[1]);
  }
  // Gone: the mask and the dispositions are as they were.
  EXPECT_FALSE(Blocked(SIGTERM));
  struct sigaction action;
  sigaction(SIGTERM, nullptr, &action);
  EXPECT_EQ(action.sa_handler, SIG_DFL);
  // A daemon that does not reload leaves SIGHUP alone.
  DaemonSignals no_reload(false);
  sigaction(SIGHUP, nullptr, &action);
  EXPECT_EQ(action.sa_handler, SIG_DFL);
  EXPECT_FALSE(Blocked(SIGHUP));
}

// The service manager's side: a datagram socket named by NOTIFY_SOCKET.
TEST(NotifyReadyTest, TheManagerNamedByTheEnvironmentHearsReadyAndALostOneIsOnlyLogged) {
  test::TempDir dir;
  const std::string path = dir.Path("notify");
  UniqueFd manager(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
  ASSERT_EQ(0, bind(manager.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
  ASSERT_EQ(0, setenv("NOTIFY_SOCKET", path.c_str(), 1));
  NotifyReady();
  char buf[64] = {};
  EXPECT_EQ(recv(manager.get(), buf, sizeof(buf) - 1, MSG_DONTWAIT), 7);
  EXPECT_STREQ(buf, "READY=1");

  manager.Close();
  unlink(path.c_str());
  test::LogCapture log;
  NotifyReady();
  EXPECT_TRUE(log.Contains("cannot tell the service manager that the daemon is ready"));
  unsetenv("NOTIFY_SOCKET");
  log.Clear();
  NotifyReady();
  EXPECT_TRUE(log.Lines().empty());
}

}  // namespace
}  // namespace platform
}  // namespace orvane
