#include "platform/platform_error.hpp"

#include "common/log.hpp"

namespace orvane {
namespace platform {
namespace {

thread_local uint32_t t_code = kQErrNone;
thread_local const char* t_file = "";
thread_local int t_line = 0;

}  // namespace

uint32_t QLIBCErrGet() { return t_code; }
const char* QLIBCErrFileGet() { return t_file; }
int QLIBCErrLineGet() { return t_line; }

void QLIBCErrSetAt(uint32_t code, const char* file, int line) {
  t_code = code;
  t_file = SourceName(file);
  t_line = line;
}

}  // namespace platform
}  // namespace orvane
