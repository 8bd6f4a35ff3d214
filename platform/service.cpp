#include "platform/service.hpp"

#include <fcntl.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cctype>
#include <cstdarg>
#include <cstdio>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "common/fd.hpp"
#include "common/root.hpp"
#include "platform/config.hpp"
#include "platform/internal.hpp"

extern char** environ;

namespace orvane {
namespace platform {
namespace {

int Spawn(const std::vector<std::string>& argv, int flags) {
  if (argv.empty() || argv[0].empty()) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  std::vector<char*> args;
  for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
  args.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attr;
  posix_spawn_file_actions_init(&actions);
  posix_spawnattr_init(&attr);
  if (flags & QLIBC_EXEC_STDIN_NULL) {
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  }
  if (flags & QLIBC_EXEC_STDOUT_NULL) {
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
  }
  if (flags & QLIBC_EXEC_STDERR_NULL) {
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  }
  if (flags & QLIBC_EXEC_CLOSE_FDS) posix_spawn_file_actions_addclosefrom_np(&actions, 3);
  short spawn_flags = POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF;
  if (flags & QLIBC_EXEC_NEW_SESSION) spawn_flags |= POSIX_SPAWN_SETSID;
  posix_spawnattr_setflags(&attr, spawn_flags);
  // The child starts with no blocked signals and default handlers, whatever the caller set
  // (SIGPIPE ignored by the socket clients, for one).
  sigset_t none;
  sigemptyset(&none);
  posix_spawnattr_setsigmask(&attr, &none);
  sigset_t all;
  sigfillset(&all);
  posix_spawnattr_setsigdefault(&attr, &all);

  pid_t pid = -1;
  const int rc = (flags & QLIBC_EXEC_SEARCH_PATH)
                     ? posix_spawnp(&pid, args[0], &actions, &attr, args.data(), environ)
                     : posix_spawn(&pid, args[0], &actions, &attr, args.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attr);
  if (rc != 0) return PLATFORM_FAIL(-1, rc, kQErrSystem);
  if (!(flags & QLIBC_EXEC_WAIT)) return pid;

  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  }
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  return 128 + WTERMSIG(status);
}

bool SystemdRuns() {
  struct stat st;
  return lstat(RootedPath("/run/systemd/system").c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// Runs a service-manager action; 0 when it exited with status 0.
int RunAction(const char* name, const char* action) {
  if (name == nullptr || name[0] == '\0') return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  std::vector<std::string> argv;
  if (SystemdRuns()) {
    argv = {RootedPath("/usr/bin/systemctl"), action, name};
  } else {
    auto config = ConfigForCall();
    if (!config) return -1;
    auto it = config->services.find(name);
    const std::string verb = action;
    if (it != config->services.end()) {
      argv = verb == "start" ? it->second.start : verb == "stop" ? it->second.stop : it->second.restart;
    }
    if (argv.empty() && verb == "restart" && it != config->services.end() &&
        !it->second.start.empty()) {
      // No restart command of its own: stop (when it can be stopped), then start.
      if (!it->second.stop.empty()) {
        const int stopped = Spawn(it->second.stop, QLIBC_EXEC_WAIT | QLIBC_EXEC_STDIN_NULL);
        if (stopped != 0) return PLATFORM_FAIL(-1, stopped < 0 ? errno : EIO, kQErrSystem);
      }
      argv = it->second.start;
    }
    if (argv.empty()) return PLATFORM_FAIL(-1, ENOENT, kQErrNotSupported);
  }
  const int status = Spawn(argv, QLIBC_EXEC_WAIT | QLIBC_EXEC_STDIN_NULL);
  if (status < 0) return -1;
  if (status != 0) return PLATFORM_FAIL(-1, EIO, kQErrSystem);
  return 0;
}

// Samba's own key form: case and blanks do not count.
std::string KeyOf(const std::string& line) {
  const size_t eq = line.find('=');
  if (eq == std::string::npos) return "";
  std::string key;
  for (size_t i = 0; i < eq; ++i) {
    if (!isspace(static_cast<unsigned char>(line[i]))) key += static_cast<char>(tolower(static_cast<unsigned char>(line[i])));
  }
  return key;
}

std::string Trimmed(const std::string& s) {
  const size_t begin = s.find_first_not_of(" \t\r");
  if (begin == std::string::npos) return "";
  return s.substr(begin, s.find_last_not_of(" \t\r") - begin + 1);
}

// "[global]" for a section header line, "" for any other line.
std::string SectionOf(const std::string& line) {
  const std::string t = Trimmed(line);
  if (t.size() < 2 || t.front() != '[' || t.back() != ']') return "";
  std::string name;
  for (char c : Trimmed(t.substr(1, t.size() - 2))) name += static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return "[" + name + "]";
}

bool IsComment(const std::string& line) {
  const std::string t = Trimmed(line);
  return t.empty() || t[0] == '#' || t[0] == ';';
}

bool ReadLines(const std::string& path, std::vector<std::string>* lines) {
  std::ifstream in(path);
  if (!in) return false;
  std::string line;
  while (std::getline(in, line)) lines->push_back(line);
  return !in.bad();
}

}  // namespace

int QLIBCExecl(const char* path, int flags, ...) {
  PLATFORM_FAULT_POINT("QLIBCExecl", nullptr);
  if (path == nullptr) return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  std::vector<std::string> argv = {path};
  va_list ap;
  va_start(ap, flags);
  while (const char* arg = va_arg(ap, const char*)) argv.emplace_back(arg);
  va_end(ap);
  return Spawn(argv, flags);
}

int QLIBServiceStart(const char* name, int wait) {
  PLATFORM_FAULT_POINT("QLIBServiceStart", nullptr);
  return RunAction(name, "start");
}

int QLIBServiceRestart(const char* name) {
  PLATFORM_FAULT_POINT("QLIBServiceRestart", nullptr);
  return RunAction(name, "restart");
}

int QLIBServicectlStart(const char* name, int flags) {
  PLATFORM_FAULT_POINT("QLIBServicectlStart", nullptr);
  return RunAction(name, "start");
}

int QLIBServicectlStop(const char* name, int flags) {
  PLATFORM_FAULT_POINT("QLIBServicectlStop", nullptr);
  return RunAction(name, "stop");
}

int QUIXSMBIsEnableSpotlight() {
  PLATFORM_FAULT_POINT("QUIXSMBIsEnableSpotlight", nullptr);
  auto config = ConfigForCall();
  if (!config) return -1;
  struct stat st;
  if (stat(config->samba_conf.c_str(), &st) != 0) return 0;  // no Samba: off
  std::vector<std::string> lines;
  if (!ReadLines(config->samba_conf, &lines)) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  std::string section;
  bool enabled = false;
  for (const std::string& line : lines) {
    if (IsComment(line)) continue;
    const std::string header = SectionOf(line);
    if (!header.empty()) {
      section = header;
      continue;
    }
    if (section != "[global]" || KeyOf(line) != "spotlight") continue;
    std::string value;
    for (char c : Trimmed(line.substr(line.find('=') + 1))) value += static_cast<char>(tolower(static_cast<unsigned char>(c)));
    enabled = value == "yes" || value == "true" || value == "1" || value == "on";
  }
  return enabled ? 1 : 0;
}

int QUIXSMBSetSpotlight(int enable) {
  PLATFORM_FAULT_POINT("QUIXSMBSetSpotlight", nullptr);
  auto config = ConfigForCall();
  if (!config) return -1;
  const std::string& path = config->samba_conf;
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return PLATFORM_FAIL(-1, ENOENT, kQErrNotSupported);
  std::vector<std::string> lines;
  if (!ReadLines(path, &lines)) return PLATFORM_FAIL(-1, errno, kQErrSystem);

  const std::string setting = std::string("\tspotlight = ") + (enable ? "yes" : "no");
  std::string section;
  bool done = false;
  size_t global_header = std::string::npos;
  for (size_t i = 0; i < lines.size(); ++i) {
    if (IsComment(lines[i])) continue;
    const std::string header = SectionOf(lines[i]);
    if (!header.empty()) {
      section = header;
      if (header == "[global]" && global_header == std::string::npos) global_header = i;
      continue;
    }
    if (section == "[global]" && KeyOf(lines[i]) == "spotlight") {
      lines[i] = setting;
      done = true;
    }
  }
  if (!done && global_header != std::string::npos) {
    lines.insert(lines.begin() + global_header + 1, setting);
  } else if (!done) {
    lines.insert(lines.begin(), {"[global]", setting});
  }

  std::string text;
  for (const std::string& line : lines) text += line + "\n";
  // Replaced whole: written beside, flushed, renamed, with the old file's mode.
  std::string tmp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(tmp.data(), O_CLOEXEC));
  if (!fd.valid()) return PLATFORM_FAIL(-1, errno, kQErrSystem);
  bool ok = fchmod(fd.get(), st.st_mode & 07777) == 0;
  for (size_t done_bytes = 0; ok && done_bytes < text.size();) {
    const ssize_t n = write(fd.get(), text.data() + done_bytes, text.size() - done_bytes);
    if (n < 0 && errno == EINTR) continue;
    ok = n > 0;
    if (ok) done_bytes += n;
  }
  ok = ok && fsync(fd.get()) == 0 && fd.Close() && rename(tmp.c_str(), path.c_str()) == 0;
  if (!ok) {
    const int err = errno;
    unlink(tmp.c_str());
    return PLATFORM_FAIL(-1, err, kQErrSystem);
  }
  return 0;
}

}  // namespace platform
}  // namespace orvane
