#include "extract/extract_runner.hpp"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"

extern char** environ;

namespace orvane {
namespace extract {
namespace {

constexpr size_t kMaxErrorText = 512;
// What the format libraries leak or fragment stays bounded: a helper that has served this many
// files is retired and the next file starts a fresh one.
constexpr int kFilesPerHelper = 1000;

std::atomic<uint64_t> g_failures{0};

std::string DescribeStatus(int status) {
  if (WIFSIGNALED(status)) return std::string("killed by ") + strsignal(WTERMSIG(status));
  return "exited with status " + std::to_string(WEXITSTATUS(status));
}

// One running helper: a socket that is its standard input and output, a pipe from its standard
// error, and its pid. Destroying it kills and reaps the process. Owned by one caller at a time;
// not thread-safe.
class Helper {
 public:
  enum class Outcome {
    kFields,     // the reply held the fields
    kFailed,     // the file failed: the helper replied an error, or crashed, hung or misbehaved
    kWentStale,  // a helper that served before was gone or out of step before the request
  };

  static std::unique_ptr<Helper> Start(const std::string& program, std::string* error);
  ~Helper() { KillAndReap(); }
  Helper(const Helper&) = delete;
  Helper& operator=(const Helper&) = delete;

  Outcome Extract(const std::string& path, const ExtractLimits& limits, Json::Value* fields,
                  std::string* error);

  pid_t pid() const { return pid_; }
  const std::string& program() const { return program_; }
  // Whether it may take another file: it is alive, in step and not worn out.
  bool reusable() const { return pid_ > 0 && served_ < kFilesPerHelper; }

 private:
  Helper(std::string program, pid_t pid, UniqueFd channel, UniqueFd errors)
      : program_(std::move(program)),
        pid_(pid),
        channel_(std::move(channel)),
        errors_(std::move(errors)) {}

  // Kills the process (a no-op on one that already died) and reaps it; its wait status. The
  // descriptors stay open, so that what it left in them can still be read.
  int KillAndReap();
  // Reads what the helper has written on standard error, keeping the start in `*kept` (when
  // not null) up to kMaxErrorText bytes.
  void ReadErrors(std::string* kept);
  // The reason for a helper that ended or closed its output: how it ended and the first line it
  // wrote on standard error.
  std::string Ended(std::string errors);

  const std::string program_;
  pid_t pid_;
  UniqueFd channel_;
  UniqueFd errors_;
  int served_ = 0;
};

std::unique_ptr<Helper> Helper::Start(const std::string& program, std::string* error) {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
    *error = std::string("socketpair failed: ") + std::strerror(errno);
    return nullptr;
  }
  UniqueFd channel(pair[0]);
  UniqueFd child_channel(pair[1]);
  int err_pipe[2];
  if (pipe2(err_pipe, O_CLOEXEC) != 0) {
    *error = std::string("pipe failed: ") + std::strerror(errno);
    return nullptr;
  }
  UniqueFd err_read(err_pipe[0]);
  UniqueFd err_write(err_pipe[1]);
  // Only our end: what the helper leaves there is read whenever it is asked for a file.
  fcntl(err_read.get(), F_SETFL, O_NONBLOCK);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, child_channel.get(), 0);
  posix_spawn_file_actions_adddup2(&actions, child_channel.get(), 1);
  posix_spawn_file_actions_adddup2(&actions, err_write.get(), 2);
  // Whatever another thread opened without O_CLOEXEC stays out of the helper.
  posix_spawn_file_actions_addclosefrom_np(&actions, 3);
  // The caller's thread may block signals (the daemon's workers do) and the process may ignore
  // some: the helper starts with neither, so that the CPU and file-size limits kill it.
  posix_spawnattr_t attr;
  posix_spawnattr_init(&attr);
  sigset_t none;
  sigset_t all;
  sigemptyset(&none);
  sigfillset(&all);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setsigdefault(&attr, &all);
  // A group of its own: a Ctrl-C meant for a daemon in the foreground is not a reason to fail
  // the file in hand; helpers end when they are told to, or when their input ends.
  posix_spawnattr_setpgroup(&attr, 0);
  posix_spawnattr_setflags(&attr,
                           POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
  char* argv[] = {const_cast<char*>("fileindex-extract"), nullptr};
  // Text recognition parallelises through OpenMP, whose idle threads spin between the small
  // regions it runs: in a helper that reads one file at a time beside others that spin cost
  // more CPU than all the rest of extraction, so the helper runs them on its own thread.
  std::vector<char*> env;
  for (char** e = environ; *e != nullptr; ++e) {
    if (std::strncmp(*e, "OMP_THREAD_LIMIT=", 17) != 0) env.push_back(*e);
  }
  env.push_back(const_cast<char*>("OMP_THREAD_LIMIT=1"));
  env.push_back(nullptr);
  pid_t pid = -1;
  const int rc = posix_spawn(&pid, program.c_str(), &actions, &attr, argv, env.data());
  posix_spawnattr_destroy(&attr);
  posix_spawn_file_actions_destroy(&actions);
  if (rc != 0) {
    *error = "cannot start " + program + ": " + std::strerror(rc);
    return nullptr;
  }
  return std::unique_ptr<Helper>(new Helper(program, pid, std::move(channel), std::move(err_read)));
}

int Helper::KillAndReap() {
  if (pid_ <= 0) return 0;
  kill(pid_, SIGKILL);
  int status = 0;
  while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  pid_ = -1;
  return status;
}

void Helper::ReadErrors(std::string* kept) {
  char buf[4096];
  while (errors_.valid()) {
    const ssize_t n = read(errors_.get(), buf, sizeof(buf));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return;  // nothing more for now
    if (n == 0) {
      errors_.Close();
      return;
    }
    if (kept != nullptr && kept->size() < kMaxErrorText) {
      kept->append(buf, std::min(static_cast<size_t>(n), kMaxErrorText - kept->size()));
    }
  }
}

std::string Helper::Ended(std::string errors) {
  const int status = KillAndReap();
  // Its last words were written before it died: the pipe still holds them.
  ReadErrors(&errors);
  std::string reason = DescribeStatus(status);
  const std::string detail = Trim(errors.substr(0, errors.find('\n')));
  if (!detail.empty()) reason += ": " + detail;
  return reason;
}

Helper::Outcome Helper::Extract(const std::string& path, const ExtractLimits& limits,
                                Json::Value* fields, std::string* error) {
  std::string errors;
  if (served_ > 0) {
    // What it wrote on standard error since its last reply belongs to no file.
    ReadErrors(nullptr);
    // A reply nobody asked for, or a closed socket, means this helper is out of step or gone;
    // that is no fault of this file.
    char probe;
    const ssize_t n = recv(channel_.get(), &probe, 1, MSG_PEEK | MSG_DONTWAIT);
    if (n >= 0 || (errno != EAGAIN && errno != EWOULDBLOCK)) {
      KillAndReap();
      return Outcome::kWentStale;
    }
  }
  const std::string request = path + '\0';
  // Never blocks: a helper that does not read its requests is broken, not waited for.
  const ssize_t sent =
      send(channel_.get(), request.data(), request.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
  // A fresh helper that is gone already may still have printed something: the reply is read
  // all the same, and says what it did.
  if (sent != static_cast<ssize_t>(request.size()) && served_ > 0) {
    KillAndReap();
    return Outcome::kWentStale;
  }

  // The helper is a real process, so its time limit is real time too.
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(limits.timeout_ms);
  std::string reply;
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                          deadline - std::chrono::steady_clock::now())
                          .count();
    if (left <= 0) {
      KillAndReap();
      *error = "timed out after " + std::to_string(limits.timeout_ms) + " ms";
      return Outcome::kFailed;
    }
    struct pollfd fds[2] = {{channel_.get(), POLLIN, 0}, {errors_.get(), POLLIN, 0}};
    const int ready = poll(fds, 2, static_cast<int>(left));
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0) {
      *error = std::string("poll failed: ") + std::strerror(errno);
      KillAndReap();
      return Outcome::kFailed;
    }
    if (fds[1].revents != 0) ReadErrors(&errors);
    if (fds[0].revents == 0) continue;
    char buf[65536];
    const ssize_t n = recv(channel_.get(), buf, sizeof(buf), MSG_DONTWAIT);
    if (n < 0 && (errno == EINTR || errno == EAGAIN || errno == EWOULDBLOCK)) continue;
    if (n <= 0) {
      *error = Ended(std::move(errors));
      return Outcome::kFailed;
    }
    reply.append(buf, static_cast<size_t>(n));
    const size_t end = reply.find('\n', reply.size() - static_cast<size_t>(n));
    if ((end == std::string::npos ? reply.size() : end + 1) > limits.max_output) {
      KillAndReap();
      *error = "printed more than " + std::to_string(limits.max_output) + " bytes";
      return Outcome::kFailed;
    }
    if (end == std::string::npos) continue;
    if (end + 1 != reply.size()) {
      KillAndReap();
      *error = "printed more than one reply";
      return Outcome::kFailed;
    }
    reply.pop_back();
    break;
  }
  ++served_;
  JsonValue parsed;
  if (parsed.fromString(reply) && parsed.isObject()) {
    if (parsed["fields"].isObject()) {
      fields->swap(parsed["fields"]);
      return Outcome::kFields;
    }
    if (parsed["error"].isString() && !parsed["error"].asString().empty()) {
      std::string reason = parsed["error"].asString();
      reason = Trim(reason.substr(0, std::min(reason.find('\n'), kMaxErrorText)));
      // The libraries failed on this file and may have been left in a state nobody can vouch
      // for: the helper is not given another one.
      KillAndReap();
      *error = reason;
      return Outcome::kFailed;
    }
  }
  KillAndReap();
  *error = "printed something that is not a reply";
  return Outcome::kFailed;
}

// The idle helpers, at most one per CPU; more callers than that at once start helpers of their
// own, which are ended when they are handed back to a full pool. Thread-safe.
class HelperPool {
 public:
  HelperPool() : max_idle_(std::max(1u, std::thread::hardware_concurrency())) {}

  // An idle helper running `program`, or null. Idle helpers of another program are ended.
  std::unique_ptr<Helper> Take(const std::string& program) {
    std::vector<std::unique_ptr<Helper>> others;  // ended outside the lock
    std::lock_guard<std::mutex> lock(mu_);
    std::unique_ptr<Helper> found;
    while (!idle_.empty() && found == nullptr) {
      std::unique_ptr<Helper> helper = std::move(idle_.back());
      idle_.pop_back();
      if (helper->program() == program) {
        found = std::move(helper);
      } else {
        others.push_back(std::move(helper));
      }
    }
    return found;
  }

  void Put(std::unique_ptr<Helper> helper) {
    if (!helper->reusable()) return;
    std::lock_guard<std::mutex> lock(mu_);
    if (idle_.size() < max_idle_) idle_.push_back(std::move(helper));
  }

  std::vector<pid_t> IdlePids() {
    std::lock_guard<std::mutex> lock(mu_);
    std::vector<pid_t> pids;
    for (const auto& helper : idle_) pids.push_back(helper->pid());
    return pids;
  }

  void CloseIdle() {
    std::vector<std::unique_ptr<Helper>> idle;
    {
      std::lock_guard<std::mutex> lock(mu_);
      idle.swap(idle_);
    }
  }

 private:
  const size_t max_idle_;
  std::mutex mu_;
  std::vector<std::unique_ptr<Helper>> idle_;  // guarded by mu_
};

HelperPool& Pool() {
  // Never destroyed: a worker thread may still hand a helper back while the process exits. The
  // idle helpers then see their input end and exit; init reaps them.
  static HelperPool* pool = new HelperPool();
  return *pool;
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
  return RootedPath("/usr/libexec/fileindex/fileindex-extract");
}

bool RunExtractHelper(const std::string& path, Json::Value* fields, std::string* error,
                      const ExtractLimits& limits) {
  std::string failure;
  if (path.find('\0') != std::string::npos) {
    failure = "the path holds a NUL byte";
  } else if (path.size() >= PATH_MAX) {
    failure = std::string("cannot open: ") + std::strerror(ENAMETOOLONG);
  } else {
    const std::string program = ExtractHelperPath();
    // A pooled helper that went stale is replaced; a fresh one is not, so this ends.
    for (;;) {
      std::unique_ptr<Helper> helper = Pool().Take(program);
      if (helper == nullptr) helper = Helper::Start(program, &failure);
      if (helper == nullptr) break;
      const Helper::Outcome outcome = helper->Extract(path, limits, fields, &failure);
      if (outcome == Helper::Outcome::kWentStale) continue;
      if (outcome == Helper::Outcome::kFields) {
        Pool().Put(std::move(helper));
        return true;
      }
      break;
    }
  }
  *error = failure;
  g_failures.fetch_add(1, std::memory_order_relaxed);
  return false;
}

uint64_t ExtractFailureCount() { return g_failures.load(std::memory_order_relaxed); }

std::vector<pid_t> IdleExtractHelpers() { return Pool().IdlePids(); }

void CloseIdleExtractHelpers() { Pool().CloseIdle(); }

}  // namespace extract
}  // namespace orvane
