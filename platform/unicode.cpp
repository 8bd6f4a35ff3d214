#include "platform/unicode.hpp"

#include <locale.h>
#include <wctype.h>

#include <cstdint>

namespace orvane {
namespace platform {
namespace {

// Invalid bytes map above the last code point so that they sort after every character.
constexpr uint32_t kInvalidBase = 0x110000;

// Decodes one code point at `p`, advancing it; strict UTF-8 (no overlongs, no surrogates).
uint32_t Next(const unsigned char*& p) {
  const unsigned char c = p[0];
  if (c < 0x80) {
    ++p;
    return c;
  }
  int len = 0;
  uint32_t cp = 0;
  uint32_t min = 0;
  if ((c & 0xE0) == 0xC0) {
    len = 2, cp = c & 0x1F, min = 0x80;
  } else if ((c & 0xF0) == 0xE0) {
    len = 3, cp = c & 0x0F, min = 0x800;
  } else if ((c & 0xF8) == 0xF0) {
    len = 4, cp = c & 0x07, min = 0x10000;
  } else {
    ++p;
    return kInvalidBase + c;
  }
  for (int i = 1; i < len; ++i) {
    // A NUL ends the text, and is no continuation byte, so the loop never reads past it.
    if ((p[i] & 0xC0) != 0x80) {
      ++p;
      return kInvalidBase + c;
    }
    cp = (cp << 6) | (p[i] & 0x3F);
  }
  if (cp < min || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) {
    ++p;
    return kInvalidBase + c;
  }
  p += len;
  return cp;
}

locale_t Utf8Locale() {
  static const locale_t locale = [] {
    locale_t l = newlocale(LC_CTYPE_MASK, "C.UTF-8", static_cast<locale_t>(0));
    return l != static_cast<locale_t>(0) ? l : newlocale(LC_CTYPE_MASK, "C", nullptr);
  }();
  return locale;
}

uint32_t Fold(uint32_t cp) {
  if (cp < 0x80) return (cp >= 'A' && cp <= 'Z') ? cp + ('a' - 'A') : cp;
  if (cp >= kInvalidBase) return cp;
  return static_cast<uint32_t>(towlower_l(static_cast<wint_t>(cp), Utf8Locale()));
}

}  // namespace

int QLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b) {
  const auto* pa = reinterpret_cast<const unsigned char*>(a != nullptr ? a : "");
  const auto* pb = reinterpret_cast<const unsigned char*>(b != nullptr ? b : "");
  while (*pa != 0 && *pb != 0) {
    const uint32_t ca = Fold(Next(pa));
    const uint32_t cb = Fold(Next(pb));
    if (ca != cb) return ca < cb ? -1 : 1;
  }
  if (*pa == 0 && *pb == 0) return 0;
  return *pa == 0 ? -1 : 1;
}

}  // namespace platform
}  // namespace orvane
