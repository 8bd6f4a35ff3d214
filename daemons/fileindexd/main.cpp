// fileindexd: the indexing daemon. It drains every indexed share's queue into the search engine
// and answers the library's commands on its socket.
//
//   fileindexd [--pid-file PATH]
//
// Runs in the foreground (a service manager puts it in the background), logs to syslog and to
// standard error, re-reads the folder configuration on SIGHUP, stops cleanly on SIGTERM or
// SIGINT. A start that finds the pid file of a run that did not stop cleanly queues a
// reconciliation of every indexed folder. Fixed paths follow ORVANE_ROOT.
#include <signal.h>
#include <syslog.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "daemons/fileindexd/index_daemon.hpp"
#include "daemons/fileindexd/server.hpp"
#include "extract/extract_runner.hpp"
#include "platform/daemon_start.hpp"

namespace {

using orvane::Log;
using orvane::fileindexd::IndexDaemon;

// Serves until a stop signal; the workers and the socket are stopped before it returns.
void Serve(const orvane::platform::PidFile& pid_file, orvane::platform::DaemonSignals* signals) {
  IndexDaemon daemon;
  orvane::fileindexd::CommandServer server(
      orvane::RootedPath(orvane::kFileIndexdSockPath),
      [&daemon](const Json::Value& command, uid_t uid) { return daemon.Handle(command, uid); });
  if (pid_file.left_behind()) {
    Log(LOG_WARNING,
        "fileindexd: %s was left behind, the last run did not stop cleanly: every indexed folder "
        "is reconciled",
        pid_file.path().c_str());
    IndexDaemon::ReconcileAll();
  }
  // Workers first, so that whoever reaches the socket sees them.
  daemon.Start();
  server.Start();
  Log(LOG_INFO, "fileindexd: ready");
  orvane::platform::NotifyReady();
  while (signals->Wait() == SIGHUP) {
    // A folder file broken by hand must not stop the daemon: the workers it has go on.
    try {
      daemon.Reload();
    } catch (const std::exception& e) {
      Log(LOG_ERR, "fileindexd: reload failed, workers unchanged: %s", e.what());
    }
  }
  Log(LOG_INFO, "fileindexd: stopping");
  server.Stop();
  daemon.StopAll();
  orvane::extract::CloseIdleExtractHelpers();
}

}  // namespace

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
  orvane::platform::BecomeDaemon("fileindexd", true);

  // Before any thread starts, so that every one of them leaves the signals to the main thread.
  orvane::platform::DaemonSignals signals(true);
  try {
    const orvane::platform::PidFile pid(orvane::RootedPathForWrite(pid_file));
    Serve(pid, &signals);
  } catch (const orvane::Error& e) {
    Log(LOG_ERR, "fileindexd: %s", e.what());
    return 1;
  }
  return 0;
}
