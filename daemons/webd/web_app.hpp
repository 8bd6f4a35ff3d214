// The web daemon's pages and JSON API: sign-in through PAM, searches and downloads made with the
// signed-in user's own credentials, and the administration of indexed folders for members of
// the administrators group through the library's operations. Owns its sessions; Handle() is
// called from the HTTP server's threads, several at once.
#ifndef ORVANE_DAEMONS_WEBD_WEB_APP_HPP_
#define ORVANE_DAEMONS_WEBD_WEB_APP_HPP_

#include <json/json.h>

#include <cstdint>
#include <map>
#include <mutex>
#include <string>

#include "daemons/http/server.hpp"
#include "daemons/webd/pam_login.hpp"
#include "daemons/webd/sessions.hpp"

namespace orvane {
namespace webd {

struct WebOptions {
  std::string www_dir;         // the page's files, read once at start
  std::string engine_socket;   // the engine's public socket (a real path)
  std::string indexer_socket;  // the indexing daemon's control socket (a real path)
  PamService pam;
  bool secure_cookie = false;  // the page is served over TLS
  int64_t session_idle_seconds = 30 * 60;
  int64_t session_life_seconds = 12 * 3600;
  int login_failures_per_address = 20;
  int login_failures_per_account = 5;
  int64_t login_window_seconds = 300;
  int engine_timeout_ms = 15000;
};

class WebApp {
 public:
  // Reads the page's files; throws Error naming the folder when they are not there.
  explicit WebApp(WebOptions options);

  httpd::Reply Handle(const httpd::Request& request, const httpd::Peer& peer);
  // The answer to what the HTTP server refuses itself.
  static httpd::Reply Refused(httpd::Refusal refusal, int status, const std::string& reason);

 private:
  struct Call;  // one API request being answered

  httpd::Reply Api(Call& call);
  httpd::Reply Login(Call& call);
  httpd::Reply Search(Call& call);
  httpd::Reply Suggest(Call& call);
  httpd::Reply Download(Call& call);
  httpd::Reply Admin(Call& call, const std::string& what);
  Json::Value AdminStatus();
  Json::Value Browse(const std::string& share_path);
  // One people's command to the engine as `uid`; throws ApiError when there is no answer.
  Json::Value AskEngine(uid_t uid, const std::string& command, const Json::Value& data);

  const WebOptions opt_;
  std::map<std::string, std::pair<std::string, std::string>> files_;  // name: type, contents
  SessionMgr sessions_;
  LoginLimiter limiter_;
  // The library's administration operations were written for one caller at a time.
  std::mutex admin_mu_;
};

}  // namespace webd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_WEBD_WEB_APP_HPP_
