// The fileindexctl command table: every subcommand with its usage, options and handler.
// Handlers print through Output and throw orvane::Error or UsageError on failure.
#ifndef ORVANE_TOOLS_FILEINDEXCTL_COMMANDS_HPP_
#define ORVANE_TOOLS_FILEINDEXCTL_COMMANDS_HPP_

#include <json/json.h>

#include <functional>
#include <ostream>
#include <set>
#include <string>
#include <vector>

#include "tools/fileindexctl/cli.hpp"

namespace orvane {
namespace ctl {

// Prints either the JSON value (for scripts) or the human form of it.
class Output {
 public:
  Output(std::ostream& out, bool json) : out_(out), json_(json) {}
  bool json() const { return json_; }
  std::ostream& stream() { return out_; }
  void Emit(const Json::Value& value, const std::function<void(std::ostream&)>& human);
  // A confirmation line for people; scripts get {"success": true}.
  void Done(const std::string& message);

 private:
  std::ostream& out_;
  bool json_;
};

struct Command {
  std::string group;  // "" for top-level commands
  std::string name;
  std::string usage;  // the arguments, e.g. "PATH... [--name NAME]"
  std::string summary;
  std::set<std::string> options;  // options taking a value
  std::set<std::string> flags;    // options without one
  size_t max_positional;
  std::function<void(const Args&, Output&)> run;
};

const std::vector<Command>& Commands();

// Pieces of "status" that "doctor" reads too.
// One request and one reply over a daemon's socket; false with the reason when the daemon
// cannot be reached or answers garbage.
bool DaemonExchange(const std::string& socket, const std::string& payload, Json::Value& reply,
                    std::string& error);
// {"name", "running", "pid"} from the daemon's pid file.
Json::Value DaemonStateOf(const std::string& name);
// What "status --json" prints. Throws Error when the folder or status files cannot be read.
Json::Value StatusReport();

}  // namespace ctl
}  // namespace orvane

#endif  // ORVANE_TOOLS_FILEINDEXCTL_COMMANDS_HPP_
