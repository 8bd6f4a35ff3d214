#include <poppler-document.h>
#include <poppler-global.h>
#include <poppler-page.h>

#include <memory>
#include <vector>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {
namespace {

void QuietPoppler(const std::string&, void*) {}

std::string Utf8(const poppler::ustring& s) {
  const std::vector<char> bytes = s.to_utf8();
  return std::string(bytes.begin(), bytes.end());
}


}  // namespace

void ExtractPdf(const OpenedFile& file, Json::Value& fields) {
  poppler::set_debug_error_function(QuietPoppler, nullptr);
  std::unique_ptr<poppler::document> doc(poppler::document::load_from_file(file.proc_path()));
  if (!doc) Fail("not a readable PDF");
  if (doc->is_encrypted()) fields["QUIXMDIsEncrypted"] = true;
  if (doc->is_locked()) return;
  SetText(fields, "QUIXMDTitle", Utf8(doc->info_key("Title")));
  SetText(fields, "QUIXMDAuthors", Utf8(doc->info_key("Author")));
  SetText(fields, "QUIXMDDescription", Utf8(doc->info_key("Subject")));
  SetText(fields, "QUIXMDKeywords", Utf8(doc->info_key("Keywords")));
  SetText(fields, "QUIXMDCreator", Utf8(doc->info_key("Creator")));
  const time_t created = doc->info_date_t("CreationDate");
  if (created > 0) fields["QUIXMDContentCreationDate"] = static_cast<Json::Int64>(created);
  TextSink sink(kMaxTextBytes);
  for (int i = 0; i < doc->pages() && !sink.full(); ++i) {
    std::unique_ptr<poppler::page> page(doc->create_page(i));
    if (page) {
      sink.Add(Utf8(page->text()));
      sink.Break();
    }
  }
  const std::string text = sink.Take();
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

}  // namespace extract
}  // namespace orvane
