// The table of armed faults behind the platform's fault seam: a test arms a fault so that the
// Nth following call of a name returns a chosen result, and counts the calls made. The table is
// process-wide and guarded by its own lock; it installs itself as the seam's hook the first time
// a test arms a fault or opens a ScopedFaults, so calls are counted from then on.
#ifndef ORVANE_TEST_FAULTS_HPP_
#define ORVANE_TEST_FAULTS_HPP_

#include <string>

#include "platform/fault.hpp"

namespace orvane {
namespace platform {

// Arms `fault` for call `name`: the first `skip` calls pass untouched, then `times` calls fail
// (times < 0: every call from then on).
void ArmFault(const std::string& name, const Fault& fault, int skip = 0, int times = 1);
void ClearFaults();
// How many times call `name` has been made since the last ClearFaults() (armed or not).
int CallCount(const std::string& name);

// Arms faults for a scope and clears every fault and counter when it ends.
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

#endif  // ORVANE_TEST_FAULTS_HPP_
