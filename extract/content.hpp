// Content and metadata extraction for one file: text in any common encoding, PDF text and
// properties, office documents (OOXML and OpenDocument), audio tags and properties, photo EXIF
// data and video technical data, as document fields named like the index schema ("QUIXMD...").
// Runs the format libraries in-process, so callers that must survive hostile files run it in
// the helper process (fileindex-extract). Keeps nothing between files but each thread's loaded
// file-type database; safe from any thread.
#ifndef ORVANE_EXTRACT_CONTENT_HPP_
#define ORVANE_EXTRACT_CONTENT_HPP_

#include <json/json.h>

#include <string>

namespace orvane {
namespace extract {

// Extracted text is cut at this many bytes (at a character boundary).
// The longest changelogs and manuals people search hold a few MiB of text, all of it wanted.
constexpr size_t kMaxTextBytes = 8 * 1024 * 1024;

// No single member of a container (an office zip, an archive, a compressed file) is read past
// this, whatever it claims to hold; the helper may write in-memory files of at most this size.
constexpr size_t kMaxMemberBytes = 64 * 1024 * 1024;

// The MIME type libmagic sees in the file's contents ("" when it cannot tell).
std::string MimeType(const std::string& path);

// The fields extracted from the file at `path`; an object with no members when its kind holds
// nothing to extract. Throws std::runtime_error when the file cannot be read or is malformed.
Json::Value ExtractContent(const std::string& path);

// `text` as UTF-8: converted from the encoding detected in it, invalid sequences dropped, cut at
// `max_bytes` without splitting a character.
std::string ToUtf8(const std::string& text, size_t max_bytes);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_CONTENT_HPP_
