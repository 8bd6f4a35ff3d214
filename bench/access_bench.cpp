// What the search-time permission check costs: searches as an ordinary user (nobody) against
// searches as root over the same real files, and the check alone per hit.
//
//   access_bench [folders=100 [files per folder=200]]
//
// Run as root. The files are real (empty) files in a scratch share under /tmp: one folder in
// ten closed to others (0700), one file in ten with an ACL that denies nobody. The engine runs
// in this process and is asked directly, without the socket.
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "common/json_util.hpp"
#include "daemons/quixelasticd/access.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::Cmd;
using orvane::elasticd::Caller;

double Millis(Clock::time_point since) { return orvane::bench::Seconds(since) * 1e3; }

struct Figures {
  double p50, p95, max;
  int64_t mean_total;
};

Figures Measure(orvane::elasticd::Engine& engine, const Caller& caller,
                const std::vector<std::string>& names) {
  std::vector<double> ms;
  int64_t totals = 0;
  for (const std::string& name : names) {
    Json::Value data;
    data["name"] = name;
    data["size"] = 50;
    const auto t = Clock::now();
    const Json::Value reply = engine.HandleValue(Cmd("search", data), caller);
    ms.push_back(Millis(t));
    if (!reply["success"].asBool()) {
      std::fprintf(stderr, "search failed: %s\n", orvane::JsonToString(reply).c_str());
      std::exit(1);
    }
    totals += reply["data"]["total"].asInt64();
  }
  std::sort(ms.begin(), ms.end());
  return {ms[ms.size() / 2], ms[ms.size() * 95 / 100], ms.back(),
          totals / static_cast<int64_t>(names.size())};
}

}  // namespace

int main(int argc, char** argv) {
  const int folders = argc > 1 ? std::atoi(argv[1]) : 100;
  const int per_folder = argc > 2 ? std::atoi(argv[2]) : 200;
  const struct passwd* nobody = ::getpwnam("nobody");
  if (::geteuid() != 0 || nobody == nullptr || folders < 1 || per_folder < 1) {
    std::fprintf(stderr, "run as root, on a system with a user nobody\n");
    return 2;
  }
  const std::string dir = orvane::bench::ScratchRoot("access-bench", true);
  if (dir.empty()) return 1;
  const std::string share = dir + "/share";
  ::mkdir(share.c_str(), 0755);

  orvane::bench::InProcessEngine in_process(dir);
  orvane::elasticd::Engine& engine = in_process.engine();
  const Caller root{0, 0, true};
  const Caller user{nobody->pw_uid, nobody->pw_gid, false};
  engine.HandleValue(
      orvane::bench::FileIndexCreate("fileindex_share", share + "/@eaDir/@fileindex/db"), root);

  const auto start = Clock::now();
  std::vector<std::string> paths;
  for (int f = 0; f < folders; ++f) {
    const std::string folder = share + "/folder" + std::to_string(f);
    ::mkdir(folder.c_str(), f % 10 == 9 ? 0700 : 0755);
    Json::Value batch;
    for (int i = 0; i < per_folder; ++i) {
      const int n = f * per_folder + i;
      const std::string path = folder + "/report " + std::to_string(n) + ".txt";
      FILE* file = std::fopen(path.c_str(), "w");
      if (file == nullptr) return 1;
      std::fclose(file);
      ::chmod(path.c_str(), 0644);
      paths.push_back(path);
      Json::Value sub;
      sub["command"] = "document_upsert_by_id";
      sub["data"]["id"] = "fileindex_share";
      sub["data"]["doc_id"] = path;
      Json::Value& doc = sub["data"]["data"];
      doc["QUIXMDPath"] = path;
      doc["QUIXMDFSName"] = "report " + std::to_string(n) + ".txt";
      doc["QUIXMDParent"] = folder;
      doc["QUIXMDSearchFileName"] = doc["QUIXMDFSName"];
      doc["QUIXMDSearchAncestor"] = folder;
      doc["QUIXMDExtension"] = "txt";
      batch["compound"].append(sub);
    }
    engine.HandleValue(batch, root);
    const std::string acl = "setfacl -m u:nobody:--- '" + folder + "'/report*[0-9]0.txt";
    if (std::system(acl.c_str()) != 0) {
      std::fprintf(stderr, "setfacl failed\n");
      return 1;
    }
  }
  Json::Value commit;
  commit["id"] = "fileindex_share";
  engine.HandleValue(Cmd("commit", commit), root);
  std::printf("%zu files in %d folders made and indexed in %.1f s\n", paths.size(), folders,
              Millis(start) / 1000);

  // Substrings of the names: "report" matches every file (the user's search then inspects
  // every row up to its scan limit), numbers of 2 to 4 digits match from a few to a thousand.
  std::mt19937 rng(7);
  std::vector<std::string> names(300);
  for (size_t q = 0; q < names.size(); ++q) {
    if (q % 10 == 0) {
      names[q] = "report";
    } else {
      const std::string n = std::to_string(rng() % paths.size());
      names[q] = n.substr(0, std::min<size_t>(n.size(), 2 + rng() % 3));
    }
  }
  for (int pass = 0; pass < 2; ++pass) {
    const Figures r = Measure(engine, root, names);
    const Figures u = Measure(engine, user, names);
    std::printf(
        "name search, 300 queries, page of 50: root p50 %.1f ms, p95 %.1f ms, max %.1f"
        " ms, mean total %lld; nobody p50 %.1f ms, p95 %.1f ms, max %.1f ms, mean total"
        " %lld\n",
        r.p50, r.p95, r.max, static_cast<long long>(r.mean_total), u.p50, u.p95, u.max,
        static_cast<long long>(u.mean_total));
  }

  for (int pass = 0; pass < 3; ++pass) {
    const auto t = Clock::now();
    orvane::elasticd::AccessChecker checker(nobody->pw_uid, nobody->pw_gid);
    size_t shown = 0;
    for (const std::string& path : paths) shown += checker.CanOpen(path) ? 1 : 0;
    const double ms = Millis(t);
    std::printf(
        "the check alone, one request over every file: %.1f ms, %.2f us per file, %zu"
        " of %zu shown\n",
        ms, ms * 1000 / paths.size(), shown, paths.size());
  }
  in_process.Stop();
  std::system(("rm -rf '" + dir + "'").c_str());
  return 0;
}
