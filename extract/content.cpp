#include "extract/content.hpp"

#include <magic.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

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
      {"archive",
       {"application/zip", "application/x-tar", "application/x-7z-compressed",
        "application/x-rar", "application/vnd.rar", "application/x-cpio",
        "application/x-archive", "application/vnd.debian.binary-package", "application/gzip",
        "application/x-bzip2", "application/x-xz", "application/zstd", "application/x-lz4",
        "application/x-lzma", "application/x-lzip", "application/x-compress"},
       {},
       ExtractArchive},
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

// Markdown, reStructuredText and plain text files that hold a few tags look like HTML or XML
// to libmagic; their name says they are text, read as written (a page's parser would take the
// "<script>" in a sentence for a script and drop the rest).
bool IsTextByName(const std::string& ext, const std::string& mime) {
  static const char* const kNames[] = {"md", "markdown", "mdown", "mkd", "rst", "rest", "txt", "text"};
  return (mime == "text/html" || mime == "text/xml") &&
         std::find(std::begin(kNames), std::end(kNames), ext) != std::end(kNames);
}

// nullptr: a format with nothing to extract.
const Kind* KindFor(const std::string& name, const std::string& sniffed) {
  const std::string ext = GetFileExtension(name, true);
  const std::string mime = IsTextByName(ext, sniffed) ? "text/plain" : sniffed;
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

void ExtractOpened(const OpenedFile& file, Json::Value& fields) {
  // The extension is the name's, not the descriptor's.
  if (const Kind* kind = KindFor(file.name(), MimeTypeOf(file))) kind->extract(file, fields);
}

// The helper may write no file but the in-memory copy of a member: while one is filled, the soft
// limit on file sizes is raised to what it needs, up to the hard limit, and put back after.
class FileWriteAllowance {
 public:
  explicit FileWriteAllowance(size_t bytes) {
    struct rlimit lim;
    if (getrlimit(RLIMIT_FSIZE, &lim) != 0 || lim.rlim_cur == RLIM_INFINITY ||
        lim.rlim_cur >= bytes) {
      return;
    }
    if (lim.rlim_max != RLIM_INFINITY && lim.rlim_max < bytes) {
      Fail("a member of " + std::to_string(bytes) + " bytes is over the limit on members");
    }
    saved_ = lim;
    lim.rlim_cur = bytes;
    raised_ = setrlimit(RLIMIT_FSIZE, &lim) == 0;
    if (!raised_) Fail(std::string("cannot allow a member's copy: ") + std::strerror(errno));
  }
  ~FileWriteAllowance() {
    if (raised_) setrlimit(RLIMIT_FSIZE, &saved_);
  }
  FileWriteAllowance(const FileWriteAllowance&) = delete;
  FileWriteAllowance& operator=(const FileWriteAllowance&) = delete;

 private:
  struct rlimit saved_ = {};
  bool raised_ = false;
};

}  // namespace

void ExtractMember(const std::string& name, const std::string& data, int depth,
                   Json::Value& fields) {
  if (data.size() > kMaxMemberBytes) Fail("member larger than " + std::to_string(kMaxMemberBytes));
  // An in-memory file: every extractor reads it as it reads a file on disk, nothing reaches the
  // disk, and a member's name (whatever "../" it holds) is never used as a path.
  UniqueFd fd(memfd_create("member", MFD_CLOEXEC));
  if (!fd.valid()) Fail(std::string("cannot hold a member in memory: ") + std::strerror(errno));
  {
    const FileWriteAllowance allowance(data.size());
    for (size_t done = 0; done < data.size();) {
      const ssize_t n = write(fd.get(), data.data() + done, data.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) Fail(std::string("cannot hold a member in memory: ") + std::strerror(errno));
      done += static_cast<size_t>(n);
    }
  }
  ExtractOpened(OpenedFile(std::move(fd), name, depth), fields);
}

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
  StartExpansionBudget();
  ExtractOpened(file, fields);
  return fields;
}

}  // namespace extract
}  // namespace orvane
