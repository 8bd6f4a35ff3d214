#include "test/test_util.hpp"

#include <fcntl.h>
#include <ftw.h>
#include <grp.h>
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

#include "common/root.hpp"

namespace orvane {
namespace test {

TempDir::TempDir() {
  const char* base = std::getenv("TMPDIR");
  std::string tmpl =
      std::string(base != nullptr && base[0] != '\0' ? base : "/tmp") + "/fileindex-test-XXXXXX";
  if (mkdtemp(tmpl.data()) == nullptr) throw std::runtime_error("mkdtemp failed");
  path_ = tmpl;
}

TempDir::~TempDir() {
  nftw(
      path_.c_str(),
      [](const char* p, const struct stat*, int, struct FTW*) { return remove(p) == 0 ? 0 : 0; },
      64, FTW_DEPTH | FTW_PHYS);
}

std::string TempDir::Write(const std::string& rel, const std::string& content) const {
  const std::string full = Path(rel);
  MakeParentDirs(full);
  std::ofstream out(full, std::ios::binary | std::ios::trunc);
  out << content;
  return full;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

void WriteFile(const std::string& path, const std::string& text) {
  MakeParentDirs(path);
  std::ofstream(path) << text;
}

std::string WritePlatformConfig(const std::string& root, const std::string& json_text) {
  const std::string path = root + "/etc/orvane/platform.json";
  MakeParentDirs(path);
  // Written beside and renamed, so a reader never sees half a file and the inode changes.
  const std::string tmp = path + ".tmp";
  {
    std::ofstream out(tmp, std::ios::binary | std::ios::trunc);
    out << json_text;
  }
  if (rename(tmp.c_str(), path.c_str()) != 0) throw std::runtime_error("rename failed: " + path);
  return path;
}

LogCapture::LogCapture()
    : previous_(SetLogSink([this](int, const std::string& line) {
        std::lock_guard<std::mutex> lock(mu_);
        lines_.push_back(line);
      })) {}

LogCapture::~LogCapture() { SetLogSink(previous_); }

std::vector<std::string> LogCapture::Lines() const {
  std::lock_guard<std::mutex> lock(mu_);
  return lines_;
}

bool LogCapture::Contains(const std::string& text) const { return Count(text) > 0; }

int LogCapture::Count(const std::string& text) const {
  std::lock_guard<std::mutex> lock(mu_);
  int n = 0;
  for (const std::string& line : lines_) n += line.find(text) != std::string::npos;
  return n;
}

void LogCapture::Clear() {
  std::lock_guard<std::mutex> lock(mu_);
  lines_.clear();
}

FakeEnv::FakeEnv() : now_micros_(1700000000LL * 1000000), previous_(Env::Replace(this)) {}

FakeEnv::~FakeEnv() { Env::Replace(previous_); }

time_t FakeEnv::Now() {
  std::lock_guard<std::mutex> lock(mu_);
  return static_cast<time_t>(now_micros_ / 1000000);
}

int64_t FakeEnv::NowMicros() {
  std::lock_guard<std::mutex> lock(mu_);
  return now_micros_;
}

void FakeEnv::SleepMicros(int64_t micros) {
  std::lock_guard<std::mutex> lock(mu_);
  sleeps_.push_back(micros);
  now_micros_ += micros;
}

int FakeEnv::Rand() {
  std::lock_guard<std::mutex> lock(mu_);
  if (rand_.empty()) return 0;
  int v = rand_.front();
  rand_.pop_front();
  return v;
}

void FakeEnv::QueueRand(std::vector<int> values) {
  std::lock_guard<std::mutex> lock(mu_);
  rand_.insert(rand_.end(), values.begin(), values.end());
}

void FakeEnv::Advance(int64_t micros) {
  std::lock_guard<std::mutex> lock(mu_);
  now_micros_ += micros;
}

int64_t FakeEnv::slept_micros() const {
  int64_t total = 0;
  for (int64_t s : sleeps_) total += s;
  return total;
}

int RunAsUser(const std::string& user, const std::function<int()>& fn) {
  std::fflush(nullptr);
  const pid_t pid = fork();
  if (pid < 0) return -1;
  if (pid == 0) {
    if (geteuid() == 0) {
      struct passwd* pw = getpwnam(user.c_str());
      if (pw == nullptr || setgroups(0, nullptr) != 0 || setgid(pw->pw_gid) != 0 ||
          setuid(pw->pw_uid) != 0) {
        _exit(255);
      }
    }
    _exit(fn() & 0xff);
  }
  int status = 0;
  if (waitpid(pid, &status, 0) != pid || !WIFEXITED(status) || WEXITSTATUS(status) == 255) {
    return -1;
  }
  return WEXITSTATUS(status);
}

std::string MakeOpenShare(const TempDir& dir, const std::string& rel) {
  const std::string path = dir.Path(rel);
  if (mkdir(path.c_str(), 0777) != 0 && errno != EEXIST) return path;
  chmod(path.c_str(), 0777);
  chmod(dir.path().c_str(), 0711);
  return path;
}

int RenameExchange(const std::string& a, const std::string& b) {
  return renameat2(AT_FDCWD, a.c_str(), AT_FDCWD, b.c_str(), RENAME_EXCHANGE);
}

ProgramResult RunProgram(const std::string& path, const std::vector<std::string>& args,
                         const std::string& root) {
  TempDir io;
  const std::string out_path = io.Path("out");
  const std::string err_path = io.Path("err");
  std::vector<std::string> argv_text = {path.substr(path.rfind('/') + 1)};
  argv_text.insert(argv_text.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& a : argv_text) argv.push_back(a.data());
  argv.push_back(nullptr);
  std::vector<std::string> env_text;
  if (!root.empty()) env_text.push_back("ORVANE_ROOT=" + root);
  for (char** e = environ; *e != nullptr; ++e) {
    if (root.empty() || std::strncmp(*e, "ORVANE_ROOT=", 12) != 0) env_text.emplace_back(*e);
  }
  std::vector<char*> envp;
  for (std::string& e : env_text) envp.push_back(e.data());
  envp.push_back(nullptr);
  // Everything is prepared before the fork: the child of a process with running daemon threads
  // may only make calls that take no lock (open, dup2, exec) until it execs.
  const pid_t pid = fork();
  if (pid == 0) {
    dup2(open(out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
    dup2(open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
    execve(path.c_str(), argv.data(), envp.data());
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, ReadFile(out_path), ReadFile(err_path)};
}

bool WaitFor(const std::function<bool()>& pred, int timeout_ms) {
  const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeout_ms);
  while (std::chrono::steady_clock::now() < end) {
    if (pred()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return pred();
}

ChildProcess::ChildProcess(const std::string& root, std::vector<std::string> argv) {
  pid_ = fork();
  if (pid_ == 0) {
    setenv("ORVANE_ROOT", root.c_str(), 1);
    std::vector<char*> args;
    for (std::string& a : argv) args.push_back(&a[0]);
    args.push_back(nullptr);
    if (getenv("FILEINDEXD_TEST_STDERR") == nullptr) {
      const int null = open("/dev/null", O_WRONLY);
      if (null >= 0) dup2(null, 2);
    }
    execv(args[0], args.data());
    _exit(127);
  }
}

ChildProcess::~ChildProcess() { Signal(SIGKILL); }

int ChildProcess::Signal(int sig) {
  if (pid_ <= 0) return -1;
  kill(pid_, sig);
  int status = 0;
  waitpid(pid_, &status, 0);
  pid_ = -1;
  return status;
}

bool ChildProcess::Exited(int timeout_ms) {
  if (pid_ <= 0) return true;
  int status = 0;
  const bool gone = WaitFor([&] { return waitpid(pid_, &status, WNOHANG) == pid_; }, timeout_ms);
  if (gone) pid_ = -1;
  return gone;
}

ScopedRoot::ScopedRoot(const std::string& root) {
  const char* old = std::getenv("ORVANE_ROOT");
  had_ = old != nullptr;
  if (had_) old_ = old;
  setenv("ORVANE_ROOT", root.c_str(), 1);
}

ScopedRoot::~ScopedRoot() {
  if (had_) {
    setenv("ORVANE_ROOT", old_.c_str(), 1);
  } else {
    unsetenv("ORVANE_ROOT");
  }
}

}  // namespace test
}  // namespace orvane
