// The fault-injection seam of the platform layer. Every platform call asks FaultFor(<its name>)
// before doing any work; a test arms a fault so that the Nth following call of that name returns
// a chosen result with a chosen errno and platform error number, without touching the system.
// The table is process-wide and guarded by its own lock; with nothing armed the check is one
// relaxed atomic load.
#ifndef ORVANE_PLATFORM_FAULT_HPP_
#define ORVANE_PLATFORM_FAULT_HPP_

#include <cstdint>
#include <optional>
#include <string>

namespace orvane {
namespace platform {

struct Fault {
  int result = -1;          // what the call returns
  int err = 0;              // errno left behind
  uint32_t platform_err = 0;  // what QLIBCErrGet() reports afterwards (0: left unchanged)
  int out = 0;              // written to the call's flag or value output, where it has one
  bool set_out = false;
};

// Arms `fault` for call `name`: the first `skip` calls pass untouched, then `times` calls fail
// (times < 0: every call from then on).
void ArmFault(const std::string& name, const Fault& fault, int skip = 0, int times = 1);
void ClearFaults();
// How many times call `name` has been made since the last ClearFaults() (armed or not).
int CallCount(const std::string& name);

// Consulted by each platform call on entry; a value means "fail now like this". Also counts the
// call.
std::optional<Fault> FaultFor(const char* name);

// Arms faults for a scope and clears every fault and counter when it ends (tests).
class ScopedFaults {
 public:
  ScopedFaults();
  ~ScopedFaults();
  ScopedFaults(const ScopedFaults&) = delete;
  ScopedFaults& operator=(const ScopedFaults&) = delete;

  ScopedFaults& Arm(const std::string& name, const Fault& fault, int skip = 0, int times = 1) {
    ArmFault(name, fault, skip, times);
    return *this;
  }
};

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_FAULT_HPP_
