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

struct Counter {
  std::function<void()> trim() {
    return [this] { count.fetch_add(1); };
  }
  // Waits (a generous bound: a slow machine only makes the test slower)
  // until at least `n` trims ran.
  bool waitFor(int n) const {
    for (auto end = Clock::now() + 10s; Clock::now() < end; std::this_thread::sleep_for(2ms)) {
      if (count.load() >= n) return true;
    }
    return false;
  }
  std::atomic<int> count{0};
};

TEST(IdleTrimmerTest, OneTrimPerQuietSpellAfterActivityAndNoneWhileIdle) {
  Counter idle, c;
  {
    IdleTrimmer untouched(10ms, 50ms, idle.trim());
    std::this_thread::sleep_for(150ms);  // beyond the busy bound too
  }
  EXPECT_EQ(idle.count, 0);
  IdleTrimmer trimmer(10ms, 1000ms, c.trim());
  for (int spell = 1; spell <= 3; ++spell) {
    for (int i = 0; i < 5; ++i) trimmer.activity();  // a burst trims once
    ASSERT_TRUE(c.waitFor(spell)) << spell;
    std::this_thread::sleep_for(100ms);  // quiet: no further trim
    EXPECT_EQ(c.count, spell);
  }
}

// Activity that never pauses for a whole quiet spell still gets trims, at
// most about one per busy bound: each needs a quiet spell (50 ms) since it
// woke, so about 120 activities give a handful, never one per activity.
TEST(IdleTrimmerTest, ContinuedActivityTrimsWithinTheBusyBound) {
  Counter c;
  IdleTrimmer trimmer(50ms, 100ms, c.trim());
  int seenWhileBusy = 0;
  for (const auto end = Clock::now() + 600ms; Clock::now() < end;) {
    trimmer.activity();
    seenWhileBusy = c.count;
    std::this_thread::sleep_for(5ms);
  }
  EXPECT_GE(seenWhileBusy, 1) << "no trim while activity went on";
  EXPECT_LE(seenWhileBusy, 12);
}

TEST(IdleTrimmerTest, DestroyedWhileAwakeStopsWithoutTrimming) {
  Counter c;
  {
    IdleTrimmer trimmer(10s, 10s, c.trim());
    trimmer.activity();
    std::this_thread::sleep_for(20ms);
  }
  EXPECT_EQ(c.count, 0);
}

}  // namespace
}  // namespace dr
