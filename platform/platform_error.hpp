// The platform's per-thread error number: every platform call that fails records a code here
// (with the source file and line that recorded it) next to errno, and QLIBCErrGet() reads it back.
// Thread-local, so no locking.
#ifndef ORVANE_PLATFORM_PLATFORM_ERROR_HPP_
#define ORVANE_PLATFORM_PLATFORM_ERROR_HPP_

#include <cstdint>

namespace orvane {
namespace platform {

constexpr uint32_t kQErrNone = 0x0000;
constexpr uint32_t kQErrBadParam = 0x0100;       // null, empty or malformed argument
constexpr uint32_t kQErrSystem = 0x0200;         // a system call failed; errno says which
constexpr uint32_t kQErrOutOfMemory = 0x0300;
constexpr uint32_t kQErrBufferTooSmall = 0x0400;
constexpr uint32_t kQErrNotSupported = 0x0500;   // the feature is absent on this machine
constexpr uint32_t kQErrConfig = 0x0D00;         // the platform configuration file is unusable
constexpr uint32_t kQErrNoSuchShare = 0x1400;
constexpr uint32_t kQErrNoSuchUser = 0x1700;
constexpr uint32_t kQErrNoSuchGroup = 0x1800;
constexpr uint32_t kQErrPermission = 0x1900;
constexpr uint32_t kQErrVolumeFull = 0x2400;
constexpr uint32_t kQErrQuotaExceeded = 0x2900;

// The last error number recorded on this thread (0 after a success that cleared it).
uint32_t QLIBCErrGet();
// Where the last error number was recorded.
const char* QLIBCErrFileGet();
int QLIBCErrLineGet();

void QLIBCErrSetAt(uint32_t code, const char* file, int line);

}  // namespace platform
}  // namespace orvane

#define QLIBCErrSet(code) ::orvane::platform::QLIBCErrSetAt((code), __FILE__, __LINE__)

#endif  // ORVANE_PLATFORM_PLATFORM_ERROR_HPP_
