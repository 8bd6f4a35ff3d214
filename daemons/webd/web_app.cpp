#include "daemons/webd/web_app.hpp"

#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <climits>
#include <optional>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/wire.hpp"
#include "daemons/http/peer_uid.hpp"
#include "fileindex/index_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"
#include "platform/config.hpp"
#include "platform/daemon_sock.hpp"
#include "platform/user.hpp"

namespace orvane {
namespace webd {
namespace {

namespace http = boost::beast::http;

constexpr char kCookie[] = "fi_session";
constexpr int kMaxPage = 100;
// Busy answers of the engine tried again, about half a second in all.
constexpr int kBusyAttempts = 30;

// A request answered with an error: the status and words for the person at the page.
struct ApiError {
  int status;
  std::string message;
};

httpd::Reply JsonReply(int status, const Json::Value& value) {
  httpd::Reply reply;
  reply.status = status;
  reply.body = JsonToString(value);
  reply.headers.emplace_back("Cache-Control", "no-store");
  return reply;
}

httpd::Reply ErrorReply(int status, const std::string& message) {
  Json::Value body(Json::objectValue);
  body["error"]["status"] = status;
  body["error"]["message"] = message;
  return JsonReply(status, body);
}

std::string UrlDecode(const std::string& text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '+') {
      out += ' ';
    } else if (c == '%' && i + 2 < text.size() && std::isxdigit(text[i + 1]) &&
               std::isxdigit(text[i + 2])) {
      out += static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, 16));
      i += 2;
    } else {
      out += c;
    }
  }
  return out;
}

std::map<std::string, std::string> QueryParams(const std::string& query) {
  std::map<std::string, std::string> params;
  std::stringstream in(query);
  std::string pair;
  while (std::getline(in, pair, '&')) {
    const size_t eq = pair.find('=');
    if (eq == std::string::npos) {
      params[UrlDecode(pair)] = "";
    } else {
      params[UrlDecode(pair.substr(0, eq))] = UrlDecode(pair.substr(eq + 1));
    }
  }
  return params;
}

// A percent-encoded file name for Content-Disposition's filename* (every byte but the safe ones).
std::string PercentEncode(const std::string& text) {
  static const char kHex[] = "0123456789ABCDEF";
  std::string out;
  for (unsigned char c : text) {
    if (std::isalnum(c) || c == '.' || c == '-' || c == '_') {
      out += static_cast<char>(c);
    } else {
      out += '%';
      out += kHex[c >> 4];
      out += kHex[c & 15];
    }
  }
  return out;
}

std::string ContentTypeOf(const std::string& name) {
  static const std::map<std::string, std::string> kTypes = {
      {"txt", "text/plain; charset=UTF-8"}, {"md", "text/plain; charset=UTF-8"},
      {"csv", "text/csv"}, {"html", "text/html"}, {"htm", "text/html"},
      {"pdf", "application/pdf"}, {"json", "application/json"}, {"xml", "application/xml"},
      {"zip", "application/zip"}, {"gz", "application/gzip"},
      {"doc", "application/msword"},
      {"docx", "application/vnd.openxmlformats-officedocument.wordprocessingml.document"},
      {"xlsx", "application/vnd.openxmlformats-officedocument.spreadsheetml.sheet"},
      {"pptx", "application/vnd.openxmlformats-officedocument.presentationml.presentation"},
      {"odt", "application/vnd.oasis.opendocument.text"},
      {"ods", "application/vnd.oasis.opendocument.spreadsheet"},
      {"jpg", "image/jpeg"}, {"jpeg", "image/jpeg"}, {"png", "image/png"}, {"gif", "image/gif"},
      {"webp", "image/webp"}, {"svg", "image/svg+xml"}, {"mp3", "audio/mpeg"},
      {"flac", "audio/flac"}, {"ogg", "audio/ogg"}, {"wav", "audio/wav"},
      {"mp4", "video/mp4"}, {"mkv", "video/x-matroska"}, {"webm", "video/webm"}};
  const size_t dot = name.rfind('.');
  if (dot == std::string::npos) return "application/octet-stream";
  std::string ext = name.substr(dot + 1);
  std::transform(ext.begin(), ext.end(), ext.begin(), ::tolower);
  const auto it = kTypes.find(ext);
  return it == kTypes.end() ? "application/octet-stream" : it->second;
}

std::string Cookie(const httpd::Request& req) {
  const std::string header(req[http::field::cookie]);
  const std::string key = std::string(kCookie) + "=";
  for (size_t pos = 0; pos < header.size();) {
    while (pos < header.size() && (header[pos] == ' ' || header[pos] == ';')) ++pos;
    const size_t end = std::min(header.find(';', pos), header.size());
    if (header.compare(pos, key.size(), key) == 0) {
      return header.substr(pos + key.size(), end - pos - key.size());
    }
    pos = end;
  }
  return "";
}

// An absolute path of plain components: no "." or "..", no empty component, no NUL.
bool IsPlainAbsolute(const std::string& path) {
  if (path.empty() || path[0] != '/' || path.find('\0') != std::string::npos) return false;
  if (path == "/") return true;
  std::stringstream in(path.substr(1));
  std::string part;
  size_t parts = 0;
  while (std::getline(in, part, '/')) {
    ++parts;
    if (part.empty() || part == "." || part == "..") return false;
  }
  return parts > 0 && path.back() != '/';
}

bool IsUnder(const std::string& path, const std::string& folder) {
  return path == folder ||
         (path.size() > folder.size() && path.compare(0, folder.size(), folder) == 0 &&
          (folder == "/" || path[folder.size()] == '/'));
}

int64_t NumberParam(const std::map<std::string, std::string>& params, const std::string& key,
                    int64_t min, int64_t max, int64_t fallback) {
  const auto it = params.find(key);
  if (it == params.end() || it->second.empty()) return fallback;
  char* end = nullptr;
  errno = 0;
  const long long v = std::strtoll(it->second.c_str(), &end, 10);
  if (errno != 0 || *end != '\0' || v < min || v > max) {
    throw ApiError{400, "\"" + key + "\" must be a whole number from " + std::to_string(min) +
                            " to " + std::to_string(max)};
  }
  return v;
}

Json::Value ParseBody(const httpd::Request& req) {
  const std::string type(req[http::field::content_type]);
  // A form another site posts cannot carry this type without the browser asking us first.
  if (type.compare(0, 16, "application/json") != 0) {
    throw ApiError{415, "send the body as application/json"};
  }
  Json::Value body;
  std::string errors;
  if (!JsonParseChecked(req.body(), &body, &errors) || !body.isObject()) {
    throw ApiError{400, "the body is not a JSON object"};
  }
  return body;
}

}  // namespace

struct WebApp::Call {
  const httpd::Request& req;
  const httpd::Peer& peer;
  std::string path;
  std::map<std::string, std::string> params;
  std::optional<WebSession> session;
};

WebApp::WebApp(WebOptions options)
    : opt_(std::move(options)),
      sessions_(opt_.session_idle_seconds * 1000000, opt_.session_life_seconds * 1000000, 10000),
      limiter_(opt_.login_failures_per_address, opt_.login_failures_per_account,
               opt_.login_window_seconds * 1000000) {
  const std::map<std::string, std::string> kTypes = {
      {"html", "text/html; charset=UTF-8"}, {"js", "text/javascript; charset=UTF-8"},
      {"css", "text/css; charset=UTF-8"}, {"svg", "image/svg+xml"}, {"png", "image/png"}};
  DIR* dir = ::opendir(opt_.www_dir.c_str());
  ORVANE_THROW_IF(dir == nullptr, kErrSystem,
                  "cannot read the page's files in " + opt_.www_dir + ": " + std::strerror(errno) +
                      " (give their folder with --www)");
  const std::unique_ptr<DIR, int (*)(DIR*)> closer(dir, ::closedir);
  while (const dirent* e = ::readdir(dir)) {
    const std::string name = e->d_name;
    const size_t dot = name.rfind('.');
    if (name[0] == '.' || dot == std::string::npos) continue;
    const auto type = kTypes.find(name.substr(dot + 1));
    if (type == kTypes.end()) continue;
    std::ifstream in(opt_.www_dir + "/" + name, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    files_[name] = {type->second, text.str()};
  }
  ORVANE_THROW_IF(files_.count("index.html") == 0, kErrSystem,
                  "no index.html in " + opt_.www_dir + " (give the page's folder with --www)");
}

httpd::Reply WebApp::Refused(httpd::Refusal, int status, const std::string& reason) {
  return ErrorReply(status, reason);
}

httpd::Reply WebApp::Handle(const httpd::Request& req, const httpd::Peer& peer) {
  std::string target(req.target());
  const size_t question = target.find('?');
  Call call{req, peer, target.substr(0, question), {}, std::nullopt};
  if (question != std::string::npos) call.params = QueryParams(target.substr(question + 1));
  httpd::Reply reply;
  if (call.path.compare(0, 5, "/api/") == 0) {
    try {
      reply = Api(call);
    } catch (const ApiError& e) {
      reply = ErrorReply(e.status, e.message);
    } catch (const Error& e) {
      // The library's refusals (a folder already indexed, an unknown path, ...) say what to do.
      reply = ErrorReply(400, e.message);
    } catch (const std::exception& e) {
      ORVANE_LOG(LOG_ERR, "%s %s: %s", std::string(req.method_string()).c_str(),
                 call.path.c_str(), e.what());
      reply = ErrorReply(500, std::string("internal error: ") + e.what());
    }
  } else {
    const std::string name = call.path == "/" ? "index.html" : call.path.substr(1);
    const auto it = files_.find(name);
    if (req.method() != http::verb::get && req.method() != http::verb::head) {
      reply = ErrorReply(405, "the page's files take GET");
      reply.headers.emplace_back("Allow", "GET, HEAD");
    } else if (it == files_.end()) {
      reply = ErrorReply(404, "no such page: " + call.path);
    } else {
      reply.content_type = it->second.first;
      reply.body = it->second.second;
      reply.headers.emplace_back("Cache-Control", "no-cache");
    }
  }
  // The page runs only its own files and cannot be framed by another site.
  reply.headers.emplace_back("Content-Security-Policy",
                             "default-src 'self'; img-src 'self' data:; frame-ancestors 'none'; "
                             "form-action 'self'; base-uri 'none'");
  reply.headers.emplace_back("X-Content-Type-Options", "nosniff");
  reply.headers.emplace_back("Referrer-Policy", "no-referrer");
  reply.headers.emplace_back("X-Frame-Options", "DENY");
  return reply;
}

httpd::Reply WebApp::Api(Call& call) {
  const http::verb method = call.req.method();
  if (call.path == "/api/login") {
    if (method != http::verb::post) throw ApiError{405, "/api/login takes POST"};
    return Login(call);
  }
  const std::string token = Cookie(call.req);
  if (!token.empty()) call.session = sessions_.Find(token);
  if (call.path == "/api/session" && method == http::verb::get) {
    if (!call.session) throw ApiError{401, "not signed in"};
    Json::Value me(Json::objectValue);
    me["user"] = call.session->user;
    me["admin"] = call.session->admin;
    me["csrf"] = call.session->csrf;
    return JsonReply(200, me);
  }
  if (!call.session) throw ApiError{401, "sign in first (or again: the session has ended)"};
  if (method != http::verb::get && method != http::verb::head) {
    const std::string sent(call.req["X-CSRF-Token"]);
    if (sent.empty() || sent != call.session->csrf) {
      throw ApiError{403, "the change carries no valid X-CSRF-Token: reload the page"};
    }
  }
  auto only = [&](http::verb wanted) {
    if (method != wanted) {
      throw ApiError{405, call.path + " takes " + std::string(http::to_string(wanted))};
    }
  };
  if (call.path == "/api/logout") {
    only(http::verb::post);
    sessions_.Remove(token);
    httpd::Reply reply = JsonReply(200, Json::Value(Json::objectValue));
    reply.headers.emplace_back("Set-Cookie", std::string(kCookie) +
                                                 "=; Path=/; Max-Age=0; HttpOnly; SameSite=Strict");
    return reply;
  }
  if (call.path == "/api/search") {
    only(http::verb::get);
    return Search(call);
  }
  if (call.path == "/api/suggest") {
    only(http::verb::get);
    return Suggest(call);
  }
  if (call.path == "/api/download") {
    only(http::verb::get);
    return Download(call);
  }
  if (call.path.compare(0, 11, "/api/admin/") == 0) {
    if (!call.session->admin) {
      throw ApiError{403, "only members of the administrators group may do this"};
    }
    return Admin(call, call.path.substr(11));
  }
  throw ApiError{404, "no such call: " + call.path};
}

httpd::Reply WebApp::Login(Call& call) {
  const Json::Value body = ParseBody(call.req);
  const std::string user = body["user"].isString() ? body["user"].asString() : "";
  const std::string password = body["password"].isString() ? body["password"].asString() : "";
  if (user.empty() || user.size() > 256 || password.size() > 1024 ||
      user.find_first_of(std::string("\0/:", 3)) != std::string::npos) {
    throw ApiError{400, "give \"user\" and \"password\""};
  }
  const std::string address = call.peer.address.to_string();
  const int64_t wait = limiter_.WaitSeconds(address, user);
  if (wait > 0) {
    ORVANE_LOG(LOG_WARNING, "sign-in of %s from %s refused: too many failures", user.c_str(),
               address.c_str());
    httpd::Reply reply =
        ErrorReply(429, "too many failed sign-ins: try again in " + std::to_string(wait) + " s");
    reply.headers.emplace_back("Retry-After", std::to_string(wait));
    return reply;
  }
  std::string why;
  struct passwd pw;
  struct passwd* found = nullptr;
  std::vector<char> buf(16384);
  if (!PamAuthenticate(opt_.pam, user, password, &why) ||
      ::getpwnam_r(user.c_str(), &pw, buf.data(), buf.size(), &found) != 0 || found == nullptr) {
    limiter_.Failed(address, user);
    ORVANE_LOG(LOG_NOTICE, "sign-in of %s from %s failed: %s", user.c_str(), address.c_str(),
               why.c_str());
    throw ApiError{401, "wrong user name or password"};
  }
  limiter_.Succeeded(user);
  const bool admin = pw.pw_uid == 0 || platform::QLIBGroupIsAdminGroupMem(user.c_str(), 0) == 1;
  const WebSession s = sessions_.Create(user, pw.pw_uid, admin);
  ORVANE_LOG(LOG_INFO, "%s signed in from %s%s", user.c_str(), address.c_str(),
             admin ? " (administrator)" : "");
  Json::Value me(Json::objectValue);
  me["user"] = user;
  me["admin"] = admin;
  me["csrf"] = s.csrf;
  httpd::Reply reply = JsonReply(200, me);
  reply.headers.emplace_back("Set-Cookie", std::string(kCookie) + "=" + s.token +
                                               "; Path=/; HttpOnly; SameSite=Strict" +
                                               (opt_.secure_cookie ? "; Secure" : ""));
  return reply;
}

Json::Value WebApp::AskEngine(uid_t uid, const std::string& command, const Json::Value& data) {
  Json::Value request(Json::objectValue);
  request["command"] = command;
  request["data"] = data;
  const std::string text = JsonToString(request);
  const ApiError down{503, "the search engine does not answer: ask an administrator to start "
                           "quixelasticd"};
  Json::Value reply;
  for (int attempt = 1;; ++attempt) {
    quixdaemon::DomainSockConnection conn(opt_.engine_socket);
    conn.SetTimeouts(opt_.engine_timeout_ms, opt_.engine_timeout_ms);
    bool connected;
    {
      // The engine shows each caller what that caller may open, told by the connection's
      // credentials.
      const httpd::ThreadCredentials as(uid);
      if (!as.ok()) throw ApiError{500, "cannot search as uid " + std::to_string(uid)};
      connected = conn.Connect(opt_.engine_timeout_ms);
    }
    std::string answer;
    if (!connected || !conn.Send(text) || !conn.Recv(answer)) {
      ORVANE_LOG(LOG_ERR, "search engine at %s: %s", opt_.engine_socket.c_str(),
                 std::strerror(errno));
      throw down;
    }
    std::string errors;
    const std::string_view payload = wire::PayloadText(answer);
    if (!JsonParseChecked(std::string(payload), &reply, &errors) || !reply.isObject()) throw down;
    if (reply["success"].asBool() || reply["error"]["code"].asInt() != kCodeOverloaded ||
        attempt == kBusyAttempts) {
      break;
    }
    Env::Current()->SleepMicros(std::min(attempt, 10) * 2000);
  }
  if (reply["success"].asBool()) return reply["data"];
  const int code = reply["error"]["code"].asInt();
  const std::string msg = reply["error"]["msg"].asString();
  if (code == kCodeOverloaded || code == kCodeOutOfMemory) {
    throw ApiError{429, "the search engine is busy: try again in a moment"};
  }
  if (code == kCodeMalformed || code == kCodeInvalidParam) throw ApiError{400, msg};
  throw ApiError{503, "the search engine answered " + std::to_string(code) + ": " + msg};
}

httpd::Reply WebApp::Search(Call& call) {
  const auto& p = call.params;
  auto text = [&p](const std::string& key) {
    const auto it = p.find(key);
    return it == p.end() ? std::string() : it->second;
  };
  Json::Value data(Json::objectValue);
  if (!text("q").empty()) data["keyword"] = text("q");
  if (!text("name").empty()) data["name"] = text("name");
  const std::string kind = text("kind");
  if (!kind.empty()) {
    static const char* const kKinds[] = {"document", "audio", "video", "photo", "folder"};
    if (std::find(std::begin(kKinds), std::end(kKinds), kind) == std::end(kKinds)) {
      throw ApiError{400, "\"kind\" is one of document, audio, video, photo, folder"};
    }
    data["file_type"] = kind;
  }
  std::stringstream exts(text("ext"));
  for (std::string ext; std::getline(exts, ext, ',');) {
    ext.erase(0, ext.find_first_not_of(" ."));
    if (!ext.empty()) data["ext"].append(ext);
  }
  const std::string folder = text("folder");
  if (!folder.empty()) {
    if (!IsPlainAbsolute(folder)) throw ApiError{400, "\"folder\" must be an absolute path"};
    data["folder"] = folder;
  }
  constexpr int64_t kMax = INT64_MAX / 2;
  if (p.count("min_size")) data["size_range"]["gte"] = Json::Int64(NumberParam(p, "min_size", 0, kMax, 0));
  if (p.count("max_size")) data["size_range"]["lte"] = Json::Int64(NumberParam(p, "max_size", 0, kMax, 0));
  if (p.count("after")) data["mtime_range"]["gte"] = Json::Int64(NumberParam(p, "after", 0, kMax, 0));
  if (p.count("before")) data["mtime_range"]["lte"] = Json::Int64(NumberParam(p, "before", 0, kMax, 0));
  if (data.empty()) throw ApiError{400, "give words, a name or a filter to search for"};
  const std::string sort = text("sort");
  if (!sort.empty()) {
    if (sort != "relevance" && sort != "name" && sort != "size" && sort != "mtime") {
      throw ApiError{400, "\"sort\" is one of relevance, name, size, mtime"};
    }
    data["sort"] = sort;
  }
  if (text("order") == "desc") data["order"] = "desc";
  data["from"] = Json::Int64(NumberParam(p, "from", 0, 10000, 0));
  data["size"] = Json::Int64(NumberParam(p, "size", 1, kMaxPage, 20));
  const Json::Value found = AskEngine(call.session->uid, "search", data);
  Json::Value out(Json::objectValue);
  out["total"] = found["total"];
  out["total_exact"] = found["total_exact"];
  out["hits"] = Json::Value(Json::arrayValue);
  for (const Json::Value& hit : found["hits"]) {
    Json::Value h(Json::objectValue);
    const std::string path = hit["path"].asString();
    h["path"] = path;
    h["name"] = hit["name"];
    h["folder"] = path.substr(0, std::max<size_t>(1, path.rfind('/')));
    h["ext"] = hit["ext"];
    h["size"] = hit["size"];
    h["mtime"] = hit["mtime"];
    h["is_dir"] = hit["is_dir"].asBool();
    if (hit["snippet"].isString()) h["snippet"] = hit["snippet"];
    out["hits"].append(h);
  }
  return JsonReply(200, out);
}

httpd::Reply WebApp::Suggest(Call& call) {
  const auto it = call.params.find("prefix");
  if (it == call.params.end() || it->second.empty() || it->second.size() > 200) {
    throw ApiError{400, "give \"prefix\" (1 to 200 bytes)"};
  }
  Json::Value data(Json::objectValue);
  data["prefix"] = it->second;
  data["size"] = Json::Int64(NumberParam(call.params, "size", 1, 20, 8));
  return JsonReply(200, AskEngine(call.session->uid, "suggest", data));
}

httpd::Reply WebApp::Download(Call& call) {
  const auto it = call.params.find("path");
  const std::string path = it == call.params.end() ? "" : it->second;
  if (!IsPlainAbsolute(path)) {
    throw ApiError{400, "\"path\" must be an absolute path without \".\" or \"..\" parts"};
  }
  // Only files below an indexed folder, reached from their share's folder.
  std::string root;
  {
    const std::lock_guard<std::mutex> lock(admin_mu_);
    const Json::Value folders = fileindex::FolderList(Json::Value(Json::objectValue))["folders"];
    for (const Json::Value& f : folders) {
      std::string full;
      try {
        full = fileindex::GetFullPath(f["path"].asString());
      } catch (const Error&) {
        continue;
      }
      if (IsUnder(path, full) && path != full) {
        std::string share_name;
        fileindex::GetShareNamePathByFullPath(share_name, root, full);
        break;
      }
    }
  }
  if (root.empty()) throw ApiError{403, path + " is not in an indexed folder"};
  std::vector<std::string> parts;
  {
    std::stringstream in(path.substr(root.size() + 1));
    for (std::string part; std::getline(in, part, '/');) parts.push_back(part);
  }
  UniqueFd file;
  int error = 0;
  {
    // Opened with the user's own rights, one name at a time from the share's folder, following
    // no link below it: what the user could not open, or a link out of the share, is refused.
    const httpd::ThreadCredentials as(call.session->uid, true);
    if (!as.ok()) throw ApiError{500, "cannot act as uid " + std::to_string(call.session->uid)};
    UniqueFd dir(::open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    for (size_t i = 0; dir.valid() && i + 1 < parts.size(); ++i) {
      dir = UniqueFd(::openat(dir.get(), parts[i].c_str(),
                              O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    }
    if (dir.valid()) {
      file = UniqueFd(::openat(dir.get(), parts.back().c_str(),
                               O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    }
    error = errno;
  }
  struct stat st;
  if (!file.valid()) {
    if (error == ENOENT) throw ApiError{404, "no such file: " + path};
    if (error == ELOOP || error == ENOTDIR) {
      throw ApiError{403, path + " goes through a symbolic link: it is not served"};
    }
    throw ApiError{403, "you may not open " + path};
  }
  if (::fstat(file.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
    throw ApiError{403, path + " is not a regular file"};
  }
  // Read as a blocking file from here on.
  ::fcntl(file.get(), F_SETFL, ::fcntl(file.get(), F_GETFL) & ~O_NONBLOCK);
  const std::string name = parts.back();
  std::string ascii;
  for (char c : name) ascii += (c >= 0x20 && c < 0x7f && c != '"' && c != '\\') ? c : '_';
  httpd::Reply reply;
  reply.content_type = ContentTypeOf(name);
  // Always an attachment: a user's HTML must never run as this site's page.
  reply.headers.emplace_back("Content-Disposition", "attachment; filename=\"" + ascii +
                                                        "\"; filename*=UTF-8''" +
                                                        PercentEncode(name));
  reply.headers.emplace_back("Cache-Control", "private, no-store");
  reply.file = std::move(file);
  ORVANE_LOG(LOG_INFO, "%s downloads %s", call.session->user.c_str(), path.c_str());
  return reply;
}

Json::Value WebApp::AdminStatus() {
  Json::Value status(Json::objectValue);
  Json::Value req(Json::objectValue);
  req["additional"].append("status");
  status["folders"] = fileindex::FolderList(req)["folders"];
  const Json::Value summary = fileindex::FolderSummary();
  status["paused"] = summary["paused"];
  status["resume_time"] = summary["resume_time"];
  // The indexing daemon's counters and errors, when it answers.
  Json::Value indexer;
  {
    quixdaemon::DomainSockConnection conn(opt_.indexer_socket);
    conn.SetTimeouts(5000, 5000);
    std::string text;
    if (conn.Connect(2000) && conn.Send(R"({"type":"status","data":null})" + std::string(1, '\0')) &&
        conn.Recv(text)) {
      std::string errors;
      JsonParseChecked(text, &indexer, &errors);
    }
  }
  status["indexer_running"] = indexer.isObject();
  status["shares"] = Json::Value(Json::arrayValue);
  for (const Json::Value& s : summary["shares"]) {
    Json::Value share(Json::objectValue);
    share["share"] = s["share"];
    share["folder_count"] = s["folder_count"];
    share["queued"] = s["queue_length"];
    share["need_reindex"] = s["need_reindex"];
    share["queue_no_space"] = s["queue_no_space"];
    share["watch_limit"] = s["watch_limit"];
    for (const Json::Value& w : indexer["data"]["shares"]) {
      if (w["share"] != s["share"]) continue;
      for (const char* key : {"ops_pending", "ops_done", "documents_written", "errors",
                              "last_error", "paused", "out_of_space", "unsafe", "last_pass"}) {
        if (w.isMember(key)) share[key] = w[key];
      }
    }
    status["shares"].append(share);
  }
  return status;
}

Json::Value WebApp::Browse(const std::string& share_path) {
  Json::Value out(Json::objectValue);
  out["path"] = share_path;
  out["folders"] = Json::Value(Json::arrayValue);
  if (share_path == "/") {
    const auto config = platform::LoadPlatformConfig();
    for (const platform::ShareConfig& s : config->shares) out["folders"].append("/" + s.name);
    return out;
  }
  if (!IsPlainAbsolute(share_path)) throw ApiError{400, "\"path\" must be a share path"};
  const std::string full = fileindex::GetFullPath(share_path);
  DIR* dir = ::opendir(full.c_str());
  if (dir == nullptr) throw ApiError{404, "cannot list " + share_path + ": " + std::strerror(errno)};
  const std::unique_ptr<DIR, int (*)(DIR*)> closer(dir, ::closedir);
  std::vector<std::string> names;
  while (const dirent* e = ::readdir(dir)) {
    const std::string name = e->d_name;
    if (name[0] == '.' || name[0] == '@' || name[0] == '#') continue;  // the system's own
    struct stat st;
    if (::fstatat(::dirfd(dir), e->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode)) {
      names.push_back(name);
    }
  }
  std::sort(names.begin(), names.end());
  for (const std::string& n : names) out["folders"].append(share_path + "/" + n);
  return out;
}

httpd::Reply WebApp::Admin(Call& call, const std::string& what) {
  const http::verb method = call.req.method();
  const std::lock_guard<std::mutex> lock(admin_mu_);
  auto paths_of = [](const Json::Value& body) {
    const Json::Value& paths = body["paths"];
    if (!paths.isArray() || paths.empty()) throw ApiError{400, "give \"paths\", a list of folders"};
    for (const Json::Value& p : paths) {
      if (!p.isString()) throw ApiError{400, "\"paths\" holds share paths as strings"};
    }
    return paths;
  };
  auto apply = [](const Json::Value& body, Json::Value* folder) {
    if (body["name"].isString() && !body["name"].asString().empty()) (*folder)["name"] = body["name"];
    for (const char* kind : {"document", "audio", "video", "photo"}) {
      if (body.isMember(kind)) {
        if (!body[kind].isBool()) throw ApiError{400, std::string("\"") + kind + "\" is true or false"};
        (*folder)[kind] = body[kind];
      }
    }
  };
  Json::Value done(Json::objectValue);
  done["success"] = true;
  if (what == "status" && method == http::verb::get) return JsonReply(200, AdminStatus());
  if (what == "browse" && method == http::verb::get) {
    const auto it = call.params.find("path");
    return JsonReply(200, Browse(it == call.params.end() || it->second.empty() ? "/" : it->second));
  }
  if (what == "folders") {
    if (method == http::verb::get) return JsonReply(200, AdminStatus()["folders"]);
    const Json::Value body = ParseBody(call.req);
    if (method == http::verb::post || method == http::verb::put) {
      const std::string path = body["path"].asString();
      if (!IsPlainAbsolute(path)) throw ApiError{400, "\"path\" must be a share path (/share/folder)"};
      Json::Value folder(Json::objectValue);
      if (method == http::verb::post) {
        folder["path"] = path;
        folder["name"] = path.substr(path.rfind('/') + 1);
        folder["document"] = true;
        folder["audio"] = folder["video"] = folder["photo"] = false;
        folder["owner"] = call.session->user;
        folder["privileged"] = true;
      } else {
        folder = fileindex::FolderGet(path, Json::Value(Json::arrayValue));
      }
      apply(body, &folder);
      Json::Value list(Json::arrayValue);
      list.append(folder);
      if (method == http::verb::post) {
        fileindex::FolderAdd(list, false);
      } else {
        fileindex::FolderSet(list, false);
      }
      ORVANE_LOG(LOG_INFO, "%s %s folder %s", call.session->user.c_str(),
                 method == http::verb::post ? "added" : "changed", path.c_str());
      return JsonReply(200, done);
    }
    if (method == http::verb::delete_) {
      fileindex::FolderDelete(paths_of(body));
      ORVANE_LOG(LOG_INFO, "%s removed folders %s", call.session->user.c_str(),
                 JsonToString(body["paths"]).c_str());
      return JsonReply(200, done);
    }
    throw ApiError{405, "/api/admin/folders takes GET, POST, PUT or DELETE"};
  }
  if (method != http::verb::post) {
    if (what == "reindex" || what == "pause" || what == "resume") {
      throw ApiError{405, call.path + " takes POST"};
    }
    throw ApiError{404, "no such call: " + call.path};
  }
  const Json::Value body = ParseBody(call.req);
  if (what == "reindex") {
    fileindex::FolderReindex(paths_of(body));
    return JsonReply(200, done);
  }
  if (what == "pause") {
    // Pauses last whole hours; an end time is rounded up to the next one.
    int64_t hours = 0;
    if (body["until"].isIntegral()) {
      const int64_t left = body["until"].asInt64() - Env::Current()->Now();
      if (left <= 0) throw ApiError{400, "\"until\" lies in the past"};
      hours = (left + 3599) / 3600;
    } else if (body["hours"].isIntegral()) {
      hours = body["hours"].asInt64();
    }
    if (hours < 0 || hours > 24 * 365) throw ApiError{400, "a pause lasts 0 (until resumed) to 8760 hours"};
    fileindex::StatusMgr().Pause(static_cast<int>(hours));
    ORVANE_LOG(LOG_INFO, "%s paused indexing for %lld hour(s)", call.session->user.c_str(),
               static_cast<long long>(hours));
    return JsonReply(200, done);
  }
  if (what == "resume") {
    fileindex::StatusMgr().Resume();
    return JsonReply(200, done);
  }
  throw ApiError{404, "no such call: " + call.path};
}

}  // namespace webd
}  // namespace orvane
