#include "daemons/quixelasticd/engine.hpp"

#include <sqlite3.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <functional>
#include <optional>

#include <fcntl.h>

#include "common/env.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/access.hpp"
#include "daemons/quixelasticd/engine_error.hpp"

namespace orvane {
namespace elasticd {

namespace {

std::string RequireString(const Json::Value& data, const char* key) {
  const Json::Value* v = data.isObject() ? data.find(key, key + std::strlen(key)) : nullptr;
  if (v == nullptr || !v->isString() || v->asString().empty()) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" must be a non-empty string");
  }
  return v->asString();
}

std::string NormalizeDir(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

std::string RequirePath(const Json::Value& data, const char* key) {
  const std::string path = NormalizeDir(RequireString(data, key));
  if (path[0] != '/') throw EngineError(kCodeInvalidParam, std::string("\"") + key +
                                                               "\" must be an absolute path");
  if (path.find('\0') != std::string::npos) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" holds a NUL");
  }
  return path;
}

int64_t OptionalInt(const Json::Value& obj, const char* key, int64_t fallback) {
  const Json::Value* v = obj.isObject() ? obj.find(key, key + std::strlen(key)) : nullptr;
  if (v == nullptr || v->isNull()) return fallback;
  if (!v->isIntegral() || v->asLargestInt() < 0) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key +
                                             "\" must be a non-negative integer");
  }
  return v->asLargestInt();
}

// How many times its size a request is counted against the memory limit while it runs.
constexpr int64_t kParsedWeight = 4;

// Deepest page a search may ask for; deeper paging is a sign of a runaway client.
constexpr int64_t kMaxSearchFrom = 1000000;

bool IsPublicCommand(const std::string& command) {
  return command == "search" || command == "suggest";
}

// The index a document command of a batch writes to, or empty for any other command.
std::string DocumentIndexOf(const Json::Value& sub) {
  if (!sub.isObject() || sub.isMember("compound")) return std::string();
  const Json::Value& command = sub["command"];
  const Json::Value& data = sub["data"];
  if (!command.isString() || !data.isObject()) return std::string();
  const std::string name = command.asString();
  const char* key = nullptr;
  if (name == "update_term_suggestion") {
    key = "db_name";
  } else if (name == "document_upsert_by_id" || name == "document_set_by_id" ||
             name == "document_del_by_id" || name == "document_del_by_query" ||
             name == "document_get_by_query" || name == "document_list") {
    key = "id";
  } else {
    return std::string();
  }
  const Json::Value& id = data[key];
  return id.isString() ? id.asString() : std::string();
}

// Whether every request of a batch is a document command on one and the same index.
bool IsOneIndexBatch(const Json::Value& list) {
  std::string first;
  for (const Json::Value& sub : list) {
    const std::string id = DocumentIndexOf(sub);
    if (id.empty() || (!first.empty() && id != first)) return false;
    first = id;
  }
  return !first.empty();
}

// Runs a read; a statement the guard interrupted is answered with why it stopped.
template <typename Fn>
auto Guarded(QueryGuard* guard, Fn fn) -> decltype(fn()) {
  try {
    return fn();
  } catch (const StoreError&) {
    if (guard != nullptr && guard->stopped() != QueryGuard::Stop::kNone) guard->Throw();
    throw;
  }
}

// Root sees every hit (no checker); anyone else only the files they could open. One checker
// serves the whole request, so its folder answers are shared by every hit of every index.
std::shared_ptr<AccessChecker> CheckerFor(const Caller& caller) {
  if (caller.uid == 0) return nullptr;
  return std::make_shared<AccessChecker>(caller.uid, caller.gid);
}

// The check for the hits of one index: symlinks are followed only down to its share's root.
VisibleFn VisibleIn(const std::shared_ptr<AccessChecker>& checker, const IndexStore& store) {
  if (!checker) return VisibleFn();
  return [checker, root = AccessChecker::ShareRootOf(store.dir())](const std::string& path) {
    return checker->CanOpen(path, root);
  };
}

const char* StateText(int code) {
  switch (code) {
    case kCodeIndexOpening: return "is opening";
    case kCodeIndexRecovering: return "is being checked after an unclean stop";
    case kCodeIndexPaused: return "is paused";
    case kCodeIndexMoving: return "is moving";
    case kCodeIndexDamaged: return "is damaged and needs a rebuild";
    default: return "is not available";
  }
}

const std::vector<std::string> kStoreFiles = {"", "-wal", "-shm"};

// Removes the index folder `dir` once it is empty, through its parent's verified descriptor.
void RemoveStoreDir(const std::string& dir) {
  const platform::SafeDir parent = OpenStoreDir(Dirname(dir), false);
  if (parent.valid()) parent.RemoveDir(Basename(dir));
}

// Moves the store files of one folder to another: a rename when both are on one file system,
// else a synced copy followed by removal of the originals. Both folders are reached without
// following links, and the files are moved through their descriptors.
void MoveStoreFiles(const std::string& from_dir, const std::string& to_dir) {
  const platform::SafeDir from = OpenStoreDir(from_dir, false);
  const platform::SafeDir to = OpenStoreDir(to_dir, true);
  if (!from.valid()) throw EngineError(kCodeStorage, "no store in " + from_dir);
  for (const std::string& suffix : kStoreFiles) {
    const std::string name = IndexStore::kDbFile + suffix;
    const std::string from_file = from_dir + "/" + name;
    const std::string to_file = to_dir + "/" + name;
    if (!from.Exists(name)) continue;
    if (from.RenameTo(name, to, name) == 0) continue;
    if (errno != EXDEV) {
      Log(LOG_ERR, "%s:%d rename %s to %s failed [err: %m]", SourceName(__FILE__), __LINE__,
          from_file.c_str(), to_file.c_str());
      throw EngineError(kCodeStorage, "cannot move " + from_file);
    }
    UniqueFd in;
    UniqueFd out;
    try {
      in = from.OpenFile(name, O_RDONLY);
      out = to.OpenFile(name, O_WRONLY | O_CREAT | O_TRUNC);
    } catch (const Error& e) {
      throw EngineError(kCodeStorage, e.message);
    }
    if (!in.valid() || !out.valid()) {
      throw EngineError(kCodeStorage, "cannot copy " + from_file + " to " + to_file);
    }
    char buf[64 * 1024];
    for (;;) {
      const ssize_t n = ::read(in.get(), buf, sizeof(buf));
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) throw EngineError(kCodeStorage, "cannot read " + from_file);
      if (n == 0) break;
      for (ssize_t done = 0; done < n;) {
        const ssize_t w = ::write(out.get(), buf + done, static_cast<size_t>(n - done));
        if (w < 0 && errno == EINTR) continue;
        if (w <= 0) throw EngineError(kCodeStorage, "cannot copy " + from_file + " to " + to_file);
        done += w;
      }
    }
    if (::fsync(out.get()) != 0) throw EngineError(kCodeStorage, "cannot sync " + to_file);
    from.Unlink(name);
  }
  to.Sync();
  RemoveStoreDir(from_dir);
}

}  // namespace

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

  IndexStore& Acquire(const std::string& id) {
    if (entry_ && entry_->id == id && txn_) return *entry_->store;
    FinishQuietly();
    std::shared_ptr<Entry> e = engine_.Find(id);
    std::unique_lock<std::mutex> lock(e->mu);
    if (e->removed) throw EngineError(kCodeIndexNotFound, "no index " + id);
    RequireReady(*e);
    try {
      txn_ = std::make_unique<WriteTxn>(*e->store);
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
    const bool lost = sqlite3_get_autocommit(entry_->store->writer().get()) != 0;
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
  std::unique_ptr<WriteTxn> txn_;
  std::vector<size_t> pending_;
  LostFn lost_;
  bool savepoints_ = true;
  QueryGuard* guard_ = nullptr;
};

Engine::Engine(EngineOptions options) : options_(std::move(options)) {
  // SQLite gives back cached pages as it nears half the limit, so that caches never push the
  // daemon into refusing requests for memory; the other half is for requests in flight.
  sqlite3_soft_heap_limit64(options_.memory_limit_bytes / 2);
}

Engine::~Engine() { Shutdown(); }

Json::Value Engine::ErrorReply(int code, const std::string& msg) {
  Json::Value r;
  r["success"] = false;
  r["error"]["code"] = code;
  r["error"]["msg"] = msg;
  return r;
}

void Engine::Start() {
  const bool after_crash = IsFileExist(options_.running_marker);
  if (after_crash) {
    Log(LOG_WARNING, "%s:%d the last run did not stop cleanly; checking every index",
        SourceName(__FILE__), __LINE__);
  }
  MakeParentDirs(options_.running_marker);
  std::ofstream(options_.running_marker).put('\n');
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    JsonValue reg;
    if (IsFileExist(options_.registry_file) && !reg.fromFile(options_.registry_file)) {
      Log(LOG_ERR, "%s:%d registry %s is unreadable; starting without indexes",
          SourceName(__FILE__), __LINE__, options_.registry_file.c_str());
    }
    for (const Json::Value& item : reg["indexes"]) {
      if (!item["id"].isString() || !item["path"].isString()) continue;
      auto e = std::make_shared<Entry>();
      e->id = item["id"].asString();
      e->path = item["path"].asString();
      e->state = item["paused"].asBool() ? State::kPaused
                                         : after_crash ? State::kRecovering : State::kOpening;
      indexes_[e->id] = e;
    }
  }
  opener_ = std::thread([this, after_crash] { OpenAll(after_crash); });
}

void Engine::OpenAll(bool after_crash) {
  std::vector<std::shared_ptr<Entry>> entries;
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    for (auto& [id, e] : indexes_) entries.push_back(e);
  }
  for (auto& e : entries) {
    if (shut_down_) break;
    std::string path;
    State waiting;
    {
      EntryGuard lock(*e);
      if (e->state != State::kOpening && e->state != State::kRecovering) continue;
      path = e->path;
      waiting = e->state;
    }
    // Opening and checking run without the index's lock, so that its requests are answered
    // 607 or 608 meanwhile instead of waiting.
    std::shared_ptr<IndexStore> store;
    std::string failure;
    bool damaged = false;
    bool refused = false;
    try {
      if (!IndexStore::ExistsIn(path)) {
        failure = "no store in " + path;
      } else {
        store = IndexStore::Open(path);
        if (after_crash && !store->QuickCheck(&failure)) damaged = true;
      }
    } catch (const UnsafeStoreError& err) {
      failure = err.what();
      refused = true;
    } catch (const StoreError& err) {
      failure = err.what();
      damaged = err.IsCorruption();
    } catch (const std::exception& err) {
      failure = err.what();
    }
    EntryGuard lock(*e);
    // Paused, moved or deleted meanwhile: that request decided the index's state.
    if (e->removed || e->state != waiting || e->path != path) continue;
    if (failure.empty()) {
      e->store = std::move(store);
      e->state = State::kReady;
    } else if (damaged) {
      store.reset();
      SetAside(*e, failure);
    } else if (refused) {
      Refuse(*e, failure);
    } else {
      e->state = State::kDamaged;
      Log(LOG_ERR, "%s:%d index %s cannot be opened (%s); it needs a rebuild",
          SourceName(__FILE__), __LINE__, e->id.c_str(), failure.c_str());
    }
  }
  std::lock_guard<std::mutex> lock(opened_mu_);
  opened_ = true;
  opened_cv_.notify_all();
}

void Engine::WaitOpened() {
  std::unique_lock<std::mutex> lock(opened_mu_);
  opened_cv_.wait(lock, [this] { return opened_; });
}

void Engine::Shutdown() {
  if (shut_down_.exchange(true)) return;
  if (opener_.joinable()) opener_.join();
  std::lock_guard<std::mutex> lock(registry_mu_);
  bool clean = true;
  for (auto& [id, e] : indexes_) {
    // Taking the lock waits for a writer in flight to finish its run.
    EntryGuard entry_lock(*e);
    if (!e->store) continue;
    try {
      e->store->Sync();
    } catch (const StoreError& err) {
      clean = false;
      Log(LOG_ERR, "%s:%d index %s could not be synced: %s", SourceName(__FILE__), __LINE__,
          id.c_str(), err.what());
    }
    e->store.reset();
    e->state = State::kOpening;
  }
  if (clean && !options_.running_marker.empty()) ::unlink(options_.running_marker.c_str());
}

std::shared_ptr<Engine::Entry> Engine::Find(const std::string& id) {
  std::lock_guard<std::mutex> lock(registry_mu_);
  auto it = indexes_.find(id);
  if (it == indexes_.end()) throw EngineError(kCodeIndexNotFound, "no index " + id);
  return it->second;
}

void Engine::RequireReady(const Entry& e) {
  int code = 0;
  switch (e.state) {
    case State::kReady: return;
    case State::kOpening: code = kCodeIndexOpening; break;
    case State::kRecovering: code = kCodeIndexRecovering; break;
    case State::kPaused: code = kCodeIndexPaused; break;
    case State::kMoving: code = kCodeIndexMoving; break;
    case State::kDamaged: code = kCodeIndexDamaged; break;
    case State::kRefused: throw EngineError(kCodeStorage, "index " + e.id + ": " + e.refusal);
  }
  throw EngineError(code, "index " + e.id + " " + StateText(code));
}

void Engine::Refuse(Entry& e, const std::string& why) {
  e.store.reset();
  e.state = State::kRefused;
  e.refusal = why;
  Publish(e);
}

void Engine::SetAside(Entry& e, const std::string& why) {
  e.store.reset();
  e.state = State::kDamaged;
  const std::string stamp = ".damaged-" + std::to_string(Env::Current()->Now());
  try {
    const platform::SafeDir folder = OpenStoreDir(e.path, false);
    for (const std::string& suffix : kStoreFiles) {
      const std::string name = IndexStore::kDbFile + suffix;
      if (folder.valid() && folder.Exists(name)) folder.Rename(name, name + stamp);
    }
  } catch (const StoreError& err) {
    Log(LOG_ERR, "%s:%d %s", SourceName(__FILE__), __LINE__, err.what());
  }
  Log(LOG_ERR, "%s:%d index %s in %s is damaged (%s); its files are set aside and it needs a "
      "rebuild", SourceName(__FILE__), __LINE__, e.id.c_str(), e.path.c_str(), why.c_str());
  Publish(e);
}

void Engine::HandleStoreFailure(Entry& e, const StoreError& err) {
  if (err.IsCorruption()) {
    SetAside(e, err.what());
  } else {
    Log(LOG_ERR, "%s:%d index %s: %s", SourceName(__FILE__), __LINE__, e.id.c_str(), err.what());
  }
}

void Engine::SaveRegistry() {
  JsonValue reg;
  reg["indexes"] = Json::Value(Json::arrayValue);
  for (auto& [id, e] : indexes_) {
    Json::Value item;
    item["id"] = id;
    item["path"] = e->path;
    item["paused"] = e->state == State::kPaused;
    reg["indexes"].append(item);
  }
  if (!reg.toFile(options_.registry_file)) {
    throw EngineError(kCodeStorage, "cannot write the registry " + options_.registry_file);
  }
}

int Engine::AdmitFrame(int64_t bytes) {
  // A request is held as text and as parsed values at once; the values take several times the
  // text's size.
  const int64_t weight = bytes * kParsedWeight;
  const int64_t in_flight = frame_bytes_.fetch_add(weight) + weight;
  if (in_flight + sqlite3_memory_used() > options_.memory_limit_bytes) {
    frame_bytes_.fetch_sub(weight);
    return kCodeOutOfMemory;
  }
  return 0;
}

void Engine::ReleaseFrame(int64_t bytes) { frame_bytes_.fetch_sub(bytes * kParsedWeight); }

Json::Value Engine::Handle(const std::string& payload, const Caller& caller) {
  size_t len = payload.size();
  while (len > 0 && payload[len - 1] == '\0') --len;
  JsonValue request;
  if (!request.fromString(payload.data(), payload.data() + len)) {
    return ErrorReply(kCodeMalformed, "request is not valid JSON");
  }
  return HandleValue(request, caller);
}

Json::Value Engine::HandleValue(const Json::Value& request, const Caller& caller) {
  if (!request.isObject()) return ErrorReply(kCodeMalformed, "request is not a JSON object");
  if (shut_down_) return ErrorReply(kCodeOverloaded, "the daemon is stopping");
  const bool compound = request.isMember("compound");
  if (!compound && !request.isMember("command")) {
    return ErrorReply(kCodeMalformed, "request has neither \"command\" nor \"compound\"");
  }
  if (compound && !request["compound"].isArray()) {
    return ErrorReply(kCodeMalformed, "\"compound\" is not an array");
  }
  // Everything but the people's commands writes or reads through the index's writer; a backlog
  // of those beyond the limit is refused rather than queued without bound.
  bool writes = false;
  if (compound) {
    for (const Json::Value& sub : request["compound"]) {
      if (!sub.isObject() || !sub["command"].isString() ||
          !IsPublicCommand(sub["command"].asString())) {
        writes = true;
      }
    }
  } else {
    writes = !request["command"].isString() || !IsPublicCommand(request["command"].asString());
  }
  if (writes) {
    if (write_backlog_.fetch_add(1) >= options_.max_write_backlog) {
      write_backlog_.fetch_sub(1);
      return ErrorReply(kCodeOverloaded, "too many write requests in progress");
    }
  }
  struct BacklogGuard {
    std::atomic<int>* counter;
    ~BacklogGuard() {
      if (counter != nullptr) counter->fetch_sub(1);
    }
  } guard{writes ? &write_backlog_ : nullptr};

  // One budget for all the searches of the request, so a batch of them cannot multiply it.
  const int64_t budget = options_.search_budget_micros;
  QueryGuard query_guard(budget > 0 ? Env::Current()->NowMicros() + budget : 0, caller.peer_fd,
                         budget);
  if (compound) return RunCompound(request["compound"], caller, &query_guard);
  Session session(*this);
  session.SetQueryGuard(&query_guard);
  // A failed request is rolled back whole when the session ends unfinished.
  session.SetSavepoints(false);
  Json::Value reply = RunSingle(request, caller, session);
  if (reply["success"].asBool()) {
    try {
      session.Finish();
    } catch (const StoreError& err) {
      return ErrorReply(err.IsCorruption() ? kCodeIndexDamaged : kCodeStorage, err.what());
    }
  }
  return reply;
}

Json::Value Engine::RunSingle(const Json::Value& request, const Caller& caller,
                              Session& session) {
  if (!request.isObject()) return ErrorReply(kCodeMalformed, "request is not a JSON object");
  const Json::Value& command = request["command"];
  if (!command.isString()) return ErrorReply(kCodeMalformed, "\"command\" is not a string");
  const Json::Value& data = request["data"];
  if (!data.isNull() && !data.isObject()) {
    return ErrorReply(kCodeMalformed, "\"data\" is not an object");
  }
  const std::string name = command.asString();
  if (!caller.privileged && !IsPublicCommand(name)) {
    return ErrorReply(kCodePermissionDenied, "command " + name + " is not allowed for uid " +
                                                 std::to_string(caller.uid));
  }
  try {
    Json::Value reply;
    reply["success"] = true;
    reply["data"] = Dispatch(name, data, caller, session);
    return reply;
  } catch (const EngineError& err) {
    return ErrorReply(err.code, err.what());
  } catch (const StoreError& err) {
    const bool damaged = err.IsCorruption();
    session.AfterStoreFailure(err);
    return ErrorReply(damaged ? kCodeIndexDamaged : kCodeStorage, err.what());
  } catch (const Json::Exception& err) {
    return ErrorReply(kCodeInvalidParam, err.what());
  } catch (const std::bad_alloc&) {
    return ErrorReply(kCodeOutOfMemory, "out of memory");
  }
}

Json::Value Engine::RunCompound(const Json::Value& list, const Caller& caller, QueryGuard* guard) {
  // A savepoint makes the full-text tables write their pending terms out as a segment of their
  // own, which for small documents costs more than the documents themselves. A batch on one
  // index therefore first runs as a single transaction without them; only when one of its
  // commands fails is all of it rolled back and run again with a savepoint per command.
  if (IsOneIndexBatch(list)) {
    Json::Value reply = RunCompoundPass(list, caller, false, guard);
    if (!reply.isNull()) return reply;
  }
  return RunCompoundPass(list, caller, true, guard);
}

Json::Value Engine::RunCompoundPass(const Json::Value& list, const Caller& caller, bool savepoints,
                                    QueryGuard* guard) {
  Json::Value reply;
  reply["success"] = true;
  reply["data"] = Json::Value(Json::arrayValue);
  Json::Value& results = reply["data"];
  Session session(*this);
  session.SetQueryGuard(guard);
  session.SetSavepoints(savepoints);
  session.SetLostHandler([&](const std::vector<size_t>& which, int code, const std::string& msg) {
    for (size_t i : which) results[static_cast<Json::ArrayIndex>(i)] = ErrorReply(code, msg);
  });
  for (Json::ArrayIndex i = 0; i < list.size(); ++i) {
    const Json::Value& sub = list[i];
    Json::Value result;
    if (sub.isObject() && sub.isMember("compound")) {
      result = ErrorReply(kCodeMalformed, "a compound request cannot hold another");
    } else {
      result = RunSingle(sub, caller, session);
    }
    // The session's destructor rolls back whatever this pass wrote.
    if (!savepoints && !result["success"].asBool()) return Json::Value();
    const bool ok = result["success"].asBool();
    results.append(std::move(result));
    if (ok) session.NoteWrite(i);
  }
  session.FinishQuietly();
  bool has_fail = false;
  for (const Json::Value& r : results) has_fail = has_fail || !r["success"].asBool();
  reply["has_fail"] = has_fail;
  return reply;
}

Json::Value Engine::Dispatch(const std::string& command, const Json::Value& data,
                             const Caller& caller, Session& session) {
  const bool batched = command == "update_term_suggestion" || command == "document_upsert_by_id" ||
                       command == "document_set_by_id" || command == "document_del_by_id" ||
                       command == "document_del_by_query" || command == "document_get_by_query" ||
                       command == "document_list";
  // Every other command works outside the batch's transaction: it needs the index locks the
  // batch may hold, or (searches) it reads committed data, which then includes the batch's.
  if (!batched && command != "commit") session.FinishQuietly();
  if (command == "index_create") return IndexCreate(data);
  if (command == "index_delete") return IndexDelete(data);
  if (command == "index_pause") return IndexPause(data, true);
  if (command == "index_resume") return IndexPause(data, false);
  if (command == "index_config_set") return IndexConfigSet(data);
  if (command == "index_list") return IndexList();
  if (command == "commit") return Commit(data, session);
  if (command == "list_term_sugg_db") return ListTermSuggDb();
  if (command == "search") return Search(data, caller, session.query_guard());
  if (command == "suggest") return Suggest(data, caller, session.query_guard());

  Json::Value result(Json::objectValue);
  if (command == "update_term_suggestion") {
    const std::string db = RequireString(data, "db_name");
    const std::string doc_id = RequireString(data, "doc_id_field");
    IndexStore& store = session.Acquire(db);
    std::optional<Savepoint> sp;
    if (session.savepoints()) sp.emplace(store.writer());
    if (!store.UpdateTermSuggestion(doc_id)) {
      throw EngineError(kCodeDocNotFound, "no document " + doc_id);
    }
    if (store.Meta("term_sugg") == "unavail") store.SetMeta("term_sugg", "rebuilding");
    if (sp) sp->Release();
    return result;
  }
  if (!batched) throw EngineError(kCodeUnknownCommand, "unknown command: " + command);
  const std::string id = RequireString(data, "id");
  IndexStore& store = session.Acquire(id);
  std::optional<Savepoint> sp;
  if (session.savepoints()) sp.emplace(store.writer());
  if (command == "document_upsert_by_id") {
    const Json::Value& doc = data["data"];
    if (!doc.isObject()) throw EngineError(kCodeInvalidParam, "\"data\" must be an object");
    const Json::Value& doc_id = data["doc_id"];
    if (!doc_id.isNull() && !doc_id.isString()) {
      throw EngineError(kCodeInvalidParam, "\"doc_id\" must be a string");
    }
    store.Upsert(doc_id.isString() ? doc_id.asString() : std::string(), doc);
  } else if (command == "document_set_by_id") {
    const std::string doc_id = RequireString(data, "doc_id");
    if (!data["data"].isObject()) throw EngineError(kCodeInvalidParam, "\"data\" must be an object");
    store.SetFields(doc_id, data["data"]);
  } else if (command == "document_del_by_id") {
    result["deleted"] = store.Delete(RequireString(data, "doc_id")) ? 1 : 0;
  } else if (command == "document_del_by_query") {
    result["deleted"] = static_cast<Json::Int64>(store.DeleteByQuery(DocQuery::Parse(data["query"])));
  } else if (command == "document_list") {
    const std::string dir = RequirePath(data, "path");
    const Json::Value& after = data["after"];
    if (!after.isNull() && !after.isString()) {
      throw EngineError(kCodeInvalidParam, "\"after\" must be a string");
    }
    std::vector<std::string> extra;
    if (!data["load_field"].isNull() && !data["load_field"].isArray()) {
      throw EngineError(kCodeInvalidParam, "\"load_field\" must be an array");
    }
    for (const Json::Value& f : data["load_field"]) {
      if (!f.isString()) throw EngineError(kCodeInvalidParam, "\"load_field\" holds a non-string");
      extra.push_back(f.asString());
    }
    const int64_t size =
        std::min(OptionalInt(data, "size", options_.default_page_size), options_.max_page_size);
    result = store.List(dir, after.isString() ? after.asString() : std::string(), extra, size);
  } else {
    const Json::Value& query = data["query"];
    const DocQuery q = DocQuery::Parse(query);
    std::vector<std::string> load;
    const Json::Value& fields = query["load_field"];
    if (!fields.isNull() && !fields.isArray()) {
      throw EngineError(kCodeInvalidParam, "\"load_field\" must be an array");
    }
    for (const Json::Value& f : fields) {
      if (!f.isString()) throw EngineError(kCodeInvalidParam, "\"load_field\" holds a non-string");
      // The library's rename loop repeats names on every pass; one copy is enough.
      if (std::find(load.begin(), load.end(), f.asString()) == load.end()) {
        load.push_back(f.asString());
      }
    }
    const Json::Value& paging = query.isMember("from") || query.isMember("size") ? query : data;
    const int64_t from = OptionalInt(paging, "from", 0);
    const int64_t size = std::min(OptionalInt(paging, "size", options_.default_page_size),
                                  options_.max_page_size);
    result = store.GetByQuery(q, load, from, size);
  }
  if (sp) sp->Release();
  return result;
}

void Engine::CheckIndexPath(const std::string& path) const {
  if ((path + "/").find("/../") != std::string::npos || (path + "/").find("/./") != std::string::npos) {
    throw EngineError(kCodeInvalidParam, "index path must not hold . or .. components: " + path);
  }
  if (options_.index_root.empty()) return;
  const std::string root = NormalizeDir(options_.index_root);
  if (path.compare(0, root.size() + 1, root + "/") != 0) {
    throw EngineError(kCodeInvalidParam, "index path must lie below " + root + ": " + path);
  }
}

Json::Value Engine::IndexCreate(const Json::Value& data) {
  const std::string id = RequireString(data, "id");
  const std::string path = RequirePath(data, "path");
  CheckIndexPath(path);
  const Json::Value& mappings = data["mappings"];
  if (!mappings.isObject()) throw EngineError(kCodeInvalidParam, "\"mappings\" must be an object");
  Schema::Parse(mappings);
  std::lock_guard<std::mutex> lock(registry_mu_);
  auto it = indexes_.find(id);
  if (it != indexes_.end()) {
    // Re-creating an index where it already is keeps it and its documents; one refused for a
    // planted entry is tried again, as the entry may be gone by now.
    if (it->second->path == path) {
      Entry& old = *it->second;
      EntryGuard entry_lock(old);
      if (old.state == State::kRefused) {
        try {
          old.store = IndexStore::ExistsIn(path)
                          ? IndexStore::Open(path)
                          : IndexStore::Create(path, id, mappings, data["settings"],
                                               data["event_handler"]);
        } catch (const UnsafeStoreError& err) {
          old.refusal = err.what();
          throw;
        }
        old.state = State::kReady;
        old.refusal.clear();
      }
      return Json::Value(Json::objectValue);
    }
    throw EngineError(kCodeIndexExists, "index " + id + " exists in " + it->second->path);
  }
  for (auto& [other_id, e] : indexes_) {
    if (e->path == path) throw EngineError(kCodeIndexExists, "index " + other_id + " uses " + path);
  }
  auto e = std::make_shared<Entry>();
  e->id = id;
  e->path = path;
  try {
    if (IndexStore::ExistsIn(path)) {
      // A store left in the folder (an index re-keyed or a registry lost) is adopted, not
      // overwritten: its documents are the index's.
      e->store = IndexStore::Open(path);
      WriteTxn txn(*e->store);
      e->store->SetMeta("id", id);
      txn.Commit();
      Log(LOG_INFO, "%s:%d index %s adopts the store in %s", SourceName(__FILE__), __LINE__,
          id.c_str(), path.c_str());
    } else {
      e->store = IndexStore::Create(path, id, mappings, data["settings"], data["event_handler"]);
    }
    e->state = State::kReady;
  } catch (const UnsafeStoreError& err) {
    // Kept as refused, so that the index's state tells why; creating it again once the entry
    // is gone finishes the job.
    Refuse(*e, err.what());
    indexes_[id] = e;
    SaveRegistry();
    throw;
  }
  Publish(*e);
  indexes_[id] = e;
  try {
    SaveRegistry();
  } catch (...) {
    indexes_.erase(id);
    throw;
  }
  Json::Value result;
  result["created"] = true;
  return result;
}

Json::Value Engine::IndexDelete(const Json::Value& data) {
  const std::string id = RequireString(data, "id");
  std::shared_ptr<Entry> e;
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    auto it = indexes_.find(id);
    Json::Value result;
    // Deleting an index that is not there is not an error: the caller wants it gone.
    result["deleted"] = it != indexes_.end();
    if (it == indexes_.end()) return result;
    e = it->second;
    indexes_.erase(it);
    SaveRegistry();
  }
  EntryGuard lock(*e);
  e->removed = true;
  e->store.reset();
  try {
    const platform::SafeDir folder = OpenStoreDir(e->path, false);
    if (folder.valid()) {
      for (const std::string& suffix : kStoreFiles) folder.Unlink(IndexStore::kDbFile + suffix);
    }
    RemoveStoreDir(e->path);
  } catch (const StoreError& err) {
    // The index is forgotten either way; what stands in its folder's place is not touched.
    Log(LOG_ERR, "%s:%d %s", SourceName(__FILE__), __LINE__, err.what());
  }
  Json::Value result;
  result["deleted"] = true;
  return result;
}

Json::Value Engine::IndexPause(const Json::Value& data, bool pause) {
  const std::string id = RequireString(data, "id");
  std::shared_ptr<Entry> e = Find(id);
  {
    EntryGuard lock(*e);
    if (pause) {
      if (e->state == State::kPaused) return Json::Value(Json::objectValue);
      if (e->state == State::kMoving) RequireReady(*e);
      if (e->store) e->store->Sync();
      e->store.reset();
      e->state = State::kPaused;
    } else {
      if (e->state != State::kPaused) return Json::Value(Json::objectValue);
      try {
        e->store = IndexStore::Open(e->path);
        e->state = State::kReady;
      } catch (const UnsafeStoreError& err) {
        Refuse(*e, err.what());
        throw;
      } catch (const StoreError& err) {
        if (err.IsCorruption()) {
          SetAside(*e, err.what());
        } else {
          e->state = State::kDamaged;
        }
        throw;
      } catch (const EngineError&) {
        e->state = State::kDamaged;
        throw EngineError(kCodeIndexDamaged, "index " + id + " has no store in " + e->path);
      }
    }
  }
  std::lock_guard<std::mutex> lock(registry_mu_);
  SaveRegistry();
  return Json::Value(Json::objectValue);
}

Json::Value Engine::IndexConfigSet(const Json::Value& data) {
  const std::string id = RequireString(data, "id");
  const Json::Value& change = data["data"];
  if (!change.isObject()) throw EngineError(kCodeInvalidParam, "\"data\" must be an object");
  const std::string new_id = change.isMember("id") ? RequireString(change, "id") : id;
  const std::string new_path = change.isMember("path") ? RequirePath(change, "path") : "";
  if (!new_path.empty()) CheckIndexPath(new_path);
  std::shared_ptr<Entry> e;
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    auto it = indexes_.find(id);
    if (it == indexes_.end()) throw EngineError(kCodeIndexNotFound, "no index " + id);
    e = it->second;
    if (new_id != id && indexes_.count(new_id) != 0) {
      throw EngineError(kCodeIndexExists, "index " + new_id + " exists");
    }
    if (!new_path.empty() && new_path != e->path) {
      for (auto& [other_id, other] : indexes_) {
        if (other->path == new_path) {
          throw EngineError(kCodeIndexExists, "index " + other_id + " uses " + new_path);
        }
      }
    }
    if (new_id != id) {
      std::lock_guard<std::mutex> entry_lock(e->mu);
      if (e->store) {
        WriteTxn txn(*e->store);
        e->store->SetMeta("id", new_id);
        txn.Commit();
      }
      e->id = new_id;
      indexes_.erase(it);
      indexes_[new_id] = e;
      SaveRegistry();
    }
  }
  if (new_path.empty() || new_path == e->path) return Json::Value(Json::objectValue);

  std::string old_path;
  State before;
  {
    EntryGuard lock(*e);
    if (e->state != State::kReady && e->state != State::kPaused) RequireReady(*e);
    if (IndexStore::ExistsIn(new_path)) {
      throw EngineError(kCodeIndexExists, "a store already exists in " + new_path);
    }
    before = e->state;
    if (e->store) e->store->Sync();
    e->store.reset();
    old_path = e->path;
    // Requests that arrive while the files move are answered "moving" instead of waiting.
    e->state = State::kMoving;
  }
  std::string failure;
  try {
    MoveStoreFiles(old_path, new_path);
  } catch (const EngineError& err) {
    failure = err.what();
  } catch (const StoreError& err) {
    failure = err.what();
  }
  {
    EntryGuard lock(*e);
    if (failure.empty()) e->path = new_path;
    e->state = before;
    if (before == State::kReady) {
      try {
        e->store = IndexStore::Open(e->path);
      } catch (const UnsafeStoreError& err) {
        Refuse(*e, err.what());
        failure = err.what();
      } catch (const StoreError& err) {
        HandleStoreFailure(*e, err);
        if (!err.IsCorruption()) e->state = State::kDamaged;
        failure = err.what();
      }
    }
  }
  {
    std::lock_guard<std::mutex> reg_lock(registry_mu_);
    SaveRegistry();
  }
  if (!failure.empty()) throw EngineError(kCodeStorage, failure);
  return Json::Value(Json::objectValue);
}

Json::Value Engine::Commit(const Json::Value& data, Session& session) {
  const std::string id = RequireString(data, "id");
  // Everything the batch wrote so far is committed first, so the sync covers it.
  session.Finish();
  std::shared_ptr<Entry> e = Find(id);
  std::lock_guard<std::mutex> lock(e->mu);
  RequireReady(*e);
  try {
    const std::string sugg = e->store->Meta("term_sugg");
    if (sugg == "rebuilding" || (sugg != "ready" && e->store->DocCount() == 0)) {
      WriteTxn txn(*e->store);
      e->store->SetMeta("term_sugg", "ready");
      txn.Commit();
    }
    e->store->Sync();
  } catch (const StoreError& err) {
    HandleStoreFailure(*e, err);
    throw;
  }
  return Json::Value(Json::objectValue);
}

Json::Value Engine::ListTermSuggDb() {
  Json::Value result;
  result["unavail"] = Json::Value(Json::arrayValue);
  std::vector<std::shared_ptr<Entry>> entries;
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    for (auto& [id, e] : indexes_) entries.push_back(e);
  }
  for (auto& e : entries) {
    std::lock_guard<std::mutex> lock(e->mu);
    if (e->state != State::kReady) continue;
    if (e->store->Meta("term_sugg") != "ready") result["unavail"].append(e->id);
  }
  return result;
}

Json::Value Engine::IndexList() {
  static const char* kNames[] = {"opening", "recovering", "ready",  "paused",
                                 "moving",  "damaged",    "refused"};
  Json::Value result(Json::arrayValue);
  std::lock_guard<std::mutex> lock(registry_mu_);
  for (auto& [id, e] : indexes_) {
    std::lock_guard<std::mutex> entry_lock(e->mu);
    Json::Value item;
    item["id"] = id;
    item["path"] = e->path;
    item["state"] = kNames[static_cast<int>(e->state)];
    if (e->state == State::kRefused) item["error"] = e->refusal;
    if (e->store) item["documents"] = static_cast<Json::Int64>(e->store->DocCount());
    result.append(item);
  }
  return result;
}

std::vector<std::shared_ptr<IndexStore>> Engine::SearchTargets(const Json::Value& data) {
  std::vector<std::string> ids;
  const Json::Value& id = data["id"];
  if (id.isString()) {
    ids.push_back(id.asString());
  } else if (id.isArray()) {
    for (const Json::Value& v : id) {
      if (!v.isString()) throw EngineError(kCodeInvalidParam, "\"id\" must hold strings");
      ids.push_back(v.asString());
    }
  } else if (!id.isNull()) {
    throw EngineError(kCodeInvalidParam, "\"id\" must be a string or an array of strings");
  }
  std::vector<std::pair<std::string, std::shared_ptr<Entry>>> entries;
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    if (ids.empty()) {
      for (auto& [name, e] : indexes_) entries.emplace_back(name, e);
    } else {
      for (const std::string& name : ids) {
        auto it = indexes_.find(name);
        if (it == indexes_.end()) throw EngineError(kCodeIndexNotFound, "no index " + name);
        entries.emplace_back(name, it->second);
      }
    }
  }
  std::vector<std::shared_ptr<IndexStore>> stores;
  for (auto& [name, e] : entries) {
    std::lock_guard<std::mutex> lock(e->view_mu);
    if (e->view_store) {
      stores.push_back(e->view_store);
    } else if (!ids.empty()) {
      // A named index that cannot answer is an error, not an empty result.
      Entry view;
      view.id = name;
      view.state = e->view_state;
      RequireReady(view);
    }
  }
  return stores;
}

Json::Value Engine::Search(const Json::Value& data, const Caller& caller, QueryGuard* guard) {
  SearchParams p;
  const Json::Value& d = data.isObject() ? data : Json::Value(Json::objectValue);
  auto str = [&](const char* key) {
    const Json::Value& v = d[key];
    if (!v.isNull() && !v.isString()) {
      throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" must be a string");
    }
    return v.asString();
  };
  p.keywords = str("keyword");
  p.name = str("name");
  p.folder = str("folder");
  const Json::Value& ext = d["ext"];
  if (ext.isString()) {
    p.exts.push_back(AsciiLower(ext.asString()));
  } else if (ext.isArray()) {
    for (const Json::Value& v : ext) {
      if (!v.isString()) throw EngineError(kCodeInvalidParam, "\"ext\" must hold strings");
      p.exts.push_back(AsciiLower(v.asString()));
    }
  } else if (!ext.isNull()) {
    throw EngineError(kCodeInvalidParam, "\"ext\" must be a string or an array of strings");
  }
  const std::string type = str("file_type");
  if (!type.empty()) {
    static const std::map<std::string, std::vector<std::string>> kTypes = {
        {"document", {"pdf", "doc", "docx", "odt", "rtf", "txt", "md", "xls", "xlsx", "ods",
                      "csv", "ppt", "pptx", "odp", "html", "htm", "xml", "json", "epub"}},
        {"audio", {"mp3", "flac", "wav", "ogg", "oga", "m4a", "aac", "wma", "aiff", "ape", "opus"}},
        {"video", {"mp4", "mkv", "avi", "mov", "wmv", "m4v", "mpg", "mpeg", "webm", "ts", "flv",
                   "3gp"}},
        {"photo", {"jpg", "jpeg", "png", "gif", "bmp", "tif", "tiff", "heic", "webp", "raw",
                   "cr2", "nef", "arw", "dng", "svg"}},
    };
    if (type == "folder") {
      p.is_dir = true;
    } else {
      auto it = kTypes.find(type);
      if (it == kTypes.end()) {
        throw EngineError(kCodeInvalidParam, "unknown \"file_type\": " + type);
      }
      std::vector<std::string> allowed = it->second;
      if (!p.exts.empty()) {
        // Both filters hold: keep the named extensions of that type only.
        std::vector<std::string> both;
        for (const std::string& e : p.exts) {
          if (std::find(allowed.begin(), allowed.end(), e) != allowed.end()) both.push_back(e);
        }
        allowed = both.empty() ? std::vector<std::string>{""} : both;
      }
      p.exts = allowed;
      p.is_dir = false;
    }
  }
  auto range = [&](const char* key, std::optional<int64_t>& lo, std::optional<int64_t>& hi) {
    const Json::Value& r = d[key];
    if (r.isNull()) return;
    if (!r.isObject()) throw EngineError(kCodeInvalidParam, std::string("\"") + key +
                                                                "\" must be an object");
    for (const char* bound : {"gte", "lte"}) {
      const Json::Value& v = r[bound];
      if (v.isNull()) continue;
      if (!v.isIntegral()) {
        throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" bounds must be integers");
      }
      (bound[0] == 'g' ? lo : hi) = v.asLargestInt();
    }
  };
  range("size_range", p.size_min, p.size_max);
  range("mtime_range", p.mtime_min, p.mtime_max);
  const std::string sort = str("sort");
  if (sort.empty() || sort == "relevance") p.sort = SearchParams::Sort::kRelevance;
  else if (sort == "name") p.sort = SearchParams::Sort::kName;
  else if (sort == "size") p.sort = SearchParams::Sort::kSize;
  else if (sort == "mtime") p.sort = SearchParams::Sort::kMtime;
  else throw EngineError(kCodeInvalidParam, "unknown \"sort\": " + sort);
  const std::string order = str("order");
  if (!order.empty() && order != "asc" && order != "desc") {
    throw EngineError(kCodeInvalidParam, "\"order\" must be asc or desc");
  }
  p.desc = order == "desc";
  p.from = OptionalInt(d, "from", 0);
  if (p.from > kMaxSearchFrom) {
    throw EngineError(kCodeInvalidParam, "\"from\" is beyond " + std::to_string(kMaxSearchFrom));
  }
  p.size = std::min<int64_t>(OptionalInt(d, "size", 20), 1000);
  if (p.keywords.empty() && p.name.empty() && p.folder.empty() && p.exts.empty() && !p.is_dir &&
      !p.size_min && !p.size_max && !p.mtime_min && !p.mtime_max) {
    throw EngineError(kCodeInvalidParam, "a search needs \"keyword\", \"name\" or a filter");
  }

  std::vector<std::shared_ptr<IndexStore>> stores = SearchTargets(d);
  const std::shared_ptr<AccessChecker> checker = CheckerFor(caller);
  // Each index gives its best from + size hits; the merge keeps the global order.
  SearchParams each = p;
  each.from = 0;
  each.size = p.from + p.size;
  // With one index its page is the answer from `from` on; merged pages may take any of theirs.
  each.snippet_from = stores.size() == 1 ? p.from : 0;
  int64_t total = 0;
  bool exact = true;
  std::vector<Json::Value> hits;
  for (auto& store : stores) {
    SearchPage page =
        Guarded(guard, [&] { return store->Search(each, VisibleIn(checker, *store), guard); });
    total += page.total;
    exact = exact && page.total_exact;
    for (Json::Value& h : page.hits) hits.push_back(std::move(h));
  }
  auto key_less = [&](const Json::Value& a, const Json::Value& b) {
    switch (p.sort) {
      case SearchParams::Sort::kRelevance:
        if (!p.keywords.empty()) {
          return p.desc ? a["score"].asDouble() < b["score"].asDouble()
                        : a["score"].asDouble() > b["score"].asDouble();
        }
        return false;  // index order within each index, indexes one after the other
      case SearchParams::Sort::kName:
        return p.desc ? AsciiLower(a["name"].asString()) > AsciiLower(b["name"].asString())
                      : AsciiLower(a["name"].asString()) < AsciiLower(b["name"].asString());
      case SearchParams::Sort::kSize:
        return p.desc ? a["size"].asInt64() > b["size"].asInt64()
                      : a["size"].asInt64() < b["size"].asInt64();
      case SearchParams::Sort::kMtime:
        return p.desc ? a["mtime"].asInt64() > b["mtime"].asInt64()
                      : a["mtime"].asInt64() < b["mtime"].asInt64();
    }
    return false;
  };
  if (stores.size() > 1) std::stable_sort(hits.begin(), hits.end(), key_less);
  Json::Value result;
  result["total"] = static_cast<Json::Int64>(total);
  result["total_exact"] = exact;
  result["hits"] = Json::Value(Json::arrayValue);
  for (int64_t i = p.from; i < static_cast<int64_t>(hits.size()) && i < p.from + p.size; ++i) {
    result["hits"].append(hits[static_cast<size_t>(i)]);
  }
  return result;
}

Json::Value Engine::Suggest(const Json::Value& data, const Caller& caller, QueryGuard* guard) {
  const Json::Value& d = data.isObject() ? data : Json::Value(Json::objectValue);
  const std::string prefix = RequireString(d, "prefix");
  const int64_t size = std::min<int64_t>(OptionalInt(d, "size", 10), 100);
  std::vector<std::shared_ptr<IndexStore>> stores = SearchTargets(d);
  const std::shared_ptr<AccessChecker> checker = CheckerFor(caller);
  std::vector<std::string> terms;
  for (auto& store : stores) {
    for (const std::string& t : Guarded(guard, [&] {
           return store->Suggest(prefix, static_cast<size_t>(size), VisibleIn(checker, *store),
                                 guard);
         })) {
      if (std::find(terms.begin(), terms.end(), t) == terms.end()) terms.push_back(t);
    }
  }
  if (terms.size() > static_cast<size_t>(size)) terms.resize(static_cast<size_t>(size));
  Json::Value result;
  result["suggestions"] = Json::Value(Json::arrayValue);
  for (const std::string& t : terms) result["suggestions"].append(t);
  return result;
}

}  // namespace elasticd
}  // namespace orvane
