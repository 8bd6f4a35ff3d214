// quixnotifyd: the file-change daemon. It appends one event line per change below every
// registered folder to that registration's queue file, and a reconcile line for every folder
// when it starts (what changed while nobody watched), when the kernel lost events, and, for a
// folder the inotify watch limit leaves partly unwatched, every --limit-retry seconds (300).
//
//   quixnotifyd [--pid-file PATH] [--limit-retry SECONDS]
//
// Runs in the foreground (a service manager puts it in the background), logs to syslog and to
// standard error, re-reads the registrations on SIGHUP or when they change, stops on SIGTERM or
// SIGINT after writing what it holds. The pid file is locked: a second daemon refuses to start.
// Fixed paths follow ORVANE_ROOT.
#include <syslog.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "daemons/quixnotifyd/watcher.hpp"
#include "platform/daemon_start.hpp"

namespace {

// Follows the registered folders until a stop signal; false when inotify failed.
bool Serve(const orvane::quixnotifyd::WatcherOptions& options,
           orvane::platform::DaemonSignals* signals) {
  orvane::quixnotifyd::Watcher watcher(options);
  // The watcher waits in its own poll; a signal cuts that wait short.
  signals->Unblock();
  // Whatever changed while no watcher ran (a stop, a crash, a reboot) is found by comparing
  // every folder with its index; the watches are in place first.
  watcher.ReconcileAll();
  orvane::platform::NotifyReady();
  while (!signals->stop().load()) {
    if (!watcher.RunOnce(500)) {
      orvane::Log(LOG_ERR, "quixnotifyd: inotify failed, stopping");
      return false;
    }
    if (signals->TakeReload()) watcher.Reload();
  }
  watcher.Run(signals->stop(), 0);
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  std::string pid_file = "/var/run/quixnotifyd.pid";
  orvane::quixnotifyd::WatcherOptions options;
  for (int i = 1; i < argc; ++i) {
    char* end = nullptr;
    if (std::strcmp(argv[i], "--pid-file") == 0 && i + 1 < argc) {
      pid_file = argv[++i];
    } else if (std::strcmp(argv[i], "--limit-retry") == 0 && i + 1 < argc &&
               std::strtol(argv[i + 1], &end, 10) > 0 && *end == '\0') {
      options.limit_retry_micros = std::strtol(argv[++i], nullptr, 10) * 1000000LL;
    } else {
      std::fprintf(stderr, "usage: quixnotifyd [--pid-file PATH] [--limit-retry SECONDS]\n");
      return 2;
    }
  }
  orvane::platform::BecomeDaemon("quixnotifyd", true);

  orvane::platform::DaemonSignals signals(true);
  try {
    // Taken before anything is watched: a second daemon must not add lines to the queues.
    const orvane::platform::PidFile pid(orvane::RootedPathForWrite(pid_file));
    return Serve(options, &signals) ? 0 : 1;
  } catch (const orvane::Error& e) {
    orvane::Log(LOG_ERR, "quixnotifyd: %s", e.what());
    return 1;
  }
}
