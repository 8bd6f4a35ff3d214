#include "daemons/quixelasticd/json_writer.hpp"

namespace orvane {
namespace elasticd {

namespace {

void AppendQuoted(const char* begin, const char* end, std::string* out) {
  static const char kHex[] = "0123456789abcdef";
  out->push_back('"');
  // Runs of bytes that need no escape are copied at once; text goes out as UTF-8 unchanged.
  const char* run = begin;
  for (const char* p = begin; p != end; ++p) {
    const unsigned char c = static_cast<unsigned char>(*p);
    if (c >= 0x20 && c != '"' && c != '\\') continue;
    out->append(run, p);
    run = p + 1;
    switch (c) {
      case '"': out->append("\\\""); break;
      case '\\': out->append("\\\\"); break;
      case '\b': out->append("\\b"); break;
      case '\f': out->append("\\f"); break;
      case '\n': out->append("\\n"); break;
      case '\r': out->append("\\r"); break;
      case '\t': out->append("\\t"); break;
      default:
        out->append("\\u00");
        out->push_back(kHex[c >> 4]);
        out->push_back(kHex[c & 0xf]);
    }
  }
  out->append(run, end);
  out->push_back('"');
}

}  // namespace

void AppendCompactJson(const Json::Value& value, std::string* out) {
  switch (value.type()) {
    case Json::nullValue:
      out->append("null");
      break;
    case Json::intValue:
      out->append(std::to_string(value.asLargestInt()));
      break;
    case Json::uintValue:
      out->append(std::to_string(value.asLargestUInt()));
      break;
    case Json::realValue:
      // The library's own formatting keeps precision, NaN and infinities as before.
      out->append(Json::valueToString(value.asDouble()));
      break;
    case Json::booleanValue:
      out->append(value.asBool() ? "true" : "false");
      break;
    case Json::stringValue: {
      const char* begin = nullptr;
      const char* end = nullptr;
      if (value.getString(&begin, &end)) {
        AppendQuoted(begin, end, out);
      } else {
        out->append("\"\"");
      }
      break;
    }
    case Json::arrayValue: {
      out->push_back('[');
      const Json::ArrayIndex n = value.size();
      for (Json::ArrayIndex i = 0; i < n; ++i) {
        if (i > 0) out->push_back(',');
        AppendCompactJson(value[i], out);
      }
      out->push_back(']');
      break;
    }
    case Json::objectValue: {
      out->push_back('{');
      bool first = true;
      for (auto it = value.begin(); it != value.end(); ++it) {
        if (!first) out->push_back(',');
        first = false;
        const char* end = nullptr;
        const char* begin = it.memberName(&end);
        AppendQuoted(begin, end, out);
        out->push_back(':');
        AppendCompactJson(*it, out);
      }
      out->push_back('}');
      break;
    }
  }
}

std::string CompactJson(const Json::Value& value) {
  std::string out;
  AppendCompactJson(value, &out);
  return out;
}

}  // namespace elasticd
}  // namespace orvane
