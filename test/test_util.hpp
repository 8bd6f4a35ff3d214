// Helpers shared by every test: a scratch folder, a log capture, a fake clock, an ORVANE_ROOT
// scope and child programs. Each is a scoped object that undoes itself; none is thread-safe.
#ifndef ORVANE_TEST_TEST_UTIL_HPP_
#define ORVANE_TEST_TEST_UTIL_HPP_

#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include <sys/types.h>

#include <gmock/gmock.h>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/log.hpp"

namespace orvane {
namespace test {

// A fresh folder under $TMPDIR (or /tmp), removed with everything in it at scope end.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  // path() + "/" + rel.
  std::string Path(const std::string& rel) const { return path_ + "/" + rel; }
  // Writes `content` to path()/rel, creating parent folders; returns the full path.
  std::string Write(const std::string& rel, const std::string& content) const;

 private:
  std::string path_;
};

// Reads a whole file; "" when it cannot be read.
std::string ReadFile(const std::string& path);
// Writes `text` to the file at `path`, making its parent folders.
void WriteFile(const std::string& path, const std::string& text);

// Writes the platform configuration (shares, administrators group, ...) that the platform layer
// reads under `root` (the test's ORVANE_ROOT): `root`/etc/orvane/platform.json. Returns its path.
std::string WritePlatformConfig(const std::string& root, const std::string& json_text);

// Captures every log line for its lifetime instead of sending it to syslog.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<std::string> Lines() const;
  // Whether some line contains `text`.
  bool Contains(const std::string& text) const;
  // The number of lines containing `text`.
  int Count(const std::string& text) const;
  void Clear();

 private:
  mutable std::mutex mu_;
  std::vector<std::string> lines_;
  LogSink previous_;
};

// A clock that only moves when slept on, with scripted rand() values; installed for its
// lifetime. Every sleep is recorded.
class FakeEnv : public Env {
 public:
  FakeEnv();
  ~FakeEnv() override;

  time_t Now() override;
  int64_t NowMicros() override;
  void SleepMicros(int64_t micros) override;
  int Rand() override;

  // Values Rand() returns, in order; 0 once they are used up.
  void QueueRand(std::vector<int> values);
  // Advances the clock without a sleep.
  void Advance(int64_t micros);
  const std::vector<int64_t>& sleeps() const { return sleeps_; }
  int64_t slept_micros() const;

 private:
  std::mutex mu_;
  int64_t now_micros_;
  std::vector<int64_t> sleeps_;
  std::deque<int> rand_;
  Env* previous_;
};

// Runs `fn` in a child process as `user` (real and effective ids, no supplementary groups) and
// returns what it returns, or -1 when the child could not switch or died. Unprivileged callers
// cannot switch: `fn` then runs in a child as the caller, who is unprivileged already.
int RunAsUser(const std::string& user, const std::function<int()>& fn);

// Makes `dir`/`rel` a share root every user may write (0777), with `dir` searchable by all
// (0711), as a hostile local user meets a share open to everyone. Returns its path.
std::string MakeOpenShare(const TempDir& dir, const std::string& rel);

// renameat2(RENAME_EXCHANGE) of two paths: 0 or -1 with errno set.
int RenameExchange(const std::string& a, const std::string& b);

// What a program run to its end left: its exit status (-1 when it did not exit) and what it
// wrote to standard output and error.
struct ProgramResult {
  int status;
  std::string out;
  std::string err;
};

// Runs the program at `path` (argv[0] its file name) with `args` and this process's
// environment, ORVANE_ROOT replaced by `root` unless that is empty, and waits for it.
ProgramResult RunProgram(const std::string& path, const std::vector<std::string>& args,
                         const std::string& root = std::string());

// Polls `pred` every 20 ms until it holds or `timeout_ms` passes; returns its last answer.
bool WaitFor(const std::function<bool()>& pred, int timeout_ms);

// A program (argv[0] its path) run in a child process under `root` as ORVANE_ROOT, its standard
// error sent to /dev/null unless FILEINDEXD_TEST_STDERR is set (a daemon's log lines would drown
// the test's output; syslog still has them). Killed (SIGKILL) at scope end unless stopped before.
class ChildProcess {
 public:
  ChildProcess(const std::string& root, std::vector<std::string> argv);
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  // Sends `sig` and waits for the exit; returns the wait status (-1 when not running).
  int Signal(int sig);
  // Waits up to `timeout_ms` for the process to end by itself; true when it did (it is reaped).
  bool Exited(int timeout_ms);
  pid_t pid() const { return pid_; }

 private:
  pid_t pid_ = -1;
};

// Sets ORVANE_ROOT for its lifetime and restores the former value.
class ScopedRoot {
 public:
  explicit ScopedRoot(const std::string& root);
  ~ScopedRoot();
  ScopedRoot(const ScopedRoot&) = delete;
  ScopedRoot& operator=(const ScopedRoot&) = delete;

 private:
  bool had_;
  std::string old_;
};

// The Error that `fn` throws; a test failure (and a placeholder Error) when it throws none.
template <typename Fn>
Error ErrorOf(Fn fn) {
  try {
    fn();
  } catch (const Error& e) {
    return e;
  }
  ADD_FAILURE() << "no Error thrown";
  return Error(kErrInvalidParam);
}

// Matches a call that throws an Error of `code`.
inline auto ThrowsCode(int code) {
  return ::testing::Throws<Error>(::testing::Field(&Error::code, static_cast<ErrorCode>(code)));
}

}  // namespace test
}  // namespace orvane

#endif  // ORVANE_TEST_TEST_UTIL_HPP_
