// The index commands: create, delete, pause and resume, re-key or move, commit, and the lists.
#include "daemons/quixelasticd/engine.hpp"

#include <syslog.h>

#include "common/log.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/engine_session.hpp"
#include "daemons/quixelasticd/request_args.hpp"
#include "daemons/quixelasticd/schema.hpp"

namespace orvane {
namespace elasticd {

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
          old.store = options_.stores->Exists(path, id)
                          ? options_.stores->Open(path, id)
                          : options_.stores->Create(path, id, mappings, data["settings"],
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
    if (options_.stores->Exists(path, id)) {
      // A store left in the folder (an index re-keyed or a registry lost) is adopted, not
      // overwritten: its documents are the index's.
      e->store = options_.stores->Open(path, id);
      e->store->Rekey(id);
      ORVANE_LOG(LOG_INFO, "index %s adopts the store in %s", id.c_str(), path.c_str());
    } else {
      e->store = options_.stores->Create(path, id, mappings, data["settings"], data["event_handler"]);
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
  options_.stores->Remove(e->path, e->id);
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
        e->store = options_.stores->Open(e->path, e->id);
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
      if (e->store) e->store->Rekey(new_id);
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
    if (options_.stores->Exists(new_path, e->id)) {
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
    options_.stores->Move(old_path, new_path, e->id);
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
        e->store = options_.stores->Open(e->path, e->id);
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
      std::unique_ptr<StoreTxn> txn = e->store->Begin();
      e->store->SetMeta("term_sugg", "ready");
      txn->Commit();
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

}  // namespace elasticd
}  // namespace orvane
