// Text recognition in images with Tesseract, for folders whose photo switch is on (images reach
// the extraction helper only then). Tiny and huge images are skipped; recognition stops at a
// deadline below the helper's time limit. The languages come from $FILEINDEX_OCR_LANGUAGES
// ("eng+deu"; default "eng"). Keeps one loaded engine per process; safe from one thread at a time.
#ifndef ORVANE_EXTRACT_OCR_HPP_
#define ORVANE_EXTRACT_OCR_HPP_

#include <json/json.h>

#include <string>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {

// Images with a side shorter than this, or fewer pixels than kMinOcrPixels, are icons and
// rules, not pages: they are not read.
constexpr int kMinOcrSide = 24;
constexpr long kMinOcrPixels = 10000;
// Larger images would not fit the helper's memory once decoded.
constexpr long kMaxOcrPixels = 40L * 1000 * 1000;

// The languages recognition uses: $FILEINDEX_OCR_LANGUAGES when it is a valid list, else "eng".
std::string OcrLanguages();

// Adds the text recognised in the image to `fields` ("QUIXMDTextContent"); nothing when the
// image is skipped or the engine or its language data is not installed (logged once).
void AddOcrText(const OpenedFile& file, Json::Value& fields);

// An image's metadata and, for a file on disk (not a member of a container), the text recognised
// in it.
void ExtractImageWithText(const OpenedFile& file, Json::Value& fields);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_OCR_HPP_
