// Who is at the other end of a loopback TCP connection. The file server's search backend sends
// no credentials, so the gateway tells it from other local users by the owner of its socket,
// which the kernel tells through its socket diagnostics. Stateless; safe from any thread.
#ifndef ORVANE_DAEMONS_HTTP_PEER_UID_HPP_
#define ORVANE_DAEMONS_HTTP_PEER_UID_HPP_

#include <sys/types.h>

#include <boost/asio/ip/tcp.hpp>
#include <optional>
#include <vector>

namespace orvane {
namespace httpd {

// The uid owning the socket whose own end is `peer` and whose other end is `local` (our end of
// an accepted connection); nothing when no such socket is listed (the peer is on another
// machine, or it has gone).
std::optional<uid_t> LocalPeerUid(const boost::asio::ip::tcp::endpoint& local,
                                  const boost::asio::ip::tcp::endpoint& peer);

// The calling thread acts as `uid` (and its primary group, and with `with_groups` the account's
// supplementary groups too) while it lives; the rest of the process keeps its own credentials.
// Root (uid 0) changes nothing. A thread that cannot take root back ends the process: it must
// never go on with another user's rights.
class ThreadCredentials {
 public:
  explicit ThreadCredentials(uid_t uid, bool with_groups = false);
  ~ThreadCredentials();
  ThreadCredentials(const ThreadCredentials&) = delete;
  ThreadCredentials& operator=(const ThreadCredentials&) = delete;

  // False when the switch failed (errno set); the thread then still acts as itself.
  bool ok() const { return ok_; }

 private:
  bool switched_ = false;
  bool ok_ = true;
  bool groups_switched_ = false;
  std::vector<gid_t> saved_groups_;  // the thread's own, put back when groups_switched_
};

}  // namespace httpd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_HTTP_PEER_UID_HPP_
