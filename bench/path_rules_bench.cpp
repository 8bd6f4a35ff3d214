// How many queued paths per second the indexability rules can judge, and what each rule costs:
// a file in an ordinary share, page cache warm, configuration cached.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <boost/algorithm/string/classification.hpp>
#include <boost/algorithm/string/split.hpp>
#include <climits>
#include <cstdio>
#include <fstream>
#include <string>
#include <vector>

#include "common/root.hpp"
#include "common/sdk/share.hpp"
#include "fileindex/util.hpp"
#include "platform/config.hpp"
#include "platform/fs.hpp"
#include "platform/share.hpp"

namespace {

using namespace orvane;  // NOLINT

// A scratch root with one share holding a file four folders deep.
struct Setup {
  std::string root;
  std::string file;

  Setup() {
    char tmpl[] = "/tmp/fileindex-bench-XXXXXX";
    root = mkdtemp(tmpl);
    setenv("ORVANE_ROOT", root.c_str(), 1);
    const std::string share = root + "/volume1/music";
    file = share + "/artist/album/disc 1/track01.flac";
    MakeParentDirs(file);
    std::ofstream(file) << "x";
    const std::string config = root + "/etc/orvane/platform.json";
    MakeParentDirs(config);
    std::ofstream(config) << R"({"shares": [
      {"name": "photo", "path": ")" << root << R"(/volume1/photo"},
      {"name": "music", "path": ")" << share << R"(", "recycle_bin": true},
      {"name": "video", "path": ")" << root << R"(/volume1/video"}]})";
  }
  ~Setup() { std::system(("rm -rf '" + root + "'").c_str()); }
};

Setup& GetSetup() {
  static Setup setup;
  return setup;
}

void BM_CanFullPathBeIndexed(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  if (!fileindex::CanFullPathBeIndexed(file)) state.SkipWithError("the path was refused");
  for (auto _ : state) benchmark::DoNotOptimize(fileindex::CanFullPathBeIndexed(file));
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_CanFullPathBeIndexed);

void BM_Rule2to4_FileSystemType(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  for (auto _ : state) {
    const int type = platform::QUIXGetFSType(file.c_str(), 0);
    benchmark::DoNotOptimize(platform::QUIXFSIsRemoteFS(type) + platform::QUIXFSIsImageFS(type));
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Rule2to4_FileSystemType);

void BM_Rule5_ShareLookupAndOpen(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  for (auto _ : state) {
    std::string name;
    std::string path;
    fileindex::GetShareNamePathByFullPath(name, path, file);
    sdk::SDKShare share(name);
    benchmark::DoNotOptimize(share.CanBeIndexed());
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Rule5_ShareLookupAndOpen);

void BM_Rule6_RecycleBin(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  for (auto _ : state) benchmark::DoNotOptimize(fileindex::IsFullPathInRecycleBin(file));
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Rule6_RecycleBin);

void BM_Rule7_MountPoint(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  for (auto _ : state) benchmark::DoNotOptimize(platform::QUIXFSDirIsMntPoint(file.c_str()));
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Rule7_MountPoint);

void BM_Rule8_Components(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  for (auto _ : state) {
    std::vector<std::string> parts;
    boost::algorithm::split(parts, file, boost::algorithm::is_any_of("/"));
    bool preserved = false;
    for (const std::string& part : parts) preserved |= fileindex::IsSystemPreservedFileName(part);
    benchmark::DoNotOptimize(preserved);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Rule8_Components);

void BM_Rule9_RealPath(benchmark::State& state) {
  const std::string& file = GetSetup().file;
  char real[PATH_MAX];
  for (auto _ : state) benchmark::DoNotOptimize(realpath(file.c_str(), real));
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Rule9_RealPath);

void BM_ConfigFreshnessCheck(benchmark::State& state) {
  GetSetup();
  for (auto _ : state) benchmark::DoNotOptimize(platform::LoadPlatformConfig());
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ConfigFreshnessCheck);

}  // namespace

BENCHMARK_MAIN();
