// The requests a store answers: document queries of the library's forms and searches, with the
// page a search gives back. Plain values.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_SEARCH_PARAMS_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_SEARCH_PARAMS_HPP_

#include <json/json.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "daemons/quixelasticd/query_tree.hpp"

namespace orvane {
namespace elasticd {

// A document query of the library's forms: a whole value or a prefix of one field.
struct DocQuery {
  enum class Kind { kAll, kTerm, kPrefix };
  Kind kind = Kind::kAll;
  std::string field;
  std::string value;
  // Reads {"qsl": {"term"|"prefix": {field: value}}} or {"qsl": {"match_all": {}}};
  // throws EngineError(kCodeInvalidParam).
  static DocQuery Parse(const Json::Value& query);
};

struct SearchParams {
  enum class Sort { kRelevance, kName, kSize, kMtime };
  std::string keywords;
  std::string name;
  std::vector<std::string> exts;  // lower case
  std::optional<bool> is_dir;
  std::optional<int64_t> size_min, size_max, mtime_min, mtime_max;
  std::string folder;
  // A structured query, ANDed with the members above.
  std::optional<SqlCondition> query;
  // The same query rendered for the PostgreSQL store.
  std::optional<SqlCondition> server_query;
  Sort sort = Sort::kRelevance;
  bool desc = false;
  int64_t from = 0;
  int64_t size = 20;
  // Hits before this position of the page get no snippet (the caller drops them).
  int64_t snippet_from = 0;
};

struct SearchPage {
  int64_t total = 0;
  bool total_exact = true;
  std::vector<Json::Value> hits;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_SEARCH_PARAMS_HPP_
