#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <random>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace {

// Queue text that is mostly well-formed, over a small set of paths so that events meet on the
// same nodes, with malformed lines mixed in.
std::string RandomQueue(std::mt19937& rng) {
  static const char* const kNames[] = {"a", "b", "c", "d", "\xc3\xa9", ".", ".."};
  static const uint32_t kBits[] = {0x2,     0x4,     0x8,    0x40, 0x80, 0x100, 0x200,
                                   0x10000, 0x20000, 0x1000, 0x42, 0x84, 0x144};
  static const char* const kBroken[] = {"",
                                        "{",
                                        "[]",
                                        "{\"event\":2}",
                                        "{\"path\":\"/a\"}",
                                        "{\"event\":-4,\"path\":\"/a\"}",
                                        "\xff\xfe\x00",
                                        "{\"event\":2,\"path\":\"a//b\"}"};
  auto pick = [&rng](size_t n) { return static_cast<size_t>(rng() % n); };
  auto path = [&]() {
    std::string p;
    const size_t depth = 1 + pick(4);
    for (size_t i = 0; i < depth; ++i) p += std::string("/") + kNames[pick(std::size(kNames))];
    if (pick(40) == 0) p += "/";
    return p;
  };
  std::string text;
  const size_t lines = 1 + pick(24);
  for (size_t i = 0; i < lines; ++i) {
    if (pick(12) == 0) {
      text += kBroken[pick(std::size(kBroken))];
    } else {
      uint32_t bits = kBits[pick(std::size(kBits))];
      if (pick(6) == 0) bits |= kBits[pick(std::size(kBits))];
      if (bits & 0x200 && pick(4) != 0) bits &= ~0x200u;
      text += "{\"event\":" + std::to_string(bits) + ",\"path\":\"" + path() + "\"";
      if (pick(2)) text += std::string(",\"is_dir\":") + (pick(2) ? "true" : "false");
      if (bits & 0x100 || pick(10) == 0) text += ",\"path_old\":\"" + path() + "\"";
      if (bits & 0x20000 || pick(10) == 0) {
        text += pick(5) == 0 ? ",\"data\":7" : ",\"data\":{\"photo\":true,\"audio\":false}";
      }
      text += "}";
    }
    text += "\n";
  }
  return text;
}

TEST(OPTreeFuzzTest, SeededRandomQueuesKeepTheTreeConsistent) {
  // The libFuzzer target runs the same entry point for as long as one likes; this is the short
  // run that every test pass makes, and FILEINDEX_FUZZ_RUNS asks for a longer one.
  const char* runs_env = std::getenv("FILEINDEX_FUZZ_RUNS");
  const long runs = runs_env != nullptr ? std::atol(runs_env) : 20000;
  std::mt19937 rng(20261122);
  for (long i = 0; i < runs; ++i) {
    const std::string text = RandomQueue(rng);
    LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(text.data()), text.size());
  }
}

}  // namespace
