// Mutex wraps one process-local pthread mutex; LockMutex holds it for a scope. A failure to lock
// or unlock is logged, never thrown. Neither is copyable.
#ifndef ORVANE_COMMON_LOCK_MUTEX_HPP_
#define ORVANE_COMMON_LOCK_MUTEX_HPP_

#include <pthread.h>

namespace orvane {

class Mutex {
 public:
  Mutex();
  ~Mutex();
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  bool Lock();
  bool TryLock();
  bool Unlock();

 private:
  pthread_mutex_t mutex_;
};

class LockMutex {
 public:
  explicit LockMutex(Mutex& mutex);
  ~LockMutex();
  LockMutex(const LockMutex&) = delete;
  LockMutex& operator=(const LockMutex&) = delete;

 private:
  Mutex& mutex_;
};

}  // namespace orvane

#endif  // ORVANE_COMMON_LOCK_MUTEX_HPP_
