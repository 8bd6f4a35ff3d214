// A reader of Samba's configuration file and the shares it exports, for servers that have no
// platform.json: sections, parameters, continuation lines and includes, read as Samba reads
// them. Plain values; the functions keep no state and are safe from any thread.
#ifndef ORVANE_PLATFORM_SMB_CONF_HPP_
#define ORVANE_PLATFORM_SMB_CONF_HPP_

#include <map>
#include <string>
#include <vector>

#include "platform/config.hpp"

namespace orvane {
namespace platform {

// One section of the file. Parameter names are kept folded (lower case, no white space), so
// "Read Only" and "readonly" are one key; each value remembers where it was set.
struct SmbSection {
  struct Value {
    std::string text;
    std::string where;  // "file:line"
  };
  std::string name;   // as first spelled, inner white space collapsed
  std::string where;  // "file:line" of its first header
  std::map<std::string, Value> params;

  // The value of `key` (any spelling), or null.
  const Value* Find(const std::string& key) const;
};

struct SmbConf {
  SmbSection global;
  std::vector<SmbSection> sections;  // in order of first appearance; repeated headers merge
  std::vector<std::string> files;    // every file read: the main one, then its includes
  std::vector<std::string> notes;    // includes left out, and why
};

// Reads `path` and the files it includes. Throws Error 504 "file:line: fault; what to do" for a
// file that cannot be read, a header without "]", a line that is neither a header, a comment
// nor "name = value", and an include loop. `follow_includes` false reads one plain file.
SmbConf ReadSmbConf(const std::string& path, bool follow_includes = true);

// The shares that `conf` exports as the platform describes shares. A section that cannot be one
// (a printer, "available = no", no path, a path that depends on who connects, a folder that does
// not bear the share's name) is left out with a note saying why in `skipped`. Throws Error 504
// for a value that is not what its parameter takes (a boolean that is not yes or no). The
// reader's notes come first in `skipped`.
void SharesFromSmbConf(const SmbConf& conf, std::vector<ShareConfig>* shares,
                       std::vector<std::string>* skipped);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_SMB_CONF_HPP_
