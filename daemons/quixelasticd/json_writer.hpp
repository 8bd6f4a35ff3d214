// Compact JSON text of a value, written straight into a string: the same text the common
// writer produces, without its stream and per-call setup, for the stored documents and the
// replies that the daemon writes by the thousand. Stateless and safe from any thread.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_JSON_WRITER_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_JSON_WRITER_HPP_

#include <json/json.h>

#include <string>

namespace orvane {
namespace elasticd {

void AppendCompactJson(const Json::Value& value, std::string* out);
std::string CompactJson(const Json::Value& value);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_JSON_WRITER_HPP_
