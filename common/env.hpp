// The seam for time, sleeping and randomness. Library code never calls sleep(), time() or rand()
// directly, so tests swap in a fake Env and run hour-long retry paths in microseconds.
// The current Env is process-wide; swap it only while no other thread uses it.
#ifndef ORVANE_COMMON_ENV_HPP_
#define ORVANE_COMMON_ENV_HPP_

#include <cstdint>
#include <ctime>

namespace orvane {

class Env {
 public:
  virtual ~Env() = default;
  // Wall-clock seconds since the epoch.
  virtual time_t Now();
  // Monotonic microseconds, for measuring intervals.
  virtual int64_t NowMicros();
  virtual void SleepMicros(int64_t micros);
  // The C library's rand(): unseeded unless the program seeds it.
  virtual int Rand();

  // The Env in force: the default one unless a test replaced it.
  static Env* Current();
  // Replaces the Env in force (nullptr restores the default); returns the previous one.
  static Env* Replace(Env* env);
};

// Installs `env` for the lifetime of the scope (tests).
class ScopedEnv {
 public:
  explicit ScopedEnv(Env* env) : previous_(Env::Replace(env)) {}
  ~ScopedEnv() { Env::Replace(previous_); }
  ScopedEnv(const ScopedEnv&) = delete;
  ScopedEnv& operator=(const ScopedEnv&) = delete;

 private:
  Env* previous_;
};

}  // namespace orvane

#endif  // ORVANE_COMMON_ENV_HPP_
