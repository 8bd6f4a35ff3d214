#include "daemons/fileindexd/parse_pool.hpp"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <exception>
#include <mutex>
#include <thread>
#include <utility>

#include "extract/content_extract.hpp"

namespace orvane {
namespace fileindexd {

size_t DefaultParseThreads() { return std::max(2u, std::thread::hardware_concurrency()); }

// Shared with the threads, so that a thread still inside a slow extraction when the pool goes
// away finishes into state that is still there, then ends.
struct ParsePool::State {
  struct Job {
    std::string path;
    bool need_meta;
  };
  std::mutex mu;
  std::condition_variable work;
  std::condition_variable done_cv;
  std::deque<Job> jobs;     // guarded by mu
  std::deque<Result> done;  // guarded by mu
  bool closed = false;      // guarded by mu
};

ParsePool::ParsePool(size_t threads)
    : threads_(std::max<size_t>(1, threads)), state_(std::make_shared<State>()) {}

ParsePool::~ParsePool() {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->closed = true;
    state_->jobs.clear();
  }
  state_->work.notify_all();
}

void ParsePool::StartThread() {
  std::thread([state = state_] {
    std::unique_lock<std::mutex> lock(state->mu);
    for (;;) {
      state->work.wait(lock, [&] { return state->closed || !state->jobs.empty(); });
      if (state->closed) return;
      const State::Job job = std::move(state->jobs.front());
      state->jobs.pop_front();
      lock.unlock();
      Result result;
      result.path = job.path;
      Json::Value config(Json::objectValue);
      config[QUIX::CONTENT_EXTRACT::kKeyNeedMeta] = job.need_meta;
      try {
        QUIX::CONTENT_EXTRACT::ParseFile(job.path, config, result.doc);
        result.ok = true;
      } catch (const std::exception& e) {
        result.error = e.what();
      }
      lock.lock();
      state->done.push_back(std::move(result));
      state->done_cv.notify_all();
    }
  }).detach();
  ++started_;
}

void ParsePool::Submit(const std::string& path, bool need_meta) {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->jobs.push_back(State::Job{path, need_meta});
  }
  ++outstanding_;
  // Threads are started as work comes: a crawl of names only never needs one.
  if (started_ < threads_) StartThread();
  state_->work.notify_one();
}

bool ParsePool::Next(Result* out, bool wait) {
  if (outstanding_ == 0) return false;
  std::unique_lock<std::mutex> lock(state_->mu);
  if (wait) state_->done_cv.wait(lock, [&] { return !state_->done.empty(); });
  if (state_->done.empty()) return false;
  *out = std::move(state_->done.front());
  state_->done.pop_front();
  --outstanding_;
  return true;
}

}  // namespace fileindexd
}  // namespace orvane
