#include "daemons/quixelasticd/query_tree.hpp"

#include <cctype>
#include <set>

#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/schema.hpp"
#include "daemons/quixelasticd/store.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace elasticd {

namespace {

const char* const kOperators[] = {"and", "or", "not", "match", "range", "in", "under", "all"};

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

std::string EscapeLikeText(const std::string& s) {
  std::string out;
  for (char c : s) {
    if (c == '%' || c == '_' || c == '\\') out += '\\';
    out += c;
  }
  return out;
}

class Compiler {
 public:
  SqlCondition Run(const Json::Value& tree) {
    if (!tree.isObject()) Refuse("must be an object");
    SqlCondition c;
    c.sql = Node(tree, 1, true);
    c.values = std::move(values_);
    c.join = join_;
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
    if (op == "under") return Under(arg);
    if (!arg.isBool() || !arg.asBool()) Refuse("\"all\" must be true");
    return "1";
  }

  std::string Match(const Json::Value& q, bool required) {
    const std::string field = q["match"].isString() ? q["match"].asString() : "";
    if (field != "name" && field != "content" && field != "any") {
      Refuse("unknown \"match\" field " + JsonToString(q["match"]) + " (name, content or any)");
    }
    const Json::Value& pattern = q["pattern"];
    if (!pattern.isString() || pattern.asString().empty()) {
      Refuse("\"pattern\" of a match must be a non-empty string");
    }
    if (pattern.asString().find_first_not_of('*') == std::string::npos) return "1";
    // A full-text MATCH may not stand under OR or NOT: only a required pattern is joined.
    const bool joined = required && join_.empty() && field != "any";
    if (joined) join_ = field == "name" ? "fts_name" : "fts_all";
    if (field == "name") return NameMatch(pattern.asString(), joined);
    if (field == "content") return ContentCondition(pattern.asString(), joined);
    // Two statements: the values are bound in the order of the marks.
    std::string sql = "(" + NameMatch(pattern.asString(), false);
    sql += " OR " + ContentCondition(pattern.asString(), false);
    return sql + ")";
  }

  // Names match as a whole, with '*' standing for any run of characters. The trigram index
  // narrows the rows by every literal run of three characters or more; the LIKE then checks
  // the runs' order and the name's ends. Without such a run the names are scanned. A single
  // run between two '*' is a substring, which the trigram phrase alone answers exactly.
  std::string NameMatch(const std::string& pattern, bool joined) {
    const std::string low = EncodeName(AsciiLower(pattern));
    std::string match;
    std::string like;
    bool wild = false;  // the LIKE pattern ends in a '%' of a '*'
    size_t i = 0;
    while (true) {
      const size_t star = low.find('*', i);
      const std::string run =
          low.substr(i, star == std::string::npos ? std::string::npos : star - i);
      if (!run.empty()) wild = false;
      like += EscapeLikeText(run);
      if (DisplayLength(run) >= 3) match += (match.empty() ? "" : " AND ") + Quoted(run);
      if (star == std::string::npos) break;
      if (!wild) like += '%';
      wild = true;
      i = star + 1;
    }
    const bool substring = low.size() >= 2 && low.front() == '*' && low.back() == '*' &&
                           low.find('*', 1) == low.size() - 1 && !match.empty();
    std::string sql;
    if (!match.empty()) {
      sql += "fts_name MATCH ?";
      Text(match);
    }
    if (!substring) {
      sql += std::string(sql.empty() ? "" : " AND ") + "fts_name.name LIKE ? ESCAPE '\\'";
      Text(like);
    }
    return joined ? "(" + sql + ")" : "d.rowid IN (SELECT rowid FROM fts_name WHERE " + sql + ")";
  }

  std::string ContentCondition(const std::string& pattern, bool joined) {
    // The word index holds the written form of names, as the catch-all text does.
    const std::string match = ContentMatch(EncodeName(pattern));
    if (match.empty()) {
      if (joined) join_.clear();
      return "1";
    }
    Text(match);
    return joined ? "fts_all MATCH ?"
                  : "d.rowid IN (SELECT rowid FROM fts_all WHERE fts_all MATCH ?)";
  }

  std::string Range(const Json::Value& q) {
    const std::string field = q["range"].isString() ? q["range"].asString() : "";
    std::string column;
    if (field == "size") {
      column = "d.size";
    } else if (field == "mtime") {
      column = "d.mtime";
    } else if (field == "ctime") {
      column = "json_extract(d.body, '$.QUIXMDAttributeChangeDate')";
    } else if (field == "crtime") {
      column = "json_extract(d.body, '$.QUIXMDFSCreationDate')";
    } else {
      Refuse("unknown \"range\" field " + JsonToString(q["range"]) +
             " (size, mtime, ctime or crtime)");
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
      sql += (sql.empty() ? "" : " AND ") + column + cmp;
    }
    if (sql.empty()) Refuse("a range needs \"gte\", \"gt\", \"lte\" or \"lt\"");
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
  std::string Under(const Json::Value& arg) {
    if (!arg.isString() || arg.asString().empty() || arg.asString()[0] != '/') {
      Refuse("\"under\" must be an absolute folder path");
    }
    std::string folder = arg.asString();
    while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
    const std::string under = folder == "/" ? "/" : folder + "/";
    const std::string upper = *PrefixUpperBound(under);
    for (const std::string& v : {folder, under, upper, folder, under, upper}) Text(v);
    return "(d.path = ? OR (d.path >= ? AND d.path < ? AND (d.ancestor = ? OR"
           " (d.ancestor >= ? AND d.ancestor < ?))))";
  }

  int nodes_ = 0;
  std::vector<SqlValue> values_;
  std::string join_;
};

}  // namespace

SqlCondition CompileQueryTree(const Json::Value& tree) { return Compiler().Run(tree); }

}  // namespace elasticd
}  // namespace orvane
