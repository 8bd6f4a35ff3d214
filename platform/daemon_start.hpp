// The start-up the daemons share: a pid file held locked for the life of the process, and the
// stop and reload signals turned into flags the main thread waits on. Both are made once, on the
// main thread, before any other thread starts; the objects themselves are not thread-safe.
#ifndef ORVANE_PLATFORM_DAEMON_START_HPP_
#define ORVANE_PLATFORM_DAEMON_START_HPP_

#include <signal.h>

#include <atomic>
#include <string>

#include "common/fd.hpp"

namespace orvane {
namespace platform {

class PidFile {
 public:
  // Creates `path` when missing (mode 0644), locks it exclusively without waiting and writes the
  // process's pid into it. Throws Error(kErrLockFile) naming the file and the pid in it when a
  // running process holds the lock, Error(kErrSystem) when the file cannot be opened or written.
  explicit PidFile(const std::string& path);
  // A clean stop: the file is removed. A process that dies without this leaves it, pid and all.
  ~PidFile();
  PidFile(const PidFile&) = delete;
  PidFile& operator=(const PidFile&) = delete;

  // The file held a pid when it was taken: the run before did not stop cleanly.
  bool left_behind() const { return left_behind_; }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  UniqueFd fd_;
  bool left_behind_ = false;
};

// SIGTERM and SIGINT ask the daemon to stop, SIGHUP (when taken) to re-read its configuration;
// SIGPIPE is ignored, so a peer that went away is an error of the write, not the end of the
// process. The handlers only set flags: the daemon acts on them in its main thread. One at a
// time per process; the previous dispositions and mask come back when it goes.
class DaemonSignals {
 public:
  // Blocks the signals in the calling thread, so that every thread started afterwards inherits
  // the block and only Wait() (or a thread that called Unblock()) takes them. Without
  // `take_reload`, SIGHUP keeps its default action.
  explicit DaemonSignals(bool take_reload);
  ~DaemonSignals();
  DaemonSignals(const DaemonSignals&) = delete;
  DaemonSignals& operator=(const DaemonSignals&) = delete;

  // Waits up to `timeout_ms` (-1: without limit) for a signal and returns its number: the stop
  // signal once one arrived (every call after it too), SIGHUP once per reload asked, 0 when the
  // time ran out.
  int Wait(int timeout_ms = -1);
  // For a main thread that waits in a poll of its own: the signals reach this thread from now on
  // and cut that wait short; the daemon looks at stop() and TakeReload() after it.
  void Unblock();

  const std::atomic<bool>& stop() const;
  // Whether a reload was asked since the last call.
  bool TakeReload();

 private:
  sigset_t taken_;
  sigset_t old_mask_;
  struct sigaction old_term_, old_int_, old_hup_, old_pipe_;
  bool take_reload_;
};

// Detaches from the terminal into a session of its own, standard streams on /dev/null; the
// parent exits only once the child is on its own. `program` names the daemon in the message of a
// failed fork.
void Daemonize(const char* program);

// A daemon's first step: detached unless `foreground`, its log lines to the system log under the
// name `program` (a literal: the log keeps the pointer), and to standard error in the foreground.
void BecomeDaemon(const char* program, bool foreground);

// Called once the daemon serves its clients (its sockets listen): tells a service manager that
// started it with a notification socket (NOTIFY_SOCKET) that it is ready; nothing otherwise.
// A failed notice is logged, never fatal.
void NotifyReady();

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_DAEMON_START_HPP_
