// The people's commands: search and suggest over one, several or every index, each hit shown
// only to a caller who could open its file.
#include "daemons/quixelasticd/engine.hpp"

#include <algorithm>
#include <optional>
#include <string>
#include <vector>

#include "common/util.hpp"
#include "daemons/quixelasticd/access.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/request_args.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace elasticd {

namespace {

// Deepest page a search may ask for; deeper paging is a sign of a runaway client.
constexpr int64_t kMaxSearchFrom = 1000000;

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
VisibleFn VisibleIn(const std::shared_ptr<AccessChecker>& checker, const Store& store) {
  if (!checker) return VisibleFn();
  return [checker, root = AccessChecker::ShareRootOf(store.dir())](const std::string& path) {
    return checker->CanOpen(path, root);
  };
}

// The value of `key`: a string, or "" when absent.
std::string OptionalString(const Json::Value& d, const char* key) {
  const Json::Value& v = d[key];
  if (!v.isNull() && !v.isString()) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" must be a string");
  }
  return v.asString();
}

std::vector<std::string> ReadExts(const Json::Value& ext) {
  std::vector<std::string> exts;
  if (ext.isString()) {
    exts.push_back(AsciiLower(ext.asString()));
  } else if (ext.isArray()) {
    for (const Json::Value& v : ext) {
      if (!v.isString()) throw EngineError(kCodeInvalidParam, "\"ext\" must hold strings");
      exts.push_back(AsciiLower(v.asString()));
    }
  } else if (!ext.isNull()) {
    throw EngineError(kCodeInvalidParam, "\"ext\" must be a string or an array of strings");
  }
  return exts;
}

// The extensions a search by kind ("document", "audio", "video", "photo") matches: the library's
// own table, the one the folders' content switches ask, so that a search by kind finds what that
// kind's switch extracts. The index keeps only the extension, so the kind becomes a list over
// that column: the index format stays as it was. Extensions `named` as well narrow it to those
// of the kind; when none is, the list holds "/", which no extension can contain.
std::vector<std::string> ExtensionsOfKind(const std::string& type,
                                          const std::vector<std::string>& named) {
  const fileindex::FileType kind = fileindex::GetFileTypeBySetting(type);
  if (kind == fileindex::kOther) {
    throw EngineError(kCodeInvalidParam, "unknown \"file_type\": " + type);
  }
  if (named.empty()) return fileindex::GetExtensionsOfType(kind);
  std::vector<std::string> both;
  for (const std::string& ext : named) {
    if (fileindex::GetFileTypeByExtension(ext) == kind) both.push_back(ext);
  }
  if (both.empty()) both.push_back("/");
  return both;
}

void ReadRange(const Json::Value& d, const char* key, std::optional<int64_t>* lo,
               std::optional<int64_t>* hi) {
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
    *(bound[0] == 'g' ? lo : hi) = v.asLargestInt();
  }
}

SearchParams::Sort ReadSort(const std::string& sort) {
  if (sort.empty() || sort == "relevance") return SearchParams::Sort::kRelevance;
  if (sort == "name") return SearchParams::Sort::kName;
  if (sort == "size") return SearchParams::Sort::kSize;
  if (sort == "mtime") return SearchParams::Sort::kMtime;
  throw EngineError(kCodeInvalidParam, "unknown \"sort\": " + sort);
}

// A search request's parameters, checked in the order of its keys' errors.
SearchParams ParseSearch(const Json::Value& d) {
  SearchParams p;
  p.keywords = OptionalString(d, "keyword");
  p.name = OptionalString(d, "name");
  p.folder = OptionalString(d, "folder");
  p.exts = ReadExts(d["ext"]);
  const std::string type = OptionalString(d, "file_type");
  if (type == "folder") {
    p.is_dir = true;
  } else if (!type.empty()) {
    p.exts = ExtensionsOfKind(type, p.exts);
    p.is_dir = false;
  }
  if (!d["query"].isNull()) {
    p.query = CompileQueryTree(d["query"]);
    p.server_query = CompileQueryTreeForServer(d["query"]);
  }
  ReadRange(d, "size_range", &p.size_min, &p.size_max);
  ReadRange(d, "mtime_range", &p.mtime_min, &p.mtime_max);
  p.sort = ReadSort(OptionalString(d, "sort"));
  const std::string order = OptionalString(d, "order");
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
      !p.size_min && !p.size_max && !p.mtime_min && !p.mtime_max && !p.query) {
    throw EngineError(kCodeInvalidParam, "a search needs \"keyword\", \"name\" or a filter");
  }
  return p;
}

// The check for hits of any of this server's indexes: each path is checked against the share of
// the index whose share holds it.
VisibleFn VisibleInAny(const std::shared_ptr<AccessChecker>& checker,
                       const std::vector<std::shared_ptr<Store>>& stores) {
  if (!checker) return VisibleFn();
  std::vector<std::string> roots;
  for (const auto& store : stores) {
    const std::string root = AccessChecker::ShareRootOf(store->dir());
    if (!root.empty()) roots.push_back(root);
  }
  return [checker, roots](const std::string& path) {
    std::string best;
    for (const std::string& root : roots) {
      if (root.size() > best.size() && path.compare(0, root.size(), root) == 0 &&
          (path.size() == root.size() || path[root.size()] == '/')) {
        best = root;
      }
    }
    return checker->CanOpen(path, best);
  };
}

// Whether the search asks for the indexes of every file server sharing the database
// ("servers": "all") rather than this server's ("this", the default).
bool AllServers(const Json::Value& d) {
  const std::string servers = OptionalString(d, "servers");
  if (servers.empty() || servers == "this") return false;
  if (servers == "all") return true;
  throw EngineError(kCodeInvalidParam, "\"servers\" must be \"this\" or \"all\"");
}

// The hits of every index, each index giving its best from + size, with their totals summed.
SearchPage SearchEach(const std::vector<std::shared_ptr<Store>>& stores,
                      const SearchParams& p, const Caller& caller, QueryGuard* guard) {
  const std::shared_ptr<AccessChecker> checker = CheckerFor(caller);
  SearchParams each = p;
  each.from = 0;
  each.size = p.from + p.size;
  // With one index its page is the answer from `from` on; merged pages may take any of theirs.
  each.snippet_from = stores.size() == 1 ? p.from : 0;
  SearchPage all;
  for (auto& store : stores) {
    SearchPage page =
        Guarded(guard, [&] { return store->Search(each, VisibleIn(checker, *store), guard); });
    all.total += page.total;
    all.total_exact = all.total_exact && page.total_exact;
    for (Json::Value& h : page.hits) all.hits.push_back(std::move(h));
  }
  return all;
}

// Puts the hits of several indexes in the asked order; a stable sort keeps each index's own
// order among equals.
void MergeOrder(const SearchParams& p, std::vector<Json::Value>* hits) {
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
  std::stable_sort(hits->begin(), hits->end(), key_less);
}

Json::Value SearchReply(const SearchPage& all, const SearchParams& p) {
  Json::Value result;
  result["total"] = static_cast<Json::Int64>(all.total);
  result["total_exact"] = all.total_exact;
  result["hits"] = Json::Value(Json::arrayValue);
  for (int64_t i = p.from; i < static_cast<int64_t>(all.hits.size()) && i < p.from + p.size; ++i) {
    result["hits"].append(all.hits[static_cast<size_t>(i)]);
  }
  return result;
}

}  // namespace

std::vector<std::shared_ptr<Store>> Engine::SearchTargets(const Json::Value& data) {
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
  std::vector<std::shared_ptr<Store>> stores;
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
  const Json::Value& d = data.isObject() ? data : Json::Value(Json::objectValue);
  const SearchParams p = ParseSearch(d);
  const std::vector<std::shared_ptr<Store>> stores = SearchTargets(d);
  if (AllServers(d) && options_.stores->Shared() && !stores.empty()) {
    // One search of the shared database covers every index of every server.
    SearchParams each = p;
    each.from = 0;
    each.size = p.from + p.size;
    each.snippet_from = p.from;
    const VisibleFn visible = VisibleInAny(CheckerFor(caller), stores);
    return SearchReply(
        Guarded(guard, [&] { return stores[0]->SearchAllServers(each, visible, guard); }), p);
  }
  SearchPage all = SearchEach(stores, p, caller, guard);
  if (stores.size() > 1) MergeOrder(p, &all.hits);
  return SearchReply(all, p);
}

Json::Value Engine::Suggest(const Json::Value& data, const Caller& caller, QueryGuard* guard) {
  const Json::Value& d = data.isObject() ? data : Json::Value(Json::objectValue);
  const std::string prefix = RequireString(d, "prefix");
  const int64_t size = std::min<int64_t>(OptionalInt(d, "size", 10), 100);
  std::vector<std::shared_ptr<Store>> stores = SearchTargets(d);
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
