// Extraction through the converters Debian ships (rich text, manual pages, legacy office files,
// PostScript, DjVu): each runs as a child of the extraction helper, without a shell, with the
// file handed over as an inherited descriptor, its output read through a pipe and the whole
// process group killed when it overruns its time. Keeps nothing between calls except which
// tools were found missing; safe from one thread at a time.
#ifndef ORVANE_EXTRACT_TOOL_EXTRACT_HPP_
#define ORVANE_EXTRACT_TOOL_EXTRACT_HPP_

#include <json/json.h>

#include <string>
#include <vector>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {

// An argument equal to this is replaced by a name the tool opens the input file by.
constexpr char kToolInput[] = "{input}";

struct ToolLimits {
  int timeout_ms = 20000;               // wall-clock time before the tool's process group is killed
  size_t max_output = 8 * 1024 * 1024;  // bytes of output read; the tool is stopped past this
};

enum class ToolOutcome {
  kDone,     // exited 0, or stopped after printing max_output bytes
  kMissing,  // the program is not installed
  kFailed,   // exited with another status or was killed by a signal
  kTimedOut,
};

// Runs `argv` (the program looked up on PATH) with `input_fd` readable by it, standard input and
// error on /dev/null; its standard output in `*output`, a reason in `*error` unless kDone.
ToolOutcome RunTool(const std::vector<std::string>& argv, int input_fd, const ToolLimits& limits,
                    std::string* output, std::string* error);

// The extractors that run a tool. A tool that is not installed leaves the file with no content
// fields and one log line per tool and process; any other failure throws.
void ExtractRtf(const OpenedFile& file, Json::Value& fields);
void ExtractManPage(const OpenedFile& file, Json::Value& fields);
void ExtractLegacyWord(const OpenedFile& file, Json::Value& fields);
void ExtractLegacyExcel(const OpenedFile& file, Json::Value& fields);
void ExtractLegacyPowerPoint(const OpenedFile& file, Json::Value& fields);
void ExtractPostScript(const OpenedFile& file, Json::Value& fields);
void ExtractDjvu(const OpenedFile& file, Json::Value& fields);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_TOOL_EXTRACT_HPP_
