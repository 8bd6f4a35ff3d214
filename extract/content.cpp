#include "extract/content.hpp"

#include <archive.h>
#include <archive_entry.h>
#include <fcntl.h>
#include <iconv.h>
#include <libxml/xmlreader.h>
#include <magic.h>
#include <poppler-document.h>
#include <poppler-global.h>
#include <poppler-page.h>
#include <sys/stat.h>
#include <taglib/fileref.h>
#include <taglib/tag.h>
#include <taglib/tpropertymap.h>
#include <uchardet.h>
#include <unistd.h>

#include <MediaInfo/MediaInfo.h>
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <exiv2/exiv2.hpp>
#include <initializer_list>
#include <map>
#include <memory>
#include <stdexcept>
#include <vector>

#include "common/fd.hpp"
#include "common/util.hpp"

namespace orvane {
namespace extract {
namespace {

// Office documents are zip files; no member is read past this, whatever it claims to hold.
constexpr size_t kMaxMemberBytes = 64 * 1024 * 1024;

[[noreturn]] void Fail(const std::string& what) { throw std::runtime_error(what); }

// The file being extracted, opened once. Every library reads this descriptor or its
// /proc/self/fd name, which reaches the same inode, so a name swapped for something else after
// the open changes nothing, and nothing here ever blocks on a FIFO or follows a link.
class OpenedFile {
 public:
  explicit OpenedFile(const std::string& path) {
    // Non-blocking: opening a FIFO with no writer returns at once instead of waiting for one.
    fd_.Reset(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
    if (!fd_.valid()) {
      Fail(errno == ELOOP ? std::string("a symbolic link, not read")
                          : std::string("cannot open: ") + std::strerror(errno));
    }
    struct stat st;
    if (fstat(fd_.get(), &st) != 0) Fail(std::string("cannot stat: ") + std::strerror(errno));
    if (!S_ISREG(st.st_mode)) {
      Fail(std::string("not a regular file (") + KindName(st.st_mode) + ")");
    }
    proc_path_ = "/proc/self/fd/" + std::to_string(fd_.get());
  }

  int fd() const { return fd_.get(); }
  // A name the path-taking libraries open the same file by.
  const std::string& proc_path() const { return proc_path_; }

 private:
  static const char* KindName(mode_t mode) {
    if (S_ISDIR(mode)) return "a folder";
    if (S_ISFIFO(mode)) return "a FIFO";
    if (S_ISSOCK(mode)) return "a socket";
    if (S_ISCHR(mode) || S_ISBLK(mode)) return "a device";
    return "not a file";
  }

  UniqueFd fd_;
  std::string proc_path_;
};

// Reads from the start whatever the descriptor's offset, which the type sniffing may move.
std::string ReadPrefix(const OpenedFile& file, size_t max_bytes) {
  std::string data;
  char buf[65536];
  while (data.size() < max_bytes) {
    const ssize_t n = pread(file.fd(), buf, std::min(sizeof(buf), max_bytes - data.size()),
                            static_cast<off_t>(data.size()));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) Fail(std::string("cannot read: ") + std::strerror(errno));
    if (n == 0) break;
    data.append(buf, static_cast<size_t>(n));
  }
  return data;
}

// Length of the UTF-8 sequence starting at s[i], or 0 when it is not a valid one.
size_t Utf8SequenceLength(const std::string& s, size_t i) {
  const auto c = static_cast<unsigned char>(s[i]);
  size_t len;
  uint32_t min;
  if (c < 0x80) return c == 0 ? 0 : 1;
  if ((c & 0xE0) == 0xC0) {
    len = 2;
    min = 0x80;
  } else if ((c & 0xF0) == 0xE0) {
    len = 3;
    min = 0x800;
  } else if ((c & 0xF8) == 0xF0) {
    len = 4;
    min = 0x10000;
  } else {
    return 0;
  }
  if (i + len > s.size()) return 0;
  uint32_t cp = c & (0xFF >> (len + 1));
  for (size_t k = 1; k < len; ++k) {
    const auto cc = static_cast<unsigned char>(s[i + k]);
    if ((cc & 0xC0) != 0x80) return 0;
    cp = (cp << 6) | (cc & 0x3F);
  }
  if (cp < min || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return 0;
  return len;
}

// Keeps the valid sequences of `s`, at most `max_bytes` of them.
std::string CleanUtf8(const std::string& s, size_t max_bytes) {
  std::string out;
  out.reserve(std::min(s.size(), max_bytes));
  for (size_t i = 0; i < s.size();) {
    const size_t len = Utf8SequenceLength(s, i);
    if (len == 0) {
      ++i;
      continue;
    }
    if (out.size() + len > max_bytes) break;
    out.append(s, i, len);
    i += len;
  }
  return out;
}

bool IsValidUtf8(const std::string& s) {
  for (size_t i = 0; i < s.size();) {
    const size_t len = Utf8SequenceLength(s, i);
    if (len == 0) return false;
    i += len;
  }
  return true;
}

std::string DetectEncoding(const std::string& text) {
  std::unique_ptr<std::remove_pointer_t<uchardet_t>, void (*)(uchardet_t)> detector(
      uchardet_new(), uchardet_delete);
  if (!detector || uchardet_handle_data(detector.get(), text.data(), text.size()) != 0) return "";
  uchardet_data_end(detector.get());
  return uchardet_get_charset(detector.get());
}

std::string Convert(const std::string& text, const std::string& from) {
  iconv_t cd = iconv_open("UTF-8//IGNORE", from.c_str());
  if (cd == reinterpret_cast<iconv_t>(-1)) return "";
  std::string out(text.size() * 4 + 16, '\0');
  char* in = const_cast<char*>(text.data());
  size_t in_left = text.size();
  char* dst = out.data();
  size_t out_left = out.size();
  while (in_left > 0) {
    if (iconv(cd, &in, &in_left, &dst, &out_left) != static_cast<size_t>(-1)) break;
    if (errno == EILSEQ && in_left > 0) {  // skip what cannot be converted
      ++in;
      --in_left;
    } else {
      break;
    }
  }
  iconv_close(cd);
  out.resize(out.size() - out_left);
  return out;
}

// Collects text with a byte budget.
class TextSink {
 public:
  explicit TextSink(size_t max) : max_(max) {}
  void Add(const std::string& s) {
    if (!full()) text_ += s;
  }
  void Break() {
    if (!text_.empty() && text_.back() != '\n' && !full()) text_ += '\n';
  }
  bool full() const { return text_.size() >= max_; }
  std::string Take() { return CleanUtf8(text_, max_); }

 private:
  size_t max_;
  std::string text_;
};

void SetText(Json::Value& fields, const std::string& key, const std::string& value) {
  const std::string clean = CleanUtf8(Trim(value), kMaxTextBytes);
  if (!clean.empty()) fields[key] = clean;
}

// ---- plain text

void ExtractText(const OpenedFile& file, Json::Value& fields) {
  // Read a little more than the cap: a conversion can shrink the text.
  const std::string raw = ReadPrefix(file, kMaxTextBytes + 4096);
  const std::string text = ToUtf8(raw, kMaxTextBytes);
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

// ---- PDF

void QuietPoppler(const std::string&, void*) {}

std::string Utf8(const poppler::ustring& s) {
  const std::vector<char> bytes = s.to_utf8();
  return std::string(bytes.begin(), bytes.end());
}

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

// ---- office documents

// Reads the members of a zip file that `want` selects, in archive order.
std::map<std::string, std::string> ReadZipMembers(const OpenedFile& file,
                                                  bool (*want)(const std::string&)) {
  std::unique_ptr<struct archive, int (*)(struct archive*)> zip(archive_read_new(),
                                                                archive_read_free);
  archive_read_support_format_zip(zip.get());
  if (lseek(file.fd(), 0, SEEK_SET) != 0 ||
      archive_read_open_fd(zip.get(), file.fd(), 65536) != ARCHIVE_OK) {
    Fail(std::string("not a readable zip: ") + archive_error_string(zip.get()));
  }
  std::map<std::string, std::string> members;
  struct archive_entry* entry;
  while (archive_read_next_header(zip.get(), &entry) == ARCHIVE_OK) {
    const char* name = archive_entry_pathname(entry);
    if (name == nullptr || !want(name)) continue;
    std::string data;
    char buf[65536];
    for (;;) {
      const la_ssize_t n = archive_read_data(zip.get(), buf, sizeof(buf));
      if (n < 0) Fail(std::string("damaged zip member: ") + name);
      if (n == 0 || data.size() >= kMaxMemberBytes) break;
      data.append(buf, static_cast<size_t>(n));
    }
    members[name] = std::move(data);
  }
  return members;
}

// Paragraph-like elements end a line; runs of text inside one are joined as they stand.
bool EndsLine(const xmlChar* local_name) {
  static const char* const kNames[] = {"p", "h", "br", "tab", "si", "tr", "line-break"};
  for (const char* n : kNames) {
    if (xmlStrEqual(local_name, reinterpret_cast<const xmlChar*>(n))) return true;
  }
  return false;
}

// Walks one XML member: text goes to `sink`, and the text of the elements named in `props`
// (local names) goes to their fields.
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

// ---- audio

std::string Utf8(const TagLib::String& s) { return s.to8Bit(true); }

void ExtractAudio(const OpenedFile& opened, Json::Value& fields) {
  // The descriptor's name has no extension: the library tells the format by its contents.
  TagLib::FileRef file(opened.proc_path().c_str(), true, TagLib::AudioProperties::Average);
  if (file.isNull()) Fail("not a readable audio file");
  fields["QUIXMDMediaTypes"] = "Sound";
  if (const TagLib::Tag* tag = file.tag()) {
    SetText(fields, "QUIXMDTitle", Utf8(tag->title()));
    SetText(fields, "QUIXMDAuthors", Utf8(tag->artist()));
    SetText(fields, "QUIXMDAlbum", Utf8(tag->album()));
    SetText(fields, "QUIXMDMusicalGenre", Utf8(tag->genre()));
    SetText(fields, "QUIXMDComment", Utf8(tag->comment()));
    if (tag->year() > 0) fields["QUIXMDRecordingYear"] = static_cast<Json::Int64>(tag->year());
    if (tag->track() > 0) fields["QUIXMDAudioTrackNumber"] = static_cast<Json::Int64>(tag->track());
    const TagLib::PropertyMap properties = tag->properties();
    auto composer = properties.find("COMPOSER");
    if (composer != properties.end() && !composer->second.isEmpty()) {
      SetText(fields, "QUIXMDComposer", Utf8(composer->second.front()));
    }
  }
  if (const TagLib::AudioProperties* audio = file.audioProperties()) {
    fields["QUIXMDDurationSecond"] = audio->lengthInMilliseconds() / 1000.0;
    if (audio->bitrate() > 0) fields["QUIXMDAudioBitRate"] = audio->bitrate();
    if (audio->sampleRate() > 0) fields["QUIXMDAudioSampleRate"] = audio->sampleRate();
    if (audio->channels() > 0) fields["QUIXMDAudioChannelCount"] = audio->channels();
  }
}

// ---- photos

time_t ExifTime(const std::string& text) {
  struct tm tm = {};
  if (strptime(text.c_str(), "%Y:%m:%d %H:%M:%S", &tm) == nullptr) return 0;
  return timegm(&tm);
}

void ExtractPhoto(const OpenedFile& file, Json::Value& fields) {
  Exiv2::LogMsg::setLevel(Exiv2::LogMsg::mute);
  auto image = Exiv2::ImageFactory::open(file.proc_path(), false);
  if (image.get() == nullptr) Fail("not a readable image");
  image->readMetadata();
  fields["QUIXMDMediaTypes"] = "Image";
  const Exiv2::ExifData& exif = image->exifData();
  auto get = [&exif](const char* key) -> const Exiv2::Exifdatum* {
    auto it = exif.findKey(Exiv2::ExifKey(key));
    return it == exif.end() ? nullptr : &*it;
  };
  if (auto* d = get("Exif.Image.Make")) SetText(fields, "QUIXMDAcquisitionMake", d->toString());
  if (auto* d = get("Exif.Image.Model")) SetText(fields, "QUIXMDAcquisitionModel", d->toString());
  if (auto* d = get("Exif.Image.ImageDescription")) {
    SetText(fields, "QUIXMDDescription", d->toString());
  }
  if (auto* d = get("Exif.Photo.ExposureTime")) {
    SetText(fields, "QUIXMDExposureTimeString", d->toString());
  }
  if (auto* d = get("Exif.Photo.FNumber")) {
    char text[32];
    std::snprintf(text, sizeof(text), "f/%.1f", d->toFloat());
    fields["QUIXMDAperture"] = text;
  }
  if (auto* d = get("Exif.Photo.ISOSpeedRatings")) {
    fields["QUIXMDISOSpeed"] = static_cast<Json::Int64>(d->toLong());
  }
  if (auto* d = get("Exif.Image.XResolution")) {
    fields["QUIXMDResolutionWidthDPI"] = static_cast<Json::Int64>(d->toFloat());
  }
  if (auto* d = get("Exif.Image.YResolution")) {
    fields["QUIXMDResolutionHeightDPI"] = static_cast<Json::Int64>(d->toFloat());
  }
  if (auto* d = get("Exif.Photo.DateTimeOriginal")) {
    if (time_t t = ExifTime(d->toString())) {
      fields["QUIXMDContentCreationDate"] = static_cast<Json::Int64>(t);
    }
  }
}

// ---- video

// UTF-8 and wide strings, both ways; MediaInfo speaks wide strings.
std::wstring Widen(const std::string& s) {
  std::wstring out;
  for (size_t i = 0; i < s.size();) {
    const size_t len = Utf8SequenceLength(s, i);
    if (len == 0) Fail("path is not UTF-8");
    const auto c = static_cast<unsigned char>(s[i]);
    uint32_t cp = len == 1 ? c : c & (0xFF >> (len + 1));
    for (size_t k = 1; k < len; ++k) cp = (cp << 6) | (static_cast<unsigned char>(s[i + k]) & 0x3F);
    out += static_cast<wchar_t>(cp);
    i += len;
  }
  return out;
}

std::string Narrow(const std::wstring& w) {
  std::string out;
  for (wchar_t wc : w) {
    const auto cp = static_cast<uint32_t>(wc);
    if (cp < 0x80) {
      out += static_cast<char>(cp);
    } else if (cp < 0x800) {
      out += static_cast<char>(0xC0 | (cp >> 6));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
      out += static_cast<char>(0xE0 | (cp >> 12));
      out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp <= 0x10FFFF) {
      out += static_cast<char>(0xF0 | (cp >> 18));
      out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
      out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    }
  }
  return out;
}

void ExtractVideo(const OpenedFile& file, Json::Value& fields) {
  MediaInfoLib::MediaInfo info;
  info.Option(L"Internet", L"No");
  if (info.Open(Widen(file.proc_path())) == 0) Fail("not a readable media file");
  auto get = [&info](MediaInfoLib::stream_t stream, const wchar_t* name) {
    return Narrow(info.Get(stream, 0, name));
  };
  auto number = [&](MediaInfoLib::stream_t stream, const wchar_t* name) -> double {
    const std::string text = get(stream, name);
    return text.empty() ? 0 : std::strtod(text.c_str(), nullptr);
  };
  fields["QUIXMDMediaTypes"] = "Video";
  SetText(fields, "QUIXMDTitle", get(MediaInfoLib::Stream_General, L"Title"));
  if (double ms = number(MediaInfoLib::Stream_General, L"Duration")) {
    fields["QUIXMDDurationSecond"] = ms / 1000.0;
  }
  if (double rate = number(MediaInfoLib::Stream_General, L"OverallBitRate")) {
    fields["QUIXMDTotalBitRate"] = static_cast<Json::Int64>(rate);
  }
  if (double rate = number(MediaInfoLib::Stream_Video, L"BitRate")) {
    fields["QUIXMDVideoBitRate"] = static_cast<Json::Int64>(rate);
  }
  if (double rate = number(MediaInfoLib::Stream_Audio, L"BitRate")) {
    fields["QUIXMDAudioBitRate"] = static_cast<Json::Int64>(rate);
  }
  if (double rate = number(MediaInfoLib::Stream_Audio, L"SamplingRate")) {
    fields["QUIXMDAudioSampleRate"] = static_cast<Json::Int64>(rate);
  }
  if (double channels = number(MediaInfoLib::Stream_Audio, L"Channel(s)")) {
    fields["QUIXMDAudioChannelCount"] = static_cast<Json::Int64>(channels);
  }
  const std::string codecs = Trim(get(MediaInfoLib::Stream_Video, L"Format") + " " +
                                  get(MediaInfoLib::Stream_Audio, L"Format"));
  SetText(fields, "QUIXMDCodecs", codecs);
  info.Close();
}

// Which parser reads a file follows its contents, so that a misnamed file is still read right.
// Whether a file is read at all is the folder's switch for the kind its name gives
// (fileindex::GetFileTypeByFullPath), decided before the helper is asked ("need_meta").
using Extractor = void (*)(const OpenedFile&, Json::Value&);

void ExtractOoxml(const OpenedFile& file, Json::Value& fields) {
  ExtractOffice(file, false, fields);
}

void ExtractOdf(const OpenedFile& file, Json::Value& fields) { ExtractOffice(file, true, fields); }

// An office file says so in its type, or its type says only "an archive" and its name tells.
bool IsOffice(const std::string& mime, const std::string& ext, const char* type_prefix,
              std::initializer_list<const char*> extensions) {
  if (StringStartWith(mime, type_prefix)) return true;
  if (mime != "application/zip" && mime != "application/octet-stream") return false;
  return std::find(extensions.begin(), extensions.end(), ext) != extensions.end();
}

// nullptr: a format with nothing to extract.
Extractor ExtractorFor(const std::string& path, const std::string& mime) {
  const std::string ext = GetFileExtension(path, true);
  if (mime == "application/pdf") return ExtractPdf;
  if (IsOffice(mime, ext, "application/vnd.openxmlformats-officedocument.",
               {"docx", "xlsx", "pptx"})) {
    return ExtractOoxml;
  }
  if (IsOffice(mime, ext, "application/vnd.oasis.opendocument.", {"odt", "ods", "odp"})) {
    return ExtractOdf;
  }
  if (StringStartWith(mime, "audio/")) return ExtractAudio;
  if (StringStartWith(mime, "image/")) return ExtractPhoto;
  if (StringStartWith(mime, "video/")) return ExtractVideo;
  if (StringStartWith(mime, "text/") || mime == "application/json" || mime == "application/xml" ||
      mime == "application/javascript" || mime == "application/x-subrip") {
    return ExtractText;
  }
  return nullptr;
}

}  // namespace

namespace {

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

std::string ToUtf8(const std::string& text, size_t max_bytes) {
  if (IsValidUtf8(text.substr(0, std::min(text.size(), max_bytes + 4)))) {
    return CleanUtf8(text, max_bytes);
  }
  const std::string encoding = DetectEncoding(text);
  std::string converted =
      Convert(text, encoding.empty() || encoding == "ASCII" ? "WINDOWS-1252" : encoding);
  return CleanUtf8(converted, max_bytes);
}

Json::Value ExtractContent(const std::string& path) {
  // Every format, even one with nothing to extract, must at least be a readable regular file.
  const OpenedFile file(path);
  ReadPrefix(file, 1);
  Json::Value fields(Json::objectValue);
  // The extension is the name's, not the descriptor's.
  if (const Extractor extract = ExtractorFor(path, MimeTypeOf(file))) extract(file, fields);
  return fields;
}

}  // namespace extract
}  // namespace orvane
