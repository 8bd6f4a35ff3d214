// The request channel to the search-engine daemon: one JSON request and one JSON reply per
// connection over its Unix-domain socket, every failure turned into an Error, and the retry
// policy that waits out a daemon that is not ready or busy. No state between calls; any number
// of threads may send at once, each on its own connection.
#ifndef ORVANE_COMMON_COMM_HPP_
#define ORVANE_COMMON_COMM_HPP_

#include <json/json.h>

#include "common/wire.hpp"

namespace orvane {

// One exchange. On return `res` holds the whole reply, whose "success" is true. Throws Error 913
// when the exchange breaks or the reply is malformed, and the daemon's own code when it reports
// a failure; a failed part of a compound request is only logged, unless the daemon was busy.
void SendRequestImpl(Json::Value& res, const Json::Value& req);

namespace fileindex {
namespace elastic {

// SendRequestImpl, repeated while the daemon answers that its database is not ready (every 30 s)
// or that it is busy (every 15 to 19 minutes, with a desktop notification on the eleventh busy
// answer). There is no overall limit: the indexing worker must not drop operations. Internal to
// the search-index binding.
void SendRequest(Json::Value& res, const Json::Value& req);
// The same, for commands whose reply only needs to say success.
void SendRequest(const Json::Value& req);

}  // namespace elastic
}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_COMMON_COMM_HPP_
