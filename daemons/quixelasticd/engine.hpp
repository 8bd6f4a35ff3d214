// Engine: the daemon's request handling, independent of sockets. It keeps the set of indexes
// (id, folder, state) in a registry file, opens their stores, answers single and compound
// requests with the reply shapes of the protocol, and applies admission limits.
// Thread-safe: any number of connection threads call Handle() at once; writes to one index are
// serialised by that index's lock, and a compound request holds at most one index lock at a time.
// The code is split by job: engine.cpp (requests, batches, document commands), registry.cpp
// (the set of indexes and their states), index_commands.cpp, search.cpp.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_ENGINE_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_ENGINE_HPP_

#include <sys/types.h>

#include <json/json.h>

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "daemons/quixelasticd/store.hpp"

namespace orvane {
namespace elasticd {

// Who sent a request, from the socket's peer credentials.
struct Caller {
  uid_t uid = 0;
  gid_t gid = 0;
  // Root or the service account: may run index and document commands.
  bool privileged = false;
  // The client's connection, watched while its searches run: a search whose client hung up is
  // stopped. -1: none (in-process callers).
  int peer_fd = -1;
};

struct EngineOptions {
  // The registry of indexes (JSON, replaced atomically).
  std::string registry_file;
  // Present while the daemon runs; found at start, it means the last run did not stop cleanly.
  std::string running_marker;
  // Write requests in progress or waiting beyond which new ones are answered kCodeOverloaded.
  int max_write_backlog = 64;
  // Request bytes in flight plus the store's own memory beyond which requests are answered
  // kCodeOutOfMemory.
  int64_t memory_limit_bytes = int64_t{1} << 30;
  // When set, index folders must lie below it (a deployment that keeps every index database
  // under one volume, and the fuzz harness).
  std::string index_root;
  int64_t default_page_size = 1000;
  int64_t max_page_size = 10000;
  // Time a request's searches and suggestions may take together before they are stopped and
  // answered kCodeSearchTooLong; 0: no limit.
  int64_t search_budget_micros = 10 * 1000000LL;
  // Where the indexes' documents live; null: an SQLite database in each index's folder.
  std::shared_ptr<StoreBackend> stores;
};

class Engine {
 public:
  explicit Engine(EngineOptions options);
  ~Engine();
  Engine(const Engine&) = delete;
  Engine& operator=(const Engine&) = delete;

  // Reads the registry and opens every index in a background thread; until an index is open
  // its requests are answered kCodeIndexOpening (kCodeIndexRecovering while it is checked after
  // an unclean stop).
  void Start();
  // Blocks until the background opening is done (tests, benchmarks).
  void WaitOpened();
  // Syncs and closes every index and removes the running marker. Requests after it fail.
  void Shutdown();

  // One request payload (JSON text, trailing NULs ignored) to its reply.
  Json::Value Handle(const std::string& payload, const Caller& caller);
  Json::Value HandleValue(const Json::Value& request, const Caller& caller);

  // Admission of a frame of `bytes` before it is read: 0 when accepted (the bytes are then
  // accounted until ReleaseFrame), else the code to answer.
  int AdmitFrame(int64_t bytes);
  void ReleaseFrame(int64_t bytes);

  static Json::Value ErrorReply(int code, const std::string& msg);

 private:
  // kRefused: a planted entry stands where the index's folder or files belong (see `refusal`).
  enum class State { kOpening, kRecovering, kReady, kPaused, kMoving, kDamaged, kRefused };
  struct Entry {
    std::string id;
    std::string path;
    State state = State::kOpening;
    bool removed = false;
    std::string refusal;  // why the index is refused: the entry's path and what to do
    std::shared_ptr<Store> store;
    std::mutex mu;  // guards everything above; held by a writer for its whole run
    // A copy of state and store for searches, which must not wait for a writer's run.
    std::mutex view_mu;
    State view_state = State::kOpening;
    std::shared_ptr<Store> view_store;
  };
  class Session;
  // Holds an index's lock and publishes its state to searches when released.
  class EntryGuard {
   public:
    explicit EntryGuard(Entry& e) : e_(e), lock_(e.mu) {}
    ~EntryGuard() { Publish(e_); }
    EntryGuard(const EntryGuard&) = delete;
    EntryGuard& operator=(const EntryGuard&) = delete;

   private:
    Entry& e_;
    std::lock_guard<std::mutex> lock_;
  };
  static void Publish(Entry& e) {
    std::lock_guard<std::mutex> lock(e.view_mu);
    e.view_state = e.state;
    e.view_store = e.state == State::kReady ? e.store : nullptr;
  }

  Json::Value Dispatch(const std::string& command, const Json::Value& data, const Caller& caller,
                       Session& session);
  Json::Value RunSingle(const Json::Value& request, const Caller& caller, Session& session);
  Json::Value RunCompound(const Json::Value& list, const Caller& caller, QueryGuard* guard);
  // One run of a batch; without savepoints it gives up (null) at the first failed command.
  Json::Value RunCompoundPass(const Json::Value& list, const Caller& caller, bool savepoints,
                              QueryGuard* guard);

  Json::Value IndexCreate(const Json::Value& data);
  Json::Value IndexDelete(const Json::Value& data);
  Json::Value IndexPause(const Json::Value& data, bool pause);
  Json::Value IndexConfigSet(const Json::Value& data);
  Json::Value Commit(const Json::Value& data, Session& session);
  Json::Value ListTermSuggDb();
  Json::Value Search(const Json::Value& data, const Caller& caller, QueryGuard* guard);
  Json::Value Suggest(const Json::Value& data, const Caller& caller, QueryGuard* guard);
  Json::Value IndexList();

  std::shared_ptr<Entry> Find(const std::string& id);
  void CheckIndexPath(const std::string& path) const;
  // Throws the code of a state other than ready.
  static void RequireReady(const Entry& e);
  // Marks an index damaged after its store reported corruption, and sets its files aside.
  void SetAside(Entry& e, const std::string& why);
  // Marks the index refused for a planted entry among its files; `why` names it.
  void Refuse(Entry& e, const std::string& why);
  void HandleStoreFailure(Entry& e, const StoreError& err);
  void SaveRegistry();  // with registry_mu_ held
  void OpenAll(bool after_crash);
  std::vector<std::shared_ptr<Store>> SearchTargets(const Json::Value& data);

  EngineOptions options_;
  std::mutex registry_mu_;
  std::map<std::string, std::shared_ptr<Entry>> indexes_;
  std::thread opener_;
  std::mutex opened_mu_;
  std::condition_variable opened_cv_;
  bool opened_ = false;
  std::atomic<int> write_backlog_{0};
  std::atomic<int64_t> frame_bytes_{0};
  std::atomic<bool> shut_down_{false};
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_ENGINE_HPP_
