// An HTTP/1.1 listener for the daemons that answer browsers and search clients: requests read
// one after another on keep-alive connections, each handed to the owner's handler on one of the
// server's threads, with caps on connections (per local uid or remote address), idle and request
// timeouts and header and body bounds. Owns its acceptor, connections and threads; Start() and
// Stop() come from one thread, the handlers run on the server's own, several at once.
#ifndef ORVANE_DAEMONS_HTTP_SERVER_HPP_
#define ORVANE_DAEMONS_HTTP_SERVER_HPP_

#include <sys/types.h>

#include <boost/asio/ip/address.hpp>
#include <boost/beast/http/message.hpp>
#include <boost/beast/http/string_body.hpp>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "common/fd.hpp"

namespace orvane {
namespace httpd {

struct ServerOptions {
  // Loopback unless an administrator names another address.
  std::string address = "127.0.0.1";
  uint16_t port = 0;  // 0: any free port (see Server::port())
  int threads = 4;
  // Local users all come from one address, so a local user is counted by uid (a remote peer by
  // its address): one user holding connections leaves room for the others.
  int max_connections = 128;
  int max_connections_per_user = 16;
  int idle_timeout_ms = 3600 * 1000;  // the wait for the next request's first byte
  int request_timeout_ms = 5000;      // the rest of a request once its first byte came; a reply
  size_t max_header_bytes = 8192;
  size_t max_body_bytes = 64 * 1024;
  // A PEM file holding the certificate chain and its private key; empty: plain HTTP.
  std::string tls_certificate;
};

using Request = boost::beast::http::request<boost::beast::http::string_body>;

// Who is at the other end of a connection.
struct Peer {
  boost::asio::ip::address address;
  uid_t uid = 0;       // the owner of a local peer's socket; 0 for a peer on another machine
  bool local = false;  // the peer's socket is on this machine
};

struct Reply {
  int status = 200;
  std::string content_type = "application/json; charset=UTF-8";
  std::string body;
  std::vector<std::pair<std::string, std::string>> headers;  // more header fields
  // When open, the body is the rest of this file instead of `body` (streamed, never held whole).
  UniqueFd file;
};

// Why the server answers a request or a connection itself, without the handler.
enum class Refusal {
  kUnknownPeer,         // 403: a local connection whose owner cannot be told
  kTooManyConnections,  // 429
  kMalformed,           // 400: not HTTP
  kHeaderTooLarge,      // 431
  kBodyTooLarge,        // 413
};

struct Handlers {
  // Answers one request; called on a server thread, several at once.
  std::function<Reply(const Request& request, const Peer& peer)> handle;
  // The reply to a refusal; `reason` says what was wrong in words for people.
  std::function<Reply(Refusal refusal, int status, const std::string& reason)> refuse;
};

class Server {
 public:
  Server(ServerOptions options, Handlers handlers);
  ~Server();
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // Binds and starts serving. Throws Error naming the address (or the certificate) when it
  // cannot.
  void Start();
  // Closes the listener and every connection; a request in progress ends first.
  void Stop();
  // The port listened on (the one chosen when the options said 0).
  uint16_t port() const;

  struct Impl;  // the listener and its connections, shared with them in server.cpp

 private:
  std::unique_ptr<Impl> impl_;
};

}  // namespace httpd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_HTTP_SERVER_HPP_
