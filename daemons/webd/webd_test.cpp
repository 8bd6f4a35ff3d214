// The web daemon as a real process before the real engine, indexer and watcher in a scratch root,
// with users this test creates (useradd, passwords through chpasswd, always removed) signing in
// through real PAM. Run as root.
#include <arpa/inet.h>
#include <grp.h>
#include <netinet/in.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <json/json.h>

#include <map>
#include <set>
#include <string>
#include <vector>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "test/daemon_system.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace webd {
namespace {

using fileindexd::test::RunningSystemTest;

int Shell(const std::string& command) {
  const int rc = std::system(command.c_str());
  return WIFEXITED(rc) ? WEXITSTATUS(rc) : -1;
}

// An ordinary user in a team group, and an administrator in the administrators group this test
// names in the platform file; both with passwords, all removed at the end.
struct ScopedUsers {
  ScopedUsers() {
    ok = Shell("groupadd " + team) == 0 && Shell("groupadd " + admins) == 0 &&
         Shell("useradd -M -N -g nogroup -G " + team + " -s /usr/sbin/nologin " + user) == 0 &&
         Shell("useradd -M -N -g nogroup -G " + admins + " -s /usr/sbin/nologin " + admin) == 0 &&
         Shell("printf '%s:%s\\n%s:%s\\n' " + user + " " + kPassword + " " + admin + " " +
               kPassword + " | chpasswd") == 0;
  }
  ~ScopedUsers() {
    Shell("userdel " + user + " 2>/dev/null");
    Shell("userdel " + admin + " 2>/dev/null");
    Shell("groupdel " + team + " 2>/dev/null");
    Shell("groupdel " + admins + " 2>/dev/null");
  }
  ScopedUsers(const ScopedUsers&) = delete;
  ScopedUsers& operator=(const ScopedUsers&) = delete;

  static constexpr const char* kPassword = "Zebra-horse-42";
  const std::string user = "fiwebu" + std::to_string(::getpid());
  const std::string admin = "fiweba" + std::to_string(::getpid());
  const std::string team = "fiwebt" + std::to_string(::getpid());
  const std::string admins = "fiwebg" + std::to_string(::getpid());
  bool ok = false;
};

struct Response {
  int status = 0;  // 0: closed without an answer
  std::map<std::string, std::string> headers;  // names in lower case
  std::string body;
  Json::Value json() const {
    Json::Value v;
    std::string errors;
    JsonParseChecked(body, &v, &errors);
    return v;
  }
};

UniqueFd Connect(uint16_t port) {
  UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in sa{};
  sa.sin_family = AF_INET;
  sa.sin_port = htons(port);
  sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa) != 0) return UniqueFd();
  const timeval tv = {20, 0};  // a daemon that never answers fails the test, not hangs it
  ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  return fd;
}

// One request on its own connection, read to the end.
Response Raw(uint16_t port, const std::string& bytes) {
  Response r;
  UniqueFd fd = Connect(port);
  if (!fd.valid() || ::send(fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) < 0) return r;
  // Read to the end of the reply's body (the connection may stay open) or of the stream.
  std::string all;
  char buf[65536];
  size_t end = std::string::npos;
  size_t want = std::string::npos;
  for (ssize_t n; (end == std::string::npos || all.size() < want) &&
                  (n = ::recv(fd.get(), buf, sizeof buf, 0)) > 0;) {
    all.append(buf, n);
    end = all.find("\r\n\r\n");
    const size_t cl = all.find("Content-Length: ");
    if (end != std::string::npos && cl != std::string::npos && cl < end) {
      want = end + 4 + std::stoul(all.substr(cl + 16));
    }
  }
  if (all.size() < 12 || end == std::string::npos) return r;
  r.status = std::stoi(all.substr(9, 3));
  std::string head = all.substr(0, end);
  for (size_t pos = head.find("\r\n"); pos != std::string::npos;) {
    const size_t next = head.find("\r\n", pos + 2);
    const std::string line = head.substr(pos + 2, next == std::string::npos ? next : next - pos - 2);
    const size_t colon = line.find(':');
    std::string name = line.substr(0, colon);
    for (char& c : name) c = static_cast<char>(std::tolower(c));
    r.headers[name] += (r.headers.count(name) ? "\n" : "") + line.substr(colon + 2);
    pos = next;
  }
  r.body = all.substr(end + 4);
  return r;
}

// A browser's session: its cookie and CSRF token.
struct Browser {
  uint16_t port;
  std::string cookie;
  std::string csrf;

  Response Call(const std::string& method, const std::string& target, const std::string& body = "",
                bool with_csrf = true) const {
    std::string req = method + " " + target + " HTTP/1.1\r\nHost: 127.0.0.1\r\nConnection: close\r\n";
    if (!cookie.empty()) req += "Cookie: fi_session=" + cookie + "\r\n";
    if (with_csrf && !csrf.empty()) req += "X-CSRF-Token: " + csrf + "\r\n";
    if (!body.empty()) req += "Content-Type: application/json\r\n";
    req += "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n" + body;
    return Raw(port, req);
  }

  Response SignIn(const std::string& user, const std::string& password) {
    Json::Value b;
    b["user"] = user;
    b["password"] = password;
    const Response r = Call("POST", "/api/login", JsonToString(b));
    if (r.status == 200) {
      const std::string set = r.headers.at("set-cookie");
      cookie = set.substr(set.find('=') + 1, set.find(';') - set.find('=') - 1);
      csrf = r.json()["csrf"].asString();
    }
    return r;
  }

  std::set<std::string> Found(const std::string& query) const {
    std::set<std::string> paths;
    const Json::Value found = Call("GET", "/api/search?" + query).json();
    for (const Json::Value& hit : found["hits"]) {
      paths.insert(hit["path"].asString());
    }
    return paths;
  }
};

uint16_t FreePort() {
  UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in sa{};
  sa.sin_family = AF_INET;
  sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof sa;
  ::bind(fd.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa);
  ::getsockname(fd.get(), reinterpret_cast<sockaddr*>(&sa), &len);
  return ntohs(sa.sin_port);
}

class WebdTest : public RunningSystemTest {
 protected:
  WebdTest() : RunningSystemTest({"docs"}) {}

  void SetUp() override {
    ASSERT_TRUE(users_.ok) << "groupadd/useradd/chpasswd failed";
    test::WritePlatformConfig(sys_.root(), R"({"shares": [{"name": "docs", "path": ")" +
                                               sys_.Vol("docs") + R"("}], "admin_group": ")" +
                                               users_.admins + R"("})");
    // The engine's socket and the share reachable for other users.
    for (const std::string& dir : {sys_.root(), sys_.root() + "/var", sys_.root() + "/var/run",
                                   sys_.Vol(""), sys_.Vol("docs")}) {
      MakeParentDirs(dir + "/x");
      ::chmod(dir.c_str(), 0755);
    }
    // Readable by all; by the team group only; by root only; and links in and out of the share.
    test::WriteFile(sys_.Vol("docs/public/report.txt"), "quarterly zebrafish numbers\n");
    test::WriteFile(sys_.Vol("docs/team/notes.txt"), "zebrafish team notes\n");
    test::WriteFile(sys_.Vol("docs/secret/plan.txt"), "zebrafish secret plan\n");
    const gid_t team = ::getgrnam(users_.team.c_str())->gr_gid;
    ASSERT_EQ(::chown(sys_.Vol("docs/team").c_str(), 0, team), 0);
    ASSERT_EQ(::chown(sys_.Vol("docs/team/notes.txt").c_str(), 0, team), 0);
    ::chmod(sys_.Vol("docs/team").c_str(), 0750);
    ::chmod(sys_.Vol("docs/team/notes.txt").c_str(), 0640);
    ::chmod(sys_.Vol("docs/secret").c_str(), 0700);
    ASSERT_EQ(::symlink("/etc/passwd", sys_.Vol("docs/public/out").c_str()), 0);
    ASSERT_EQ(::symlink("../secret", sys_.Vol("docs/public/in").c_str()), 0);
    RunningSystemTest::SetUp();
    port_ = FreePort();
    webd_ = std::make_unique<test::ChildProcess>(
        sys_.root(), std::vector<std::string>{WEBD_BIN, "--foreground", "--port",
                                              std::to_string(port_), "--www", WEBD_WWW,
                                              "--pam-dir", WEBD_PAM_DIR, "--pam-service",
                                              "fileindex-web.pam"});
    ASSERT_TRUE(test::WaitFor([&] { return Raw(port_, "GET / HTTP/1.1\r\n\r\n").status == 200; },
                              20000));
  }

  Browser Signed(const std::string& user) {
    Browser b{port_, "", ""};
    EXPECT_EQ(b.SignIn(user, ScopedUsers::kPassword).status, 200);
    return b;
  }

  // The administrator adds the share's folder through the page and waits until it is finished.
  void IndexDocs() {
    const Browser admin = Signed(users_.admin);
    ASSERT_EQ(admin.Call("POST", "/api/admin/folders", R"({"path": "/docs", "document": true})").status,
              200);
    ASSERT_TRUE(test::WaitFor(
        [&] {
          const Json::Value st = admin.Call("GET", "/api/admin/status").json();
          return st["folders"][0]["additional"]["status"]["text"] == "finished" &&
                 !admin.Found("q=zebrafish").empty();
        },
        60000))
        << admin.Call("GET", "/api/admin/status").body;
  }

  ScopedUsers users_;
  uint16_t port_ = 0;
  std::unique_ptr<test::ChildProcess> webd_;
};

TEST_F(WebdTest, EachUserFindsAndDownloadsOnlyWhatTheyMayOpen) {
  IndexDocs();
  Browser user{port_, "", ""};
  EXPECT_EQ(user.SignIn(users_.user, "wrong").status, 401);
  const Response in = user.SignIn(users_.user, ScopedUsers::kPassword);
  ASSERT_EQ(in.status, 200) << in.body;
  EXPECT_NE(in.headers.at("set-cookie").find("HttpOnly"), std::string::npos);
  EXPECT_NE(in.headers.at("set-cookie").find("SameSite=Strict"), std::string::npos);
  EXPECT_FALSE(in.json()["admin"].asBool());

  const std::string pub = sys_.Vol("docs/public/report.txt");
  const std::string team = sys_.Vol("docs/team/notes.txt");
  EXPECT_EQ(user.Found("q=zebrafish"), (std::set<std::string>{pub, team}));
  EXPECT_EQ(user.Found("q=zebra*&ext=txt&sort=name"), (std::set<std::string>{pub, team}));
  EXPECT_EQ(Signed(users_.admin).Found("q=secret"), std::set<std::string>{});
  const Json::Value hit = user.Call("GET", "/api/search?q=quarterly").json()["hits"][0];
  EXPECT_EQ(hit["folder"], sys_.Vol("docs/public"));
  EXPECT_NE(hit["snippet"].asString().find("<b>quarterly</b>"), std::string::npos);
  const Json::Value words = user.Call("GET", "/api/suggest?prefix=zeb").json()["suggestions"];
  ASSERT_EQ(words.size(), 1u);
  EXPECT_EQ(words[0], "zebrafish");
  EXPECT_EQ(user.Call("GET", "/api/suggest?prefix=secr").json()["suggestions"].size(), 0u);

  // Downloads: the team's file through the user's supplementary group; nothing else.
  const Response file = user.Call("GET", "/api/download?path=" + team);
  EXPECT_EQ(file.status, 200);
  EXPECT_EQ(file.body, "zebrafish team notes\n");
  EXPECT_EQ(file.headers.at("content-type"), "text/plain; charset=UTF-8");
  EXPECT_NE(file.headers.at("content-disposition").find("attachment; filename=\"notes.txt\""),
            std::string::npos);
  const std::map<std::string, int> refused = {
      {sys_.Vol("docs/secret/plan.txt"), 403},           // root's own folder
      {sys_.Vol("docs/public/out"), 403},                // a link out of the share
      {sys_.Vol("docs/public/in/plan.txt"), 403},        // through a link within it
      {sys_.Vol("docs/public/../secret/plan.txt"), 400}, // ".." in the path
      {sys_.Vol("docs/public/missing.txt"), 404},
      {"/etc/passwd", 403},                              // outside every indexed folder
      {"public/report.txt", 400},
  };
  for (const auto& [path, status] : refused) {
    const Response r = user.Call("GET", "/api/download?path=" + path);
    EXPECT_EQ(r.status, status) << path << ": " << r.body;
    EXPECT_EQ(r.body.find("zebrafish"), std::string::npos) << path;
  }
  // An administrator downloads with their own rights too.
  EXPECT_EQ(Signed(users_.admin).Call("GET", "/api/download?path=" + sys_.Vol("docs/secret/plan.txt")).status,
            403);
}

TEST_F(WebdTest, AdministrationIsForTheAdministratorsGroupAndEveryChangeCarriesTheToken) {
  const Browser user = Signed(users_.user);
  const std::vector<std::pair<std::string, std::string>> calls = {
      {"GET", "/api/admin/status"},   {"GET", "/api/admin/folders"},
      {"POST", "/api/admin/folders"}, {"PUT", "/api/admin/folders"},
      {"DELETE", "/api/admin/folders"}, {"GET", "/api/admin/browse?path=/docs"},
      {"POST", "/api/admin/reindex"}, {"POST", "/api/admin/pause"},
      {"POST", "/api/admin/resume"}};
  for (const auto& [method, target] : calls) {
    EXPECT_EQ(user.Call(method, target, R"({"path": "/docs", "paths": ["/docs"]})").status, 403)
        << method << " " << target;
  }
  Browser admin = Signed(users_.admin);
  EXPECT_EQ(admin.Call("GET", "/api/admin/browse?path=/").json()["folders"][0], "/docs");
  EXPECT_EQ(JsonToString(admin.Call("GET", "/api/admin/browse?path=/docs").json()["folders"]),
            R"(["/docs/public","/docs/secret","/docs/team"])");
  // Without the token, or with another session's, a change is refused and nothing happens.
  const Browser other = Signed(users_.admin);
  Browser forged = admin;
  forged.csrf = other.csrf;
  EXPECT_EQ(admin.Call("POST", "/api/admin/folders", R"({"path": "/docs"})", false).status, 403);
  EXPECT_EQ(forged.Call("POST", "/api/admin/folders", R"({"path": "/docs"})").status, 403);
  EXPECT_EQ(admin.Call("GET", "/api/admin/folders").json().size(), 0u);
  // A form of another site cannot send JSON.
  Response form = admin.Call("POST", "/api/admin/pause", "");
  EXPECT_EQ(form.status, 415);

  ASSERT_EQ(admin.Call("POST", "/api/admin/folders", R"({"path": "/docs", "photo": true})").status, 200);
  EXPECT_EQ(admin.Call("POST", "/api/admin/folders", R"({"path": "/docs"})").status, 400);
  EXPECT_EQ(admin.Call("PUT", "/api/admin/folders", R"({"path": "/docs", "audio": true})").status, 200);
  const Json::Value folder = admin.Call("GET", "/api/admin/folders").json()[0];
  EXPECT_TRUE(folder["photo"].asBool() && folder["audio"].asBool() && folder["document"].asBool());
  const int64_t until = ::time(nullptr) + 2 * 3600;
  ASSERT_EQ(admin.Call("POST", "/api/admin/pause", R"({"until": )" + std::to_string(until) + "}").status, 200);
  Json::Value st = admin.Call("GET", "/api/admin/status").json();
  EXPECT_TRUE(st["paused"].asBool());
  EXPECT_GE(st["resume_time"].asInt64(), until);
  ASSERT_EQ(admin.Call("POST", "/api/admin/resume", "{}").status, 200);
  EXPECT_FALSE(admin.Call("GET", "/api/admin/status").json()["paused"].asBool());
  EXPECT_EQ(admin.Call("POST", "/api/admin/reindex", R"({"paths": ["/docs"]})").status, 200);
  EXPECT_EQ(admin.Call("DELETE", "/api/admin/folders", R"({"paths": ["/docs"]})").status, 200);
  EXPECT_EQ(admin.Call("GET", "/api/admin/folders").json().size(), 0u);

  // Signing out ends the session at the server, whatever the browser keeps.
  EXPECT_EQ(admin.Call("POST", "/api/logout", "", false).status, 403);
  EXPECT_EQ(admin.Call("POST", "/api/logout").status, 200);
  EXPECT_EQ(admin.Call("GET", "/api/session").status, 401);
  EXPECT_EQ(admin.Call("GET", "/api/admin/status").status, 401);
}

TEST_F(WebdTest, FailedSignInsAreLimitedPerAccount) {
  Browser b{port_, "", ""};
  for (int i = 0; i < 5; ++i) EXPECT_EQ(b.SignIn(users_.user, "wrong").status, 401);
  // Now even the right password waits, and says how long.
  const Response r = b.SignIn(users_.user, ScopedUsers::kPassword);
  EXPECT_EQ(r.status, 429);
  EXPECT_GT(std::stoi(r.headers.at("retry-after")), 0);
  // Another account from the same address is not held by this one's failures.
  EXPECT_EQ(b.SignIn(users_.admin, ScopedUsers::kPassword).status, 200);
  EXPECT_EQ(b.SignIn("no-such-user-here", "x").status, 401);
}

TEST_F(WebdTest, BadRequestsAreAnsweredAndTheDaemonKeepsServing) {
  const Browser admin = Signed(users_.admin);
  const std::string huge(100 * 1024, 'x');
  struct Case {
    std::string request;
    int status;
  };
  const std::vector<Case> cases = {
      {"POST /api/login HTTP/1.1\r\nContent-Type: application/json\r\nContent-Length: " +
           std::to_string(huge.size()) + "\r\n\r\n" + huge, 413},
      {"GET / HTTP/1.1\r\nX-Big: " + huge + "\r\n\r\n", 431},
      {"POST /api/login HTTP/1.1\r\nContent-Type: application/json\r\nContent-Length: 9\r\n\r\n{\"user\":[", 400},
      {"GET /api/login HTTP/1.1\r\n\r\n", 405},
      {"DELETE /index.html HTTP/1.1\r\n\r\n", 405},
      {"GET /../../etc/passwd HTTP/1.1\r\n\r\n", 404},
      {"GET /api/search?q=x HTTP/1.1\r\n\r\n", 401},
      {"NONSENSE\r\n\r\n", 400},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Raw(port_, c.request).status, c.status) << c.request.substr(0, 60);
  }
  const std::map<std::string, int> searches = {
      {"", 400}, {"q=a&size=5000", 400}, {"kind=spreadsheet", 400}, {"folder=rel/ative", 400},
      {"q=a&sort=colour", 400}, {"min_size=-1", 400}, {"q=a&from=x", 400}};
  for (const auto& [query, status] : searches) {
    EXPECT_EQ(admin.Call("GET", "/api/search?" + query).status, status) << query;
  }

  // A thousand connections that send nothing: each is answered (refused) or held, and the
  // daemon still serves once they go.
  std::vector<UniqueFd> idle;
  for (int i = 0; i < 1000; ++i) {
    UniqueFd fd = Connect(port_);
    if (fd.valid()) idle.push_back(std::move(fd));
  }
  EXPECT_GT(idle.size(), 900u);
  idle.clear();
  ASSERT_TRUE(test::WaitFor([&] { return admin.Call("GET", "/api/session").status == 200; }, 20000));
  EXPECT_EQ(Raw(port_, "GET /app.js HTTP/1.1\r\n\r\n").status, 200);
}

// Beyond loopback only with a certificate; with one, HTTPS and a Secure cookie, and plain HTTP
// on that port gets nothing.
TEST_F(WebdTest, TlsWithTheConfiguredCertificate) {
  test::TempDir dir;
  const std::string pem = dir.Path("webd.pem");
  ASSERT_EQ(Shell("openssl req -x509 -newkey rsa:2048 -nodes -days 1 -subj /CN=127.0.0.1 "
                  "-keyout " + pem + " -out " + dir.Path("cert.pem") + " 2>/dev/null && cat " +
                  dir.Path("cert.pem") + " >> " + pem),
            0);
  const std::string base = std::string(WEBD_BIN) + " --foreground --www " + WEBD_WWW +
                           " --pam-dir " + WEBD_PAM_DIR + " --pam-service fileindex-web.pam";
  EXPECT_EQ(Shell("ORVANE_ROOT=" + sys_.root() + " " + base +
                  " --address 0.0.0.0 --port 0 --pid-file /var/run/webd2.pid 2>/dev/null"),
            2);
  EXPECT_EQ(Shell("ORVANE_ROOT=" + sys_.root() + " " + base +
                  " --port 0 --pid-file /var/run/webd3.pid --tls-certificate " +
                  dir.Path("missing.pem") + " 2>/dev/null"),
            1);
  const uint16_t port = FreePort();
  test::ChildProcess tls(sys_.root(), {WEBD_BIN, "--foreground", "--port", std::to_string(port),
                                       "--www", WEBD_WWW, "--pam-dir", WEBD_PAM_DIR,
                                       "--pam-service", "fileindex-web.pam", "--pid-file",
                                       "/var/run/webd-tls.pid", "--tls-certificate", pem});
  const std::string curl = "curl -sk -o /dev/null -w '%{http_code}' https://127.0.0.1:" +
                           std::to_string(port);
  ASSERT_TRUE(test::WaitFor([&] { return Shell(curl + "/ | grep -qx 200") == 0; }, 20000));
  EXPECT_EQ(Shell(curl + "/api/session | grep -qx 401"), 0);
  const std::string login = "curl -sk -D - -o /dev/null -H 'Content-Type: application/json' "
                            "-d '{\"user\":\"" + users_.user + "\",\"password\":\"" +
                            ScopedUsers::kPassword + "\"}' https://127.0.0.1:" +
                            std::to_string(port) + "/api/login";
  EXPECT_EQ(Shell(login + " | grep -q '^Set-Cookie: fi_session=.*; Secure'"), 0);
  EXPECT_EQ(Raw(port, "GET / HTTP/1.1\r\nConnection: close\r\n\r\n").status, 0);
}

// Headless Chromium from Debian, driven by browser_check.py; the screenshots land in the build
// folder (webd/screenshots).
TEST_F(WebdTest, APersonUsesThePageInABrowser) {
  test::WriteFile(sys_.Vol("docs/public/zebrafish-habitat.md"),
                  "Zebrafish live in rivers of South Asia; the habitat notes cover water and "
                  "temperature.\n");
  test::WriteFile(sys_.Vol("docs/public/feeding schedule.txt"),
                  "Feed the zebrafish twice a day, flakes in the morning.\n");
  test::WriteFile(sys_.Vol("docs/public/photos/zebrafish-tank.jpg"), "not really a photo");
  test::WriteFile(sys_.Vol("docs/public/photos/reef.png"), "not really a photo");
  const std::string out = WEBD_SCREENSHOTS;
  const std::string command = std::string("/usr/bin/python3 ") + WEBD_BROWSER_CHECK +
                              " http://127.0.0.1:" + std::to_string(port_) + "/ " +
                              users_.admin + " " + users_.user + " " + ScopedUsers::kPassword +
                              " /docs zebrafish " + out;
  EXPECT_EQ(Shell(command), 0) << "see " << out << "/failed.png";
}

TEST_F(WebdTest, AnEngineThatIsDownIsSaidSo) {
  const Browser user = Signed(users_.user);
  engine_.reset();
  const Response r = user.Call("GET", "/api/search?q=zebrafish");
  EXPECT_EQ(r.status, 503);
  EXPECT_NE(r.json()["error"]["message"].asString().find("quixelasticd"), std::string::npos);
}

}  // namespace
}  // namespace webd
}  // namespace orvane
