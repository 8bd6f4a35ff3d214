// Engine::Session, the engine's private helper shared by its source files (request handling
// and the index commands). One session belongs to the one thread running its request.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_ENGINE_SESSION_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_ENGINE_SESSION_HPP_

#include <sqlite3.h>

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "daemons/quixelasticd/engine.hpp"
#include "daemons/quixelasticd/engine_error.hpp"

namespace orvane {
namespace elasticd {

// The write side of one request: at most one index locked at a time, inside one transaction,
// so that the writes of a batch are atomic per index and visible to its own later queries.
class Engine::Session {
 public:
  // Called with the results (by position) whose writes were lost with a failed transaction.
  using LostFn = std::function<void(const std::vector<size_t>&, int code, const std::string&)>;

  explicit Session(Engine& engine) : engine_(engine) {}
  ~Session() { Abort(); }
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  void SetLostHandler(LostFn fn) { lost_ = std::move(fn); }

  // Whether each command runs inside its own savepoint, so that a failed one is undone alone.
  // Without them a failed command leaves its partial writes in the transaction, which the
  // caller must then roll back as a whole.
  void SetSavepoints(bool on) { savepoints_ = on; }
  bool savepoints() const { return savepoints_; }

  // What stops the request's searches (its time budget, its client hanging up); may be null.
  void SetQueryGuard(QueryGuard* guard) { guard_ = guard; }
  QueryGuard* query_guard() const { return guard_; }

  Store& Acquire(const std::string& id) {
    if (entry_ && entry_->id == id && txn_) return *entry_->store;
    FinishQuietly();
    std::shared_ptr<Entry> e = engine_.Find(id);
    std::unique_lock<std::mutex> lock(e->mu);
    if (e->removed) throw EngineError(kCodeIndexNotFound, "no index " + id);
    RequireReady(*e);
    try {
      txn_ = e->store->Begin();
    } catch (const StoreError& err) {
      engine_.HandleStoreFailure(*e, err);
      throw;
    }
    entry_ = std::move(e);
    lock_ = std::move(lock);
    return *entry_->store;
  }

  // Records that result `index` depends on the open transaction.
  void NoteWrite(size_t index) {
    if (txn_) pending_.push_back(index);
  }

  // Commits and unlocks; a failed commit throws after the index's failure is handled.
  void Finish() {
    if (!txn_) return;
    try {
      txn_->Commit();
    } catch (const StoreError& err) {
      txn_.reset();
      engine_.HandleStoreFailure(*entry_, err);
      FailPending(err);
      Release();
      throw;
    }
    txn_.reset();
    Release();
  }

  // Finish() for a batch moving on to another index: a failed commit fails the results that
  // depended on it instead of the whole batch.
  void FinishQuietly() {
    try {
      Finish();
    } catch (const StoreError& err) {
      FailPending(err);
    }
  }

  // Called after a store failure inside the transaction: when SQLite has rolled it back on its
  // own, everything written in it is gone and the results that said otherwise are corrected.
  void AfterStoreFailure(const StoreError& err) {
    if (!txn_) return;
    const bool lost = entry_->store->TransactionLost();
    if (!lost && !err.IsCorruption()) return;
    txn_.reset();
    engine_.HandleStoreFailure(*entry_, err);
    FailPending(err);
    Release();
  }

  void Abort() {
    txn_.reset();
    Release();
  }

  Entry* entry() { return entry_.get(); }

 private:
  void FailPending(const StoreError& err) {
    if (lost_ && !pending_.empty()) {
      lost_(pending_, err.IsCorruption() ? kCodeIndexDamaged : kCodeStorage, err.what());
    }
    pending_.clear();
  }
  void Release() {
    pending_.clear();
    if (lock_.owns_lock()) lock_.unlock();
    lock_ = std::unique_lock<std::mutex>();
    entry_.reset();
  }

  Engine& engine_;
  std::shared_ptr<Entry> entry_;
  std::unique_lock<std::mutex> lock_;
  std::unique_ptr<StoreTxn> txn_;
  std::vector<size_t> pending_;
  LostFn lost_;
  bool savepoints_ = true;
  QueryGuard* guard_ = nullptr;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_ENGINE_SESSION_HPP_
