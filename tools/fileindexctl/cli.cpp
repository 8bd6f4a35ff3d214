#include "tools/fileindexctl/cli.hpp"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <ctime>

#include "common/name_codec.hpp"

namespace orvane {
namespace ctl {

Args::Args(const std::vector<std::string>& argv, const std::set<std::string>& flags) {
  bool options_done = false;
  for (size_t i = 0; i < argv.size(); ++i) {
    const std::string& arg = argv[i];
    if (options_done || arg.size() < 3 || arg.compare(0, 2, "--") != 0) {
      if (arg == "--") {
        options_done = true;
        continue;
      }
      positional_.push_back(arg);
      continue;
    }
    std::string name = arg.substr(2);
    const size_t eq = name.find('=');
    if (eq != std::string::npos) {
      options_[name.substr(0, eq)] = name.substr(eq + 1);
    } else if (flags.count(name) != 0) {
      options_[name] = "on";
    } else if (i + 1 < argv.size()) {
      options_[name] = argv[++i];
    } else {
      throw UsageError("option --" + name + " needs a value");
    }
  }
}

const std::string& Args::At(size_t i, const std::string& what) const {
  if (i >= positional_.size()) throw UsageError("missing " + what);
  return positional_[i];
}

std::string Args::Get(const std::string& option, const std::string& fallback) const {
  auto it = options_.find(option);
  return it == options_.end() ? fallback : it->second;
}

long long Args::GetInt(const std::string& option, long long fallback) const {
  if (!Has(option)) return fallback;
  const std::string text = Get(option);
  char* end = nullptr;
  const long long value = std::strtoll(text.c_str(), &end, 10);
  if (text.empty() || *end != '\0') throw UsageError("--" + option + " takes a whole number");
  return value;
}

bool Args::GetSwitch(const std::string& option, bool fallback) const {
  if (!Has(option)) return fallback;
  const std::string v = Get(option);
  if (v == "on" || v == "yes" || v == "true" || v == "1") return true;
  if (v == "off" || v == "no" || v == "false" || v == "0") return false;
  throw UsageError("--" + option + " takes on or off");
}

void Args::Check(const std::set<std::string>& known, size_t max_positional) const {
  for (const auto& [name, value] : options_) {
    if (known.count(name) == 0) throw UsageError("unknown option --" + name);
  }
  if (positional_.size() > max_positional) {
    throw UsageError("unexpected argument \"" + positional_[max_positional] + "\"");
  }
}

void Table::Print(std::ostream& out) const {
  // Columns line up by characters as shown, an undecodable byte counting as one.
  std::vector<size_t> widths;
  for (const auto& row : rows_) {
    widths.resize(std::max(widths.size(), row.size()));
    for (size_t c = 0; c < row.size(); ++c) widths[c] = std::max(widths[c], DisplayLength(row[c]));
  }
  for (const auto& row : rows_) {
    std::string line;
    for (size_t c = 0; c < row.size(); ++c) {
      line += row[c];
      if (c + 1 < row.size()) line += std::string(widths[c] - DisplayLength(row[c]) + 2, ' ');
    }
    out << line << '\n';
  }
}

std::string HumanSize(uint64_t bytes) {
  static const char* const kUnits[] = {"B", "KiB", "MiB", "GiB", "TiB", "PiB"};
  double value = static_cast<double>(bytes);
  size_t unit = 0;
  while (value >= 1024 && unit + 1 < std::size(kUnits)) {
    value /= 1024;
    ++unit;
  }
  char text[32];
  if (unit == 0) {
    std::snprintf(text, sizeof(text), "%llu B", static_cast<unsigned long long>(bytes));
  } else {
    std::snprintf(text, sizeof(text), "%.1f %s", value, kUnits[unit]);
  }
  return text;
}

std::string HumanTime(int64_t seconds) {
  if (seconds <= 0) return "-";
  const time_t t = static_cast<time_t>(seconds);
  struct tm tm;
  localtime_r(&t, &tm);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M", &tm);
  return text;
}

std::string YesNo(bool value) { return value ? "yes" : "no"; }

int64_t ParseTime(const std::string& text) {
  struct tm tm = {};
  const char* end = strptime(text.c_str(), "%Y-%m-%d %H:%M", &tm);
  if (end == nullptr || *end != '\0') {
    tm = {};
    end = strptime(text.c_str(), "%Y-%m-%d", &tm);
  }
  if (end != nullptr && *end == '\0') {
    tm.tm_isdst = -1;
    return static_cast<int64_t>(mktime(&tm));
  }
  char* rest = nullptr;
  const long long seconds = std::strtoll(text.c_str(), &rest, 10);
  if (text.empty() || *rest != '\0') {
    throw UsageError("\"" + text + "\" is not a date (YYYY-MM-DD [HH:MM]) or epoch seconds");
  }
  return seconds;
}

uint64_t ParseSize(const std::string& text) {
  char* rest = nullptr;
  const double value = std::strtod(text.c_str(), &rest);
  uint64_t scale = 1;
  const std::string unit = rest != nullptr ? rest : "";
  if (unit == "k" || unit == "K") {
    scale = 1ULL << 10;
  } else if (unit == "m" || unit == "M") {
    scale = 1ULL << 20;
  } else if (unit == "g" || unit == "G") {
    scale = 1ULL << 30;
  } else if (!unit.empty()) {
    throw UsageError("\"" + text + "\" is not a size (like 512, 10k, 4M, 2G)");
  }
  if (text.empty() || value < 0) throw UsageError("\"" + text + "\" is not a size");
  return static_cast<uint64_t>(value * static_cast<double>(scale));
}

ErrorAdvice AdviceFor(int code) {
  switch (code) {
    case 120:
      return {"invalid request", "check the arguments (add --help to the command)"};
    case 121:
      return {"the shares cannot be listed", "check the platform file etc/orvane/platform.json"};
    case 502:
      return {"a system call failed", "the system log has the details"};
    case 503:
      return {"cannot switch user", "run the command as root"};
    case 504:
      return {"a configuration file cannot be read", "repair or remove the file named"};
    case 505:
      return {"a configuration file cannot be saved", "check free space and permissions"};
    case 506:
      return {"another administration command holds the lock", "try again in a moment"};
    case 800:
      return {"no such share", "check the share name in the platform file"};
    case 801:
      return {"cannot change the owner of a file", "check that the service account exists"};
    case 901:
      return {"invalid folder settings", "check the folder's name and switches"};
    case 902:
      return {"the folder is not indexed", "\"fileindexctl folder list\" shows indexed folders"};
    case 903:
      return {"the path cannot be indexed",
              "use a folder of a writable, local share outside recycle bins and snapshots"};
    case 906:
      return {"a queue line is malformed", "the system log has the line"};
    case 913:
      return {"the search engine cannot be reached",
              "check that quixelasticd is running (\"fileindexctl status\")"};
    case 914:
      return {"a file's contents cannot be read", "the system log has the file"};
    case 916:
    case 917:
      return {"the search index does not hold what was expected",
              "rebuild the share's index (\"fileindexctl share rebuild\")"};
    case 609:
      return {"a share's search index is damaged",
              "the rebuild indexes the share's files again from the disk"};
    case 1003:
      return {"the share is short of space", "free some space on the share's volume"};
    default:
      return {"the operation failed", "the system log has the details"};
  }
}

std::string ReasonOf(const std::string& message) {
  const size_t open = message.find(", reason=[");
  if (open == std::string::npos || message.empty() || message.back() != ']') return message;
  return message.substr(open + 10, message.size() - open - 11);
}

}  // namespace ctl
}  // namespace orvane
