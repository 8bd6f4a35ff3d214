// The web daemon's signed-in sessions and its limits on sign-in attempts. A session is a random
// token (the cookie) with the account it stands for and a second random token every change must
// carry; it ends at sign-out, after an idle time or after its whole life. Times come from Env.
// Both classes own their tables and are safe from any thread.
#ifndef ORVANE_DAEMONS_WEBD_SESSIONS_HPP_
#define ORVANE_DAEMONS_WEBD_SESSIONS_HPP_

#include <sys/types.h>

#include <cstdint>
#include <deque>
#include <map>
#include <mutex>
#include <optional>
#include <string>

namespace orvane {
namespace webd {

struct WebSession {
  std::string token;  // the cookie's value
  std::string csrf;   // what each change carries in X-CSRF-Token
  std::string user;
  uid_t uid = 0;
  bool admin = false;
  int64_t created_micros = 0;
  int64_t used_micros = 0;
};

class SessionMgr {
 public:
  SessionMgr(int64_t idle_micros, int64_t life_micros, size_t max_sessions)
      : idle_micros_(idle_micros), life_micros_(life_micros), max_sessions_(max_sessions) {}

  // A new session for the account; the oldest is dropped when the table is full.
  WebSession Create(const std::string& user, uid_t uid, bool admin);
  // The live session of `token`, its idle time restarted; nothing for an unknown, idle or
  // too old one (which is forgotten).
  std::optional<WebSession> Find(const std::string& token);
  void Remove(const std::string& token);

 private:
  bool Expired(const WebSession& s, int64_t now) const;

  const int64_t idle_micros_;
  const int64_t life_micros_;
  const size_t max_sessions_;
  std::mutex mu_;
  std::map<std::string, WebSession> sessions_;
};

// Failed sign-ins counted per remote address and per account over a sliding window: past the
// bound, further attempts are refused unread until the oldest failure leaves the window.
class LoginLimiter {
 public:
  LoginLimiter(int per_address, int per_account, int64_t window_micros)
      : per_address_(per_address), per_account_(per_account), window_micros_(window_micros) {}

  // Zero when an attempt may be made now, else the seconds until one may.
  int64_t WaitSeconds(const std::string& address, const std::string& account);
  void Failed(const std::string& address, const std::string& account);
  // A success forgets the account's failures (not the address's: one address trying many
  // accounts stays bounded).
  void Succeeded(const std::string& account);

 private:
  int64_t Wait(std::map<std::string, std::deque<int64_t>>* table, const std::string& key,
               int bound, int64_t now);

  const int per_address_;
  const int per_account_;
  const int64_t window_micros_;
  std::mutex mu_;
  std::map<std::string, std::deque<int64_t>> addresses_;
  std::map<std::string, std::deque<int64_t>> accounts_;
};

// A random token of 32 bytes in hex, from the kernel's generator.
std::string RandomToken();

}  // namespace webd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_WEBD_SESSIONS_HPP_
