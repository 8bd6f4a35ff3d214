// Framing of the daemon's socket: a 4-byte unsigned length in host byte order, then that many
// bytes of payload. Every read and write has a deadline, so a silent or slow peer cannot hold a
// connection thread for ever. Stateless functions; safe from any thread on distinct descriptors.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_FRAME_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_FRAME_HPP_

#include <cstdint>
#include <string>

namespace orvane {
namespace elasticd {

enum class IoStatus { kOk, kClosed, kTimeout, kError };

// Reads exactly `n` bytes before `deadline_micros` (monotonic, Env::NowMicros()).
IoStatus ReadExact(int fd, void* buf, size_t n, int64_t deadline_micros);
// Reads and throws away `n` bytes (the payload of a frame that is refused).
IoStatus Discard(int fd, uint64_t n, int64_t deadline_micros);
IoStatus WriteExact(int fd, const void* buf, size_t n, int64_t deadline_micros);

IoStatus ReadFrameLength(int fd, uint32_t* length, int64_t deadline_micros);
// Writes one frame whose payload is `text` followed by one NUL, like the requests.
IoStatus WriteFrame(int fd, const std::string& text, int64_t deadline_micros);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_FRAME_HPP_
