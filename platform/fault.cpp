#include "platform/fault.hpp"

#include <atomic>

namespace orvane {
namespace platform {
namespace {

// A hook is a plain function with no state of its own to publish, so relaxed ordering is enough.
std::atomic<FaultHook> g_hook{nullptr};

}  // namespace

void SetFaultHook(FaultHook hook) { g_hook.store(hook, std::memory_order_relaxed); }

std::optional<Fault> FaultFor(const char* name) {
  const FaultHook hook = g_hook.load(std::memory_order_relaxed);
  if (hook == nullptr) return std::nullopt;
  return hook(name);
}

}  // namespace platform
}  // namespace orvane
