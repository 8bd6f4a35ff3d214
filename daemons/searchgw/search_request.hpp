// What the gateway makes of an HTTP search: the JSON body read into the engine's query tree and
// page, and the engine's answer shaped into the reply the HTTP client reads. Pure functions of
// their arguments; any thread.
#ifndef ORVANE_DAEMONS_SEARCHGW_SEARCH_REQUEST_HPP_
#define ORVANE_DAEMONS_SEARCHGW_SEARCH_REQUEST_HPP_

#include <json/json.h>

#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include "daemons/searchgw/query_string.hpp"

namespace orvane {
namespace searchgw {

// The largest page one request may ask for (the engine's own bound).
constexpr int64_t kMaxPageSize = 1000;
// The reply body never grows past this; hits that would not fit are left off the page.
constexpr size_t kMaxReplyBytes = 400 * 1024;

// A request the gateway refuses: `type` names the kind of failure for the client
// ("parsing_exception", "index_not_found_exception", ...), what() says what to change.
class RequestError : public std::runtime_error {
 public:
  RequestError(std::string type, const std::string& reason)
      : std::runtime_error(reason), type_(std::move(type)) {}
  const std::string& type() const { return type_; }

 private:
  std::string type_;
};

struct SearchRequest {
  Json::Value query;  // the engine's query tree
  int64_t from = 0;
  int64_t size = 10;
  // The folder the query is confined to (a folder node ANDed at its top), as the engine spells
  // paths; empty when there is none. The folder itself is never a hit: clients search inside it.
  std::string scope;
};

// The body of a `_search` request: {"from", "size", "query"} where the query is a
// {"query_string": {"query": text}}, a {"bool": {"must", "filter", "should", "must_not"}} of
// queries, a {"prefix": {field: value}} or {"match_all": {}}. Throws RequestError.
SearchRequest ReadSearchBody(const std::string& body);

// The engine's tree for a parsed query string. Fields are the gateway's own names (the ones the
// Spotlight mappings file shipped beside it uses); bare terms search any of `fields`, or names
// and contents when it is empty. Throws RequestError for an unknown field or a value the field
// cannot take.
Json::Value TranslateQuery(const QueryNode& node, const std::vector<std::string>& fields = {});

// Seconds since the epoch of an ISO-8601 UTC time ("2024-05-01", "2024-05-01T10:20:30Z",
// fractions and "+00:00" accepted) or of a plain number of seconds; false otherwise.
bool ParseUtcTime(const std::string& text, int64_t* seconds);

// The index ids the URL's index part names: empty for "_all" (every index), else each id of a
// comma list, each checked to be one of the system's. Throws RequestError.
std::vector<std::string> ReadIndexList(const std::string& part);

// The reply body for the engine's search answer {"total", "hits": [{"path"}, ...]}: at most
// kMaxReplyBytes.
std::string BuildSearchReply(const Json::Value& engine_data);

// An error body in the shape search clients expect, for `status`.
std::string BuildErrorBody(const std::string& type, const std::string& reason, int status);

}  // namespace searchgw
}  // namespace orvane

#endif  // ORVANE_DAEMONS_SEARCHGW_SEARCH_REQUEST_HPP_
