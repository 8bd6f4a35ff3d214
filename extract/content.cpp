#include "extract/content.hpp"

#include <magic.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "common/util.hpp"
#include "extract/extractor.hpp"
#include "extract/html.hpp"
#include "extract/mail.hpp"
#include "extract/ocr.hpp"
#include "extract/tool_extract.hpp"

namespace orvane {
namespace extract {
namespace {

// One kind of file and its extractor. Which extractor reads a file follows its contents, so that
// a misnamed file is still read right: the first row one of whose types matches the type
// libmagic sees wins. A type ending in '/' or '.' matches every type it starts; otherwise it
// must be equal. A container format whose contents say only "a zip" (or nothing at all) is told
// by its name: `by_name` lists the extensions that take such a file.
// Whether a file is read at all is the folder's switch for the kind its name gives
// (fileindex::GetFileTypeByFullPath), decided before the helper is asked ("need_meta").
struct Kind {
  const char* name;
  std::vector<std::string> types;
  std::vector<std::string> by_name;
  Extractor extract;
};

// Generic containers: a type that says no more than this leaves the name to tell.
bool IsGenericContainer(const std::string& mime) {
  return mime == "application/zip" || mime == "application/octet-stream" ||
         mime == "application/CDFV2" || mime == "application/x-ole-storage";
}

const std::vector<Kind>& Kinds() {
  static const std::vector<Kind> kinds = {
      {"pdf", {"application/pdf"}, {}, ExtractPdf},
      {"ooxml", {"application/vnd.openxmlformats-officedocument."}, {"docx", "xlsx", "pptx"},
       ExtractOoxml},
      {"odf", {"application/vnd.oasis.opendocument."}, {"odt", "ods", "odp"}, ExtractOdf},
      {"epub", {"application/epub+zip"}, {"epub"}, ExtractEpub},
      {"word97", {"application/msword"}, {"doc", "dot"}, ExtractLegacyWord},
      {"excel97", {"application/vnd.ms-excel"}, {"xls", "xlt"}, ExtractLegacyExcel},
      {"powerpoint97", {"application/vnd.ms-powerpoint"}, {"ppt", "pps", "pot"},
       ExtractLegacyPowerPoint},
      {"html", {"text/html", "application/xhtml+xml"}, {}, ExtractHtml},
      {"xml", {"text/xml", "application/xml"}, {}, ExtractXml},
      {"mail", {"message/rfc822"}, {}, ExtractMessage},
      {"mbox", {"application/mbox"}, {}, ExtractMailbox},
      {"rtf", {"text/rtf", "application/rtf"}, {}, ExtractRtf},
      {"man", {"text/troff"}, {}, ExtractManPage},
      {"postscript", {"application/postscript"}, {}, ExtractPostScript},
      {"djvu", {"image/vnd.djvu"}, {}, ExtractDjvu},
      {"audio", {"audio/"}, {}, ExtractAudio},
      {"photo", {"image/"}, {}, ExtractImageWithText},
      {"video", {"video/"}, {}, ExtractVideo},
      {"text",
       {"text/", "application/json", "application/javascript",
        "application/x-subrip"},
       {},
       ExtractText},
  };
  return kinds;
}

bool TypeMatches(const std::string& mime, const std::string& pattern) {
  const char last = pattern.back();
  return last == '/' || last == '.' ? StringStartWith(mime, pattern) : mime == pattern;
}

// nullptr: a format with nothing to extract.
const Kind* KindFor(const std::string& name, const std::string& mime) {
  const std::string ext = GetFileExtension(name, true);
  for (const Kind& kind : Kinds()) {
    for (const std::string& type : kind.types) {
      if (TypeMatches(mime, type)) return &kind;
    }
    if (IsGenericContainer(mime) &&
        std::find(kind.by_name.begin(), kind.by_name.end(), ext) != kind.by_name.end()) {
      return &kind;
    }
  }
  return nullptr;
}

// Loading the magic database costs more than looking most files up, and a long-lived helper
// looks up many: each thread keeps the cookie it loaded (a cookie is not thread-safe).
magic_t MagicCookie() {
  thread_local std::unique_ptr<struct magic_set, void (*)(magic_t)> cookie(nullptr, magic_close);
  if (!cookie) {
    cookie.reset(magic_open(MAGIC_MIME_TYPE | MAGIC_NO_CHECK_COMPRESS | MAGIC_ERROR));
    if (cookie && magic_load(cookie.get(), nullptr) != 0) cookie.reset();
  }
  return cookie.get();
}

std::string MimeTypeOf(const OpenedFile& file) {
  magic_t cookie = MagicCookie();
  if (cookie == nullptr || lseek(file.fd(), 0, SEEK_SET) != 0) return "";
  const char* type = magic_descriptor(cookie, file.fd());
  return type == nullptr ? "" : type;
}

}  // namespace

std::string MimeType(const std::string& path) {
  try {
    return MimeTypeOf(OpenedFile(path));
  } catch (const std::exception&) {
    return "";
  }
}

Json::Value ExtractContent(const std::string& path) {
  // Every format, even one with nothing to extract, must at least be a readable regular file.
  const OpenedFile file(path);
  ReadPrefix(file, 1);
  Json::Value fields(Json::objectValue);
  // The extension is the name's, not the descriptor's.
  if (const Kind* kind = KindFor(file.name(), MimeTypeOf(file))) kind->extract(file, fields);
  return fields;
}

}  // namespace extract
}  // namespace orvane
