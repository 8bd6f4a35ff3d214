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
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <set>
#include <string>
#include <thread>
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
const char* kWords[] = {"holiday", "report", "invoice",  "summer", "family", "project", "draft",
                        "final",   "budget", "meeting",  "photo",  "scan",   "notes",   "backup",
                        "music",   "video",  "contract", "slides", "thesis", "recipe"};
const char* kExts[] = {"jpg", "pdf", "docx", "mp3", "mp4", "txt", "xlsx", "png"};
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

std::string NameOf(uint64_t i) {
  std::mt19937_64 rng(i * 2654435761u + 17);
  std::string name = kWords[rng() % 20];
  name += "_";
  name += kWords[rng() % 20];
  name += "_" + std::to_string(rng() % 100000) + "." + kExts[rng() % 8];
  return name;
}

// A rare word: one document in about 20,000 holds each.
std::string RareWord(uint64_t i) { return "zq" + std::to_string(i % 50); }

std::string DirOf(const std::string& share, uint64_t i) {
  return share + "/d" + std::to_string(i / 1000);
}

// The number in the name of document i.
uint64_t NumberOf(uint64_t i) {
  const std::string name = NameOf(i);
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
        ::open((dir + "/" + NameOf(i)).c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
    if (!fd.valid()) {
      std::perror(dir.c_str());
      std::exit(1);
    }
  }
  return made;
}

void Load(const std::string& socket, const std::string& share, uint64_t count) {
  std::atomic<uint64_t> next{0};
  auto send = [&] {
    for (;;) {
      const uint64_t done = next.fetch_add(1000);
      if (done >= count) return;
      Json::Value req;
      for (uint64_t i = done; i < std::min(done + 1000, count); ++i) {
        const std::string dir = DirOf(share, i);
        const std::string name = NameOf(i);
        Json::Value& sub = req["compound"].append(Json::Value(Json::objectValue));
        sub["command"] = "document_upsert_by_id";
        Json::Value& data = sub["data"];
        data["id"] = kId;
        data["doc_id"] = dir + "/" + name;
        Json::Value& d = data["data"];
        d["QUIXMDPath"] = dir + "/" + name;
        d["QUIXMDFSName"] = name;
        d["QUIXMDParent"] = dir;
        d["QUIXMDSearchFileName"] = name;
        d["QUIXMDSearchAncestor"] = dir;
        d["QUIXMDExtension"] = name.substr(name.rfind('.') + 1);
        d["QUIXMDIsDir"] = false;
        d["QUIXMDFSSize"] = static_cast<Json::Int64>(i * 37 % 10000000);
        d["QUIXMDFSContentChangeDate"] = static_cast<Json::Int64>(1600000000 + i);
        d["QUIXMDTextContent"] = std::string(kWords[i % 20]) + " minutes of the " +
                                 kWords[(i / 20) % 20] + " " +
                                 (i % 400 == 0 ? RareWord(i / 400) : "plain");
      }
      if (orvane::bench::Request(socket, req)["has_fail"].asBool()) {
        std::fprintf(stderr, "a batch had failures\n");
        std::exit(1);
      }
    }
  };
  std::thread other(send);
  send();
  other.join();
}

class Http {
 public:
  explicit Http(uint16_t port) : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_port = htons(port);
    sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (::connect(fd_.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa) != 0) std::exit(1);
  }

  // One request; the reply's head and body, or exits when it is not a 200.
  std::string Call(const std::string& method, const std::string& target,
                   const std::string& body, std::string* head) {
    const std::string req = method + " " + target + "\r\nHost: 127.0.0.1\r\n" +
                            (cookie_.empty() ? "" : "Cookie: fi_session=" + cookie_ + "\r\n") +
                            "Content-Type: application/json\r\nContent-Length: " +
                            std::to_string(body.size()) + "\r\n\r\n" + body;
    if (::send(fd_.get(), req.data(), req.size(), MSG_NOSIGNAL) != ssize_t(req.size()))
      std::exit(1);
    std::string in;
    size_t head_end, length = 0;
    char buf[65536];
    for (;;) {
      head_end = in.find("\r\n\r\n");
      if (head_end != std::string::npos) {
        const size_t cl = in.find("Content-Length: ");
        length = std::strtoul(in.c_str() + cl + 16, nullptr, 10);
        if (in.size() >= head_end + 4 + length) break;
      }
      const ssize_t n = ::recv(fd_.get(), buf, sizeof buf, 0);
      if (n <= 0) std::exit(1);
      in.append(buf, size_t(n));
    }
    if (in.compare(0, 12, "HTTP/1.1 200") != 0) {
      std::fprintf(stderr, "%s: %s\n", target.c_str(), in.c_str());
      std::exit(1);
    }
    *head = in.substr(0, head_end);
    return in.substr(head_end + 4, length);
  }

  void SignIn(const std::string& user) {
    std::string head;
    Call("POST", "/api/login HTTP/1.1",
         R"({"user": ")" + user + R"(", "password": ")" + kPassword + R"("})", &head);
    const size_t at = head.find("fi_session=") + 11;
    cookie_ = head.substr(at, head.find(';', at) - at);
  }

  long Search(const std::string& query) {
    std::string head;
    const std::string body = Call("GET", "/api/search?" + query + " HTTP/1.1", "", &head);
    return std::strtol(body.c_str() + body.find("\"total\":") + 8, nullptr, 10);
  }

 private:
  orvane::UniqueFd fd_;
  std::string cookie_;
};

void Measure(const char* what, Http* http, const std::vector<std::string>& queries) {
  std::vector<double> ms;
  long hits = 0;
  for (const std::string& q : queries) {
    const auto start = Clock::now();
    hits += http->Search(q);
    ms.push_back(Seconds(start) * 1000);
  }
  std::sort(ms.begin(), ms.end());
  std::printf(
      "%-36s p50 %6.1f ms  p95 %6.1f ms  max %6.1f ms  (%zu searches, %.0f hits each on"
      " average)\n",
      what, ms[ms.size() / 2], ms[ms.size() * 95 / 100], ms.back(), ms.size(),
      double(hits) / double(ms.size()));
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
    contents.push_back("q=" + RareWord(rng() % 50) + "&size=30");
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
  Load(engine.socket(), share, total);
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
  Http http(server.port());
  http.SignIn(user.name);
  Measure("name (a part of the name)", &http, names);
  Measure("content (a rare word)", &http, contents);
  server.Stop();
  engine.Stop();
  Shell("rm -rf " + dir);
  return 0;
}
