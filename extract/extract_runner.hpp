// Runs content extraction for one file in the helper process (fileindex-extract), so that a
// malformed or hostile file can neither crash nor hang the indexer: the helper runs under
// limits on CPU time, memory, open files and output, and is killed when it overruns its time.
// Stateless; safe from any thread (each call has its own child process).
#ifndef ORVANE_EXTRACT_EXTRACT_RUNNER_HPP_
#define ORVANE_EXTRACT_EXTRACT_RUNNER_HPP_

#include <json/json.h>

#include <cstddef>
#include <cstdint>
#include <string>

namespace orvane {
namespace extract {

struct ExtractLimits {
  int timeout_ms = 60000;               // wall-clock time before the helper is killed
  size_t max_output = 8 * 1024 * 1024;  // bytes of JSON the helper may print
};

// The helper program: $FILEINDEX_EXTRACT_HELPER when set, else "fileindex-extract" in the
// folder of the running program, else /usr/lib/fileindex/fileindex-extract (under ORVANE_ROOT).
std::string ExtractHelperPath();

// Extracts the contents of `path` in the helper. True with the fields in `*fields`; false with
// a one-line reason in `*error` (the helper failed, crashed, timed out or printed too much).
bool RunExtractHelper(const std::string& path, Json::Value* fields, std::string* error,
                      const ExtractLimits& limits = ExtractLimits());

// How many extractions have failed in this process, for the indexer's report.
uint64_t ExtractFailureCount();

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_EXTRACT_RUNNER_HPP_
