// Names on disk are bytes; every JSON text the system writes is UTF-8. A byte that is not part
// of a well-formed UTF-8 sequence is written as the code point U+10FF00 + byte
// (U+10FF80..U+10FFFF, private use), and a real character of that range as the code points of
// its four bytes, so each name has one text and reads back to the same bytes. Strings inside
// the programs always hold the real bytes. Stateless; safe from any thread.
#ifndef ORVANE_COMMON_NAME_CODEC_HPP_
#define ORVANE_COMMON_NAME_CODEC_HPP_

#include <cstddef>
#include <cstring>
#include <string>
#include <string_view>

namespace orvane {

// The length of the well-formed UTF-8 sequence (no overlong forms, no surrogates, nothing past
// U+10FFFF) that starts at `p`, or 0 when none does. `p` < `end`.
inline size_t Utf8SequenceLength(const char* p, const char* end) {
  const auto at = [p](size_t i) { return static_cast<unsigned char>(p[i]); };
  const auto cont = [&at](size_t i) { return (at(i) & 0xC0) == 0x80; };
  const size_t avail = static_cast<size_t>(end - p);
  const unsigned char c = at(0);
  if (c < 0x80) return 1;
  if (c < 0xC2) return 0;  // a continuation byte, or the start of an overlong form
  if (c < 0xE0) return avail >= 2 && cont(1) ? 2 : 0;
  if (c < 0xF0) {
    if (avail < 3 || !cont(2)) return 0;
    // E0 needs A0.. (else overlong); ED stops at 9F (else a surrogate).
    const unsigned char lo = c == 0xE0 ? 0xA0 : 0x80;
    const unsigned char hi = c == 0xED ? 0x9F : 0xBF;
    return at(1) >= lo && at(1) <= hi ? 3 : 0;
  }
  if (c < 0xF5) {
    if (avail < 4 || !cont(2) || !cont(3)) return 0;
    // F0 needs 90.. (else overlong); F4 stops at 8F (else past U+10FFFF).
    const unsigned char lo = c == 0xF0 ? 0x90 : 0x80;
    const unsigned char hi = c == 0xF4 ? 0x8F : 0xBF;
    return at(1) >= lo && at(1) <= hi ? 4 : 0;
  }
  return 0;
}

// The length of the sequence at `p` that a text carries unchanged: a well-formed one outside
// U+10FF80..U+10FFFF; 0 when the byte at `p` is written as its own code point.
inline size_t PlainSequenceLength(const char* p, const char* end) {
  const size_t n = Utf8SequenceLength(p, end);
  // U+10FF80..U+10FFFF is F4 8F BE/BF xx: the written form of single bytes.
  if (n == 4 && static_cast<unsigned char>(p[0]) == 0xF4 &&
      static_cast<unsigned char>(p[1]) == 0x8F && static_cast<unsigned char>(p[2]) >= 0xBE) {
    return 0;
  }
  return n;
}

// True when `text` is well-formed UTF-8 throughout.
bool IsValidUtf8(std::string_view text);

// Appends U+10FF00 + `byte` (`byte` >= 0x80) in UTF-8.
inline void AppendByteCodePoint(unsigned char byte, std::string* out) {
  const char seq[4] = {'\xF4', '\x8F', byte < 0xC0 ? '\xBE' : '\xBF',
                       static_cast<char>(0x80 | (byte & 0x3F))};
  out->append(seq, 4);
}

// The text of the name `raw` (valid UTF-8), appended to `out`.
void AppendEncodedName(const char* begin, const char* end, std::string* out);
std::string EncodeName(std::string_view raw);
// True when EncodeName would change `raw`.
bool NameNeedsEncoding(std::string_view raw);

// The name a text stands for: each U+10FF80..U+10FFFF back to its byte. Anything else passes
// unchanged, bytes that are not UTF-8 included (texts written before names were encoded).
std::string DecodeName(std::string_view text);
// The same, in place; false when the text holds no such code point. Every string the JSON
// reader reads comes here, so the common case, no F4 lead byte at all, costs one memchr.
bool DecodeByteCodePoints(std::string* text);
inline bool DecodeNameInPlace(std::string* text) {
  return std::memchr(text->data(), '\xF4', text->size()) != nullptr && DecodeByteCodePoints(text);
}

// The name for people: each byte that is not part of a well-formed sequence becomes U+FFFD.
// Not reversible; never for anything but display.
std::string DisplayName(std::string_view raw);
// The characters DisplayName(raw) has, for lining up columns.
size_t DisplayLength(std::string_view raw);

}  // namespace orvane

#endif  // ORVANE_COMMON_NAME_CODEC_HPP_
