// The whole indexing road for a queue file: read, parse, fold into the operation tree and hand
// every surviving operation to a callback. Each size runs in a child process of its own so the
// peak memory it reports is that size's alone.
//
//   queue_bench [lines...]     (default: 10000 100000 1000000)
#include <malloc.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "common/log.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/queue_file.hpp"

namespace {

using orvane::fileindex::OP;
using orvane::fileindex::OPNode;
using orvane::fileindex::OPTree;

// A share with a deep folder tree; the number of files grows with the queue so that about one
// distinct path comes per three lines, as on a busy file server.
class QueueGenerator {
 public:
  QueueGenerator(size_t lines, uint32_t seed) : rng_(seed), lines_(lines) {
    const size_t dirs = std::max<size_t>(50, lines / 60);
    dirs_.push_back("/volume1/share");
    for (size_t i = 1; i < dirs; ++i) {
      const std::string& parent = dirs_[Pick(dirs_.size())];
      dirs_.push_back(parent + "/folder_" + std::to_string(i));
    }
  }

  void Write(const std::string& path) {
    std::ofstream out(path, std::ios::trunc);
    size_t written = 0;
    auto emit = [&](uint32_t bits, const std::string& p, const std::string& extra) {
      out << "{\"event\":" << bits << ",\"path\":\"" << p << "\"" << extra << "}\n";
      ++written;
    };
    while (written < lines_) {
      const size_t roll = Pick(1000);
      if (roll < 450) {  // a write burst on a file, often a new one
        const std::string f = roll < 200 ? NewFile() : AnyFile();
        if (roll < 200) emit(0x40, f, ",\"is_dir\":false");
        for (size_t n = 1 + Pick(4); n > 0; --n) emit(0x2, f, "");
        emit(0x8, f, "");
      } else if (roll < 600) {
        emit(0x4, AnyFile(), "");
      } else if (roll < 700) {
        emit(0x80, AnyFile(), ",\"is_dir\":false");
      } else if (roll < 760) {
        const std::string from = AnyFile();
        const std::string to = NewFile();
        emit(0x100, to, ",\"path_old\":\"" + from + "\"");
      } else if (roll < 765) {
        const size_t d = 1 + Pick(dirs_.size() - 1);
        const std::string to = dirs_[d] + "_renamed";
        emit(0x100, to, ",\"path_old\":\"" + dirs_[d] + "\"");
      } else if (roll < 770) {
        dirs_.push_back(dirs_[Pick(dirs_.size())] + "/new_" + std::to_string(dirs_.size()));
        emit(0x40, dirs_.back(), ",\"is_dir\":true");
      } else if (roll < 771) {
        emit(0x10000, dirs_[Pick(dirs_.size())], "");
      } else {
        const std::string f = AnyFile();
        emit(0x2, f, "");
        emit(0x8, f, "");
      }
    }
  }

 private:
  size_t Pick(size_t n) { return static_cast<size_t>(rng_() % n); }
  std::string NewFile() {
    files_.push_back(dirs_[Pick(dirs_.size())] + "/document_" + std::to_string(files_.size()) +
                     ".txt");
    return files_.back();
  }
  std::string AnyFile() { return files_.empty() ? NewFile() : files_[Pick(files_.size())]; }

  std::mt19937 rng_;
  size_t lines_;
  std::vector<std::string> dirs_;
  std::vector<std::string> files_;
};

// Bytes the allocator has handed out and not yet taken back.
size_t HeapInUse() {
  const struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
}

long PeakRssKiB() {
  struct rusage usage;
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_maxrss;
}

size_t CountNodes(const std::shared_ptr<OPNode>& node) {
  size_t n = 1;
  for (const auto& child : node->children) n += CountNodes(child);
  return n;
}

void RunOne(size_t lines) {
  const std::string path = "/tmp/fileindex-queue-bench-" + std::to_string(getpid());
  QueueGenerator(lines, 42).Write(path);
  orvane::SetLogSink([](int, const std::string&) {});
  const size_t base_heap = HeapInUse();
  const auto start = std::chrono::steady_clock::now();
  size_t callbacks = 0;
  size_t distinct = 0;
  double road_secs = 0;
  {
    OPTree tree(path);
    tree.ProcessOP([&callbacks](std::shared_ptr<OP>) { ++callbacks; });
    // The tree is whole now: this is the most the pass ever holds.
    const size_t tree_heap = HeapInUse() - base_heap;
    distinct = CountNodes(tree.root) - 1;
    const double secs =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    road_secs = secs;
    const long peak_kib = PeakRssKiB();
    std::printf(
        "%9zu lines  %7.3f s  %8.0f lines/s  %6.0f ns/line  %7zu ops  %7zu paths  "
        "tree %6.1f MiB = %4.0f B/path  process peak RSS %6.1f MiB\n",
        lines, secs, lines / secs, secs * 1e9 / lines, callbacks, distinct, tree_heap / 1048576.0,
        static_cast<double>(tree_heap) / distinct, peak_kib / 1024.0);
  }
  // The same lines parsed into events only, to show what the JSON parse alone costs.
  const auto parse_start = std::chrono::steady_clock::now();
  orvane::fileindex::QueueFileReader reader(path);
  std::string line;
  size_t parsed = 0;
  while (reader.ReadLine(&line, orvane::fileindex::kMaxEventLineLength)) {
    parsed += orvane::fileindex::Event(line).path.size() > 0;
  }
  const double parse_secs =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - parse_start).count();
  std::printf("%9s parse only: %10.0f lines/s (%.0f%% of the whole road's time)\n", "",
              parsed / parse_secs, 100.0 * parse_secs * lines / parsed / road_secs);
  unlink(path.c_str());
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<size_t> sizes;
  for (int i = 1; i < argc; ++i) sizes.push_back(std::strtoull(argv[i], nullptr, 10));
  if (sizes.empty()) sizes = {10000, 100000, 1000000};
  for (size_t lines : sizes) {
    std::fflush(stdout);
    pid_t pid = fork();
    if (pid == 0) {
      RunOne(lines);
      std::fflush(stdout);
      _exit(0);
    }
    int status = 0;
    waitpid(pid, &status, 0);
  }
  return 0;
}
