#include "common/json_util.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstring>
#include <cstdlib>
#include <memory>

#include "common/fd.hpp"
#include "common/name_codec.hpp"
#include "common/root.hpp"

namespace orvane {
namespace {

// The general reader, for whatever the fast one below leaves to it. It is costly to build and
// not thread-safe, so each thread keeps its own.
Json::CharReader& Reader() {
  thread_local std::unique_ptr<Json::CharReader> reader = [] {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    builder["failIfExtra"] = true;
    return std::unique_ptr<Json::CharReader>(builder.newCharReader());
  }();
  return *reader;
}

// Reads the strict JSON that the system itself writes (queue lines, requests, replies, stored
// documents) at about twice the general reader's speed. It gives up on anything it is not sure
// to read exactly as the general reader does (comments, lenient numbers, surrogate escapes,
// deep nesting, bad syntax), and the general reader then decides, so the two never differ.
class FastReader {
 public:
  FastReader(const char* begin, const char* end) : p_(begin), end_(end) {}

  bool Parse(Json::Value* out) {
    SkipSpace();
    if (!ReadValue(out, 0)) return false;
    SkipSpace();
    // The general reader takes a NUL byte for the end of the text.
    return p_ == end_ || *p_ == '\0';
  }

 private:
  static constexpr int kMaxDepth = 256;

  void SkipSpace() {
    while (p_ != end_ && (*p_ == ' ' || *p_ == '\n' || *p_ == '\r' || *p_ == '\t')) ++p_;
  }
  bool Consume(char c) {
    SkipSpace();
    if (p_ == end_ || *p_ != c) return false;
    ++p_;
    return true;
  }
  bool Literal(const char* word, size_t n) {
    if (static_cast<size_t>(end_ - p_) < n || std::memcmp(p_, word, n) != 0) return false;
    p_ += n;
    return true;
  }

  bool ReadValue(Json::Value* out, int depth) {
    if (p_ == end_ || depth > kMaxDepth) return false;
    switch (*p_) {
      case '{': return ReadObject(out, depth);
      case '[': return ReadArray(out, depth);
      case '"': {
        std::string s;
        if (!ReadString(&s)) return false;
        *out = Json::Value(s.data(), s.data() + s.size());
        return true;
      }
      case 't': *out = true; return Literal("true", 4);
      case 'f': *out = false; return Literal("false", 5);
      case 'n': *out = Json::Value(); return Literal("null", 4);
      default: return ReadNumber(out);
    }
  }

  bool ReadObject(Json::Value* out, int depth) {
    ++p_;
    *out = Json::Value(Json::objectValue);
    if (Consume('}')) return true;
    std::string key;
    do {
      SkipSpace();
      if (p_ == end_ || *p_ != '"' || !ReadString(&key) || !Consume(':')) return false;
      SkipSpace();
      Json::Value value;
      if (!ReadValue(&value, depth + 1)) return false;
      // A repeated name keeps its last value, as with the general reader.
      *out->demand(key.data(), key.data() + key.size()) = std::move(value);
    } while (Consume(','));
    return Consume('}');
  }

  bool ReadArray(Json::Value* out, int depth) {
    ++p_;
    *out = Json::Value(Json::arrayValue);
    if (Consume(']')) return true;
    do {
      SkipSpace();
      Json::Value value;
      if (!ReadValue(&value, depth + 1)) return false;
      out->append(std::move(value));
    } while (Consume(','));
    return Consume(']');
  }

  static int Hex(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
  }

  // Bytes other than the quote and the backslash pass unchanged, as with the general reader;
  // names written as code points are turned back into their bytes.
  bool ReadString(std::string* s) {
    ++p_;
    s->clear();
    for (;;) {
      const char* run = p_;
      while (p_ != end_ && *p_ != '"' && *p_ != '\\') ++p_;
      s->append(run, p_);
      if (p_ == end_) return false;
      if (*p_++ == '"') {
        DecodeNameInPlace(s);
        return true;
      }
      if (p_ == end_) return false;
      const char c = *p_++;
      switch (c) {
        case '"': case '\\': case '/': s->push_back(c); break;
        case 'b': s->push_back('\b'); break;
        case 'f': s->push_back('\f'); break;
        case 'n': s->push_back('\n'); break;
        case 'r': s->push_back('\r'); break;
        case 't': s->push_back('\t'); break;
        case 'u': {
          if (end_ - p_ < 4) return false;
          unsigned cp = 0;
          for (int i = 0; i < 4; ++i) {
            const int h = Hex(*p_++);
            if (h < 0) return false;
            cp = cp << 4 | static_cast<unsigned>(h);
          }
          if (cp >= 0xd800 && cp <= 0xdfff) return false;
          if (cp < 0x80) {
            s->push_back(static_cast<char>(cp));
          } else if (cp < 0x800) {
            s->push_back(static_cast<char>(0xc0 | cp >> 6));
            s->push_back(static_cast<char>(0x80 | (cp & 0x3f)));
          } else {
            s->push_back(static_cast<char>(0xe0 | cp >> 12));
            s->push_back(static_cast<char>(0x80 | (cp >> 6 & 0x3f)));
            s->push_back(static_cast<char>(0x80 | (cp & 0x3f)));
          }
          break;
        }
        default:
          return false;
      }
    }
  }

  static bool Digit(const char* p, const char* end) { return p != end && *p >= '0' && *p <= '9'; }

  // -?(0|[1-9][0-9]*)(.[0-9]+)?([eE][+-]?[0-9]+)? only; integers typed as the general reader
  // types them (signed when they fit, else unsigned), reals correctly rounded.
  bool ReadNumber(Json::Value* out) {
    const char* start = p_;
    const bool negative = p_ != end_ && *p_ == '-';
    if (negative) ++p_;
    if (!Digit(p_, end_)) return false;
    uint64_t magnitude = 0;
    bool overflow = false;
    if (*p_ == '0') {
      ++p_;
    } else {
      while (Digit(p_, end_)) {
        const unsigned d = static_cast<unsigned>(*p_++ - '0');
        overflow = overflow || magnitude > (UINT64_MAX - d) / 10;
        magnitude = magnitude * 10 + d;
      }
    }
    bool integral = true;
    if (p_ != end_ && *p_ == '.') {
      integral = false;
      ++p_;
      if (!Digit(p_, end_)) return false;
      while (Digit(p_, end_)) ++p_;
    }
    if (p_ != end_ && (*p_ == 'e' || *p_ == 'E')) {
      integral = false;
      ++p_;
      if (p_ != end_ && (*p_ == '+' || *p_ == '-')) ++p_;
      if (!Digit(p_, end_)) return false;
      while (Digit(p_, end_)) ++p_;
    }
    if (integral) {
      // Integers past 64 bits become reals in the general reader; it reads those itself.
      if (overflow) return false;
      if (!negative) {
        *out = magnitude <= static_cast<uint64_t>(INT64_MAX)
                   ? Json::Value(static_cast<Json::Int64>(magnitude))
                   : Json::Value(static_cast<Json::UInt64>(magnitude));
        return true;
      }
      if (magnitude > static_cast<uint64_t>(INT64_MAX) + 1) return false;
      *out = Json::Value(static_cast<Json::Int64>(0 - magnitude));
      return true;
    }
    double value = 0;
    const auto [ptr, ec] = std::from_chars(start, p_, value);
    // Out of range is left to the general reader, which has its own rules for it.
    if (ec != std::errc() || ptr != p_) return false;
    *out = value;
    return true;
  }

  const char* p_;
  const char* end_;
};

void AppendQuoted(const char* begin, const char* end, std::string* out) {
  static const char kHex[] = "0123456789abcdef";
  out->push_back('"');
  // Runs of bytes that need no escape are copied at once; well-formed UTF-8 goes out unchanged
  // and any other byte as its own code point, so the text is always UTF-8.
  const char* run = begin;
  for (const char* p = begin; p != end; ++p) {
    const unsigned char c = static_cast<unsigned char>(*p);
    if (c >= 0x20 && c < 0x80 && c != '"' && c != '\\') continue;
    if (c >= 0x80) {
      const size_t n = PlainSequenceLength(p, end);
      if (n != 0) {
        p += n - 1;
        continue;
      }
      out->append(run, p);
      run = p + 1;
      AppendByteCodePoint(c, out);
      continue;
    }
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

// True when some string or member name below `v` is not text as it stands.
bool NeedsEncoding(const Json::Value& v) {
  const char* begin = nullptr;
  const char* end = nullptr;
  switch (v.type()) {
    case Json::stringValue:
      return v.getString(&begin, &end) && NameNeedsEncoding(std::string_view(begin, end - begin));
    case Json::arrayValue:
      for (const Json::Value& e : v) {
        if (NeedsEncoding(e)) return true;
      }
      return false;
    case Json::objectValue:
      for (auto it = v.begin(); it != v.end(); ++it) {
        begin = it.memberName(&end);
        if (NameNeedsEncoding(std::string_view(begin, end - begin)) || NeedsEncoding(*it)) {
          return true;
        }
      }
      return false;
    default:
      return false;
  }
}

// A copy of `v` with every string and member name in its written form, for the library's
// writer, which would otherwise copy the bytes as they are.
Json::Value EncodedCopy(const Json::Value& v) {
  const char* begin = nullptr;
  const char* end = nullptr;
  switch (v.type()) {
    case Json::stringValue: {
      if (!v.getString(&begin, &end)) return v;
      const std::string text = EncodeName(std::string_view(begin, end - begin));
      return Json::Value(text.data(), text.data() + text.size());
    }
    case Json::arrayValue: {
      Json::Value out(Json::arrayValue);
      for (const Json::Value& e : v) out.append(EncodedCopy(e));
      return out;
    }
    case Json::objectValue: {
      Json::Value out(Json::objectValue);
      for (auto it = v.begin(); it != v.end(); ++it) {
        begin = it.memberName(&end);
        const std::string key = EncodeName(std::string_view(begin, end - begin));
        *out.demand(key.data(), key.data() + key.size()) = EncodedCopy(*it);
      }
      return out;
    }
    default:
      return v;
  }
}

// The general reader keeps strings as bytes; names written as code points become bytes again.
void DecodeStrings(Json::Value* v) {
  const char* begin = nullptr;
  const char* end = nullptr;
  const auto has_lead = [](const char* b, const char* e) {
    return std::memchr(b, '\xF4', static_cast<size_t>(e - b)) != nullptr;
  };
  switch (v->type()) {
    case Json::stringValue:
      if (v->getString(&begin, &end) && has_lead(begin, end)) {
        std::string s(begin, end);
        DecodeNameInPlace(&s);
        *v = Json::Value(s.data(), s.data() + s.size());
      }
      break;
    case Json::arrayValue:
      for (Json::Value& e : *v) DecodeStrings(&e);
      break;
    case Json::objectValue: {
      bool keys = false;
      for (auto it = v->begin(); it != v->end() && !keys; ++it) {
        begin = it.memberName(&end);
        keys = has_lead(begin, end);
      }
      if (!keys) {
        for (Json::Value& e : *v) DecodeStrings(&e);
        break;
      }
      Json::Value out(Json::objectValue);
      for (auto it = v->begin(); it != v->end(); ++it) {
        begin = it.memberName(&end);
        const std::string key = DecodeName(std::string_view(begin, end - begin));
        Json::Value& member = *out.demand(key.data(), key.data() + key.size());
        member = *it;
        DecodeStrings(&member);
      }
      v->swap(out);
      break;
    }
    default:
      break;
  }
}

bool WriteAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

void AppendJson(const Json::Value& value, std::string* out) {
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
      // The library's own formatting keeps precision, NaN and infinities as they always were.
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
        AppendJson(value[i], out);
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
        AppendJson(*it, out);
      }
      out->push_back('}');
      break;
    }
  }
}

std::string JsonToString(const Json::Value& value) {
  std::string out;
  AppendJson(value, &out);
  return out;
}

std::string JsonToStyledString(const Json::Value& value, const std::string& indentation) {
  Json::StreamWriterBuilder builder;
  builder["emitUTF8"] = true;
  builder["indentation"] = indentation;
  return Json::writeString(builder, NeedsEncoding(value) ? EncodedCopy(value) : value);
}

bool JsonParseChecked(const std::string& text, Json::Value* out, std::string* errors) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["rejectDupKeys"] = true;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value parsed;
  if (!reader->parse(text.data(), text.data() + text.size(), &parsed, errors)) return false;
  DecodeStrings(&parsed);
  out->swap(parsed);
  return true;
}

bool JsonValue::fromString(const std::string& text) {
  return fromString(text.data(), text.data() + text.size());
}

bool JsonValue::fromString(const char* begin, const char* end) {
  Json::Value parsed;
  bool ok = FastReader(begin, end).Parse(&parsed);
  if (!ok) {
    parsed = Json::Value();
    try {
      ok = Reader().parse(begin, end, &parsed, nullptr);
    } catch (const std::exception&) {
      // Nesting past the reader's stack limit is thrown rather than reported.
    }
    if (ok) DecodeStrings(&parsed);
  }
  if (!ok) {
    Json::Value::operator=(Json::Value());
    return false;
  }
  Json::Value::swap(parsed);
  return true;
}

bool JsonValue::fromFile(const std::string& path) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return false;
  std::string text;
  char buf[65536];
  for (;;) {
    ssize_t n = read(fd.get(), buf, sizeof(buf));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (n == 0) break;
    text.append(buf, static_cast<size_t>(n));
  }
  return fromString(text);
}

bool JsonValue::toFile(const std::string& path) const {
  const int saved_errno = errno;
  MakeParentDirs(path);
  std::string tmp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(tmp.data(), O_CLOEXEC));
  if (!fd.valid()) return false;
  const bool ok = WriteAll(fd.get(), JsonToStyledString(*this, "\t") + "\n") && fchmod(fd.get(), 0644) == 0 &&
                  fsync(fd.get()) == 0 && fd.Close() && rename(tmp.c_str(), path.c_str()) == 0;
  if (!ok) {
    const int failure = errno;
    unlink(tmp.c_str());
    errno = failure;
    return false;
  }
  // The rename is durable only once the folder itself is synced.
  const size_t slash = path.rfind('/');
  const std::string dir =
      slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
  UniqueFd dir_fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (dir_fd.valid()) fsync(dir_fd.get());
  errno = saved_errno;
  return true;
}

std::string AppendData(const Json::Value& v) { return ", data=" + JsonToString(v); }

void JsonApplyChanges(Json::Value& dst, const Json::Value& changes) {
  for (auto it = changes.begin(); it != changes.end(); ++it) {
    const std::string key = it.name();
    if (it->isNull()) {
      dst.removeMember(key);
    } else if (it->isObject()) {
      JsonApplyChanges(dst[key], *it);
    } else {
      dst[key] = *it;
    }
  }
}

template <>
Json::Value Vec2JsonArr<std::string>(const std::vector<std::string>& vec) {
  Json::Value arr(Json::arrayValue);
  for (const std::string& s : vec) arr.append(s);
  return arr;
}

template <>
std::vector<std::string> JsonArr2Vec<std::string>(const Json::Value& arr) {
  std::vector<std::string> out;
  for (const Json::Value& v : arr) {
    if (isJsonType<std::string>(v)) out.push_back(asJsonType<std::string>(v));
  }
  return out;
}

}  // namespace orvane
