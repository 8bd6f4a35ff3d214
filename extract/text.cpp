#include "extract/extractor.hpp"

namespace orvane {
namespace extract {

void ExtractText(const OpenedFile& file, Json::Value& fields) {
  // Read a little more than the cap: a conversion can shrink the text.
  const std::string raw = ReadPrefix(file, kMaxTextBytes + 4096);
  const std::string text = ToUtf8(raw, kMaxTextBytes);
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

}  // namespace extract
}  // namespace orvane
