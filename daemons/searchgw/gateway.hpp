// The search gateway's HTTP/1.1 listener: `POST /<index>/_search` requests read into engine
// searches, one framed request each on the engine's socket, answered with Content-Length
// replies on keep-alive connections. Owns its acceptor, connections and threads; Start() and
// Stop() come from one thread, the rest runs on the gateway's own.
#ifndef ORVANE_DAEMONS_SEARCHGW_GATEWAY_HPP_
#define ORVANE_DAEMONS_SEARCHGW_GATEWAY_HPP_

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace orvane {
namespace searchgw {

struct GatewayOptions {
  // Loopback unless an administrator names another address.
  std::string address = "127.0.0.1";
  uint16_t port = 9210;       // 0: any free port (see Gateway::port())
  std::string engine_socket;  // a real path (already under ORVANE_ROOT)
  int threads = 4;            // also the most engine searches in progress at once
  // Local users all come from one address, so a local user is counted by uid (a remote peer by
  // its address): one user holding connections leaves room for the others.
  int max_connections = 128;
  int max_connections_per_user = 16;
  // The wait for the next request's first byte. Long: the file server keeps one connection per
  // share open between searches, and the first search after the gateway closed it fails.
  int idle_timeout_ms = 3600 * 1000;
  int request_timeout_ms = 5000;  // the rest of a request, once its first byte came
  int engine_timeout_ms = 15000;  // the engine's answer
  size_t max_header_bytes = 8192;
  size_t max_body_bytes = 64 * 1024;
};

class Gateway {
 public:
  explicit Gateway(GatewayOptions options);
  ~Gateway();
  Gateway(const Gateway&) = delete;
  Gateway& operator=(const Gateway&) = delete;

  // Binds and starts serving. Throws Error naming the address when it cannot listen.
  void Start();
  // Closes the listener and every connection; a search in progress ends first.
  void Stop();
  // The port listened on (the one chosen when the options said 0).
  uint16_t port() const;

  struct Impl;  // the listener and its connections, shared with them in gateway.cpp

 private:
  std::unique_ptr<Impl> impl_;
};

}  // namespace searchgw
}  // namespace orvane

#endif  // ORVANE_DAEMONS_SEARCHGW_GATEWAY_HPP_
