// The command channel to the indexing daemon: one length-framed JSON command per connection over
// its Unix-domain socket (common/wire.hpp), whose reply only keeps the exchange in step. Each
// call uses its own socket; nothing is shared except the process-wide SIGPIPE setting (ignored
// from the first call on).
#ifndef ORVANE_FILEINDEX_COMMUNICATION_HPP_
#define ORVANE_FILEINDEX_COMMUNICATION_HPP_

#include <json/json.h>

#include <string>

namespace orvane {
namespace fileindex {

// Sends {"type": cmd, "data": data} and reads the reply. Throws Error 502 on failure.
void SendCommandToDaemon(const std::string& cmd, const Json::Value& data);

// Writes exactly `size` bytes in chunks of at most 1024, retrying up to 10 interrupted calls
// (wire::kCommandTransfer). Throws Error 502 "write failed, reason=..." on failure.
void BufferWrite(int fd, unsigned int size, const unsigned char* buf);
// Reads exactly `size` bytes, with the same interrupted-call budget. A peer that has closed
// (reads of 0) is read again a few times and then fails. Throws Error 502 "read failed, ...".
void BufferRead(int fd, unsigned int size, unsigned char* buf);

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_COMMUNICATION_HPP_
