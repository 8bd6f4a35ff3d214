#include "daemons/http/server.hpp"

#include <syslog.h>

#include <algorithm>
#include <atomic>
#include <boost/asio.hpp>
#include <boost/asio/ssl.hpp>
#include <boost/beast/core.hpp>
#include <boost/beast/http.hpp>
#include <boost/beast/ssl.hpp>
#include <chrono>
#include <map>
#include <mutex>
#include <optional>
#include <thread>
#include <type_traits>

#include "common/error.hpp"
#include "common/log.hpp"
#include "daemons/http/peer_uid.hpp"

namespace orvane {
namespace httpd {
namespace {

namespace asio = boost::asio;
namespace beast = boost::beast;
namespace http = beast::http;
namespace ssl = asio::ssl;
using tcp = asio::ip::tcp;
using Millis = std::chrono::milliseconds;

bool IsPowerOfTwo(uint64_t n) { return n != 0 && (n & (n - 1)) == 0; }

}  // namespace

struct Server::Impl {
  Impl(ServerOptions o, Handlers h) : opt(std::move(o)), handlers(std::move(h)) {}

  // Counts a connection of `who` (a local user, or a remote address); false when it is one too
  // many in all or for `who`.
  bool Admit(const std::string& who);
  void Release(const std::string& who);
  void Accept();
  // Who a connection is: the owner of the peer's socket, or a peer on another machine; nothing
  // (and why) when that cannot be told. `who` names the peer for the connection caps: local
  // users share one address, so they are counted by uid.
  std::optional<Peer> Identify(const tcp::socket& s, const tcp::endpoint& peer, std::string* who,
                               std::string* why) const;
  void Refuse(tcp::socket socket, Refusal refusal, int status, const std::string& why);
  template <class Stream>
  void Serve(tcp::socket socket, Peer peer, std::string who);

  ServerOptions opt;
  Handlers handlers;
  // Declared before the I/O context so that they outlive the connections it destroys.
  std::mutex mu;
  std::map<std::string, int> per_peer;
  int connections = 0;
  std::atomic<uint64_t> refused{0};
  uint16_t port = 0;
  std::optional<ssl::context> tls;

  asio::io_context ioc;
  std::optional<tcp::acceptor> acceptor;
  std::optional<asio::steady_timer> retry;
  std::vector<std::thread> threads;
};

namespace {

using TlsStream = beast::ssl_stream<beast::tcp_stream>;

// One client connection: requests read one after another, each answered before the next is
// read. Lives as long as an operation of it is pending.
template <class Stream>
class Session : public std::enable_shared_from_this<Session<Stream>> {
 public:
  template <class... Args>
  Session(Server::Impl* server, Peer peer, std::string who, Args&&... stream_args)
      : server_(server), stream_(std::forward<Args>(stream_args)...), peer_(std::move(peer)),
        who_(std::move(who)) {}
  ~Session() { server_->Release(who_); }

  void Start() {
    if constexpr (std::is_same_v<Stream, TlsStream>) {
      beast::get_lowest_layer(stream_).expires_after(Millis(server_->opt.request_timeout_ms));
      stream_.async_handshake(ssl::stream_base::server,
                              [self = this->shared_from_this()](beast::error_code ec) {
                                if (ec) return self->Close();
                                self->WaitForRequest();
                              });
    } else {
      WaitForRequest();
    }
  }

 private:
  void WaitForRequest() {
    parser_.emplace();
    parser_->header_limit(static_cast<uint32_t>(server_->opt.max_header_bytes));
    parser_->body_limit(server_->opt.max_body_bytes);
    if (buffer_.size() > 0) return ReadRest();
    // An idle keep-alive connection may wait long for its next request; once a byte has come,
    // the whole request must follow within the shorter time, so dripping bytes buys nothing.
    beast::get_lowest_layer(stream_).expires_after(Millis(server_->opt.idle_timeout_ms));
    stream_.async_read_some(buffer_.prepare(1024),
                            [self = this->shared_from_this()](beast::error_code ec, size_t n) {
                              if (ec) return self->Close();
                              self->buffer_.commit(n);
                              self->ReadRest();
                            });
  }

  void ReadRest() {
    beast::get_lowest_layer(stream_).expires_after(Millis(server_->opt.request_timeout_ms));
    http::async_read(
        stream_, buffer_, *parser_,
        [self = this->shared_from_this()](beast::error_code ec, size_t) { self->OnRead(ec); });
  }

  void OnRead(beast::error_code ec) {
    if (!ec) return Handle();
    if (ec.category() != http::make_error_code(http::error::bad_target).category() ||
        ec == http::error::end_of_stream || ec == http::error::partial_message) {
      return Close();  // gone, timed out or cut short: nobody to answer
    }
    Refusal refusal = Refusal::kMalformed;
    int status = 400;
    std::string reason = "malformed HTTP request: " + ec.message();
    if (ec == http::error::header_limit) {
      refusal = Refusal::kHeaderTooLarge;
      status = 431;
      reason = "the request's header is longer than " +
               std::to_string(server_->opt.max_header_bytes) + " bytes";
    } else if (ec == http::error::body_limit) {
      refusal = Refusal::kBodyTooLarge;
      status = 413;
      reason = "the request's body is longer than " +
               std::to_string(server_->opt.max_body_bytes) + " bytes";
    }
    ORVANE_LOG(LOG_WARNING, "request from %s refused: %s", peer_.address.to_string().c_str(),
               reason.c_str());
    Send(11, server_->handlers.refuse(refusal, status, reason), false);
  }

  void Handle() {
    const Request& req = parser_->get();
    Send(req.version(), server_->handlers.handle(req, peer_), req.keep_alive());
  }

  template <class Message>
  void Prepare(Message& res, unsigned version, const Reply& reply, bool keep_alive) {
    res.version(version == 11 || version == 10 ? version : 11);
    res.result(static_cast<http::status>(reply.status));
    res.set(http::field::content_type, reply.content_type);
    for (const auto& [name, value] : reply.headers) res.insert(name, value);
    res.keep_alive(keep_alive);
  }

  void Send(unsigned version, Reply reply, bool keep_alive) {
    beast::get_lowest_layer(stream_).expires_after(Millis(server_->opt.request_timeout_ms));
    if (reply.file.valid()) {
      beast::file file;
      file.native_handle(reply.file.Release());
      beast::error_code ec;
      file_res_ = {};
      file_res_.body().reset(std::move(file), ec);
      if (!ec) {
        Prepare(file_res_, version, reply, keep_alive);
        file_res_.prepare_payload();
        // A large file takes as long as the client reads it, a slow client not longer than the
        // request timeout between pieces.
        file_serializer_.emplace(file_res_);
        return WriteFilePiece();
      }
      reply.status = 500;
      reply.content_type = "text/plain; charset=UTF-8";
      reply.body = "cannot read the file: " + ec.message();
    }
    res_ = {};
    Prepare(res_, version, reply, keep_alive);
    res_.body() = std::move(reply.body);
    res_.prepare_payload();
    http::async_write(stream_, res_,
                      [self = this->shared_from_this()](beast::error_code ec, size_t) {
                        if (ec || !self->res_.keep_alive()) return self->Close();
                        self->WaitForRequest();
                      });
  }

  void WriteFilePiece() {
    beast::get_lowest_layer(stream_).expires_after(Millis(server_->opt.request_timeout_ms));
    http::async_write_some(stream_, *file_serializer_,
                           [self = this->shared_from_this()](beast::error_code ec, size_t) {
                             if (ec) return self->Close();
                             if (!self->file_serializer_->is_done()) {
                               return self->WriteFilePiece();
                             }
                             const bool keep = self->file_res_.keep_alive();
                             self->file_serializer_.reset();
                             self->file_res_ = {};
                             if (!keep) return self->Close();
                             self->WaitForRequest();
                           });
  }

  void Close() {
    beast::error_code ignored;
    beast::get_lowest_layer(stream_).socket().shutdown(tcp::socket::shutdown_both, ignored);
    beast::get_lowest_layer(stream_).close();
  }

  Server::Impl* server_;
  Stream stream_;
  Peer peer_;
  std::string who_;  // what its place in the connection caps is counted under
  beast::flat_buffer buffer_;
  std::optional<http::request_parser<http::string_body>> parser_;
  http::response<http::string_body> res_;
  http::response<http::file_body> file_res_;
  std::optional<http::response_serializer<http::file_body>> file_serializer_;
};

}  // namespace

bool Server::Impl::Admit(const std::string& who) {
  std::lock_guard<std::mutex> lock(mu);
  int& mine = per_peer[who];
  if (connections >= opt.max_connections || mine >= opt.max_connections_per_user) {
    if (mine == 0) per_peer.erase(who);
    return false;
  }
  ++mine;
  ++connections;
  return true;
}

void Server::Impl::Release(const std::string& who) {
  std::lock_guard<std::mutex> lock(mu);
  --connections;
  if (--per_peer[who] <= 0) per_peer.erase(who);
}

std::optional<Peer> Server::Impl::Identify(const tcp::socket& s, const tcp::endpoint& peer,
                                           std::string* who, std::string* why) const {
  beast::error_code ec;
  const tcp::endpoint local = s.local_endpoint(ec);
  if (ec) {
    *why = ec.message();
    return std::nullopt;
  }
  Peer p;
  p.address = peer.address();
  const std::optional<uid_t> uid = LocalPeerUid(local, peer);
  if (uid) {
    *who = "uid " + std::to_string(*uid);
    p.uid = *uid;
    p.local = true;
    return p;
  }
  // Not a socket of this machine: only an administrator's listening address lets such peers in.
  if (!local.address().is_loopback()) {
    *who = peer.address().to_string();
    return p;
  }
  *why = "the owner of the connection cannot be told";
  return std::nullopt;
}

void Server::Impl::Refuse(tcp::socket socket, Refusal refusal, int status,
                          const std::string& why) {
  const uint64_t n = ++refused;
  if (IsPowerOfTwo(n)) {
    ORVANE_LOG(LOG_WARNING, "connection refused: %s (%llu refused so far)", why.c_str(),
               static_cast<unsigned long long>(n));
  }
  // One try without waiting, in plain text even on a TLS port (a client that cannot read it
  // sees the connection closed): a refused client costs an accept, a write and a close.
  const Reply reply = handlers.refuse(refusal, status, why);
  const std::string text =
      "HTTP/1.1 " + std::to_string(status) + " " +
      std::string(http::obsolete_reason(static_cast<http::status>(status))) +
      "\r\nContent-Type: " + reply.content_type +
      "\r\nConnection: close\r\nContent-Length: " + std::to_string(reply.body.size()) +
      "\r\n\r\n" + reply.body;
  beast::error_code ignored;
  socket.non_blocking(true, ignored);
  if (!tls) socket.write_some(asio::buffer(text), ignored);
  socket.close(ignored);
}

template <class Stream>
void Server::Impl::Serve(tcp::socket socket, Peer peer, std::string who) {
  if constexpr (std::is_same_v<Stream, TlsStream>) {
    std::make_shared<Session<TlsStream>>(this, std::move(peer), std::move(who), std::move(socket),
                                         *tls)
        ->Start();
  } else {
    std::make_shared<Session<beast::tcp_stream>>(this, std::move(peer), std::move(who),
                                                 std::move(socket))
        ->Start();
  }
}

void Server::Impl::Accept() {
  acceptor->async_accept(asio::make_strand(ioc), [this](beast::error_code ec, tcp::socket s) {
    if (ec == asio::error::operation_aborted || !acceptor->is_open()) return;
    if (ec) {
      // Out of descriptors, most likely: connections closing will free some.
      ORVANE_LOG(LOG_WARNING, "accept failed: %s", ec.message().c_str());
      retry->expires_after(Millis(100));
      retry->async_wait([this](beast::error_code e) {
        if (!e) Accept();
      });
      return;
    }
    beast::error_code peer_ec;
    const tcp::endpoint peer_end = s.remote_endpoint(peer_ec);
    std::string who;
    std::string why;
    std::optional<Peer> peer;
    if (peer_ec) {
      s.close(peer_ec);
    } else if (!(peer = Identify(s, peer_end, &who, &why))) {
      Refuse(std::move(s), Refusal::kUnknownPeer, 403, why);
    } else if (!Admit(who)) {
      Refuse(std::move(s), Refusal::kTooManyConnections, 429,
             "too many connections (at most " + std::to_string(opt.max_connections) + ", " +
                 std::to_string(opt.max_connections_per_user) + " of " + who +
                 "): close some and try again");
    } else if (tls) {
      Serve<TlsStream>(std::move(s), std::move(*peer), std::move(who));
    } else {
      Serve<beast::tcp_stream>(std::move(s), std::move(*peer), std::move(who));
    }
    Accept();
  });
}

Server::Server(ServerOptions options, Handlers handlers)
    : impl_(std::make_unique<Impl>(std::move(options), std::move(handlers))) {}

Server::~Server() { Stop(); }

void Server::Start() {
  Impl& s = *impl_;
  beast::error_code ec;
  if (!s.opt.tls_certificate.empty()) {
    s.tls.emplace(ssl::context::tls_server);
    s.tls->set_options(ssl::context::default_workarounds | ssl::context::no_sslv2 |
                           ssl::context::no_sslv3 | ssl::context::no_tlsv1 |
                           ssl::context::no_tlsv1_1,
                       ec);
    if (!ec) s.tls->use_certificate_chain_file(s.opt.tls_certificate, ec);
    if (!ec) s.tls->use_private_key_file(s.opt.tls_certificate, ssl::context::pem, ec);
    ORVANE_THROW_IF(ec, kErrInvalidParam,
                    "cannot use the certificate " + s.opt.tls_certificate + ": " + ec.message() +
                        " (give a PEM file holding the certificate chain and its private key)");
  }
  const asio::ip::address address = asio::ip::make_address(s.opt.address, ec);
  ORVANE_THROW_IF(ec, kErrInvalidParam,
                  "\"" + s.opt.address + "\" is not an IP address: give one such as 127.0.0.1");
  const tcp::endpoint endpoint(address, s.opt.port);
  s.acceptor.emplace(s.ioc);
  s.retry.emplace(s.ioc);
  const std::string where = s.opt.address + " port " + std::to_string(s.opt.port);
  s.acceptor->open(endpoint.protocol(), ec);
  if (!ec) s.acceptor->set_option(asio::socket_base::reuse_address(true), ec);
  if (!ec) s.acceptor->bind(endpoint, ec);
  if (!ec) s.acceptor->listen(asio::socket_base::max_listen_connections, ec);
  ORVANE_THROW_IF(ec, kErrSystem,
                  "cannot listen on " + where + ": " + ec.message() +
                      " (another program may hold the port: choose another with --port)");
  s.port = s.acceptor->local_endpoint().port();
  s.Accept();
  for (int i = 0; i < std::max(1, s.opt.threads); ++i) {
    s.threads.emplace_back([&s] { s.ioc.run(); });
  }
}

void Server::Stop() {
  Impl& s = *impl_;
  if (s.threads.empty()) return;
  asio::post(s.ioc, [&s] {
    beast::error_code ignored;
    s.acceptor->close(ignored);
  });
  s.ioc.stop();
  for (std::thread& t : s.threads) t.join();
  s.threads.clear();
}

uint16_t Server::port() const { return impl_->port; }

}  // namespace httpd
}  // namespace orvane
