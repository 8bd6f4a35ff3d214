#include "daemons/quixelasticd/store.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <set>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/log.hpp"
#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/name_fold.hpp"
#include "daemons/quixelasticd/snippet.hpp"

namespace orvane {
namespace elasticd {

namespace {

// The documents: the columns searches filter and sort on, and the document itself as the fields
// those columns cannot give back (`rest`, JSON, null when there are none). `kept` says which
// fields the columns give back (see kShadows below). When the path ends in "/" + name, only
// the length of the folder part is stored (`plen`) and the name is computed from the path, as
// is the ancestor when it is that folder (bit 0 of `kept`); otherwise they are stored (`nm`,
// `anc`). Computed columns cost nothing on disk and read as any other.
std::string DocsTableSql(const char* table) {
  return std::string("CREATE TABLE ") + table +
         "(rowid INTEGER PRIMARY KEY, path TEXT NOT NULL UNIQUE, nm TEXT, plen INTEGER, ext TEXT,"
         " size INTEGER, mtime INTEGER, is_dir INTEGER, ctime INTEGER, crtime INTEGER,"
         " owner TEXT, grp TEXT, anc TEXT, kept INTEGER NOT NULL, rest TEXT,"
         " name TEXT AS (CASE WHEN plen IS NULL THEN nm"
         " ELSE CAST(substr(CAST(path AS BLOB), plen + 2) AS TEXT) END) VIRTUAL,"
         " ancestor TEXT AS (CASE WHEN kept & 1 THEN CAST(substr(CAST(path AS BLOB), 1, plen)"
         " AS TEXT) ELSE anc END) VIRTUAL);";
}

// The trigram index keeps no positions and no sizes: a substring is looked up by its trigrams
// and then checked against the folded name it stores (GLOB), which costs less than positions.
const char kNameIndexSql[] =
    "CREATE VIRTUAL TABLE fts_name USING fts5(name, tokenize='trigram', detail=none,"
    " columnsize=0);";

const char kSchemaSql[] =
    "CREATE TABLE meta(key TEXT PRIMARY KEY, value TEXT NOT NULL) WITHOUT ROWID;"
    "CREATE VIRTUAL TABLE fts_all USING fts5(text, tokenize='unicode61 remove_diacritics 2');"
    // The suggestion store: the vocabulary of the catch-all index with its document counts,
    // always in step with the documents at no cost to writes.
    "CREATE VIRTUAL TABLE sugg USING fts5vocab(fts_all, 'row');";

// The columns a document is read back from, in the order ReadDoc takes them.
const char kDocColumns[] =
    "path, name, ext, size, mtime, is_dir, ctime, crtime, owner, grp, ancestor, kept, rest";

// Format 1 kept every document whole as JSON beside its columns, and positions in the name
// index; such a store is rewritten when opened.
constexpr int kOldFormat = 1;
constexpr int kFormat = 2;

// SQLite's default compile-time ceiling for a map (SQLITE_MAX_MMAP_SIZE).
const char kMmapPragma[] = "PRAGMA mmap_size=2147418112";

// WAL with synchronous=NORMAL: a finished request survives the daemon being killed; "commit"
// syncs the log so that it also survives a power loss. The map covers the store up to SQLite's
// own ceiling: once a store outgrew a smaller map, every page beyond it went through read calls
// and bulk loads of a million documents slowed by a quarter.
void ConfigureWriter(Db& db) {
  db.Exec("PRAGMA journal_mode=WAL");
  db.Exec("PRAGMA synchronous=NORMAL");
  db.Exec("PRAGMA cache_size=-65536");
  db.Exec("PRAGMA temp_store=MEMORY");
  db.Exec(kMmapPragma);
  db.Exec("PRAGMA wal_autocheckpoint=4096");
}

// Field names with quotes or backslashes were never accepted in queries; they still are not.
void CheckFieldName(const std::string& field) {
  if (field.find('"') != std::string::npos || field.find('\\') != std::string::npos) {
    throw EngineError(kCodeInvalidParam, "field name not allowed: " + field);
  }
}

Json::Value ParseBody(const std::string& body) {
  JsonValue v;
  if (!v.fromString(body) || !v.isObject()) {
    throw StoreError(SQLITE_CORRUPT, "stored document is not a JSON object");
  }
  return v;
}

// Where a field of a document comes back from when it is read. A field is left out of `rest`
// only when its column gives back the very value it had (same type, same text).
enum class Source { kName, kParent, kExt, kIsDir, kSize, kMtime, kCtime, kCrtime, kOwner, kGroup };

struct Shadow {
  const char* field;
  Source source;
  int64_t bit;
};

// Bits of `kept`. Bit 0 is the ancestor column's own: computed from the path.
constexpr int64_t kAncestorFromPath = 1;
constexpr int64_t kAncestorField = 2;
const Shadow kShadows[] = {
    {kFieldFSName, Source::kName, 1 << 2},       {kFieldDisplayName, Source::kName, 1 << 3},
    {kFieldSearchName, Source::kName, 1 << 4},   {kFieldParent, Source::kParent, 1 << 5},
    {kFieldExtension, Source::kExt, 1 << 6},     {kFieldKind, Source::kExt, 1 << 7},
    {kFieldIsDir, Source::kIsDir, 1 << 8},       {kFieldSize, Source::kSize, 1 << 9},
    {kFieldMtime, Source::kMtime, 1 << 10},      {kFieldCtime, Source::kCtime, 1 << 11},
    {kFieldCrtime, Source::kCrtime, 1 << 12},    {kFieldOwner, Source::kOwner, 1 << 13},
    {kFieldGroup, Source::kGroup, 1 << 14}};

const Shadow* ShadowOf(const std::string& field) {
  for (const Shadow& s : kShadows) {
    if (field == s.field) return &s;
  }
  return nullptr;
}

// The folder a path names when it ends in "/" + name; false otherwise.
bool ParentOfPath(const std::string& path, const std::string& name, std::string* parent) {
  if (name.empty() || path.size() <= name.size() ||
      path.compare(path.size() - name.size(), name.size(), name) != 0 ||
      path[path.size() - name.size() - 1] != '/') {
    return false;
  }
  *parent = path.substr(0, path.size() - name.size() - 1);
  return true;
}

// A number column that, like a value read out of JSON, is an integer, a real or absent.
struct NumberColumn {
  enum class Kind { kNull, kInt, kReal } kind = Kind::kNull;
  int64_t integer = 0;
  double real = 0;

  static NumberColumn Of(const Json::Value* v) {
    NumberColumn c;
    if (v == nullptr) return c;
    if (v->type() == Json::intValue ||
        (v->type() == Json::uintValue && v->asLargestUInt() <= INT64_MAX)) {
      c.kind = Kind::kInt;
      c.integer = v->asInt64();
    } else if (v->type() == Json::realValue) {
      c.kind = Kind::kReal;
      c.real = v->asDouble();
    }
    return c;
  }
  void BindTo(Stmt& st, int index) const {
    if (kind == Kind::kInt) {
      st.Bind(index, integer);
    } else if (kind == Kind::kReal) {
      st.Bind(index, real);
    } else {
      st.BindNull(index);
    }
  }
};

// The values of one row of `docs`.
struct Row {
  int64_t kept = 0;
  std::string rest;  // empty: null
  bool anc_null = false;
  std::optional<int64_t> plen;  // bytes of the folder part when the path ends in "/" + name
  NumberColumn ctime, crtime;
  std::optional<std::string> owner, grp;
};

const Json::Value* Member(const Json::Value& doc, const char* field) {
  return doc.find(field, field + std::strlen(field));
}

Row RowOf(const Schema& schema, const Json::Value& doc, const DerivedDoc& d) {
  Row r;
  std::string parent;
  const bool has_parent = ParentOfPath(d.path, d.name, &parent);
  if (has_parent) r.plen = static_cast<int64_t>(parent.size());
  if (has_parent && d.ancestor == parent) {
    r.kept |= kAncestorFromPath;
    r.anc_null = true;
  }
  r.ctime = NumberColumn::Of(Member(doc, kFieldCtime));
  r.crtime = NumberColumn::Of(Member(doc, kFieldCrtime));
  Json::Value rest(Json::objectValue);
  for (auto it = doc.begin(); it != doc.end(); ++it) {
    const std::string field = it.name();
    const Json::Value& v = *it;
    if (field == schema.property_id()) continue;  // the path, a non-empty string
    if (field == schema.ancestor_field() && v.isString() && v.asString() == d.ancestor) {
      r.kept |= kAncestorField;
      continue;
    }
    const Shadow* s = ShadowOf(field);
    bool kept = false;
    if (s != nullptr) {
      switch (s->source) {
        case Source::kName:
          kept = v.isString() && v.asString() == d.name;
          break;
        case Source::kParent:
          kept = has_parent && v.isString() && v.asString() == parent;
          break;
        case Source::kExt:
          kept = v.isString() && v.asString() == d.ext;
          break;
        case Source::kIsDir:
          kept = v.isBool();
          break;
        case Source::kSize:
        case Source::kMtime:
          kept = v.type() == Json::intValue &&
                 v.asInt64() == (s->source == Source::kSize ? d.size : d.mtime);
          break;
        case Source::kCtime:
        case Source::kCrtime:
          kept = v.type() == Json::intValue;
          break;
        case Source::kOwner:
        case Source::kGroup:
          kept = v.isString();
          if (kept) (s->source == Source::kOwner ? r.owner : r.grp) = v.asString();
          break;
      }
    }
    if (kept) {
      r.kept |= s->bit;
    } else {
      rest[field] = v;
    }
  }
  if (!rest.empty()) r.rest = JsonToString(rest);
  return r;
}

// The document of a row read with kDocColumns from column `first` on.
Json::Value ReadDoc(const Schema& schema, const Stmt& st, int first) {
  const int64_t kept = st.Int(first + 11);
  Json::Value doc =
      st.IsNull(first + 12) ? Json::Value(Json::objectValue) : ParseBody(st.Text(first + 12));
  const std::string path = st.Text(first);
  const std::string name = st.Text(first + 1);
  if (kept & kAncestorField) doc[schema.ancestor_field()] = st.Text(first + 10);
  for (const Shadow& s : kShadows) {
    if ((kept & s.bit) == 0) continue;
    Json::Value& v = doc[s.field];
    switch (s.source) {
      case Source::kName:
        v = name;
        break;
      case Source::kParent: {
        std::string parent;
        ParentOfPath(path, name, &parent);
        v = parent;
        break;
      }
      case Source::kExt:
        v = st.Text(first + 2);
        break;
      case Source::kIsDir:
        v = st.Int(first + 5) != 0;
        break;
      case Source::kSize:
        v = Json::Int64(st.Int(first + 3));
        break;
      case Source::kMtime:
        v = Json::Int64(st.Int(first + 4));
        break;
      case Source::kCtime:
        v = Json::Int64(st.Int(first + 6));
        break;
      case Source::kCrtime:
        v = Json::Int64(st.Int(first + 7));
        break;
      case Source::kOwner:
        v = st.Text(first + 8);
        break;
      case Source::kGroup:
        v = st.Text(first + 9);
        break;
    }
  }
  doc[schema.property_id()] = path;
  return doc;
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
  } else if (v->type() == Json::intValue) {
    *text = std::to_string(v->asInt64());
  } else if (v->type() == Json::uintValue) {
    *text = std::to_string(v->asUInt64());
  } else {
    *text = JsonToString(*v);
  }
  return true;
}

// The WHERE clause and its bound texts for a document query. Queries on a field without a
// column of its own (`scan`) read every document in identifier order and test it here.
struct Where {
  std::string sql;
  std::vector<std::string> args;
  bool scan = false;
  const DocQuery* query = nullptr;

  bool Matches(const Json::Value& doc) const {
    std::string text;
    if (!QueryText(doc, query->field, &text)) return false;
    if (query->kind == DocQuery::Kind::kTerm) {
      // A whole value is compared as text only for strings, never for numbers and flags.
      const std::string& f = query->field;
      return doc.find(f.data(), f.data() + f.size())->isString() && text == query->value;
    }
    return text.compare(0, query->value.size(), query->value) == 0;
  }
};

Where WhereOf(const Schema& schema, const DocQuery& q) {
  Where w;
  w.query = &q;
  const bool id_field = q.field == schema.property_id();
  switch (q.kind) {
    case DocQuery::Kind::kAll:
      w.sql = "1";
      break;
    case DocQuery::Kind::kTerm:
      if (!q.field.empty() && q.field == schema.ancestor_field()) {
        // The ancestor field stands for the folder and every folder above it: a term matches
        // documents anywhere below that folder.
        std::string folder = q.value;
        while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
        const std::string under = folder == "/" ? "/" : folder + "/";
        w.sql = "(ancestor = ? OR (ancestor >= ? AND ancestor < ?))";
        w.args = {folder, under, *PrefixUpperBound(under)};
      } else if (id_field) {
        w.sql = "path = ?";
        w.args.push_back(q.value);
      } else {
        w.sql = "1";
        w.scan = true;
      }
      break;
    case DocQuery::Kind::kPrefix: {
      const std::optional<std::string> upper = PrefixUpperBound(q.value);
      if (!id_field) {
        w.sql = "1";
        w.scan = true;
      } else if (!upper) {
        w.sql = "path >= ?";
        w.args.push_back(q.value);
      } else {
        w.sql = "path >= ? AND path < ?";
        w.args.push_back(q.value);
        w.args.push_back(*upper);
      }
      break;
    }
  }
  return w;
}

void BindWhere(Stmt& st, const Where& w, int first) {
  for (size_t i = 0; i < w.args.size(); ++i) st.Bind(first + static_cast<int>(i), w.args[i]);
}

void SyncFile(const platform::SafeDir& folder, const std::string& name) {
  const std::string path = folder.path() + "/" + name;
  UniqueFd fd(::openat(folder.fd(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) {
    if (errno == ENOENT) return;
    throw StoreError(SQLITE_IOERR, "open " + path + " for sync failed");
  }
  if (::fsync(fd.get()) != 0) throw StoreError(SQLITE_IOERR_FSYNC, "fsync " + path + " failed");
}

// Runs a check of the system's own files, turning its refusals into the store's.
template <typename F>
auto Guarded(F&& f) -> decltype(f()) {
  try {
    return f();
  } catch (const Error& e) {
    if (e.code == kErrUnsafePath) throw UnsafeStoreError(e.message);
    throw StoreError(SQLITE_CANTOPEN, e.message);
  }
}

// A user's keywords as an FTS query: every word quoted (so that no word is read as an
// operator) and all of them required; a trailing '*' keeps its prefix meaning.
std::string MatchExpression(const std::string& keywords) {
  std::string out;
  size_t i = 0;
  while (i < keywords.size()) {
    while (i < keywords.size() && std::isspace(static_cast<unsigned char>(keywords[i]))) ++i;
    size_t j = i;
    while (j < keywords.size() && !std::isspace(static_cast<unsigned char>(keywords[j]))) ++j;
    if (j > i) {
      std::string word = keywords.substr(i, j - i);
      bool prefix = false;
      while (!word.empty() && word.back() == '*') {
        word.pop_back();
        prefix = true;
      }
      if (!word.empty()) {
        std::string quoted = "\"";
        for (char c : word) {
          if (c == '"') quoted += '"';
          quoted += c;
        }
        quoted += '"';
        if (prefix) quoted += '*';
        if (!out.empty()) out += ' ';
        out += quoted;
      }
    }
    i = j;
  }
  return out;
}


}  // namespace

DocQuery DocQuery::Parse(const Json::Value& query) {
  if (!query.isObject()) throw EngineError(kCodeInvalidParam, "query is not an object");
  const Json::Value& qsl = query["qsl"];
  if (!qsl.isObject() || qsl.size() != 1) {
    throw EngineError(kCodeInvalidParam, "query qsl must hold exactly one of term, prefix, "
                                         "match_all");
  }
  DocQuery q;
  const std::string form = qsl.getMemberNames()[0];
  if (form == "match_all") return q;
  if (form != "term" && form != "prefix") {
    throw EngineError(kCodeInvalidParam, "unknown query form: " + form);
  }
  const Json::Value& body = qsl[form];
  if (!body.isObject() || body.size() != 1) {
    throw EngineError(kCodeInvalidParam, "query " + form + " must name exactly one field");
  }
  q.kind = form == "term" ? Kind::kTerm : Kind::kPrefix;
  q.field = body.getMemberNames()[0];
  const Json::Value& v = body[q.field];
  if (!v.isString() && !v.isNumeric() && !v.isBool()) {
    throw EngineError(kCodeInvalidParam, "query value of " + q.field + " is not a scalar");
  }
  q.value = v.isString() ? v.asString() : ValueText(v);
  return q;
}

Json::Value ListedValue(const Json::Value* v) {
  if (v == nullptr || v->isNull()) return Json::Value();
  if (v->isBool()) return Json::Int64(v->asBool() ? 1 : 0);
  if (v->type() == Json::intValue ||
      (v->type() == Json::uintValue && v->asUInt64() <= INT64_MAX)) {
    return Json::Int64(v->asInt64());
  }
  if (v->isString()) return *v;
  return JsonToString(*v);
}

std::optional<std::string> PrefixUpperBound(const std::string& prefix) {
  std::string upper = prefix;
  while (!upper.empty()) {
    unsigned char last = static_cast<unsigned char>(upper.back());
    if (last != 0xFF) {
      upper.back() = static_cast<char>(last + 1);
      return upper;
    }
    upper.pop_back();
  }
  return std::nullopt;
}

bool IsSuggestible(const std::string& term) {
  const bool digits =
      std::all_of(term.begin(), term.end(), [](char c) { return c >= '0' && c <= '9'; });
  return term.size() >= 2 && !digits && term.find('"') == std::string::npos;
}

platform::SafeDir OpenStoreDir(const std::string& dir, bool create) {
  return Guarded([&] { return platform::SafeDir::Open(dir, create); });
}

IndexStore::IndexStore(std::string dir, platform::SafeDir folder)
    : dir_(std::move(dir)),
      file_(dir_ + "/" + kDbFile),
      folder_(std::move(folder)),
      open_name_("/proc/self/fd/" + std::to_string(folder_.fd()) + "/" + kDbFile) {}

IndexStore::~IndexStore() {
  cached_.clear();
  readers_.clear();
  writer_.Close();
}

bool IndexStore::ExistsIn(const std::string& dir) {
  const platform::SafeDir folder = OpenStoreDir(dir, false);
  return folder.valid() && folder.Exists(kDbFile);
}

Stmt& IndexStore::Cached(const char* sql) {
  std::unique_ptr<Stmt>& st = cached_[sql];
  if (!st) {
    st = std::make_unique<Stmt>(writer_, sql);
  } else {
    st->Reset();
  }
  return *st;
}

void IndexStore::OpenWriter(bool create) {
  writer_.Open(open_name_, create, false, FolderFdVfs());
  ConfigureWriter(writer_);
}

std::shared_ptr<IndexStore> IndexStore::Create(const std::string& dir, const std::string& id,
                                               const Json::Value& mappings,
                                               const Json::Value& settings,
                                               const Json::Value& event_handler) {
  Schema::Parse(mappings);  // refuse a bad schema before anything is written
  platform::SafeDir folder = OpenStoreDir(dir, true);
  if (folder.Exists(kDbFile)) {
    throw EngineError(kCodeIndexExists, "a store already exists in " + dir);
  }
  // Made here, root-only, so that SQLite's log and shared-memory files, which take the
  // database's mode, are root-only too.
  if (!Guarded([&] { return folder.OpenFile(kDbFile, O_RDWR | O_CREAT | O_EXCL); }).valid()) {
    throw StoreError(SQLITE_CANTOPEN, "cannot create " + dir + "/" + kDbFile + ": " +
                                          std::strerror(errno));
  }
  std::shared_ptr<IndexStore> s(new IndexStore(dir, std::move(folder)));
  s->OpenWriter(true);
  {
    Transaction txn(s->writer_);
    s->writer_.Exec(std::string(kSchemaSql) + DocsTableSql("docs") + kNameIndexSql);
    Stmt put(s->writer_, "INSERT INTO meta(key, value) VALUES(?, ?)");
    auto set = [&](const std::string& k, const std::string& v) {
      put.Bind(1, k).Bind(2, v).Run();
    };
    set("format", std::to_string(kFormat));
    set("id", id);
    set("mappings", JsonToString(mappings));
    set("settings", JsonToString(settings));
    set("event_handler", JsonToString(event_handler));
    set("term_sugg", "ready");
    txn.Commit();
  }
  s->LoadSchema();
  s->Sync();
  // The folder entry of the new file must reach the disk too.
  if (!s->folder_.Sync()) throw StoreError(SQLITE_IOERR_FSYNC, "fsync " + dir + " failed");
  return s;
}

std::shared_ptr<IndexStore> IndexStore::Open(const std::string& dir) {
  platform::SafeDir folder = OpenStoreDir(dir, false);
  if (!folder.valid() || !folder.Exists(kDbFile)) {
    throw EngineError(kCodeIndexNotFound, "no store in " + dir);
  }
  // Files an older installation left readable by everyone are narrowed here, every open.
  for (const char* suffix : {"", "-wal", "-shm"}) {
    Guarded([&] { return folder.CheckEntry(std::string(kDbFile) + suffix, false); });
  }
  std::shared_ptr<IndexStore> s(new IndexStore(dir, std::move(folder)));
  s->OpenWriter(false);
  s->LoadSchema();
  return s;
}

void IndexStore::LoadSchema() {
  std::string format = Meta("format");
  if (format == std::to_string(kOldFormat)) {
    Upgrade();
    format = Meta("format");
  }
  if (format != std::to_string(kFormat)) {
    throw StoreError(SQLITE_NOTADB, "unknown store format '" + format + "' in " + file_);
  }
  JsonValue mappings;
  if (!mappings.fromString(Meta("mappings"))) {
    throw StoreError(SQLITE_CORRUPT, "stored mappings are not JSON in " + file_);
  }
  schema_ = Schema::Parse(mappings);
}

void IndexStore::Upgrade() {
  // One transaction: a crash midway leaves the old store as it was, to be upgraded next time.
  // The word index keeps its rows (same row ids, same text); the name index is rebuilt over
  // folded names.
  JsonValue mappings;
  if (!mappings.fromString(Meta("mappings"))) {
    throw StoreError(SQLITE_CORRUPT, "stored mappings are not JSON in " + file_);
  }
  schema_ = Schema::Parse(mappings);
  Transaction txn(writer_);
  writer_.Exec("ALTER TABLE docs RENAME TO docs_old; DROP TABLE fts_name;" +
               DocsTableSql("docs") + kNameIndexSql);
  int64_t count = 0;
  {
    Stmt rows(writer_, "SELECT rowid, body FROM docs_old");
    while (rows.Step()) {
      const Json::Value doc = ParseBody(rows.Text(1));
      const DerivedDoc d = schema_.Derive(doc);
      DerivedDoc before = d;
      before.name_text.clear();
      WriteRow(rows.Int(0), doc, d, true, &before);
      ++count;
    }
  }
  writer_.Exec("DROP TABLE docs_old");
  SetMeta("format", std::to_string(kFormat));
  txn.Commit();
  Log(LOG_INFO, "the index in %s was rewritten in the compact store format (%lld documents)",
      dir_.c_str(), static_cast<long long>(count));
}

std::string IndexStore::Meta(const std::string& key) {
  Stmt& st = Cached("SELECT value FROM meta WHERE key = ?");
  st.Bind(1, key);
  std::string value = st.Step() ? st.Text(0) : std::string();
  st.Reset();
  return value;
}

void IndexStore::SetMeta(const std::string& key, const std::string& value) {
  Cached("INSERT OR REPLACE INTO meta(key, value) VALUES(?, ?)").Bind(1, key).Bind(2, value).Run();
}

void IndexStore::WriteRow(int64_t rowid, const Json::Value& doc, const DerivedDoc& d, bool insert,
                          const DerivedDoc* old) {
  const Row r = RowOf(schema_, doc, d);
  Stmt& st = insert ? Cached("INSERT INTO docs(path, nm, plen, ext, size, mtime, is_dir, ctime,"
                             " crtime, owner, grp, anc, kept, rest, rowid)"
                             " VALUES(?,?,?,?,?,?,?,?,?,?,?,?,?,?,?)")
                    : Cached("UPDATE docs SET path=?, nm=?, plen=?, ext=?, size=?, mtime=?,"
                             " is_dir=?, ctime=?, crtime=?, owner=?, grp=?, anc=?, kept=?, rest=?"
                             " WHERE rowid=?");
  auto text_or_null = [&](int index, const std::optional<std::string>& v) {
    if (v) {
      st.Bind(index, *v);
    } else {
      st.BindNull(index);
    }
  };
  st.Bind(1, d.path);
  if (r.plen) {
    st.BindNull(2).Bind(3, *r.plen);
  } else {
    st.Bind(2, d.name).BindNull(3);
  }
  st.Bind(4, d.ext).Bind(5, d.size).Bind(6, d.mtime).Bind(7, static_cast<int64_t>(d.is_dir));
  r.ctime.BindTo(st, 8);
  r.crtime.BindTo(st, 9);
  text_or_null(10, r.owner);
  text_or_null(11, r.grp);
  text_or_null(12, r.anc_null ? std::nullopt : std::optional<std::string>(d.ancestor));
  st.Bind(13, r.kept);
  text_or_null(14, r.rest.empty() ? std::nullopt : std::optional<std::string>(r.rest));
  if (insert && rowid == 0) {
    st.BindNull(15);
  } else {
    st.Bind(15, rowid);
  }
  st.Run();
  if (insert && rowid == 0) rowid = writer_.LastInsertRowid();
  // Full-text rows are only rewritten when their text changed: re-pathing a directory's
  // descendants leaves names and words alone and stays cheap. The tokenizers read UTF-8, so
  // the texts go in in their written form: a name's valid parts are found as any other.
  if (old == nullptr || old->all_text != d.all_text) {
    if (old != nullptr && !old->all_text.empty()) {
      Cached("DELETE FROM fts_all WHERE rowid = ?").Bind(1, rowid).Run();
    }
    if (!d.all_text.empty()) {
      Cached("INSERT INTO fts_all(rowid, text) VALUES(?, ?)").Bind(1, rowid)
          .Bind(2, EncodeName(d.all_text)).Run();
    }
  }
  if (old == nullptr || old->name_text != d.name_text) {
    if (old != nullptr && !old->name_text.empty()) {
      Cached("DELETE FROM fts_name WHERE rowid = ?").Bind(1, rowid).Run();
    }
    if (!d.name_text.empty()) {
      Cached("INSERT INTO fts_name(rowid, name) VALUES(?, ?)").Bind(1, rowid)
          .Bind(2, FoldName(EncodeName(d.name_text))).Run();
    }
  }
}

void IndexStore::DeleteRow(int64_t rowid) {
  // Deleting a row a full-text table does not hold (a document without that text) is a no-op.
  Cached("DELETE FROM fts_all WHERE rowid = ?").Bind(1, rowid).Run();
  Cached("DELETE FROM fts_name WHERE rowid = ?").Bind(1, rowid).Run();
  Cached("DELETE FROM docs WHERE rowid = ?").Bind(1, rowid).Run();
}

void IndexStore::Upsert(const std::string& doc_id, const Json::Value& given) {
  if (!given.isObject()) throw EngineError(kCodeDocInvalid, "document is not an object");
  const std::string& pid = schema_.property_id();
  // Only a document that lacks its identifying field is copied, to fill it in.
  Json::Value filled;
  const bool fill = !given.isMember(pid) && !doc_id.empty();
  if (fill) {
    filled = given;
    filled[pid] = doc_id;
  }
  const Json::Value& doc = fill ? filled : given;
  schema_.Validate(doc);
  const DerivedDoc d = schema_.Derive(doc);
  if (!doc_id.empty() && doc_id != d.path) Delete(doc_id);
  int64_t rowid = 0;
  Json::Value stored;
  if (FindRow(d.path, &rowid, &stored)) {
    const DerivedDoc old = schema_.Derive(stored);
    WriteRow(rowid, doc, d, false, &old);
  } else {
    WriteRow(0, doc, d, true, nullptr);
  }
}

size_t IndexStore::UpsertMany(const std::vector<Json::Value>& docs,
                              std::vector<std::pair<size_t, std::string>>* refused) {
  size_t written = 0;
  for (size_t i = 0; i < docs.size(); ++i) {
    try {
      Upsert(std::string(), docs[i]);
      ++written;
    } catch (const EngineError& e) {
      // Refused before anything of it was written: the others go on.
      if (refused != nullptr) refused->emplace_back(i, e.what());
    }
  }
  return written;
}

void IndexStore::SetFields(const std::string& doc_id, const Json::Value& fields) {
  if (!fields.isObject()) throw EngineError(kCodeDocInvalid, "fields are not an object");
  int64_t rowid = 0;
  Json::Value doc;
  if (!FindRow(doc_id, &rowid, &doc)) throw EngineError(kCodeDocNotFound, "no document " + doc_id);
  const DerivedDoc old = schema_.Derive(doc);
  for (const std::string& k : fields.getMemberNames()) {
    if (fields[k].isNull()) {
      doc.removeMember(k);
    } else {
      doc[k] = fields[k];
    }
  }
  schema_.Validate(doc);
  const DerivedDoc d = schema_.Derive(doc);
  if (d.path != old.path) {
    // The file now lives where another document was: that file has been replaced.
    Stmt& find = Cached("SELECT rowid FROM docs WHERE path = ?");
    find.Bind(1, d.path);
    const int64_t other_row = find.Step() ? find.Int(0) : 0;
    find.Reset();
    if (other_row != 0) DeleteRow(other_row);
  }
  WriteRow(rowid, doc, d, false, &old);
}

bool IndexStore::Delete(const std::string& doc_id) {
  Stmt& find = Cached("SELECT rowid FROM docs WHERE path = ?");
  find.Bind(1, doc_id);
  const int64_t rowid = find.Step() ? find.Int(0) : 0;
  find.Reset();
  if (rowid == 0) return false;
  DeleteRow(rowid);
  return true;
}

bool IndexStore::FindRow(const std::string& path, int64_t* rowid, Json::Value* stored) {
  Stmt& find = Cached("SELECT rowid, path, name, ext, size, mtime, is_dir, ctime, crtime, owner,"
                      " grp, ancestor, kept, rest FROM docs WHERE path = ?");
  find.Bind(1, path);
  const bool found = find.Step();
  if (found) {
    *rowid = find.Int(0);
    *stored = ReadDoc(schema_, find, 1);
  }
  find.Reset();
  return found;
}

int64_t IndexStore::DeleteByQuery(const DocQuery& q) {
  const Where w = WhereOf(schema_, q);
  if (w.scan) {
    CheckFieldName(q.field);
    std::vector<int64_t> rows;
    Stmt st(writer_, std::string("SELECT rowid, ") + kDocColumns + " FROM docs");
    while (st.Step()) {
      if (w.Matches(ReadDoc(schema_, st, 1))) rows.push_back(st.Int(0));
    }
    for (int64_t rowid : rows) DeleteRow(rowid);
    return static_cast<int64_t>(rows.size());
  }
  const std::string rows = "SELECT rowid FROM docs WHERE " + w.sql;
  // Deleting rows whose text is empty from the full-text tables is a harmless no-op.
  for (const char* table : {"fts_all", "fts_name"}) {
    Stmt st(writer_, std::string("DELETE FROM ") + table + " WHERE rowid IN (" + rows + ")");
    BindWhere(st, w, 1);
    st.Run();
  }
  Stmt st(writer_, "DELETE FROM docs WHERE " + w.sql);
  BindWhere(st, w, 1);
  st.Run();
  return writer_.Changes();
}

Json::Value IndexStore::GetByQuery(const DocQuery& q, const std::vector<std::string>& load,
                                   int64_t from, int64_t size) {
  const Where w = WhereOf(schema_, q);
  if (w.scan) CheckFieldName(q.field);
  std::string sql = std::string("SELECT ") + kDocColumns + " FROM docs WHERE " + w.sql +
                    " ORDER BY path";
  if (!w.scan) sql += " LIMIT ? OFFSET ?";
  Stmt st(writer_, sql);
  BindWhere(st, w, 1);
  if (!w.scan) {
    st.Bind(static_cast<int>(w.args.size()) + 1, size);
    st.Bind(static_cast<int>(w.args.size()) + 2, from);
  }
  Json::Value hits(Json::arrayValue);
  int64_t matched = 0;
  while (st.Step() && static_cast<int64_t>(hits.size()) < size) {
    Json::Value doc = ReadDoc(schema_, st, 0);
    if (w.scan && (!w.Matches(doc) || matched++ < from)) continue;
    hits.append(schema_.Load(doc, load));
  }
  return hits;
}

Json::Value IndexStore::List(const std::string& dir, const std::string& after,
                             const std::vector<std::string>& extra, int64_t size) {
  for (const std::string& field : extra) CheckFieldName(field);
  // One range scan of the identifier index: from the folder itself (or just after the last
  // identifier of the previous page) up to the first identifier past its subtree; names that
  // only begin like the folder ("dir.txt" sorts between "dir" and "dir/") are filtered out.
  const std::string under = dir + "/";
  const std::optional<std::string> upper = PrefixUpperBound(under);
  const bool resume = !after.empty() && after >= dir;
  std::string sql = "SELECT path, size, mtime, is_dir";
  if (!extra.empty()) sql += std::string(", ") + kDocColumns;
  sql += std::string(" FROM docs WHERE path ") + (resume ? ">" : ">=") + " ?1";
  if (upper) sql += " AND path < ?2";
  sql += " AND (path = ?3 OR path >= ?4) ORDER BY path LIMIT ?5";
  Stmt st(writer_, sql);
  st.Bind(1, resume ? after : dir);
  if (upper) st.Bind(2, *upper);
  st.Bind(3, dir);
  st.Bind(4, under);
  st.Bind(5, size);
  Json::Value hits(Json::arrayValue);
  while (st.Step()) {
    Json::Value hit(Json::arrayValue);
    hit.append(st.Text(0));
    hit.append(st.IsNull(1) ? Json::Value() : Json::Value(Json::Int64(st.Int(1))));
    hit.append(st.IsNull(2) ? Json::Value() : Json::Value(Json::Int64(st.Int(2))));
    hit.append(!st.IsNull(3) && st.Int(3) != 0);
    if (!extra.empty()) {
      // Each loaded field as a value of SQL would give it: whole numbers and flags as numbers,
      // strings as they are, anything else as its JSON text.
      const Json::Value doc = ReadDoc(schema_, st, 4);
      for (const std::string& field : extra) {
        hit.append(ListedValue(doc.find(field.data(), field.data() + field.size())));
      }
    }
    hits.append(std::move(hit));
  }
  return hits;
}

bool IndexStore::UpdateTermSuggestion(const std::string& doc_id) {
  Stmt& find = Cached("SELECT 1 FROM docs WHERE path = ?");
  find.Bind(1, doc_id);
  if (!find.Step()) {
    find.Reset();
    return false;
  }
  find.Reset();
  // The suggestion vocabulary is derived from the documents in the same transaction, so a
  // document that exists already contributes its words.
  return true;
}

int64_t IndexStore::DocCount() {
  Stmt& st = Cached("SELECT count(*) FROM docs");
  const int64_t n = st.Step() ? st.Int(0) : 0;
  st.Reset();
  return n;
}

void IndexStore::Sync() {
  // A passive checkpoint never waits for readers; whatever it could not copy stays in the log,
  // which is synced below, so every committed transaction is on disk either way.
  sqlite3_wal_checkpoint_v2(writer_.get(), nullptr, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
  SyncFile(folder_, std::string(kDbFile) + "-wal");
  SyncFile(folder_, kDbFile);
}

bool IndexStore::QuickCheck(std::string* detail) {
  try {
    Stmt st(writer_, "PRAGMA quick_check");
    std::string result;
    while (st.Step()) {
      if (!result.empty()) result += "; ";
      result += st.Text(0);
    }
    if (result != "ok") {
      *detail = result;
      return false;
    }
    Stmt count(writer_, "SELECT count(*) FROM docs");
    count.Step();
    return true;
  } catch (const StoreError& e) {
    *detail = e.what();
    return false;
  }
}

std::unique_ptr<Db> IndexStore::TakeReader() {
  {
    std::lock_guard<std::mutex> lock(readers_mu_);
    if (!readers_.empty()) {
      std::unique_ptr<Db> db = std::move(readers_.back());
      readers_.pop_back();
      return db;
    }
  }
  auto db = std::make_unique<Db>();
  db->Open(open_name_, false, false, FolderFdVfs());
  db->Exec("PRAGMA query_only=1");
  db->Exec("PRAGMA cache_size=-16384");
  db->Exec(kMmapPragma);
  RegisterSnippetFunction(db->get());
  return db;
}

void IndexStore::GiveBackReader(std::unique_ptr<Db> db) {
  std::lock_guard<std::mutex> lock(readers_mu_);
  if (readers_.size() < 8) readers_.push_back(std::move(db));
}

namespace {

// A bound value of a search statement, in the order of its '?' marks.
struct Arg {
  bool is_text;
  std::string text;
  int64_t number;
  std::optional<double> real;
};

// A search as SQL: the joins and conditions its filters need, the order it is read in, and the
// values of its '?' marks.
struct SearchSql {
  std::string match;  // the keywords as a full-text query; empty without keywords
  std::string from = " FROM docs d";
  std::string where = " WHERE 1";
  std::string order;
  std::vector<Arg> args;

  bool has_keywords() const { return !match.empty(); }
  void Text(std::string v) { args.push_back({true, std::move(v), 0, std::nullopt}); }
  void Number(int64_t v) { args.push_back({false, std::string(), v, std::nullopt}); }
  void Real(double v) { args.push_back({false, std::string(), 0, v}); }
  // Snippets are made for the returned page only, after the rows are chosen: counting and
  // sorting never pay for them.
  std::string Select() const {
    return std::string("SELECT d.path, d.name, d.size, d.mtime, d.is_dir, d.ext") +
           (has_keywords() ? ", bm25(fts_all), d.rowid" : "") + from + where + order;
  }
  // Binds every value from the first mark on; the index of the next mark.
  int BindAll(Stmt& st) const {
    int i = 1;
    for (const Arg& a : args) {
      if (a.is_text) {
        st.Bind(i++, a.text);
      } else if (a.real) {
        st.Bind(i++, *a.real);
      } else {
        st.Bind(i++, a.number);
      }
    }
    return i;
  }
};

// A required name pattern drives the search: the planner, left to itself, may prefer reading a
// large folder's rows by path and asking the trigram index about each one, which costs a whole
// GLOB lookup per row.
void JoinNames(SearchSql* q) {
  static const std::string kDocs = " FROM docs d";
  q->from = " FROM fts_name CROSS JOIN docs d ON d.rowid = fts_name.rowid" +
            q->from.substr(kDocs.size());
}

void AddNameFilter(const std::string& name, SearchSql* q) {
  JoinNames(q);
  // The trigram index answers a GLOB from the trigrams of its literal runs and checks the
  // candidates against the folded names it holds; patterns under three characters scan them.
  const std::string glob = "*" + GlobLiteral(FoldName(name)) + "*";
  q->where += " AND " + NameGlobCondition(glob);
  q->Text(glob);
}

void AddFolderFilter(std::string folder, SearchSql* q) {
  while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
  const std::string under = folder == "/" ? "/" : folder + "/";
  const std::string upper = *PrefixUpperBound(under);
  // The path range uses the path index; the ancestor test is what scopes.
  q->where += " AND d.path >= ? AND d.path < ? AND (d.ancestor = ? OR (d.ancestor >= ? AND"
              " d.ancestor < ?))";
  q->Text(under);
  q->Text(upper);
  q->Text(folder);
  q->Text(under);
  q->Text(upper);
}

std::string OrderBy(const SearchParams& p, bool has_keywords) {
  const char* dir = p.desc ? " DESC" : " ASC";
  switch (p.sort) {
    case SearchParams::Sort::kRelevance:
      // Without keywords there is no score: hits come in index order, which costs no sort.
      return has_keywords ? std::string(" ORDER BY bm25(fts_all)") + (p.desc ? " DESC" : "")
                          : "";
    case SearchParams::Sort::kName:
      return std::string(" ORDER BY d.name COLLATE NOCASE") + dir + ", d.path";
    case SearchParams::Sort::kSize:
      return std::string(" ORDER BY d.size") + dir + ", d.path";
    case SearchParams::Sort::kMtime:
      return std::string(" ORDER BY d.mtime") + dir + ", d.path";
  }
  return "";
}

SearchSql SearchSqlOf(const SearchParams& p) {
  SearchSql q;
  // The full-text tables hold written forms; the other columns hold the names' bytes.
  q.match = MatchExpression(EncodeName(p.keywords));
  if (q.has_keywords()) {
    q.from += " JOIN fts_all ON fts_all.rowid = d.rowid";
    q.where += " AND fts_all MATCH ?";
    q.Text(q.match);
  }
  const std::string name = EncodeName(p.name);
  if (!name.empty()) AddNameFilter(name, &q);
  if (!p.folder.empty()) AddFolderFilter(p.folder, &q);
  if (!p.exts.empty()) {
    q.where += " AND d.ext IN (";
    for (size_t i = 0; i < p.exts.size(); ++i) {
      q.where += i == 0 ? "?" : ",?";
      q.Text(AsciiLower(p.exts[i]));
    }
    q.where += ")";
  }
  auto bound = [&](const std::optional<int64_t>& v, const char* cond) {
    if (!v) return;
    q.where += cond;
    q.Number(*v);
  };
  bound(p.size_min, " AND d.size >= ?");
  bound(p.size_max, " AND d.size <= ?");
  bound(p.mtime_min, " AND d.mtime >= ?");
  bound(p.mtime_max, " AND d.mtime <= ?");
  if (p.is_dir) q.where += *p.is_dir ? " AND d.is_dir = 1" : " AND d.is_dir = 0";
  if (p.query) {
    // The name and keyword filters above join the same tables on the same row.
    if ((p.query->join == "fts_name" && name.empty()) ||
        (p.query->join == "fts_all" && !q.has_keywords())) {
      if (p.query->join == "fts_name") {
        JoinNames(&q);
      } else {
        q.from += " JOIN " + p.query->join + " ON " + p.query->join + ".rowid = d.rowid";
      }
    }
    q.where += " AND " + p.query->sql;
    for (const SqlValue& v : p.query->values) {
      switch (v.kind) {
        case SqlValue::Kind::kText:
          q.Text(v.text);
          break;
        case SqlValue::Kind::kInt:
          q.Number(v.integer);
          break;
        case SqlValue::Kind::kReal:
          q.Real(v.real);
          break;
      }
    }
  }
  q.order = OrderBy(p, q.has_keywords());
  return q;
}

// The hits of a page, and the full-text rows their snippets are made from.
struct PageRows {
  SearchPage page;
  std::vector<int64_t> rowids;

  void Add(Stmt& st, bool has_keywords) {
    Json::Value hit;
    hit["path"] = st.Text(0);
    hit["name"] = st.Text(1);
    hit["size"] = static_cast<Json::Int64>(st.Int(2));
    hit["mtime"] = static_cast<Json::Int64>(st.Int(3));
    hit["is_dir"] = st.Int(4) != 0;
    hit["ext"] = st.Text(5);
    if (has_keywords) {
      hit["score"] = -st.Double(6);
      rowids.push_back(st.Int(7));
    }
    page.hits.push_back(std::move(hit));
  }
};

// Every hit is visible: the page is read with LIMIT and OFFSET, and counting stops at a bound,
// so that a one-letter search over a million names stays fast.
void ReadPage(Db& db, const SearchSql& q, const SearchParams& p, PageRows* rows) {
  Stmt count(db, "SELECT count(*) FROM (SELECT d.rowid" + q.from + q.where + " LIMIT " +
                     std::to_string(IndexStore::kCountLimit + 1) + ")");
  q.BindAll(count);
  SearchPage& page = rows->page;
  if (count.Step()) page.total = count.Int(0);
  if (page.total > IndexStore::kCountLimit) {
    page.total = IndexStore::kCountLimit;
    page.total_exact = false;
  }
  Stmt st(db, q.Select() + " LIMIT ? OFFSET ?");
  const int next = q.BindAll(st);
  st.Bind(next, p.size).Bind(next + 1, p.from);
  while (st.Step()) rows->Add(st, q.has_keywords());
}

// Hits the user may not open are skipped before paging, so counts and pages only ever reflect
// what this user can see. Past the page, counting goes on for a bounded number of rows.
void ScanVisible(Db& db, const SearchSql& q, const SearchParams& p, const VisibleFn& visible,
                 PageRows* rows) {
  Stmt st(db, q.Select());
  q.BindAll(st);
  int64_t seen = 0;
  int64_t inspected = 0;
  while (st.Step()) {
    ++inspected;
    if (seen >= p.from + p.size && inspected > p.from + p.size + IndexStore::kFilteredScanLimit) {
      rows->page.total_exact = false;
      break;
    }
    if (!visible(st.Text(0))) continue;
    ++seen;
    if (seen > p.from && seen <= p.from + p.size) rows->Add(st, q.has_keywords());
  }
  rows->page.total = seen;
}

void AddSnippets(Db& db, const std::string& match, int64_t snippet_from, PageRows* rows) {
  std::vector<Json::Value>& hits = rows->page.hits;
  if (hits.empty()) return;
  Stmt snip(db, std::string("SELECT ") + kSnippetFunction +
                    "(fts_all, '<b>', '</b>', '...', 12) FROM fts_all"
                    " WHERE fts_all MATCH ? AND rowid = ?");
  for (size_t i = static_cast<size_t>(std::max<int64_t>(snippet_from, 0)); i < hits.size(); ++i) {
    snip.Reset();
    snip.Bind(1, match).Bind(2, rows->rowids[i]);
    hits[i]["snippet"] = snip.Step() ? DecodeName(snip.Text(0)) : std::string();
  }
}

}  // namespace

SearchPage IndexStore::Search(const SearchParams& p, const VisibleFn& visible, QueryGuard* guard) {
  std::unique_ptr<Db> db = TakeReader();
  PageRows rows;
  {
    // The guard and every statement are gone before the connection goes back to the pool.
    const ScopedQueryGuard scoped(*db, guard);
    SearchParams planned = p;
    if (p.query) planned.query = NarrowToFolder(*db, *p.query);
    const SearchSql q = SearchSqlOf(planned);
    if (visible) {
      ScanVisible(*db, q, p, visible, &rows);
    } else {
      ReadPage(*db, q, p, &rows);
    }
    if (q.has_keywords()) AddSnippets(*db, q.match, p.snippet_from, &rows);
  }
  GiveBackReader(std::move(db));
  return std::move(rows.page);
}

std::vector<std::string> IndexStore::Suggest(const std::string& prefix, size_t limit,
                                             const VisibleFn& visible, QueryGuard* guard) {
  std::vector<std::string> out;
  const std::string low = EncodeName(AsciiLower(prefix));
  const std::optional<std::string> upper = PrefixUpperBound(low);
  if (!upper) return out;
  std::unique_ptr<Db> db = TakeReader();
  {
    const ScopedQueryGuard scoped(*db, guard);
    std::vector<std::pair<int64_t, std::string>> candidates;
    Stmt st(*db, "SELECT term, doc FROM sugg WHERE term >= ? AND term < ?");
    st.Bind(1, low).Bind(2, *upper);
    for (int scanned = 0; scanned < kSuggestScanLimit && st.Step(); ++scanned) {
      std::string term = st.Text(0);
      if (IsSuggestible(term)) candidates.emplace_back(st.Int(1), std::move(term));
    }
    std::stable_sort(candidates.begin(), candidates.end(),
                     [](const auto& a, const auto& b) { return a.first > b.first; });
    Stmt docs(*db, "SELECT d.path FROM fts_all JOIN docs d ON d.rowid = fts_all.rowid"
                   " WHERE fts_all MATCH ? LIMIT 64");
    size_t checked = 0;
    for (const auto& [count, term] : candidates) {
      if (out.size() >= limit || ++checked > 200) break;
      bool shown = !visible;
      if (!shown) {
        docs.Reset();
        docs.Bind(1, "\"" + term + "\"");
        while (!shown && docs.Step()) shown = visible(docs.Text(0));
      }
      if (shown) out.push_back(DecodeName(term));
    }
  }
  GiveBackReader(std::move(db));
  return out;
}

namespace {

class SqliteTxn : public StoreTxn {
 public:
  explicit SqliteTxn(Db& db) : txn_(db) {}
  void Commit() override { txn_.Commit(); }

 private:
  Transaction txn_;
};

class SqliteSavepoint : public StoreSavepoint {
 public:
  explicit SqliteSavepoint(Db& db) : sp_(db) {}
  void Release() override { sp_.Release(); }

 private:
  elasticd::Savepoint sp_;
};

}  // namespace

std::unique_ptr<StoreTxn> IndexStore::Begin() { return std::make_unique<SqliteTxn>(writer_); }

std::unique_ptr<StoreSavepoint> IndexStore::BeginSavepoint() {
  return std::make_unique<SqliteSavepoint>(writer_);
}

// SQLite rolls a transaction back on its own after some failures (a full disk, an I/O error):
// the connection is then in autocommit mode again.
bool IndexStore::TransactionLost() { return sqlite3_get_autocommit(writer_.get()) != 0; }

void IndexStore::Rekey(const std::string& new_id) {
  Transaction txn(writer_);
  SetMeta("id", new_id);
  txn.Commit();
}

}  // namespace elasticd
}  // namespace orvane
