// Markup extraction: HTML and XHTML (the visible text, the title and the author, keywords and
// description of the meta tags), other XML (its text nodes) and EPUB books (their chapters in
// reading order and the package's title, creator and language). libxml2 parses, with no network
// and no entity expansion. Keeps nothing between files; safe from any thread.
#ifndef ORVANE_EXTRACT_HTML_HPP_
#define ORVANE_EXTRACT_HTML_HPP_

#include <json/json.h>

#include <string>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {

// Markup is read up to this many bytes; the text it yields is capped much lower anyway.
constexpr size_t kMaxMarkupBytes = 16 * 1024 * 1024;

// Adds the visible text of `html` to `sink` and its title and meta fields to `fields` (those
// already set are kept). `encoding` names the bytes' encoding when the caller knows it (nullptr:
// the document's own declaration, else UTF-8, else Latin-1).
void HtmlToText(const std::string& html, const char* encoding, TextSink* sink, Json::Value& fields);

void ExtractHtml(const OpenedFile& file, Json::Value& fields);
void ExtractXml(const OpenedFile& file, Json::Value& fields);
void ExtractEpub(const OpenedFile& file, Json::Value& fields);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_HTML_HPP_
