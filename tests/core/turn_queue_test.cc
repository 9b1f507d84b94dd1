#include "core/turn_queue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <map>
#include <string>
#include <thread>
#include <vector>

namespace dr {
namespace {

// Holds a SerialQueue busy until release(), so that work submitted meanwhile
// waits and its order is decided by the queue alone.
class Gate {
 public:
  explicit Gate(SerialQueue& q) {
    q.async([f = released_.get_future().share()] { f.wait(); });
  }
  void release() { released_.set_value(); }

 private:
  std::promise<void> released_;
};

struct Item {
  uint64_t source;
  std::string label;
};

// Items are submitted in the order given while the queue is held; each
// source's items run in that order, sources in turns by first arrival.
TEST(TurnQueueTest, SourcesTakeTurnsAndEachKeepsItsOrder) {
  struct Case {
    const char* name;
    std::vector<Item> submitted;
    std::vector<std::string> expected;
  };
  const std::vector<Case> cases = {
      {"one source runs in order", {{1, "a1"}, {1, "a2"}, {1, "a3"}}, {"a1", "a2", "a3"}},
      {"a pipelining source lets another in after one item",
       {{1, "a1"}, {1, "a2"}, {1, "a3"}, {1, "a4"}, {2, "b1"}},
       {"a1", "b1", "a2", "a3", "a4"}},
      {"three sources, uneven lines",
       {{1, "a1"}, {1, "a2"}, {1, "a3"}, {2, "b1"}, {2, "b2"}, {3, "c1"}},
       {"a1", "b1", "c1", "a2", "b2", "a3"}},
      {"arrivals interleaved",
       {{2, "b1"}, {1, "a1"}, {2, "b2"}, {1, "a2"}, {3, "c1"}},
       {"b1", "a1", "c1", "b2", "a2"}},
      {"a long pipeline delays each other source by one item",
       {{1, "a1"}, {1, "a2"}, {1, "a3"}, {1, "a4"}, {2, "b1"}, {3, "c1"}, {4, "d1"}},
       {"a1", "b1", "c1", "d1", "a2", "a3", "a4"}},
      {"source 0 is a source like any other",
       {{0, "z1"}, {0, "z2"}, {5, "f1"}},
       {"z1", "f1", "z2"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    SerialQueue q("test");
    TurnQueue turns(&q);
    std::vector<std::string> ran;
    Gate gate(q);
    for (const Item& item : c.submitted) {
      turns.submit(item.source, [&ran, label = item.label] { ran.push_back(label); });
    }
    EXPECT_EQ(turns.waiting(), c.submitted.size());
    gate.release();
    q.sync([] {});
    EXPECT_EQ(ran, c.expected);
    EXPECT_EQ(turns.waiting(), 0u);
  }
}

// Work that a running item submits for its own source goes to the back of
// the round, behind sources already waiting.
TEST(TurnQueueTest, WorkSubmittedWhileRunningWaitsForTheRound) {
  SerialQueue q("test");
  TurnQueue turns(&q);
  std::vector<std::string> ran;
  Gate gate(q);
  turns.submit(1, [&] {
    ran.push_back("a1");
    turns.submit(1, [&] { ran.push_back("a2"); });
  });
  turns.submit(2, [&] { ran.push_back("b1"); });
  turns.submit(3, [&] { ran.push_back("c1"); });
  gate.release();
  q.sync([] {});
  q.sync([] {});  // a2 was posted while the first drain ran
  EXPECT_EQ(ran, (std::vector<std::string>{"a1", "b1", "c1", "a2"}));
}

// Many threads submitting at once, each for a source of its own, beside work
// posted to the SerialQueue directly: every item runs exactly once, alone,
// and each source's items in the order they were submitted.
TEST(TurnQueueTest, ConcurrentSubmittersEachItemRunsOnceInOrder) {
  SerialQueue q("test");
  TurnQueue turns(&q);
  constexpr int kSources = 16, kEach = 300;
  std::map<uint64_t, std::vector<int>> seen;  // unguarded on purpose: the queue is the guard
  int direct = 0;
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  auto enter = [&] {
    if (running.fetch_add(1) != 0) overlapped = true;
  };
  std::vector<std::thread> threads;
  for (int t = 0; t < kSources; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kEach; ++i) {
        turns.submit(static_cast<uint64_t>(t), [&, t, i] {
          enter();
          seen[static_cast<uint64_t>(t)].push_back(i);
          running.fetch_sub(1);
        });
        if (i % 10 == 0) {
          q.async([&] {
            enter();
            ++direct;
            running.fetch_sub(1);
          });
        }
      }
    });
  }
  for (auto& th : threads) th.join();
  q.sync([] {});
  EXPECT_FALSE(overlapped);
  EXPECT_EQ(direct, kSources * kEach / 10);
  ASSERT_EQ(seen.size(), static_cast<size_t>(kSources));
  for (const auto& [source, items] : seen) {
    ASSERT_EQ(items.size(), static_cast<size_t>(kEach)) << "source " << source;
    for (int i = 0; i < kEach; ++i) ASSERT_EQ(items[i], i) << "source " << source;
  }
  EXPECT_EQ(turns.waiting(), 0u);
}

// A client that dies with requests queued: nobody else holds it, yet each of
// its items still runs exactly once and it is released after the last one,
// also when the TurnQueue itself is gone before the SerialQueue runs them.
TEST(TurnQueueTest, ItemsOfAGoneSourceRunOnceThenReleaseIt) {
  for (bool dropTurnQueue : {false, true}) {
    SCOPED_TRACE(dropTurnQueue ? "TurnQueue gone first" : "TurnQueue kept");
    SerialQueue q("test");
    auto turns = std::make_unique<TurnQueue>(&q);
    struct Client {
      int ran = 0;
    };
    auto client = std::make_shared<Client>();
    std::weak_ptr<Client> weak = client;
    std::vector<int> ranWhileAlive;
    Gate gate(q);
    for (int i = 0; i < 5; ++i) {
      turns->submit(7, [client, &ranWhileAlive] { ranWhileAlive.push_back(++client->ran); });
      turns->submit(8, [] {});
    }
    client.reset();  // the connection is gone
    EXPECT_FALSE(weak.expired()) << "the queued items hold the client";
    if (dropTurnQueue) turns.reset();
    gate.release();
    q.sync([] {});
    EXPECT_EQ(ranWhileAlive, (std::vector<int>{1, 2, 3, 4, 5}));
    EXPECT_TRUE(weak.expired()) << "released after its last item";
  }
}

}  // namespace
}  // namespace dr
