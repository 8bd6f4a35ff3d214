// Reading the arguments of a request's "data" object: each reader throws EngineError
// (invalid parameter) with a message naming the key when the value is missing or of the wrong
// kind. Stateless; safe from any thread.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_REQUEST_ARGS_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_REQUEST_ARGS_HPP_

#include <json/json.h>

#include <cstdint>
#include <string>

namespace orvane {
namespace elasticd {

// The value of `key`, which must be a non-empty string.
std::string RequireString(const Json::Value& data, const char* key);
// `path` without trailing slashes (the root stays "/").
std::string NormalizeDir(std::string path);
// The value of `key`, which must be an absolute path without NULs; trailing slashes dropped.
std::string RequirePath(const Json::Value& data, const char* key);
// The value of `key` when present and not null, which must be a non-negative integer.
int64_t OptionalInt(const Json::Value& obj, const char* key, int64_t fallback);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_REQUEST_ARGS_HPP_
