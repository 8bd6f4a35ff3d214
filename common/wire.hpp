// The daemons' wire: every socket path, the result codes the daemons answer with, and the frame
// both Unix-domain channels carry (a 4-byte unsigned length in host byte order, then that many
// bytes of payload) with the transfers that move it, their limits and time-outs. The functions
// keep no state and are safe from any thread on distinct descriptors; the I/O seam is
// process-wide.
#ifndef ORVANE_COMMON_WIRE_HPP_
#define ORVANE_COMMON_WIRE_HPP_

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

#include "common/fd.hpp"

namespace orvane {

// The sockets, as fixed paths below ORVANE_ROOT (RootedPath).
constexpr char kFileIndexdSockPath[] = "/var/run/fileindexd.sock";
constexpr char kElasticdSockPath[] = "/var/run/quixelasticd.sock";
// The search engine's socket for everyone's searches and suggestions.
constexpr char kElasticdSearchSockPath[] = "/var/run/quixelasticd.search.sock";
// Passed to the socket client's Connect as is (milliseconds there).
constexpr long kElasticdConnectTimeout = 864000;

// The codes of {"success": false, "error": {"code", "msg"}} replies: 100 to 105 are about the
// request itself (both daemons), the rest are the search engine's about its indexes and load.
enum ResultCode : int {
  kCodeMalformed = 100,  // not a JSON object, wrong member shapes
  kCodeUnknownCommand = 101,
  kCodeInvalidParam = 102,        // a member is missing or has the wrong type or value
  kCodePermissionDenied = 103,    // the caller may not run this command
  kCodeTooLarge = 104,            // the frame is longer than the daemon accepts
  kCodeTooManyConnections = 105,  // the indexing daemon's caps on connections
  kCodeIndexNotFound = 601,
  kCodeIndexExists = 602,
  kCodeDocNotFound = 603,
  kCodeDocInvalid = 604,  // a required field is missing or a value has the wrong type
  kCodeStorage = 605,     // the store could not be read or written (disk full, I/O)
  kCodeIndexPaused = 606,
  kCodeIndexOpening = 607,
  kCodeIndexRecovering = 608,
  kCodeIndexDamaged = 609,  // set aside; needs a rebuild (delete and create)
  kCodeIndexMoving = 610,
  kCodeOutOfMemory = 1400,
  kCodeOverloaded = 1401,     // too many requests or connections (of this user, or of all)
  kCodeSearchTooLong = 1402,  // a search ran past its time budget and was stopped
  kCodeCallerGone = 1403,     // the client hung up while its search ran; never sent
};

namespace wire {

// The search engine's sockets: the longest request and the time a request has to arrive (and
// its reply to be taken); the public socket's own, smaller bounds.
constexpr uint32_t kEngineMaxFrameBytes = 64u << 20;
constexpr int64_t kEngineIoTimeoutMicros = 30 * 1000000LL;
constexpr uint32_t kEnginePublicMaxFrameBytes = 1u << 20;
constexpr int64_t kEnginePublicRequestTimeoutMicros = 2 * 1000000LL;

// The indexing daemon's socket: the longest command (commands are small JSON objects), and the
// time a client has to send all of it after connecting, and to take each part of the reply.
constexpr uint32_t kMaxCommandFrame = 1u << 20;
constexpr int kCommandTimeoutMillis = 1000;

// The daemon client (quixdaemon::SockConnection): the longest reply, the wait for its first
// byte (a daemon may work that long before it answers) and for each further one (a daemon
// writes a frame in one go, so silence in the middle of one means it is stuck).
constexpr uint32_t kClientMaxFrameBytes = 128u << 20;
constexpr int kClientReplyTimeoutMs = 10 * 60 * 1000;
constexpr int kClientIdleTimeoutMs = 30 * 1000;

// The command channel's client: a reply is read whole and thrown away, so a longer one is
// refused rather than allocated; the kernel's time-outs on its socket.
constexpr unsigned int kMaxDaemonReplyBytes = 16u << 20;
constexpr int kDaemonReplyTimeoutSec = 30;
constexpr int kDaemonSendTimeoutSec = 1;

enum class IoStatus {
  kOk,
  kClosed,    // the peer closed before all bytes moved (errno ECONNRESET)
  kTimeout,   // errno ETIMEDOUT
  kTooLarge,  // a frame over the bound (errno EMSGSIZE)
  kError,     // errno from the failed call
};

// When a transfer stops waiting for its peer. Measured on the real monotonic clock, not Env:
// the kernel waits in real time, and a test's frozen clock would never end a wait.
class Deadline {
 public:
  static Deadline Never() { return Deadline(kNoLimit, 0); }
  // Gives up as soon as the peer is not ready.
  static Deadline NoWait();
  // One limit for the whole exchange, so a peer dripping a byte at a time is cut off as surely
  // as a silent one.
  static Deadline In(int64_t micros);
  // `first_ms` until the first byte moves, then `idle_ms` after each byte that does; 0 or less
  // waits without limit.
  static Deadline Idle(int64_t first_ms, int64_t idle_ms);

  // Called as bytes move: an idle limit starts again.
  void Progress();
  // What one poll() may wait: -1 without limit, 0 once the limit has passed.
  int PollMillis() const;
  bool Passed() const;

 private:
  static constexpr int64_t kNoLimit = INT64_MAX;
  Deadline(int64_t at, int64_t idle) : at_(at), idle_(idle) {}

  int64_t at_;    // monotonic microseconds, or kNoLimit
  int64_t idle_;  // > 0: the limit after progress; 0: `at_` stays; < 0: no limit after progress
};

// Transfers on a socket, whatever its blocking mode: a call that would block waits in poll()
// until `deadline`; interrupted calls are simply repeated; SIGPIPE is never raised.
IoStatus ReadExact(int fd, void* buf, size_t size, Deadline& deadline);
IoStatus WriteExact(int fd, const void* buf, size_t size, Deadline& deadline);
// Reads and throws away `size` bytes (the payload of a frame that is refused).
IoStatus Discard(int fd, uint64_t size, Deadline& deadline);

// The frame header alone.
IoStatus ReadFrameLength(int fd, uint32_t* length, Deadline& deadline);
// One whole frame. A length over `max_bytes` is kTooLarge at once, before anything is
// allocated; the buffer grows with the bytes that really arrive, so a peer announcing a large
// frame and sending little costs little memory. `payload` is empty on failure.
IoStatus ReadFrame(int fd, uint32_t max_bytes, std::string* payload, Deadline& deadline);
// `payload` as one frame (kTooLarge beyond 4 GiB).
IoStatus WriteFrame(int fd, std::string_view payload, Deadline& deadline);
// `text` as a C string: a frame whose payload is the text and one NUL.
IoStatus WriteTextFrame(int fd, std::string_view text, Deadline& deadline);

// The bytes of one frame carrying `payload`.
std::string EncodeFrame(std::string_view payload);
// The text of a payload: requests and replies are C strings, so trailing NULs end the text.
std::string_view PayloadText(std::string_view payload);

// Connects a stream socket (close-on-exec) to `path`, waiting at most `timeout_ms` (0 or less:
// no limit) while the listener's backlog is full. Invalid with errno on failure: ENAMETOOLONG
// for a path no socket address holds, ETIMEDOUT when the wait ran out. errno is kept on success.
UniqueFd Connect(const std::string& path, long timeout_ms);

// Transfers on a blocking descriptor whose time-outs the kernel enforces (a time-out is an
// EAGAIN failure), as the command channel makes them: at most `chunk` bytes per call,
// `interrupts` interrupted calls tolerated per transfer (the next one fails), and a read of 0
// (the peer has closed) tried again `closed_reads` times before it fails with ECONNRESET; a
// write of 0 fails. False with errno on failure.
struct BlockingRules {
  size_t chunk;
  int interrupts;
  int closed_reads;
};
constexpr BlockingRules kCommandTransfer = {1024, 10, 10};
bool WriteBlocking(int fd, const void* buf, size_t size, const BlockingRules& rules);
bool ReadBlocking(int fd, void* buf, size_t size, const BlockingRules& rules);

// The read and write calls of the blocking transfers, replaceable so that tests can interrupt
// them. An empty member means the system call. Swap only while no transfer runs.
struct IoCalls {
  std::function<ssize_t(int fd, const void* buf, size_t size)> write;
  std::function<ssize_t(int fd, void* buf, size_t size)> read;
};
// Installs `calls`; returns the ones it replaces.
IoCalls SetIoCalls(IoCalls calls);

}  // namespace wire
}  // namespace orvane

#endif  // ORVANE_COMMON_WIRE_HPP_
