// The one process-wide mutex that serialises the platform's share and user calls and every
// credential switch. Built on first use (thread-safe static initialisation), destroyed at exit.
#ifndef ORVANE_COMMON_SDK_SDK_MUTEX_HPP_
#define ORVANE_COMMON_SDK_SDK_MUTEX_HPP_

#include "common/lock_mutex.hpp"

namespace orvane {
namespace sdk {

Mutex& SDKMutex();

}  // namespace sdk
}  // namespace orvane

#endif  // ORVANE_COMMON_SDK_SDK_MUTEX_HPP_
