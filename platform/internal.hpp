// Helpers shared by the platform's own sources; not part of its interface.
#ifndef ORVANE_PLATFORM_INTERNAL_HPP_
#define ORVANE_PLATFORM_INTERNAL_HPP_

#include <pwd.h>
#include <sys/types.h>

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/fault.hpp"
#include "platform/platform_error.hpp"

namespace orvane {
namespace platform {

// Records a failure the platform way and yields `result`.
inline int FailWith(int result, int err, uint32_t code, const char* file, int line) {
  QLIBCErrSetAt(code, file, line);
  errno = err;
  return result;
}

// Copies `text` with its NUL into buf; false (nothing copied beyond an empty string) when it
// does not fit.
bool CopyOut(const std::string& text, char* buf, size_t size);

// The user's groups, primary group included.
std::vector<gid_t> GroupList(const struct passwd& pw);

// Whether `path` is `dir` itself or lies below it, comparing whole components.
bool PathIsAtOrBelow(const std::string& path, const std::string& dir);

}  // namespace platform
}  // namespace orvane

#define PLATFORM_FAIL(result, err, code) \
  ::orvane::platform::FailWith((result), (err), (code), __FILE__, __LINE__)

// The first statement of every platform call: an armed fault answers instead of the system.
// `out_ptr` is the call's flag or value output (or nullptr).
#define PLATFORM_FAULT_POINT(name, out_ptr)                                      \
  do {                                                                          \
    if (auto fault_ = ::orvane::platform::FaultFor(name)) {                     \
      if (fault_->set_out) ::orvane::platform::internal::SetOut((out_ptr), fault_->out); \
      if (fault_->platform_err != 0) QLIBCErrSet(fault_->platform_err);         \
      errno = fault_->err;                                                      \
      return static_cast<decltype(fault_->result)>(fault_->result);             \
    }                                                                           \
  } while (0)

namespace orvane {
namespace platform {
namespace internal {
template <typename T>
void SetOut(T* out, int value) {
  if (out != nullptr) *out = static_cast<T>(value);
}
inline void SetOut(std::nullptr_t, int) {}
}  // namespace internal
}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_INTERNAL_HPP_
