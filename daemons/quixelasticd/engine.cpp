#include "daemons/quixelasticd/engine.hpp"

#include <sqlite3.h>
#include <syslog.h>

#include <algorithm>
#include <optional>

#include "common/env.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "daemons/quixelasticd/bulk_codec.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/engine_session.hpp"
#include "daemons/quixelasticd/request_args.hpp"

namespace orvane {
namespace elasticd {

namespace {

// How many times its size a request is counted against the memory limit while it runs.
constexpr int64_t kParsedWeight = 4;

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
  } else if (name == "document_upsert_by_id" || name == kBulkUpsertCommand ||
             name == "document_set_by_id" ||
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

}  // namespace

Engine::Engine(EngineOptions options) : options_(std::move(options)) {
  // SQLite gives back cached pages as it nears half the limit, so that caches never push the
  // daemon into refusing requests for memory; the other half is for requests in flight.
  sqlite3_soft_heap_limit64(options_.memory_limit_bytes / 2);
  if (!options_.stores) options_.stores = SqliteBackend();
}

Engine::~Engine() { Shutdown(); }

Json::Value Engine::ErrorReply(int code, const std::string& msg) {
  Json::Value r;
  r["success"] = false;
  r["error"]["code"] = code;
  r["error"]["msg"] = msg;
  return r;
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
                       command == kBulkUpsertCommand ||
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
    Store& store = session.Acquire(db);
    std::unique_ptr<StoreSavepoint> sp;
    if (session.savepoints()) sp = store.BeginSavepoint();
    if (!store.UpdateTermSuggestion(doc_id)) {
      throw EngineError(kCodeDocNotFound, "no document " + doc_id);
    }
    if (store.Meta("term_sugg") == "unavail") store.SetMeta("term_sugg", "rebuilding");
    if (sp) sp->Release();
    return result;
  }
  if (!batched) throw EngineError(kCodeUnknownCommand, "unknown command: " + command);
  const std::string id = RequireString(data, "id");
  Store& store = session.Acquire(id);
  std::unique_ptr<StoreSavepoint> sp;
  if (session.savepoints()) sp = store.BeginSavepoint();
  if (command == "document_upsert_by_id") {
    const Json::Value& doc = data["data"];
    if (!doc.isObject()) throw EngineError(kCodeInvalidParam, "\"data\" must be an object");
    const Json::Value& doc_id = data["doc_id"];
    if (!doc_id.isNull() && !doc_id.isString()) {
      throw EngineError(kCodeInvalidParam, "\"doc_id\" must be a string");
    }
    store.Upsert(doc_id.isString() ? doc_id.asString() : std::string(), doc);
  } else if (command == kBulkUpsertCommand) {
    int64_t upserted = 0;
    std::string error;
    if (!DecodeBulk(RequireString(data, "docs"),
                    [&](const BulkDoc& doc) {
                      store.Upsert(doc.Path(), doc.ToJson());
                      ++upserted;
                    },
                    &error)) {
      throw EngineError(kCodeInvalidParam, error);
    }
    result["upserted"] = static_cast<Json::Int64>(upserted);
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

}  // namespace elasticd
}  // namespace orvane
