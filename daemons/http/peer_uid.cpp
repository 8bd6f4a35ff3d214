#include "daemons/http/peer_uid.hpp"

#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/sock_diag.h>
#include <netinet/in.h>
#include <grp.h>
#include <pwd.h>
#include <sys/syscall.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <vector>

#include "common/fd.hpp"

namespace orvane {
namespace httpd {
namespace {

using boost::asio::ip::tcp;

void CopyAddress(const tcp::endpoint& e, __be32 out[4]) {
  if (e.address().is_v4()) {
    const auto b = e.address().to_v4().to_bytes();
    std::memcpy(out, b.data(), b.size());
  } else {
    const auto b = e.address().to_v6().to_bytes();
    std::memcpy(out, b.data(), b.size());
  }
}

}  // namespace

// One exact look-up through the kernel's socket diagnostics: the socket is named by its four
// ends, so the answer costs the same with one connection or thousands (a walk of /proc/net/tcp
// would read them all at every accept).
std::optional<uid_t> LocalPeerUid(const tcp::endpoint& local, const tcp::endpoint& peer) {
  if (local.address().is_v4() != peer.address().is_v4()) return std::nullopt;
  UniqueFd nl(::socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC, NETLINK_SOCK_DIAG));
  if (!nl.valid()) return std::nullopt;
  struct {
    nlmsghdr header;
    inet_diag_req_v2 req;
  } ask{};
  ask.header.nlmsg_len = sizeof ask;
  ask.header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
  ask.header.nlmsg_flags = NLM_F_REQUEST;
  ask.req.sdiag_family = peer.address().is_v4() ? AF_INET : AF_INET6;
  ask.req.sdiag_protocol = IPPROTO_TCP;
  ask.req.idiag_states = ~0u;
  // The peer's socket: its own end is the peer's address, its far end ours.
  ask.req.id.idiag_sport = htons(peer.port());
  ask.req.id.idiag_dport = htons(local.port());
  CopyAddress(peer, ask.req.id.idiag_src);
  CopyAddress(local, ask.req.id.idiag_dst);
  ask.req.id.idiag_cookie[0] = INET_DIAG_NOCOOKIE;
  ask.req.id.idiag_cookie[1] = INET_DIAG_NOCOOKIE;
  sockaddr_nl kernel{};
  kernel.nl_family = AF_NETLINK;
  if (::sendto(nl.get(), &ask, sizeof ask, 0, reinterpret_cast<sockaddr*>(&kernel),
               sizeof kernel) != static_cast<ssize_t>(sizeof ask)) {
    return std::nullopt;
  }
  alignas(nlmsghdr) char buf[8192];
  const ssize_t n = ::recv(nl.get(), buf, sizeof buf, 0);
  if (n < static_cast<ssize_t>(sizeof(nlmsghdr))) return std::nullopt;
  const auto* answer = reinterpret_cast<const nlmsghdr*>(buf);
  if (!NLMSG_OK(answer, static_cast<unsigned>(n)) || answer->nlmsg_type != SOCK_DIAG_BY_FAMILY ||
      answer->nlmsg_len < NLMSG_LENGTH(sizeof(inet_diag_msg))) {
    return std::nullopt;  // NLMSG_ERROR: no such socket on this machine
  }
  const auto* msg = static_cast<const inet_diag_msg*>(NLMSG_DATA(answer));
  return static_cast<uid_t>(msg->idiag_uid);
}

// The raw system calls change the calling thread only; the C library's wrappers would change
// every thread of the process.
ThreadCredentials::ThreadCredentials(uid_t uid, bool with_groups) {
  if (uid == 0) return;
  std::vector<char> buf(16384);
  passwd pw;
  passwd* found = nullptr;
  const bool named = ::getpwuid_r(uid, &pw, buf.data(), buf.size(), &found) == 0 && found;
  const gid_t gid = named ? found->pw_gid : static_cast<gid_t>(65534);  // an unnamed uid gets
                                                                        // no group's rights
  if (with_groups) {
    std::vector<gid_t> groups(1, gid);
    if (named) {
      int n = 64;
      groups.resize(n);
      while (::getgrouplist(found->pw_name, gid, groups.data(), &n) < 0) groups.resize(n *= 2);
      groups.resize(n);
    }
    const int own = ::getgroups(0, nullptr);
    saved_groups_.resize(own > 0 ? own : 0);
    if (own < 0 || ::getgroups(own, saved_groups_.data()) != own ||
        ::syscall(SYS_setgroups, groups.size(), groups.data()) != 0) {
      ok_ = false;
      return;
    }
    groups_switched_ = switched_ = true;
  }
  if (::syscall(SYS_setresgid, -1, gid, -1) != 0) {
    ok_ = false;
    return;
  }
  switched_ = true;
  if (::syscall(SYS_setresuid, -1, uid, -1) != 0) ok_ = false;
}

ThreadCredentials::~ThreadCredentials() {
  if (!switched_) return;
  if (::syscall(SYS_setresuid, -1, 0, -1) != 0 || ::syscall(SYS_setresgid, -1, 0, -1) != 0) {
    std::abort();
  }
  if (groups_switched_ &&
      ::syscall(SYS_setgroups, saved_groups_.size(), saved_groups_.data()) != 0) {
    std::abort();
  }
}

}  // namespace httpd
}  // namespace orvane
