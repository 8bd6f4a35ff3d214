#include "daemons/searchgw/gateway.hpp"

#include <pwd.h>
#include <syslog.h>

#include <algorithm>
#include <boost/beast/core.hpp>
#include <boost/beast/http.hpp>
#include <cstring>
#include <optional>
#include <utility>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/wire.hpp"
#include "daemons/http/peer_uid.hpp"
#include "daemons/http/server.hpp"
#include "daemons/searchgw/search_request.hpp"
#include "platform/daemon_sock.hpp"

namespace orvane {
namespace searchgw {
namespace {

namespace beast = boost::beast;
namespace http = beast::http;

// A failure answered with an error body instead of hits.
struct Failure {
  http::status status;
  std::string type;
  std::string reason;
};

// Busy answers of the engine tried again, about half a second in all.
constexpr int kBusyAttempts = 30;

// True when `uid` is a user of this system. The file server's search service acts as the
// signed-in user, who always is one; an owner without a name is no one the gateway answers for.
bool IsKnownUser(uid_t uid) {
  std::vector<char> buf(16384);
  passwd pw;
  passwd* found = nullptr;
  return ::getpwuid_r(uid, &pw, buf.data(), buf.size(), &found) == 0 && found != nullptr;
}

// The text of a query for the log: long ones cut, so a client cannot fill the log.
std::string ForLog(const std::string& text) {
  return text.size() <= 300 ? text : text.substr(0, 300) + "...";
}

}  // namespace

struct Gateway::Impl {
  explicit Impl(GatewayOptions o) : opt(std::move(o)) {}

  // Answers one request of `peer`: whose searches they are is the owner of the peer's socket,
  // root for a peer on another machine.
  httpd::Reply Handle(const httpd::Request& req, const httpd::Peer& peer);
  // The reply body for one search; a Failure when there is none to give.
  std::optional<Failure> Search(uid_t uid, const std::vector<std::string>& ids,
                                const SearchRequest& req,
                                std::string* body);
  // One search request to the engine: its reply's data, or why there is none.
  std::optional<Failure> Engine(uid_t uid, const Json::Value& query,
                                const std::vector<std::string>& ids,
                                int64_t from, int64_t size, Json::Value* data);

  GatewayOptions opt;
  std::optional<httpd::Server> server;
};

namespace {

httpd::Reply ErrorReply(http::status status, const std::string& type, const std::string& reason) {
  httpd::Reply reply;
  reply.status = static_cast<int>(status);
  reply.body = BuildErrorBody(type, reason, reply.status);
  return reply;
}

// The refusals the listener answers itself, in the kinds the file server expects.
httpd::Reply RefusalReply(httpd::Refusal refusal, int status, const std::string& reason) {
  const char* type = "http_parse_exception";
  if (refusal == httpd::Refusal::kUnknownPeer) type = "security_exception";
  if (refusal == httpd::Refusal::kTooManyConnections) type = "es_rejected_execution_exception";
  return ErrorReply(static_cast<http::status>(status), type, reason);
}

}  // namespace

httpd::Reply Gateway::Impl::Handle(const httpd::Request& req, const httpd::Peer& peer) {
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
      if (peer.local && !IsKnownUser(peer.uid)) {
        throw RequestError("security_exception",
                           "the connection's owner, uid " + std::to_string(peer.uid) +
                               ", is no user of this system: searches are answered for its users");
      }
      const std::vector<std::string> ids = ReadIndexList(target.substr(1, slash - 1));
      const SearchRequest search = ReadSearchBody(req.body());
      // Peers on other machines (only when an administrator gives another address) search as
      // the file server's own service does.
      failure = Search(peer.local ? peer.uid : 0, ids, search, &body);
    } catch (const RequestError& e) {
      const bool denied = e.type() == "security_exception";
      failure = Failure{denied ? http::status::forbidden : http::status::bad_request, e.type(),
                        e.what()};
    }
  }
  if (failure) {
    ORVANE_LOG(LOG_WARNING, "search from %s refused (%d %s): %s; body: %s",
               peer.address.to_string().c_str(), static_cast<int>(failure->status),
               failure->type.c_str(), failure->reason.c_str(), ForLog(req.body()).c_str());
    return ErrorReply(failure->status, failure->type, failure->reason);
  }
  httpd::Reply reply;
  reply.body = std::move(body);
  return reply;
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
      const httpd::ThreadCredentials as(uid);
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
    case kCodePermissionDenied:
      return Failure{http::status::forbidden, "security_exception", msg};
    case kCodeOutOfMemory:
    case kCodeOverloaded:
      return Failure{http::status::too_many_requests, "es_rejected_execution_exception", msg};
    case kCodeSearchTooLong:
      return Failure{http::status::gateway_timeout, "search_timeout_exception", msg};
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
  httpd::ServerOptions o;
  o.address = impl_->opt.address;
  o.port = impl_->opt.port;
  o.threads = impl_->opt.threads;
  o.max_connections = impl_->opt.max_connections;
  o.max_connections_per_user = impl_->opt.max_connections_per_user;
  o.idle_timeout_ms = impl_->opt.idle_timeout_ms;
  o.request_timeout_ms = impl_->opt.request_timeout_ms;
  o.max_header_bytes = impl_->opt.max_header_bytes;
  o.max_body_bytes = impl_->opt.max_body_bytes;
  Impl* g = impl_.get();
  impl_->server.emplace(
      std::move(o),
      httpd::Handlers{[g](const httpd::Request& req, const httpd::Peer& peer) {
                        return g->Handle(req, peer);
                      },
                      RefusalReply});
  impl_->server->Start();
}

void Gateway::Stop() {
  if (impl_->server) impl_->server->Stop();
}

uint16_t Gateway::port() const { return impl_->server ? impl_->server->port() : 0; }

}  // namespace searchgw
}  // namespace orvane
