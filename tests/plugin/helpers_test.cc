#include "plugin/helpers.h"

#include <gtest/gtest.h>

#include <span>

namespace dr {
namespace {

struct VersionRow {
  const char *a, *b;
  int expected;
};

// Capitals sort first; leading zeros and run length never change a run's
// value; canonically equivalent text is equal; digits of any script (and
// full-width ones) order like ASCII digits, so U+0662 < "3" < "Z"; invalid
// UTF-8 never crashes.
TEST(CompareVersionStringTest, OrdersVersions) {
  const VersionRow rows[] = {
      {"1.10", "1.9", 1},  {"2.0", "10.0", -1}, {"1.0", "1.0.1", -1},  {"1.0a", "1.0b", -1},
      {"", "", 0},         {"", "0", -1},       {"A", "a", -1},        {"1.0", "1.0A", -1},
      {"01", "1", 0},      {"1.01", "1.1", 0},  {"1.002", "1.10", -1}, {"2", "1a", 1},
      {"1a2", "1a10", -1}, {"x01", "x001", 0},  {"\xd9\xa2", "3", -1}, {"\xd9\xa2", "Z", -1}};
  const VersionRow longer[] = {
      {"1.99999999999999999999999", "1.100000000000000000000000", -1},
      {"123456789012345678901234567890", "123456789012345678901234567891", -1},
      {"caf\xc3\xa9", "cafe\xcc\x81", 0},
      {"\xef\xbc\x91\xef\xbc\x90", "9", 1},
      {"\xef\xbc\x91'", "1|", -1},
      {"1.\xff\xfe", "1.\xff\xfe", 0},
      {"v1.100", "v1.19", 1},
      {"1.\xc3\xa9", "1.f", -1},
      {"c", "\xef\xbc\x91", 1},
      {"1.\xff\xfe", "1.", 1}};
  for (const auto& table :
       {std::span<const VersionRow>(rows), std::span<const VersionRow>(longer)}) {
    for (const VersionRow& r : table) {
      EXPECT_EQ(compareVersionString(r.a, r.b), r.expected) << r.a << " vs " << r.b;
      EXPECT_EQ(compareVersionString(r.b, r.a), -r.expected) << r.b << " vs " << r.a;
    }
  }
}

TEST(DictionaryChangingTest, CopiesAndNeverChangesTheReceiver) {
  const Value original = Value{{"a", 1}, {"b", "two"}};
  EXPECT_EQ(dictionaryChangingTo(original, "c", 3), (Value{{"a", 1}, {"b", "two"}, {"c", 3}}));
  EXPECT_EQ(dictionaryChangingTo(original, "a", "one"), (Value{{"a", "one"}, {"b", "two"}}));
  EXPECT_EQ(dictionaryChangingTo(original, "a", Value()), (Value{{"b", "two"}}));
  Value same = dictionaryChangingTo(original, "zzz", Value());  // an equal copy, in a new node
  EXPECT_EQ(same, original);
  EXPECT_FALSE(same.sameNode(original));
  EXPECT_EQ(original, (Value{{"a", 1}, {"b", "two"}}));
  EXPECT_TRUE(dictionaryChangingTo(Value(), "a", 1).isAbsent());
  EXPECT_TRUE(dictionaryChangingTo(Value("text"), "a", 1).isAbsent());
}

TEST(MakeErrorTest, BuildsErrorsOfTheDaemonsDomain) {
  EXPECT_EQ(DRMakeError(12), Error("Dromon", 12));
  EXPECT_EQ(DRMakeError(2, "no").ownDescription(), "no");
  EXPECT_EQ(DRMakeErrorWithFormat(7, "found %d needed %d", 15, 16).localizedDescription(),
            "found 15 needed 16");
  EXPECT_EQ(DRMakeErrorWithFormat(4, nullptr, 1, 2).localizedDescription(), "Dromon error 4");
}

}  // namespace
}  // namespace dr
