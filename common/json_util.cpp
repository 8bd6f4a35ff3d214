#include "common/json_util.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>
#include <sstream>

#include "common/fd.hpp"
#include "common/root.hpp"

namespace orvane {
namespace {

// Readers and writers are costly to build and not thread-safe, so each thread keeps its own.
Json::CharReader& Reader() {
  thread_local std::unique_ptr<Json::CharReader> reader = [] {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    builder["failIfExtra"] = true;
    return std::unique_ptr<Json::CharReader>(builder.newCharReader());
  }();
  return *reader;
}

Json::StreamWriter& CompactWriter() {
  thread_local std::unique_ptr<Json::StreamWriter> writer = [] {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    return std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter());
  }();
  return *writer;
}

std::string StyledText(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value) + "\n";
}

bool WriteAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

std::string JsonToString(const Json::Value& value) {
  std::ostringstream out;
  CompactWriter().write(value, &out);
  return out.str();
}

bool JsonValue::fromString(const std::string& text) {
  Json::Value parsed;
  bool ok = false;
  try {
    ok = Reader().parse(text.data(), text.data() + text.size(), &parsed, nullptr);
  } catch (const std::exception&) {
    // Nesting past the reader's stack limit is thrown rather than reported.
  }
  if (!ok) {
    Json::Value::operator=(Json::Value());
    return false;
  }
  Json::Value::swap(parsed);
  return true;
}

bool JsonValue::fromFile(const std::string& path) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return false;
  std::string text;
  char buf[65536];
  for (;;) {
    ssize_t n = read(fd.get(), buf, sizeof(buf));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (n == 0) break;
    text.append(buf, static_cast<size_t>(n));
  }
  return fromString(text);
}

bool JsonValue::toFile(const std::string& path) const {
  const int saved_errno = errno;
  MakeParentDirs(path);
  std::string tmp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(tmp.data(), O_CLOEXEC));
  if (!fd.valid()) return false;
  const bool ok = WriteAll(fd.get(), StyledText(*this)) && fchmod(fd.get(), 0644) == 0 &&
                  fsync(fd.get()) == 0 && fd.Close() && rename(tmp.c_str(), path.c_str()) == 0;
  if (!ok) {
    const int failure = errno;
    unlink(tmp.c_str());
    errno = failure;
    return false;
  }
  // The rename is durable only once the folder itself is synced.
  const size_t slash = path.rfind('/');
  const std::string dir =
      slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
  UniqueFd dir_fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (dir_fd.valid()) fsync(dir_fd.get());
  errno = saved_errno;
  return true;
}

std::string AppendData(const Json::Value& v) { return ", data=" + JsonToString(v); }

void JsonApplyChanges(Json::Value& dst, const Json::Value& changes) {
  for (auto it = changes.begin(); it != changes.end(); ++it) {
    const std::string key = it.name();
    if (it->isNull()) {
      dst.removeMember(key);
    } else if (it->isObject()) {
      JsonApplyChanges(dst[key], *it);
    } else {
      dst[key] = *it;
    }
  }
}

template <>
Json::Value Vec2JsonArr<std::string>(const std::vector<std::string>& vec) {
  Json::Value arr(Json::arrayValue);
  for (const std::string& s : vec) arr.append(s);
  return arr;
}

template <>
std::vector<std::string> JsonArr2Vec<std::string>(const Json::Value& arr) {
  std::vector<std::string> out;
  for (const Json::Value& v : arr) {
    if (isJsonType<std::string>(v)) out.push_back(asJsonType<std::string>(v));
  }
  return out;
}

}  // namespace orvane
