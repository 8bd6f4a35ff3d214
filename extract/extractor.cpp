#include "extract/extractor.hpp"

#include <fcntl.h>
#include <iconv.h>
#include <sys/stat.h>
#include <uchardet.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <type_traits>

#include "common/util.hpp"

namespace orvane {
namespace extract {

void Fail(const std::string& what) { throw std::runtime_error(what); }

namespace {

const char* KindName(mode_t mode) {
  if (S_ISDIR(mode)) return "a folder";
  if (S_ISFIFO(mode)) return "a FIFO";
  if (S_ISSOCK(mode)) return "a socket";
  if (S_ISCHR(mode) || S_ISBLK(mode)) return "a device";
  return "not a file";
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
}  // namespace

OpenedFile::OpenedFile(const std::string& path) : name_(path) {
  // Non-blocking: opening a FIFO with no writer returns at once instead of waiting for one.
  fd_.Reset(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
  if (!fd_.valid()) {
    Fail(errno == ELOOP ? std::string("a symbolic link, not read")
                        : std::string("cannot open: ") + std::strerror(errno));
  }
  Stat();
}

OpenedFile::OpenedFile(UniqueFd fd, const std::string& name, int depth)
    : fd_(std::move(fd)), name_(name), depth_(depth) {
  Stat();
}

void OpenedFile::Stat() {
  struct stat st;
  if (fstat(fd_.get(), &st) != 0) Fail(std::string("cannot stat: ") + std::strerror(errno));
  if (!S_ISREG(st.st_mode)) {
    Fail(std::string("not a regular file (") + KindName(st.st_mode) + ")");
  }
  size_ = st.st_size;
  proc_path_ = "/proc/self/fd/" + std::to_string(fd_.get());
}

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
void SetText(Json::Value& fields, const std::string& key, const std::string& value) {
  const std::string clean = CleanUtf8(Trim(value), kMaxTextBytes);
  if (!clean.empty()) fields[key] = clean;
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

}  // namespace extract
}  // namespace orvane
