// The one log function of the system and its replaceable sink.
// Every line goes through Log(); tests swap the sink to read the exact texts.
// The sink and the level are process-wide; Log() is safe to call from any thread.
#ifndef ORVANE_COMMON_LOG_HPP_
#define ORVANE_COMMON_LOG_HPP_

#include <functional>
#include <string>

namespace orvane {

// Receives one finished line (no trailing newline) and its syslog priority.
using LogSink = std::function<void(int priority, const std::string& line)>;

// Formats like syslog(3): printf directives plus "%m" for strerror(errno).
void Log(int priority, const char* fmt, ...) __attribute__((format(printf, 2, 3)));

// Log() of a line that starts with where it was written: "file:line <message>". Called through
// ORVANE_LOG.
void LogAt(const char* file, int line, int priority, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));

// The failure form: "file:line (pid, euid) (func) <message>" at LOG_ERR, with " [err: %m]"
// appended when errno is set, and errno then cleared. Called through ORVANE_LOG_FAILED.
void LogFailedAt(const char* file, int line, const char* func, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));

// Replaces the sink; an empty sink restores the default (syslog). Returns the previous one.
LogSink SetLogSink(LogSink sink);

// A sink that writes to syslog and, when `to_stderr`, also to standard error (daemons in the
// foreground).
LogSink SyslogSink(bool to_stderr);

// The library-wide log level: 7 (LOG_DEBUG) turns on the per-event debug lines. The initial value
// is ORVANE_LOG_LEVEL from the environment when it is a number from 0 to 7, else 6 (LOG_INFO).
int GetLogLevel();
void SetLogLevel(int level);

// Returns the last component of a source file path, for log prefixes.
const char* SourceName(const char* file);

}  // namespace orvane

// Logs "file:line <message>" at `priority`; the message is formatted like Log()'s.
#define ORVANE_LOG(priority, ...) ::orvane::LogAt(__FILE__, __LINE__, (priority), __VA_ARGS__)

// Logs a failure in the enclosing function: "file:line (pid, euid) (func) <message>", errno
// named and cleared when set.
#define ORVANE_LOG_FAILED(...) ::orvane::LogFailedAt(__FILE__, __LINE__, __func__, __VA_ARGS__)

// The same, naming `func` instead of the enclosing function.
#define ORVANE_LOG_FAILED_IN(func, ...) \
  ::orvane::LogFailedAt(__FILE__, __LINE__, (func), __VA_ARGS__)

#endif  // ORVANE_COMMON_LOG_HPP_
