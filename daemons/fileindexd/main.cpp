// fileindexd: the indexing daemon. It drains every indexed share's queue into the search engine
// and answers the library's commands on its socket.
//
//   fileindexd [--pid-file PATH]
//
// Runs in the foreground (a service manager puts it in the background), logs to syslog and to
// standard error, re-reads the folder configuration on SIGHUP, stops cleanly on SIGTERM or
// SIGINT. A start that finds the pid file of a run that did not stop cleanly queues a
// reconciliation of every indexed folder. Fixed paths follow ORVANE_ROOT.
#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "daemons/fileindexd/index_daemon.hpp"
#include "daemons/fileindexd/server.hpp"
#include "extract/extract_runner.hpp"

int main(int argc, char** argv) {
  std::string pid_file = orvane::fileindexd::kFileIndexdPidPath;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--pid-file") == 0 && i + 1 < argc) {
      pid_file = argv[++i];
    } else {
      std::fprintf(stderr, "usage: fileindexd [--pid-file PATH]\n");
      return 2;
    }
  }
  openlog("fileindexd", LOG_PID, LOG_DAEMON);
  orvane::SetLogSink(orvane::SyslogSink(true));

  // Signals are taken by the main thread alone, so every thread started below blocks them.
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGHUP);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  signal(SIGPIPE, SIG_IGN);

  const std::string pid_path = orvane::RootedPathForWrite(pid_file);
  // Every clean stop removes the pid file: one with a pid in it is left by a run that was
  // killed or crashed. Judged once the lock is held, so a daemon still running does not count.
  struct stat pid_stat;
  const bool unclean = stat(pid_path.c_str(), &pid_stat) == 0 && pid_stat.st_size > 0;
  orvane::UniqueFd pid_fd(open(pid_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644));
  if (!pid_fd.valid() || flock(pid_fd.get(), LOCK_EX | LOCK_NB) != 0) {
    orvane::Log(LOG_ERR, "fileindexd: %s is locked or cannot be opened: another daemon runs?",
                pid_path.c_str());
    return 1;
  }
  const std::string pid_text = std::to_string(getpid()) + "\n";
  if (ftruncate(pid_fd.get(), 0) != 0 ||
      write(pid_fd.get(), pid_text.data(), pid_text.size()) !=
          static_cast<ssize_t>(pid_text.size())) {
    orvane::Log(LOG_ERR, "fileindexd: cannot write %s: %m", pid_path.c_str());
    return 1;
  }

  int rc = 0;
  try {
    orvane::fileindexd::IndexDaemon daemon;
    orvane::fileindexd::CommandServer server(
        orvane::RootedPath(orvane::fileindexd::kFileIndexdSockPath),
        [&daemon](const Json::Value& command, uid_t uid) { return daemon.Handle(command, uid); });
    if (unclean) {
      orvane::Log(LOG_WARNING,
                  "fileindexd: %s was left behind, the last run did not stop cleanly: every "
                  "indexed folder is reconciled",
                  pid_path.c_str());
      orvane::fileindexd::IndexDaemon::ReconcileAll();
    }
    // Workers first, so that whoever reaches the socket sees them.
    daemon.Start();
    server.Start();
    orvane::Log(LOG_INFO, "fileindexd: ready");
    for (;;) {
      int sig = 0;
      if (sigwait(&signals, &sig) != 0) continue;
      if (sig == SIGHUP) {
        // A folder file broken by hand must not stop the daemon: the workers it has go on.
        try {
          daemon.Reload();
        } catch (const std::exception& e) {
          orvane::Log(LOG_ERR, "fileindexd: reload failed, workers unchanged: %s", e.what());
        }
        continue;
      }
      break;
    }
    orvane::Log(LOG_INFO, "fileindexd: stopping");
    server.Stop();
    daemon.StopAll();
    orvane::extract::CloseIdleExtractHelpers();
  } catch (const orvane::Error& e) {
    orvane::Log(LOG_ERR, "fileindexd: %s", e.what());
    rc = 1;
  }
  unlink(pid_path.c_str());
  return rc;
}
