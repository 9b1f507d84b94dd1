// The rule index is only a prefilter: for every rules dictionary it either
// declines (every record is evaluated) or picks a set of records that holds
// every record DRDPlugIn::match accepts. These tests evaluate every record in
// full and compare.
#include "plugin/plugin_set.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "plugin/helpers.h"
#include "tests/plugin/plugin_fixture.h"

namespace dr::test {
namespace {

constexpr const char* kNotAscii = "v\u00efewer";
constexpr const char* kArabicIndic11 = "\u0661.\u0661";  // "1.1" in Arabic-Indic digits

TEST(VersionEqualityKeyTest, EqualKeysExactlyWhenTheComparisonSaysEqual) {
  const char* texts[] = {"",     "0",     "00",   "1",     "01",  "10",    "1.1",
                         "1.01", "01.01", "1.10", "1.1.0", "v1",  "v01",   "V1",
                         "a0b",  "a00b",  "a0",   "a",     "1a2", "01a02", "1 .1",
                         "1.",   ".1",    "0.1",  "00.1",  "100", "0100",  "0a"};
  for (const char* a : texts) {
    for (const char* b : texts) {
      EXPECT_EQ(*VersionEqualityKey(a) == *VersionEqualityKey(b), compareVersionString(a, b) == 0)
          << '"' << a << "\" vs \"" << b << '"';
    }
  }
  // Text that is not ASCII compares decomposed, with digits of every script.
  EXPECT_FALSE(VersionEqualityKey(kNotAscii));
  EXPECT_FALSE(VersionEqualityKey(kArabicIndic11));
}

class PlugInSetTest : public PlugInFixture {
 protected:
  // One record per row of values for "UXExtensionPointName" (in the
  // attributes, or in the bundle's information dictionary).
  void SetUp() override {
    const Value values[] = {"viewer",
                            "Viewer",
                            "1.1",
                            "1.01",
                            Value(Array{Value("editor"), Value("viewer"), Value("=viewer")}),
                            Value(Array{Value("x"), Value(3)}),
                            3,
                            Value(),
                            kArabicIndic11,
                            Value(Array{Value(kNotAscii), Value("editor")}),
                            true,
                            ""};
    int n = 0;
    for (const Value& v : values) {
      Value attrs = v.isPresent() ? Value{{"UXExtensionPointName", v}} : Value();
      records.push_back(make(PlugInInfo("p" + std::to_string(n++), Value(), attrs)));
    }
    // The key read from the bundle's information dictionary.
    records.push_back(make(PlugInInfo("top").changing("UXExtensionPointName", Value("viewer"))));
    for (const DRDPlugInPtr& r : records) ASSERT_TRUE(r);
  }

  std::vector<DRDPlugInPtr> records;
};

TEST_F(PlugInSetTest, SelectsEveryRecordTheRulesMatch) {
  const std::string point = "UXExtensionPointName";
  auto list = [](std::initializer_list<Value> v) { return Value(Array(v)); };
  // Plain names, the equality operator, equal versions (in any script), and
  // arrays of them, also beside other rules, narrow; ordering and type
  // operators, activation rules, patterns not ASCII and no rules do not.
  struct Row {
    Value rules;
    bool narrows;  // whether the index is used (else every record is evaluated)
  } rows[] = {
      {Value{{point, "viewer"}}, true},
      {Value{{point, "=viewer"}}, true},
      {Value{{point, "1.001"}}, true},
      {Value{{point, "1.1"}}, true},
      {Value{{point, ""}}, true},
      {Value{{point, "nothing"}}, true},
      {Value{{point, list({"editor", 3, "x"})}}, true},
      {Value{{point, list({})}}, true},
      {Value{{point, "viewer"}, {"UXExtensionIdentifier", "com.example.p0.ext"}}, true},
      {Value{{"ENTITLEMENT:com.corvel.security.app-sandbox", "1"}}, true},
      {Value{{point, "viewer"}, {"BNBundleVersion", ">=1"}, {"Missing", false}}, true},
      {Value{{point, "<>viewer"}}, false},
      {Value{{point, list({"viewer", "<2"})}}, false},
      {Value{{point, kNotAscii}}, false},
      {Value{{point, true}}, false},
      {Value{{point, false}}, false},
      {Value{{point, 3}}, false},
      {Value{{point, "viewer"}, {"Other", "?UT-CONFORMS:x"}}, false},
      {Value{{point, list({"viewer", "?UT-IS:x"})}}, false},
      {Value{{point, "viewer"}, {"Other", Value{{"a", 1}}}}, false},
      {Value::EmptyDictionary(), false},
      {Value(), false},
  };
  PlugInSet set(records);
  for (const Row& row : rows) {
    std::optional<std::vector<uint32_t>> chosen = set.mayMatch(row.rules);
    EXPECT_EQ(chosen.has_value(), row.narrows) << row.rules.description();
    if (!chosen) continue;
    EXPECT_TRUE(std::is_sorted(chosen->begin(), chosen->end())) << row.rules.description();
    EXPECT_EQ(std::adjacent_find(chosen->begin(), chosen->end()), chosen->end())
        << row.rules.description();
    for (uint32_t i = 0; i < records.size(); ++i) {
      const bool selected = std::binary_search(chosen->begin(), chosen->end(), i);
      if (records[i]->match(row.rules)) {
        EXPECT_TRUE(selected) << row.rules.description() << ": record " << i;
      }
    }
    EXPECT_LT(chosen->size(), records.size()) << row.rules.description();
  }
  // The values that are not ASCII are always evaluated; the one in another
  // script does match.
  EXPECT_TRUE(records[8]->match(Value{{point, "1.1"}}));
}

TEST_F(PlugInSetTest, KeysBeyondTheLimitAreNotIndexed) {
  PlugInSet set(records);
  for (size_t i = 0; i < PlugInSet::kMaxIndexedKeys; ++i) {
    EXPECT_TRUE(set.mayMatch(Value{{"Key" + std::to_string(i), "v"}})) << i;
  }
  EXPECT_FALSE(set.mayMatch(Value{{"OneMore", "v"}}));
  // Keys indexed before still are.
  EXPECT_TRUE(set.mayMatch(Value{{"Key0", "v"}}));
}

}  // namespace
}  // namespace dr::test
