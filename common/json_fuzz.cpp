// Fuzz entry point for the strict JSON reader: every input is read by it and by the general
// library reader with the settings the system has always used. Aborts when they disagree on
// whether the text is JSON, or on the value read (types included), or when the reader's compact
// output of the value does not read back to the same value.
#include <json/json.h>

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include "common/json_util.hpp"

namespace {

bool LibraryParse(const char* begin, const char* end, Json::Value* out) {
  static const std::unique_ptr<Json::CharReader> reader = [] {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    builder["failIfExtra"] = true;
    return std::unique_ptr<Json::CharReader>(builder.newCharReader());
  }();
  try {
    return reader->parse(begin, end, out, nullptr);
  } catch (const std::exception&) {
    return false;
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const char* begin = reinterpret_cast<const char*>(data);
  Json::Value expected;
  const bool expected_ok = LibraryParse(begin, begin + size, &expected);
  orvane::JsonValue got;
  if (got.fromString(begin, begin + size) != expected_ok) std::abort();
  if (!expected_ok) return 0;
  const std::string text = orvane::JsonToString(got);
  if (!(got == expected) || text != orvane::JsonToString(expected)) std::abort();
  orvane::JsonValue back;
  if (!back.fromString(text) || !(back == got)) {
    // Non-finite reals have no JSON form; everything else must survive the round trip.
    if (text.find("Infinity") == std::string::npos && text.find("NaN") == std::string::npos) {
      std::abort();
    }
  }
  return 0;
}
