#include "daemons/quixelasticd/query_guard.hpp"

#include <poll.h>

#include <string>

#include "common/env.hpp"
#include "daemons/quixelasticd/engine_error.hpp"

namespace orvane {
namespace elasticd {

namespace {

int OnProgress(void* arg) { return static_cast<QueryGuard*>(arg)->ShouldStop() ? 1 : 0; }

}  // namespace

bool QueryGuard::ShouldStop() {
  if (stopped_ != Stop::kNone) return true;
  if (deadline_micros_ > 0 && Env::Current()->NowMicros() >= deadline_micros_) {
    stopped_ = Stop::kDeadline;
    return true;
  }
  if (peer_fd_ >= 0) {
    // A client that closed its end waits for no answer. One that only shut down its writing
    // side after the request (POLLRDHUP) still reads the reply; a Unix socket reports POLLHUP
    // once the peer's both directions are gone.
    struct pollfd p = {peer_fd_, 0, 0};
    if (::poll(&p, 1, 0) > 0 && (p.revents & (POLLHUP | POLLERR)) != 0) {
      stopped_ = Stop::kGone;
      return true;
    }
  }
  return false;
}

void QueryGuard::Throw() const {
  if (stopped_ == Stop::kGone) {
    throw EngineError(kCodeCallerGone, "the client closed its connection: the search was stopped");
  }
  const int64_t seconds = (budget_micros_ + 999999) / 1000000;
  throw EngineError(kCodeSearchTooLong, "the search took longer than " + std::to_string(seconds) +
                                            " s and was stopped: narrow it (more words, a "
                                            "folder, a file type)");
}

ScopedQueryGuard::ScopedQueryGuard(Db& db, QueryGuard* guard) : db_(db) {
  if (guard != nullptr) sqlite3_progress_handler(db_.get(), kSteps, OnProgress, guard);
}

ScopedQueryGuard::~ScopedQueryGuard() { sqlite3_progress_handler(db_.get(), 0, nullptr, nullptr); }

}  // namespace elasticd
}  // namespace orvane
