#include "common/error.hpp"

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
  LogFailedAt(file, line, func, "Failed [%s], reason: %s", condition, error.what());
  throw error;
}

void LogFailure(const char* file, int line, const char* func, const char* condition) {
  LogFailedAt(file, line, func, "Failed [%s]", condition);
}

}  // namespace orvane
