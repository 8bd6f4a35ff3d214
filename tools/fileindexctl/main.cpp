// fileindexctl: administration, search and status of the file index, for people and scripts.
// Run "fileindexctl --help" for the commands. Exit status: 0 success, 1 the operation failed,
// 2 the command line is wrong.
#include <iostream>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/name_codec.hpp"
#include "tools/fileindexctl/cli.hpp"
#include "tools/fileindexctl/commands.hpp"

namespace {

using orvane::ctl::Command;
using orvane::ctl::Commands;

std::string FullName(const Command& c) { return c.group.empty() ? c.name : c.group + " " + c.name; }

void PrintCommands(std::ostream& os, const std::string& group) {
  size_t width = 0;
  for (const Command& c : Commands()) {
    if (group.empty() || c.group == group) width = std::max(width, FullName(c).size());
  }
  for (const Command& c : Commands()) {
    if (!group.empty() && c.group != group) continue;
    os << "  " << FullName(c) << std::string(width - FullName(c).size() + 2, ' ') << c.summary
       << '\n';
  }
}

void PrintHelp(std::ostream& os) {
  os << "usage: fileindexctl [--json] COMMAND [ARGS...]\n\n"
        "Administration, search and status of the file index.\n\n"
        "Commands:\n";
  PrintCommands(os, "");
  os << "\nFolders are named by their share path (/share/folder) or by their folder on disk.\n"
        "--json prints results as JSON for scripts. Add --help to any command for its usage.\n";
}

void PrintUsage(std::ostream& os, const Command& c) {
  os << "usage: fileindexctl " << FullName(c) << (c.usage.empty() ? "" : " " + c.usage) << "\n\n"
     << c.summary << '\n';
}

bool IsHelp(const std::string& arg) { return arg == "--help" || arg == "-h" || arg == "help"; }

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> args;
  bool json = false;
  bool help = false;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--json") {
      json = true;
    } else if (arg == "--help" || arg == "-h") {
      help = true;
    } else {
      args.push_back(arg);
    }
  }
  if (args.empty() || (args.size() == 1 && IsHelp(args[0]))) {
    PrintHelp(std::cout);
    return args.empty() && !help ? 2 : 0;
  }
  // "group name ..." or a top-level "name ...".
  const Command* command = nullptr;
  size_t consumed = 0;
  bool is_group = false;
  for (const Command& c : Commands()) {
    if (c.group.empty() && c.name == args[0]) {
      command = &c;
      consumed = 1;
    } else if (c.group == args[0]) {
      is_group = true;
      if (args.size() > 1 && c.name == args[1]) {
        command = &c;
        consumed = 2;
      }
    }
  }
  if (command == nullptr) {
    if (is_group) {
      if (args.size() > 1 && !IsHelp(args[1])) {
        std::cerr << "fileindexctl: unknown command \"" << args[0] << " " << args[1] << "\"\n";
      }
      std::ostream& os = help || (args.size() > 1 && IsHelp(args[1])) ? std::cout : std::cerr;
      os << "usage: fileindexctl " << args[0] << " COMMAND\n\n";
      PrintCommands(os, args[0]);
      return help || (args.size() > 1 && IsHelp(args[1])) ? 0 : 2;
    }
    std::cerr << "fileindexctl: unknown command \"" << args[0]
              << "\" (\"fileindexctl --help\" lists them)\n";
    return 2;
  }
  if (help) {
    PrintUsage(std::cout, *command);
    return 0;
  }
  try {
    std::set<std::string> known = command->options;
    known.insert(command->flags.begin(), command->flags.end());
    const orvane::ctl::Args parsed(
        std::vector<std::string>(args.begin() + static_cast<long>(consumed), args.end()),
        command->flags);
    parsed.Check(known, command->max_positional);
    orvane::ctl::Output out(std::cout, json);
    command->run(parsed, out);
    return 0;
  } catch (const orvane::ctl::ExitWith& e) {
    return e.status;
  } catch (const orvane::ctl::UsageError& e) {
    // Messages may quote names, which are bytes; the terminal gets U+FFFD for what is not text.
    std::cerr << "fileindexctl: " << orvane::DisplayName(e.what()) << '\n';
    PrintUsage(std::cerr, *command);
    return 2;
  } catch (const orvane::ctl::EngineRefusal& e) {
    std::cerr << "fileindexctl: the search engine turned the request down (engine code "
              << e.engine_code << "): " << orvane::DisplayName(orvane::ctl::ReasonOf(e.message))
              << '\n';
    return 1;
  } catch (const orvane::Error& e) {
    const orvane::ctl::ErrorAdvice advice = orvane::ctl::AdviceFor(e.code);
    std::cerr << "fileindexctl: " << advice.meaning << " (error " << e.code
              << "): " << orvane::DisplayName(orvane::ctl::ReasonOf(e.message)) << "; "
              << advice.hint << '\n';
    return 1;
  } catch (const std::exception& e) {
    std::cerr << "fileindexctl: " << orvane::DisplayName(e.what()) << '\n';
    return 1;
  }
}
