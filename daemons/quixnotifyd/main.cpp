// quixnotifyd: the file-change daemon. It appends one event line per change below every
// registered folder to that registration's queue file, and a reconcile line for every folder
// when it starts (what changed while nobody watched), when the kernel lost events, and, for a
// folder the inotify watch limit leaves partly unwatched, every --limit-retry seconds (300).
//
//   quixnotifyd [--pid-file PATH] [--limit-retry SECONDS]
//
// Runs in the foreground (a service manager puts it in the background), logs to syslog and to
// standard error, re-reads the registrations on SIGHUP or when they change, stops on SIGTERM or
// SIGINT after writing what it holds. Fixed paths follow ORVANE_ROOT.
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "daemons/quixnotifyd/watcher.hpp"

namespace {

std::atomic<bool> g_stop{false};

void OnStop(int) { g_stop.store(true); }

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
  openlog("quixnotifyd", LOG_PID, LOG_DAEMON);
  orvane::SetLogSink(orvane::SyslogSink(true));

  struct sigaction stop = {};
  stop.sa_handler = OnStop;
  sigaction(SIGTERM, &stop, nullptr);
  sigaction(SIGINT, &stop, nullptr);
  signal(SIGPIPE, SIG_IGN);
  // SIGHUP only has to interrupt the wait; the reload itself is done below.
  std::atomic<bool> reload{false};
  static std::atomic<bool>* reload_flag = &reload;
  struct sigaction hup = {};
  hup.sa_handler = [](int) { reload_flag->store(true); };
  sigaction(SIGHUP, &hup, nullptr);

  try {
    orvane::quixnotifyd::Watcher watcher(options);
    // Whatever changed while no watcher ran (a stop, a crash, a reboot) is found by comparing
    // every folder with its index; the watches are in place first.
    watcher.ReconcileAll();
    const std::string pid_path = orvane::RootedPathForWrite(pid_file);
    std::ofstream(pid_path, std::ios::trunc) << getpid() << "\n";
    while (!g_stop.load()) {
      if (!watcher.RunOnce(500)) {
        orvane::Log(LOG_ERR, "quixnotifyd: inotify failed, stopping");
        unlink(pid_path.c_str());
        return 1;
      }
      if (reload.exchange(false)) watcher.Reload();
    }
    watcher.Run(g_stop, 0);
    unlink(pid_path.c_str());
  } catch (const orvane::Error& e) {
    orvane::Log(LOG_ERR, "quixnotifyd: %s", e.what());
    return 1;
  }
  return 0;
}
