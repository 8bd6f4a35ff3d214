#include "common/name_codec.hpp"

#include <gtest/gtest.h>
#include <locale.h>
#include <uchar.h>

#include <set>
#include <vector>

#include "common/json_util.hpp"

namespace orvane {
namespace {

// Strict UTF-8 by the C library's decoder rather than ours (it lets U+110000.. through, so
// those are refused here).
bool IsStrictUtf8(const std::string& text) {
  static const locale_t utf8 = newlocale(LC_CTYPE_MASK, "C.UTF-8", static_cast<locale_t>(0));
  const locale_t old = uselocale(utf8);
  mbstate_t state{};
  bool ok = true;
  for (size_t i = 0; i < text.size() && ok;) {
    char32_t c = 0;
    const size_t n = mbrtoc32(&c, text.data() + i, text.size() - i, &state);
    ok = n != static_cast<size_t>(-1) && n != static_cast<size_t>(-2) && c <= 0x10FFFF;
    i += n == 0 ? 1 : n;
  }
  uselocale(old);
  return ok;
}

// U+10FF00 + b in UTF-8, written out independently of the codec.
std::string CodePointOf(unsigned char b) {
  const unsigned cp = 0x10FF00 + b;
  return {static_cast<char>(0xF0 | cp >> 18), static_cast<char>(0x80 | (cp >> 12 & 0x3F)),
          static_cast<char>(0x80 | (cp >> 6 & 0x3F)), static_cast<char>(0x80 | (cp & 0x3F))};
}

struct Case {
  const char* what;
  std::string raw;
  std::string text;  // its written form
};

// TheMappingIsOneToOne below checks every short name reads back; these pin the written form.
std::vector<Case> Cases() {
  const auto cp = CodePointOf;
  return {
      {"ASCII and valid 2 to 4 bytes", "/v/caf\xC3\xA9 \xE6\x97\xA5 \xF0\x9F\x98\x80",
       "/v/caf\xC3\xA9 \xE6\x97\xA5 \xF0\x9F\x98\x80"},
      {"Latin-1 name", "caf\xE9 na\xEFve.txt", "caf" + cp(0xE9) + " na" + cp(0xEF) + "ve.txt"},
      {"truncated 4-byte then valid", "\xF0\x9F\x98\xC3\xA9",
       cp(0xF0) + cp(0x9F) + cp(0x98) + "\xC3\xA9"},
      {"overlong NUL, surrogate, past U+10FFFF", "\xC0\x80\xED\xA0\x80\xF4\x90\x80\x80",
       cp(0xC0) + cp(0x80) + cp(0xED) + cp(0xA0) + cp(0x80) + cp(0xF4) + cp(0x90) + cp(0x80) +
           cp(0x80)},
      {"last characters before the range stay", "\xF4\x8F\xBD\xBF\xEF\xBF\xBD",
       "\xF4\x8F\xBD\xBF\xEF\xBF\xBD"},
      {"real U+10FF80 and U+10FFFF are written byte by byte", "\xF4\x8F\xBE\x80 \xF4\x8F\xBF\xBF",
       cp(0xF4) + cp(0x8F) + cp(0xBE) + cp(0x80) + " " + cp(0xF4) + cp(0x8F) + cp(0xBF) + cp(0xBF)},
  };
}

TEST(NameCodecTest, EveryKindOfNameHasOneTextThatReadsBack) {
  for (const Case& c : Cases()) {
    SCOPED_TRACE(c.what);
    const std::string text = EncodeName(c.raw);
    EXPECT_EQ(text, c.text);
    EXPECT_TRUE(IsStrictUtf8(text));
    EXPECT_EQ(NameNeedsEncoding(c.raw), c.raw != c.text);
    EXPECT_EQ(DecodeName(text), c.raw);

    // Through JSON both ways, as a value and as a member name, compact and indented; and a
    // text written by the library itself with the code point as a surrogate-pair escape.
    Json::Value v(Json::objectValue);
    v[c.raw] = c.raw;
    const std::string compact = JsonToString(v);
    const std::string styled = JsonToStyledString(v, "  ");
    EXPECT_TRUE(IsStrictUtf8(styled)) << styled;
    EXPECT_EQ(compact, "{\"" + c.text + "\":\"" + c.text + "\"}");
    for (const std::string& written : {compact, styled}) {
      JsonValue back;
      ASSERT_TRUE(back.fromString(written)) << written;
      EXPECT_EQ(back, v);
    }
  }
  JsonValue escaped;
  ASSERT_TRUE(escaped.fromString(R"({"p":"caf\udbff\udfe9 \u00e9","\udbff\udfff":1})"));
  EXPECT_EQ(escaped["p"].asString(), "caf\xE9 \xC3\xA9");
  EXPECT_TRUE(escaped.isMember("\xFF"));
}

// Texts from before names were encoded, or from people, may hold raw bytes: they read as they
// are. Stray pieces of the written form are left alone.
TEST(NameCodecTest, DecodingLeavesEverythingElseAsItIs) {
  for (const std::string& text :
       {std::string("caf\xE9"), std::string("\xF4\x8F\xBE"), std::string("\xF4\x8F\xBD\x80"),
        std::string("\xF4\x8F\xBE\xC0"), std::string("\x8F\xBE\x80")}) {
    EXPECT_EQ(DecodeName(text), text);
    JsonValue v;
    ASSERT_TRUE(v.fromString("[\"" + text + "\"]"));
    EXPECT_EQ(v[0].asString(), text);
  }
  std::string unchanged = "plain";
  EXPECT_FALSE(DecodeNameInPlace(&unchanged));
}

// Every name of one and two bytes, and every four-byte name over the bytes where the rules
// change, has its own text and reads back to itself; our validator agrees with the C library's.
TEST(NameCodecTest, TheMappingIsOneToOne) {
  std::vector<std::string> names;
  for (int a = 0; a < 256; ++a) {
    names.push_back(std::string(1, static_cast<char>(a)));
    for (int b = 0; b < 256; ++b) names.push_back({static_cast<char>(a), static_cast<char>(b)});
  }
  const unsigned char edges[] = {'a',  0x7F, 0x80, 0x8F, 0x90, 0x9F, 0xA0, 0xBD, 0xBE,
                                 0xBF, 0xC0, 0xC2, 0xE0, 0xED, 0xF0, 0xF4, 0xF5, 0xFF};
  for (unsigned char a : edges) {
    for (unsigned char b : edges) {
      for (unsigned char c : edges) {
        for (unsigned char d : edges) {
          names.push_back({static_cast<char>(a), static_cast<char>(b), static_cast<char>(c),
                           static_cast<char>(d)});
        }
      }
    }
  }
  std::set<std::string> texts;
  for (const std::string& name : names) {
    ASSERT_EQ(IsValidUtf8(name), IsStrictUtf8(name)) << testing::PrintToString(name);
    const std::string text = EncodeName(name);
    ASSERT_TRUE(IsStrictUtf8(text)) << testing::PrintToString(name);
    ASSERT_EQ(DecodeName(text), name) << testing::PrintToString(name);
    texts.insert(text);
  }
  EXPECT_EQ(texts.size(), std::set<std::string>(names.begin(), names.end()).size());
}

TEST(NameCodecTest, DisplayNamesReplaceEachUndecodableByte) {
  EXPECT_EQ(DisplayName("caf\xE9.txt"), "caf\xEF\xBF\xBD.txt");
  EXPECT_EQ(DisplayName("\xFF\xFE/\xE6\x97"), "\xEF\xBF\xBD\xEF\xBF\xBD/\xEF\xBF\xBD\xEF\xBF\xBD");
  EXPECT_EQ(DisplayName("caf\xC3\xA9 \xF4\x8F\xBF\xBF"), "caf\xC3\xA9 \xF4\x8F\xBF\xBF");
  EXPECT_EQ(DisplayLength("caf\xE9"), 4u);
  EXPECT_EQ(DisplayLength("caf\xC3\xA9\xF0\x9F\x98\x80"), 5u);
  EXPECT_EQ(DisplayLength("\xE6\x97"), 2u);
}

}  // namespace
}  // namespace orvane
