#include "daemons/webd/sessions.hpp"

#include <sys/random.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "common/env.hpp"

namespace orvane {
namespace webd {

std::string RandomToken() {
  unsigned char bytes[32];
  size_t got = 0;
  while (got < sizeof bytes) {
    const ssize_t n = ::getrandom(bytes + got, sizeof bytes - got, 0);
    if (n < 0 && errno == EINTR) continue;
    // A guessable token would let anyone in: without the kernel's generator there is no session.
    if (n <= 0) std::abort();
    got += static_cast<size_t>(n);
  }
  static const char kHex[] = "0123456789abcdef";
  std::string text;
  for (unsigned char b : bytes) {
    text += kHex[b >> 4];
    text += kHex[b & 15];
  }
  return text;
}

bool SessionMgr::Expired(const WebSession& s, int64_t now) const {
  return now - s.used_micros > idle_micros_ || now - s.created_micros > life_micros_;
}

WebSession SessionMgr::Create(const std::string& user, uid_t uid, bool admin) {
  WebSession s;
  s.token = RandomToken();
  s.csrf = RandomToken();
  s.user = user;
  s.uid = uid;
  s.admin = admin;
  s.created_micros = s.used_micros = Env::Current()->NowMicros();
  std::lock_guard<std::mutex> lock(mu_);
  for (auto it = sessions_.begin(); it != sessions_.end();) {
    it = Expired(it->second, s.created_micros) ? sessions_.erase(it) : std::next(it);
  }
  if (sessions_.size() >= max_sessions_) {
    auto oldest = std::min_element(sessions_.begin(), sessions_.end(), [](auto& a, auto& b) {
      return a.second.used_micros < b.second.used_micros;
    });
    sessions_.erase(oldest);
  }
  sessions_[s.token] = s;
  return s;
}

std::optional<WebSession> SessionMgr::Find(const std::string& token) {
  const int64_t now = Env::Current()->NowMicros();
  std::lock_guard<std::mutex> lock(mu_);
  const auto it = sessions_.find(token);
  if (it == sessions_.end()) return std::nullopt;
  if (Expired(it->second, now)) {
    sessions_.erase(it);
    return std::nullopt;
  }
  it->second.used_micros = now;
  return it->second;
}

void SessionMgr::Remove(const std::string& token) {
  std::lock_guard<std::mutex> lock(mu_);
  sessions_.erase(token);
}

int64_t LoginLimiter::Wait(std::map<std::string, std::deque<int64_t>>* table,
                           const std::string& key, int bound, int64_t now) {
  const auto it = table->find(key);
  if (it == table->end()) return 0;
  std::deque<int64_t>& failures = it->second;
  while (!failures.empty() && now - failures.front() >= window_micros_) failures.pop_front();
  if (failures.empty()) {
    table->erase(it);
    return 0;
  }
  if (static_cast<int>(failures.size()) < bound) return 0;
  const int64_t free_at = failures[failures.size() - bound] + window_micros_;
  return std::max<int64_t>(1, (free_at - now + 999999) / 1000000);
}

int64_t LoginLimiter::WaitSeconds(const std::string& address, const std::string& account) {
  const int64_t now = Env::Current()->NowMicros();
  std::lock_guard<std::mutex> lock(mu_);
  return std::max(Wait(&addresses_, address, per_address_, now),
                  Wait(&accounts_, account, per_account_, now));
}

void LoginLimiter::Failed(const std::string& address, const std::string& account) {
  const int64_t now = Env::Current()->NowMicros();
  std::lock_guard<std::mutex> lock(mu_);
  // Bounded: a flood of made-up account names must not grow the table without end.
  if (accounts_.size() > 100000) accounts_.clear();
  if (addresses_.size() > 100000) addresses_.clear();
  addresses_[address].push_back(now);
  accounts_[account].push_back(now);
}

void LoginLimiter::Succeeded(const std::string& account) {
  std::lock_guard<std::mutex> lock(mu_);
  accounts_.erase(account);
}

}  // namespace webd
}  // namespace orvane
