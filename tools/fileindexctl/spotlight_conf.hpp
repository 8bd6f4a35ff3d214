// The smb.conf lines that hand a share's Spotlight searches to the search gateway, and their
// merge into an existing smb.conf. Pure text work plus one atomic file replacement; any thread.
#ifndef ORVANE_TOOLS_FILEINDEXCTL_SPOTLIGHT_CONF_HPP_
#define ORVANE_TOOLS_FILEINDEXCTL_SPOTLIGHT_CONF_HPP_

#include <string>
#include <utility>
#include <vector>

namespace orvane {
namespace ctl {

// The mappings file installed beside the gateway.
constexpr char kSpotlightMappingsPath[] = "/usr/share/fileindex/spotlight_mappings.json";

struct SpotlightSettings {
  std::string share;
  std::string address = "127.0.0.1";
  int port = 9210;
  std::string mappings = kSpotlightMappingsPath;
};

using ConfLines = std::vector<std::pair<std::string, std::string>>;  // key, value

// The [global] lines (the mappings file is read for every share) and the share's own lines.
ConfLines SpotlightGlobalLines(const SpotlightSettings& s);
ConfLines SpotlightShareLines(const SpotlightSettings& s);

// The lines for people to paste, each section with its header.
std::string SpotlightConfText(const SpotlightSettings& s);

// `conf` (the text of an smb.conf) with the lines set: existing settings of the same keys in
// those sections are replaced, the others kept as they are; a missing [global] is added at the
// top. Throws Error naming `conf_path` when the share has no section.
std::string MergeSpotlightConf(const std::string& conf, const std::string& conf_path,
                               const SpotlightSettings& s);

// Merges the lines into the file at `path`, replacing it atomically with its mode kept.
void WriteSpotlightConf(const std::string& path, const SpotlightSettings& s);

}  // namespace ctl
}  // namespace orvane

#endif  // ORVANE_TOOLS_FILEINDEXCTL_SPOTLIGHT_CONF_HPP_
