// CommandServer serves the indexing daemon's Unix-domain command socket: one frame in (4-byte
// host-order length, JSON text, NUL), one frame out, per connection, on its own thread. Frames
// are bounded and a slow client is cut off, so no caller can stall the daemon. The handler runs
// on the server's thread.
#ifndef ORVANE_DAEMONS_FILEINDEXD_SERVER_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_SERVER_HPP_

#include <sys/types.h>
#include <json/json.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <string>
#include <thread>

#include "common/fd.hpp"

namespace orvane {
namespace fileindexd {

// The longest command accepted; commands are small JSON objects.
constexpr uint32_t kMaxCommandFrame = 1 << 20;
// A client must send its command, and take the reply, within this time.
constexpr int kClientTimeoutMillis = 2000;

class CommandServer {
 public:
  // Gets the parsed command and the caller's user id; returns the reply object.
  using Handler = std::function<Json::Value(const Json::Value& command, uid_t peer_uid)>;

  CommandServer(const std::string& socket_path, Handler handler);
  ~CommandServer();
  CommandServer(const CommandServer&) = delete;
  CommandServer& operator=(const CommandServer&) = delete;

  // Binds the socket (mode 0666: "status" is for everyone; the handler checks the caller) and
  // starts serving. Throws Error 502 when the socket cannot be set up.
  void Start();
  // Stops serving and removes the socket file.
  void Stop();

  // An error reply {"success": false, "error": {"code", "msg"}}.
  static Json::Value ErrorReply(int code, const std::string& msg);

 private:
  void Serve();
  void ServeOne(int fd);

  std::string path_;
  Handler handler_;
  UniqueFd listen_;
  UniqueFd stop_read_;
  UniqueFd stop_write_;
  std::thread thread_;
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_SERVER_HPP_
