// Figures of the search-engine daemon through its real socket: bulk upsert of file documents
// in compound batches, substring file-name search latency over a large index (also as query
// trees, with searches by words of the catch-all text), deleting a
// folder of 100,000 documents, re-pathing a folder with 25,000 descendants the way the library
// does it, and the store size per name-only document.
//
//   quixelasticd_bench [documents=1000000 [batch=1000 [connections=2 [renamed=25000
//                      [CONNINFO]]]]]
//
// With a libpq connection string the engine keeps the index in that PostgreSQL database
// instead of an SQLite file; the server is one the caller runs, its CPU time not counted.
//
// The engine and server run in this process on the daemon's socket path below a scratch
// ORVANE_ROOT; the bulk load and the searches are framed requests on that socket, the delete
// and the rename are the library's own IndexDelDir and IndexRename.
#include <libpq-fe.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <random>
#include <string>
#include <thread>
#include <atomic>
#include <vector>

#include "bench/bench_util.hpp"
#include "daemons/quixelasticd/pg_backend.hpp"
#include "fileindex/elastic_control.hpp"

namespace {

using orvane::bench::Clock;
using orvane::bench::Cmd;
using orvane::bench::CpuSeconds;
using orvane::bench::Seconds;

std::string g_socket;

Json::Value Request(const Json::Value& req) { return orvane::bench::Request(g_socket, req); }

const char kShare[] = "bench";
const char kId[] = "fileindex_bench";
using orvane::bench::FileDoc;
using orvane::bench::NameOf;
using orvane::bench::NameWord;

// Upserts `count` documents under `parent` in compound batches of `batch`, from `g_senders`
// connections at once: each builds its next batch while the daemon writes another's.
unsigned g_senders = 2;

void Load(const std::string& parent, uint64_t first, uint64_t count, uint64_t batch) {
  std::atomic<uint64_t> next{0};
  auto send = [&] {
    for (;;) {
      const uint64_t done = next.fetch_add(batch);
      if (done >= count) return;
      Json::Value req;
      req["compound"] = Json::Value(Json::arrayValue);
      const uint64_t n = std::min(batch, count - done);
      for (uint64_t k = 0; k < n; ++k) {
        const uint64_t i = first + done + k;
        const std::string dir = parent + "/d" + std::to_string(i / 1000);
        const std::string name = NameOf(i);
        Json::Value& sub = req["compound"].append(Json::Value(Json::objectValue));
        sub["command"] = "document_upsert_by_id";
        Json::Value& data = sub["data"];
        data["id"] = kId;
        data["doc_id"] = dir + "/" + name;
        data["data"] = FileDoc(dir, name, i);
      }
      if (Request(req)["has_fail"].asBool()) {
        std::fprintf(stderr, "a batch had failures\n");
        std::exit(1);
      }
    }
  };
  std::vector<std::thread> senders;
  for (unsigned t = 1; t < g_senders; ++t) senders.emplace_back(send);
  send();
  for (std::thread& t : senders) t.join();
}

void Commit() {
  Json::Value data;
  data["id"] = kId;
  Request(Cmd("commit", data));
}

}  // namespace

int main(int argc, char** argv) {
  const uint64_t total = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 1000000;
  if (total < 130000) {
    std::fprintf(stderr, "at least 130000 documents are needed\n");
    return 2;
  }
  const std::string dir = orvane::bench::ScratchRoot("quixelasticd-bench", false);
  if (dir.empty()) return 1;
  const std::string conninfo = argc > 5 ? argv[5] : "";
  // This run's own name in the database, which may hold earlier runs' indexes.
  const std::string pg_server = "bench-" + std::to_string(::getpid());
  orvane::bench::InProcessEngine engine(
      dir, conninfo.empty() ? nullptr
                            : orvane::elasticd::PgBackend(conninfo, pg_server));
  engine.Serve(false);
  g_socket = engine.socket();

  // The library's own schema and settings, as ShareIndexCreate sends them.
  Request(orvane::bench::FileIndexCreate(kId, dir + "/db"));

  if (conninfo.empty()) {
    std::printf("SQLite %s; WAL, synchronous=NORMAL (commit syncs the log), cache_size=64 MiB,"
                " temp_store=MEMORY, mmap_size=2 GiB, page size 4096; FTS5 unicode61 (catch-all)"
                " and trigram without positions over folded names\n", sqlite3_libversion());
  } else {
    std::printf("PostgreSQL store (%s)\n", conninfo.c_str());
  }
  const uint64_t batch = argc > 2 ? std::strtoull(argv[2], nullptr, 10) : 1000;
  if (argc > 3) g_senders = static_cast<unsigned>(std::strtoul(argv[3], nullptr, 10));
  const uint64_t renamed = argc > 4 ? std::strtoull(argv[4], nullptr, 10) : 25000;
  if (total < 105000 + renamed) {
    std::fprintf(stderr, "at least %llu documents are needed\n",
                 static_cast<unsigned long long>(105000 + renamed));
    return 2;
  }
  const uint64_t bulk = total - 100000 - renamed;
  auto start = Clock::now();
  double cpu = CpuSeconds();
  Load("/volume1/share/bulk", 0, bulk, batch);
  Commit();
  double s = Seconds(start);
  cpu = CpuSeconds() - cpu;
  std::printf("bulk upsert: %llu documents in batches of %llu: %.1f s, %.0f documents/s;"
              " %.1f CPU s (client and daemon), %.0f documents per CPU second\n",
              static_cast<unsigned long long>(bulk), static_cast<unsigned long long>(batch), s,
              bulk / s, cpu, bulk / cpu);
  Load("/volume1/share/big", bulk, 100000, batch);
  Load("/volume1/share/ren", bulk + 100000, renamed, batch);
  Commit();

  if (!conninfo.empty()) {
    // The index's partition with its indexes and out-of-line values.
    PGconn* conn = PQconnectdb(conninfo.c_str());
    const char* values[] = {pg_server.c_str(), kId};
    PGresult* r = PQexecParams(conn,
                               "SELECT pg_total_relation_size(('fi_docs_' || part)::regclass)"
                               " FROM fi_indexes WHERE server = $1 AND id = $2",
                               2, nullptr, values, nullptr, nullptr, 0);
    if (PQresultStatus(r) == PGRES_TUPLES_OK && PQntuples(r) == 1) {
      const double bytes = std::strtod(PQgetvalue(r, 0, 0), nullptr);
      std::printf("store size after the load: %.1f MiB, %.0f bytes per name-only document\n",
                  bytes / 1048576.0, bytes / total);
    }
    PQclear(r);
    PQfinish(conn);
  } else {
    // Pages in use, free pages excluded, per document after the load.
    sqlite3* db = nullptr;
    if (sqlite3_open_v2((dir + "/db/index.db").c_str(), &db, SQLITE_OPEN_READONLY, nullptr) ==
        SQLITE_OK) {
      std::printf("store size after the load: ");
      sqlite3_exec(
          db, "SELECT sum(pgsize) FROM dbstat",
          [](void* n, int, char** v, char**) {
            const double bytes = std::strtod(v[0], nullptr);
            std::printf("%.1f MiB, %.0f bytes per name-only document\n  by table and index:",
                        bytes / 1048576.0, bytes / *static_cast<const uint64_t*>(n));
            return 0;
          },
          const_cast<uint64_t*>(&total), nullptr);
      sqlite3_exec(
          db, "SELECT name, sum(pgsize) FROM dbstat GROUP BY name ORDER BY 2 DESC LIMIT 10",
          [](void* n, int, char** v, char**) {
            std::printf(" %s %.0f;", v[0],
                        std::strtod(v[1], nullptr) / *static_cast<const uint64_t*>(n));
            return 0;
          },
          const_cast<uint64_t*>(&total), nullptr);
      std::printf("\n");
    }
    sqlite3_close(db);
  }

  std::mt19937_64 rng(42);
  std::vector<double> latencies;
  int64_t hits = 0;
  for (int q = 0; q < 300; ++q) {
    const std::string name = NameOf(rng() % total);
    const size_t len = 3 + rng() % 4;
    const size_t pos = rng() % (name.size() - len);
    Json::Value data;
    data["name"] = name.substr(pos, len);
    data["size"] = 50;
    const auto t = Clock::now();
    hits += Request(Cmd("search", data))["data"]["total"].asInt64();
    latencies.push_back(Seconds(t) * 1000);
  }
  std::sort(latencies.begin(), latencies.end());
  std::printf("substring name search over %llu documents (3-6 characters, 300 queries, total"
              " counted up to 10000, page of 50): p50 %.1f ms, p95 %.1f ms, max %.1f ms, mean hits %lld\n",
              static_cast<unsigned long long>(total), latencies[150], latencies[284],
              latencies.back(), static_cast<long long>(hits / 300));

  // The same kind of name search as a query tree, a search by two words of the catch-all text
  // (a common word and a rare one, as someone narrowing a search types them), and a tree that
  // joins a name, a folder and a size range.
  auto tree_search = [&](const char* label, const std::function<Json::Value(uint64_t)>& tree) {
    std::vector<double> ms;
    int64_t found = 0;
    for (int q = 0; q < 300; ++q) {
      Json::Value data;
      data["query"] = tree(rng() % total);
      data["size"] = 50;
      const auto t = Clock::now();
      found += Request(Cmd("search", data))["data"]["total"].asInt64();
      ms.push_back(Seconds(t) * 1000);
    }
    std::sort(ms.begin(), ms.end());
    std::printf("query tree, %s (300 queries, page of 50): p50 %.1f ms, p95 %.1f ms,"
                " max %.1f ms, mean hits %lld\n", label, ms[150], ms[284], ms.back(),
                static_cast<long long>(found / 300));
  };
  auto match = [](const char* field, const std::string& pattern) {
    Json::Value m;
    m["match"] = field;
    m["pattern"] = pattern;
    return m;
  };
  tree_search("name *substring* (3-6 characters)", [&](uint64_t i) {
    const std::string name = NameOf(i);
    const size_t len = 3 + i % 4;
    return match("name", "*" + name.substr(i % (name.size() - len), len) + "*");
  });
  tree_search("content, a word and a number of a name", [&](uint64_t i) {
    const std::string name = NameOf(i);
    const size_t under = name.rfind('_');
    return match("content", name.substr(0, name.find_first_of("_ ")) + " " +
                                name.substr(under + 1, name.rfind('.') - under - 1));
  });
  tree_search("content, one word as a prefix (about a tenth of the documents)", [&](uint64_t i) {
    return match("content", NameWord(i).substr(0, 4) + "*");
  });
  tree_search("name *substring* under the share's root, as the gateway scopes it", [&](uint64_t i) {
    const std::string name = NameOf(i);
    const size_t len = 3 + i % 4;
    Json::Value tree;
    tree["and"].append(match("name", "*" + name.substr(i % (name.size() - len), len) + "*"));
    tree["and"].append(Json::Value(Json::objectValue))["under"] = "/volume1/share";
    return tree;
  });
  tree_search("a common name word in a folder of 1000, size range", [&](uint64_t i) {
    Json::Value tree;
    tree["and"].append(match("name", "*" + NameWord(i) + "*"));
    tree["and"].append(Json::Value(Json::objectValue))["under"] =
        "/volume1/share/bulk/d" + std::to_string(i % (bulk / 1000));
    Json::Value& range = tree["and"].append(Json::Value(Json::objectValue));
    range["range"] = "size";
    range["gte"] = 1000;
    return tree;
  });

  // One file written and then looked for by name until a search finds it: the request is
  // answered once its transaction is committed, so the first search already should.
  {
    std::vector<double> ms;
    for (int i = 0; i < 20; ++i) {
      const std::string name = "fresh_qzx" + std::to_string(i) + "w.txt";
      Json::Value data;
      data["id"] = kId;
      data["doc_id"] = "/volume1/share/fresh/" + name;
      data["data"] = FileDoc("/volume1/share/fresh", name, i);
      Json::Value query;
      query["name"] = "qzx" + std::to_string(i) + "w";
      const auto t = Clock::now();
      Request(Cmd("document_upsert_by_id", data));
      while (Request(Cmd("search", query))["data"]["total"].asInt64() == 0) {
        if (Seconds(t) > 10) {
          std::fprintf(stderr, "an upserted document was not found within 10 s\n");
          return 1;
        }
      }
      ms.push_back(Seconds(t) * 1000);
    }
    std::sort(ms.begin(), ms.end());
    std::printf("single upsert until a name search finds it (20 files): p50 %.1f ms, max %.1f ms\n",
                ms[10], ms.back());
  }

  // The renamed folder's own document, which IndexRename requires.
  {
    Json::Value data;
    data["id"] = kId;
    data["doc_id"] = "/volume1/share/ren";
    data["data"] = FileDoc("/volume1/share", "ren", 0);
    Request(Cmd("document_upsert_by_id", data));
  }
  start = Clock::now();
  cpu = CpuSeconds();
  orvane::fileindex::elastic::IndexRename(kShare, "/volume1/share/renamed", "/volume1/share/ren");
  orvane::fileindex::elastic::IndexCommit(kShare);
  std::printf("IndexRename of a folder with %llu descendants (then IndexCommit): %.2f s,"
              " %.2f CPU s\n", static_cast<unsigned long long>(renamed), Seconds(start),
              CpuSeconds() - cpu);

  start = Clock::now();
  cpu = CpuSeconds();
  orvane::fileindex::elastic::IndexDelDir(kShare, "/volume1/share/big");
  orvane::fileindex::elastic::IndexCommit(kShare);
  std::printf("IndexDelDir of 100000 documents (then IndexCommit): %.2f s, %.2f CPU s\n",
              Seconds(start), CpuSeconds() - cpu);

  // The database keeps what the scratch folder does not: the index goes with the run.
  if (!conninfo.empty()) {
    Json::Value index;
    index["id"] = kId;
    Request(Cmd("index_delete", index));
  }
  engine.Stop();
  std::string cleanup = "rm -rf '" + dir + "'";
  return std::system(cleanup.c_str()) == 0 ? 0 : 1;
}
