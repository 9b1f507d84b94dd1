#include "core/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <map>
#include <random>
#include <set>
#include <thread>
#include <tuple>

#include "core/key.h"

namespace dr {
namespace {

constexpr int64_t kMax = std::numeric_limits<int64_t>::max();
constexpr uint64_t kUMax = std::numeric_limits<uint64_t>::max();

TEST(ValueTest, AbsentAndNonContainersReadAsZeroFalseAndEmpty) {
  const Value dict = Value{{"a", 1}};
  const Value absent, text("text");
  for (const Value* v : {&absent, &dict["missing"], &absent["x"]["y"], &dict.at(3), &text["a"]}) {
    EXPECT_TRUE(v->isAbsent());
    EXPECT_EQ(v->intValue() + v->uintValue() + v->doubleValue() + v->boolValue() + v->size(), 0);
    EXPECT_FALSE(v->string() || v->has("a") || !v->array().empty() || !v->dictionary().empty());
  }
  EXPECT_EQ(Value("1").intValue() + Value("1").uintValue() + Value("1").boolValue(), 0);
  EXPECT_EQ(Value(Dictionary{{"a", 1}, {"gone", Value()}}), dict) << "never holds an absent value";
  EXPECT_EQ(dict.changing("a", Value()).size(), 0u);
  EXPECT_EQ(dict.changing("b", 2), (Value{{"a", 1}, {"b", 2}}));
  EXPECT_EQ(dict, (Value{{"a", 1}})) << "changing() left the original alone";
  const Value outer = Value{{"inner", dict}, {"list", Array{1}}};
  EXPECT_TRUE(outer["inner"].sameNode(dict) && outer["list"] == Value(outer)["list"]);
  EXPECT_FALSE((Value{{"a", 1}}).sameNode(dict) || Value(1).sameNode(Value(1)));
  EXPECT_EQ((Value{{"a", Value(Array{Value{{"b", Value(Array{})}}})}}).depth(), 4u);
}

TEST(ValueTest, NumbersConvertSaturatingAndCompareAcrossKinds) {
  const std::tuple<Value, int64_t, uint64_t, bool> conversions[] = {
      {Value(kUMax), kMax, kUMax, true},
      {Value(-5), -5, 0, true},
      {Value(1e300), kMax, kUMax, true},
      {Value(-1e300), std::numeric_limits<int64_t>::min(), 0, true},
      {Value(2.9), 2, 2, true},
      {Value(std::nan("")), 0, 0, true},
      {Value(0.0), 0, 0, false},
      {Value(Date{5}), 0, 0, false}};
  for (const auto& [v, i, u, b] : conversions) {
    EXPECT_EQ(std::make_tuple(v.intValue(), v.uintValue(), v.boolValue()), std::make_tuple(i, u, b))
        << v.description();
  }
  const std::tuple<Value, Value, bool> rows[] = {
      {Value(1), Value(uint64_t{1}), true},
      {Value(1), Value(1.0), true},
      {Value(true), Value(1), true},
      {Value(true), Value(2), false},
      {Value(-1), Value(kUMax), false},
      {Value(kMax), Value(uint64_t{kMax}), true},
      {Value(int64_t{9007199254740993}), Value(uint64_t{9007199254740992}), false},  // one double
      {Value(std::nan("")), Value(std::nan("")), false},
      {Value(Array{1, "a"}), Value(Array{1.0, "a"}), true},
      {Value(Array{1, "a"}), Value(Array{"a", 1}), false},
      {Value{{"k", 1}}, Value{{"k", true}}, true},
      {Value{{"k", 1}}, Value{{"k", 1}, {"j", 1}}, false}};
  for (const auto& [a, b, equal] : rows) {
    EXPECT_EQ(a == b, equal) << a.description() << " vs " << b.description();
    EXPECT_EQ(b == a, equal) << b.description() << " vs " << a.description();
  }
  EXPECT_EQ(*Value(-1).compareNumber(Value(kUMax)), std::partial_ordering::less);
  EXPECT_EQ(*Value(true).compareNumber(Value(0.5)), std::partial_ordering::greater);
  EXPECT_FALSE(Value("1").compareNumber(Value(1)).has_value());
}

TEST(ValueTest, DictionaryChangesAsAnOrderedMapWould) {
  std::map<std::string, int> model;
  Dictionary d;
  std::mt19937 random(7);
  const char* keys[] = {"", "B", "a", "aa", "b", "\xc3\xa9", "k1", "k2", "k3", "k4", "k5", "z"};
  for (int step = 0; step < 4000; ++step) {
    const std::string k = keys[random() % std::size(keys)];
    const int v = static_cast<int>(random() % 1000);
    EXPECT_EQ(d.find(k) == d.end(), !model.contains(k));
    if (const auto op = random() % 4; op == 0) {
      EXPECT_EQ(d.emplace(k, v).second, model.emplace(k, v).second);
    } else if (op == 1) {  // a hint anywhere, right or wrong
      EXPECT_EQ(d.emplace_hint(d.begin() + random() % (d.size() + 1), k, v)->first, k);
      model.emplace(k, v);
    } else if (op == 2) {
      EXPECT_EQ(d.erase(k), model.erase(k));
    } else if (!d.empty()) {
      auto it = d.begin() + static_cast<ptrdiff_t>(random() % d.size());
      model.erase(it->first.str());
      d.erase(it);
    }
    ASSERT_EQ(d.size(), model.size()) << step;
    auto m = model.begin();
    for (const auto& [dk, dv] : d) {
      ASSERT_EQ(dk, m->first) << step;
      ASSERT_EQ(dv.intValue(), (m++)->second) << step;
    }
  }
  EXPECT_EQ(Value(Dictionary{{"b", 1}, {"a", 2}, {"b", 3}}), (Value{{"a", 2}, {"b", 1}}));
}

TEST(ValueTest, UuidAndDescriptionText) {
  const Uuid u = Uuid::random();
  EXPECT_EQ(std::make_pair(u.bytes[6] >> 4, u.bytes[8] & 0xC0), std::make_pair(4, 0x80));  // v4
  EXPECT_NE(u, Uuid::random());
  EXPECT_EQ(Uuid::parse(u.string()), u);
  EXPECT_EQ(Uuid::parse("1b4e28ba-2fa1-11d2-883f-0016d3cca427")->string(),
            "1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  for (const char* bad :
       {"", "1B4E28BA2FA111D2883F0016D3CCA427", "1B4E28BA-2FA1-11D2-883F-0016D3CCA42",
        "1B4E28BA-2FA1-11D2-883F-0016D3CCA4277", "1B4E28BA-2FA1-11D2-883F_0016D3CCA427",
        "1B4E28BA-2FA1-11D2-883F-0016D3CCA42G"}) {
    EXPECT_FALSE(Uuid::parse(bad).has_value()) << bad;
  }
  EXPECT_EQ((Value{{"r", "m"},
                   {"u", Array{*Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427")}},
                   {"k", "a\"b\n"}})
                .description(),
            "{ \"k\": \"a\\\"b\\n\", \"r\": \"m\", "
            "\"u\": [ <uuid 1B4E28BA-2FA1-11D2-883F-0016D3CCA427> ] }");
  EXPECT_EQ(Value("a\nb").description(), "a\\nb");
  EXPECT_EQ(Value(Data{0xde, 0xad, 0xbe, 0xef, 1}).description(), "<deadbeef 01>");
}

TEST(KeyTest, KeysBeyondTheSharedLengthOwnACopyAndStillCompareByText) {
  const std::string text(Key::kMaxSharedLength + 1, 'x');
  const Key own(text), other(text);
  Key copy = own;
  Key moved = std::move(copy);
  EXPECT_TRUE(copy.empty());  // a moved-from key is ""
  copy = moved;
  EXPECT_EQ(std::string(copy) + std::string(own), text + text);
  EXPECT_FALSE(own.isShared());
  EXPECT_NE(own.data(), other.data());
  EXPECT_EQ(own, other);
}

TEST(KeyTest, SharedTableIsRaceFreeAndBounded) {
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
  std::vector<std::set<const char*>> copies(kTexts);
  for (const auto& keys : made) {
    for (size_t j = 0; j < keys.size(); ++j) {
      ASSERT_EQ(keys[j].view(), "KeyTest.race." + std::to_string(j % kTexts));
      if (keys[j].isShared()) copies[j % kTexts].insert(keys[j].data());
    }
  }
  for (const auto& c : copies) EXPECT_LE(c.size(), 1u);
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
}

}  // namespace
}  // namespace dr
