// The command channel to the indexing daemon: one length-framed JSON command per connection over
// its Unix-domain socket, whose reply only keeps the exchange in step. Each call uses its own
// socket; nothing is shared except the process-wide SIGPIPE setting (ignored from the first
// call on) and the test seam below.
#ifndef ORVANE_FILEINDEX_COMMUNICATION_HPP_
#define ORVANE_FILEINDEX_COMMUNICATION_HPP_

#include <json/json.h>
#include <sys/types.h>

#include <functional>
#include <string>

namespace orvane {
namespace fileindex {

constexpr char kFileIndexdSockPath[] = "/var/run/fileindexd.sock";
// A reply is read whole and thrown away; a longer one is refused rather than allocated.
constexpr unsigned int kMaxDaemonReplyBytes = 16u << 20;
// How long the daemon may take to answer (and to send each further part of its answer).
constexpr int kDaemonReplyTimeoutSec = 30;

// Sends {"type": cmd, "data": data} and reads the reply. Throws Error 502 on failure.
void SendCommandToDaemon(const std::string& cmd, const Json::Value& data);

// Writes exactly `size` bytes in chunks of at most 1024, retrying up to 10 interrupted calls.
// Throws Error 502 "write failed, reason=..." on failure.
void BufferWrite(int fd, unsigned int size, const unsigned char* buf);
// Reads exactly `size` bytes, with the same interrupted-call budget. A peer that has closed
// (reads of 0) is read again a few times and then fails. Throws Error 502 "read failed, ...".
void BufferRead(int fd, unsigned int size, unsigned char* buf);

// The read and write calls of the buffer transfers, replaceable so that tests can interrupt
// them. An empty member means the system call. Swap only while no transfer runs.
struct BufferIo {
  std::function<ssize_t(int fd, const void* buf, size_t size)> write;
  std::function<ssize_t(int fd, void* buf, size_t size)> read;
};
// Installs `io`; returns the one it replaces.
BufferIo SetBufferIo(BufferIo io);

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_COMMUNICATION_HPP_
