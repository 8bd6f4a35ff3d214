#include "daemons/searchgw/gateway.hpp"

#include <syslog.h>

#include <algorithm>
#include <atomic>
#include <boost/asio.hpp>
#include <boost/beast/core.hpp>
#include <boost/beast/http.hpp>
#include <chrono>
#include <cstring>
#include <map>
#include <mutex>
#include <optional>
#include <thread>
#include <utility>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/wire.hpp"
#include "daemons/searchgw/peer_uid.hpp"
#include "daemons/searchgw/search_request.hpp"
#include "platform/daemon_sock.hpp"

namespace orvane {
namespace searchgw {
namespace {

namespace asio = boost::asio;
namespace beast = boost::beast;
namespace http = beast::http;
using tcp = asio::ip::tcp;
using Millis = std::chrono::milliseconds;

// A failure answered with an error body instead of hits.
struct Failure {
  http::status status;
  std::string type;
  std::string reason;
};

// Busy answers of the engine tried again, about half a second in all.
constexpr int kBusyAttempts = 30;

bool IsPowerOfTwo(uint64_t n) { return n != 0 && (n & (n - 1)) == 0; }

// The text of a query for the log: long ones cut, so a client cannot fill the log.
std::string ForLog(const std::string& text) {
  return text.size() <= 300 ? text : text.substr(0, 300) + "...";
}

}  // namespace

struct Gateway::Impl {
  explicit Impl(GatewayOptions o) : opt(std::move(o)) {}

  // Counts a connection of `who` (a local user, or a remote address); false when it is one too
  // many in all or for `who`.
  bool Admit(const std::string& who);
  void Release(const std::string& who);
  void Accept();
  // Whose searches a connection asks for: the owner of the peer's socket, root for a peer on
  // another machine; nothing (and why) when that cannot be told. `who` names the asker for the
  // connection caps: local users share one address, so they are counted by uid.
  std::optional<uid_t> Asker(const tcp::socket& s, const tcp::endpoint& peer, std::string* who,
                             std::string* why) const;
  void Refuse(tcp::socket socket, int status, const std::string& type, const std::string& why);
  // The reply body for one search; a Failure when there is none to give.
  std::optional<Failure> Search(uid_t uid, const std::vector<std::string>& ids,
                                const SearchRequest& req,
                                std::string* body);
  // One search request to the engine: its reply's data, or why there is none.
  std::optional<Failure> Engine(uid_t uid, const Json::Value& query,
                                const std::vector<std::string>& ids,
                                int64_t from, int64_t size, Json::Value* data);

  GatewayOptions opt;
  // Declared before the I/O context so that they outlive the connections it destroys.
  std::mutex mu;
  std::map<std::string, int> per_asker;
  int connections = 0;
  std::atomic<uint64_t> refused{0};
  uint16_t port = 0;

  asio::io_context ioc;
  std::optional<tcp::acceptor> acceptor;
  std::optional<asio::steady_timer> retry;
  std::vector<std::thread> threads;
};

namespace {

// One client connection: requests read one after another, each answered before the next is
// read. Lives as long as an operation of it is pending.
class Session : public std::enable_shared_from_this<Session> {
 public:
  Session(Gateway::Impl* gw, tcp::socket socket, asio::ip::address peer, uid_t uid,
          std::string who)
      : gw_(gw), stream_(std::move(socket)), peer_(std::move(peer)), uid_(uid),
        who_(std::move(who)) {}
  ~Session() { gw_->Release(who_); }

  void WaitForRequest() {
    parser_.emplace();
    parser_->header_limit(static_cast<uint32_t>(gw_->opt.max_header_bytes));
    parser_->body_limit(gw_->opt.max_body_bytes);
    if (buffer_.size() > 0) return ReadRest();
    // An idle keep-alive connection may wait long for its next request; once a byte has come,
    // the whole request must follow within the shorter time, so dripping bytes buys nothing.
    stream_.expires_after(Millis(gw_->opt.idle_timeout_ms));
    stream_.async_read_some(buffer_.prepare(1024),
                            [self = shared_from_this()](beast::error_code ec, size_t n) {
                              if (ec) return self->Close();
                              self->buffer_.commit(n);
                              self->ReadRest();
                            });
  }

 private:
  void ReadRest() {
    stream_.expires_after(Millis(gw_->opt.request_timeout_ms));
    http::async_read(
        stream_, buffer_, *parser_,
        [self = shared_from_this()](beast::error_code ec, size_t) { self->OnRead(ec); });
  }

  void OnRead(beast::error_code ec) {
    if (!ec) return Handle();
    if (ec.category() != http::make_error_code(http::error::bad_target).category() ||
        ec == http::error::end_of_stream || ec == http::error::partial_message) {
      return Close();  // gone, timed out or cut short: nobody to answer
    }
    Failure f{http::status::bad_request, "http_parse_exception",
              "malformed HTTP request: " + ec.message()};
    if (ec == http::error::header_limit) {
      f = {http::status::request_header_fields_too_large, "http_parse_exception",
           "the request's header is longer than " + std::to_string(gw_->opt.max_header_bytes) +
               " bytes"};
    } else if (ec == http::error::body_limit) {
      f = {http::status::payload_too_large, "http_parse_exception",
           "the request's body is longer than " + std::to_string(gw_->opt.max_body_bytes) +
               " bytes"};
    }
    ORVANE_LOG(LOG_WARNING, "request from %s refused: %s", peer_.to_string().c_str(),
               f.reason.c_str());
    Reply(11, f.status, BuildErrorBody(f.type, f.reason, static_cast<int>(f.status)), false);
  }

  void Handle() {
    const http::request<http::string_body>& req = parser_->get();
    std::string target(req.target());
    target = target.substr(0, target.find('?'));
    std::string body;
    std::optional<Failure> failure;
    const size_t slash = target.find('/', 1);
    if (target.size() < 2 || target[0] != '/' || slash == std::string::npos ||
        target.compare(slash, std::string::npos, "/_search") != 0) {
      failure = Failure{http::status::not_found, "no_handler_found_exception",
                        "no handler for " + std::string(req.method_string()) + " " + target +
                            ": the gateway answers POST /INDEX/_search"};
    } else if (req.method() != http::verb::post && req.method() != http::verb::get) {
      failure = Failure{http::status::method_not_allowed, "method_not_allowed_exception",
                        "_search takes POST or GET, not " + std::string(req.method_string())};
    } else {
      try {
        const std::vector<std::string> ids = ReadIndexList(target.substr(1, slash - 1));
        const SearchRequest search = ReadSearchBody(req.body());
        failure = gw_->Search(uid_, ids, search, &body);
      } catch (const RequestError& e) {
        failure = Failure{http::status::bad_request, e.type(), e.what()};
      }
    }
    if (failure) {
      ORVANE_LOG(LOG_WARNING, "search from %s refused (%d %s): %s; body: %s",
                 peer_.to_string().c_str(), static_cast<int>(failure->status),
                 failure->type.c_str(), failure->reason.c_str(), ForLog(req.body()).c_str());
      body = BuildErrorBody(failure->type, failure->reason, static_cast<int>(failure->status));
    }
    Reply(req.version(), failure ? failure->status : http::status::ok, std::move(body),
          req.keep_alive());
  }

  void Reply(unsigned version, http::status status, std::string body, bool keep_alive) {
    res_ = {};
    res_.version(version == 11 || version == 10 ? version : 11);
    res_.result(status);
    res_.set(http::field::content_type, "application/json; charset=UTF-8");
    res_.keep_alive(keep_alive);
    res_.body() = std::move(body);
    res_.prepare_payload();
    stream_.expires_after(Millis(gw_->opt.request_timeout_ms));
    http::async_write(stream_, res_, [self = shared_from_this()](beast::error_code ec, size_t) {
      if (ec || !self->res_.keep_alive()) return self->Close();
      self->WaitForRequest();
    });
  }

  void Close() {
    beast::error_code ignored;
    stream_.socket().shutdown(tcp::socket::shutdown_both, ignored);
    stream_.close();
  }

  Gateway::Impl* gw_;
  beast::tcp_stream stream_;
  asio::ip::address peer_;
  uid_t uid_;  // whose view of the index its searches get
  std::string who_;  // what its place in the connection caps is counted under
  beast::flat_buffer buffer_;
  std::optional<http::request_parser<http::string_body>> parser_;
  http::response<http::string_body> res_;
};

}  // namespace

bool Gateway::Impl::Admit(const std::string& who) {
  std::lock_guard<std::mutex> lock(mu);
  int& mine = per_asker[who];
  if (connections >= opt.max_connections || mine >= opt.max_connections_per_user) {
    if (mine == 0) per_asker.erase(who);
    return false;
  }
  ++mine;
  ++connections;
  return true;
}

void Gateway::Impl::Release(const std::string& who) {
  std::lock_guard<std::mutex> lock(mu);
  --connections;
  if (--per_asker[who] <= 0) per_asker.erase(who);
}

std::optional<uid_t> Gateway::Impl::Asker(const tcp::socket& s, const tcp::endpoint& peer,
                                          std::string* who, std::string* why) const {
  beast::error_code ec;
  const tcp::endpoint local = s.local_endpoint(ec);
  if (ec) {
    *why = ec.message();
    return std::nullopt;
  }
  const std::optional<uid_t> uid = LocalPeerUid(local, peer);
  if (uid) {
    *who = "uid " + std::to_string(*uid);
    return uid;
  }
  // Not a socket of this machine: only an administrator's listening address lets such peers in,
  // and they search as the file server's own service does.
  if (!local.address().is_loopback()) {
    *who = peer.address().to_string();
    return 0;
  }
  *why = "the owner of the connection cannot be told";
  return std::nullopt;
}

void Gateway::Impl::Refuse(tcp::socket socket, int status, const std::string& type,
                           const std::string& why) {
  const uint64_t n = ++refused;
  if (IsPowerOfTwo(n)) {
    ORVANE_LOG(LOG_WARNING, "connection refused: %s (%llu refused so far)", why.c_str(),
               static_cast<unsigned long long>(n));
  }
  // One try without waiting: a refused client costs an accept, a write and a close.
  const std::string body = BuildErrorBody(type, why, status);
  const std::string text =
      "HTTP/1.1 " + std::to_string(status) + " " +
      std::string(http::obsolete_reason(static_cast<http::status>(status))) +
      "\r\nContent-Type: application/json\r\nConnection: close\r\nContent-Length: " +
      std::to_string(body.size()) + "\r\n\r\n" + body;
  beast::error_code ignored;
  socket.non_blocking(true, ignored);
  socket.write_some(asio::buffer(text), ignored);
  socket.close(ignored);
}

void Gateway::Impl::Accept() {
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
    const asio::ip::address peer = peer_end.address();
    std::string who;
    std::string why;
    std::optional<uid_t> uid;
    if (peer_ec) {
      s.close(peer_ec);
    } else if (!(uid = Asker(s, peer_end, &who, &why))) {
      Refuse(std::move(s), 403, "security_exception", why);
    } else if (!Admit(who)) {
      Refuse(std::move(s), 429, "es_rejected_execution_exception",
             "too many connections (at most " + std::to_string(opt.max_connections) + ", " +
                 std::to_string(opt.max_connections_per_user) + " of " + who +
                 "): close some and try again");
    } else {
      std::make_shared<Session>(this, std::move(s), peer, *uid, std::move(who))->WaitForRequest();
    }
    Accept();
  });
}

std::optional<Failure> Gateway::Impl::Engine(uid_t uid, const Json::Value& query,
                                             const std::vector<std::string>& ids, int64_t from,
                                             int64_t size, Json::Value* data) {
  Json::Value request(Json::objectValue);
  request["command"] = "search";
  Json::Value& d = request["data"];
  d["query"] = query;
  d["from"] = Json::Int64(from);
  d["size"] = Json::Int64(size);
  for (const std::string& id : ids) d["id"].append(id);
  const Failure down{
      http::status::service_unavailable, "unavailable_shards_exception",
      "the search engine at " + opt.engine_socket + " does not answer: is quixelasticd running?"};
  const std::string request_text = JsonToString(request);
  Json::Value reply;
  // The engine counts a search as running until its connection is done with, a moment after
  // the answer came: searches one after another may meet the count of the one before, so a
  // busy answer is tried again for a short while before the client is told.
  for (int attempt = 1;; ++attempt) {
    quixdaemon::DomainSockConnection conn(opt.engine_socket);
    conn.SetTimeouts(opt.engine_timeout_ms, opt.engine_timeout_ms);
    std::string text;
    bool connected;
    {
      // The engine judges each hit by the credentials the connection was made with.
      const ThreadCredentials as(uid);
      if (!as.ok()) {
        ORVANE_LOG(LOG_ERR, "cannot search as uid %u: %m", static_cast<unsigned>(uid));
        return Failure{http::status::forbidden, "security_exception",
                       "cannot search as uid " + std::to_string(uid)};
      }
      connected = conn.Connect(opt.engine_timeout_ms);
    }
    if (!connected || !conn.Send(request_text) || !conn.Recv(text)) {
      ORVANE_LOG(LOG_ERR, "search engine at %s: %s", opt.engine_socket.c_str(),
                 std::strerror(errno));
      return down;
    }
    std::string errors;
    Json::CharReaderBuilder builder;
    const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    const std::string_view payload = wire::PayloadText(text);
    if (!reader->parse(payload.data(), payload.data() + payload.size(), &reply, &errors) ||
        !reply.isObject()) {
      ORVANE_LOG(LOG_ERR, "search engine at %s answered something that is not JSON",
                 opt.engine_socket.c_str());
      return down;
    }
    if (reply["success"].asBool() || reply["error"]["code"].asInt() != kCodeOverloaded ||
        attempt == kBusyAttempts) {
      break;
    }
    Env::Current()->SleepMicros(std::min(attempt, 10) * 2000);
  }
  if (reply["success"].asBool()) {
    *data = std::move(reply["data"]);
    if (!(*data)["hits"].isArray()) (*data)["hits"] = Json::Value(Json::arrayValue);
    return std::nullopt;
  }
  const int code = reply["error"]["code"].asInt();
  const std::string msg = reply["error"]["msg"].asString();
  switch (code) {
    case kCodeIndexNotFound:
      return Failure{http::status::bad_request, "index_not_found_exception", msg};
    case kCodeMalformed:
    case kCodeInvalidParam:
      return Failure{http::status::bad_request, "query_shard_exception", msg};
    case kCodeOutOfMemory:
    case kCodeOverloaded:
      return Failure{http::status::too_many_requests, "es_rejected_execution_exception", msg};
    default:
      return Failure{http::status::service_unavailable, "unavailable_shards_exception",
                     "the search engine answered " + std::to_string(code) + ": " + msg};
  }
}

std::optional<Failure> Gateway::Impl::Search(uid_t uid, const std::vector<std::string>& ids,
                                             const SearchRequest& req, std::string* body) {
  Json::Value data;
  std::optional<Failure> failure;
  if (req.scope.empty()) {
    failure = Engine(uid, req.query, ids, req.from, req.size, &data);
    if (!failure) *body = BuildSearchReply(data);
    return failure;
  }
  // The scope folder matches its own scope; it is taken out of the hits and of the total. The
  // pages before this one are read too, so that where it falls shifts no page.
  auto is_scope = [&](const Json::Value& hit) { return hit["path"].asString() == req.scope; };
  const bool whole = req.from + req.size + 1 <= kMaxPageSize;
  const int64_t from = whole ? 0 : req.from;
  failure = Engine(uid, req.query, ids, from, req.from + req.size + 1 - from, &data);
  if (failure) return failure;
  Json::Value& hits = data["hits"];
  bool found = false;
  Json::Value kept(Json::arrayValue);
  for (Json::Value& hit : hits) {
    if (is_scope(hit)) {
      found = true;
    } else {
      kept.append(std::move(hit));
    }
  }
  int64_t total = data["total"].asInt64();
  if (!found && total > static_cast<int64_t>(hits.size())) {
    // Past the hits read: the folder's own name, within the scope, finds it if it is there.
    Json::Value check(Json::objectValue);
    const std::string name = req.scope.substr(req.scope.rfind('/') + 1);
    if (!name.empty() && name.find('*') == std::string::npos) {
      check["and"].append(req.query);
      Json::Value match(Json::objectValue);
      match["match"] = "name";
      match["pattern"] = name;
      check["and"].append(match);
      Json::Value named;
      failure = Engine(uid, check, ids, 0, kMaxPageSize, &named);
      if (failure) return failure;
      for (const Json::Value& hit : named["hits"]) found = found || is_scope(hit);
    }
  }
  if (found) --total;
  Json::Value page(Json::arrayValue);
  const int64_t skip = whole ? req.from : 0;
  for (Json::ArrayIndex i = 0; i < kept.size(); ++i) {
    if (static_cast<int64_t>(i) >= skip && static_cast<int64_t>(page.size()) < req.size) {
      page.append(kept[i]);
    }
  }
  data["hits"] = std::move(page);
  data["total"] = Json::Int64(std::max<int64_t>(total, 0));
  *body = BuildSearchReply(data);
  return std::nullopt;
}

Gateway::Gateway(GatewayOptions options) : impl_(std::make_unique<Impl>(std::move(options))) {}

Gateway::~Gateway() { Stop(); }

void Gateway::Start() {
  Impl& g = *impl_;
  beast::error_code ec;
  const asio::ip::address address = asio::ip::make_address(g.opt.address, ec);
  ORVANE_THROW_IF(ec, kErrInvalidParam,
                  "\"" + g.opt.address + "\" is not an IP address: give one such as 127.0.0.1");
  const tcp::endpoint endpoint(address, g.opt.port);
  g.acceptor.emplace(g.ioc);
  g.retry.emplace(g.ioc);
  const std::string where = g.opt.address + " port " + std::to_string(g.opt.port);
  g.acceptor->open(endpoint.protocol(), ec);
  if (!ec) g.acceptor->set_option(asio::socket_base::reuse_address(true), ec);
  if (!ec) g.acceptor->bind(endpoint, ec);
  if (!ec) g.acceptor->listen(asio::socket_base::max_listen_connections, ec);
  ORVANE_THROW_IF(ec, kErrSystem,
                  "cannot listen on " + where + ": " + ec.message() +
                      " (another program may hold the port: choose another with --port)");
  g.port = g.acceptor->local_endpoint().port();
  g.Accept();
  for (int i = 0; i < std::max(1, g.opt.threads); ++i) {
    g.threads.emplace_back([&g] { g.ioc.run(); });
  }
}

void Gateway::Stop() {
  Impl& g = *impl_;
  if (g.threads.empty()) return;
  asio::post(g.ioc, [&g] {
    beast::error_code ignored;
    g.acceptor->close(ignored);
  });
  g.ioc.stop();
  for (std::thread& t : g.threads) t.join();
  g.threads.clear();
}

uint16_t Gateway::port() const { return impl_->port; }

}  // namespace searchgw
}  // namespace orvane
