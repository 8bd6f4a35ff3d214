// A structured search query (a tree of and/or/not over name and content patterns, ranges,
// extension and kind lists, folder scopes), checked and turned into a SQL condition over the
// store's `docs d` table with every value a bound parameter. Pure functions; thread-safe.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_QUERY_TREE_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_QUERY_TREE_HPP_

#include <json/json.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace orvane {
namespace elasticd {

// A bound value, in the order of the condition's '?' marks.
struct SqlValue {
  enum class Kind { kText, kInt, kReal };
  Kind kind = Kind::kText;
  std::string text;
  int64_t integer = 0;
  double real = 0;
};

// A condition that is never NULL (so NOT inverts it exactly) and its bound values. One pattern
// every hit must match is read through `join`, a full-text table ("fts_name" or "fts_all", or
// none) the statement must join on the document's rowid: the search then runs from that
// table's matches and stops at its limit, instead of first collecting every match.
struct SqlCondition {
  std::string sql;
  std::vector<SqlValue> values;
  std::string join;
  // The folder every hit lies at or below, when the tree has one; empty otherwise.
  std::string folder;
  // With a folder and a joined pattern: the same condition for a small folder, its rows read
  // by the path index, names checked on each row, a joined content pattern kept.
  std::shared_ptr<const SqlCondition> by_folder;
};

// Limits of a tree: deeper or larger ones are refused before anything runs.
constexpr int kMaxQueryDepth = 32;
constexpr int kMaxQueryNodes = 256;

// Reads a query tree; throws EngineError(kCodeInvalidParam) with a message naming the fault
// (unknown operator or field, a value of the wrong type, too deep, too many nodes).
SqlCondition CompileQueryTree(const Json::Value& tree);

// The same tree for the PostgreSQL store's table `d`: its marks are '?' as well (the store
// numbers them), texts are compared as bytes or text as their column is, content patterns are
// word-vector queries and names are LIKE patterns over the folded names. Never joined.
SqlCondition CompileQueryTreeForServer(const Json::Value& tree);

// A content pattern as a word-vector query (see PgKeywordQuery); empty when it holds no word.
std::string PgContentQuery(const std::string& pattern);

// `text` as a LIKE pattern that matches it literally (backslash the escape).
std::string LikeLiteral(const std::string& text);

// The keywords of a search, split on white space; a keyword's trailing '*' makes it a prefix.
struct Keyword {
  std::string text;
  bool prefix;
};
std::vector<Keyword> SplitKeywords(const std::string& keywords);

// A lexeme quoted for the text form of a word vector or a word-vector query.
std::string PgLexeme(const std::string& word);

// A user's keywords as a word-vector query: each word folded and required, the words of one
// keyword as a phrase, a trailing '*' a prefix. Empty when no keyword holds a word.
std::string PgKeywordQuery(const std::string& keywords);

class Db;

// `c` as it is best run on `db`. A joined pattern is read from all of its matches, a common
// word's tens of thousands, though the folder the hits must lie in may hold a few hundred
// rows: when the folder is small, its rows are read instead (by_folder), and a joined content
// pattern is told the span of the folder's row ids, which it skips to. Costs one bounded read
// of the path index.
SqlCondition NarrowToFolder(Db& db, const SqlCondition& c);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_QUERY_TREE_HPP_
