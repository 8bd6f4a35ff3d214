// Server: the daemon's Unix-domain sockets. One request frame and one reply frame per
// connection, one thread per connection, the caller's identity from SO_PEERCRED.
// The main socket (mode 0660, group of the service account) takes every command; the public
// socket (mode 0666) takes only the people's commands "search" and "suggest", under limits of
// its own (per user and in all) so that nothing done there takes room from the main socket.
// Start() and Stop() are called from one thread; connections run on their own threads.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_SERVER_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_SERVER_HPP_

#include <sys/types.h>

#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <thread>

#include "common/fd.hpp"
#include "common/wire.hpp"
#include "daemons/quixelasticd/engine.hpp"

namespace orvane {
namespace elasticd {

struct ServerOptions {
  std::string socket_path;
  std::string public_socket_path;  // empty: no public socket
  uint32_t max_frame_bytes = wire::kEngineMaxFrameBytes;
  // A request must arrive, and its reply be taken, within this time.
  int64_t io_timeout_micros = wire::kEngineIoTimeoutMicros;
  // Connections of the main socket served at once; beyond it they are answered kCodeOverloaded.
  int max_connections = 256;
  // The public socket. Connections beyond these limits are answered kCodeOverloaded at once and
  // closed.
  int max_public_connections = 128;          // all users together
  int max_public_connections_per_user = 16;  // by the peer's uid
  // Requests of one user being worked on at once (the rest of its connections wait for their
  // request to arrive); beyond it they are answered kCodeOverloaded.
  int max_public_requests_per_user = 4;
  // A public request must arrive whole within this time of connecting, or the connection is
  // closed without a reply: idle connections do not hold room.
  int64_t public_request_timeout_micros = wire::kEnginePublicRequestTimeoutMicros;
  // Longest request accepted on the public socket (a search is a few hundred bytes).
  uint32_t max_public_frame_bytes = wire::kEnginePublicMaxFrameBytes;
  // The service account, whose processes may run index and document commands like root.
  uid_t service_uid = static_cast<uid_t>(-1);
  gid_t service_gid = static_cast<gid_t>(-1);
};

class Server {
 public:
  Server(Engine& engine, ServerOptions options);
  ~Server();
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // Binds and listens on the sockets and starts accepting; throws Error (502) on failure.
  void Start();
  // Stops accepting, removes the socket files and waits for connections in flight to answer.
  void Stop();

  // Serves one accepted connection to the end (used by the accept loop and the fuzz harness).
  void Serve(int fd, bool public_socket);

 private:
  UniqueFd Listen(const std::string& path, mode_t mode);
  void AcceptLoop();
  // Takes a place for a new public connection of `uid`; false (and the reason) when full.
  bool AdmitPublic(uid_t uid, std::string* why);
  void ServePublic(int fd, uid_t uid);

  Engine& engine_;
  ServerOptions options_;
  UniqueFd main_fd_;
  UniqueFd public_fd_;
  UniqueFd stop_read_;
  UniqueFd stop_write_;
  std::thread acceptor_;
  std::mutex mu_;
  std::condition_variable idle_cv_;
  int active_ = 0;  // connection threads of both sockets
  int main_active_ = 0;
  int public_active_ = 0;
  std::map<uid_t, int> public_by_user_;   // connections
  std::map<uid_t, int> running_by_user_;  // requests being worked on
  bool started_ = false;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_SERVER_HPP_
