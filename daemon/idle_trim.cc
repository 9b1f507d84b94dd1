#include "daemon/idle_trim.h"

#include <malloc.h>

#include <utility>

namespace dr {

IdleTrimmer::IdleTrimmer(std::chrono::milliseconds quiet, std::chrono::milliseconds busy,
                         std::function<void()> trim)
    : quiet_(quiet), busy_(busy), trim_(std::move(trim)), thread_([this] { run(); }) {}

IdleTrimmer::~IdleTrimmer() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    stopping_ = true;
  }
  cv_.notify_all();
  thread_.join();
}

void IdleTrimmer::activity() {
  events_.fetch_add(1, std::memory_order_relaxed);
  if (!asleep_.load(std::memory_order_acquire)) return;
  {
    std::lock_guard<std::mutex> lock(mu_);
    asleep_.store(false);
  }
  cv_.notify_one();
}

void IdleTrimmer::TrimMalloc() { ::malloc_trim(0); }

void IdleTrimmer::run() {
  std::unique_lock<std::mutex> lock(mu_);
  for (;;) {
    cv_.wait(lock, [&] { return !asleep_.load() || stopping_; });
    // Awake: wait until a whole quiet spell passes with no activity, or
    // until the activity has gone on for `busy_`.
    const auto deadline = std::chrono::steady_clock::now() + busy_;
    uint64_t seen = events_.load();
    for (;;) {
      if (cv_.wait_for(lock, quiet_, [&] { return stopping_; })) return;
      const uint64_t now = events_.load();
      if (now == seen || std::chrono::steady_clock::now() >= deadline) break;
      seen = now;
    }
    // Activity from here on wakes the thread again; some that comes while
    // trimming is covered by this trim or the next.
    asleep_.store(true);
    lock.unlock();
    trim_();
    lock.lock();
  }
}

}  // namespace dr
