// The gateway on a real loopback port, in front of a scripted engine on a real Unix socket (the
// engine's answers to the query tree are the engine's own tests' business).
#include "daemons/searchgw/gateway.hpp"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <grp.h>
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/wire.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace searchgw {
namespace {

using test::FakeDaemon;

struct Response {
  int status = 0;  // 0: closed without an answer
  std::string status_line;
  std::string headers;
  std::string body;
};

class Client {
 public:
  explicit Client(uint16_t port) : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_port = htons(port);
    sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    connected_ = ::connect(fd_.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa) == 0;
    const timeval tv = {10, 0};  // a gateway that never answers fails the test, not hangs it
    ::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  }
  bool connected() const { return connected_; }

  bool Send(const std::string& bytes) {
    return ::send(fd_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) ==
           static_cast<ssize_t>(bytes.size());
  }

  // Reads one response, as far as it comes.
  Response Read() {
    Response r;
    size_t end;
    while ((end = pending_.find("\r\n\r\n")) == std::string::npos) {
      if (!Fill()) return r;
    }
    r.headers = pending_.substr(0, end + 2);
    pending_.erase(0, end + 4);
    r.status_line = r.headers.substr(0, r.headers.find("\r\n"));
    r.status = std::stoi(r.status_line.substr(9, 3));
    const size_t cl = r.headers.find("Content-Length: ");
    const size_t length = cl == std::string::npos ? 0 : std::stoul(r.headers.substr(cl + 16));
    while (pending_.size() < length) {
      if (!Fill()) return r;
    }
    r.body = pending_.substr(0, length);
    pending_.erase(0, length);
    return r;
  }

  Response Search(const std::string& index, const std::string& body,
                  const std::string& suffix = "") {
    Send("POST /" + index + "/_search" + suffix +
         " HTTP/1.1\r\nHost: 127.0.0.1\r\n"
         "Content-Type: application/json\r\nContent-Length: " +
         std::to_string(body.size()) + "\r\n\r\n" + body);
    return Read();
  }

  // True once the gateway has closed the connection.
  bool Closed() { return !Fill(); }

 private:
  bool Fill() {
    char buf[4096];
    const ssize_t n = ::recv(fd_.get(), buf, sizeof buf, 0);
    if (n <= 0) return false;
    pending_.append(buf, static_cast<size_t>(n));
    return true;
  }

  UniqueFd fd_;
  bool connected_ = false;
  std::string pending_;
};

// An engine that finds a folder and a file in it, and knows no index named "fileindex_gone".
void Engine(int fd, const std::string& request) {
  const Json::Value req = FakeDaemon::Parse(std::string(wire::PayloadText(request)));
  for (const Json::Value& id : req["data"]["id"]) {
    if (id.asString() == "fileindex_gone") {
      FakeDaemon::WriteFrame(
          fd, R"({"success":false,"error":{"code":601,"msg":"index fileindex_gone not found"}})");
      return;
    }
  }
  // Within /srv/deep, the folder itself comes past the first page; asked by its name, it is found.
  const std::string tree = JsonToString(req["data"]["query"]);
  if (tree.find(R"({"match":"name","pattern":"deep"})") != std::string::npos) {
    FakeDaemon::WriteFrame(fd,
                           R"({"success":true,"data":{"total":1,"hits":[{"path":"/srv/deep"}]}})");
    return;
  }
  if (tree.find(R"({"under":"/srv/deep"})") != std::string::npos) {
    FakeDaemon::WriteFrame(
        fd, R"({"success":true,"data":{"total":5,"hits":[{"path":"/srv/deep/a"}]}})");
    return;
  }
  FakeDaemon::WriteFrame(fd, R"({"success":true,"data":{"total":2,"total_exact":true,)"
                             R"("hits":[{"path":"/srv/s","name":"s"},{"path":"/srv/s/a.txt"}]}})");
}

class GatewayTest : public ::testing::Test {
 protected:
  void StartGateway(GatewayOptions o = {}) {
    o.port = 0;
    o.engine_socket = dir_.Path("engine.sock");
    gateway_ = std::make_unique<Gateway>(o);
    gateway_->Start();
  }
  uint16_t port() const { return gateway_->port(); }

  test::TempDir dir_;
  std::unique_ptr<Gateway> gateway_;
};

TEST_F(GatewayTest, SearchesOnOneKeptAliveConnectionReachTheEngineAndComeBackInShape) {
  FakeDaemon engine(dir_.Path("engine.sock"), Engine);
  StartGateway();
  Client c(port());
  ASSERT_TRUE(c.connected());

  Response r =
      c.Search("fileindex_s", R"({"from": 0, "size": 50, "query": {"query_string": )"
                              R"({"query": "name:*a* AND path.real.fulltext:\"/srv/s\""}}})");
  EXPECT_EQ(r.status_line, "HTTP/1.1 200 OK");
  EXPECT_NE(r.headers.find("Content-Length: "), std::string::npos);
  EXPECT_EQ(r.headers.find("chunked"), std::string::npos);
  // The folder searched in is no hit of its own search.
  EXPECT_EQ(r.body, R"({"hits":{"total":{"value":1,"relation":"eq"},"hits":[)"
                    R"({"_source":{"path":{"real":"/srv/s/a.txt"}}}]}})");

  // The same connection: an index list, then all indexes, then one the engine does not know.
  EXPECT_EQ(c.Search("fileindex_s,fileindex_t", R"({"from": 50, "size": 50})").status, 200);
  r = c.Search("_all", "{}", "?pretty");
  EXPECT_EQ(r.status, 200);
  EXPECT_NE(r.body.find(R"("total":{"value":2,)"), std::string::npos);
  r = c.Search("fileindex_gone", "{}");
  EXPECT_EQ(r.status, 400);
  EXPECT_EQ(FakeDaemon::Parse(r.body)["error"]["type"].asString(), "index_not_found_exception");

  r = c.Search("fileindex_s", R"({"query": {"prefix": {"path.real": "/srv/deep/"}}})");
  EXPECT_NE(r.body.find(R"("total":{"value":4,)"), std::string::npos) << r.body;

  const std::vector<Json::Value> sent = engine.json_requests();
  ASSERT_EQ(sent.size(), 6u);
  EXPECT_EQ(JsonToString(sent[0]),
            R"({"command":"search","data":{"from":0,"id":["fileindex_s"],"query":{"and":[)"
            R"({"match":"name","pattern":"*a*"},{"under":"/srv/s"}]},"size":51}})");
  EXPECT_EQ(JsonToString(sent[1]["data"]["id"]), R"(["fileindex_s","fileindex_t"])");
  EXPECT_EQ(sent[1]["data"]["from"].asInt(), 50);
  EXPECT_FALSE(sent[2]["data"].isMember("id"));
  EXPECT_EQ(JsonToString(sent[2]["data"]["query"]), R"({"all":true})");
}

TEST_F(GatewayTest, MalformedRequestsAreAnsweredOrClosedAndServingGoesOn) {
  FakeDaemon engine(dir_.Path("engine.sock"), Engine);
  GatewayOptions o;
  o.request_timeout_ms = 300;
  o.max_header_bytes = 2048;
  o.max_body_bytes = 4096;
  StartGateway(o);
  struct Row {
    std::string bytes;
    int status;  // 0: closed without an answer
    const char* type;
  };
  const std::string post = "POST /fileindex_s/_search HTTP/1.1\r\nHost: x\r\n";
  const Row rows[] = {
      {"GARBAGE\r\n\r\n", 400, "http_parse_exception"},
      {post + "X-Big: " + std::string(4000, 'h') + "\r\n\r\n", 431, "http_parse_exception"},
      {post + "Content-Length: 10000000\r\n\r\n{", 413, "http_parse_exception"},
      {post + "Content-Length: 8\r\n\r\nnot json", 400, "parsing_exception"},
      {post + "Content-Length: 37\r\n\r\n{\"query\":{\"query_string\":{\"query\":\"(\"}}", 400,
       "parsing_exception"},
      {"GET /fileindex_s/_doc/1 HTTP/1.1\r\n\r\n", 404, "no_handler_found_exception"},
      {"DELETE /fileindex_s/_search HTTP/1.1\r\n\r\n", 405, "method_not_allowed_exception"},
      {"POST /other/_search HTTP/1.1\r\nContent-Length: 2\r\n\r\n{}", 400,
       "index_not_found_exception"},
      // Cut short, and never finished: closed once the request's time is up.
      {post + "Content-Length: 100\r\n\r\n{\"from\"", 0, ""},
      {"POST /fileindex_s/_sea", 0, ""},
  };
  for (const Row& row : rows) {
    Client c(port());
    ASSERT_TRUE(c.Send(row.bytes));
    const Response r = c.Read();
    EXPECT_EQ(r.status, row.status) << row.bytes.substr(0, 80);
    if (row.status != 0) {
      EXPECT_EQ(FakeDaemon::Parse(r.body)["error"]["type"].asString(), row.type);
      EXPECT_EQ(FakeDaemon::Parse(r.body)["status"].asInt(), row.status);
    }
  }
  EXPECT_EQ(engine.connections(), 0);
  EXPECT_EQ(Client(port()).Search("fileindex_s", "{}").status, 200);
}

TEST_F(GatewayTest, ConnectionsBeyondTheCapAreRefusedAtOnceAndIdleOnesTimeOut) {
  FakeDaemon engine(dir_.Path("engine.sock"), Engine);
  GatewayOptions o;
  o.max_connections = 16;
  o.max_connections_per_user = 16;
  o.idle_timeout_ms = 2000;
  StartGateway(o);
  // A thousand connections held at once: the first sixteen are kept, every other one is told
  // so and closed.
  std::vector<std::unique_ptr<Client>> held;
  int refused = 0;
  for (int i = 0; i < 1000; ++i) {
    held.push_back(std::make_unique<Client>(port()));
    ASSERT_TRUE(held.back()->connected());
    if (i >= 16) {
      const Response r = held.back()->Read();
      refused += r.status == 429;
      held.pop_back();
    }
  }
  EXPECT_EQ(refused, 1000 - 16);
  // The kept ones are served; once they are gone, room is made for others.
  EXPECT_EQ(held.front()->Search("fileindex_s", "{}").status, 200);
  held.clear();
  for (int tries = 0; tries < 100; ++tries) {
    Client c(port());
    const Response r = c.Search("fileindex_s", "{}");
    if (r.status == 200) break;
    ASSERT_EQ(r.status, 429);
    ::usleep(20000);
  }
  // A connection that says nothing is closed after the idle time.
  Client idle(port());
  EXPECT_TRUE(idle.Closed());
}

// What the client is told of each answer of the engine but hits: a busy engine is asked again
// for a while before the client is told to come back.
TEST_F(GatewayTest, EngineFailuresBecomeTheStatusesClientsActOn) {
  const std::string busy = R"({"success":false,"error":{"code":1401,"msg":"busy"}})";
  const std::string found = R"({"success":true,"data":{"total":0,"hits":[]}})";
  struct Row {
    std::vector<std::string> replies;  // the last one repeated
    int status;
    const char* type;
    int asked;  // how often the engine is asked (0: not counted)
  };
  const Row rows[] = {
      {{busy, busy, busy, found}, 200, nullptr, 4},
      {{busy}, 429, "es_rejected_execution_exception", 30},
      {{R"({"success":false,"error":{"code":1400,"msg":"out of memory"}})"}, 429,
       "es_rejected_execution_exception", 1},
      {{R"({"success":false,"error":{"code":1402,"msg":"too long"}})"}, 504,
       "search_timeout_exception", 1},
      {{R"({"success":false,"error":{"code":103,"msg":"denied"}})"}, 403, "security_exception", 1},
      {{R"({"success":false,"error":{"code":607,"msg":"opening"}})"}, 503,
       "unavailable_shards_exception", 1},
      {{"not json"}, 503, "unavailable_shards_exception", 1},
      {{}, 503, "unavailable_shards_exception", 1},  // closes without a word
  };
  for (const Row& row : rows) {
    FakeDaemon engine(dir_.Path("engine.sock"), FakeDaemon::Replies(row.replies));
    StartGateway();
    const Response r = Client(port()).Search("fileindex_s", "{}");
    const std::string what = row.replies.empty() ? "nothing" : row.replies.front();
    EXPECT_EQ(r.status, row.status) << what << r.body;
    if (row.type != nullptr) {
      EXPECT_EQ(FakeDaemon::Parse(r.body)["error"]["type"].asString(), row.type) << what;
    }
    EXPECT_EQ(engine.connections(), row.asked) << what;
    gateway_.reset();
  }
  // No engine at all.
  StartGateway();
  const Response r = Client(port()).Search("fileindex_s", "{}");
  EXPECT_EQ(r.status, 503);
  EXPECT_NE(r.body.find("is quixelasticd running?"), std::string::npos);
}

// Runs `fn` in a child process as `uid` with `gid`; its exit status, -1 when it died.
int RunAsIds(uid_t uid, gid_t gid, const std::function<int()>& fn) {
  const pid_t pid = ::fork();
  if (pid == 0) {
    if (::setgroups(0, nullptr) != 0 || ::setresgid(gid, gid, gid) != 0 ||
        ::setresuid(uid, uid, uid) != 0) {
      ::_exit(255);
    }
    ::_exit(fn() & 0xff);
  }
  int status = 0;
  return pid > 0 && ::waitpid(pid, &status, 0) == pid && WIFEXITED(status) ? WEXITSTATUS(status)
                                                                            : -1;
}

// A search is answered only with the rights of a user of the system: the owner of a connection
// who has no name is refused, and so is every search the gateway cannot switch to its asker for
// (a gateway not run as root).
TEST_F(GatewayTest, SearchesNoUserCouldMakeAreRefused) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as other users";
  FakeDaemon engine(dir_.Path("engine.sock"), Engine);
  ASSERT_EQ(::chmod(dir_.path().c_str(), 0711), 0);
  ASSERT_EQ(::chmod(dir_.Path("engine.sock").c_str(), 0666), 0);
  const passwd* daemon_user = ::getpwnam("daemon");
  const passwd* nobody = ::getpwnam("nobody");
  ASSERT_TRUE(daemon_user != nullptr && nobody != nullptr);
  const uid_t unnamed = 4242;
  ASSERT_EQ(::getpwuid(unnamed), nullptr) << "uid 4242 has a name on this machine";

  // 0: a 403 whose reason holds `says`; 1: another answer.
  auto refused = [](uint16_t port, const char* says) {
    const Response r = Client(port).Search("fileindex_s", "{}");
    return r.status == 403 && r.body.find(says) != std::string::npos &&
                   FakeDaemon::Parse(r.body)["error"]["type"].asString() == "security_exception"
               ? 0
               : 1;
  };
  StartGateway();
  const uint16_t p = port();
  EXPECT_EQ(RunAsIds(unnamed, 65534, [&] { return refused(p, "uid 4242, is no user"); }), 0);
  EXPECT_EQ(engine.connections(), 0);

  // A gateway run as nobody cannot take another user's rights.
  int ports[2];
  ASSERT_EQ(::pipe(ports), 0);
  const pid_t gw = ::fork();
  if (gw == 0) {
    ::close(ports[0]);
    if (::setgroups(0, nullptr) != 0 || ::setresgid(nobody->pw_gid, nobody->pw_gid, nobody->pw_gid) != 0 ||
        ::setresuid(nobody->pw_uid, nobody->pw_uid, nobody->pw_uid) != 0) {
      ::_exit(1);
    }
    GatewayOptions o;
    o.port = 0;
    o.engine_socket = dir_.Path("engine.sock");
    Gateway unprivileged(o);
    unprivileged.Start();
    const uint16_t port = unprivileged.port();
    if (::write(ports[1], &port, sizeof port) != sizeof port) ::_exit(1);
    ::pause();
    ::_exit(0);
  }
  ::close(ports[1]);
  uint16_t gw_port = 0;
  ASSERT_EQ(::read(ports[0], &gw_port, sizeof gw_port), static_cast<ssize_t>(sizeof gw_port));
  ::close(ports[0]);
  EXPECT_EQ(test::RunAsUser("daemon",
                            [&] { return refused(gw_port, "cannot search as uid"); }),
            0);
  ::kill(gw, SIGKILL);
  ::waitpid(gw, nullptr, 0);
  EXPECT_EQ(engine.connections(), 0);
}

// A local user searches with their own rights: the engine is asked on a connection made with
// that user's credentials, and judges every hit by them. Local users share one address, so each
// is counted by uid against the connection caps.
TEST_F(GatewayTest, EachLocalUserSearchesAsThemselves) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act as another user";
  std::vector<uid_t> askers;
  std::mutex mu;
  FakeDaemon engine(dir_.Path("engine.sock"), [&](int fd, const std::string& request) {
    ucred cred{};
    socklen_t len = sizeof cred;
    ::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len);
    {
      std::lock_guard<std::mutex> lock(mu);
      askers.push_back(cred.uid);
    }
    Engine(fd, request);
  });
  // The engine's socket must be reachable by the user, as the real public socket is.
  ASSERT_EQ(::chmod(dir_.path().c_str(), 0711), 0);
  ASSERT_EQ(::chmod(dir_.Path("engine.sock").c_str(), 0666), 0);
  GatewayOptions o;
  o.max_connections_per_user = 2;
  StartGateway(o);
  const uint16_t p = port();
  // Root holding all of its places leaves another local user's unharmed.
  Client held1(p), held2(p);
  ASSERT_TRUE(held1.connected() && held2.connected());
  EXPECT_EQ(Client(p).Read().status, 429);
  // An exit status holds 8 bits: the status class comes back.
  EXPECT_EQ(test::RunAsUser("nobody",
                            [p] { return Client(p).Search("fileindex_s", "{}").status / 100; }),
            2);
  EXPECT_EQ(held1.Search("fileindex_s", "{}").status, 200);
  EXPECT_EQ(askers, (std::vector<uid_t>{65534, 0}));
}

}  // namespace
}  // namespace searchgw
}  // namespace orvane
