#include "core/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <map>
#include <random>

namespace dr {
namespace {

TEST(ValueTest, AbsentReadsAsZeroFalseAndEmpty) {
  const Value absent;
  const Value dict = Value{{"a", 1}};
  // Every way of reaching a missing value reads the same.
  for (const Value* v : {&absent, &dict["missing"], &absent["x"]["y"], &dict.at(3)}) {
    EXPECT_TRUE(v->isAbsent());
    EXPECT_EQ(v->intValue(), 0);
    EXPECT_EQ(v->uintValue(), 0u);
    EXPECT_EQ(v->doubleValue(), 0.0);
    EXPECT_FALSE(v->boolValue());
    EXPECT_EQ(v->stringValue(), "");
    EXPECT_FALSE(v->string().has_value());
    EXPECT_TRUE(v->array().empty());
    EXPECT_TRUE(v->dictionary().empty());
    EXPECT_EQ(v->size(), 0u);
    EXPECT_FALSE(v->has("a"));
  }
  // A string is not a dictionary: indexing it reads absent.
  EXPECT_TRUE(Value("text")["a"].isAbsent());
  EXPECT_EQ(Value("text").intValue(), 0);
  EXPECT_FALSE(Value("1").boolValue());
  // A dictionary never holds an absent value.
  EXPECT_EQ(Value(Dictionary{{"a", 1}, {"gone", Value()}}), (Value{{"a", 1}}));
  EXPECT_EQ(dict.changing("a", Value()).size(), 0u);
}

TEST(ValueTest, NumbersCompareAcrossKindsWithBooleansAsZeroAndOne) {
  struct Row {
    Value a;
    Value b;
    bool equal;
  };
  const Row rows[] = {
      {Value(1), Value(uint64_t{1}), true},
      {Value(1), Value(1.0), true},
      {Value(true), Value(1), true},
      {Value(false), Value(0), true},
      {Value(true), Value(2), false},
      {Value(-1), Value(std::numeric_limits<uint64_t>::max()), false},
      {Value(std::numeric_limits<int64_t>::max()),
       Value(uint64_t{std::numeric_limits<int64_t>::max()}), true},
      // Exact integer comparison: these two differ by one but are the same
      // double.
      {Value(int64_t{9007199254740993}), Value(uint64_t{9007199254740992}), false},
      {Value(0.5), Value(0), false},
      {Value(std::nan("")), Value(std::nan("")), false},
      {Value(1), Value("1"), false},
      {Value(Date{5}), Value(Date{5}), true},
      {Value(Date{5}), Value(5), false},
      {Value(), Value(), true},
      {Value(), Value(0), false},
      {Value(""), Value(), false},
      {Value(Data{1, 2}), Value(Data{1, 2}), true},
      {Value(Array{1, "a"}), Value(Array{1.0, "a"}), true},
      {Value(Array{1, "a"}), Value(Array{"a", 1}), false},
      {Value{{"k", 1}}, Value{{"k", true}}, true},
      {Value{{"k", 1}}, Value{{"k", 1}, {"j", 1}}, false},
  };
  for (const Row& r : rows) {
    EXPECT_EQ(r.a == r.b, r.equal) << r.a.description() << " vs " << r.b.description();
    EXPECT_EQ(r.b == r.a, r.equal) << r.b.description() << " vs " << r.a.description();
  }
  EXPECT_EQ(*Value(-1).compareNumber(Value(std::numeric_limits<uint64_t>::max())),
            std::partial_ordering::less);
  EXPECT_EQ(*Value(true).compareNumber(Value(0.5)), std::partial_ordering::greater);
  EXPECT_FALSE(Value("1").compareNumber(Value(1)).has_value());
}

TEST(ValueTest, NumberConversionsSaturateInsteadOfOverflowing) {
  EXPECT_EQ(Value(std::numeric_limits<uint64_t>::max()).intValue(),
            std::numeric_limits<int64_t>::max());
  EXPECT_EQ(Value(-5).uintValue(), 0u);
  EXPECT_EQ(Value(1e300).intValue(), std::numeric_limits<int64_t>::max());
  EXPECT_EQ(Value(-1e300).intValue(), std::numeric_limits<int64_t>::min());
  EXPECT_EQ(Value(std::nan("")).intValue(), 0);
  EXPECT_EQ(Value(2.9).intValue(), 2);
  EXPECT_TRUE(Value(0.1).boolValue());
}

TEST(ValueTest, DictionariesEnumerateKeysInAscendingByteOrder) {
  Dictionary d;
  for (const char* k : {"b", "a", "\xc3\xa9", "B", "", "aa"}) d[k] = 1;
  const Value dict(d);
  std::vector<std::string> keys;
  for (const auto& [k, v] : dict.dictionary()) keys.emplace_back(k);
  // Bytes above 0x7F sort after ASCII: compared as unsigned.
  EXPECT_EQ(keys, (std::vector<std::string>{"", "B", "a", "aa", "b", "\xc3\xa9"}));
}

TEST(ValueTest, DictionaryChangesAsAnOrderedMapWould) {
  // Random inserts, assignments, hinted inserts and erases against std::map
  // as the model: same entries, same order, same answers.
  std::map<std::string, int> model;
  Dictionary d;
  std::mt19937 random(7);
  auto key = [&] { return "k" + std::to_string(random() % 40); };
  for (int step = 0; step < 4000; ++step) {
    const std::string k = key();
    const int v = static_cast<int>(random() % 1000);
    switch (random() % 7) {
      case 0: {
        auto [it, inserted] = d.emplace(k, v);
        EXPECT_EQ(inserted, model.emplace(k, v).second);
        EXPECT_EQ(it->first, k);
        break;
      }
      case 1:
        EXPECT_EQ(d.insert_or_assign(k, v).second, model.insert_or_assign(k, v).second);
        break;
      case 2:
        d[k] = v;
        model[k] = v;
        break;
      case 3: {
        // A hint anywhere: right or wrong, the entry lands in order.
        auto hint = d.begin() + static_cast<ptrdiff_t>(random() % (d.size() + 1));
        EXPECT_EQ(d.emplace_hint(hint, k, v)->first, k);
        model.emplace(k, v);
        break;
      }
      case 4:
        EXPECT_EQ(d.erase(k), model.erase(k));
        break;
      case 5:
        if (!d.empty()) {
          auto it = d.begin() + static_cast<ptrdiff_t>(random() % d.size());
          model.erase(it->first.str());
          d.erase(it);
        }
        break;
      case 6:
        EXPECT_EQ(d.contains(k), model.count(k) == 1);
        EXPECT_EQ(d.find(k) == d.end(), !model.contains(k));
        break;
    }
    ASSERT_EQ(d.size(), model.size()) << step;
    auto m = model.begin();
    for (const auto& [dk, dv] : d) {
      ASSERT_EQ(dk, m->first) << step;
      ASSERT_EQ(dv.intValue(), m->second) << step;
      ++m;
    }
  }
  // Of two entries with the same key, the first is kept, as std::map does.
  const Dictionary made{{"b", 1}, {"a", 2}, {"b", 3}};
  EXPECT_EQ(Value(made), (Value{{"a", 2}, {"b", 1}}));
}

TEST(ValueTest, DictionaryBuilderTakesKeysInAnyOrderButEachOnce) {
  const struct {
    std::vector<std::string> keys;
    std::vector<bool> added;
  } rows[] = {
      {{"a", "b", "c"}, {true, true, true}},
      {{"c", "b", "a"}, {true, true, true}},
      {{"a", "a"}, {true, false}},
      {{"b", "c", "a", "b"}, {true, true, true, false}},  // duplicate after disorder
      {{"b", "a", "c", "a", "c"}, {true, true, true, false, false}},
      {{"", "\xc3\xa9", "B", ""}, {true, true, true, false}},
  };
  for (const auto& row : rows) {
    DictionaryBuilder builder;
    std::map<std::string, int> model;  // the first value of each key
    for (size_t i = 0; i < row.keys.size(); ++i) {
      EXPECT_EQ(builder.contains(row.keys[i]), model.contains(row.keys[i]));
      EXPECT_EQ(builder.add(row.keys[i], static_cast<int>(i)), row.added[i]) << i;
      model.emplace(row.keys[i], static_cast<int>(i));
      EXPECT_TRUE(builder.contains(row.keys[i]));
    }
    const Dictionary d = builder.finish();
    ASSERT_EQ(d.size(), model.size());
    auto m = model.begin();
    for (const auto& [k, v] : d) {
      EXPECT_EQ(k, m->first);
      EXPECT_EQ(v.intValue(), m->second);
      ++m;
    }
    EXPECT_EQ(builder.size(), 0u);
  }
}

TEST(ValueTest, DepthCountsLevelsOfContainers) {
  const struct {
    Value value;
    size_t depth;
  } rows[] = {
      {Value(), 0},
      {Value("text"), 0},
      {Value::EmptyArray(), 1},
      {Value::EmptyDictionary(), 1},
      {Value{{"a", 1}, {"b", Value(Array{Value(Array{})})}}, 3},
      {Value(Array{Value(1), Value{{"x", Value{{"y", 2}}}}, Value::EmptyArray()}), 3},
  };
  for (const auto& row : rows) EXPECT_EQ(row.value.depth(), row.depth) << row.value.description();
}

TEST(ValueTest, CopiesShareNodesAndChangesMakeNewOnes) {
  const Value inner = Value{{"x", 1}};
  const Value outer = Value{{"inner", inner}};
  EXPECT_TRUE(outer["inner"].sameNode(inner));
  EXPECT_TRUE(Value(outer).sameNode(outer));
  // A changed copy is a new node; the original is untouched.
  Dictionary mutableCopy = outer.dictionary();
  mutableCopy["inner"] = inner.changing("x", 2);
  const Value changed(std::move(mutableCopy));
  EXPECT_FALSE(changed.sameNode(outer));
  EXPECT_EQ(outer, (Value{{"inner", Value{{"x", 1}}}}));
  EXPECT_EQ(changed["inner"]["x"], Value(2));
  EXPECT_EQ(inner["x"], Value(1));
  // Equal contents are not the same node; scalars have no node.
  EXPECT_FALSE((Value{{"x", 1}}).sameNode(inner));
  EXPECT_FALSE(Value(1).sameNode(Value(1)));
}

TEST(ValueTest, UuidTextRoundTripsAndRejectsMalformedText) {
  const Uuid u = Uuid::random();
  EXPECT_EQ(u.bytes[6] >> 4, 4);  // version 4
  EXPECT_EQ(u.bytes[8] & 0xC0, 0x80);
  EXPECT_NE(u, Uuid::random());
  ASSERT_TRUE(Uuid::parse(u.string()).has_value());
  EXPECT_EQ(*Uuid::parse(u.string()), u);
  auto lower = Uuid::parse("1b4e28ba-2fa1-11d2-883f-0016d3cca427");
  ASSERT_TRUE(lower.has_value());
  EXPECT_EQ(lower->string(), "1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  for (const char* bad :
       {"", "1B4E28BA2FA111D2883F0016D3CCA427", "1B4E28BA-2FA1-11D2-883F-0016D3CCA42",
        "1B4E28BA-2FA1-11D2-883F-0016D3CCA4277", "1B4E28BA-2FA1-11D2-883F_0016D3CCA427",
        "1B4E28BA-2FA1-11D2-883F-0016D3CCA42G"}) {
    EXPECT_FALSE(Uuid::parse(bad).has_value()) << bad;
  }
}

TEST(ValueTest, DescriptionIsOneJsonLikeLine) {
  const Uuid u = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  const Value message = Value{{"request", "match"}, {"version", 2}, {"uuids", Array{u}}};
  EXPECT_EQ(message.description(),
            "{ \"request\": \"match\", \"uuids\": [ <uuid 1B4E28BA-2FA1-11D2-883F-0016D3CCA427> ], "
            "\"version\": 2 }");
  EXPECT_EQ(Value(u).description(), "1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  EXPECT_EQ(Value("a\nb").description(), "a\\nb");
  EXPECT_EQ((Value{{"k", "a\"b\n"}}).description(), "{ \"k\": \"a\\\"b\\n\" }");
  EXPECT_EQ(Value().description(), "(null)");
  EXPECT_EQ(Value::EmptyDictionary().description(), "{ }");
  EXPECT_EQ(Value(Array{}).description(), "[ ]");
  EXPECT_EQ(Value(Date{0}).description(), "1970-01-01 00:00:00 +0000");
  EXPECT_EQ(Value(Data{0xde, 0xad, 0xbe, 0xef, 1}).description(), "<deadbeef 01>");
}

}  // namespace
}  // namespace dr
