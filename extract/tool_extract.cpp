#include "extract/tool_extract.hpp"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>
#include <set>

#include "common/env.hpp"
#include "common/fd.hpp"
#include "common/log.hpp"
#include "common/util.hpp"
#include "extract/content.hpp"
#include "extract/html.hpp"

extern char** environ;

namespace orvane {
namespace extract {
namespace {

// The descriptor number the tool finds its input on.
constexpr int kChildInputFd = 3;
constexpr char kChildInputPath[] = "/proc/self/fd/3";

// Owns a spawned tool's process group: ending the scope kills whatever of it is left and reaps
// the leader, so a tool that forked helpers of its own leaves nothing running.
class ToolProcess {
 public:
  explicit ToolProcess(pid_t pid) : pid_(pid) {}
  ~ToolProcess() {
    if (pid_ > 0) {
      kill(-pid_, SIGKILL);
      Reap(-1);
    }
  }
  ToolProcess(const ToolProcess&) = delete;
  ToolProcess& operator=(const ToolProcess&) = delete;

  // Waits for the leader until `deadline_us` (Env's clock; < 0: forever); true with its status.
  bool Wait(int64_t deadline_us, int* status) {
    for (;;) {
      const pid_t r = waitpid(pid_, status, WNOHANG);
      if (r == pid_) {
        kill(-pid_, SIGKILL);  // whatever it left behind in its group
        pid_ = -1;
        return true;
      }
      if (r < 0 && errno != EINTR) {
        pid_ = -1;
        *status = 0;
        return true;
      }
      if (deadline_us >= 0 && Env::Current()->NowMicros() >= deadline_us) return false;
      Env::Current()->SleepMicros(2000);
    }
  }

 private:
  void Reap(int64_t deadline_us) {
    int status;
    Wait(deadline_us, &status);
  }

  pid_t pid_;
};

// Spawns the tool in a process group of its own with its output going to `out_w`.
int Spawn(const std::vector<std::string>& argv, int input_fd, int out_w, pid_t* pid) {
  std::vector<std::string> args = argv;
  for (std::string& a : args) {
    if (a == kToolInput) a = kChildInputPath;
  }
  std::vector<char*> cargv;
  for (std::string& a : args) cargv.push_back(a.data());
  cargv.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attr;
  posix_spawn_file_actions_init(&actions);
  posix_spawnattr_init(&attr);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, out_w, 1);
  // Its complaints are not wanted. The helper may open nothing for writing, so /dev/null is
  // opened for reading: what the tool writes there fails quietly.
  posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, input_fd, kChildInputFd);
  posix_spawn_file_actions_addclosefrom_np(&actions, kChildInputFd + 1);
  sigset_t none;
  sigset_t defaults;
  sigemptyset(&none);
  sigemptyset(&defaults);
  sigaddset(&defaults, SIGPIPE);
  sigaddset(&defaults, SIGXFSZ);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setsigdefault(&attr, &defaults);
  posix_spawnattr_setpgroup(&attr, 0);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETPGROUP | POSIX_SPAWN_SETSIGMASK |
                                      POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_USEVFORK);
  const int rc = posix_spawnp(pid, cargv[0], &actions, &attr, cargv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attr);
  return rc;
}

std::string Describe(int status) {
  if (WIFSIGNALED(status)) return std::string("killed by ") + strsignal(WTERMSIG(status));
  return "exited with status " + std::to_string(WEXITSTATUS(status));
}

// A missing tool is said once per helper, not once per file.
void NoteMissing(const std::string& program) {
  static std::mutex mu;
  static std::set<std::string> noted;
  std::lock_guard<std::mutex> lock(mu);
  if (noted.insert(program).second) {
    ORVANE_LOG(LOG_WARNING,
               "%s is not installed: files it converts are indexed without their contents; "
               "install it to index them",
               program.c_str());
  }
}

// Runs a converter on the file; false when it is not installed.
bool RunConverter(const std::vector<std::string>& argv, const OpenedFile& file,
                  std::string* output) {
  std::string error;
  switch (RunTool(argv, file.fd(), ToolLimits(), output, &error)) {
    case ToolOutcome::kDone:
      return true;
    case ToolOutcome::kMissing:
      NoteMissing(argv[0]);
      return false;
    default:
      Fail(argv[0] + " " + error);
  }
}

void SetBody(const std::string& raw, Json::Value& fields) {
  const std::string text = Trim(ToUtf8(raw, kMaxTextBytes));
  if (!text.empty()) {
    fields["QUIXMDTextContent"] = text;
  }
}

}  // namespace

ToolOutcome RunTool(const std::vector<std::string>& argv, int input_fd, const ToolLimits& limits,
                    std::string* output, std::string* error) {
  output->clear();
  int fds[2];
  if (argv.empty() || pipe2(fds, O_CLOEXEC) != 0) {
    *error = std::string("cannot be started: ") + std::strerror(argv.empty() ? EINVAL : errno);
    return ToolOutcome::kFailed;
  }
  UniqueFd out_r(fds[0]);
  UniqueFd out_w(fds[1]);
  pid_t pid = -1;
  const int rc = Spawn(argv, input_fd, out_w.get(), &pid);
  out_w.Reset();
  if (rc == ENOENT) {
    *error = "is not installed";
    return ToolOutcome::kMissing;
  }
  if (rc != 0) {
    *error = std::string("cannot be started: ") + std::strerror(rc);
    return ToolOutcome::kFailed;
  }
  ToolProcess process(pid);
  const int64_t deadline = Env::Current()->NowMicros() + int64_t{limits.timeout_ms} * 1000;
  char buf[65536];
  bool full = false;
  while (!full) {
    const int64_t left_ms = (deadline - Env::Current()->NowMicros() + 999) / 1000;
    if (left_ms <= 0) {
      *error = "took longer than " + std::to_string(limits.timeout_ms) + " ms and was stopped";
      return ToolOutcome::kTimedOut;
    }
    struct pollfd p = {out_r.get(), POLLIN, 0};
    const int ready = poll(&p, 1, static_cast<int>(std::min<int64_t>(left_ms, 1000)));
    if (ready < 0 && errno != EINTR) {
      *error = std::string("output cannot be read: ") + std::strerror(errno);
      return ToolOutcome::kFailed;
    }
    if (ready <= 0) continue;
    const ssize_t n = read(out_r.get(), buf, sizeof(buf));
    if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
    if (n <= 0) break;
    const size_t keep = std::min(static_cast<size_t>(n), limits.max_output - output->size());
    output->append(buf, keep);
    // Enough text for the index: the rest of the tool's work is not needed.
    full = output->size() >= limits.max_output;
  }
  if (full) return ToolOutcome::kDone;  // the scope's end stops the tool
  int status = 0;
  if (!process.Wait(deadline, &status)) {
    *error = "took longer than " + std::to_string(limits.timeout_ms) + " ms and was stopped";
    return ToolOutcome::kTimedOut;
  }
  if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return ToolOutcome::kDone;
  *error = Describe(status);
  return ToolOutcome::kFailed;
}

void ExtractRtf(const OpenedFile& file, Json::Value& fields) {
  // The HTML form carries the document's title and author as well as its text, with every
  // character spelled as an entity or in UTF-8.
  std::string html;
  if (!RunConverter({"unrtf", "--html", kToolInput}, file, &html)) return;
  TextSink sink(kMaxTextBytes);
  HtmlToText(html, "UTF-8", &sink, fields);
  const std::string text = Trim(sink.Take());
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

void ExtractManPage(const OpenedFile& file, Json::Value& fields) {
  // preconv (-k) reads the source in whatever encoding it declares or looks like; no
  // hyphenation, so a word split at a line end is still one word; no bold or underline.
  std::string text;
  if (!RunConverter({"groff", "-k", "-t", "-Tutf8", "-mandoc", "-rHY=0", "-P-c", "-P-b", "-P-o",
                     "-P-u", kToolInput},
                    file, &text)) {
    return;
  }
  SetBody(text, fields);
}

void ExtractLegacyWord(const OpenedFile& file, Json::Value& fields) {
  std::string text;
  if (RunConverter({"catdoc", "-d", "utf-8", "-w", kToolInput}, file, &text)) SetBody(text, fields);
}

void ExtractLegacyExcel(const OpenedFile& file, Json::Value& fields) {
  std::string text;
  if (RunConverter({"xls2csv", "-d", "utf-8", "-q", "0", kToolInput}, file, &text)) {
    SetBody(text, fields);
  }
}

void ExtractLegacyPowerPoint(const OpenedFile& file, Json::Value& fields) {
  std::string text;
  if (RunConverter({"catppt", "-d", "utf-8", kToolInput}, file, &text)) SetBody(text, fields);
}

void ExtractPostScript(const OpenedFile& file, Json::Value& fields) {
  // -dSAFER: the document cannot open, write or delete files; text goes to standard output.
  std::string text;
  if (RunConverter({"gs", "-q", "-dSAFER", "-dBATCH", "-dNOPAUSE", "-sDEVICE=txtwrite",
                    "-sOutputFile=-", kToolInput},
                   file, &text)) {
    SetBody(text, fields);
  }
}

void ExtractDjvu(const OpenedFile& file, Json::Value& fields) {
  std::string text;
  if (RunConverter({"djvutxt", kToolInput}, file, &text)) SetBody(text, fields);
}

}  // namespace extract
}  // namespace orvane
