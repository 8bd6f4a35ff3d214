#include "extract/extract_runner.hpp"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"

extern char** environ;

namespace orvane {
namespace extract {
namespace {

constexpr size_t kMaxErrorText = 512;

std::atomic<uint64_t> g_failures{0};

std::string DescribeStatus(int status) {
  if (WIFSIGNALED(status)) return std::string("killed by ") + strsignal(WTERMSIG(status));
  return "exited with status " + std::to_string(WEXITSTATUS(status));
}

}  // namespace

std::string ExtractHelperPath() {
  const char* env = std::getenv("FILEINDEX_EXTRACT_HELPER");
  if (env != nullptr && env[0] != '\0') return env;
  char self[PATH_MAX];
  const ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
  if (n > 0) {
    const std::string beside =
        Dirname(std::string(self, static_cast<size_t>(n))) + "/fileindex-extract";
    if (access(beside.c_str(), X_OK) == 0) return beside;
  }
  return RootedPath("/usr/lib/fileindex/fileindex-extract");
}

bool RunExtractHelper(const std::string& path, Json::Value* fields, std::string* error,
                      const ExtractLimits& limits) {
  int out_pipe[2];
  int err_pipe[2];
  if (pipe2(out_pipe, O_CLOEXEC) != 0) {
    *error = std::string("pipe failed: ") + std::strerror(errno);
    return false;
  }
  UniqueFd out_read(out_pipe[0]);
  UniqueFd out_write(out_pipe[1]);
  if (pipe2(err_pipe, O_CLOEXEC) != 0) {
    *error = std::string("pipe failed: ") + std::strerror(errno);
    return false;
  }
  UniqueFd err_read(err_pipe[0]);
  UniqueFd err_write(err_pipe[1]);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, out_write.get(), 1);
  posix_spawn_file_actions_adddup2(&actions, err_write.get(), 2);
  const std::string helper = ExtractHelperPath();
  char* argv[] = {const_cast<char*>("fileindex-extract"), const_cast<char*>(path.c_str()), nullptr};
  pid_t pid = -1;
  const int rc = posix_spawn(&pid, helper.c_str(), &actions, nullptr, argv, environ);
  posix_spawn_file_actions_destroy(&actions);
  out_write.Close();
  err_write.Close();
  if (rc != 0) {
    *error = "cannot start " + helper + ": " + std::strerror(rc);
    return false;
  }

  // The helper is a real process, so its time limit is real time too.
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(limits.timeout_ms);
  std::string output;
  std::string errors;
  std::string failure;
  struct pollfd fds[2] = {{out_read.get(), POLLIN, 0}, {err_read.get(), POLLIN, 0}};
  int open_fds = 2;
  while (open_fds > 0 && failure.empty()) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                          deadline - std::chrono::steady_clock::now())
                          .count();
    if (left <= 0) {
      failure = "timed out after " + std::to_string(limits.timeout_ms) + " ms";
      break;
    }
    const int ready = poll(fds, 2, static_cast<int>(left));
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0) {
      failure = std::string("poll failed: ") + std::strerror(errno);
      break;
    }
    for (int i = 0; i < 2; ++i) {
      if (fds[i].fd < 0 || (fds[i].revents & (POLLIN | POLLHUP | POLLERR)) == 0) continue;
      char buf[65536];
      const ssize_t n = read(fds[i].fd, buf, sizeof(buf));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        fds[i].fd = -1;
        --open_fds;
        continue;
      }
      std::string& sink = i == 0 ? output : errors;
      sink.append(buf, static_cast<size_t>(n));
      if (i == 0 && output.size() > limits.max_output) {
        failure = "printed more than " + std::to_string(limits.max_output) + " bytes";
      }
      if (i == 1 && errors.size() > kMaxErrorText) errors.resize(kMaxErrorText);
    }
  }
  if (!failure.empty()) kill(pid, SIGKILL);
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  if (failure.empty() && !(WIFEXITED(status) && WEXITSTATUS(status) == 0)) {
    failure = DescribeStatus(status);
    const std::string detail = Trim(errors.substr(0, errors.find('\n')));
    if (!detail.empty()) failure += ": " + detail;
  }
  if (failure.empty()) {
    JsonValue parsed;
    if (!parsed.fromString(output) || !parsed.isObject()) {
      failure = "printed something that is not a JSON object";
    } else {
      *fields = parsed;
      return true;
    }
  }
  *error = failure;
  g_failures.fetch_add(1, std::memory_order_relaxed);
  return false;
}

uint64_t ExtractFailureCount() { return g_failures.load(std::memory_order_relaxed); }

}  // namespace extract
}  // namespace orvane
