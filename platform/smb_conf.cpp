#include "platform/smb_conf.hpp"

#include <limits.h>
#include <stdlib.h>
#include <strings.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <set>
#include <sstream>

#include "common/error.hpp"

namespace orvane {
namespace platform {
namespace {

constexpr int kMaxIncludeDepth = 32;
constexpr size_t kMaxShareNameBytes = 491;

[[noreturn]] void Fail(const std::string& where, const std::string& fault) {
  throw Error(kErrLoadConfig, where + ": " + fault);
}

std::string Trim(const std::string& s) {
  const size_t begin = s.find_first_not_of(" \t\r");
  if (begin == std::string::npos) return "";
  return s.substr(begin, s.find_last_not_of(" \t\r") - begin + 1);
}

std::string Lower(std::string s) {
  for (char& c : s) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return s;
}

// Samba compares parameter names without regard to case or white space.
std::string FoldKey(const std::string& key) {
  std::string folded;
  for (char c : key) {
    if (c != ' ' && c != '\t') folded += static_cast<char>(tolower(static_cast<unsigned char>(c)));
  }
  return folded;
}

// Section names keep their inner spaces ("My Music"), but runs of them count as one.
std::string CollapseSpaces(const std::string& s) {
  std::string out;
  for (char c : Trim(s)) {
    if (c == '\t') c = ' ';
    if (c == ' ' && !out.empty() && out.back() == ' ') continue;
    out += c;
  }
  return out;
}

std::string DirOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

class Reader {
 public:
  Reader(SmbConf* conf, bool follow_includes) : conf_(conf), follow_includes_(follow_includes) {}

  void ReadFile(const std::string& path, const std::string& included_at) {
    std::ifstream in(path, std::ios::binary);
    if (!in) {
      const std::string why = strerror(errno);
      if (included_at.empty()) Fail(path, "cannot be read: " + why);
      // Samba goes on without an include it cannot open; so do we, and say so.
      conf_->notes.push_back(included_at + ": the included file " + path +
                             " cannot be read (" + why + "); its shares are left out");
      return;
    }
    char resolved[PATH_MAX];
    const std::string identity = realpath(path.c_str(), resolved) ? resolved : path;
    if (open_.count(identity)) {
      Fail(included_at, "includes " + path + ", which is already being read (an include loop); "
                        "remove one of the include lines");
    }
    if (open_.size() >= kMaxIncludeDepth) {
      Fail(included_at, "includes are nested more than " + std::to_string(kMaxIncludeDepth) +
                            " deep; flatten them");
    }
    open_.insert(identity);
    conf_->files.push_back(path);

    std::string line;
    std::string logical;
    int number = 0;
    int first = 0;
    while (std::getline(in, line)) {
      ++number;
      if (!line.empty() && line.back() == '\r') line.pop_back();
      if (logical.empty()) first = number;
      // A backslash at the end of a line continues the line on the next one.
      if (!line.empty() && line.back() == '\\') {
        logical += line.substr(0, line.size() - 1);
        continue;
      }
      logical += line;
      Line(path, first, logical);
      logical.clear();
    }
    if (in.bad()) Fail(path, std::string("cannot be read: ") + strerror(errno));
    if (!logical.empty()) Line(path, first, logical);
    open_.erase(identity);
  }

 private:
  void Line(const std::string& file, int number, const std::string& raw) {
    const std::string text = Trim(raw);
    if (text.empty() || text[0] == '#' || text[0] == ';') return;
    const std::string where = file + ":" + std::to_string(number);
    if (text[0] == '[') {
      // Samba ignores whatever follows the closing bracket on a header line.
      const size_t close = text.find(']');
      if (close == std::string::npos) {
        Fail(where, "the section header " + text + " has no closing \"]\"; write it as [name]");
      }
      const std::string name = CollapseSpaces(text.substr(1, close - 1));
      if (name.empty()) Fail(where, "the section header [] has no name");
      OpenSection(name, where);
      return;
    }
    const size_t eq = text.find('=');
    if (eq == std::string::npos) {
      Fail(where, "\"" + text + "\" is neither a [section] header, a comment nor "
                  "\"name = value\"; fix or remove the line");
    }
    const std::string key = FoldKey(text.substr(0, eq));
    if (key.empty()) Fail(where, "a value without a parameter name; write \"name = value\"");
    // Samba keeps one space of every run of spaces in a value (tabs stay as written), so
    // "/srv/my  docs" and a value continued on an indented line read as it does.
    std::string value;
    for (char c : Trim(text.substr(eq + 1))) {
      if (c != ' ' || value.empty() || value.back() != ' ') value += c;
    }
    if (key == "include" && follow_includes_) {
      Include(value, file, where);
      return;
    }
    SmbSection& section = current_ < 0 ? conf_->global : conf_->sections[current_];
    section.params[key] = SmbSection::Value{value, where};
  }

  void OpenSection(const std::string& name, const std::string& where) {
    const std::string lower = Lower(name);
    if (lower == "global") {
      current_ = -1;
      return;
    }
    for (size_t i = 0; i < conf_->sections.size(); ++i) {
      if (Lower(conf_->sections[i].name) == lower) {  // a repeated header adds to the first
        current_ = static_cast<int>(i);
        return;
      }
    }
    conf_->sections.push_back(SmbSection{name, where, {}});
    current_ = static_cast<int>(conf_->sections.size()) - 1;
  }

  void Include(const std::string& value, const std::string& file, const std::string& where) {
    if (value.empty()) return;
    if (value == "registry") {
      conf_->notes.push_back(where + ": shares kept in Samba's registry are not read");
      return;
    }
    if (value.find('%') != std::string::npos) {
      conf_->notes.push_back(where + ": the include " + value +
                             " depends on who connects (%); its shares are left out");
      return;
    }
    // An include goes on in the section it appears in, as if its lines stood there.
    ReadFile(value[0] == '/' ? value : DirOf(file) + "/" + value, where);
  }

  SmbConf* conf_;
  bool follow_includes_;
  int current_ = -1;  // index into conf_->sections; -1 for [global]
  std::set<std::string> open_;
};

bool ParseBool(const SmbSection::Value& value, const std::string& key) {
  const std::string v = Lower(value.text);
  if (v == "yes" || v == "true" || v == "on" || v == "1") return true;
  if (v == "no" || v == "false" || v == "off" || v == "0") return false;
  Fail(value.where, "\"" + key + " = " + value.text + "\" is not yes or no");
}

// A share's parameter, or the [global] one that stands for every share.
const SmbSection::Value* Param(const SmbConf& conf, const SmbSection& section,
                               const std::string& key) {
  if (const SmbSection::Value* v = section.Find(key)) return v;
  return conf.global.Find(key);
}

bool BoolParam(const SmbConf& conf, const SmbSection& section, const std::string& key,
               bool fallback) {
  const SmbSection::Value* v = Param(conf, section, key);
  return v == nullptr ? fallback : ParseBool(*v, key);
}

// Names in a list parameter: separated by spaces or commas, a name with spaces in quotes.
std::vector<std::string> ListOf(const std::string& text) {
  std::vector<std::string> items;
  std::string item;
  bool quoted = false;
  for (char c : text) {
    if (c == '"') {
      quoted = !quoted;
    } else if (!quoted && (c == ' ' || c == '\t' || c == ',')) {
      if (!item.empty()) items.push_back(item);
      item.clear();
    } else {
      item += c;
    }
  }
  if (!item.empty()) items.push_back(item);
  return items;
}

// The folder as an absolute path without "//" or a trailing "/"; "" when it has "." or "..".
std::string CleanPath(const std::string& path) {
  if (path.empty() || path[0] != '/') return "";
  std::string out;
  std::stringstream parts(path);
  std::string part;
  while (std::getline(parts, part, '/')) {
    if (part.empty()) continue;
    if (part == "." || part == "..") return "";
    out += "/" + part;
  }
  return out;
}

}  // namespace

const SmbSection::Value* SmbSection::Find(const std::string& key) const {
  auto it = params.find(FoldKey(key));
  return it == params.end() ? nullptr : &it->second;
}

SmbConf ReadSmbConf(const std::string& path, bool follow_includes) {
  SmbConf conf;
  conf.global.name = "global";
  Reader reader(&conf, follow_includes);
  reader.ReadFile(path, "");
  return conf;
}

void SharesFromSmbConf(const SmbConf& conf, std::vector<ShareConfig>* shares,
                       std::vector<std::string>* skipped) {
  skipped->insert(skipped->end(), conf.notes.begin(), conf.notes.end());
  for (const SmbSection& section : conf.sections) {
    const std::string lower = Lower(section.name);
    const std::string about = section.where + ": share [" + section.name + "]";
    if (lower == "printers" || BoolParam(conf, section, "printable", false) ||
        BoolParam(conf, section, "print ok", false)) {
      continue;  // printer queues hold no files to search
    }
    if (!BoolParam(conf, section, "available", true)) {
      skipped->push_back(about + " is switched off (available = no)");
      continue;
    }
    const SmbSection::Value* path_value = Param(conf, section, "path");
    if (path_value == nullptr) path_value = Param(conf, section, "directory");
    if (path_value == nullptr || path_value->text.empty()) {
      skipped->push_back(
          lower == "homes"
              ? about + " has no path: users' homes are wherever their accounts say; to index "
                        "them keep them as <folder named homes>/<user> and set "
                        "\"path = <that folder>/%S\""
              : about + " has no path; give it one");
      continue;
    }
    const std::string at_path = path_value->where + ": share [" + section.name + "]";
    std::string path = path_value->text;
    if (lower == "homes") {
      // "<folder>/%S" (or %U, %u) is each user's own folder below one folder of homes.
      for (const char* tail : {"/%S", "/%U", "/%u"}) {
        const size_t n = strlen(tail);
        if (path.size() > n && path.compare(path.size() - n, n, tail) == 0) {
          path.resize(path.size() - n);
          break;
        }
      }
    }
    if (path.find('%') != std::string::npos) {
      skipped->push_back(at_path + ": path " + path_value->text +
                         " depends on who connects (%); only a fixed folder can be indexed");
      continue;
    }
    const std::string clean = CleanPath(path);
    if (clean.empty()) {
      skipped->push_back(at_path + ": path " + path_value->text +
                         " is not an absolute path without \".\" or \"..\"; write it plainly");
      continue;
    }
    // The index locates a share's files by the share's name as the last folder of its path.
    // Samba's names ignore case, so the folder's own spelling names the share when they differ
    // only in case.
    const std::string folder = clean.substr(clean.rfind('/') + 1);
    if (strcasecmp(folder.c_str(), section.name.c_str()) != 0) {
      skipped->push_back(at_path + ": its folder " + clean +
                         " does not bear the share's name; rename the share or the folder so "
                         "that they match");
      continue;
    }
    if (folder.size() > kMaxShareNameBytes) {
      skipped->push_back(about + ": the name is longer than 491 bytes");
      continue;
    }
    ShareConfig share;
    share.name = folder;
    share.path = clean;
    // Samba's "read only" says what clients may do; the index is the server's own and is
    // written as root, so a share that clients may only read is still indexed.
    share.hide_unreadable = BoolParam(conf, section, "hide unreadable", false);
    if (const SmbSection::Value* vfs = Param(conf, section, "vfs objects")) {
      for (const std::string& module : ListOf(vfs->text)) {
        if (module == "recycle") share.recycle_bin = true;
      }
    }
    if (const SmbSection::Value* invalid = Param(conf, section, "invalid users")) {
      for (const std::string& name : ListOf(invalid->text)) {
        const size_t start = name.find_first_not_of("@+&");
        if (start == std::string::npos || name.find('%') != std::string::npos) continue;
        if (start == 0) {
          share.user_access[name] = SHARE_NOACCESS;
        } else {
          share.group_access[name.substr(start)] = SHARE_NOACCESS;
        }
      }
    }
    shares->push_back(std::move(share));
  }
}

}  // namespace platform
}  // namespace orvane
