#include "platform/daemon_start.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/log.hpp"
#include "platform/fault.hpp"

namespace orvane {
namespace platform {

namespace {

// The pid a holder of the lock wrote, or a word saying it has not yet.
std::string HolderPid(int fd) {
  char buf[32] = {};
  const ssize_t n = pread(fd, buf, sizeof(buf) - 1, 0);
  std::string pid(buf, n > 0 ? static_cast<size_t>(n) : 0);
  while (!pid.empty() && (pid.back() == '\n' || pid.back() == ' ')) pid.pop_back();
  return pid.empty() ? "not written yet" : pid;
}

// Under the service manager standard error may be the journal's own stream; the lines already
// reach the journal through the system log, so they are not written there twice.
bool StderrIsJournal() {
  const char* stream = std::getenv("JOURNAL_STREAM");
  struct stat st;
  if (stream == nullptr || fstat(2, &st) != 0) return false;
  unsigned long long dev = 0, ino = 0;
  return std::sscanf(stream, "%llu:%llu", &dev, &ino) == 2 && dev == st.st_dev && ino == st.st_ino;
}

bool SameFile(int fd, const std::string& path) {
  struct stat held, named;
  return fstat(fd, &held) == 0 && stat(path.c_str(), &named) == 0 && held.st_dev == named.st_dev &&
         held.st_ino == named.st_ino;
}

// Set by the handlers, read by the main thread: lock-free atomics are all a handler may touch.
std::atomic<bool> g_stop{false};
std::atomic<int> g_stop_signal{0};
std::atomic<bool> g_reload{false};

void OnSignal(int sig) {
  if (sig == SIGHUP) {
    g_reload.store(true);
    return;
  }
  g_stop_signal.store(sig);
  g_stop.store(true);
}

}  // namespace

PidFile::PidFile(const std::string& path) : path_(path) {
  // A daemon stopping at this moment removes the file it held after this one opened it, and a
  // lock on a removed file keeps nobody out: the lock counts only on the file the path still
  // names once it is held.
  constexpr int kAttempts = 8;
  for (int attempt = 1;; ++attempt) {
    // Not through a link: where others may write to the pid file's folder, a planted link would
    // have root truncate and write the file it points to.
    fd_.Reset(open(path_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644));
    ORVANE_THROW_IF(!fd_.valid(), kErrSystem,
                    "cannot open the pid file " + path_ + ": " + std::strerror(errno));
    if (flock(fd_.get(), LOCK_EX | LOCK_NB) != 0) {
      const int failure = errno;
      ORVANE_THROW_IF(failure == EWOULDBLOCK, kErrLockFile,
                      "the pid file " + path_ + " is held by a running daemon (pid " +
                          HolderPid(fd_.get()) +
                          "): stop that one first, or give this one another --pid-file");
      ORVANE_THROW_IF(failure != EINTR, kErrSystem,
                      "cannot lock the pid file " + path_ + ": " + std::strerror(failure));
    } else if (SameFile(fd_.get(), path_)) {
      break;
    }
    ORVANE_THROW_IF(attempt >= kAttempts, kErrSystem,
                    "the pid file " + path_ + " keeps being replaced while it is locked");
  }
  // Every clean stop removes the file, so one that still holds a pid was left by a run that was
  // killed or crashed. Judged under the lock, so a daemon still running does not count.
  struct stat st;
  left_behind_ = fstat(fd_.get(), &st) == 0 && st.st_size > 0;
  // Written over the old pid before the rest is cut, so a failed write does not wipe the mark
  // of an unclean stop.
  const std::string text = std::to_string(getpid()) + "\n";
  ssize_t written = -1;
  if (const auto fault = FaultFor("PidFileWrite")) {
    errno = fault->err;
  } else {
    written = pwrite(fd_.get(), text.data(), text.size(), 0);
  }
  ORVANE_THROW_IF(written != static_cast<ssize_t>(text.size()) ||
                      ftruncate(fd_.get(), static_cast<off_t>(text.size())) != 0,
                  kErrSystem, "cannot write the pid file " + path_ + ": " + std::strerror(errno));
}

PidFile::~PidFile() {
  // Removed while still locked, and only while the path names this file: one put in its place
  // by hand belongs to someone else.
  if (fd_.valid() && SameFile(fd_.get(), path_)) unlink(path_.c_str());
}

DaemonSignals::DaemonSignals(bool take_reload) : take_reload_(take_reload) {
  g_stop.store(false);
  g_stop_signal.store(0);
  g_reload.store(false);
  sigemptyset(&taken_);
  sigaddset(&taken_, SIGTERM);
  sigaddset(&taken_, SIGINT);
  if (take_reload_) sigaddset(&taken_, SIGHUP);
  // Blocked before the handlers go in, so none runs on a thread that is not meant to take it.
  pthread_sigmask(SIG_BLOCK, &taken_, &old_mask_);
  struct sigaction on = {};
  on.sa_handler = OnSignal;
  on.sa_mask = taken_;
  sigaction(SIGTERM, &on, &old_term_);
  sigaction(SIGINT, &on, &old_int_);
  if (take_reload_) sigaction(SIGHUP, &on, &old_hup_);
  struct sigaction ignore = {};
  ignore.sa_handler = SIG_IGN;
  sigaction(SIGPIPE, &ignore, &old_pipe_);
}

DaemonSignals::~DaemonSignals() {
  sigaction(SIGPIPE, &old_pipe_, nullptr);
  if (take_reload_) sigaction(SIGHUP, &old_hup_, nullptr);
  sigaction(SIGINT, &old_int_, nullptr);
  sigaction(SIGTERM, &old_term_, nullptr);
  pthread_sigmask(SIG_SETMASK, &old_mask_, nullptr);
}

int DaemonSignals::Wait(int timeout_ms) {
  // The signals are let through only inside ppoll, atomically with the wait: one that arrived
  // after the flags were looked at is pending and ends the wait at once.
  sigset_t open;
  pthread_sigmask(SIG_SETMASK, nullptr, &open);
  sigdelset(&open, SIGTERM);
  sigdelset(&open, SIGINT);
  if (take_reload_) sigdelset(&open, SIGHUP);
  Env* env = Env::Current();
  const int64_t deadline = timeout_ms < 0 ? -1 : env->NowMicros() + timeout_ms * 1000LL;
  for (bool timed_out = false;;) {
    if (g_stop.load()) return g_stop_signal.load();
    if (take_reload_ && g_reload.exchange(false)) return SIGHUP;
    if (timed_out) return 0;
    struct timespec left = {};
    if (deadline >= 0) {
      const int64_t micros = std::max<int64_t>(deadline - env->NowMicros(), 0);
      left.tv_sec = micros / 1000000;
      left.tv_nsec = (micros % 1000000) * 1000;
    }
    // An interruption is a signal (ours or another's): the flags say which.
    const int polled = ppoll(nullptr, 0, deadline >= 0 ? &left : nullptr, &open);
    timed_out = polled == 0 || (polled < 0 && errno != EINTR);
  }
}

void DaemonSignals::Unblock() { pthread_sigmask(SIG_UNBLOCK, &taken_, nullptr); }

const std::atomic<bool>& DaemonSignals::stop() const { return g_stop; }

bool DaemonSignals::TakeReload() { return g_reload.exchange(false); }

void Daemonize(const char* program) {
  const pid_t pid = ::fork();
  if (pid < 0) {
    std::perror((std::string(program) + ": fork").c_str());
    std::exit(1);
  }
  if (pid > 0) std::_Exit(0);
  ::setsid();
  if (::chdir("/") != 0) std::_Exit(1);
  const int null = ::open("/dev/null", O_RDWR);
  if (null >= 0) {
    ::dup2(null, 0);
    ::dup2(null, 1);
    ::dup2(null, 2);
    if (null > 2) ::close(null);
  }
}

void BecomeDaemon(const char* program, bool foreground) {
  if (!foreground) Daemonize(program);
  ::openlog(program, LOG_PID, LOG_DAEMON);
  SetLogSink(SyslogSink(foreground && !StderrIsJournal()));
}

void NotifyReady() {
  // Started by hand or by a manager that does not wait for the notice, there is no
  // NOTIFY_SOCKET and nothing is sent. The variable stays: threads already run and may read the
  // environment, and the helpers this daemon starts never notify.
  const int rc = sd_notify(0, "READY=1");
  if (rc < 0) {
    ORVANE_LOG(LOG_WARNING, "cannot tell the service manager that the daemon is ready: %s",
               std::strerror(-rc));
  }
}

}  // namespace platform
}  // namespace orvane
