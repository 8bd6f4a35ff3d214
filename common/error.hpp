// orvane::Error, the one exception type of the system, and the throw-site routine that logs
// where and why a failure arose before throwing it. Errors are plain values: copyable and
// immutable once built.
#ifndef ORVANE_COMMON_ERROR_HPP_
#define ORVANE_COMMON_ERROR_HPP_

#include <cstdint>
#include <stdexcept>
#include <string>

namespace orvane {

enum ErrorCode : int32_t {
  kErrInvalidParam = 120,
  kErrShareEnum = 121,
  kErrSystem = 502,
  kErrCredentials = 503,
  kErrLoadConfig = 504,
  kErrSaveConfig = 505,
  kErrLockFile = 506,
  kErrUnsafePath = 507,
  // The search engine's answer for an index it found damaged and set aside; passed through.
  kErrIndexDamaged = 609,
  kErrShareGet = 800,
  kErrChown = 801,
  kErrFolderInvalid = 901,
  kErrFolderNotFound = 902,
  kErrPathCannotIndex = 903,
  kErrMalformedEvent = 906,
  kErrElastic = 913,
  kErrParseFile = 914,
  kErrNoQueryData = 916,
  kErrNoDocument = 917,
  kErrSpaceNotEnough = 1003,
  kErrOPTreePath = 9999,
};

class Error : public std::runtime_error {
 public:
  explicit Error(ErrorCode code);
  Error(ErrorCode code, const std::string& reason);
  Error(const Error& other);
  ~Error() override = default;

  const char* what() const noexcept override { return message.c_str(); }

  ErrorCode code;
  std::string message;
};

// Logs "file:line (pid, euid) (func) Failed [condition], reason: <what()>" (with " [err: %m]"
// and errno cleared when errno is set) and throws Error(code, reason).
[[noreturn]] void ThrowError(const char* file, int line, const char* func, const char* condition,
                             ErrorCode code, const std::string& reason);

// The logged-only form: the same prefix without a reason.
void LogFailure(const char* file, int line, const char* func, const char* condition);

}  // namespace orvane

// Throws Error(code, reason), logged at the throw site, when `cond` holds. The log line names
// the condition by its own source text, so the code and what the log says it tested cannot
// drift apart: shape the code so that it reads as the failure should be reported.
#define ORVANE_THROW_IF(cond, code, reason)                                            \
  do {                                                                                 \
    if (cond) ::orvane::ThrowError(__FILE__, __LINE__, __func__, #cond, code, reason); \
  } while (0)

// The same, naming `func` instead of the enclosing function: for a helper that fails on behalf
// of the command its caller runs.
#define ORVANE_THROW_IF_IN(func, cond, code, reason)                               \
  do {                                                                             \
    if (cond) ::orvane::ThrowError(__FILE__, __LINE__, func, #cond, code, reason); \
  } while (0)

// The same with a condition text given by hand, only where the text log readers know cannot be
// the code's own.
#define ORVANE_THROW_IF_TEXT(text, cond, code, reason)                                \
  do {                                                                                \
    if (cond) ::orvane::ThrowError(__FILE__, __LINE__, __func__, text, code, reason); \
  } while (0)

// Logs a failed condition without throwing; evaluates to whether it failed.
#define ORVANE_LOG_IF(cond) \
  ((cond) ? (::orvane::LogFailure(__FILE__, __LINE__, __func__, #cond), true) : false)

// The same, naming the source `source` instead of this file.
#define ORVANE_LOG_IF_FROM(source, cond) \
  ((cond) ? (::orvane::LogFailure(source, __LINE__, __func__, #cond), true) : false)

#endif  // ORVANE_COMMON_ERROR_HPP_
