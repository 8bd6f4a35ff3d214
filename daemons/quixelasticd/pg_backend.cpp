#include "daemons/quixelasticd/pg_backend.hpp"

#include <syslog.h>

#include <utility>
#include <vector>

#include "common/log.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/pg_store.hpp"

namespace orvane {
namespace elasticd {

namespace {

// The meta key holding the index's folder.
const char kFolderKey[] = "folder";
// Connections kept open between requests: the writer of each index is its own; searches share
// these.
constexpr size_t kIdleConnections = 8;

class PgTxnOf : public StoreTxn {
 public:
  explicit PgTxnOf(PgStore& store) : txn_(store) {}
  void Commit() override { txn_.Commit(); }

 private:
  PgWriteTxn txn_;
};

class PgSavepointOf : public StoreSavepoint {
 public:
  explicit PgSavepointOf(PgStore& store) : store_(store) { store_.SetSavepoint(); }
  ~PgSavepointOf() override {
    if (!open_) return;
    try {
      store_.RollbackToSavepoint();
    } catch (const StoreError& err) {
      // The transaction itself is then lost, which the engine finds out next.
      ORVANE_LOG(LOG_ERR, "%s", err.what());
    }
  }
  void Release() override {
    store_.ReleaseSavepoint();
    open_ = false;
  }

 private:
  PgStore& store_;
  bool open_ = true;
};

class PgIndex : public Store {
 public:
  PgIndex(std::shared_ptr<PgStore> store, std::string dir)
      : store_(std::move(store)), dir_(std::move(dir)) {}

  const std::string& dir() const override { return dir_; }
  std::string Meta(const std::string& key) override { return store_->Meta(key); }
  void SetMeta(const std::string& key, const std::string& value) override {
    store_->SetMeta(key, value);
  }
  std::unique_ptr<StoreTxn> Begin() override { return std::make_unique<PgTxnOf>(*store_); }
  std::unique_ptr<StoreSavepoint> BeginSavepoint() override {
    return std::make_unique<PgSavepointOf>(*store_);
  }
  bool TransactionLost() override { return !store_->InTransaction(); }
  void Rekey(const std::string& new_id) override {
    PgWriteTxn txn(*store_);
    store_->Rename(new_id);
    txn.Commit();
  }
  void Upsert(const std::string& doc_id, const Json::Value& doc) override {
    store_->Upsert(doc_id, doc);
  }
  size_t UpsertMany(const std::vector<Json::Value>& docs,
                    std::vector<std::pair<size_t, std::string>>* refused) override {
    return store_->UpsertMany(docs, refused);
  }
  void SetFields(const std::string& doc_id, const Json::Value& fields) override {
    store_->SetFields(doc_id, fields);
  }
  bool Delete(const std::string& doc_id) override { return store_->Delete(doc_id); }
  int64_t DeleteByQuery(const DocQuery& q) override { return store_->DeleteByQuery(q); }
  Json::Value GetByQuery(const DocQuery& q, const std::vector<std::string>& load, int64_t from,
                         int64_t size) override {
    return store_->GetByQuery(q, load, from, size);
  }
  Json::Value List(const std::string& dir, const std::string& after,
                   const std::vector<std::string>& extra, int64_t size) override {
    return store_->List(dir, after, extra, size);
  }
  bool UpdateTermSuggestion(const std::string& doc_id) override {
    return store_->UpdateTermSuggestion(doc_id);
  }
  int64_t DocCount() override { return store_->DocCount(); }
  void Sync() override { store_->Sync(); }
  bool QuickCheck(std::string* detail) override { return store_->QuickCheck(detail); }
  SearchPage Search(const SearchParams& p, const VisibleFn& visible,
                    QueryGuard* guard) override {
    return store_->Search(p, visible, guard);
  }
  std::vector<std::string> Suggest(const std::string& prefix, size_t limit,
                                   const VisibleFn& visible, QueryGuard* guard) override {
    return store_->Suggest(prefix, limit, visible, guard);
  }
  SearchPage SearchAllServers(const SearchParams& p, const VisibleFn& visible,
                              QueryGuard* guard) override {
    return store_->SearchEverywhere(p, visible, guard);
  }

 private:
  std::shared_ptr<PgStore> store_;
  std::string dir_;
};

class PgStores : public StoreBackend {
 public:
  PgStores(const std::string& conninfo, std::string server)
      : pool_(std::make_shared<PgPool>(conninfo, kIdleConnections)), server_(std::move(server)) {
    PgStore::PrepareDatabase(*pool_);
  }

  // An index of this server counts as being in `dir` when it was last kept there, so that a
  // folder given to another index is not mistaken for this one's.
  bool Exists(const std::string& dir, const std::string& id) override {
    if (!PgStore::Exists(*pool_, server_, id)) return false;
    return PgStore::Open(pool_, server_, id)->Meta(kFolderKey) == dir;
  }
  std::shared_ptr<Store> Create(const std::string& dir, const std::string& id,
                                const Json::Value& mappings, const Json::Value& settings,
                                const Json::Value& event_handler) override {
    std::shared_ptr<PgStore> store =
        PgStore::Create(pool_, server_, id, mappings, settings, event_handler);
    SetFolder(*store, dir);
    return std::make_shared<PgIndex>(std::move(store), dir);
  }
  std::shared_ptr<Store> Open(const std::string& dir, const std::string& id) override {
    return std::make_shared<PgIndex>(PgStore::Open(pool_, server_, id), dir);
  }
  void Remove(const std::string& dir, const std::string& id) override {
    try {
      PgStore::Drop(*pool_, server_, id);
    } catch (const StoreError& err) {
      // The index is forgotten by the daemon either way; its rows wait for the next removal.
      ORVANE_LOG(LOG_ERR, "index %s in %s: its documents stay in the database: %s", id.c_str(),
                 dir.c_str(), err.what());
    }
  }
  void Move(const std::string&, const std::string& to_dir, const std::string& id) override {
    SetFolder(*PgStore::Open(pool_, server_, id), to_dir);
  }
  bool Shared() const override { return true; }
  void SetAside(const std::string& dir, const std::string& id, const std::string&) override {
    // Nothing of the index lives in its folder: the database server keeps its own copies.
    ORVANE_LOG(LOG_ERR, "index %s in %s: the database reported damage; rebuild the index",
               id.c_str(), dir.c_str());
  }

 private:
  static void SetFolder(PgStore& store, const std::string& dir) {
    PgWriteTxn txn(store);
    store.SetMeta(kFolderKey, dir);
    txn.Commit();
  }

  std::shared_ptr<PgPool> pool_;
  std::string server_;
};

}  // namespace

std::shared_ptr<StoreBackend> PgBackend(const std::string& conninfo, const std::string& server) {
  return std::make_shared<PgStores>(conninfo, server);
}

}  // namespace elasticd
}  // namespace orvane
