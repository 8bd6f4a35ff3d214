// The query-string language of search requests: AND, OR, NOT and parentheses, `field:term` with
// `*` wildcards, `field:(a b)`, ranges `[a TO b]` / `{a TO *}`, quoted phrases and backslash
// escapes. Parsing gives a tree of plain values; nothing is shared, any thread may parse.
#ifndef ORVANE_DAEMONS_SEARCHGW_QUERY_STRING_HPP_
#define ORVANE_DAEMONS_SEARCHGW_QUERY_STRING_HPP_

#include <stdexcept>
#include <string>
#include <vector>

namespace orvane {
namespace searchgw {

// A query that does not follow the grammar; what() says where and what was expected.
class QuerySyntaxError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

struct QueryNode {
  enum Kind { kAnd, kOr, kNot, kTerm, kPhrase, kRange };
  Kind kind = kTerm;
  // kTerm, kPhrase, kRange: the field as written, escapes resolved; empty for a bare term.
  std::string field;
  // kTerm: the text with escapes resolved, `*` kept as the wildcard; kPhrase: the quoted text.
  std::string text;
  // kRange: the bounds as written ("*" is open) and whether each is included.
  std::string low, high;
  bool low_included = true, high_included = true;
  // kAnd, kOr: two or more; kNot: one.
  std::vector<QueryNode> children;
};

// Parses `text`. Terms side by side without an operator are OR'ed, as `field:(a b)` is; AND
// binds tighter than OR, NOT tighter than both. Throws QuerySyntaxError.
QueryNode ParseQueryString(const std::string& text);

}  // namespace searchgw
}  // namespace orvane

#endif  // ORVANE_DAEMONS_SEARCHGW_QUERY_STRING_HPP_
