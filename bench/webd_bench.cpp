// Latency of the web page's search API end to end, as a signed-in ordinary user: HTTP requests
// on one kept-alive connection, through the web daemon (which connects to the engine's public
// socket with the user's credentials) and back, over an index of many file documents. Every
// document a search of the run can match has its file on disk, so the engine's permission
// check passes each hit as it does for real users; the others (which no search matches, so
// none is ever checked) are documents only, which keeps the set-up to seconds.
//
//   webd_bench [documents=1000000 [searches=200]]     (as root; a user is made and removed)
//
// The engine, its server and the web daemon's server run in this process below a scratch
// ORVANE_ROOT.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "common/fd.hpp"
#include "daemons/http/server.hpp"
#include "daemons/webd/web_app.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::Cmd;
using orvane::bench::Seconds;

const char kId[] = "fileindex_bench";
const char kPassword[] = "Bench-pass-7";

int Shell(const std::string& command) {
  const int rc = std::system(command.c_str());
  return WIFEXITED(rc) ? WEXITSTATUS(rc) : -1;
}

// The ordinary user the searches are made as; removed at the end.
struct BenchUser {
  BenchUser() {
    ok = Shell("useradd -M -N -s /usr/sbin/nologin " + name) == 0 &&
         Shell("echo '" + name + ":" + kPassword + "' | chpasswd") == 0;
  }
  ~BenchUser() { Shell("userdel " + name + " 2>/dev/null"); }
  const std::string name = "fiwebb" + std::to_string(::getpid());
  bool ok = false;
};

std::string DirOf(const std::string& share, uint64_t i) {
  return share + "/d" + std::to_string(i / 1000);
}

// The number in the name of document i.
uint64_t NumberOf(uint64_t i) {
  const std::string name = orvane::bench::SyntheticName(i);
  const size_t end = name.rfind('.');
  const size_t start = name.rfind('_', end) + 1;
  return std::strtoull(name.substr(start, end - start).c_str(), nullptr, 10);
}

// The files the searches can find, empty, readable by all (the engine hides hits whose file is
// gone): those holding a rare word, and those whose name has one of `numbers`.
uint64_t MakeFiles(const std::string& share, uint64_t count, const std::set<uint64_t>& numbers) {
  uint64_t made = 0;
  for (uint64_t i = 0; i < count; ++i) {
    const std::string dir = DirOf(share, i);
    if (i % 1000 == 0) ::mkdir(dir.c_str(), 0755);
    if (i % 400 != 0 && numbers.count(NumberOf(i)) == 0) continue;
    ++made;
    const orvane::UniqueFd fd(
        ::open((dir + "/" + orvane::bench::SyntheticName(i)).c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
    if (!fd.valid()) {
      std::perror(dir.c_str());
      std::exit(1);
    }
  }
  return made;
}

// A signed-in browser's searches on one kept-alive connection.
class Browser {
 public:
  explicit Browser(uint16_t port) : http_(port) {}

  void SignIn(const std::string& user) {
    const std::string body =
        R"({"user": ")" + user + R"(", "password": ")" + kPassword + R"("})";
    std::string reply;
    const std::string head = http_.Exchange(
        "POST /api/login HTTP/1.1\r\nHost: 127.0.0.1\r\nContent-Type: application/json\r\n"
        "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n" + body,
        &reply);
    const size_t at = head.find("fi_session=") + 11;
    cookie_ = head.substr(at, head.find(';', at) - at);
  }

  // One search; the number of hits the reply's total gives.
  long Search(const std::string& query) {
    std::string reply;
    http_.Exchange("GET /api/search?" + query + " HTTP/1.1\r\nHost: 127.0.0.1\r\nCookie: "
                   "fi_session=" + cookie_ + "\r\n\r\n",
                   &reply);
    return std::strtol(reply.c_str() + reply.find("\"total\":") + 8, nullptr, 10);
  }

 private:
  orvane::bench::HttpClient http_;
  std::string cookie_;
};

void Measure(const char* what, Browser* browser, const std::vector<std::string>& queries) {
  std::vector<double> ms;
  long hits = 0;
  for (const std::string& q : queries) {
    const auto start = Clock::now();
    hits += browser->Search(q);
    ms.push_back(Seconds(start) * 1000);
  }
  orvane::bench::PrintLatency(what, std::move(ms), hits);
}

}  // namespace

int main(int argc, char** argv) {
  const uint64_t total = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 1000000;
  const size_t searches = argc > 2 ? std::strtoul(argv[2], nullptr, 10) : 200;
  const BenchUser user;
  if (!user.ok) {
    std::fprintf(stderr, "cannot make the user %s (run as root)\n", user.name.c_str());
    return 1;
  }
  const std::string dir = orvane::bench::ScratchRoot("webd-bench", true);
  if (dir.empty()) return 1;
  const std::string share = dir + "/share";
  ::mkdir(share.c_str(), 0755);
  ::mkdir((dir + "/etc").c_str(), 0755);
  ::mkdir((dir + "/etc/orvane").c_str(), 0755);
  Shell("echo '{\"shares\": []}' > " + dir + "/etc/orvane/platform.json");

  std::mt19937_64 rng(7);
  std::vector<std::string> names, contents;
  std::set<uint64_t> numbers;
  for (size_t i = 0; i < searches; ++i) {
    // A name part of about 1 in 100,000 files, and a word of about 1 in 20,000.
    const uint64_t number = rng() % 100000;
    numbers.insert(number);
    names.push_back("name=_" + std::to_string(number) + ".&size=30");
    contents.push_back("q=" + orvane::bench::RareWord(rng() % 50) + "&size=30");
  }
  auto start = Clock::now();
  const uint64_t made = MakeFiles(share, total, numbers);
  std::printf("made %llu files in %.1f s\n", static_cast<unsigned long long>(made),
              Seconds(start));
  orvane::bench::InProcessEngine engine(dir);
  engine.Serve(true);
  for (const std::string& d : {dir + "/var", dir + "/var/run"}) ::chmod(d.c_str(), 0755);
  orvane::bench::Request(engine.socket(), orvane::bench::FileIndexCreate(kId, dir + "/db"));
  start = Clock::now();
  orvane::bench::LoadSynthetic(engine.socket(), kId, total,
                               [&share](uint64_t i) { return DirOf(share, i); });
  Json::Value commit;
  commit["id"] = kId;
  orvane::bench::Request(engine.socket(), Cmd("commit", commit));
  std::printf("loaded %llu documents in %.1f s\n", static_cast<unsigned long long>(total),
              Seconds(start));

  orvane::webd::WebOptions web;
  web.www_dir = WEBD_WWW;
  web.pam.name = "fileindex-web.pam";
  web.pam.dir = WEBD_PAM_DIR;
  web.engine_socket = engine.public_socket();
  orvane::webd::WebApp app(web);
  orvane::httpd::ServerOptions options;
  orvane::httpd::Server server(
      options, orvane::httpd::Handlers{
                   [&app](const orvane::httpd::Request& req, const orvane::httpd::Peer& peer) {
                     return app.Handle(req, peer);
                   },
                   orvane::webd::WebApp::Refused});
  server.Start();
  Browser http(server.port());
  http.SignIn(user.name);
  Measure("name (a part of the name)", &http, names);
  Measure("content (a rare word)", &http, contents);
  server.Stop();
  engine.Stop();
  Shell("rm -rf " + dir);
  return 0;
}
