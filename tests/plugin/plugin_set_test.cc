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
  const char* texts[] = {"",     "0",    "00",    "000",  "1",      "01",     "001",  "10",
                         "1.1",  "1.01", "01.01", "1.10", "1.1.0",  "v1",     "v01",  "V1",
                         "a0b",  "a00b", "a0",    "a",    "viewer", "Viewer", "1a2",  "01a02",
                         "1 .1", "1.",   ".1",    "0.1",  "00.1",   "100",    "0100", "0a"};
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
    const Value values[] = {
        Value("viewer"),
        Value("Viewer"),
        Value("1.1"),
        Value("1.01"),
        Value(Array{Value("editor"), Value("viewer"), Value("=viewer")}),
        Value(Array{Value("x"), Value(3)}),
        Value(3),
        Value(),                // none
        Value(kArabicIndic11),  // compares equal to "1.1"
        Value(Array{Value(kNotAscii), Value("editor")}),
        Value(true),
        Value(""),
    };
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
  struct Row {
    const char* what;
    Value rules;
    bool narrows;  // whether the index is used (else every record is evaluated)
  } rows[] = {
      {"plain name", Value{{point, "viewer"}}, true},
      {"equality operator", Value{{point, "=viewer"}}, true},
      {"leading zeros", Value{{point, "1.001"}}, true},
      {"ASCII pattern meets a value in another script", Value{{point, "1.1"}}, true},
      {"empty pattern", Value{{point, ""}}, true},
      {"no record has it", Value{{point, "nothing"}}, true},
      {"array of names, other elements skipped",
       Value{{point, Value(Array{Value("editor"), Value(3), Value("x")})}}, true},
      {"empty array", Value{{point, Value(Array{})}}, true},
      {"two rules", Value{{point, "viewer"}, {"UXExtensionIdentifier", "com.example.p0.ext"}},
       true},
      {"entitlement rule", Value{{"ENTITLEMENT:com.corvel.security.app-sandbox", "1"}}, true},
      {"one equality rule among others",
       Value{{point, "viewer"}, {"BNBundleVersion", ">=1"}, {"Missing", false}}, true},
      {"ordering operator", Value{{point, "<>viewer"}}, false},
      {"at least", Value{{point, ">=1"}}, false},
      {"array with an operator", Value{{point, Value(Array{Value("viewer"), Value("<2")})}}, false},
      {"pattern not ASCII", Value{{point, kNotAscii}}, false},
      {"true", Value{{point, true}}, false},
      {"false", Value{{point, false}}, false},
      {"number", Value{{point, 3}}, false},
      {"type operator logs", Value{{point, "viewer"}, {"Other", "?UT-CONFORMS:x"}}, false},
      {"type operator in an array",
       Value{{point, Value(Array{Value("viewer"), Value("?UT-IS:x")})}}, false},
      {"activation rule", Value{{point, "viewer"}, {"Other", Value{{"a", 1}}}}, false},
      {"no rules", Value::EmptyDictionary(), false},
      {"absent rules", Value(), false},
  };
  PlugInSet set(records);
  for (const Row& row : rows) {
    std::optional<std::vector<uint32_t>> chosen = set.mayMatch(row.rules);
    EXPECT_EQ(chosen.has_value(), row.narrows) << row.what;
    if (!chosen) continue;
    EXPECT_TRUE(std::is_sorted(chosen->begin(), chosen->end())) << row.what;
    EXPECT_EQ(std::adjacent_find(chosen->begin(), chosen->end()), chosen->end()) << row.what;
    for (uint32_t i = 0; i < records.size(); ++i) {
      const bool selected = std::binary_search(chosen->begin(), chosen->end(), i);
      if (records[i]->match(row.rules)) {
        EXPECT_TRUE(selected) << row.what << ": record " << i;
      }
    }
    EXPECT_LT(chosen->size(), records.size()) << row.what;
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
