#include "common/sdk/sdk_mutex.hpp"

namespace orvane {
namespace sdk {

Mutex& SDKMutex() {
  static Mutex mutex;
  return mutex;
}

}  // namespace sdk
}  // namespace orvane
