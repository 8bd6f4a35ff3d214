// Reconciliation of an indexed folder against the real engine, in a scratch root:
//   1. a full re-index of a folder of N files (default 100,000) that the index already holds,
//      for comparison;
//   2. the engine's listing of the folder alone (what the comparison reads from the index);
//   3. a reconciliation of the unchanged folder, warm (target: under 2 s for 100,000 files);
//   4. a reconciliation after 1% of the files changed size.
// The worker runs in this process (its pass, as the daemon runs it); the engine is a child.
// Built with the benchmarks, run by hand (a non-sanitized release build gives the real figures):
//   reconcile_bench [files]
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/reconciler.hpp"
#include "daemons/fileindexd/worker.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/queue_file.hpp"
#include "test/daemon_system.hpp"

namespace {

using orvane::fileindexd::EngineEntries;
using orvane::fileindexd::IndexedEntry;
using orvane::fileindexd::Worker;
using orvane::fileindexd::test::System;
using orvane::bench::Clock;
using orvane::bench::ProcessCpuSeconds;
using orvane::bench::Seconds;

// Queues one line and runs the worker's pass; the wall time of the pass.
double Pass(const System& sys, Worker& worker, const std::string& line) {
  if (!orvane::fileindex::QueueFileAppend(sys.Queue("docs"), line + "\n")) {
    std::fprintf(stderr, "cannot append to the queue\n");
    std::exit(1);
  }
  const auto start = Clock::now();
  if (!worker.RunPass()) {
    std::fprintf(stderr, "the pass failed: %s\n", orvane::JsonToString(worker.Report()).c_str());
    std::exit(1);
  }
  return Seconds(start, Clock::now());
}

// The CPU seconds this process and the engine spent since the last call.
std::string CpuSince(pid_t engine) {
  static double self_before = 0, engine_before = 0;
  const double self = ProcessCpuSeconds(0), eng = ProcessCpuSeconds(engine);
  char text[96];
  std::snprintf(text, sizeof(text), "CPU: worker %.2f s, engine %.2f s", self - self_before,
                eng - engine_before);
  self_before = self;
  engine_before = eng;
  return text;
}

// Writes a file whose folder exists.
void WriteSmall(const std::string& path, const std::string& text) {
  const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0 || write(fd, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
    std::perror(path.c_str());
    std::exit(1);
  }
  close(fd);
}

void PrintReconcile(const char* what, double s, const Json::Value& report) {
  const Json::Value& r = report["last_reconcile"];
  std::printf("%-44s %7.3f s  (%llu compared, %llu added, %llu removed, %llu refreshed)\n", what, s,
              static_cast<unsigned long long>(r["compared"].asUInt64()),
              static_cast<unsigned long long>(r["added"].asUInt64()),
              static_cast<unsigned long long>(r["removed"].asUInt64()),
              static_cast<unsigned long long>(r["refreshed"].asUInt64()));
}

}  // namespace

int main(int argc, char** argv) {
  const int files = argc > 1 ? std::atoi(argv[1]) : 100000;
  constexpr int kPerDir = 1000;
  System sys({"docs"});
  sys.WriteFolders({System::Folder("/docs/a", false)});
  auto engine = sys.StartEngine();
  orvane::fileindex::elastic::ShareIndexCreate("docs");
  for (int i = 0; i < files; ++i) {
    const std::string dir = sys.Vol("docs/a/d" + std::to_string(i / kPerDir));
    if (i % kPerDir == 0) orvane::MakeParentDirs(dir + "/x");
    WriteSmall(dir + "/f" + std::to_string(i) + ".txt", "x");
  }
  const std::string folder = sys.Vol("docs/a");
  const std::string reindex = R"({"event": 65536, "is_dir": true, "path": ")" + folder + "\"}";
  const std::string reconcile = R"({"event": 65536, "is_dir": true, "path": ")" + folder +
                                R"(", "data": {"reconcile": true}})";
  Worker worker("docs", sys.Queue("docs"), Worker::PauseGate());

  std::printf("folder of %d files in %d directories\n", files, (files + kPerDir - 1) / kPerDir);
  const pid_t pid = engine->pid();
  CpuSince(pid);
  double s = Pass(sys, worker, reindex);
  std::printf("%-44s %7.3f s  %s\n", "first indexing", s, CpuSince(pid).c_str());
  s = Pass(sys, worker, reindex);
  std::printf("%-44s %7.3f s  %s\n", "full re-index of the indexed folder", s,
              CpuSince(pid).c_str());

  std::vector<double> listing;
  for (int run = 0; run < 3; ++run) {
    const auto start = Clock::now();
    EngineEntries index("docs", folder);
    IndexedEntry entry;
    size_t n = 0;
    while (index.Next(&entry)) ++n;
    listing.push_back(Seconds(start, Clock::now()));
    if (run == 0) std::printf("listing holds %zu documents\n", n);
  }
  std::sort(listing.begin(), listing.end());
  std::printf("%-44s %7.3f s  (median of 3; all 3: %s)\n", "engine listing of the folder",
              listing[1], CpuSince(pid).c_str());

  // The index keeps whole seconds: the reconciliations start in a second after the last write.
  const time_t written = time(nullptr);
  while (time(nullptr) == written) usleep(20000);
  std::vector<double> runs;
  Json::Value report;
  for (int run = 0; run < 3; ++run) {
    runs.push_back(Pass(sys, worker, reconcile));
    report = worker.Report();
  }
  std::sort(runs.begin(), runs.end());
  PrintReconcile("reconciliation, unchanged (median of 3)", runs[1], report);
  std::printf("%-44s %7.3f s / %7.3f s  (all 3: %s)\n", "  fastest / slowest", runs.front(),
              runs.back(), CpuSince(pid).c_str());

  for (int i = 0; i < files; i += 100) {
    WriteSmall(
        sys.Vol("docs/a/d" + std::to_string(i / kPerDir) + "/f" + std::to_string(i) + ".txt"),
        "changed");
  }
  const double changed = Pass(sys, worker, reconcile);
  PrintReconcile("reconciliation, 1% of the files changed", changed, worker.Report());
  std::printf("%-44s %s\n", "", CpuSince(pid).c_str());
  engine.reset();
  return 0;
}
