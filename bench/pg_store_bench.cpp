// The two stores side by side, in process (no socket, no JSON on the wire): bulk upsert of
// name-only documents, name-substring and content-word search latency, a folder rename of
// 25,000 descendants (one re-keying per descendant, as the library's loop does) and the size
// on disk. The PostgreSQL server is one the caller runs; its CPU time is not counted here.
//
//   pg_store_bench CONNINFO [documents [pg]]
#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "bench/bench_util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/pg_store.hpp"
#include "daemons/quixelasticd/store.hpp"
#include "fileindex/elastic_control.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::CpuSeconds;
using orvane::bench::Seconds;
using namespace orvane::elasticd;

using orvane::bench::NameOf;
using orvane::bench::NameWord;

constexpr uint64_t kBatch = 1000;
constexpr uint64_t kRenamed = 25000;

Json::Value FileDoc(const std::string& parent, uint64_t i) {
  return orvane::bench::FileDoc(parent, NameOf(i), i);
}

// The operations the figures are taken of, for either store.
struct Target {
  const char* name;
  std::function<void(const std::vector<Json::Value>&)> write_batch;
  std::function<void(const std::vector<std::pair<std::string, Json::Value>>&)> rekey_batch;
  std::function<SearchPage(const SearchParams&)> search;
  std::function<void()> sync;
  std::function<double()> megabytes;
};

void Measure(Target& t, uint64_t count) {
  std::printf("== %s\n", t.name);
  const Clock::time_point start = Clock::now();
  const double cpu = CpuSeconds();
  std::vector<Json::Value> batch;
  for (uint64_t i = 0; i < count; ++i) {
    const uint64_t dir = i < kRenamed ? 0 : i / 1000;
    batch.push_back(FileDoc(i < kRenamed ? "/bench/big" : "/bench/d" + std::to_string(dir), i));
    if (batch.size() == kBatch || i + 1 == count) {
      t.write_batch(batch);
      batch.clear();
    }
  }
  t.sync();
  const double wall = Seconds(start);
  std::printf("bulk upsert: %llu documents, %.0f documents/s wall, %.1f CPU s in this process\n",
              static_cast<unsigned long long>(count), count / wall, CpuSeconds() - cpu);

  std::mt19937_64 rng(42);
  std::vector<double> ms;
  long hits = 0;
  for (int k = 0; k < 200; ++k) {
    const std::string name = NameOf(rng() % count);
    const size_t len = 3 + rng() % 4;
    SearchParams p;
    p.name = name.substr(rng() % (name.size() - len), len);
    const Clock::time_point s = Clock::now();
    hits += t.search(p).total;
    ms.push_back(Seconds(s) * 1000);
  }
  orvane::bench::PrintLatency("name substring (3 to 6 characters)", ms, hits);
  ms.clear();
  hits = 0;
  for (int k = 0; k < 200; ++k) {
    SearchParams p;
    // A number of a name is a rare word, a name word a common one (one document in ten).
    p.keywords = k % 2 ? std::to_string(rng() % 100000) : NameWord(rng());
    const Clock::time_point s = Clock::now();
    hits += t.search(p).total;
    ms.push_back(Seconds(s) * 1000);
  }
  orvane::bench::PrintLatency("content word (common and rare, by relevance)", ms, hits);

  const Clock::time_point r = Clock::now();
  const double rcpu = CpuSeconds();
  // The library lists the folder's documents in path order and re-keys each.
  std::vector<std::string> names;
  for (uint64_t i = 0; i < kRenamed && i < count; ++i) names.push_back(NameOf(i));
  std::sort(names.begin(), names.end());
  std::vector<std::pair<std::string, Json::Value>> moves;
  for (const std::string& name : names) {
    Json::Value fields;
    fields["QUIXMDPath"] = "/bench/moved/" + name;
    fields["QUIXMDParent"] = "/bench/moved";
    fields["QUIXMDSearchAncestor"] = "/bench/moved";
    moves.emplace_back("/bench/big/" + name, fields);
    if (moves.size() == kBatch) {
      t.rekey_batch(moves);
      moves.clear();
    }
  }
  if (!moves.empty()) t.rekey_batch(moves);
  t.sync();
  std::printf("folder rename of %llu descendants: %.2f s wall, %.2f CPU s in this process\n",
              static_cast<unsigned long long>(kRenamed), Seconds(r), CpuSeconds() - rcpu);
  std::printf("size: %.1f MiB, %.0f bytes per document\n", t.megabytes(),
              t.megabytes() * 1048576.0 / count);
}

// Two documents of the renamed folder may share a name: the second move finds the first gone.
template <typename F>
void Moved(F&& move) {
  try {
    move();
  } catch (const EngineError& e) {
    if (e.code != orvane::kCodeDocNotFound) throw;
  }
}

double FileMiB(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 ? st.st_size / 1048576.0 : 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fprintf(stderr, "usage: %s CONNINFO [documents]\n", argv[0]);
    return 2;
  }
  const uint64_t count = argc > 2 ? std::strtoull(argv[2], nullptr, 10) : 1000000;
  const std::string root = orvane::bench::ScratchRoot("pg_store_bench", false);
  const Json::Value none(Json::objectValue);

  auto lite = IndexStore::Create(root + "/idx", "bench",
                                 orvane::fileindex::elastic::GetFileIndexMappings(), none, none);
  Target sqlite{
      "SQLite",
      [&](const std::vector<Json::Value>& docs) {
        WriteTxn txn(*lite);
        lite->UpsertMany(docs, nullptr);
        txn.Commit();
      },
      [&](const std::vector<std::pair<std::string, Json::Value>>& moves) {
        WriteTxn txn(*lite);
        for (const auto& move : moves) Moved([&] { lite->SetFields(move.first, move.second); });
        txn.Commit();
      },
      [&](const SearchParams& p) { return lite->Search(p, nullptr); },
      [&] { lite->Sync(); },
      [&] { return FileMiB(root + "/idx/index.db") + FileMiB(root + "/idx/index.db-wal"); }};
  // "pg" as a third argument measures the PostgreSQL store alone.
  if (argc < 4 || std::string(argv[3]) != "pg") Measure(sqlite, count);

  auto pool = std::make_shared<PgPool>(argv[1], 4);
  PgStore::Drop(*pool, "bench", "bench");
  auto pg = PgStore::Create(pool, "bench", "bench",
                            orvane::fileindex::elastic::GetFileIndexMappings(), none, none);
  Target postgres{"PostgreSQL",
                  [&](const std::vector<Json::Value>& docs) {
                    PgWriteTxn txn(*pg);
                    pg->UpsertMany(docs, nullptr);
                    txn.Commit();
                  },
                  [&](const std::vector<std::pair<std::string, Json::Value>>& moves) {
                    PgWriteTxn txn(*pg);
                    for (const auto& move : moves)
                      Moved([&] { pg->SetFields(move.first, move.second); });
                    txn.Commit();
                  },
                  [&](const SearchParams& p) { return pg->Search(p, nullptr); },
                  [&] { pg->Sync(); },
                  [&] { return pg->DiskBytes() / 1048576.0; }};
  Measure(postgres, count);
  return 0;
}
