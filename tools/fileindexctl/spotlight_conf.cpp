#include "tools/fileindexctl/spotlight_conf.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <sstream>

#include "common/error.hpp"
#include "common/fd.hpp"
#include "platform/fileidx.hpp"

namespace orvane {
namespace ctl {
namespace {

std::string Trim(const std::string& s) {
  size_t b = 0, e = s.size();
  while (b < e && std::isspace(static_cast<unsigned char>(s[b]))) ++b;
  while (e > b && std::isspace(static_cast<unsigned char>(s[e - 1]))) --e;
  return s.substr(b, e - b);
}

// Parameter names compare as the file server compares them: case and spaces do not count.
std::string Canonical(const std::string& key) {
  std::string out;
  for (char c : key) {
    if (!std::isspace(static_cast<unsigned char>(c))) {
      out += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    }
  }
  return out;
}

// The section a line opens ("global" for "[ Global ]"), or "" when it opens none.
std::string SectionOf(const std::string& line) {
  const std::string t = Trim(line);
  if (t.size() < 2 || t.front() != '[' || t.back() != ']') return "";
  return Canonical(t.substr(1, t.size() - 2));
}

bool SetsOneOf(const std::string& line, const ConfLines& lines) {
  const std::string t = Trim(line);
  const size_t eq = t.find('=');
  if (t.empty() || t[0] == '#' || t[0] == ';' || eq == std::string::npos) return false;
  const std::string key = Canonical(t.substr(0, eq));
  for (const auto& kv : lines) {
    if (Canonical(kv.first) == key) return true;
  }
  return false;
}

void AppendLines(const ConfLines& lines, std::string* out) {
  for (const auto& kv : lines) *out += "\t" + kv.first + " = " + kv.second + "\n";
}

}  // namespace

ConfLines SpotlightGlobalLines(const SpotlightSettings& s) {
  return {{"elasticsearch:mappings", s.mappings}};
}

ConfLines SpotlightShareLines(const SpotlightSettings& s) {
  return {{"spotlight", "yes"},
          {"spotlight backend", "elasticsearch"},
          {"elasticsearch:address", s.address},
          {"elasticsearch:port", std::to_string(s.port)},
          {"elasticsearch:index", platform::ComposeIndexID(s.share)}};
}

std::string SpotlightConfText(const SpotlightSettings& s) {
  std::string out = "[global]\n";
  AppendLines(SpotlightGlobalLines(s), &out);
  out += "\n[" + s.share + "]\n";
  AppendLines(SpotlightShareLines(s), &out);
  return out;
}

std::string MergeSpotlightConf(const std::string& conf, const std::string& conf_path,
                               const SpotlightSettings& s) {
  const ConfLines global = SpotlightGlobalLines(s);
  const ConfLines share = SpotlightShareLines(s);
  const std::string share_key = Canonical(s.share);
  std::string out;
  bool saw_global = false, saw_share = false;
  const ConfLines* current = nullptr;  // the lines of the section being copied, if ours
  std::istringstream in(conf);
  std::string line;
  while (std::getline(in, line)) {
    const std::string section = SectionOf(line);
    if (!section.empty()) {
      current = nullptr;
      out += line + "\n";
      if (section == "global") {
        saw_global = true;
        current = &global;
      } else if (section == share_key) {
        saw_share = true;
        current = &share;
      }
      if (current != nullptr) AppendLines(*current, &out);
      continue;
    }
    // A continued line belongs to the setting above it, which is kept or dropped with it.
    if (current != nullptr && SetsOneOf(line, *current)) {
      while (!line.empty() && line.back() == '\\' && std::getline(in, line)) {
      }
      continue;
    }
    out += line + "\n";
  }
  ORVANE_THROW_IF(!saw_share, kErrInvalidParam,
                  conf_path + " has no section [" + s.share +
                      "]: define the share there first, then run this again");
  if (!saw_global) {
    std::string head = "[global]\n";
    AppendLines(global, &head);
    out = head + "\n" + out;
  }
  return out;
}

void WriteSpotlightConf(const std::string& path, const SpotlightSettings& s) {
  std::string conf;
  struct stat st;
  {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    ORVANE_THROW_IF(!fd.valid() || ::fstat(fd.get(), &st) != 0, kErrSystem,
                    "cannot read " + path + ": " + std::strerror(errno));
    char buf[65536];
    ssize_t n;
    while ((n = ::read(fd.get(), buf, sizeof buf)) > 0) conf.append(buf, static_cast<size_t>(n));
    ORVANE_THROW_IF(n < 0, kErrSystem, "cannot read " + path + ": " + std::strerror(errno));
  }
  const std::string merged = MergeSpotlightConf(conf, path, s);
  std::string tmp = path + ".XXXXXX";
  UniqueFd fd(::mkostemp(tmp.data(), O_CLOEXEC));
  ORVANE_THROW_IF(!fd.valid(), kErrSystem,
                  "cannot write beside " + path + ": " + std::strerror(errno));
  size_t done = 0;
  bool ok = true;
  while (ok && done < merged.size()) {
    const ssize_t n = ::write(fd.get(), merged.data() + done, merged.size() - done);
    ok = n > 0 || (n < 0 && errno == EINTR);
    if (n > 0) done += static_cast<size_t>(n);
  }
  ok = ok && ::fchmod(fd.get(), st.st_mode & 07777) == 0 &&
       ::fchown(fd.get(), st.st_uid, st.st_gid) == 0 && ::fsync(fd.get()) == 0 && fd.Close() &&
       ::rename(tmp.c_str(), path.c_str()) == 0;
  if (!ok) {
    const int failure = errno;
    ::unlink(tmp.c_str());
    ORVANE_THROW_IF(
        true, kErrSystem,
        "cannot replace " + path + ": " + std::strerror(failure) + " (the file is unchanged)");
  }
}

}  // namespace ctl
}  // namespace orvane
