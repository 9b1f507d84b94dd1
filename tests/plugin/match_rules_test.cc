#include <gtest/gtest.h>

#include <cctype>
#include <string>
#include <vector>

#include "core/log.h"
#include "plugin/plugin.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/fake_types.h"

namespace dr::test {
namespace {

Value Strings(std::initializer_list<const char*> list) {
  Array a;
  for (const char* s : list) a.emplace_back(s);
  return Value(std::move(a));
}

class MatchRulesTest : public PlugInFixture {
 protected:
  void SetUp() override {
    types.parents["org.example.photo"] = {"org.example.picture"};
    Value attrs{{"Version", "10.10"},
                {"Two", "2"},
                {"Name", "Photo"},
                {"Empty", ""},
                {"EqX", "=x"},
                {"Tags", Strings({"a", "b"})},
                {"NoTags", Value::EmptyArray()},
                {"Mixed", Value(Array{Value(7), Value("x")})},
                {"Zero", 0},
                {"One", 1},
                {"Dict", Value{{"k", "v"}}},
                {"Bytes", Data{'x'}},
                {"dot.key", "dotted"},
                {"Type", "org.example.photo"},
                {"Super", "org.example.picture"},
                {"Rule", Value{{"org.example.picture", 2}}},
                {"RuleTrue", true}};
    Value info = PlugInInfo("a", Value(), attrs)
                     .changing("OnlyInBundle", "bundle-value")
                     .changing("Name", "BundleName");
    plugIn = make(info, Sandboxed()
                            .changing("ent.string", "NO")
                            .changing("ent.false", false)
                            .changing("ent.zero", 0)
                            .changing("ent.array", Value::EmptyArray()));
    ASSERT_TRUE(plugIn);
  }
  PlugInServices services() override {
    PlugInServices s = PlugInFixture::services();
    s.types = &types;
    return s;
  }

  FakeTypeService types;
  std::shared_ptr<DRDPlugIn> plugIn;
};

TEST_F(MatchRulesTest, EveryKeyPatternAndOperator) {
  const std::string uuid = plugIn->uuid()->string();
  std::string lower = uuid;
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  struct Row {
    const char* key;
    Value pattern;
    bool matches;
  };
  const Row rows[] = {
      // Entitlement keys consult only the entitlement.
      {"ENTITLEMENT:com.corvel.security.app-sandbox", true, true},
      {"ENTITLEMENT:ent.string", true, true},
      {"ENTITLEMENT:ent.string", false, false},
      {"ENTITLEMENT:ent.string", "NO", true},
      {"ENTITLEMENT:ent.false", true, false},
      {"ENTITLEMENT:ent.false", false, true},
      {"ENTITLEMENT:ent.zero", false, true},
      {"ENTITLEMENT:ent.array", true, true},
      {"ENTITLEMENT:Version", false, true},
      {"ENTITLEMENT:Version", "10.10", false},
      {"ENTITLEMENT:", true, false},
      {"entitlement:com.corvel.security.app-sandbox", true, false},
      // Identifier, UUID, attributes, then bundle information; no paths.
      {"UXExtensionIdentifier", "com.example.a.ext", true},
      {"UXExtensionIdentifier", "com.example.A.ext", false},
      {"UXExtensionIdentifier", Strings({"com.example.x", "com.example.a.ext"}), true},
      {"com.corvel.uuid", uuid.c_str(), true},
      {"com.corvel.uuid", lower.c_str(), false},
      {"OnlyInBundle", "bundle-value", true},
      {"Name", "BundleName", false},
      {"UXExtensionVersion", ">=2", true},
      {"dot.key", "dotted", true},
      {"dot", false, true},
      // A key the plug-in lacks fails all but false.
      {"Missing", false, true},
      {"Missing", true, false},
      {"Missing", "<>", false},
      {"Missing", Strings({"x"}), false},
      {"Missing", Value{{"org.example.photo", 1}}, false},
      // An empty string is present; operator characters in the operand.
      {"Empty", true, true},
      {"EqX", "==x", true},
      {"EqX", "=x", false},
      // Array values: any string element.
      {"Tags", "b", true},
      {"Tags", "c", false},
      {"Tags", Strings({"c", "a"}), true},
      {"Tags", true, true},
      {"Tags", false, false},
      {"NoTags", "a", false},
      {"NoTags", Strings({"a"}), false},
      {"NoTags", true, true},
      {"NoTags", false, false},
      {"Mixed", "x", true},
      {"Mixed", "7", false},
      // Number, dictionary and data values.
      {"Zero", true, false},
      {"Zero", false, true},
      {"Zero", "0", false},
      {"One", true, true},
      {"One", "1", false},
      {"One", 2, false},
      {"Dict", "v", false},
      {"Dict", true, true},
      {"Bytes", "x", false},
      // Patterns of other types.
      {"Name", 1.0, true},
      {"Name", 0, false},
      {"Name", 2, false},
      {"Name", 0.5, false},
      {"Name", Date{0}, false},
      {"Name", Data{'P'}, false},
      {"Name", *plugIn->uuid(), false},
      {"Name", Value::EmptyArray(), false},
      {"Name", Value(Array{Value(1), Value(true)}), false},
      {"Name", Value(Array{Strings({"Photo"})}), false},
      {"Name", Strings({"", "Photo"}), true},
      // Type operators.
      {"Type", "?UT-CONFORMS:org.example.picture", true},
      {"Type", "?UT-CONFORMS:org.example.photo", true},
      {"Super", "?UT-CONFORMS:org.example.photo", false},
      {"Super", "?UT-IS:org.example.photo", true},
      {"Type", "?UT-IS:org.example.picture", false},
      {"Type", "?UT-CONFORMS:", false},
      {"Tags", "?UT-CONFORMS:b", true},
      {"Type", "?", false},
      {"Type", "?UT-LIKE:x", false},
      {"Type", "?ut-is:org.example.photo", false},
      {"Name", "=?UT-IS:Photo", false},
      // Activation rules.
      {"Rule", Value{{"org.example.photo", 2}}, true},
      {"Rule", Value{{"org.example.photo", 3}}, false},
      {"Rule", Value{{"org.example.other", 1}}, false},
      {"Rule", Value{{"org.example.other", 0}}, true},
      {"Rule", Value::EmptyDictionary(), true},
      {"RuleTrue", Value{{"org.example.other", 9}}, true},
      {"Name", Value{{"Photo", 1}}, false},
      {"Tags", Value{{"a", 1}}, false},
  };
  ScopedLogCapture quiet;
  for (const Row& row : rows) {
    SCOPED_TRACE(std::string(row.key) + " " + row.pattern.description());
    EXPECT_EQ(plugIn->match(Value{{row.key, row.pattern}}), row.matches);
  }

  // Each comparison operator against an operand the value sorts after, is
  // equal to, or sorts before; answers in the order of kOperators ('1' match).
  const char* kOperators[] = {"", "=", "<>", "<", "<=", ">", ">="};
  const char* orderings[][3] = {{"Version", "10.9", "0010011"},   {"Version", "10.10", "1100101"},
                                {"Version", "10.010", "1100101"}, {"Version", "10.11", "0011100"},
                                {"Version", " 10.11", "0010011"}, {"Two", "10", "0011100"},
                                {"Name", "photo", "0011100"},     {"Name", "Photo", "1100101"},
                                {"Name", "", "0010011"},          {"Empty", "", "1100101"},
                                {"Empty", "a", "0011100"},        {"Tags", "a", "1110111"},
                                {"NoTags", "a", "0000000"},       {"Missing", "a", "0000000"}};
  for (const auto& [key, operand, answers] : orderings) {
    for (size_t i = 0; i < std::size(kOperators); ++i) {
      std::string pattern = std::string(kOperators[i]) + operand;
      EXPECT_EQ(plugIn->match(Value{{key, pattern}}), answers[i] == '1') << key << " " << pattern;
    }
  }
  // Whole rules: none, empty, all keys, one failing key, not a dictionary.
  const std::pair<Value, bool> rules[] = {
      {Value(), true},
      {Value::EmptyDictionary(), true},
      {Value{{"Name", "Photo"}, {"Two", "2"}}, true},
      {Value{{"Name", "Photo"}, {"Two", "3"}}, false},
      {Strings({"Name"}), false},
      {Value(true), false},
  };
  for (const auto& [r, matches] : rules) EXPECT_EQ(plugIn->match(r), matches) << r.description();

  // Without a type service a type conforms only to itself.
  auto plain = DRDPlugIn::initWithRGData(plugIn->rgproxy(), PlugInFixture::services());
  ASSERT_TRUE(plain);
  EXPECT_TRUE(plain->matchKeyPattern("Type", "?UT-IS:org.example.photo"));
  EXPECT_FALSE(plain->matchKeyPattern("Type", "?UT-CONFORMS:org.example.picture"));
  EXPECT_TRUE(plain->matchKeyPattern("Rule", Value{{"org.example.picture", 1}}));
}

TEST_F(MatchRulesTest, UnknownOperatorIsLoggedOnlyWhenReached) {
  const std::pair<Value, std::vector<std::string>> rows[] = {
      {Value{{"Name", "?UT-LIKE:x"}}, {"unrecognized match operator:?UT-LIKE:x"}},
      {Value{{"Tags", "?"}}, {"unrecognized match operator:?", "unrecognized match operator:?"}},
      {Value{{"Name", Strings({"Photo", "?x"})}}, {}},
      {Value{{"A-missing", "x"}, {"Name", "?x"}}, {}},
      {Value{{"Missing", "?x"}}, {}},
  };
  for (const auto& [rules, lines] : rows) {
    ScopedLogCapture log;
    plugIn->match(rules);
    EXPECT_EQ(log.lines(), lines) << rules.description();
  }
}

}  // namespace
}  // namespace dr::test
