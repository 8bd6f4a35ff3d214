#include "common/name_codec.hpp"

#include <cstring>

namespace orvane {
namespace {

// The first byte at or after `p` that is not ASCII; most names have none, and this is the
// only look they get.
const char* FirstHighByte(const char* p, const char* end) {
  while (p != end && static_cast<unsigned char>(*p) < 0x80) ++p;
  return p;
}

// True when the four bytes at `p` are one of U+10FF80..U+10FFFF.
bool IsByteCodePoint(const char* p, const char* end) {
  return end - p >= 4 && static_cast<unsigned char>(p[0]) == 0xF4 &&
         static_cast<unsigned char>(p[1]) == 0x8F &&
         (static_cast<unsigned char>(p[2]) & 0xFE) == 0xBE &&
         (static_cast<unsigned char>(p[3]) & 0xC0) == 0x80;
}

const char kReplacement[] = "\xEF\xBF\xBD";  // U+FFFD

}  // namespace

bool IsValidUtf8(std::string_view text) {
  const char* const end = text.data() + text.size();
  for (const char* p = FirstHighByte(text.data(), end); p != end;) {
    const size_t n = Utf8SequenceLength(p, end);
    if (n == 0) return false;
    p += n;
  }
  return true;
}

void AppendEncodedName(const char* begin, const char* end, std::string* out) {
  const char* run = begin;
  for (const char* p = FirstHighByte(begin, end); p != end;) {
    if (static_cast<unsigned char>(*p) < 0x80) {
      ++p;
      continue;
    }
    const size_t n = PlainSequenceLength(p, end);
    if (n != 0) {
      p += n;
      continue;
    }
    out->append(run, p);
    AppendByteCodePoint(static_cast<unsigned char>(*p), out);
    run = ++p;
  }
  out->append(run, end);
}

std::string EncodeName(std::string_view raw) {
  std::string out;
  out.reserve(raw.size());
  AppendEncodedName(raw.data(), raw.data() + raw.size(), &out);
  return out;
}

bool NameNeedsEncoding(std::string_view raw) {
  const char* end = raw.data() + raw.size();
  for (const char* p = FirstHighByte(raw.data(), end); p != end;) {
    if (static_cast<unsigned char>(*p) < 0x80) {
      ++p;
      continue;
    }
    const size_t n = PlainSequenceLength(p, end);
    if (n == 0) return true;
    p += n;
  }
  return false;
}

bool DecodeByteCodePoints(std::string* text) {
  char* const begin = text->data();
  char* const end = begin + text->size();
  // F4 only ever leads a sequence, so a text without it has nothing to decode.
  char* p = static_cast<char*>(std::memchr(begin, '\xF4', text->size()));
  char* w = p;
  bool changed = false;
  while (p != nullptr && p != end) {
    if (IsByteCodePoint(p, end)) {
      *w++ = static_cast<char>(0x80 | (static_cast<unsigned char>(p[2]) & 1) << 6 |
                               (static_cast<unsigned char>(p[3]) & 0x3F));
      p += 4;
      changed = true;
    } else {
      *w++ = *p++;
    }
  }
  if (changed) text->resize(static_cast<size_t>(w - begin));
  return changed;
}

std::string DecodeName(std::string_view text) {
  std::string out(text);
  DecodeNameInPlace(&out);
  return out;
}

std::string DisplayName(std::string_view raw) {
  const char* const end = raw.data() + raw.size();
  std::string out;
  const char* run = raw.data();
  for (const char* p = FirstHighByte(raw.data(), end); p != end;) {
    const size_t n = Utf8SequenceLength(p, end);
    if (n != 0) {
      p += n;
      continue;
    }
    if (out.empty()) out.reserve(raw.size() + 8);
    out.append(run, p);
    out.append(kReplacement);
    run = ++p;
  }
  out.append(run, end);
  return out;
}

size_t DisplayLength(std::string_view raw) {
  const char* const end = raw.data() + raw.size();
  size_t chars = 0;
  for (const char* p = raw.data(); p != end; ++chars) {
    const size_t n = Utf8SequenceLength(p, end);
    p += n == 0 ? 1 : n;
  }
  return chars;
}

}  // namespace orvane
