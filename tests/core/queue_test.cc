#include "core/queue.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <future>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "core/turn_queue.h"

namespace dr {
namespace {

std::promise<void> Hold(SerialQueue& q) {
  std::promise<void> released;
  q.async([f = released.get_future().share()] { f.wait(); });
  return released;
}

TEST(SerialQueueTest, RunsWorkOneAtATimeInSubmissionOrder) {
  SerialQueue q("test");
  TurnQueue turns(&q);
  constexpr int kThreads = 128, kEach = 200;
  std::map<uint64_t, std::vector<int>> seen;  // unguarded on purpose: the queue is the guard
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  auto work = [&](uint64_t source, int i) {
    return [&, source, i] {
      if (running.fetch_add(1) != 0) overlapped = true;
      seen[source].push_back(i);
      running.fetch_sub(1);
    };
  };
  std::vector<std::thread> threads;
  for (uint64_t t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kEach; ++i) {
        turns.submit(t, work(t, i));
        if (i % 10 == 0) i % 20 ? q.async(work(1000 + t, i)) : q.sync(work(1000 + t, i));
      }
    });
  }
  for (int i = 0; i < kEach; ++i) i % 3 ? q.async(work(999, i)) : q.sync(work(999, i));
  for (auto& th : threads) th.join();
  q.sync([] {});
  EXPECT_FALSE(overlapped);
  ASSERT_EQ(seen.size(), 2u * kThreads + 1);
  for (const auto& [source, items] : seen) {
    EXPECT_EQ(items.size(), source >= 1000 ? kEach / 10 : kEach) << source;
    EXPECT_EQ(std::adjacent_find(items.begin(), items.end(), std::greater_equal<int>()),
              items.end())
        << source;
  }
  std::atomic<int> ran{0};
  {
    SerialQueue drained("drain");
    for (int i = 0; i < 50; ++i) drained.async([&] { ran++; });
  }
  EXPECT_EQ(ran, 50) << "destruction runs queued work";
}

TEST(SerialQueueTest, SyncRunsOnTheCallerAndBackgroundLowersOnlyItsThread) {
  auto nice = [] { return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::gettid())); };
  const int caller = nice(), low = std::min(caller + 10, 19);
  if (caller >= 19) GTEST_SKIP() << "already at the lowest priority";
  SerialQueue q("made by a default thread"), bg("bg", QueuePriority::kBackground);
  int inBackground = -100, onQueue = -100, onBg = -100, inSync = -100;
  std::thread([&] {
    EnterBackgroundPriority();
    EnterBackgroundPriority();  // not lowered twice
    inBackground = nice();
    q.async([&] { onQueue = nice(); });
    q.sync([] {});
  }).join();
  bg.async([&] { onBg = bg.isCurrent() ? nice() : -1; });
  bg.sync([&] {
    inSync = q.syncResult([&] { return bg.isCurrent() && q.isCurrent() ? nice() : -1; });
  });
  EXPECT_FALSE(q.isCurrent());
  EXPECT_EQ(std::vector<int>({inBackground, onQueue, nice(), onBg, inSync}),
            std::vector<int>({low, caller, caller, low, caller}));
}

TEST(SerialQueueDeathTest, SyncFromItsOwnWorkStopsTheProcess) {
  auto selfSync = [] {
    SerialQueue q("self");
    q.sync([&] { q.sync([] {}); });
  };
  EXPECT_DEATH(selfSync(), "would deadlock");
  EXPECT_DEATH(SerialQueue("checked").assertCurrent("needs"), "needs: not on queue \"checked\"");
}

TEST(TurnQueueTest, SourcesTakeTurnsAndEachKeepsItsOrder) {
  const std::pair<std::string, std::string> cases[] = {{"a1 a2 a3", "a1 a2 a3"},
                                                       {"a1 a2 a3 b1 b2 c1", "a1 b1 c1 a2 b2 a3"},
                                                       {"b1 a1 b2 a2 c1", "b1 a1 c1 b2 a2"},
                                                       {"a1 a2 a3 b1 c1 d1", "a1 b1 c1 d1 a2 a3"},
                                                       {"z1 z2 f1", "z1 f1 z2"},
                                                       {"a1+ b1 c1", "a1 b1 c1 a2"}};
  for (const auto& [submitted, expected] : cases) {
    SerialQueue q("test");
    TurnQueue turns(&q);
    std::string ran;
    std::function<void(std::string)> submit = [&](std::string label) {
      turns.submit(label[0] == 'z' ? 0 : label[0] - 'a' + 1, [&, label] {
        ran += (ran.empty() ? "" : " ") + label.substr(0, 2);
        if (label.ends_with('+')) submit(label.substr(0, 1) + "2");
      });
    };
    std::promise<void> gate = Hold(q);
    std::istringstream in(submitted);
    size_t n = 0;
    for (std::string label; in >> label; ++n) submit(label);
    EXPECT_EQ(turns.waiting(), n);
    gate.set_value();
    q.sync([] {});
    q.sync([] {});  // after the drain that ran items submitted by items
    EXPECT_EQ(ran, expected) << submitted;
    EXPECT_EQ(turns.waiting(), 0u);
  }
}

TEST(TurnQueueTest, ItemsOfAGoneSourceRunOnceThenReleaseIt) {
  for (bool dropTurnQueue : {false, true}) {
    SerialQueue q("test");
    auto turns = std::make_unique<TurnQueue>(&q);
    auto client = std::make_shared<int>(0);
    std::weak_ptr<int> weak = client;
    std::vector<int> ran;
    std::promise<void> gate = Hold(q);
    for (int i = 0; i < 5; ++i) {
      turns->submit(7, [client, &ran] { ran.push_back(++*client); });
      turns->submit(8, [] {});
    }
    client.reset();
    EXPECT_FALSE(weak.expired()) << "the queued items hold the client";
    if (dropTurnQueue) turns.reset();
    gate.set_value();
    q.sync([] {});
    EXPECT_EQ(ran, (std::vector<int>{1, 2, 3, 4, 5})) << dropTurnQueue;
    EXPECT_TRUE(weak.expired()) << "released after its last item";
  }
}

}  // namespace
}  // namespace dr
