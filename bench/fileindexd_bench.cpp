// The indexing road end to end, with the three daemons as real processes in a scratch root:
//   1. first indexing of a 100,000-file tree by name and attributes (files per second);
//   2. delay from a file's close-write to its appearance in a search (median, 95th percentile);
//   3. a burst of 100,000 changes (ten writes to each of 10,000 files), coalesced and applied;
//   4. first indexing with contents of a mixed text corpus (UTF-8 and Latin-1 text, CSV, HTML,
//      Markdown; MB and files per second);
//   5. peak memory (VmHWM) of each daemon.
// Built with the benchmarks, run by hand (a non-sanitized release build gives the real figures):
//   fileindexd_bench [files]
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/test_system.hpp"
#include "fileindex/index_mgr.hpp"

namespace {

using orvane::fileindexd::test::ChildProcess;
using orvane::fileindexd::test::System;
using orvane::fileindexd::test::WaitFor;
using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point a, Clock::time_point b) {
  return std::chrono::duration<double>(b - a).count();
}

int64_t Documents(const std::string& id) {
  try {
    const Json::Value list = System::Engine("index_list", Json::Value());
    for (const auto& index : list["data"]) {
      if (index["id"] == id) return index["documents"].asInt64();
    }
  } catch (const std::exception&) {
  }
  return -1;
}

long PeakKb(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return std::strtol(line.c_str() + 6, nullptr, 10);
  }
  return -1;
}

// User plus system CPU seconds the process has used so far.
double CpuSeconds(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  const size_t close = text.rfind(')');
  if (close == std::string::npos) return -1;
  std::istringstream rest(text.substr(close + 2));
  std::string field;
  unsigned long long utime = 0, stime = 0;
  for (int i = 3; i <= 15 && rest >> field; ++i) {
    if (i == 14) utime = std::stoull(field);
    if (i == 15) stime = std::stoull(field);
  }
  return double(utime + stime) / sysconf(_SC_CLK_TCK);
}

bool Searchable(const std::string& name) {
  Json::Value q(Json::objectValue);
  q["name"] = name;
  q["id"] = "fileindex_bench";
  try {
    return System::Engine("search", q)["data"]["total"].asInt() > 0;
  } catch (const std::exception&) {
    return false;
  }
}

}  // namespace

int main(int argc, char** argv) {
  const int files = argc > 1 ? std::atoi(argv[1]) : 100000;
  constexpr int kPerDir = 1000;
  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
  System sys({"bench", "content"});
  sys.WriteFolders(Json::Value(Json::arrayValue));
  const std::string tree = sys.Vol("bench/tree");
  for (int i = 0; i < files; ++i) {
    const std::string dir = tree + "/d" + std::to_string(i / kPerDir);
    if (i % kPerDir == 0) orvane::MakeParentDirs(dir + "/x");
    std::ofstream(dir + "/f" + std::to_string(i) + ".txt") << i;
  }
  const int dirs = (files + kPerDir - 1) / kPerDir;
  // The content corpus: 2,000 files of 2 to 64 KiB of words in five formats.
  constexpr int kContentFiles = 2000;
  const char* const kExts[] = {".txt", ".csv", ".html", ".md", ".log"};
  const char* const kWords[] = {"invoice", "quarterly", "revenue", "holiday", "garden",
                                "report",  "meeting",   "budget",  "caf\xe9", "na\xefve"};
  uint64_t content_bytes = 0;
  unsigned seed = 7;
  for (int i = 0; i < kContentFiles; ++i) {
    const std::string path = sys.Vol("content/c" + std::to_string(i % 20) + "/doc" +
                                     std::to_string(i) + kExts[i % 5]);
    orvane::MakeParentDirs(path);
    const size_t size = 2048 + (seed = seed * 1103515245u + 12345u) % (62 * 1024);
    std::string text;
    if (i % 5 == 2) text = "<html><body><p>";
    while (text.size() < size) {
      // Every third file is Latin-1: its accented words are single bytes.
      std::string word = kWords[(seed = seed * 1103515245u + 12345u) % 10];
      if (i % 3 != 0) {
        std::string utf8;
        for (unsigned char c : word) {
          if (c < 0x80) {
            utf8 += char(c);
          } else {
            utf8 += char(0xC0 | (c >> 6));
            utf8 += char(0x80 | (c & 0x3F));
          }
        }
        word = utf8;
      }
      text += word + (i % 5 == 1 ? "," : " ");
      if (text.size() % 80 < 8) text += "\n";
    }
    std::ofstream(path) << text;
    content_bytes += text.size();
  }
  auto engine = sys.StartEngine();
  auto notifyd = sys.StartNotifyd();
  auto indexd = sys.StartIndexd();

  // 1. First indexing.
  Json::Value add(Json::arrayValue);
  add.append(System::Folder("/bench/tree", false));
  const auto t0 = Clock::now();
  orvane::fileindex::FolderAdd(add, false);
  const int64_t want = files + dirs + 1;
  WaitFor([&] { return Documents("fileindex_bench") >= want; }, 3600 * 1000);
  const double first = Seconds(t0, Clock::now());
  std::printf("first indexing: %d files (+%d folders) in %.2f s = %.0f files/s\n", files, dirs,
              first, files / first);
  std::printf("  CPU seconds so far: quixelasticd %.2f, quixnotifyd %.2f, fileindexd %.2f\n",
              CpuSeconds(engine->pid()), CpuSeconds(notifyd->pid()), CpuSeconds(indexd->pid()));

  // 2. Close-write to searchable.
  std::vector<double> delays;
  for (int i = 0; i < 100; ++i) {
    const std::string name = "latency_probe_" + std::to_string(i) + ".txt";
    std::ofstream(tree + "/" + name) << i;  // closed here
    const auto start = Clock::now();
    WaitFor([&] { return Searchable(name); }, 30000);
    delays.push_back(Seconds(start, Clock::now()));
    usleep(20000);
  }
  std::sort(delays.begin(), delays.end());
  std::printf("close-write to searchable: median %.0f ms, p95 %.0f ms (100 files, polled every"
              " 20 ms)\n",
              delays[delays.size() / 2] * 1000, delays[delays.size() * 95 / 100] * 1000);

  // 3. A burst of changes: ten writes to each of 10,000 files.
  const int burst_files = std::min(files, 10000);
  const auto b0 = Clock::now();
  for (int round = 0; round < 10; ++round) {
    for (int i = 0; i < burst_files; ++i) {
      std::ofstream(tree + "/d" + std::to_string(i / kPerDir) + "/f" + std::to_string(i) +
                    ".txt")
          << round << "-" << i;
    }
  }
  const auto b1 = Clock::now();
  const std::string queue = sys.Queue("bench");
  WaitFor(
      [&] {
        // Drained: neither file exists for a moment longer than the watcher's flush delay.
        if (orvane::IsFileExist(queue) || orvane::IsFileExist(queue + ".tmp")) return false;
        usleep(300000);
        return !orvane::IsFileExist(queue) && !orvane::IsFileExist(queue + ".tmp");
      },
      3600 * 1000);
  const auto b2 = Clock::now();
  std::printf("burst: %d changes written in %.2f s, applied %.2f s after the last write"
              " (%.2f s in all)\n",
              burst_files * 10, Seconds(b0, b1), Seconds(b1, b2) - 0.3, Seconds(b0, b2) - 0.3);

  // 4. Contents.
  Json::Value content(Json::arrayValue);
  content.append(System::Folder("/content", true));
  const auto c0 = Clock::now();
  orvane::fileindex::FolderAdd(content, false);
  WaitFor([&] { return Documents("fileindex_content") >= kContentFiles + 21; }, 3600 * 1000);
  const double with_content = Seconds(c0, Clock::now());
  std::printf("first indexing with contents: %d files, %.1f MB in %.2f s = %.2f MB/s, %.0f files/s\n",
              kContentFiles, content_bytes / 1e6, with_content,
              content_bytes / 1e6 / with_content, kContentFiles / with_content);

  std::printf("peak memory (VmHWM): quixelasticd %ld KiB, quixnotifyd %ld KiB, fileindexd %ld KiB\n",
              PeakKb(engine->pid()), PeakKb(notifyd->pid()), PeakKb(indexd->pid()));
  indexd->Signal(SIGTERM);
  notifyd->Signal(SIGTERM);
  engine->Signal(SIGTERM);
  return 0;
}
