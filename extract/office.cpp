#include <archive.h>
#include <archive_entry.h>
#include <libxml/xmlreader.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <vector>

#include "common/util.hpp"
#include "extract/extractor.hpp"

namespace orvane {
namespace extract {

void ForEachZipMember(const OpenedFile& file, size_t max_bytes,
                      const std::function<bool(const std::string&)>& want,
                      const std::function<bool(const std::string&, std::string&)>& visit) {
  std::unique_ptr<struct archive, int (*)(struct archive*)> zip(archive_read_new(),
                                                                archive_read_free);
  archive_read_support_format_zip(zip.get());
  if (lseek(file.fd(), 0, SEEK_SET) != 0 ||
      archive_read_open_fd(zip.get(), file.fd(), 65536) != ARCHIVE_OK) {
    Fail(std::string("not a readable zip: ") + archive_error_string(zip.get()));
  }
  struct archive_entry* entry;
  while (archive_read_next_header(zip.get(), &entry) == ARCHIVE_OK) {
    const char* name = archive_entry_pathname(entry);
    if (name == nullptr || !want(name)) continue;
    std::string data;
    char buf[65536];
    for (;;) {
      const la_ssize_t n = archive_read_data(zip.get(), buf, sizeof(buf));
      if (n < 0) Fail(std::string("damaged zip member: ") + name);
      if (n == 0 || data.size() >= max_bytes) break;
      data.append(buf, std::min(static_cast<size_t>(n), max_bytes - data.size()));
    }
    if (!visit(name, data)) return;
  }
}

std::map<std::string, std::string> ReadZipMembers(const OpenedFile& file,
                                                  bool (*want)(const std::string&)) {
  std::map<std::string, std::string> members;
  ForEachZipMember(file, kMaxMemberBytes, want,
                   [&members](const std::string& name, std::string& data) {
                     members[name] = std::move(data);
                     return true;
                   });
  return members;
}

namespace {

// Paragraph-like elements end a line; runs of text inside one are joined as they stand.
bool EndsLine(const xmlChar* local_name) {
  static const char* const kNames[] = {"p", "h", "br", "tab", "si", "tr", "line-break"};
  for (const char* n : kNames) {
    if (xmlStrEqual(local_name, reinterpret_cast<const xmlChar*>(n))) return true;
  }
  return false;
}

}  // namespace

void WalkXml(const std::string& xml, TextSink* sink,
             const std::map<std::string, std::string>& props, Json::Value& fields) {
  // No network, no entity expansion: a document cannot make the parser fetch or balloon.
  std::unique_ptr<xmlTextReader, void (*)(xmlTextReaderPtr)> reader(
      xmlReaderForMemory(xml.data(), static_cast<int>(xml.size()), nullptr, nullptr,
                         XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING),
      xmlFreeTextReader);
  if (!reader) return;
  std::string current_prop;
  std::string prop_text;
  while (xmlTextReaderRead(reader.get()) == 1) {
    const int type = xmlTextReaderNodeType(reader.get());
    const xmlChar* local = xmlTextReaderConstLocalName(reader.get());
    if (type == XML_READER_TYPE_ELEMENT) {
      auto it = props.find(reinterpret_cast<const char*>(local));
      if (it != props.end()) {
        current_prop = it->second;
        prop_text.clear();
      }
      if (sink != nullptr && EndsLine(local) && xmlTextReaderIsEmptyElement(reader.get())) {
        sink->Break();
      }
    } else if (type == XML_READER_TYPE_END_ELEMENT) {
      if (!current_prop.empty() && props.count(reinterpret_cast<const char*>(local)) != 0) {
        if (!fields.isMember(current_prop)) SetText(fields, current_prop, prop_text);
        current_prop.clear();
      }
      if (sink != nullptr && EndsLine(local)) sink->Break();
    } else if (type == XML_READER_TYPE_TEXT || type == XML_READER_TYPE_CDATA ||
               type == XML_READER_TYPE_SIGNIFICANT_WHITESPACE) {
      const xmlChar* value = xmlTextReaderConstValue(reader.get());
      if (value == nullptr) continue;
      const std::string text = reinterpret_cast<const char*>(value);
      if (!current_prop.empty()) prop_text += text;
      if (sink != nullptr) sink->Add(text);
    }
    if (sink != nullptr && sink->full() && current_prop.empty()) break;
  }
}

namespace {

bool IsOoxmlMember(const std::string& name) {
  return name == "word/document.xml" || name == "xl/sharedStrings.xml" ||
         name == "docProps/core.xml" ||
         (StringStartWith(name, "ppt/slides/slide") && GetFileExtension(name, false) == "xml");
}

bool IsOdfMember(const std::string& name) { return name == "content.xml" || name == "meta.xml"; }

// Slides in their own order: slide2 before slide10.
bool SlideOrder(const std::string& a, const std::string& b) {
  return a.size() != b.size() ? a.size() < b.size() : a < b;
}

void ExtractOffice(const OpenedFile& file, bool odf, Json::Value& fields) {
  const auto members = ReadZipMembers(file, odf ? IsOdfMember : IsOoxmlMember);
  const std::map<std::string, std::string> props = {{"title", "QUIXMDTitle"},
                                                    {"creator", "QUIXMDAuthors"},
                                                    {"initial-creator", "QUIXMDAuthors"},
                                                    {"keywords", "QUIXMDKeywords"},
                                                    {"keyword", "QUIXMDKeywords"},
                                                    {"description", "QUIXMDDescription"},
                                                    {"subject", "QUIXMDDescription"}};
  const std::string meta = odf ? "meta.xml" : "docProps/core.xml";
  if (members.count(meta) != 0) WalkXml(members.at(meta), nullptr, props, fields);
  std::vector<std::string> bodies;
  for (const auto& [name, data] : members) {
    if (name != meta) bodies.push_back(name);
  }
  std::sort(bodies.begin(), bodies.end(), SlideOrder);
  if (bodies.empty()) Fail("no document body in the archive");
  TextSink sink(kMaxTextBytes);
  for (const std::string& name : bodies) WalkXml(members.at(name), &sink, {}, fields);
  const std::string text = sink.Take();
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

}  // namespace

void ExtractOoxml(const OpenedFile& file, Json::Value& fields) {
  ExtractOffice(file, false, fields);
}

void ExtractOdf(const OpenedFile& file, Json::Value& fields) { ExtractOffice(file, true, fields); }

}  // namespace extract
}  // namespace orvane
