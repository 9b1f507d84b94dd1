#include "core/key.h"

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <thread>
#include <vector>

namespace dr {
namespace {

TEST(KeyTest, ReadsComparesAndCopiesLikeItsText) {
  const std::string longText(Key::kMaxSharedLength + 1, 'x');
  for (const std::string& text : std::vector<std::string>{"", "a", "BNBundleIdentifier",
                                                          std::string("nul\0in", 6), longText}) {
    SCOPED_TRACE(text);
    const Key key(text);
    EXPECT_EQ(key.view(), text);
    EXPECT_EQ(key.size(), text.size());
    EXPECT_EQ(key, text);
    Key copy = key;
    EXPECT_EQ(copy, key);
    Key moved = std::move(copy);
    EXPECT_EQ(moved.view(), text);
    EXPECT_TRUE(copy.empty());  // a moved-from key is ""
    copy = moved;
    EXPECT_EQ(copy.view(), text);
    EXPECT_EQ(std::string(key) + "!", text + "!");
  }
  // Longer texts than the table takes own their copy, and still equal and
  // order with the same text made any other way.
  const Key own(longText), other(longText);
  EXPECT_FALSE(own.isShared());
  EXPECT_NE(own.data(), other.data());
  EXPECT_EQ(own, other);
  // Order is by unsigned bytes, as in a dictionary.
  EXPECT_LT(Key("B"), Key("a"));
  EXPECT_LT(Key("z"), Key("\xc3\xa9"));
  EXPECT_LT(Key("a"), Key("aa"));
}

TEST(KeyTest, EqualTextsMadeOnManyThreadsShareOneCopy) {
  // Eight threads make the same 64 keys at once; every shared key of a text
  // must point at one copy, whichever thread made it first.
  constexpr int kThreads = 8, kTexts = 64;
  std::vector<std::vector<Key>> made(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&made, t] {
      for (int round = 0; round < 50; ++round)
        for (int i = 0; i < kTexts; ++i) made[t].emplace_back("KeyTest.race." + std::to_string(i));
    });
  }
  for (std::thread& thread : threads) thread.join();
  for (int i = 0; i < kTexts; ++i) {
    std::set<const char*> copies;
    for (const auto& keys : made) {
      for (size_t j = static_cast<size_t>(i); j < keys.size(); j += kTexts) {
        ASSERT_EQ(keys[j].view(), "KeyTest.race." + std::to_string(i));
        if (keys[j].isShared()) copies.insert(keys[j].data());
      }
    }
    EXPECT_LE(copies.size(), 1u) << i;
  }
}

TEST(KeyTest, TheSharedTableStopsGrowingAtItsBound) {
  // Far more distinct texts than the table may take: the excess own their
  // text, nothing is lost, and texts shared before stay shared.
  const Key early("KeyTest.early");
  std::vector<Key> keys;
  for (size_t i = 0; i < 2 * Key::kMaxSharedKeys; ++i)
    keys.emplace_back("KeyTest.fill." + std::to_string(i));
  size_t shared = 0;
  for (size_t i = 0; i < keys.size(); ++i) {
    ASSERT_EQ(keys[i].view(), "KeyTest.fill." + std::to_string(i));
    shared += keys[i].isShared();
  }
  EXPECT_LE(shared, Key::kMaxSharedKeys);
  EXPECT_FALSE(Key("KeyTest.after the table is full").isShared());
  if (early.isShared()) {
    EXPECT_EQ(Key("KeyTest.early").data(), early.data());
  }
}

}  // namespace
}  // namespace dr
