#include "daemons/quixelasticd/request_args.hpp"

#include <cstring>

#include "daemons/quixelasticd/engine_error.hpp"

namespace orvane {
namespace elasticd {

std::string RequireString(const Json::Value& data, const char* key) {
  const Json::Value* v = data.isObject() ? data.find(key, key + std::strlen(key)) : nullptr;
  if (v == nullptr || !v->isString() || v->asString().empty()) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" must be a non-empty string");
  }
  return v->asString();
}

std::string NormalizeDir(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

std::string RequirePath(const Json::Value& data, const char* key) {
  const std::string path = NormalizeDir(RequireString(data, key));
  if (path[0] != '/') throw EngineError(kCodeInvalidParam, std::string("\"") + key +
                                                               "\" must be an absolute path");
  if (path.find('\0') != std::string::npos) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key + "\" holds a NUL");
  }
  return path;
}

int64_t OptionalInt(const Json::Value& obj, const char* key, int64_t fallback) {
  const Json::Value* v = obj.isObject() ? obj.find(key, key + std::strlen(key)) : nullptr;
  if (v == nullptr || v->isNull()) return fallback;
  if (!v->isIntegral() || v->asLargestInt() < 0) {
    throw EngineError(kCodeInvalidParam, std::string("\"") + key +
                                             "\" must be a non-negative integer");
  }
  return v->asLargestInt();
}

}  // namespace elasticd
}  // namespace orvane
