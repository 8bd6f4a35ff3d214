// Typed access to members of JSON objects with one fixed set of failure texts, the recursive
// merge of partial updates, and the JSON conveniences the whole system uses (parse a text or a
// file, write a file atomically, one-line text). Stateless; safe from any thread.
#ifndef ORVANE_COMMON_JSON_UTIL_HPP_
#define ORVANE_COMMON_JSON_UTIL_HPP_

#include <json/json.h>

#include <string>
#include <vector>

#include "common/error.hpp"

namespace orvane {

// Every text written here is UTF-8 and every text read gives back the bytes it was written
// from: strings hold names as the disk has them, and a name that is not UTF-8 is written in
// the form common/name_codec.hpp describes. Use these helpers for every JSON text, never the
// library's own readers and writers.

// The compact one-line text of a value (on the wire, in stored documents and in failure texts),
// byte for byte what the library's compact writer produces for UTF-8 strings.
std::string JsonToString(const Json::Value& value);
// The same text, appended to `*out`.
void AppendJson(const Json::Value& value, std::string* out);
// The indented text of a value (files, output for scripts), without a final newline.
std::string JsonToStyledString(const Json::Value& value, const std::string& indentation);
// Parses a file people write: comments allowed, a repeated member name refused, and on
// failure false with the reader's description of where and why in `*errors`.
bool JsonParseChecked(const std::string& text, Json::Value* out, std::string* errors);

// A Json::Value with the three conveniences. It adds no data, so it converts both ways freely.
class JsonValue : public Json::Value {
 public:
  using Json::Value::Value;
  JsonValue() = default;
  JsonValue(const Json::Value& other) : Json::Value(other) {}  // NOLINT: implicit on purpose
  JsonValue& operator=(const Json::Value& other) {
    Json::Value::operator=(other);
    return *this;
  }

  // Parses one JSON text (the whole text; trailing garbage fails). False and null on failure.
  bool fromString(const std::string& text);
  bool fromString(const char* begin, const char* end);
  // Parses a whole file. False on a missing, unreadable or malformed file.
  bool fromFile(const std::string& path);
  // Writes the value, indented, to `path`: a temporary file beside it is written, synced and
  // renamed over it, so a crash or a full disk never leaves a truncated file. Missing parent
  // folders are created. False on failure, with the old file intact.
  bool toFile(const std::string& path) const;
  std::string toString() const { return JsonToString(*this); }
};

// Instantiated for std::string, bool, int, unsigned int, long long, double.
template <typename T>
bool isJsonType(const Json::Value& v);
template <typename T>
T asJsonType(const Json::Value& v);

template <>
inline bool isJsonType<std::string>(const Json::Value& v) {
  return v.isConvertibleTo(Json::stringValue);
}
template <>
inline bool isJsonType<bool>(const Json::Value& v) {
  return v.isConvertibleTo(Json::booleanValue);
}
template <>
inline bool isJsonType<int>(const Json::Value& v) {
  return v.isConvertibleTo(Json::intValue);
}
template <>
inline bool isJsonType<unsigned int>(const Json::Value& v) {
  return v.isConvertibleTo(Json::uintValue);
}
template <>
inline bool isJsonType<long long>(const Json::Value& v) {
  return v.type() == Json::intValue || v.type() == Json::uintValue;
}
template <>
inline bool isJsonType<double>(const Json::Value& v) {
  return v.isConvertibleTo(Json::realValue);
}

template <>
inline std::string asJsonType<std::string>(const Json::Value& v) {
  return v.asString();
}
template <>
inline bool asJsonType<bool>(const Json::Value& v) {
  return v.asBool();
}
template <>
inline int asJsonType<int>(const Json::Value& v) {
  return v.asInt();
}
template <>
inline unsigned int asJsonType<unsigned int>(const Json::Value& v) {
  return v.asUInt();
}
template <>
inline long long asJsonType<long long>(const Json::Value& v) {
  return v.asInt64();
}
template <>
inline double asJsonType<double>(const Json::Value& v) {
  return v.asDouble();
}

// ", data=" followed by the one-line text of `v`.
std::string AppendData(const Json::Value& v);

// Reads member `key` of `obj` into `out`. A missing member, or one of the wrong type, leaves
// `out` as it was unless `required`, in which case Error 120 is thrown. A non-object `obj`
// always throws Error 120. These errors are thrown without a log line.
template <typename T>
void GetJsonValue(T& out, const Json::Value& obj, const std::string& key, bool required) {
  if (!obj.isObject()) throw Error(kErrInvalidParam, "Not an object" + AppendData(obj));
  const Json::Value* member = obj.find(key.data(), key.data() + key.size());
  if (member == nullptr) {
    if (required) throw Error(kErrInvalidParam, "Missing property: " + key + AppendData(obj));
    return;
  }
  if (!isJsonType<T>(*member)) {
    // The same wording for every type, numeric and boolean ones included.
    if (required) throw Error(kErrInvalidParam, "Not a string" + AppendData(obj));
    return;
  }
  out = asJsonType<T>(*member);
}

template <>
inline void GetJsonValue<Json::Value>(Json::Value& out, const Json::Value& obj,
                                      const std::string& key, bool required) {
  if (!obj.isObject()) throw Error(kErrInvalidParam, "Not an object" + AppendData(obj));
  const Json::Value* member = obj.find(key.data(), key.data() + key.size());
  if (member == nullptr) {
    if (required) throw Error(kErrInvalidParam, "Missing property: " + key + AppendData(obj));
    return;
  }
  out = *member;
}

// Merges `changes` into `dst`: a null member deletes, an object descends, anything else
// (arrays included) replaces.
void JsonApplyChanges(Json::Value& dst, const Json::Value& changes);

template <typename T>
Json::Value Vec2JsonArr(const std::vector<T>& vec);
template <typename T>
std::vector<T> JsonArr2Vec(const Json::Value& arr);

template <>
Json::Value Vec2JsonArr<std::string>(const std::vector<std::string>& vec);
template <>
std::vector<std::string> JsonArr2Vec<std::string>(const Json::Value& arr);

}  // namespace orvane

#endif  // ORVANE_COMMON_JSON_UTIL_HPP_
