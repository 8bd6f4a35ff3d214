// The fault-injection seam of the platform layer. Every platform call asks FaultFor(<its name>)
// before doing any work; a value means "fail now like this" (a chosen result, errno and platform
// error number) without touching the system. Production installs no hook, so the check is one
// relaxed atomic load; the tests install one that keeps the table of armed faults.
#ifndef ORVANE_PLATFORM_FAULT_HPP_
#define ORVANE_PLATFORM_FAULT_HPP_

#include <cstdint>
#include <optional>

namespace orvane {
namespace platform {

struct Fault {
  int result = -1;          // what the call returns
  int err = 0;              // errno left behind
  uint32_t platform_err = 0;  // what QLIBCErrGet() reports afterwards (0: left unchanged)
  int out = 0;              // written to the call's flag or value output, where it has one
  bool set_out = false;
};

// Decides, for each call by name, whether it fails; it may be called from any thread.
using FaultHook = std::optional<Fault> (*)(const char* name);

// Installs `hook` for the whole process (nullptr: none). The hook must stay callable until it is
// replaced, since a call in flight may still be using it.
void SetFaultHook(FaultHook hook);

// Consulted by each platform call on entry.
std::optional<Fault> FaultFor(const char* name);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_FAULT_HPP_
