#include "common/error.hpp"

#include <syslog.h>
#include <unistd.h>

#include <cerrno>

#include "common/log.hpp"

namespace orvane {
namespace {

std::string BuildMessage(ErrorCode code, const std::string& reason) {
  std::string message = "Orvane error, code=" + std::to_string(static_cast<int32_t>(code));
  if (!reason.empty()) message += ", reason=[" + reason + "]";
  return message;
}

}  // namespace

Error::Error(ErrorCode code) : Error(code, std::string()) {}

Error::Error(ErrorCode code, const std::string& reason)
    : std::runtime_error(BuildMessage(code, reason)),
      code(code),
      message(BuildMessage(code, reason)) {}

Error::Error(const Error& other)
    : std::runtime_error(other), code(other.code), message(other.message) {}

void ThrowError(const char* file, int line, const char* func, const char* condition, ErrorCode code,
                const std::string& reason) {
  const int saved_errno = errno;
  Error error(code, reason);
  errno = saved_errno;
  if (saved_errno != 0) {
    Log(LOG_ERR, "%s:%d (%d, %u) (%s) Failed [%s], reason: %s [err: %m]", SourceName(file), line,
        getpid(), geteuid(), func, condition, error.what());
    errno = 0;
  } else {
    Log(LOG_ERR, "%s:%d (%d, %u) (%s) Failed [%s], reason: %s", SourceName(file), line, getpid(),
        geteuid(), func, condition, error.what());
  }
  throw error;
}

void LogFailure(const char* file, int line, const char* func, const char* condition) {
  if (errno != 0) {
    Log(LOG_ERR, "%s:%d (%d, %u) (%s) Failed [%s] [err: %m]", SourceName(file), line, getpid(),
        geteuid(), func, condition);
    errno = 0;
  } else {
    Log(LOG_ERR, "%s:%d (%d, %u) (%s) Failed [%s]", SourceName(file), line, getpid(), geteuid(),
        func, condition);
  }
}

}  // namespace orvane
