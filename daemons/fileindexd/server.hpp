// CommandServer serves the indexing daemon's Unix-domain command socket: one frame in (JSON text
// and NUL, see common/wire.hpp), one frame out, per connection. Connections are served
// concurrently, each on a thread of its own, so an idle or slow client holds only its own
// connection; frames are bounded, a client must send its command within a short time, and
// callers other than root and the daemon's own user have a cap of connections each and together
// (beyond it they are answered kCodeTooManyConnections).
// The handler may run on several threads at once.
#ifndef ORVANE_DAEMONS_FILEINDEXD_SERVER_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_SERVER_HPP_

#include <json/json.h>
#include <sys/types.h>

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>

#include "common/fd.hpp"
#include "common/wire.hpp"

namespace orvane {
namespace fileindexd {

// Connections served at once for callers other than root and the daemon's own user: in all,
// and for one user. Root and the daemon's user are never turned away.
constexpr int kMaxConnections = 64;
constexpr int kMaxConnectionsPerUser = 8;

class CommandServer {
 public:
  // Gets the parsed command and the caller's user id; returns the reply object. It is sent only
  // once the handler has returned, so a command's effect precedes its reply.
  using Handler = std::function<Json::Value(const Json::Value& command, uid_t peer_uid)>;

  CommandServer(const std::string& socket_path, Handler handler);
  ~CommandServer();
  CommandServer(const CommandServer&) = delete;
  CommandServer& operator=(const CommandServer&) = delete;

  // Binds the socket (mode 0666: "status" is for everyone; the handler checks the caller) and
  // starts serving. Throws Error 502 when the socket cannot be set up.
  void Start();
  // Stops accepting, cuts off clients still sending, waits for the commands being handled and
  // removes the socket file.
  void Stop();

  // An error reply {"success": false, "error": {"code", "msg"}}.
  static Json::Value ErrorReply(int code, const std::string& msg);

 private:
  void Serve();
  // Runs on the connection's own thread; `privileged` callers are outside the caps.
  void ServeOne(UniqueFd conn, uid_t uid, bool privileged);

  std::string path_;
  Handler handler_;
  UniqueFd listen_;
  UniqueFd stop_read_;
  UniqueFd stop_write_;
  std::thread thread_;

  std::mutex mu_;  // guards the connection book-keeping below
  std::condition_variable idle_cv_;
  int active_ = 0;                 // connection threads running
  int capped_ = 0;                 // ... of them, of callers under the caps
  std::map<uid_t, int> per_user_;  // capped connections by user
  std::set<int> open_fds_;         // descriptors of running connections, shut down by Stop
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_SERVER_HPP_
