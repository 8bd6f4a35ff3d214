#include "common/log.hpp"

#include <syslog.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <mutex>

namespace orvane {
namespace {

std::mutex& SinkMutex() {
  static std::mutex mu;
  return mu;
}

LogSink& CurrentSink() {
  static LogSink sink = SyslogSink(false);
  return sink;
}

int InitialLevel() {
  const char* env = std::getenv("ORVANE_LOG_LEVEL");
  if (env != nullptr && env[0] >= '0' && env[0] <= '7' && env[1] == '\0') return env[0] - '0';
  return LOG_INFO;
}

std::atomic<int>& Level() {
  static std::atomic<int> level{InitialLevel()};
  return level;
}

// "%m" is expanded here rather than by syslog so that every sink sees the same text.
std::string ExpandErrno(const char* fmt, int saved_errno) {
  std::string out;
  for (const char* p = fmt; *p != '\0'; ++p) {
    if (p[0] == '%' && p[1] == '%') {
      out += "%%";
      ++p;
    } else if (p[0] == '%' && p[1] == 'm') {
      for (const char* s = std::strerror(saved_errno); *s != '\0'; ++s) {
        out += *s;
        if (*s == '%') out += '%';
      }
      ++p;
    } else {
      out += *p;
    }
  }
  return out;
}

}  // namespace

void Log(int priority, const char* fmt, ...) {
  const int saved_errno = errno;
  const std::string format = ExpandErrno(fmt, saved_errno);
  va_list args;
  va_start(args, fmt);
  va_list copy;
  va_copy(copy, args);
  char small[512];
  int n = std::vsnprintf(small, sizeof(small), format.c_str(), args);
  va_end(args);
  std::string line;
  if (n >= 0 && static_cast<size_t>(n) < sizeof(small)) {
    line.assign(small, n);
  } else if (n >= 0) {
    line.resize(n + 1);
    std::vsnprintf(line.data(), line.size(), format.c_str(), copy);
    line.resize(n);
  }
  va_end(copy);
  LogSink sink;
  {
    std::lock_guard<std::mutex> lock(SinkMutex());
    sink = CurrentSink();
  }
  sink(priority, line);
  errno = saved_errno;
}

LogSink SetLogSink(LogSink sink) {
  std::lock_guard<std::mutex> lock(SinkMutex());
  LogSink previous = std::move(CurrentSink());
  CurrentSink() = sink ? std::move(sink) : SyslogSink(false);
  return previous;
}

LogSink SyslogSink(bool to_stderr) {
  return [to_stderr](int priority, const std::string& line) {
    syslog(priority, "%s", line.c_str());
    if (to_stderr) {
      static std::mutex stderr_mu;
      std::lock_guard<std::mutex> lock(stderr_mu);
      std::cerr << line << '\n';
    }
  };
}

int GetLogLevel() { return Level().load(std::memory_order_relaxed); }

void SetLogLevel(int level) { Level().store(level, std::memory_order_relaxed); }

const char* SourceName(const char* file) {
  const char* slash = std::strrchr(file, '/');
  return slash == nullptr ? file : slash + 1;
}

}  // namespace orvane
