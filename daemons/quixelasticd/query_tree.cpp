#include "daemons/quixelasticd/query_tree.hpp"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <memory>
#include <optional>
#include <set>

#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/name_fold.hpp"
#include "daemons/quixelasticd/schema.hpp"
#include "daemons/quixelasticd/sqlite_util.hpp"
#include "daemons/quixelasticd/store.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace elasticd {

namespace {

const char* const kOperators[] = {"and", "or", "not", "match", "range", "in", "under", "all"};

// A field of the tree and the SQL value it reads: a column, or a member of the stored document
// (members without a column of their own are kept in `rest`).
struct FieldColumn {
  const char* name;
  const char* column;
};

// The numbers a range compares. A document without the member is outside every range.
constexpr FieldColumn kRangeFields[] = {
    {"size", "d.size"},
    {"mtime", "d.mtime"},
    {"ctime", "d.ctime"},
    {"crtime", "d.crtime"},
    {"content_created", "json_extract(d.rest, '$.QUIXMDContentCreationDate')"},
    {"duration", "json_extract(d.rest, '$.QUIXMDDurationSecond')"},
    {"pixel_height", "json_extract(d.rest, '$.QUIXMDPixelHeight')"},
    {"pixel_width", "json_extract(d.rest, '$.QUIXMDPixelWidth')"},
    {"year", "json_extract(d.rest, '$.QUIXMDRecordingYear')"},
    {"track", "json_extract(d.rest, '$.QUIXMDAudioTrackNumber')"},
    {"audio_bit_rate", "json_extract(d.rest, '$.QUIXMDAudioBitRate')"},
    {"sample_rate", "json_extract(d.rest, '$.QUIXMDAudioSampleRate')"},
    {"channels", "json_extract(d.rest, '$.QUIXMDAudioChannelCount')"},
    {"iso_speed", "json_extract(d.rest, '$.QUIXMDISOSpeed')"},
};

// The texts a match reads word by word, as the catch-all text holds them.
constexpr FieldColumn kTextFields[] = {
    {"title", "json_extract(d.rest, '$.QUIXMDTitle')"},
    {"authors", "json_extract(d.rest, '$.QUIXMDAuthors')"},
    {"album", "json_extract(d.rest, '$.QUIXMDAlbum')"},
    {"composer", "json_extract(d.rest, '$.QUIXMDComposer')"},
    {"genre", "json_extract(d.rest, '$.QUIXMDMusicalGenre')"},
    {"comment", "json_extract(d.rest, '$.QUIXMDComment')"},
    {"description", "json_extract(d.rest, '$.QUIXMDDescription')"},
    {"keywords", "json_extract(d.rest, '$.QUIXMDKeywords')"},
    {"creator", "json_extract(d.rest, '$.QUIXMDCreator')"},
    {"camera_make", "json_extract(d.rest, '$.QUIXMDAcquisitionMake')"},
    {"camera_model", "json_extract(d.rest, '$.QUIXMDAcquisitionModel')"},
    {"codecs", "json_extract(d.rest, '$.QUIXMDCodecs')"},
};

template <size_t N>
const char* ColumnOf(const FieldColumn (&fields)[N], const std::string& name) {
  for (const FieldColumn& f : fields) {
    if (name == f.name) return f.column;
  }
  return nullptr;
}

template <size_t N>
std::string NamesOf(const FieldColumn (&fields)[N]) {
  std::string out;
  for (const FieldColumn& f : fields) out += std::string(out.empty() ? "" : ", ") + f.name;
  return out;
}

// Where a path range reads the path column. A joined pattern must drive the search: offered
// a path range too, the planner prefers it (a share's range holds every row) and looks the
// pattern up row by row, which over a million rows takes minutes. A unary plus keeps the range
// from being offered to the index; it is still checked on the rows the pattern finds.
const char kPathRef[] = "{path}";

// The most rows of a folder counted to learn the span of their row ids (see NarrowToFolder).
constexpr int64_t kFolderSpanRows = 5000;

[[noreturn]] void Refuse(const std::string& what) {
  throw EngineError(kCodeInvalidParam, "\"query\": " + what);
}

// A word or phrase for the full-text query language, quoted so that nothing in it is read as
// an operator.
std::string Quoted(const std::string& text) {
  std::string out = "\"";
  for (char c : text) {
    if (c == '"') out += '"';
    out += c;
  }
  return out + "\"";
}

// Content patterns are words, all required. The word index can only match a word's start, so
// a '*' ends the word there (a prefix) and leading ones are dropped: "*port*" finds "portal".
std::string ContentMatch(const std::string& pattern) {
  std::string out;
  size_t i = 0;
  while (i < pattern.size()) {
    while (i < pattern.size() && std::isspace(static_cast<unsigned char>(pattern[i]))) ++i;
    size_t j = i;
    while (j < pattern.size() && !std::isspace(static_cast<unsigned char>(pattern[j]))) ++j;
    std::string word = pattern.substr(i, j - i);
    i = j;
    const size_t start = word.find_first_not_of('*');
    if (start == std::string::npos) continue;
    word.erase(0, start);
    const size_t star = word.find('*');
    const bool prefix = star != std::string::npos;
    if (prefix) word.erase(star);
    if (!out.empty()) out += ' ';
    out += Quoted(word) + (prefix ? "*" : "");
  }
  return out;
}


// A glob of '*' wildcards as a LIKE pattern: '*' any run, everything else literal.
std::string LikeOfGlob(const std::string& glob) {
  std::string out;
  size_t from = 0;
  for (size_t star = glob.find('*'); star != std::string::npos; star = glob.find('*', from)) {
    out += LikeLiteral(glob.substr(from, star - from)) + "%";
    from = star + 1;
  }
  return out + LikeLiteral(glob.substr(from));
}

// A column of the embedded store's table as the server's table gives it: the document's
// members are read from its JSON (numbers only for ranges, text for matches).
std::string ServerColumn(const std::string& column, bool number) {
  std::string member;
  if (column == "d.ctime") {
    member = kFieldCtime;
  } else if (column == "d.crtime") {
    member = kFieldCrtime;
  } else if (column.compare(0, 24, "json_extract(d.rest, '$.") == 0) {
    member = column.substr(24, column.size() - 26);
  } else {
    return column;
  }
  const std::string value = "(d.doc::jsonb -> '" + member + "')";
  const std::string json = number ? "(CASE WHEN jsonb_typeof" + value + " = 'number' THEN (" +
                                        value + " #>> '{}')::float8 END)"
                                  : "(" + value + " #>> '{}')";
  // Whole change and creation times have columns of their own; other values stay in the JSON.
  return member == kFieldCtime || member == kFieldCrtime
             ? "COALESCE(" + column + "::float8, " + json + ")"
             : json;
}

class Compiler {
 public:
  // `by_folder`: for a small folder, whose rows the path index gives at once; each name is
  // then checked on the row at hand rather than looked up by its trigrams. `server`: rendered
  // for the PostgreSQL store, whose table holds the folded name (`fname`) and the word vector
  // (`words`) on the row itself, so nothing is joined.
  Compiler(bool by_folder, bool server) : by_folder_(by_folder), server_(server) {}

  SqlCondition Run(const Json::Value& tree) {
    if (!tree.isObject()) Refuse("must be an object");
    SqlCondition c;
    c.sql = Node(tree, 1, true);
    const std::string path = join_.empty() || server_ ? "d.path" : "+d.path";
    for (size_t at = c.sql.find(kPathRef); at != std::string::npos; at = c.sql.find(kPathRef, at)) {
      c.sql.replace(at, std::strlen(kPathRef), path);
    }
    c.values = std::move(values_);
    c.join = server_ ? std::string() : join_;
    c.folder = folder_;
    return c;
  }

 private:
  void Text(std::string v) {
    SqlValue s;
    s.text = std::move(v);
    values_.push_back(std::move(s));
  }

  // The one operator of a node; its other members must be those the operator takes.
  std::string OperatorOf(const Json::Value& q) {
    std::string op;
    for (const std::string& key : q.getMemberNames()) {
      for (const char* known : kOperators) {
        if (key != known) continue;
        if (!op.empty()) Refuse("a node has two operators, \"" + op + "\" and \"" + key + "\"");
        op = key;
      }
    }
    if (op.empty()) Refuse("no known operator in " + JsonToString(q));
    const std::set<std::string> allowed =
        op == "match"   ? std::set<std::string>{"pattern"}
        : op == "range" ? std::set<std::string>{"gte", "gt", "lte", "lt"}
        : op == "in"    ? std::set<std::string>{"values"}
                        : std::set<std::string>{};
    for (const std::string& key : q.getMemberNames()) {
      if (key != op && allowed.count(key) == 0) {
        Refuse("unknown member \"" + key + "\" of a \"" + op + "\" node");
      }
    }
    return op;
  }

  // `required`: every hit must match this node (the root, and the nodes of an "and" that is).
  std::string Node(const Json::Value& q, int depth, bool required) {
    if (!q.isObject()) Refuse("a node must be an object, not " + JsonToString(q));
    if (depth > kMaxQueryDepth) {
      Refuse("deeper than " + std::to_string(kMaxQueryDepth) + " levels");
    }
    if (++nodes_ > kMaxQueryNodes) {
      Refuse("more than " + std::to_string(kMaxQueryNodes) + " nodes");
    }
    const std::string op = OperatorOf(q);
    const Json::Value& arg = q[op];
    if (op == "and" || op == "or") {
      if (!arg.isArray() || arg.empty()) Refuse("\"" + op + "\" must be a non-empty array");
      std::string sql = "(";
      for (Json::ArrayIndex i = 0; i < arg.size(); ++i) {
        if (i > 0) sql += op == "and" ? " AND " : " OR ";
        sql += Node(arg[i], depth + 1, required && op == "and");
      }
      return sql + ")";
    }
    if (op == "not") return "(NOT " + Node(arg, depth + 1, false) + ")";
    if (op == "match") return Match(q, required);
    if (op == "range") return Range(q);
    if (op == "in") return In(q);
    if (op == "under") return Under(arg, required);
    if (!arg.isBool() || !arg.asBool()) Refuse("\"all\" must be true");
    return True();
  }

  std::string Match(const Json::Value& q, bool required) {
    const std::string field = q["match"].isString() ? q["match"].asString() : "";
    const char* text_column = ColumnOf(kTextFields, field);
    if (field != "name" && field != "content" && field != "any" && field != "path" &&
        text_column == nullptr) {
      Refuse("unknown \"match\" field " + JsonToString(q["match"]) +
             " (name, content, any, path, " + NamesOf(kTextFields) + ")");
    }
    const Json::Value& pattern = q["pattern"];
    if (!pattern.isString() || pattern.asString().empty()) {
      Refuse("\"pattern\" of a match must be a non-empty string");
    }
    if (pattern.asString().find_first_not_of('*') == std::string::npos) {
      return text_column == nullptr ? True() : "(" + Column(text_column, false) + " IS NOT NULL)";
    }
    if (field == "path") return PathMatch(pattern.asString());
    // A full-text MATCH may not stand under OR or NOT: only a required pattern is joined.
    const bool joined =
        required && join_.empty() && field != "any" && !(by_folder_ && field == "name");
    if (joined) join_ = field == "name" ? "fts_name" : "fts_all";
    if (field == "name") return NameMatch(pattern.asString(), joined);
    if (field == "content") return ContentCondition(pattern.asString(), joined);
    if (text_column != nullptr) return TextFieldMatch(text_column, pattern.asString(), joined);
    // Two statements: the values are bound in the order of the marks.
    std::string sql = "(" + NameMatch(pattern.asString(), false);
    sql += " OR " + ContentCondition(pattern.asString(), false);
    return sql + ")";
  }

  // Names match as a whole, with '*' standing for any run of characters, compared in the
  // folded form the trigram index holds (any case, with or without diacritics). Its GLOB looks
  // the literal runs of three characters or more up by their trigrams and checks the rows it
  // finds; a pattern without such a run scans the names.
  std::string NameMatch(const std::string& pattern, bool joined) {
    const std::string glob = GlobLiteral(FoldName(EncodeName(pattern)), true);
    if (server_) {
      // The key's pattern finds the candidates by their trigrams; the folded name decides.
      const std::string folded = FoldName(EncodeName(pattern));
      std::string key;
      size_t from = 0;
      for (size_t star = folded.find('*'); star != std::string::npos;
           star = folded.find('*', from)) {
        key += NameKey(folded.substr(from, star - from)) + "%";
        from = star + 1;
      }
      Text(key + NameKey(folded.substr(from)));
      Text(LikeOfGlob(folded));
      return "(d.nkey LIKE ? AND d.fname LIKE ?)";
    }
    Text(glob);
    if (by_folder_) return "((SELECT name FROM fts_name WHERE fts_name.rowid = d.rowid) GLOB ?)";
    const std::string sql = NameGlobCondition(glob);
    return joined ? "(" + sql + ")" : "d.rowid IN (SELECT rowid FROM fts_name WHERE " + sql + ")";
  }

  std::string ContentCondition(const std::string& pattern, bool joined) {
    // The word index holds the written form of names, as the catch-all text does.
    if (server_) {
      const std::string query = PgContentQuery(pattern);
      if (query.empty()) return True();
      Text(query);
      return "(d.words @@ ?::text::tsquery)";
    }
    const std::string match = ContentMatch(EncodeName(pattern));
    if (match.empty()) {
      if (joined) join_.clear();
      return "1";
    }
    Text(match);
    return joined ? "fts_all MATCH ?"
                  : "d.rowid IN (SELECT rowid FROM fts_all WHERE fts_all MATCH ?)";
  }

  // A text member of the document, word by word as contents are: the word index finds the
  // documents that hold the words anywhere, and the member itself must hold each of them.
  std::string TextFieldMatch(const char* column, const std::string& pattern, bool joined) {
    std::string sql = ContentCondition(pattern, joined);
    size_t i = 0;
    while (i < pattern.size()) {
      const size_t start = pattern.find_first_not_of(" \t\n*", i);
      if (start == std::string::npos) break;
      i = pattern.find_first_of(" \t\n*", start);
      sql += server_ ? " AND COALESCE(" + Column(column, false) + " LIKE ?, FALSE)"
                     : std::string(" AND IFNULL(") + column + " LIKE ? ESCAPE '\\', 0)";
      Text("%" + LikeLiteral(pattern.substr(start, i - start)) + "%");
    }
    return "(" + sql + ")";
  }

  // A whole path with '*' wildcards, as the bytes are: no case is folded. The literal start
  // of the pattern is a range of the path index.
  std::string PathMatch(const std::string& pattern) {
    const std::string path = EncodeName(pattern);
    if (server_) {
      // The server keeps paths as their bytes.
      std::string sql = "(d.path LIKE ?";
      Text(LikeOfGlob(pattern));
      const std::string prefix = pattern.substr(0, pattern.find('*'));
      const std::optional<std::string> upper = PrefixUpperBound(prefix);
      if (!prefix.empty() && upper) {
        sql += " AND d.path >= ? AND d.path < ?";
        Text(prefix);
        Text(*upper);
      }
      return sql + ")";
    }
    std::string glob;
    for (char c : path) {
      if (c == '[' || c == '?') {
        glob += std::string("[") + c + "]";
      } else {
        glob += c;
      }
    }
    std::string sql = std::string("(") + kPathRef + " GLOB ?";
    Text(glob);
    const std::string prefix = path.substr(0, path.find('*'));
    const std::optional<std::string> upper = PrefixUpperBound(prefix);
    if (!prefix.empty() && upper) {
      sql += std::string(" AND ") + kPathRef + " >= ? AND " + kPathRef + " < ?";
      Text(prefix);
      Text(*upper);
    }
    return sql + ")";
  }

  std::string Range(const Json::Value& q) {
    const std::string field = q["range"].isString() ? q["range"].asString() : "";
    const char* const column = ColumnOf(kRangeFields, field);
    if (column == nullptr) {
      Refuse("unknown \"range\" field " + JsonToString(q["range"]) + " (" +
             NamesOf(kRangeFields) + ")");
    }
    std::string sql;
    for (const auto& [bound, cmp] : {std::pair<const char*, const char*>{"gte", " >= ?"},
                                     {"gt", " > ?"}, {"lte", " <= ?"}, {"lt", " < ?"}}) {
      const Json::Value& v = q[bound];
      if (v.isNull()) continue;
      if (!v.isNumeric()) Refuse(std::string("\"") + bound + "\" of a range must be a number");
      SqlValue n;
      if (v.isIntegral()) {
        n.kind = SqlValue::Kind::kInt;
        n.integer = v.asLargestInt();
      } else {
        n.kind = SqlValue::Kind::kReal;
        n.real = v.asDouble();
      }
      values_.push_back(n);
      sql += (sql.empty() ? "" : " AND ") + Column(column, true) + cmp;
    }
    if (sql.empty()) Refuse("a range needs \"gte\", \"gt\", \"lte\" or \"lt\"");
    if (server_) return "COALESCE(" + sql + ", FALSE)";
    // A document without the value is outside every range, and inside its negation.
    return "IFNULL(" + sql + ", 0)";
  }

  std::string ExtList(const std::vector<std::string>& exts) {
    std::string sql = "d.ext IN (";
    for (size_t i = 0; i < exts.size(); ++i) {
      sql += i == 0 ? "?" : ",?";
      Text(exts[i]);
    }
    return sql + ")";
  }

  std::string In(const Json::Value& q) {
    const std::string field = q["in"].isString() ? q["in"].asString() : "";
    if (field != "ext" && field != "kind") {
      Refuse("unknown \"in\" field " + JsonToString(q["in"]) + " (ext or kind)");
    }
    const Json::Value& values = q["values"];
    if (!values.isArray() || values.empty()) Refuse("\"values\" must be a non-empty array");
    std::vector<std::string> names;
    for (const Json::Value& v : values) {
      if (!v.isString()) Refuse("\"values\" must hold strings, not " + JsonToString(v));
      names.push_back(AsciiLower(v.asString()));
    }
    if (field == "ext") return ExtList(names);
    std::string sql = "(";
    for (const std::string& kind : names) {
      if (sql.size() > 1) sql += " OR ";
      if (kind == "folder") {
        sql += "d.is_dir = 1";
      } else if (kind == "other") {
        // The kind table is the one the crawl and the folders' switches decide by.
        std::vector<std::string> known;
        for (const auto& [ext, type] : fileindex::FileTypeTable()) {
          if (type != fileindex::kOther) known.push_back(ext);
        }
        for (const std::string& ext : fileindex::GetExtensionsOfType(fileindex::kDocument)) {
          if (ext.empty()) known.push_back(ext);
        }
        sql += "(d.is_dir = 0 AND NOT " + ExtList(known) + ")";
      } else {
        const fileindex::FileType type = fileindex::GetFileTypeBySetting(kind);
        if (type == fileindex::kOther) {
          Refuse("unknown kind \"" + kind + "\" (document, audio, video, photo, other or folder)");
        }
        sql += "(d.is_dir = 0 AND " + ExtList(fileindex::GetExtensionsOfType(type)) + ")";
      }
    }
    return sql + ")";
  }

  // The folder itself and everything below it. The path range uses the path index; the
  // ancestor test is what scopes, as in the search's own folder filter.
  std::string Under(const Json::Value& arg, bool required) {
    if (!arg.isString() || arg.asString().empty() || arg.asString()[0] != '/') {
      Refuse("\"under\" must be an absolute folder path");
    }
    std::string folder = arg.asString();
    while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
    if (required && folder_.empty()) folder_ = folder;
    const std::string under = folder == "/" ? "/" : folder + "/";
    const std::string upper = *PrefixUpperBound(under);
    for (const std::string& v : {folder, under, upper, folder, under, upper}) Text(v);
    const std::string path = kPathRef;
    const std::string anc = server_ ? "d.anc" : "d.ancestor";
    return "(" + path + " = ? OR (" + path + " >= ? AND " + path + " < ? AND (" + anc +
           " = ? OR (" + anc + " >= ? AND " + anc + " < ?))))";
  }

  std::string True() const { return server_ ? "TRUE" : "1"; }
  std::string Column(const char* column, bool number) const {
    return server_ ? ServerColumn(column, number) : std::string(column);
  }

  const bool by_folder_;
  const bool server_;
  int nodes_ = 0;
  std::vector<SqlValue> values_;
  std::string join_;
  std::string folder_;  // the first folder every hit must lie in
};

}  // namespace

std::string LikeLiteral(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '%' || c == '_' || c == '\\') out += '\\';
    out += c;
  }
  return out;
}

SqlCondition CompileQueryTree(const Json::Value& tree) {
  SqlCondition c = Compiler(false, false).Run(tree);
  if (!c.folder.empty() && !c.join.empty()) {
    c.by_folder = std::make_shared<const SqlCondition>(Compiler(true, false).Run(tree));
  }
  return c;
}

std::vector<Keyword> SplitKeywords(const std::string& keywords) {
  std::vector<Keyword> out;
  size_t i = 0;
  while (i < keywords.size()) {
    while (i < keywords.size() && std::isspace(static_cast<unsigned char>(keywords[i]))) ++i;
    size_t j = i;
    while (j < keywords.size() && !std::isspace(static_cast<unsigned char>(keywords[j]))) ++j;
    std::string word = keywords.substr(i, j - i);
    i = j;
    bool prefix = false;
    while (!word.empty() && word.back() == '*') {
      word.pop_back();
      prefix = true;
    }
    if (!word.empty()) out.push_back({std::move(word), prefix});
  }
  return out;
}

std::string PgLexeme(const std::string& word) {
  std::string out = "'";
  for (char c : word) {
    if (c == '\'' || c == '\\') out += c;
    out += c;
  }
  return out + "'";
}

std::string PgKeywordQuery(const std::string& keywords) {
  std::string out;
  for (const Keyword& k : SplitKeywords(EncodeName(keywords))) {
    const std::vector<std::string> words = FoldWords(k.text);
    if (words.empty()) continue;
    std::string phrase;
    for (size_t i = 0; i < words.size(); ++i) {
      if (i > 0) phrase += " <-> ";
      phrase += PgLexeme(words[i]);
      if (k.prefix && i + 1 == words.size()) phrase += ":*";
    }
    if (!out.empty()) out += " & ";
    out += words.size() > 1 ? "(" + phrase + ")" : phrase;
  }
  return out;
}

SqlCondition CompileQueryTreeForServer(const Json::Value& tree) {
  return Compiler(false, true).Run(tree);
}

std::string PgContentQuery(const std::string& pattern) {
  // Leading stars are dropped and a star ends its word as a prefix, as in the word index.
  std::string words;
  size_t i = 0;
  while (i < pattern.size()) {
    const size_t start = pattern.find_first_not_of(" \t\n*", i);
    if (start == std::string::npos) break;
    i = pattern.find_first_of(" \t\n", start);
    std::string word = pattern.substr(start, i == std::string::npos ? i : i - start);
    const size_t star = word.find('*');
    const bool prefix = star != std::string::npos;
    if (prefix) word.erase(star);
    words += (words.empty() ? "" : " ") + word + (prefix ? "*" : "");
  }
  return PgKeywordQuery(words);
}

SqlCondition NarrowToFolder(Db& db, const SqlCondition& c) {
  if (!c.by_folder) return c;
  const std::string under = c.folder == "/" ? "/" : c.folder + "/";
  Stmt span(db, "SELECT count(*), min(rowid), max(rowid) FROM"
                " (SELECT rowid FROM docs WHERE path >= ? AND path < ? LIMIT ?)");
  span.Bind(1, under).Bind(2, *PrefixUpperBound(under)).Bind(3, kFolderSpanRows);
  if (!span.Step() || span.Int(0) >= kFolderSpanRows) return c;
  SqlCondition narrowed = *c.by_folder;
  if (narrowed.join.empty()) return narrowed;
  SqlValue low, high;
  low.kind = high.kind = SqlValue::Kind::kInt;
  // An empty folder: a span no row id is in (row ids start at 1).
  low.integer = span.Int(0) == 0 ? 0 : span.Int(1);
  high.integer = span.Int(0) == 0 ? 0 : span.Int(2);
  // The folder itself may lie outside its rows' span.
  Stmt self(db, "SELECT rowid FROM docs WHERE path = ?");
  self.Bind(1, c.folder);
  if (self.Step()) {
    low.integer = span.Int(0) == 0 ? self.Int(0) : std::min(low.integer, self.Int(0));
    high.integer = std::max(high.integer, self.Int(0));
  }
  narrowed.sql = "(" + narrowed.sql + " AND " + narrowed.join + ".rowid BETWEEN ? AND ?)";
  narrowed.values.push_back(low);
  narrowed.values.push_back(high);
  return narrowed;
}

}  // namespace elasticd
}  // namespace orvane
