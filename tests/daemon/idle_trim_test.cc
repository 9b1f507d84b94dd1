// When the trimmer gives memory back: once per quiet spell after activity,
// within the busy bound while activity goes on, never while idle, and a
// trimmer destroyed while awake neither trims nor hangs.
#include "daemon/idle_trim.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

namespace dr {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

class Counter {
 public:
  std::function<void()> trim() {
    return [this] { count_.fetch_add(1); };
  }
  int count() const { return count_.load(); }
  // Waits (a generous bound, so a slow machine only makes the test slower)
  // until at least `n` trims ran.
  bool waitFor(int n) const {
    for (auto end = Clock::now() + 10s; Clock::now() < end;) {
      if (count_.load() >= n) return true;
      std::this_thread::sleep_for(2ms);
    }
    return false;
  }

 private:
  std::atomic<int> count_{0};
};

TEST(IdleTrimmerTest, IdleNeverTrims) {
  Counter c;
  IdleTrimmer trimmer(10ms, 50ms, c.trim());
  std::this_thread::sleep_for(150ms);
  EXPECT_EQ(c.count(), 0);
}

TEST(IdleTrimmerTest, OneTrimPerQuietSpellAfterActivity) {
  Counter c;
  IdleTrimmer trimmer(10ms, 1000ms, c.trim());
  for (int spell = 1; spell <= 3; ++spell) {
    SCOPED_TRACE(spell);
    for (int i = 0; i < 5; ++i) trimmer.activity();  // a burst trims once
    ASSERT_TRUE(c.waitFor(spell));
    std::this_thread::sleep_for(100ms);  // quiet: no further trim
    EXPECT_EQ(c.count(), spell);
  }
}

// Activity that never pauses for a whole quiet spell still gets trims, at
// most about one per busy bound.
TEST(IdleTrimmerTest, ContinuedActivityTrimsWithinTheBusyBound) {
  Counter c;
  IdleTrimmer trimmer(50ms, 100ms, c.trim());
  const auto end = Clock::now() + 600ms;
  int seenWhileBusy = 0;
  while (Clock::now() < end) {
    trimmer.activity();
    seenWhileBusy = c.count();
    std::this_thread::sleep_for(5ms);
  }
  EXPECT_GE(seenWhileBusy, 1) << "no trim while activity went on";
  // Each trim needs at least a quiet spell (50 ms) since it woke, so about
  // 120 activities give a handful of trims, never one per activity.
  EXPECT_LE(seenWhileBusy, 12);
}

TEST(IdleTrimmerTest, DestroyedWhileAwakeStopsWithoutTrimming) {
  Counter c;
  {
    IdleTrimmer trimmer(10s, 10s, c.trim());
    trimmer.activity();
    std::this_thread::sleep_for(20ms);
  }
  EXPECT_EQ(c.count(), 0);
}

}  // namespace
}  // namespace dr
