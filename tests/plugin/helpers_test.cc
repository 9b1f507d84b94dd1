#include "plugin/helpers.h"

#include <gtest/gtest.h>

namespace dr {
namespace {

TEST(CompareVersionStringTest, OrdersVersions) {
  struct Row {
    const char* a;
    const char* b;
    int expected;
  };
  const Row rows[] = {
      {"1.10", "1.9", 1},
      {"2.0", "10.0", -1},
      {"1.0", "1.0.1", -1},
      {"1.0a", "1.0b", -1},
      {"1.2", "1.2", 0},
      {"10", "9", 1},
      {"abc", "abd", -1},
      {"", "", 0},
      {"", "0", -1},
      {"A", "a", -1},  // case-sensitive: capitals first
      {"1.0", "1.0A", -1},
      {"01", "1", 0},  // leading zeros do not change a run's value
      {"1.01", "1.1", 0},
      {"1.002", "1.10", -1},
      // Runs longer than any integer type still compare by value.
      {"1.99999999999999999999999", "1.100000000000000000000000", -1},
      {"123456789012345678901234567890", "123456789012345678901234567891", -1},
      {"2", "1a", 1},
      {"1a2", "1a10", -1},
      // Strings that part inside a digit run compare the whole run.
      {"v1.100", "v1.19", 1},
      {"x01", "x001", 0},
      // Canonically equivalent: precomposed e-acute and e + combining acute.
      {"caf\xc3\xa9", "cafe\xcc\x81", 0},
      {"1.\xc3\xa9", "1.f", -1},
      // Full-width digits are digits too.
      {"\xef\xbc\x91\xef\xbc\x90", "9", 1},
      // Against other characters a digit of any script orders like an ASCII
      // digit; by code point, U+0662 < "3" < "Z" < U+0662 would be a cycle.
      {"\xd9\xa2", "3", -1},
      {"\xd9\xa2", "Z", -1},
      {"c", "\xef\xbc\x91", 1},
      {"\xef\xbc\x91'", "1|", -1},
  };
  for (const Row& r : rows) {
    EXPECT_EQ(compareVersionString(r.a, r.b), r.expected) << r.a << " vs " << r.b;
    EXPECT_EQ(compareVersionString(r.b, r.a), -r.expected) << r.b << " vs " << r.a;
  }
}

TEST(CompareVersionStringTest, InvalidUtf8NeverCrashesAndStaysConsistent) {
  const std::string bad = "1.\xff\xfe";
  EXPECT_EQ(compareVersionString(bad, bad), 0);
  EXPECT_EQ(compareVersionString(bad, "1."), 1);
}

TEST(DictionaryChangingTest, CopiesAndNeverChangesTheReceiver) {
  const Value original = Value{{"a", 1}, {"b", "two"}};
  const Value before = original;

  Value added = dictionaryChangingTo(original, "c", 3);
  EXPECT_EQ(added, (Value{{"a", 1}, {"b", "two"}, {"c", 3}}));
  Value replaced = dictionaryChangingTo(original, "a", "one");
  EXPECT_EQ(replaced["a"], Value("one"));
  Value removed = dictionaryChangingTo(original, "a", Value());
  EXPECT_FALSE(removed.has("a"));
  EXPECT_EQ(removed.size(), 1u);

  // Removing a key that is not there gives an equal copy, in a new node.
  Value same = dictionaryChangingTo(original, "zzz", Value());
  EXPECT_EQ(same, original);
  EXPECT_FALSE(same.sameNode(original));

  EXPECT_EQ(original, before);
  EXPECT_TRUE(original.sameNode(before));
  EXPECT_EQ(original["a"], Value(1));

  EXPECT_TRUE(dictionaryChangingTo(Value(), "a", 1).isAbsent());
  EXPECT_TRUE(dictionaryChangingTo(Value("text"), "a", 1).isAbsent());
}

TEST(MakeErrorTest, BuildsErrorsOfTheDaemonsDomain) {
  Error plain = DRMakeError(12);
  EXPECT_EQ(plain.domain(), "Dromon");
  EXPECT_EQ(plain.code(), 12);
  EXPECT_FALSE(plain.ownDescription().has_value());

  Error described = DRMakeError(2, "Registrar failed to register the plug-in");
  EXPECT_EQ(described.ownDescription(), "Registrar failed to register the plug-in");

  Error formatted = DRMakeErrorWithFormat(7, "found database version %d needed version %d", 15, 16);
  EXPECT_EQ(formatted.code(), 7);
  EXPECT_EQ(formatted.localizedDescription(), "found database version 15 needed version 16");

  Error noFormat = DRMakeErrorWithFormat(4, nullptr, 1, 2);
  EXPECT_FALSE(noFormat.ownDescription().has_value());
  EXPECT_EQ(noFormat.localizedDescription(), "Dromon error 4");
}

}  // namespace
}  // namespace dr
