// Figures of the search engine under hostile input, through its real sockets: searches for a
// word one document repeats `repeats` times (relevance order, snippets), the cost SQLite's own
// snippet function had on a tenth of that document, and how quickly the main socket and
// another user's search are served while another process holds 400 idle connections to the
// public socket.
//
//   search_limits_bench [repeats=200000 [documents=1000]]
//
// The engine and server run in this process on sockets below a scratch ORVANE_ROOT. Run it as
// root: the flood runs as nobody, as a hostile local user would.
#include <poll.h>
#include <pwd.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "platform/daemon_sock.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::Cmd;
using orvane::bench::CpuSeconds;
using orvane::bench::Median;
using orvane::bench::Request;
using orvane::bench::Seconds;

const char kId[] = "fileindex_bench";

Json::Value Upsert(const std::string& path, const std::string& content) {
  const std::string name = path.substr(path.rfind('/') + 1);
  const std::string parent = path.substr(0, path.rfind('/'));
  Json::Value d;
  d["QUIXMDPath"] = path;
  d["QUIXMDFSName"] = name;
  d["QUIXMDParent"] = parent;
  d["QUIXMDDisplayName"] = name;
  d["QUIXMDExtension"] = "txt";
  d["QUIXMDSearchFileName"] = name;
  d["QUIXMDSearchAncestor"] = parent;
  d["QUIXMDIsDir"] = false;
  d["QUIXMDFSSize"] = static_cast<Json::Int64>(content.size());
  d["QUIXMDTextContent"] = content;
  Json::Value data;
  data["id"] = kId;
  data["doc_id"] = path;
  data["data"] = d;
  return Cmd("document_upsert_by_id", data);
}

// Wall and CPU seconds of five searches for `keyword`, medians.
void TimeSearch(const std::string& socket, const std::string& label, const std::string& keyword,
                const std::string& sort) {
  Json::Value data;
  data["keyword"] = keyword;
  data["size"] = 20;
  data["sort"] = sort;
  std::vector<double> walls, cpus;
  int64_t total = 0;
  for (int i = 0; i < 5; ++i) {
    const auto start = Clock::now();
    const double cpu = CpuSeconds();
    total = Request(socket, Cmd("search", data))["data"]["total"].asInt64();
    walls.push_back(Seconds(start));
    cpus.push_back(CpuSeconds() - cpu);
  }
  std::printf("%-44s %6lld hits  median %7.1f ms wall, %7.1f ms CPU (max %.1f ms wall)\n",
              label.c_str(), static_cast<long long>(total), Median(walls) * 1e3, Median(cpus) * 1e3,
              *std::max_element(walls.begin(), walls.end()) * 1e3);
}

// SQLite's own snippet() on one document of `repeats` repetitions, in a scratch database.
double BuiltinSnippetSeconds(int repeats) {
  sqlite3* db = nullptr;
  sqlite3_open(":memory:", &db);
  sqlite3_exec(db,
               "CREATE VIRTUAL TABLE t USING fts5(text, tokenize='unicode61 remove_diacritics 2')",
               nullptr, nullptr, nullptr);
  std::string text;
  for (int i = 0; i < repeats; ++i) text += "hello ";
  sqlite3_stmt* st = nullptr;
  sqlite3_prepare_v2(db, "INSERT INTO t(rowid, text) VALUES(1, ?)", -1, &st, nullptr);
  sqlite3_bind_text(st, 1, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
  sqlite3_step(st);
  sqlite3_finalize(st);
  sqlite3_prepare_v2(db,
                     "SELECT snippet(t, 0, '<b>', '</b>', '...', 12) FROM t WHERE t MATCH 'hello'",
                     -1, &st, nullptr);
  const double cpu = CpuSeconds();
  sqlite3_step(st);
  const double used = CpuSeconds() - cpu;
  sqlite3_finalize(st);
  sqlite3_close(db);
  return used;
}

// A child process, as `uid`, holding `count` idle connections to `socket` until told to stop
// (its pipe closes) or 60 s pass. Returns its pid once the connections are open.
pid_t StartFlood(const std::string& socket, int count, uid_t uid, gid_t gid, int* release) {
  int ready[2], stop[2];
  if (::pipe(ready) != 0 || ::pipe(stop) != 0) std::exit(1);
  const pid_t pid = ::fork();
  if (pid == 0) {
    ::close(ready[0]);
    ::close(stop[1]);
    if (::setgid(gid) != 0 || ::setuid(uid) != 0) _exit(3);
    std::vector<std::unique_ptr<quixdaemon::DomainSockConnection>> conns;
    for (int i = 0; i < count; ++i) {
      conns.emplace_back(new quixdaemon::DomainSockConnection(socket));
      conns.back()->Connect(0);
    }
    if (::write(ready[1], "x", 1) != 1) _exit(4);
    struct pollfd p = {stop[0], POLLIN, 0};
    ::poll(&p, 1, 60000);
    _exit(0);
  }
  ::close(ready[1]);
  ::close(stop[0]);
  char c;
  if (::read(ready[0], &c, 1) != 1) std::exit(1);
  ::close(ready[0]);
  *release = stop[1];
  return pid;
}

}  // namespace

int main(int argc, char** argv) {
  const int repeats = argc > 1 ? std::atoi(argv[1]) : 200000;
  const int documents = argc > 2 ? std::atoi(argv[2]) : 1000;
  // The flood runs as nobody, who must reach the public socket below the scratch root.
  const std::string dir = orvane::bench::ScratchRoot("search-limits-bench", true);
  if (dir.empty()) return 1;
  orvane::bench::InProcessEngine engine(dir);
  engine.Serve(true);
  const std::string main_socket = engine.socket();
  const std::string public_socket = engine.public_socket();

  Request(main_socket, orvane::bench::FileIndexCreate(kId, dir + "/db"));
  std::string text;
  for (int i = 0; i < repeats; ++i) text += "hello ";
  text += "the quarterly figures";
  Request(main_socket, Upsert("/volume1/share/all-hello.txt", text));
  Json::Value batch;
  for (int i = 0; i < documents; ++i) {
    batch["compound"].append(
        Upsert("/volume1/share/doc" + std::to_string(i) + ".txt",
               "hello world number " + std::to_string(i) + " of the quarterly report"));
  }
  if (documents > 0) Request(main_socket, batch);
  Json::Value commit;
  commit["id"] = kId;
  Request(main_socket, Cmd("commit", commit));

  std::printf("SQLite %s; one document of %d repetitions of one word and %d ordinary ones\n",
              sqlite3_libversion(), repeats, documents);
  // By name the repeated document comes first, so its snippet is made on every run; by
  // relevance every match is ranked.
  TimeSearch(public_socket, "\"hello\", by name", "hello", "name");
  TimeSearch(public_socket, "\"hello\", by relevance", "hello", "relevance");
  TimeSearch(public_socket, "\"quarterly hello\", by name", "quarterly hello", "name");
  TimeSearch(public_socket, "\"hel*\" (prefix), by name", "hel*", "name");
  std::printf("%-44s %.2f CPU s\n",
              ("SQLite's snippet() on " + std::to_string(repeats / 10) + " repetitions").c_str(),
              BuiltinSnippetSeconds(repeats / 10));

  const struct passwd* nobody = ::getpwnam("nobody");
  if (::geteuid() != 0 || nobody == nullptr) {
    std::printf("flood: skipped (run as root, with a nobody account)\n");
    return 0;
  }
  int release = -1;
  const pid_t flood = StartFlood(public_socket, 400, nobody->pw_uid, nobody->pw_gid, &release);
  std::vector<double> main_waits, search_waits;
  for (int i = 0; i < 20; ++i) {
    auto start = Clock::now();
    Request(main_socket, Upsert("/volume1/share/during" + std::to_string(i) + ".txt", "flood"));
    Request(main_socket, Cmd("commit", commit));
    main_waits.push_back(Seconds(start));
    start = Clock::now();
    Json::Value data;
    data["keyword"] = "flood";
    const int64_t found = Request(public_socket, Cmd("search", data))["data"]["total"].asInt64();
    search_waits.push_back(Seconds(start));
    if (found != i + 1) std::fprintf(stderr, "the document written is not found\n");
  }
  std::printf(
      "during a flood of 400 idle connections by nobody: upsert and commit on the main"
      " socket median %.1f ms, max %.1f ms; root's search on the public socket median"
      " %.1f ms, max %.1f ms\n",
      Median(main_waits) * 1e3, *std::max_element(main_waits.begin(), main_waits.end()) * 1e3,
      Median(search_waits) * 1e3,
      *std::max_element(search_waits.begin(), search_waits.end()) * 1e3);
  ::close(release);
  int status = 0;
  ::waitpid(flood, &status, 0);
  engine.Stop();
  return 0;
}
