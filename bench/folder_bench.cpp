// The administration operations at scale: adding 1,000 folders in one request, listing 10,000
// folders with a keyword sorted by name, and the per-file question of which folder's settings
// govern a path with 1,000 folders configured (the indexer asks it for every file). The indexing
// daemon and the search engine are in-process responders on their real sockets.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <memory>
#include <string>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/index_mgr.hpp"
#include "test/fake_daemon.hpp"

namespace {

using namespace orvane;  // NOLINT

// A scratch root with the share "music" holding 1,000 folders, and both daemons answering.
struct Setup {
  std::string root;
  std::string share;
  std::unique_ptr<test::FakeDaemon> indexd;
  std::unique_ptr<test::FakeDaemon> engine;

  Setup() {
    char tmpl[] = "/tmp/fileindex-bench-XXXXXX";
    root = mkdtemp(tmpl);
    setenv("ORVANE_ROOT", root.c_str(), 1);
    share = root + "/volume1/music";
    for (int i = 0; i < 1000; ++i) MakeParentDirs(share + "/artist" + std::to_string(i) + "/x");
    const std::string config = root + "/etc/orvane/platform.json";
    MakeParentDirs(config);
    std::ofstream(config) << R"({"shares": [{"name": "music", "path": ")" << share << R"("}]})";
    indexd = std::make_unique<test::FakeDaemon>(RootedPath("/var/run/fileindexd.sock"),
                                                test::FakeDaemon::Replies({"{}"}));
    engine = std::make_unique<test::FakeDaemon>(RootedPath("/var/run/quixelasticd.sock"),
                                                test::FakeDaemon::Replies({R"({"success":true})"}));
  }
  ~Setup() {
    indexd.reset();
    engine.reset();
    std::system(("rm -rf '" + root + "'").c_str());
  }

  static Json::Value Folder(const std::string& path, const std::string& name) {
    Json::Value f(Json::objectValue);
    f["path"] = path;
    f["name"] = name;
    f["document"] = true;
    f["audio"] = true;
    f["video"] = false;
    f["photo"] = false;
    return f;
  }
  // Writes `count` folders of the music share straight into the folder file.
  void WriteFolders(int count) const {
    JsonValue list(Json::arrayValue);
    for (int i = 0; i < count; ++i) {
      list.append(Folder("/music/artist" + std::to_string(i % 1000) + "/" + std::to_string(i),
                         "Folder " + std::to_string((i * 7919) % count)));
    }
    list.toFile(RootedPath(fileindex::kFileIndexFoldersCfgPath));
  }
};

Setup& GetSetup() {
  static Setup setup;
  return setup;
}

void BM_FolderAdd1000InOneCall(benchmark::State& state) {
  Setup& setup = GetSetup();
  Json::Value request(Json::arrayValue);
  for (int i = 0; i < 1000; ++i) {
    request.append(Setup::Folder("/music/artist" + std::to_string(i), "A" + std::to_string(i)));
  }
  for (auto _ : state) {
    state.PauseTiming();
    unlink(RootedPath(fileindex::kFileIndexFoldersCfgPath).c_str());
    unlink((setup.share + "/@eaDir/@fileindex/queue").c_str());
    state.ResumeTiming();
    fileindex::FolderAdd(request, false);
  }
  state.SetItemsProcessed(state.iterations() * 1000);
}
BENCHMARK(BM_FolderAdd1000InOneCall)->Unit(benchmark::kMillisecond)->Iterations(3);

// Load of the folder file included, as every listing request pays it.
void BM_FolderList10000Keyword(benchmark::State& state) {
  GetSetup().WriteFolders(10000);
  Json::Value request(Json::objectValue);
  request["keyword"] = "der 12";
  request["sort_by"] = "name";
  request["limit"] = 50;
  for (auto _ : state) benchmark::DoNotOptimize(fileindex::FolderList(request));
}
BENCHMARK(BM_FolderList10000Keyword)->Unit(benchmark::kMillisecond);

void BM_FolderMgrList10000Keyword(benchmark::State& state) {
  GetSetup().WriteFolders(10000);
  fileindex::FolderMgr folders;
  std::vector<std::shared_ptr<fileindex::Folder>> out;
  unsigned int total = 0;
  for (auto _ : state) {
    folders.List(out, total, 0, 50, "name", "asc", "all", "der 12");
    benchmark::DoNotOptimize(out);
  }
}
BENCHMARK(BM_FolderMgrList10000Keyword)->Unit(benchmark::kMillisecond);

void BM_GetMostSuitableCfg1000(benchmark::State& state) {
  Setup& setup = GetSetup();
  setup.WriteFolders(1000);
  fileindex::FolderMgr folders;
  const std::string hit = setup.share + "/artist517/517/disc 1/sub/track01.flac";
  const std::string miss = setup.share + "/artist517/other/disc 1/track01.flac";
  if (!folders.GetMostSuitableCfg(hit) || folders.GetMostSuitableCfg(miss)) {
    state.SkipWithError("unexpected look-up result");
  }
  bool flip = false;
  for (auto _ : state) {
    benchmark::DoNotOptimize(folders.GetMostSuitableCfg(flip ? hit : miss));
    flip = !flip;
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_GetMostSuitableCfg1000);

}  // namespace

BENCHMARK_MAIN();
