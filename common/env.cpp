#include "common/env.hpp"

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdlib>

namespace orvane {
namespace {

Env& DefaultEnv() {
  static Env env;
  return env;
}

std::atomic<Env*>& CurrentEnv() {
  static std::atomic<Env*> env{&DefaultEnv()};
  return env;
}

}  // namespace

time_t Env::Now() { return std::time(nullptr); }

int64_t Env::NowMicros() {
  return std::chrono::duration_cast<std::chrono::microseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

void Env::SleepMicros(int64_t micros) {
  if (micros <= 0) return;
  struct timespec ts = {static_cast<time_t>(micros / 1000000),
                        static_cast<long>((micros % 1000000) * 1000)};
  const int saved_errno = errno;
  while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
  }
  errno = saved_errno;
}

int Env::Rand() { return std::rand(); }

Env* Env::Current() { return CurrentEnv().load(std::memory_order_acquire); }

Env* Env::Replace(Env* env) {
  return CurrentEnv().exchange(env != nullptr ? env : &DefaultEnv(), std::memory_order_acq_rel);
}

}  // namespace orvane
