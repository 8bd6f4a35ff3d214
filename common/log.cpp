#include "common/log.hpp"

#include <syslog.h>
#include <unistd.h>

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

// Formats like Log(): printf directives, "%m" read as `saved_errno`.
std::string VFormat(const char* fmt, va_list args, int saved_errno) {
  const std::string format = ExpandErrno(fmt, saved_errno);
  va_list copy;
  va_copy(copy, args);
  char small[512];
  int n = std::vsnprintf(small, sizeof(small), format.c_str(), args);
  std::string line;
  if (n >= 0 && static_cast<size_t>(n) < sizeof(small)) {
    line.assign(small, n);
  } else if (n >= 0) {
    line.resize(n + 1);
    std::vsnprintf(line.data(), line.size(), format.c_str(), copy);
    line.resize(n);
  }
  va_end(copy);
  return line;
}

void Emit(int priority, const std::string& line) {
  LogSink sink;
  {
    std::lock_guard<std::mutex> lock(SinkMutex());
    sink = CurrentSink();
  }
  sink(priority, line);
}

}  // namespace

void Log(int priority, const char* fmt, ...) {
  const int saved_errno = errno;
  va_list args;
  va_start(args, fmt);
  const std::string line = VFormat(fmt, args, saved_errno);
  va_end(args);
  Emit(priority, line);
  errno = saved_errno;
}

void LogAt(const char* file, int line, int priority, const char* fmt, ...) {
  const int saved_errno = errno;
  std::string text = std::string(SourceName(file)) + ":" + std::to_string(line) + " ";
  va_list args;
  va_start(args, fmt);
  text += VFormat(fmt, args, saved_errno);
  va_end(args);
  Emit(priority, text);
  errno = saved_errno;
}

void LogFailedAt(const char* file, int line, const char* func, const char* fmt, ...) {
  const int saved_errno = errno;
  std::string text = std::string(SourceName(file)) + ":" + std::to_string(line) + " (" +
                     std::to_string(getpid()) + ", " + std::to_string(geteuid()) + ") (" + func +
                     ") ";
  va_list args;
  va_start(args, fmt);
  text += VFormat(fmt, args, saved_errno);
  va_end(args);
  if (saved_errno != 0) {
    text += " [err: ";
    text += std::strerror(saved_errno);
    text += "]";
  }
  Emit(LOG_ERR, text);
  errno = 0;
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
