#include "extract/mail.hpp"

#include <fcntl.h>
#include <gmime/gmime.h>
#include <unistd.h>

#include <exception>
#include <memory>
#include <mutex>

#include "common/util.hpp"
#include "extract/content.hpp"
#include "extract/html.hpp"

namespace orvane {
namespace extract {
namespace {

// Messages inside messages are followed this deep.
constexpr int kMaxMailDepth = 8;

// Releases a GObject reference at the end of its scope.
template <typename T>
using GPtr = std::unique_ptr<T, void (*)(gpointer)>;

template <typename T>
GPtr<T> Owned(T* object) {
  return GPtr<T>(object, g_object_unref);
}

std::string TakeGString(char* s) {
  std::string out = s == nullptr ? "" : s;
  g_free(s);
  return out;
}

void InitGMime() {
  static std::once_flag once;
  std::call_once(once, [] { g_mime_init(); });
}

std::string Addresses(InternetAddressList* list) {
  if (list == nullptr || internet_address_list_length(list) == 0) return "";
  return TakeGString(internet_address_list_to_string(list, nullptr, FALSE));
}

// The part's content with its transfer encoding undone and, when `to_utf8`, its declared charset
// converted to UTF-8. The content is no larger than the message it came from.
std::string DecodedContent(GMimePart* part, bool to_utf8) {
  GMimeDataWrapper* content = g_mime_part_get_content(part);
  if (content == nullptr) return "";
  auto mem = Owned(g_mime_stream_mem_new());
  auto filtered = Owned(g_mime_stream_filter_new(mem.get()));
  const char* charset =
      to_utf8 ? g_mime_object_get_content_type_parameter(GMIME_OBJECT(part), "charset") : nullptr;
  bool converted = false;
  if (charset != nullptr && g_ascii_strcasecmp(charset, "utf-8") != 0) {
    if (GMimeFilter* filter = g_mime_filter_charset_new(charset, "UTF-8")) {
      g_mime_stream_filter_add(GMIME_STREAM_FILTER(filtered.get()), filter);
      g_object_unref(filter);
      converted = true;
    }
  }
  g_mime_data_wrapper_write_to_stream(content, filtered.get());
  g_mime_stream_flush(filtered.get());
  GByteArray* bytes = g_mime_stream_mem_get_byte_array(GMIME_STREAM_MEM(mem.get()));
  std::string data(reinterpret_cast<const char*>(bytes->data), bytes->len);
  // An unknown or missing charset: the bytes are recognised as the plain-text extractor does.
  return to_utf8 && !converted ? ToUtf8(data, data.size()) : data;
}

// Walks one message's parts into the text.
class MessageWalker {
 public:
  // `depth`: how deep the file being read lies in containers, so that an attachment is one deeper.
  MessageWalker(TextSink* sink, int depth) : sink_(sink), depth_(depth) {}

  // The headers worth searching, as lines of text.
  void AddHeaders(GMimeMessage* message) {
    const std::string from = Addresses(g_mime_message_get_from(message));
    const std::string to = Addresses(g_mime_message_get_to(message));
    const char* subject = g_mime_message_get_subject(message);
    if (!from.empty()) AddLine("From: " + from);
    if (!to.empty()) AddLine("To: " + to);
    if (subject != nullptr && *subject != '\0') AddLine(std::string("Subject: ") + subject);
  }

  void Walk(GMimeObject* object, int depth) {
    if (object == nullptr || depth > kMaxMailDepth || sink_->full() || ++parts_ > kMaxMailParts) {
      return;
    }
    if (GMIME_IS_MULTIPART(object)) {
      GMimeMultipart* multipart = GMIME_MULTIPART(object);
      const int count = g_mime_multipart_get_count(multipart);
      for (int i = 0; i < count && parts_ <= kMaxMailParts; ++i) {
        Walk(g_mime_multipart_get_part(multipart, i), depth + 1);
      }
    } else if (GMIME_IS_MESSAGE_PART(object)) {
      GMimeMessage* inner = g_mime_message_part_get_message(GMIME_MESSAGE_PART(object));
      if (inner != nullptr) {
        AddHeaders(inner);
        Walk(g_mime_message_get_mime_part(inner), depth + 1);
      }
    } else if (GMIME_IS_PART(object)) {
      WalkPart(GMIME_PART(object));
    }
  }

 private:
  void AddLine(const std::string& line) {
    sink_->Break();
    sink_->Add(CleanUtf8(line, line.size()));
    sink_->Break();
  }

  void WalkPart(GMimePart* part) {
    GMimeContentType* type = g_mime_object_get_content_type(GMIME_OBJECT(part));
    const char* filename = g_mime_part_get_filename(part);
    if (filename != nullptr && *filename != '\0') AddLine(filename);
    const bool is_html = g_mime_content_type_is_type(type, "text", "html");
    const bool is_text = g_mime_content_type_is_type(type, "text", "plain") ||
                         (g_mime_content_type_is_type(type, "text", "*") && filename == nullptr);
    if (is_text || is_html) {
      const std::string text = DecodedContent(part, true);
      if (is_html) {
        Json::Value ignored;
        sink_->Break();
        HtmlToText(text, "UTF-8", sink_, ignored);
      } else {
        AddLine(text);
      }
      return;
    }
    // Anything else is read as a file of its own kind would be, a PDF as a PDF.
    std::string data = DecodedContent(part, false);
    if (data.size() > kMaxMemberBytes) data.resize(kMaxMemberBytes);
    Json::Value member(Json::objectValue);
    try {
      ExtractMember(filename != nullptr ? filename : "attachment", data, depth_ + 1, member);
    } catch (const std::exception&) {
      return;  // an attachment that cannot be read leaves its name, as a damaged member does
    }
    if (member["QUIXMDTextContent"].isString()) AddLine(member["QUIXMDTextContent"].asString());
  }

  TextSink* sink_;
  int depth_;
  int parts_ = 0;
};

void SetBody(TextSink& sink, Json::Value& fields) {
  const std::string text = Trim(sink.Take());
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

// A GMime stream over the file from its start; the stream owns a descriptor of its own.
GPtr<GMimeStream> OpenStream(const OpenedFile& file) {
  const int fd = fcntl(file.fd(), F_DUPFD_CLOEXEC, 0);
  if (fd < 0) Fail("cannot read the message");
  return Owned(g_mime_stream_fs_new_with_bounds(fd, 0, -1));
}

}  // namespace

void ExtractMessage(const OpenedFile& file, Json::Value& fields) {
  InitGMime();
  auto stream = OpenStream(file);
  auto parser = Owned(g_mime_parser_new_with_stream(stream.get()));
  g_mime_parser_set_format(parser.get(), GMIME_FORMAT_MESSAGE);
  auto message = Owned(g_mime_parser_construct_message(parser.get(), nullptr));
  if (!message) Fail("not a readable e-mail message");
  SetText(fields, "QUIXMDAuthors", Addresses(g_mime_message_get_from(message.get())));
  std::string recipients = Addresses(g_mime_message_get_to(message.get()));
  const std::string cc = Addresses(g_mime_message_get_cc(message.get()));
  if (!cc.empty()) recipients += (recipients.empty() ? "" : ", ") + cc;
  SetText(fields, "QUIXMDRecipients", recipients);
  if (const char* subject = g_mime_message_get_subject(message.get())) {
    SetText(fields, "QUIXMDTitle", subject);
  }
  if (GDateTime* date = g_mime_message_get_date(message.get())) {
    fields["QUIXMDContentCreationDate"] = static_cast<Json::Int64>(g_date_time_to_unix(date));
  }
  TextSink sink(kMaxTextBytes);
  MessageWalker walker(&sink, file.depth());
  walker.Walk(g_mime_message_get_mime_part(message.get()), 0);
  SetBody(sink, fields);
}

void ExtractMailbox(const OpenedFile& file, Json::Value& fields) {
  InitGMime();
  auto stream = OpenStream(file);
  auto parser = Owned(g_mime_parser_new_with_stream(stream.get()));
  g_mime_parser_set_format(parser.get(), GMIME_FORMAT_MBOX);
  TextSink sink(kMaxTextBytes);
  int messages = 0;
  while (!sink.full() && !g_mime_parser_eos(parser.get())) {
    auto message = Owned(g_mime_parser_construct_message(parser.get(), nullptr));
    if (!message) break;
    ++messages;
    MessageWalker walker(&sink, file.depth());
    walker.AddHeaders(message.get());
    walker.Walk(g_mime_message_get_mime_part(message.get()), 0);
    sink.Break();
  }
  if (messages == 0) Fail("not a readable mailbox");
  SetBody(sink, fields);
}

}  // namespace extract
}  // namespace orvane
