#include "daemons/quixelasticd/pg_store.hpp"

#include <syslog.h>

#include <algorithm>
#include <cctype>
#include <unordered_map>

#include "common/env.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/name_codec.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/name_fold.hpp"
#include "daemons/quixelasticd/snippet.hpp"

namespace orvane {
namespace elasticd {

namespace {

// The shared tables. `fi_docs` is partitioned by the index's number: each index is a
// partition of its own, made and dropped with the index, so a whole index goes at once and a
// search of one index reads one partition. Paths are kept as bytes (file names need not be
// UTF-8) and ordered as the disk's bytes; `fname` holds the folded names in their written
// form, `words` the folded words of the catch-all text with their positions. A document is
// kept once: the columns, and in `doc` (JSON in its written form, so the server can read
// members of it; null when empty) the members no column gives back; `kept` says which members
// the columns stand for (see CompactOf).
const char kSchemaSql[] =
    "CREATE EXTENSION IF NOT EXISTS pg_trgm;"
    "CREATE TABLE IF NOT EXISTS fi_indexes(part serial PRIMARY KEY, server text NOT NULL,"
    " id text NOT NULL, UNIQUE(server, id));"
    "CREATE TABLE IF NOT EXISTS fi_meta(part int NOT NULL REFERENCES fi_indexes ON DELETE"
    " CASCADE, key text NOT NULL, value text NOT NULL, PRIMARY KEY(part, key));"
    "CREATE TABLE IF NOT EXISTS fi_docs(part int NOT NULL, path bytea NOT NULL,"
    " fname text NOT NULL, nkey text NOT NULL, ext text NOT NULL, size bigint NOT NULL, mtime bigint NOT NULL,"
    " is_dir smallint NOT NULL, ctime bigint, crtime bigint, owner text, grp text,"
    " anc bytea NOT NULL, kept int NOT NULL, words tsvector, doc text,"
    " PRIMARY KEY(part, path)) PARTITION BY LIST (part);"
    "CREATE INDEX IF NOT EXISTS fi_docs_nkey ON fi_docs USING gin (nkey gin_trgm_ops);"
    "CREATE INDEX IF NOT EXISTS fi_docs_words ON fi_docs USING gin (words);";

// Held while the shared tables are made or an index is added or dropped, so that daemons
// sharing the database do not trip over each other's DDL.
const char kSchemaLock[] = "SELECT pg_advisory_xact_lock(7415011)";

// The columns a write sets, in the order WriteRows binds them.
const char kRowColumns[] =
    "part, path, fname, nkey, ext, size, mtime, is_dir, ctime, crtime, owner, grp, anc, kept, words,"
    " doc";
constexpr int kRowParams = 15;  // all but the partition number, which is part of the statement
constexpr int kWordsParam = 13;
// The columns a document is read back from, in the order ReadDoc takes them.
const char kDocColumns[] =
    "d.path, d.doc, d.anc, d.ext, d.size, d.mtime, d.is_dir, d.ctime, d.crtime, d.owner, d.grp,"
    " d.kept";
// Rows of one INSERT: PostgreSQL takes at most 65535 parameters in a statement.
constexpr size_t kRowsPerStatement = 1000;

// Limits of a word vector: longer words are refused by the server, more positions are dropped.
constexpr size_t kMaxWordBytes = 2046;
constexpr size_t kMaxPositions = 256;
constexpr int kMaxPosition = 16383;
constexpr size_t kMaxVectorBytes = 900 * 1024;

// Rows written after which Sync() refreshes the planner's figures of the partition.
constexpr int64_t kAnalyzeAfterRows = 50000;
// Documents read with the one a change asks for (see ReadAhead).
constexpr int kReadAheadRows = 256;
// Rows a search with a permission filter fetches at a time.
constexpr int kFetchRows = 500;
// Documents holding a prefix whose words are counted for suggestions.
constexpr int kSuggestSampleDocs = 5000;

// The text form of the word vector of `text` (UTF-8): every folded word with its positions;
// empty when there are none.
std::string WordVector(const std::string& text) {
  std::unordered_map<std::string, std::vector<int>> positions;
  std::vector<const std::string*> order;
  int pos = 0;
  size_t bytes = 0;
  for (std::string& w : FoldWords(text)) {
    pos = std::min(pos + 1, kMaxPosition);
    if (w.size() > kMaxWordBytes) continue;
    auto it = positions.find(w);
    if (it == positions.end()) {
      if (bytes + w.size() > kMaxVectorBytes) continue;
      bytes += w.size() + 8;
      it = positions.emplace(std::move(w), std::vector<int>()).first;
      order.push_back(&it->first);
    }
    if (it->second.size() < kMaxPositions) it->second.push_back(pos);
  }
  std::string out;
  for (const std::string* w : order) {
    if (!out.empty()) out += ' ';
    out += PgLexeme(*w);
    char sep = ':';
    for (int p : positions[*w]) {
      out += sep;
      out += std::to_string(p);
      sep = ',';
    }
  }
  return out;
}

// The same keywords for the in-memory word index snippets are made with.
std::string SnippetMatch(const std::string& keywords) {
  std::string out;
  for (const Keyword& k : SplitKeywords(keywords)) {
    std::string quoted = "\"";
    for (char c : k.text) {
      if (c == '"') quoted += '"';
      quoted += c;
    }
    if (!out.empty()) out += ' ';
    out += quoted + (k.prefix ? "\"*" : "\"");
  }
  return out;
}

Json::Value ParseDoc(const std::string& text) {
  JsonValue v;
  if (!v.fromString(text) || !v.isObject()) {
    throw StoreError(SQLITE_CORRUPT, "stored document is not a JSON object");
  }
  return v;
}

// Bits of `kept`: the members of the document the columns give back, each only when the
// column gives back the very value it had, type included.
enum Kept : int {
  kName = 1 << 0,         // the file name: the path's last part
  kDisplayName = 1 << 1,  // the same as the file name
  kSearchName = 1 << 2,   // the same as the file name
  kParent = 1 << 3,       // the path's folder part
  kAncestor = 1 << 4,     // the ancestor field: the `anc` column
  kExtension = 1 << 5,    // the `ext` column (already lower case)
  kKind = 1 << 6,         // the `ext` column
  kIsDir = 1 << 7,        // a flag
  kSize = 1 << 8,         // whole numbers
  kMtime = 1 << 9,
  kCtime = 1 << 10,
  kCrtime = 1 << 11,
  kOwner = 1 << 12,  // texts
  kGroup = 1 << 13,
};

// The path's last part and its folder part.
std::pair<std::string, std::string> SplitPath(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return {path, std::string()};
  return {path.substr(slash + 1), path.substr(0, slash)};
}

// A document as the row keeps it: the members no column gives back, and which ones they do.
struct Compact {
  int kept = 0;
  std::optional<int64_t> ctime, crtime;
  std::optional<std::string> owner, grp;
  Json::Value rest{Json::objectValue};
};

Compact CompactOf(const Schema& schema, const Json::Value& doc, const DerivedDoc& d) {
  Compact c;
  const auto [base, folder] = SplitPath(d.path);
  const Json::Value* fs_name = doc.find(kFieldFSName, kFieldFSName + std::strlen(kFieldFSName));
  for (auto it = doc.begin(); it != doc.end(); ++it) {
    const std::string field = it.name();
    const Json::Value& v = *it;
    if (field == schema.property_id()) continue;
    const bool text = v.isString();
    const bool whole = v.type() == Json::intValue;
    int bit = 0;
    if (field == schema.ancestor_field()) {
      if (text && v.asString() == d.ancestor) bit = kAncestor;
    } else if (field == kFieldFSName) {
      if (text && v.asString() == base) bit = kName;
    } else if (field == kFieldDisplayName || field == kFieldSearchName) {
      if (text && fs_name != nullptr && fs_name->isString() && v == *fs_name &&
          fs_name->asString() == base) {
        bit = field == kFieldDisplayName ? kDisplayName : kSearchName;
      }
    } else if (field == kFieldParent) {
      if (text && v.asString() == folder && d.path.find('/') != std::string::npos) bit = kParent;
    } else if (field == kFieldExtension || field == kFieldKind) {
      if (text && v.asString() == d.ext) bit = field == kFieldExtension ? kExtension : kKind;
    } else if (field == kFieldIsDir) {
      if (v.isBool()) bit = kIsDir;
    } else if (field == kFieldSize || field == kFieldMtime) {
      if (whole && v.asInt64() == (field == kFieldSize ? d.size : d.mtime)) {
        bit = field == kFieldSize ? kSize : kMtime;
      }
    } else if (field == kFieldCtime || field == kFieldCrtime) {
      if (whole) {
        bit = field == kFieldCtime ? kCtime : kCrtime;
        (bit == kCtime ? c.ctime : c.crtime) = v.asInt64();
      }
    } else if (field == kFieldOwner || field == kFieldGroup) {
      if (text) {
        bit = field == kFieldOwner ? kOwner : kGroup;
        (bit == kOwner ? c.owner : c.grp) = v.asString();
      }
    }
    if (bit != 0) {
      c.kept |= bit;
    } else {
      c.rest[field] = v;
    }
  }
  return c;
}

// A field's value as the document queries compare it: the text of a string or a number, 1 or
// 0 for a flag, the JSON text of anything else; false when the document has no such field.
bool QueryText(const Json::Value& doc, const std::string& field, std::string* text) {
  const Json::Value* v = doc.find(field.data(), field.data() + field.size());
  if (v == nullptr || v->isNull()) return false;
  if (v->isString()) {
    *text = v->asString();
  } else if (v->isBool()) {
    *text = v->asBool() ? "1" : "0";
  } else if (v->type() == Json::intValue || v->type() == Json::uintValue) {
    *text =
        v->type() == Json::intValue ? std::to_string(v->asInt64()) : std::to_string(v->asUInt64());
  } else {
    *text = JsonToString(*v);
  }
  return true;
}

// A statement being built: its conditions and the values of its $n marks.
struct Sql {
  std::string where;
  PgParams params;

  std::string Next() { return "$" + std::to_string(params.size()); }
  std::string Text(const std::string& v) {
    params.Text(v);
    return Next();
  }
  std::string Bytes(const std::string& v) {
    params.Bytes(v);
    return Next();
  }
  std::string Int(int64_t v) {
    params.Int(v);
    return Next();
  }
  void And(const std::string& cond) { where += " AND " + cond; }
};

// `c` with its marks numbered after the values already in `q`, its values added to them. Texts
// go in binary form, which is their bytes both where the server reads them as text and where
// it reads them as bytes (paths).
std::string Numbered(const SqlCondition& c, Sql* q) {
  std::string out;
  size_t next = 0;
  for (char ch : c.sql) {
    if (ch != '?') {
      out += ch;
      continue;
    }
    const SqlValue& v = c.values.at(next++);
    switch (v.kind) {
      case SqlValue::Kind::kText:
        out += q->Bytes(v.text);
        break;
      case SqlValue::Kind::kInt:
        out += q->Int(v.integer);
        break;
      case SqlValue::Kind::kReal:
        q->params.Real(v.real);
        out += q->Next();
        break;
    }
  }
  return "(" + out + ")";
}

// Runs `fn`, turning a statement the server stopped at the request's time budget into the
// guard's own answer.
template <typename F>
auto WithinBudget(QueryGuard* guard, F&& fn) -> decltype(fn()) {
  try {
    return fn();
  } catch (const StoreError& e) {
    if (e.sqlite_code == SQLITE_INTERRUPT && guard != nullptr && guard->ShouldStop()) {
      guard->Throw();
    }
    throw;
  }
}

// The condition of a document query; `scan` when it tests a field without a column, which is
// then read from every document.
struct DocWhere {
  bool scan = false;
  const DocQuery* query = nullptr;

  bool Matches(const Json::Value& doc) const {
    std::string text;
    if (!QueryText(doc, query->field, &text)) return false;
    if (query->kind == DocQuery::Kind::kTerm) {
      const std::string& f = query->field;
      return doc.find(f.data(), f.data() + f.size())->isString() && text == query->value;
    }
    return text.compare(0, query->value.size(), query->value) == 0;
  }
};

// A folder and everything below it, on the ancestor column.
std::string UnderFolder(std::string folder, Sql* q) {
  while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
  const std::string under = folder == "/" ? "/" : folder + "/";
  return "(anc = " + q->Bytes(folder) + " OR (anc >= " + q->Bytes(under) + " AND anc < " +
         q->Bytes(*PrefixUpperBound(under)) + "))";
}

DocWhere WhereOf(const Schema& schema, const DocQuery& q, Sql* sql) {
  DocWhere w;
  w.query = &q;
  const bool id_field = q.field == schema.property_id();
  if (q.kind == DocQuery::Kind::kAll) return w;
  if (q.kind == DocQuery::Kind::kTerm && !q.field.empty() && q.field == schema.ancestor_field()) {
    sql->And(UnderFolder(q.value, sql));
  } else if (!id_field) {
    w.scan = true;
  } else if (q.kind == DocQuery::Kind::kTerm) {
    sql->And("path = " + sql->Bytes(q.value));
  } else {
    sql->And("path >= " + sql->Bytes(q.value));
    const std::optional<std::string> upper = PrefixUpperBound(q.value);
    if (upper) sql->And("path < " + sql->Bytes(*upper));
  }
  return w;
}

// The snippets of a page, made by the same snippet function as the embedded store's, over an
// in-memory word index holding the page's texts only.
void AddSnippets(const Schema& schema, const std::string& keywords, int64_t snippet_from,
                 const std::vector<Json::Value>& docs, std::vector<Json::Value>* hits) {
  const std::string match = SnippetMatch(keywords);
  if (hits->empty() || match.empty()) return;
  Db mem;
  mem.Open(":memory:", true, false);
  mem.Exec(
      "CREATE VIRTUAL TABLE fts_all USING fts5(text, tokenize='unicode61"
      " remove_diacritics 2')");
  RegisterSnippetFunction(mem.get());
  Stmt put(mem, "INSERT INTO fts_all(rowid, text) VALUES(?, ?)");
  Stmt snip(mem, std::string("SELECT ") + kSnippetFunction +
                     "(fts_all, '<b>', '</b>', '...', 12) FROM fts_all"
                     " WHERE fts_all MATCH ? AND rowid = ?");
  for (size_t i = static_cast<size_t>(std::max<int64_t>(snippet_from, 0)); i < hits->size(); ++i) {
    const int64_t rowid = static_cast<int64_t>(i) + 1;
    put.Reset();
    put.Bind(1, rowid).Bind(2, EncodeName(schema.Derive(docs[i]).all_text)).Run();
    snip.Reset();
    snip.Bind(1, match).Bind(2, rowid);
    (*hits)[i]["snippet"] = snip.Step() ? DecodeName(snip.Text(0)) : std::string();
  }
}

}  // namespace

void PgStore::PrepareDatabase(PgPool& pool) {
  PgPool::Lease conn(pool);
  PgTxn txn(*conn);
  conn->Exec(kSchemaLock);
  conn->Script(kSchemaSql);
  txn.Commit();
}

PgStore::PgStore(std::shared_ptr<PgPool> pool, std::string server, std::string id, int part)
    : pool_(std::move(pool)), server_(std::move(server)), id_(std::move(id)), part_(part) {}

std::shared_ptr<PgStore> PgStore::Create(std::shared_ptr<PgPool> pool, const std::string& server,
                                         const std::string& id, const Json::Value& mappings,
                                         const Json::Value& settings,
                                         const Json::Value& event_handler) {
  Schema::Parse(mappings);  // refuse a bad schema before anything is written
  PrepareDatabase(*pool);
  int part = 0;
  {
    PgPool::Lease conn(*pool);
    PgTxn txn(*conn);
    conn->Exec(kSchemaLock);
    PgResult r = conn->Exec(
        "INSERT INTO fi_indexes(server, id) VALUES($1, $2) ON CONFLICT DO NOTHING RETURNING part",
        PgParams().Text(server).Text(id));
    if (r.rows() == 0) {
      throw EngineError(kCodeIndexExists,
                        "index " + id + " of server " + server + " already exists in the database");
    }
    part = static_cast<int>(r.Int(0, 0));
    // The partition's name and bounds are our own number, never a value from outside.
    const std::string n = std::to_string(part);
    conn->Script("CREATE TABLE fi_docs_" + n + " PARTITION OF fi_docs FOR VALUES IN (" + n + ")");
    const std::string put = "INSERT INTO fi_meta(part, key, value) VALUES(" + n + ", $1, $2)";
    auto set = [&](const char* key, const std::string& value) {
      conn->Exec(put, PgParams().Text(key).Text(value));
    };
    set("mappings", JsonToString(mappings));
    set("settings", JsonToString(settings));
    set("event_handler", JsonToString(event_handler));
    set("term_sugg", "ready");
    txn.Commit();
  }
  std::shared_ptr<PgStore> s(new PgStore(std::move(pool), server, id, part));
  s->LoadSchema();
  return s;
}

std::shared_ptr<PgStore> PgStore::Open(std::shared_ptr<PgPool> pool, const std::string& server,
                                       const std::string& id) {
  PrepareDatabase(*pool);
  int part = 0;
  {
    PgPool::Lease conn(*pool);
    PgResult r = conn->Exec("SELECT part FROM fi_indexes WHERE server = $1 AND id = $2",
                            PgParams().Text(server).Text(id));
    if (r.rows() == 0) {
      throw EngineError(kCodeIndexNotFound,
                        "no index " + id + " of server " + server + " in the database");
    }
    part = static_cast<int>(r.Int(0, 0));
  }
  std::shared_ptr<PgStore> s(new PgStore(std::move(pool), server, id, part));
  s->LoadSchema();
  return s;
}

bool PgStore::Exists(PgPool& pool, const std::string& server, const std::string& id) {
  PrepareDatabase(pool);
  PgPool::Lease conn(pool);
  return conn->Exec("SELECT 1 FROM fi_indexes WHERE server = $1 AND id = $2",
                    PgParams().Text(server).Text(id))
             .rows() > 0;
}

bool PgStore::Drop(PgPool& pool, const std::string& server, const std::string& id) {
  PrepareDatabase(pool);
  PgPool::Lease conn(pool);
  PgTxn txn(*conn);
  conn->Exec(kSchemaLock);
  PgResult r = conn->Exec("DELETE FROM fi_indexes WHERE server = $1 AND id = $2 RETURNING part",
                          PgParams().Text(server).Text(id));
  if (r.rows() == 0) return false;
  conn->Script("DROP TABLE IF EXISTS fi_docs_" + std::to_string(r.Int(0, 0)));
  txn.Commit();
  return true;
}

void PgStore::LoadSchema() {
  JsonValue mappings;
  if (!mappings.fromString(Meta("mappings"))) {
    throw StoreError(SQLITE_CORRUPT, "stored mappings of index " + id_ + " are not JSON");
  }
  schema_ = Schema::Parse(mappings);
}

PgConn& PgStore::Settled() {
  Flush();
  read_ahead_.clear();
  return Writer();
}

void PgStore::Flush() {
  if (pending_.empty()) return;
  read_ahead_.clear();
  std::vector<const Json::Value*> docs;
  std::string gone;
  PgParams params;
  auto drop = [&] {
    if (params.size() == 0) return;
    Writer().ExecCached("DELETE FROM " + Table() + " WHERE part = " + std::to_string(part_) +
                            " AND path IN (" + gone + ")",
                        params);
    gone.clear();
    params = PgParams();
  };
  for (const auto& [path, doc] : pending_) {
    if (doc) {
      docs.push_back(&*doc);
      if (docs.size() == kRowsPerStatement) {
        WriteRows(docs);
        docs.clear();
      }
    } else {
      params.Bytes(path);
      gone += (gone.empty() ? "$" : ",$") + std::to_string(params.size());
      if (params.size() == kRowsPerStatement) drop();
    }
  }
  drop();
  if (!docs.empty()) WriteRows(docs);
  pending_.clear();
}

void PgStore::Put(const std::string& path, std::optional<Json::Value> doc) {
  pending_[path] = std::move(doc);
  if (pending_.size() >= kRowsPerStatement) Flush();
}

PgConn& PgStore::Writer() {
  // A connection the server dropped is replaced here, at the start of the next request; the
  // request it failed in was answered as unavailable and is sent again by its owner.
  if (!writer_ || !writer_->Healthy()) {
    writer_.reset();
    std::unique_ptr<PgConn> conn = pool_->Take();
    // A commit the server did not flush is lost when the server crashes, though its request
    // was answered as done and its batch dropped by the indexer: every commit waits for the
    // flush, whatever the server's default (a batch of a thousand documents pays it once).
    conn->Script("SET synchronous_commit = on");
    writer_ = std::move(conn);
  }
  return *writer_;
}

void PgStore::SetSavepoint() { Settled().Script("SAVEPOINT fi_command"); }

void PgStore::ReleaseSavepoint() { Settled().Script("RELEASE SAVEPOINT fi_command"); }

void PgStore::RollbackToSavepoint() {
  pending_.clear();
  read_ahead_.clear();
  Writer().Script("ROLLBACK TO SAVEPOINT fi_command; RELEASE SAVEPOINT fi_command");
}

bool PgStore::InTransaction() const {
  return writer_ && writer_->Healthy() && writer_->InTransaction();
}

std::string PgStore::Meta(const std::string& key) {
  PgResult r = Settled().Exec("SELECT value FROM fi_meta WHERE part = $1 AND key = $2",
                              PgParams().Int(part_).Text(key));
  return r.rows() > 0 ? r.Text(0, 0) : std::string();
}

void PgStore::SetMeta(const std::string& key, const std::string& value) {
  Settled().Exec(
      "INSERT INTO fi_meta(part, key, value) VALUES($1, $2, $3)"
      " ON CONFLICT (part, key) DO UPDATE SET value = excluded.value",
      PgParams().Int(part_).Text(key).Text(value));
}

void PgStore::Rename(const std::string& new_id) {
  PgResult r = Settled().Exec(
      "UPDATE fi_indexes SET id = $1 WHERE part = $2 AND NOT EXISTS"
      " (SELECT 1 FROM fi_indexes WHERE server = $3 AND id = $1)",
      PgParams().Text(new_id).Int(part_).Text(server_));
  if (r.Changed() == 0) {
    throw EngineError(kCodeIndexExists, "index " + new_id + " of server " + server_ +
                                            " already exists in the database");
  }
  id_ = new_id;
}

Json::Value PgStore::ReadDoc(const PgResult& r, int row, int first) const {
  Json::Value doc = r.IsNull(row, first + 1) ? Json::Value(Json::objectValue)
                                             : ParseDoc(DecodeName(r.Text(row, first + 1)));
  const std::string path = r.Bytes(row, first);
  const int kept = static_cast<int>(r.Int(row, first + 11));
  const auto [base, folder] = SplitPath(path);
  auto put = [&](int bit, const char* field, Json::Value v) {
    if (kept & bit) doc[field] = std::move(v);
  };
  put(kName, kFieldFSName, base);
  put(kDisplayName, kFieldDisplayName, base);
  put(kSearchName, kFieldSearchName, base);
  put(kParent, kFieldParent, folder);
  if (kept & kAncestor) doc[schema_.ancestor_field()] = r.Bytes(row, first + 2);
  const std::string ext = (kept & (kExtension | kKind)) ? DecodeName(r.Text(row, first + 3)) : "";
  put(kExtension, kFieldExtension, ext);
  put(kKind, kFieldKind, ext);
  put(kSize, kFieldSize, Json::Int64(r.Int(row, first + 4)));
  put(kMtime, kFieldMtime, Json::Int64(r.Int(row, first + 5)));
  put(kIsDir, kFieldIsDir, r.Int(row, first + 6) != 0);
  put(kCtime, kFieldCtime, Json::Int64(r.Int(row, first + 7)));
  put(kCrtime, kFieldCrtime, Json::Int64(r.Int(row, first + 8)));
  put(kOwner, kFieldOwner, DecodeName(r.Text(row, first + 9)));
  put(kGroup, kFieldGroup, DecodeName(r.Text(row, first + 10)));
  doc[schema_.property_id()] = path;
  return doc;
}

void PgStore::WriteRows(const std::vector<const Json::Value*>& docs, const std::string* gone) {
  read_ahead_.clear();
  std::string sql;
  PgParams params;
  int n = 0;
  if (gone != nullptr) {
    // In the same statement, so that a re-keyed document costs one round trip: the insert
    // does not see the deleted row, and its key is another.
    params.Bytes(*gone);
    sql = "WITH gone AS (DELETE FROM " + Table() + " WHERE part = " + std::to_string(part_) +
          " AND path = $" + std::to_string(++n) + ") ";
  }
  sql += std::string("INSERT INTO ") + Table() + " AS d(" + kRowColumns + ") VALUES";
  for (size_t i = 0; i < docs.size(); ++i) {
    const Json::Value& doc = *docs[i];
    const DerivedDoc d = schema_.Derive(doc);
    const Compact c = CompactOf(schema_, doc, d);
    const std::string folded = FoldName(EncodeName(d.name_text));
    const std::string words = WordVector(EncodeName(d.all_text));
    auto int_or_null = [&](const std::optional<int64_t>& v) {
      if (v) {
        params.Int(*v);
      } else {
        params.Null();
      }
    };
    auto text_or_null = [&](const std::optional<std::string>& v) {
      if (v) {
        params.Text(EncodeName(*v));
      } else {
        params.Null();
      }
    };
    params.Bytes(d.path)
        .Text(folded)
        .Text(NameKey(folded))
        .Text(EncodeName(d.ext))
        .Int(d.size)
        .Int(d.mtime)
        .Int(d.is_dir ? 1 : 0);
    int_or_null(c.ctime);
    int_or_null(c.crtime);
    text_or_null(c.owner);
    text_or_null(c.grp);
    params.Bytes(d.ancestor).Int(c.kept);
    if (words.empty()) {
      params.Null();
    } else {
      params.Text(words);  // in written form already
    }
    text_or_null(c.rest.empty() ? std::nullopt : std::optional<std::string>(JsonToString(c.rest)));
    sql += i == 0 ? "(" : ",(";
    sql += std::to_string(part_);
    for (int c = 0; c < kRowParams; ++c) {
      sql += ",$" + std::to_string(++n);
      if (c == kWordsParam) sql += "::tsvector";
    }
    sql += ")";
  }
  sql +=
      " ON CONFLICT (part, path) DO UPDATE SET fname = excluded.fname, nkey = excluded.nkey,"
         " ext = excluded.ext,"
      " size = excluded.size, mtime = excluded.mtime, is_dir = excluded.is_dir,"
      " ctime = excluded.ctime, crtime = excluded.crtime, owner = excluded.owner,"
      " grp = excluded.grp, anc = excluded.anc, kept = excluded.kept,"
      " words = excluded.words, doc = excluded.doc";
  Writer().ExecCached(sql, params);
  written_ += static_cast<int64_t>(docs.size());
}

void PgStore::Upsert(const std::string& doc_id, const Json::Value& given) {
  if (!given.isObject()) throw EngineError(kCodeDocInvalid, "document is not an object");
  const std::string& pid = schema_.property_id();
  Json::Value doc = given;
  if (!doc.isMember(pid) && !doc_id.empty()) doc[pid] = doc_id;
  schema_.Validate(doc);
  const std::string path = doc[pid].asString();
  if (!buffering_) {
    WriteRows({&doc}, !doc_id.empty() && doc_id != path ? &doc_id : nullptr);
    return;
  }
  if (!doc_id.empty() && doc_id != path) Put(doc_id, std::nullopt);
  Put(path, std::move(doc));
}

size_t PgStore::UpsertMany(const std::vector<Json::Value>& docs,
                           std::vector<std::pair<size_t, std::string>>* refused) {
  // One statement per run of documents; a path given twice keeps its last document, as
  // upserting them one by one would.
  Flush();
  std::vector<const Json::Value*> run;
  std::unordered_map<std::string, size_t> at;
  size_t written = 0;
  auto flush = [&] {
    if (run.empty()) return;
    std::vector<const Json::Value*> rows;
    for (const Json::Value* d : run) {
      if (d != nullptr) rows.push_back(d);
    }
    WriteRows(rows);
    run.clear();
    at.clear();
  };
  for (size_t i = 0; i < docs.size(); ++i) {
    try {
      if (!docs[i].isObject()) throw EngineError(kCodeDocInvalid, "document is not an object");
      schema_.Validate(docs[i]);
    } catch (const EngineError& e) {
      if (refused != nullptr) refused->emplace_back(i, e.what());
      continue;
    }
    const std::string path = docs[i][schema_.property_id()].asString();
    auto it = at.find(path);
    if (it != at.end()) run[it->second] = nullptr;
    at[path] = run.size();
    run.push_back(&docs[i]);
    ++written;
    if (run.size() >= kRowsPerStatement) flush();
  }
  flush();
  return written;
}

Json::Value PgStore::ReadAhead(const std::string& path) {
  auto it = read_ahead_.find(path);
  if (it == read_ahead_.end()) {
    // A folder's documents are changed one after the other in path order (a rename): the
    // ones after this are read with it, so that each does not cost a round trip of its own.
    read_ahead_.clear();
    PgResult r = Writer().ExecCached(std::string("SELECT ") + kDocColumns + " FROM " + Table() +
                                         " d WHERE part = $1 AND path >= $2 ORDER BY path"
                                         " LIMIT " +
                                         std::to_string(kReadAheadRows),
                                     PgParams().Int(part_).Bytes(path));
    for (int i = 0; i < r.rows(); ++i) read_ahead_.emplace(r.Bytes(i, 0), ReadDoc(r, i, 0));
    it = read_ahead_.find(path);
    if (it == read_ahead_.end()) throw EngineError(kCodeDocNotFound, "no document " + path);
  }
  Json::Value doc = std::move(it->second);
  read_ahead_.erase(it);
  return doc;
}

void PgStore::SetFields(const std::string& doc_id, const Json::Value& fields) {
  if (!fields.isObject()) throw EngineError(kCodeDocInvalid, "fields are not an object");
  // A document written earlier in this transaction is still here; any other is read from the
  // server, where nothing waiting here can have changed it.
  Json::Value doc;
  auto it = pending_.find(doc_id);
  if (it != pending_.end()) {
    if (!it->second) throw EngineError(kCodeDocNotFound, "no document " + doc_id);
    doc = *it->second;
  } else {
    doc = ReadAhead(doc_id);
  }
  for (const std::string& k : fields.getMemberNames()) {
    if (fields[k].isNull()) {
      doc.removeMember(k);
    } else {
      doc[k] = fields[k];
    }
  }
  schema_.Validate(doc);
  const std::string path = doc[schema_.property_id()].asString();
  // A re-keyed document replaces whatever was at its new path.
  if (!buffering_) {
    WriteRows({&doc}, path != doc_id ? &doc_id : nullptr);
    return;
  }
  if (path != doc_id) Put(doc_id, std::nullopt);
  Put(path, std::move(doc));
}

bool PgStore::Delete(const std::string& doc_id) {
  return Settled()
             .Exec("DELETE FROM " + Table() + " WHERE part = $1 AND path = $2",
                   PgParams().Int(part_).Bytes(doc_id))
             .Changed() > 0;
}

int64_t PgStore::DeleteByQuery(const DocQuery& q) {
  Sql sql;
  sql.Int(part_);
  const DocWhere w = WhereOf(schema_, q, &sql);
  if (!w.scan) {
    return Settled()
        .Exec("DELETE FROM " + Table() + " WHERE part = $1" + sql.where, sql.params)
        .Changed();
  }
  PgResult r = Settled().Exec(
      std::string("SELECT ") + kDocColumns + " FROM " + Table() + " d WHERE part = $1", sql.params);
  int64_t deleted = 0;
  for (int i = 0; i < r.rows(); ++i) {
    if (w.Matches(ReadDoc(r, i, 0)) && Delete(r.Bytes(i, 0))) ++deleted;
  }
  return deleted;
}

Json::Value PgStore::GetByQuery(const DocQuery& q, const std::vector<std::string>& load,
                                int64_t from, int64_t size) {
  Sql sql;
  sql.Int(part_);
  const DocWhere w = WhereOf(schema_, q, &sql);
  std::string text = std::string("SELECT ") + kDocColumns + " FROM " + Table() +
                     " d WHERE part = $1" + sql.where + " ORDER BY path";
  if (!w.scan) {
    text += " LIMIT " + sql.Int(size);
    text += " OFFSET " + sql.Int(from);
  }
  PgResult r = Settled().Exec(text, sql.params);
  Json::Value hits(Json::arrayValue);
  int64_t matched = 0;
  for (int i = 0; i < r.rows() && static_cast<int64_t>(hits.size()) < size; ++i) {
    const Json::Value doc = ReadDoc(r, i, 0);
    if (w.scan && (!w.Matches(doc) || matched++ < from)) continue;
    hits.append(schema_.Load(doc, load));
  }
  return hits;
}

Json::Value PgStore::List(const std::string& dir, const std::string& after,
                          const std::vector<std::string>& extra, int64_t size) {
  // One range of the path index: from the folder (or past the previous page) to the end of its
  // subtree; names that only begin like the folder ("dir.txt") are left out.
  const std::string under = dir + "/";
  const std::optional<std::string> upper = PrefixUpperBound(under);
  const bool resume = !after.empty() && after >= dir;
  Sql sql;
  sql.Int(part_);
  sql.And(std::string("path ") + (resume ? "> " : ">= ") + sql.Bytes(resume ? after : dir));
  if (upper) sql.And("path < " + sql.Bytes(*upper));
  sql.And("(path = " + sql.Bytes(dir) + " OR path >= " + sql.Bytes(under) + ")");
  const std::string text = std::string("SELECT d.path, d.size, d.mtime, d.is_dir") +
                           (extra.empty() ? "" : std::string(", ") + kDocColumns) + " FROM " +
                           Table() + " d WHERE part = $1" + sql.where + " ORDER BY path LIMIT " +
                           sql.Int(size);
  PgResult r = Settled().Exec(text, sql.params);
  Json::Value hits(Json::arrayValue);
  for (int i = 0; i < r.rows(); ++i) {
    Json::Value hit(Json::arrayValue);
    hit.append(r.Bytes(i, 0));
    hit.append(Json::Int64(r.Int(i, 1)));
    hit.append(Json::Int64(r.Int(i, 2)));
    hit.append(r.Int(i, 3) != 0);
    if (!extra.empty()) {
      const Json::Value doc = ReadDoc(r, i, 4);
      for (const std::string& field : extra) {
        hit.append(ListedValue(doc.find(field.data(), field.data() + field.size())));
      }
    }
    hits.append(std::move(hit));
  }
  return hits;
}

bool PgStore::UpdateTermSuggestion(const std::string& doc_id) {
  // Suggestions are read from the documents' word vectors: there is nothing to recompute.
  return Settled()
             .Exec("SELECT 1 FROM " + Table() + " WHERE part = $1 AND path = $2",
                   PgParams().Int(part_).Bytes(doc_id))
             .rows() > 0;
}

int64_t PgStore::DocCount() { return Settled().Exec("SELECT count(*) FROM " + Table()).Int(0, 0); }

PgWriteTxn::PgWriteTxn(PgStore& store) : store_(store), txn_(store.Writer()) {
  store_.buffering_ = true;
}

PgWriteTxn::~PgWriteTxn() {
  store_.buffering_ = false;
  store_.pending_.clear();
  store_.read_ahead_.clear();
}

void PgWriteTxn::Commit() {
  store_.Flush();
  txn_.Commit();
}

int64_t PgStore::DiskBytes() {
  return Settled()
      .Exec("SELECT pg_total_relation_size($1::regclass)", PgParams().Text(Table()))
      .Int(0, 0);
}

void PgStore::Sync() {
  // Every commit has waited for the server's log to reach its disk already: what is left is
  // to send what waits here.
  PgConn& w = Settled();
  if (written_ >= kAnalyzeAfterRows) {
    // The planner's figures of a partition that grew by a bulk load come from the server's
    // background analysis, minutes later; until then name searches may scan the table.
    w.Script("ANALYZE " + Table());
    written_ = 0;
  }
}

bool PgStore::QuickCheck(std::string* detail) {
  try {
    DocCount();
    return true;
  } catch (const StoreError& e) {
    *detail = e.what();
    return false;
  }
}

SearchPage PgStore::Search(const SearchParams& p, const VisibleFn& visible, QueryGuard* guard) {
  return Run(p, visible, guard, false);
}

SearchPage PgStore::SearchEverywhere(const SearchParams& p, const VisibleFn& visible,
                                     QueryGuard* guard) {
  return Run(p, visible, guard, true);
}

SearchPage PgStore::Run(const SearchParams& p, const VisibleFn& visible, QueryGuard* guard,
                        bool everywhere) {
  Sql sql;
  if (!everywhere) sql.Int(part_);
  // The server's name comes last, after the score.
  std::string score = "0";
  std::string order;
  const std::string tsquery = PgKeywordQuery(p.keywords);
  if (!p.keywords.empty() && tsquery.empty()) {
    // Keywords without a single word (only punctuation) match nothing, as in the word index.
    sql.And("FALSE");
  } else if (!tsquery.empty()) {
    const std::string q = sql.Text(tsquery) + "::tsquery";
    sql.And("d.words @@ " + q);
    score = "ts_rank(d.words, " + q + ")";
    if (p.sort == SearchParams::Sort::kRelevance) {
      order = std::string(" ORDER BY ts_rank(d.words, ") + q + ")" + (p.desc ? "" : " DESC") +
              ", d.path";
    }
  }
  const std::string name = EncodeName(p.name);
  const std::string folded_name = FoldName(name);
  if (!name.empty()) {
    // The key finds the candidates by their trigrams; the folded name decides.
    sql.And("d.nkey LIKE " + sql.Text("%" + NameKey(folded_name) + "%"));
    sql.And("d.fname LIKE " + sql.Text("%" + LikeLiteral(folded_name) + "%"));
  }
  if (!p.folder.empty()) {
    std::string folder = p.folder;
    while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
    const std::string under = folder == "/" ? "/" : folder + "/";
    sql.And("d.path >= " + sql.Bytes(under) + " AND d.path < " +
            sql.Bytes(*PrefixUpperBound(under)));
    sql.And(UnderFolder(folder, &sql));
  }
  if (!p.exts.empty()) {
    std::string list = "{";
    for (size_t i = 0; i < p.exts.size(); ++i) {
      list += (i == 0 ? "" : ",") + PgArrayElement(EncodeName(AsciiLower(p.exts[i])));
    }
    sql.And("d.ext = ANY(" + sql.Text(list + "}") + "::text[])");
  }
  auto bound = [&](const std::optional<int64_t>& v, const char* cond) {
    if (v) sql.And(cond + sql.Int(*v));
  };
  bound(p.size_min, "d.size >= ");
  bound(p.size_max, "d.size <= ");
  bound(p.mtime_min, "d.mtime >= ");
  bound(p.mtime_max, "d.mtime <= ");
  if (p.is_dir) sql.And(*p.is_dir ? "d.is_dir = 1" : "d.is_dir = 0");
  if (p.server_query) sql.And(Numbered(*p.server_query, &sql));
  const char* dir = p.desc ? " DESC" : " ASC";
  switch (p.sort) {
    case SearchParams::Sort::kRelevance:
      break;
    case SearchParams::Sort::kName:
      order = std::string(" ORDER BY d.fname COLLATE \"C\"") + dir + ", d.path";
      break;
    case SearchParams::Sort::kSize:
      order = std::string(" ORDER BY d.size") + dir + ", d.path";
      break;
    case SearchParams::Sort::kMtime:
      order = std::string(" ORDER BY d.mtime") + dir + ", d.path";
      break;
  }
  const std::string from =
      everywhere ? " FROM fi_docs d JOIN fi_indexes i ON i.part = d.part WHERE TRUE" + sql.where
                 : " FROM " + Table() + " d WHERE d.part = $1" + sql.where;
  const bool ranked = !tsquery.empty();
  // The score and the server's name first, then the document.
  const std::string select =
      "SELECT " + score + (everywhere ? ", i.server, " : ", NULL, ") + kDocColumns;

  PgPool::Lease conn(*pool_);
  return WithinBudget(guard, [&] {
    PgTxn txn(*conn);
    Budget(*conn, guard);
    if (NameKey(folded_name).size() >= 3) {
      // The planner guesses how many names hold a substring; guessing many, it reads the
      // table in order until the page is full, which for a rare one means the whole table.
      // The trigram index answers any substring whose key has a trigram.
      conn->Script("SET LOCAL enable_seqscan = off");
    }
    return Page(*conn, p, visible, guard, everywhere, sql.params, select, from, order, ranked);
  });
}

void PgStore::Budget(PgConn& conn, QueryGuard* guard) {
  if (guard == nullptr || guard->deadline_micros() == 0) return;
  // The server stops a statement past the request's budget; what is left of it is the
  // statements' time limit for this transaction.
  const int64_t left = guard->deadline_micros() - Env::Current()->NowMicros();
  if (left <= 0 && guard->ShouldStop()) guard->Throw();
  conn.Script("SET LOCAL statement_timeout = " + std::to_string(std::max<int64_t>(left / 1000, 1)));
}

SearchPage PgStore::Page(PgConn& conn, const SearchParams& p, const VisibleFn& visible,
                         QueryGuard* guard, bool everywhere, const PgParams& params,
                         const std::string& select, const std::string& from,
                         const std::string& order, bool ranked) {
  SearchPage page;
  std::vector<Json::Value> docs;
  auto add = [&](const PgResult& r, int i) {
    Json::Value doc = ReadDoc(r, i, 2);
    const DerivedDoc d = schema_.Derive(doc);
    Json::Value hit;
    hit["path"] = d.path;
    hit["name"] = d.name;
    hit["size"] = static_cast<Json::Int64>(d.size);
    hit["mtime"] = static_cast<Json::Int64>(d.mtime);
    hit["is_dir"] = d.is_dir;
    hit["ext"] = d.ext;
    if (ranked) hit["score"] = r.Real(i, 0);
    if (everywhere) hit["server"] = r.Text(i, 1);
    page.hits.push_back(std::move(hit));
    docs.push_back(std::move(doc));
  };
  if (!visible) {
    // An ordered page reads every match anyway: it counts them in the same pass. An unordered
    // one stops at the page, and is counted apart only when the page does not say the total.
    const bool ordered = !order.empty();
    // Numbers of our own, written out so that the count below can run with the same values.
    const std::string limits =
        " LIMIT " + std::to_string(p.size) + " OFFSET " + std::to_string(p.from);
    PgResult r =
        conn.Exec(select + (ordered ? ", count(*) OVER ()" : "") + from + order + limits, params);
    for (int i = 0; i < r.rows(); ++i) add(r, i);
    if (ordered && r.rows() > 0) {
      page.total = r.Int(0, 14);
    } else if (!ordered && p.from == 0 && r.rows() < p.size) {
      page.total = r.rows();
    } else {
      page.total = conn.Exec("SELECT count(*) FROM (SELECT 1" + from + " LIMIT " +
                                 std::to_string(IndexStore::kCountLimit + 1) + ") s",
                             params)
                       .Int(0, 0);
    }
    if (page.total > IndexStore::kCountLimit) {
      page.total = IndexStore::kCountLimit;
      page.total_exact = false;
    }
  } else {
    // Hidden hits are skipped before paging: rows come from a cursor a batch at a time, and
    // counting goes on for a bounded number of rows past the page.
    conn.Exec("DECLARE hits NO SCROLL CURSOR FOR " + select + from + order, params);
    int64_t seen = 0;
    int64_t inspected = 0;
    bool done = false;
    while (!done) {
      if (guard != nullptr && guard->ShouldStop()) guard->Throw();
      PgResult r = conn.Exec("FETCH " + std::to_string(kFetchRows) + " FROM hits");
      if (r.rows() == 0) break;
      for (int i = 0; i < r.rows(); ++i) {
        ++inspected;
        if (seen >= p.from + p.size &&
            inspected > p.from + p.size + IndexStore::kFilteredScanLimit) {
          page.total_exact = false;
          done = true;
          break;
        }
        // Another server's files cannot be checked here: they are shown to root only.
        if (everywhere && r.Text(i, 1) != server_) continue;
        if (!visible(r.Bytes(i, 2))) continue;
        ++seen;
        if (seen > p.from && seen <= p.from + p.size) add(r, i);
      }
    }
    page.total = seen;
  }
  if (ranked) AddSnippets(schema_, EncodeName(p.keywords), p.snippet_from, docs, &page.hits);
  return page;
}

std::vector<std::string> PgStore::Suggest(const std::string& prefix, size_t limit,
                                          const VisibleFn& visible, QueryGuard* guard) {
  std::vector<std::string> out;
  const std::vector<std::string> folded = FoldWords(EncodeName(prefix));
  if (folded.size() != 1) return out;
  const std::string& low = folded[0];
  PgPool::Lease conn(*pool_);
  return WithinBudget(guard, [&] {
    PgTxn txn(*conn);
    Budget(*conn, guard);
    // The words of a bounded sample of the documents holding one that starts with the prefix,
    // counted over that sample: the most used come first without a vocabulary kept up to date
    // on every write.
    PgResult r = conn->Exec("SELECT w.lexeme, count(*) FROM (SELECT words FROM " + Table() +
                                " WHERE part = $1 AND words @@ $2::tsquery LIMIT " +
                                std::to_string(kSuggestSampleDocs) +
                                ") s, unnest(s.words) w WHERE starts_with(w.lexeme, $3)"
                                " GROUP BY w.lexeme ORDER BY count(*) DESC, w.lexeme LIMIT 200",
                            PgParams().Int(part_).Text(PgLexeme(low) + ":*").Text(low));
    for (int i = 0; i < r.rows() && out.size() < limit; ++i) {
      if (guard != nullptr && guard->ShouldStop()) guard->Throw();
      const std::string term = r.Text(i, 0);
      if (!IsSuggestible(term)) continue;
      bool shown = !visible;
      if (!shown) {
        PgResult docs = conn->Exec(
            "SELECT path FROM " + Table() + " WHERE part = $1 AND words @@ $2::tsquery LIMIT 64",
            PgParams().Int(part_).Text(PgLexeme(term)));
        for (int j = 0; !shown && j < docs.rows(); ++j) shown = visible(docs.Bytes(j, 0));
      }
      if (shown) out.push_back(DecodeName(term));
    }
    return out;
  });
}

}  // namespace elasticd
}  // namespace orvane
