// Runs content extraction in helper processes (fileindex-extract), so that a malformed or hostile
// file can neither crash nor hang the indexer: a helper runs under limits on CPU time, memory,
// open files and output, and is killed when it overruns its time. Helpers are long-lived and
// pooled: a caller borrows an idle one (or starts one), sends it one file and gets it back, so a
// file costs a request rather than a process start. Thread-safe; concurrent callers each get a
// helper of their own.
//
// The helper's protocol, on its standard input and output: a request is one path followed by a
// NUL byte; the reply is one line holding a JSON object, {"fields": {...}} or {"error": "reason"}.
// The helper exits at the end of its input.
#ifndef ORVANE_EXTRACT_EXTRACT_RUNNER_HPP_
#define ORVANE_EXTRACT_EXTRACT_RUNNER_HPP_

#include <json/json.h>
#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace orvane {
namespace extract {

struct ExtractLimits {
  int timeout_ms = 60000;               // wall-clock time for one file before the helper is killed
  // Bytes of reply the helper may print for one file: the longest text with its fields, room
  // left for the escapes of control characters.
  size_t max_output = 24 * 1024 * 1024;
};

// The helper program: $FILEINDEX_EXTRACT_HELPER when set, else "fileindex-extract" in the
// folder of the running program, else /usr/libexec/fileindex/fileindex-extract (under ORVANE_ROOT).
std::string ExtractHelperPath();

// Extracts the contents of `path` in a helper. True with the fields in `*fields`; false with a
// one-line reason in `*error` (the file could not be extracted, or the helper crashed, timed out,
// printed too much or something that is not a reply). A helper that failed is never given
// another file; one that died while idle is replaced without failing the file.
bool RunExtractHelper(const std::string& path, Json::Value* fields, std::string* error,
                      const ExtractLimits& limits = ExtractLimits());

// How many extractions have failed in this process, for the indexer's report.
uint64_t ExtractFailureCount();

// The process ids of the helpers waiting for a file, for tests and diagnostics.
std::vector<pid_t> IdleExtractHelpers();

// Ends the idle helpers and reaps them; the next extraction starts a fresh one.
void CloseIdleExtractHelpers();

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_EXTRACT_RUNNER_HPP_
