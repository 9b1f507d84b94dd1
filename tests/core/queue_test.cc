#include "core/queue.h"

#include <gtest/gtest.h>

#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <thread>
#include <vector>

namespace dr {
namespace {

// Work from this thread keeps its order while hundreds of threads wait at
// once (as when many connections die together), mixing sync and async:
// every piece runs once, alone, and every waiter gets its turn (a lost
// wake-up hangs this test).
TEST(SerialQueueTest, RunsWorkOneAtATimeInSubmissionOrder) {
  SerialQueue q("test");
  std::vector<int> order;
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  auto work = [&](int i) {
    if (running.fetch_add(1) != 0) overlapped = true;
    order.push_back(i);  // unguarded on purpose: the queue is the guard
    running.fetch_sub(1);
  };
  constexpr int kThreads = 256, kEach = 20;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kEach; ++i) {
        if ((t + i) % 2) {
          q.sync([&] { work(-1); });
        } else {
          q.async([&] { work(-1); });
        }
      }
    });
  }
  for (int i = 0; i < 200; ++i) {  // sync waits for the work submitted before it
    if (i % 3 == 0) {
      q.sync([&, i] { work(i); });
    } else {
      q.async([&, i] { work(i); });
    }
  }
  for (auto& t : threads) t.join();
  q.sync([] {});
  EXPECT_FALSE(overlapped);
  EXPECT_EQ(order.size(), 200u + kThreads * kEach);
  std::erase(order, -1);
  ASSERT_EQ(order.size(), 200u);
  for (int i = 0; i < 200; ++i) EXPECT_EQ(order[i], i);
}

TEST(SerialQueueTest, SyncRunsOnTheCallersThreadAndKnowsItsQueue) {
  SerialQueue a("a"), b("b");
  const auto caller = std::this_thread::get_id();
  EXPECT_FALSE(a.isCurrent());
  a.sync([&] {
    EXPECT_EQ(std::this_thread::get_id(), caller);
    EXPECT_TRUE(a.isCurrent());
    EXPECT_FALSE(b.isCurrent());
    b.sync([&] {
      EXPECT_TRUE(b.isCurrent());
      EXPECT_TRUE(a.isCurrent());  // still inside a's work
    });
  });
  EXPECT_FALSE(a.isCurrent());
  std::atomic<bool> onWorker{false};
  a.async([&] { onWorker = a.isCurrent() && std::this_thread::get_id() != caller; });
  a.sync([] {});
  EXPECT_TRUE(onWorker);
  EXPECT_EQ(a.syncResult([] { return 42; }), 42);
}

// A thread that enters background priority runs lower than the others; a
// queue keeps the priority of the thread that made it, also when work first
// reaches it from a background thread (threads start as low as their maker),
// and a background queue's thread runs lower.
TEST(SerialQueueTest, BackgroundThreadsLowerOnlyThemselves) {
  auto niceHere = [] { return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::gettid())); };
  const int caller = niceHere();
  if (caller >= 19) GTEST_SKIP() << "already at the lowest priority";
  SerialQueue q("made by a default thread");
  int background = -100, onQueue = -100;
  std::thread([&] {
    EnterBackgroundPriority();
    EnterBackgroundPriority();  // once is enough: not lowered twice
    background = niceHere();
    std::atomic<bool> ran{false};
    q.async([&] {
      onQueue = niceHere();
      ran = true;
    });
    while (!ran) std::this_thread::yield();
  }).join();
  EXPECT_EQ(background, std::min(caller + 10, 19));
  EXPECT_EQ(onQueue, caller);
  EXPECT_EQ(niceHere(), caller);

  SerialQueue low("background", QueuePriority::kBackground);
  int onLow = -100, inSync = -100;
  low.async([&] { onLow = niceHere(); });
  low.sync([&] { inSync = niceHere(); });
  EXPECT_EQ(onLow, std::min(caller + 10, 19));
  EXPECT_EQ(inSync, caller) << "sync() runs on its caller's thread";
}

TEST(SerialQueueTest, DestructionRunsQueuedWork) {
  std::atomic<int> ran{0};
  {
    SerialQueue q("drain");
    for (int i = 0; i < 50; ++i) q.async([&] { ran++; });
  }
  EXPECT_EQ(ran, 50);
}

TEST(SerialQueueDeathTest, SyncFromItsOwnWorkStopsTheProcess) {
  EXPECT_DEATH(
      {
        SerialQueue q("self");
        q.sync([&] { q.sync([] {}); });
      },
      "would deadlock");
  EXPECT_DEATH(
      {
        SerialQueue q("checked");
        q.assertCurrent("needs the queue");
      },
      "needs the queue: not on queue \"checked\"");
}

}  // namespace
}  // namespace dr
