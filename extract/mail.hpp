// E-mail extraction with GMime: a message file (.eml) gives its sender, recipients, subject and
// date as fields and its text (bodies decoded from their charsets, HTML bodies through the HTML
// extractor, attachments' names and the text of attachments of kinds we read); a mailbox (mbox)
// gives the headers and text of each of its messages. Keeps nothing between files; safe from one
// thread at a time (the library's set-up is process-wide).
#ifndef ORVANE_EXTRACT_MAIL_HPP_
#define ORVANE_EXTRACT_MAIL_HPP_

#include <json/json.h>

#include <string>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {

// At most this many parts of one file are looked at; the rest are skipped.
constexpr int kMaxMailParts = 1000;

void ExtractMessage(const OpenedFile& file, Json::Value& fields);
void ExtractMailbox(const OpenedFile& file, Json::Value& fields);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_MAIL_HPP_
