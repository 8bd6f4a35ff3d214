#include "common/lock_mutex.hpp"

#include "common/error.hpp"

namespace orvane {

Mutex::Mutex() { pthread_mutex_init(&mutex_, nullptr); }

Mutex::~Mutex() { pthread_mutex_destroy(&mutex_); }

bool Mutex::Lock() { return pthread_mutex_lock(&mutex_) == 0; }

bool Mutex::TryLock() { return pthread_mutex_trylock(&mutex_) == 0; }

bool Mutex::Unlock() { return pthread_mutex_unlock(&mutex_) == 0; }

// These lines name the unit rather than the file, as every log reader of the system expects.
LockMutex::LockMutex(Mutex& mutex) : mutex_(mutex) {
  ORVANE_LOG_IF_FROM("lock_mutex", !mutex_.Lock());
}

LockMutex::~LockMutex() {
  ORVANE_LOG_IF_FROM("lock_mutex", !mutex_.Unlock());
}

}  // namespace orvane
