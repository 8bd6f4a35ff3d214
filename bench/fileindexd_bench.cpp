// The indexing road end to end, with the three daemons as real processes in a scratch root:
//   1. first indexing of a 100,000-file tree by name and attributes (files per second);
//   2. delay from a file's close-write to its appearance in a search (median, 95th percentile);
//   3. a burst of 100,000 changes (ten writes to each of 10,000 files), coalesced and applied;
//   4. first indexing with contents of a mixed text corpus (UTF-8 and Latin-1 text, CSV, HTML,
//      Markdown; MB and files per second), then of small PDF, office (OOXML, OpenDocument), WAV
//      and PNG files (files per second), with the CPU time of the engine, the indexer and its
//      extraction helpers;
//   5. peak memory (VmHWM) of each daemon.
// Built with the benchmarks, run by hand (a non-sanitized release build gives the real figures):
//   fileindexd_bench [files]
#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "fileindex/index_mgr.hpp"
#include "test/daemon_system.hpp"
#include "test/sample_files.hpp"

namespace {

using orvane::fileindexd::test::ChildProcess;
using orvane::fileindexd::test::System;
using orvane::fileindexd::test::WaitFor;
using orvane::bench::Clock;
using orvane::bench::ProcessCpuSeconds;
using orvane::bench::Seconds;

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

// CPU seconds of the children of `pid` (its extraction helpers), the running and the reaped.
double ChildrenCpuSeconds(pid_t pid) {
  const std::string proc = "/proc/" + std::to_string(pid);
  double total = 0;
  std::ifstream stat(proc + "/stat");
  std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
  const size_t close = text.rfind(')');
  if (close != std::string::npos) {
    std::istringstream rest(text.substr(close + 2));
    std::string field;
    unsigned long long reaped = 0;
    for (int i = 3; i <= 17 && rest >> field; ++i) {
      if (i == 16 || i == 17) reaped += std::stoull(field);
    }
    total += double(reaped) / sysconf(_SC_CLK_TCK);
  }
  std::unique_ptr<DIR, int (*)(DIR*)> tasks(opendir((proc + "/task").c_str()), closedir);
  while (tasks != nullptr) {
    const struct dirent* task = readdir(tasks.get());
    if (task == nullptr) break;
    if (task->d_name[0] == '.') continue;
    std::ifstream children(proc + "/task/" + task->d_name + "/children");
    pid_t child;
    while (children >> child) total += ProcessCpuSeconds(child);
  }
  return total;
}

// Prints the CPU seconds the engine, the indexer and its helpers used since `before`, which it
// then updates.
void PrintCpu(pid_t engine, pid_t indexd, double before[3]) {
  const double now[3] = {ProcessCpuSeconds(engine), ProcessCpuSeconds(indexd),
                         ChildrenCpuSeconds(indexd)};
  std::printf("  CPU seconds: quixelasticd %.2f, fileindexd %.2f, extraction helpers %.2f\n",
              now[0] - before[0], now[1] - before[1], now[2] - before[2]);
  for (int i = 0; i < 3; ++i) before[i] = now[i];
}

// Documents of index `id` whose extracted words hold `keyword`.
int KeywordHits(const std::string& id, const std::string& keyword) {
  Json::Value q(Json::objectValue);
  q["keyword"] = keyword;
  q["id"] = id;
  try {
    return System::Engine("search", q)["data"]["total"].asInt();
  } catch (const std::exception&) {
    return -1;
  }
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

// Adds one folder and waits until `index` holds `documents`: the seconds that took.
double IndexFolder(const std::string& path, bool contents, const std::string& index,
                   int64_t documents) {
  Json::Value add(Json::arrayValue);
  add.append(System::Folder(path, contents));
  const auto t0 = Clock::now();
  orvane::fileindex::FolderAdd(add, false);
  WaitFor([&] { return Documents(index) >= documents; }, 3600 * 1000);
  return Seconds(t0, Clock::now());
}

}  // namespace

int main(int argc, char** argv) {
  const int files = argc > 1 ? std::atoi(argv[1]) : 100000;
  constexpr int kPerDir = 1000;
  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
  System sys({"bench", "content", "media"});
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
  // The other kinds: small real files, a hundred of each.
  constexpr int kMediaFiles = 500;
  for (int i = 0; i < kMediaFiles; ++i) {
    const std::string stem =
        sys.Vol("media/m" + std::to_string(i % 10) + "/file" + std::to_string(i));
    orvane::MakeParentDirs(stem);
    const std::string words =
        std::string(kWords[i % 8]) + " " + kWords[(i + 3) % 8] + " " + std::to_string(i);
    switch (i % 5) {
      case 0:
        std::ofstream(stem + ".pdf")
            << orvane::test::SamplePdf("Report " + std::to_string(i), words);
        break;
      case 1:
        orvane::test::WriteSampleZip(
            stem + ".docx",
            {{"[Content_Types].xml", "<Types/>"},
             {"word/document.xml", "<w:document xmlns:w=\"w\"><w:body><w:p><w:r><w:t>" + words +
                                       "</w:t></w:r></w:p></w:body></w:document>"},
             {"docProps/core.xml",
              "<cp:coreProperties xmlns:cp=\"c\" xmlns:dc=\"d\">"
              "<dc:title>Plan</dc:title></cp:coreProperties>"}});
        break;
      case 2:
        orvane::test::WriteSampleZip(
            stem + ".odt", {{"mimetype", "application/vnd.oasis.opendocument.text"},
                            {"content.xml",
                             "<office:document-content xmlns:text=\"t\" xmlns:office=\"o\">"
                             "<office:body><text:p>" +
                                 words + "</text:p></office:body></office:document-content>"}});
        break;
      case 3:
        std::ofstream(stem + ".wav") << orvane::test::SampleWav(1, 8000, 1);
        break;
      case 4:
        std::ofstream(stem + ".png") << orvane::test::SamplePng(64, 64);
        break;
    }
  }
  auto engine = sys.StartEngine();
  auto notifyd = sys.StartNotifyd();
  auto indexd = sys.StartIndexd();

  // 1. First indexing.
  const double first = IndexFolder("/bench/tree", false, "fileindex_bench", files + dirs + 1);
  std::printf("first indexing: %d files (+%d folders) in %.2f s = %.0f files/s\n", files, dirs,
              first, files / first);
  std::printf("  CPU seconds so far: quixelasticd %.2f, quixnotifyd %.2f, fileindexd %.2f\n",
              ProcessCpuSeconds(engine->pid()), ProcessCpuSeconds(notifyd->pid()),
              ProcessCpuSeconds(indexd->pid()));

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
  double cpu[3] = {ProcessCpuSeconds(engine->pid()), ProcessCpuSeconds(indexd->pid()),
                   ChildrenCpuSeconds(indexd->pid())};
  const double with_content =
      IndexFolder("/content", true, "fileindex_content", kContentFiles + 21);
  std::printf("first indexing with contents: %d files, %.1f MB in %.2f s = %.2f MB/s, %.0f files/s\n",
              kContentFiles, content_bytes / 1e6, with_content,
              content_bytes / 1e6 / with_content, kContentFiles / with_content);
  PrintCpu(engine->pid(), indexd->pid(), cpu);
  const double with_media = IndexFolder("/media", true, "fileindex_media", kMediaFiles + 11);
  // The PDF and office files whose words hold "quarterly" show that their contents, not just
  // their names, were indexed.
  int quarterly = 0;
  for (int i = 0; i < kMediaFiles; ++i) quarterly += i % 5 < 3 && (i % 8 == 1 || i % 8 == 6);
  std::printf(
      "first indexing with contents: %d PDF, office, WAV and PNG files in %.2f s = %.0f"
      " files/s (%d of %d documents found by a word of their contents)\n",
      kMediaFiles, with_media, kMediaFiles / with_media,
      KeywordHits("fileindex_media", "quarterly"), quarterly);
  PrintCpu(engine->pid(), indexd->pid(), cpu);

  std::printf("peak memory (VmHWM): quixelasticd %ld KiB, quixnotifyd %ld KiB, fileindexd %ld KiB\n",
              PeakKb(engine->pid()), PeakKb(notifyd->pid()), PeakKb(indexd->pid()));
  indexd->Signal(SIGTERM);
  notifyd->Signal(SIGTERM);
  engine->Signal(SIGTERM);
  return 0;
}
