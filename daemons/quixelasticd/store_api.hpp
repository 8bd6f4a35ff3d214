// Store and StoreBackend: what the engine asks of the place an index's documents are kept, so
// that the same engine runs on an SQLite file in each index's folder (the default) or on a
// PostgreSQL database that several file servers share.
// A Store's writer side is called with the index's write lock held and a transaction of its
// Begin() open; its reader side from any thread. Backends are thread-safe.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_STORE_API_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_STORE_API_HPP_

#include <json/json.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "daemons/quixelasticd/query_guard.hpp"
#include "daemons/quixelasticd/search_params.hpp"

namespace orvane {
namespace elasticd {

// Decides whether the asking user may see the file at a full path.
using VisibleFn = std::function<bool(const std::string& path)>;

// An open write transaction: committed by Commit(), rolled back when destroyed without it.
class StoreTxn {
 public:
  virtual ~StoreTxn() = default;
  virtual void Commit() = 0;
};

// A savepoint inside the open transaction: kept by Release(), rolled back to otherwise.
class StoreSavepoint {
 public:
  virtual ~StoreSavepoint() = default;
  virtual void Release() = 0;
};

class Store {
 public:
  virtual ~Store() = default;

  // The index's folder, as the registry names it (the share its files belong to).
  virtual const std::string& dir() const = 0;
  virtual std::string Meta(const std::string& key) = 0;
  virtual void SetMeta(const std::string& key, const std::string& value) = 0;

  // --- transactions of the writer side.
  virtual std::unique_ptr<StoreTxn> Begin() = 0;
  virtual std::unique_ptr<StoreSavepoint> BeginSavepoint() = 0;
  // After a failure inside the open transaction: whether the store rolled it back on its own,
  // so that everything written in it is gone.
  virtual bool TransactionLost() = 0;
  // Gives the index a new identifier (inside a transaction of its own).
  virtual void Rekey(const std::string& new_id) = 0;

  // --- writer side.
  virtual void Upsert(const std::string& doc_id, const Json::Value& doc) = 0;
  virtual size_t UpsertMany(const std::vector<Json::Value>& docs,
                            std::vector<std::pair<size_t, std::string>>* refused) = 0;
  virtual void SetFields(const std::string& doc_id, const Json::Value& fields) = 0;
  virtual bool Delete(const std::string& doc_id) = 0;
  virtual int64_t DeleteByQuery(const DocQuery& q) = 0;
  virtual Json::Value GetByQuery(const DocQuery& q, const std::vector<std::string>& load,
                                 int64_t from, int64_t size) = 0;
  virtual Json::Value List(const std::string& dir, const std::string& after,
                           const std::vector<std::string>& extra, int64_t size) = 0;
  virtual bool UpdateTermSuggestion(const std::string& doc_id) = 0;
  virtual int64_t DocCount() = 0;
  virtual void Sync() = 0;
  virtual bool QuickCheck(std::string* detail) = 0;

  // --- reader side.
  virtual SearchPage Search(const SearchParams& p, const VisibleFn& visible,
                            QueryGuard* guard = nullptr) = 0;
  virtual std::vector<std::string> Suggest(const std::string& prefix, size_t limit,
                                           const VisibleFn& visible,
                                           QueryGuard* guard = nullptr) = 0;
  // The search over the indexes of every file server sharing the store's database, each hit
  // naming its server ("server"). A caller with a permission filter (`visible`) sees only this
  // server's files, which the filter can check. A store of one server searches itself.
  virtual SearchPage SearchAllServers(const SearchParams& p, const VisibleFn& visible,
                                      QueryGuard* guard) {
    return Search(p, visible, guard);
  }
};

// Where the stores of the daemon's indexes live. `dir` is the index's folder of the registry;
// `id` its identifier.
class StoreBackend {
 public:
  virtual ~StoreBackend() = default;
  // Throws UnsafeStoreError when a planted entry stands in the way.
  virtual bool Exists(const std::string& dir, const std::string& id) = 0;
  virtual std::shared_ptr<Store> Create(const std::string& dir, const std::string& id,
                                        const Json::Value& mappings, const Json::Value& settings,
                                        const Json::Value& event_handler) = 0;
  virtual std::shared_ptr<Store> Open(const std::string& dir, const std::string& id) = 0;
  // Removes the index's documents for good; what cannot be removed is logged, not thrown.
  virtual void Remove(const std::string& dir, const std::string& id) = 0;
  // Moves a closed store from one folder to another.
  virtual void Move(const std::string& from_dir, const std::string& to_dir,
                    const std::string& id) = 0;
  // Whether several file servers share the stores' database, so that a search may span them.
  virtual bool Shared() const { return false; }
  // Sets a damaged store's files aside (kept for inspection) so that a rebuild starts afresh.
  virtual void SetAside(const std::string& dir, const std::string& id,
                        const std::string& stamp) = 0;
};

// The default: an SQLite database in each index's folder.
std::shared_ptr<StoreBackend> SqliteBackend();

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_STORE_API_HPP_
