// The engine's set of indexes: reading and saving the registry, opening the stores at start,
// and the states an index takes when its store cannot serve.
#include "daemons/quixelasticd/engine.hpp"

#include <syslog.h>
#include <unistd.h>

#include <fstream>

#include "common/env.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"

namespace orvane {
namespace elasticd {

namespace {

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

}  // namespace

void Engine::Start() {
  const bool after_crash = IsFileExist(options_.running_marker);
  if (after_crash) {
    ORVANE_LOG(LOG_WARNING, "the last run did not stop cleanly; checking every index");
  }
  MakeParentDirs(options_.running_marker);
  std::ofstream(options_.running_marker).put('\n');
  {
    std::lock_guard<std::mutex> lock(registry_mu_);
    JsonValue reg;
    if (IsFileExist(options_.registry_file) && !reg.fromFile(options_.registry_file)) {
      ORVANE_LOG(LOG_ERR, "registry %s is unreadable; starting without indexes",
                 options_.registry_file.c_str());
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
    // kCodeIndexOpening or kCodeIndexRecovering meanwhile instead of waiting.
    std::shared_ptr<Store> store;
    std::string failure;
    bool damaged = false;
    bool refused = false;
    try {
      if (!options_.stores->Exists(path, e->id)) {
        failure = "no store in " + path;
      } else {
        store = options_.stores->Open(path, e->id);
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
      ORVANE_LOG(LOG_ERR, "index %s cannot be opened (%s); it needs a rebuild", e->id.c_str(),
                 failure.c_str());
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
      ORVANE_LOG(LOG_ERR, "index %s could not be synced: %s", id.c_str(), err.what());
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
  options_.stores->SetAside(e.path, e.id, ".damaged-" + std::to_string(Env::Current()->Now()));
  ORVANE_LOG(LOG_ERR,
             "index %s in %s is damaged (%s); its files are set aside and it needs a "
             "rebuild",
             e.id.c_str(), e.path.c_str(), why.c_str());
  Publish(e);
}

void Engine::HandleStoreFailure(Entry& e, const StoreError& err) {
  if (err.IsCorruption()) {
    SetAside(e, err.what());
  } else {
    ORVANE_LOG(LOG_ERR, "index %s: %s", e.id.c_str(), err.what());
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

}  // namespace elasticd
}  // namespace orvane
