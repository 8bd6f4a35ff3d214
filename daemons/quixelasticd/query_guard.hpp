// QueryGuard: stops the SQLite work of one request once its time budget is spent or its client
// has hung up. Installed on a connection for a scope (ScopedQueryGuard), it is consulted from
// SQLite's progress handler on the connection's thread; one thread at a time.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_QUERY_GUARD_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_QUERY_GUARD_HPP_

#include <cstdint>

#include "daemons/quixelasticd/sqlite_util.hpp"

namespace orvane {
namespace elasticd {

class QueryGuard {
 public:
  enum class Stop { kNone, kDeadline, kGone };
  // `deadline_micros` on the Env clock (0: none); `peer_fd` is the client's connection, watched
  // for a hang-up (-1: none); `budget_micros` is what the deadline allowed, for the message.
  QueryGuard(int64_t deadline_micros, int peer_fd, int64_t budget_micros)
      : deadline_micros_(deadline_micros), peer_fd_(peer_fd), budget_micros_(budget_micros) {}

  // Whether the work must stop now; remembers why.
  bool ShouldStop();
  Stop stopped() const { return stopped_; }
  // The deadline on the Env clock; 0 when there is none.
  int64_t deadline_micros() const { return deadline_micros_; }
  // The engine error (code and message) for a stop; call only when stopped() is not kNone.
  [[noreturn]] void Throw() const;

 private:
  int64_t deadline_micros_;
  int peer_fd_;
  int64_t budget_micros_;
  Stop stopped_ = Stop::kNone;
};

// Makes `guard` the progress handler of `db` until the scope ends. Statements stopped by it
// fail with SQLITE_INTERRUPT.
class ScopedQueryGuard {
 public:
  // Virtual-machine steps between two looks at the guard: a look costs a clock read and a poll,
  // about a microsecond; the steps between, some tens of microseconds.
  static constexpr int kSteps = 1000;
  ScopedQueryGuard(Db& db, QueryGuard* guard);
  ~ScopedQueryGuard();
  ScopedQueryGuard(const ScopedQueryGuard&) = delete;
  ScopedQueryGuard& operator=(const ScopedQueryGuard&) = delete;

 private:
  Db& db_;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_QUERY_GUARD_HPP_
