// PgStore: the documents of one index in a PostgreSQL database that several file servers may
// share. One table of documents is partitioned by index (each index its own partition, listed
// with its server's name in `fi_indexes`); names are found through a trigram index over their
// folded form, words through a word vector (`tsvector`) of the catch-all text.
// Writes go through the store's one writer connection and must be serialised by the owner (the
// daemon holds the index's write lock and a PgWriteTxn); searches take pooled connections and
// may run from any thread at the same time as a writer.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_PG_STORE_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_PG_STORE_HPP_

#include <json/json.h>

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "daemons/quixelasticd/pg_util.hpp"
#include "daemons/quixelasticd/schema.hpp"
#include "daemons/quixelasticd/store.hpp"

namespace orvane {
namespace elasticd {

class PgStore {
 public:
  // Makes the shared tables when the database has none (several daemons may race to do it).
  // Throws StoreError.
  static void PrepareDatabase(PgPool& pool);
  // A new, empty index `id` of `server`; EngineError(kCodeIndexExists) when it exists.
  static std::shared_ptr<PgStore> Create(std::shared_ptr<PgPool> pool, const std::string& server,
                                         const std::string& id, const Json::Value& mappings,
                                         const Json::Value& settings,
                                         const Json::Value& event_handler);
  // The existing index; EngineError(kCodeIndexNotFound) when there is none.
  static std::shared_ptr<PgStore> Open(std::shared_ptr<PgPool> pool, const std::string& server,
                                       const std::string& id);
  static bool Exists(PgPool& pool, const std::string& server, const std::string& id);
  // Removes the index and its documents; false when there was none.
  static bool Drop(PgPool& pool, const std::string& server, const std::string& id);

  PgStore(const PgStore&) = delete;
  PgStore& operator=(const PgStore&) = delete;

  const std::string& server() const { return server_; }
  const std::string& id() const { return id_; }
  const Schema& schema() const { return schema_; }
  std::string Meta(const std::string& key);
  void SetMeta(const std::string& key, const std::string& value);
  // Re-keys the index to `new_id` of the same server; EngineError(kCodeIndexExists) when taken.
  void Rename(const std::string& new_id);

  // --- writer side: call only with the index's write lock held and a PgWriteTxn open.
  PgConn& Writer();
  // A savepoint of the open transaction. The writes waiting in the store go to the server
  // first, so that rolling back drops exactly the writes made after the savepoint.
  void SetSavepoint();
  void ReleaseSavepoint();
  void RollbackToSavepoint();
  // Whether the writer's transaction is still open (false once the server dropped it).
  bool InTransaction() const;
  void Upsert(const std::string& doc_id, const Json::Value& doc);
  size_t UpsertMany(const std::vector<Json::Value>& docs,
                    std::vector<std::pair<size_t, std::string>>* refused);
  void SetFields(const std::string& doc_id, const Json::Value& fields);
  bool Delete(const std::string& doc_id);
  int64_t DeleteByQuery(const DocQuery& q);
  Json::Value GetByQuery(const DocQuery& q, const std::vector<std::string>& load, int64_t from,
                         int64_t size);
  Json::Value List(const std::string& dir, const std::string& after,
                   const std::vector<std::string>& extra, int64_t size);
  bool UpdateTermSuggestion(const std::string& doc_id);
  int64_t DocCount();
  // The bytes the index's partition takes with its indexes and out-of-line values.
  int64_t DiskBytes();

  // Sends the writes waiting in the store (every commit is synchronous, so what is committed is
  // on the server's disk) and refreshes the planner's figures after a bulk load.
  void Sync();
  bool QuickCheck(std::string* detail);

  // --- reader side: any thread. The guard is consulted between rows.
  SearchPage Search(const SearchParams& p, const VisibleFn& visible, QueryGuard* guard = nullptr);
  // The search over every index of every server in the database. Each hit names its server
  // ("server"); a caller with a permission filter sees only this server's files, which the
  // filter can check.
  SearchPage SearchEverywhere(const SearchParams& p, const VisibleFn& visible,
                              QueryGuard* guard = nullptr);
  std::vector<std::string> Suggest(const std::string& prefix, size_t limit,
                                   const VisibleFn& visible, QueryGuard* guard = nullptr);

 private:
  friend class PgWriteTxn;
  PgStore(std::shared_ptr<PgPool> pool, std::string server, std::string id, int part);
  // The writer, once the writes waiting here are on the server.
  PgConn& Settled();
  void Flush();
  // The stored document at `path`, read with the next ones; EngineError(kCodeDocNotFound).
  // Only for paths with no write waiting.
  Json::Value ReadAhead(const std::string& path);
  // Keeps a write of `path` (a document, or its deletion) for the next Flush().
  void Put(const std::string& path, std::optional<Json::Value> doc);
  void LoadSchema();
  SearchPage Run(const SearchParams& p, const VisibleFn& visible, QueryGuard* guard,
                 bool everywhere);
  // Gives the statements of the open transaction on `conn` what is left of the request's time.
  static void Budget(PgConn& conn, QueryGuard* guard);
  // The page of a search whose statement parts Run() has made.
  SearchPage Page(PgConn& conn, const SearchParams& p, const VisibleFn& visible, QueryGuard* guard,
                  bool everywhere, const PgParams& params, const std::string& select,
                  const std::string& from, const std::string& order, bool ranked);
  std::string Table() const { return "fi_docs_" + std::to_string(part_); }
  // Writes `docs` (validated, deduplicated by path) in one statement, deleting the document
  // at `gone` (when given, a path none of them has) in the same statement.
  void WriteRows(const std::vector<const Json::Value*>& docs, const std::string* gone = nullptr);
  // The document of a row read with the store's document columns from column `first` on.
  Json::Value ReadDoc(const PgResult& r, int row, int first) const;

  std::shared_ptr<PgPool> pool_;
  std::string server_;
  std::string id_;
  int part_;
  Schema schema_;
  std::unique_ptr<PgConn> writer_;
  // Writes of the open transaction not yet sent: the last document of each path, or nullopt
  // for a deletion.
  int64_t written_ = 0;  // rows written since the partition was last analysed
  bool buffering_ = false;
  std::map<std::string, std::optional<Json::Value>> pending_;
  // Documents read ahead of a change, as the server has them; dropped before anything else
  // runs and whenever the waiting writes are sent.
  std::map<std::string, Json::Value> read_ahead_;
};

// RAII write transaction on a store's writer connection: BEGIN, COMMIT on Commit(), ROLLBACK
// otherwise. While it is open, single writes wait in the store and go to the server many rows
// to a statement, before anything is read and at the commit.
class PgWriteTxn {
 public:
  explicit PgWriteTxn(PgStore& store);
  ~PgWriteTxn();
  PgWriteTxn(const PgWriteTxn&) = delete;
  PgWriteTxn& operator=(const PgWriteTxn&) = delete;
  void Commit();

 private:
  PgStore& store_;
  PgTxn txn_;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_PG_STORE_HPP_
