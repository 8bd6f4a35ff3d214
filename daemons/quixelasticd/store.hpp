// IndexStore: the documents of one index in one SQLite database (WAL mode) in the index's
// folder: a table of documents keyed by their identifying field, a word index over the catch-all
// text (whose vocabulary is the term-suggestion store), and a trigram index over the n-grammed
// file names.
// Writes go through the one writer connection and must be serialised by the owner (the daemon
// holds the index's write lock and an open WriteTxn); reads for people use pooled read-only
// connections and may run from any thread at the same time as a writer.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_STORE_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_STORE_HPP_

#include <json/json.h>

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "daemons/quixelasticd/query_guard.hpp"
#include "daemons/quixelasticd/query_tree.hpp"
#include "daemons/quixelasticd/schema.hpp"
#include "daemons/quixelasticd/store_api.hpp"
#include "daemons/quixelasticd/sqlite_util.hpp"
#include "platform/safe_dir.hpp"

namespace orvane {
namespace elasticd {

// An index folder or file that is not the system's own (a planted link, a foreign owner): the
// store is refused rather than damaged. The text names the path and what to do.
class UnsafeStoreError : public StoreError {
 public:
  explicit UnsafeStoreError(const std::string& what) : StoreError(SQLITE_CANTOPEN, what) {}
};

// Opens the index folder `dir` without following links (see platform::SafeDir), made with mode
// 0700 when `create`; invalid when missing. Throws UnsafeStoreError or StoreError.
platform::SafeDir OpenStoreDir(const std::string& dir, bool create);

class IndexStore : public Store {
 public:
  static constexpr const char* kDbFile = "index.db";
  // Rows a filtered search inspects beyond the requested page before it stops counting.
  static constexpr int64_t kFilteredScanLimit = 20000;
  // Hits an unfiltered search counts before it reports the total as a lower bound.
  static constexpr int64_t kCountLimit = 10000;
  // Vocabulary entries a suggestion looks at for one prefix.
  static constexpr int kSuggestScanLimit = 20000;

  // Creates a new, empty store in `dir` (made when missing). Throws StoreError or EngineError.
  static std::shared_ptr<IndexStore> Create(const std::string& dir, const std::string& id,
                                            const Json::Value& mappings,
                                            const Json::Value& settings,
                                            const Json::Value& event_handler);
  // Opens the existing store in `dir`, narrowing the modes of its files (0600). Throws
  // StoreError (damaged, unreadable, UnsafeStoreError when refused) or EngineError.
  static std::shared_ptr<IndexStore> Open(const std::string& dir);
  // Throws UnsafeStoreError when a planted entry stands in the way.
  static bool ExistsIn(const std::string& dir);

  ~IndexStore() override;
  IndexStore(const IndexStore&) = delete;
  IndexStore& operator=(const IndexStore&) = delete;

  const std::string& dir() const override { return dir_; }
  const Schema& schema() const { return schema_; }
  std::string Meta(const std::string& key) override;
  void SetMeta(const std::string& key, const std::string& value) override;  // inside a WriteTxn

  std::unique_ptr<StoreTxn> Begin() override;
  std::unique_ptr<StoreSavepoint> BeginSavepoint() override;
  bool TransactionLost() override;
  void Rekey(const std::string& new_id) override;

  // --- writer side: call only with the index's write lock held and a WriteTxn open.
  Db& writer() { return writer_; }
  // Adds or replaces a whole document. `doc_id` names the document it replaces; the document's
  // identity is its property_id field (filled from `doc_id` when absent).
  void Upsert(const std::string& doc_id, const Json::Value& doc) override;
  // Upserts documents already decoded (the indexer's bulk form), each identified by its own
  // property_id field. A document the schema refuses is skipped and listed in `refused` (its
  // position and why); the others are written. Returns how many were written; throws
  // StoreError when the store fails, leaving the caller's transaction to roll back.
  size_t UpsertMany(const std::vector<Json::Value>& docs,
                    std::vector<std::pair<size_t, std::string>>* refused) override;
  // Merges `fields` into the existing document `doc_id`; throws EngineError(kCodeDocNotFound).
  // Changing the identifying field re-keys it, replacing any document already under the new key.
  void SetFields(const std::string& doc_id, const Json::Value& fields) override;
  bool Delete(const std::string& doc_id) override;
  int64_t DeleteByQuery(const DocQuery& q) override;
  // Hits in identifier order, each the loaded stored fields.
  Json::Value GetByQuery(const DocQuery& q, const std::vector<std::string>& load, int64_t from,
                         int64_t size) override;
  // The documents whose identifier is `dir` or lies below `dir` + "/", after `after` (all
  // when empty), in identifier order, at most `size`: each [identifier, size, modification
  // time, is a directory, then the stored fields `extra` in order], null where a document has
  // no value. Reads only the derived columns unless `extra` asks for more.
  Json::Value List(const std::string& dir, const std::string& after,
                   const std::vector<std::string>& extra, int64_t size) override;
  // (Re)computes the suggestion terms of one document; false when it does not exist.
  bool UpdateTermSuggestion(const std::string& doc_id) override;
  int64_t DocCount() override;

  // Makes every committed transaction durable against power loss. No WriteTxn open.
  void Sync() override;
  // Checks the database structure; false with a detail when damaged.
  bool QuickCheck(std::string* detail) override;

  // --- reader side: any thread. A `guard` (may be null) stops the work early: its statement
  // then fails with a StoreError of SQLITE_INTERRUPT and the guard says why.
  SearchPage Search(const SearchParams& p, const VisibleFn& visible,
                    QueryGuard* guard = nullptr) override;
  // Completions of `prefix` (lower case), most used first.
  std::vector<std::string> Suggest(const std::string& prefix, size_t limit,
                                   const VisibleFn& visible, QueryGuard* guard = nullptr) override;

 private:
  IndexStore(std::string dir, platform::SafeDir folder);
  void OpenWriter(bool create);
  void LoadSchema();
  std::unique_ptr<Db> TakeReader();
  void GiveBackReader(std::unique_ptr<Db> db);
  // Rewrites a store of the previous format in this one, in one transaction.
  void Upgrade();
  void WriteRow(int64_t rowid, const Json::Value& doc, const DerivedDoc& d, bool insert,
                const DerivedDoc* old);
  void DeleteRow(int64_t rowid);
  // The row and stored document under `path`; false when there is none.
  bool FindRow(const std::string& path, int64_t* rowid, Json::Value* stored);
  // A prepared writer statement, reset and ready for binding.
  Stmt& Cached(const char* sql);

  std::string dir_;
  std::string file_;
  // The verified folder, open for the store's whole life: SQLite reaches the files through it
  // by `open_name_` ("/proc/self/fd/<fd>/index.db").
  platform::SafeDir folder_;
  std::string open_name_;
  Schema schema_;
  Db writer_;
  std::map<const char*, std::unique_ptr<Stmt>> cached_;
  std::mutex readers_mu_;
  std::vector<std::unique_ptr<Db>> readers_;
};

// RAII write transaction on a store's writer connection: BEGIN IMMEDIATE, COMMIT on Commit(),
// ROLLBACK otherwise.
class WriteTxn {
 public:
  explicit WriteTxn(IndexStore& store) : txn_(store.writer()) {}
  void Commit() { txn_.Commit(); }

 private:
  Transaction txn_;
};

// Whether a word of the vocabulary is offered as a suggestion: two characters or more, not only
// digits.
bool IsSuggestible(const std::string& term);

// A loaded field of a document list as a value of SQL would give it: whole numbers and flags
// as numbers, strings as they are, anything else as its JSON text; null when missing.
Json::Value ListedValue(const Json::Value* v);

// The smallest string greater than every string that starts with `prefix`; nullopt when there
// is none (empty prefix or all bytes 0xFF).
std::optional<std::string> PrefixUpperBound(const std::string& prefix);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_STORE_HPP_
