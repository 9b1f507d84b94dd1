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

// Entitlement keys consult only the entitlement; then the identifier, UUID,
// attributes and bundle information; a key the plug-in lacks fails all but
// false; array values match on any string element; "?" introduces a type
// operator; a dictionary pattern is an activation rule.
TEST_F(MatchRulesTest, EveryKeyPatternAndOperator) {
  struct Text {
    const char *key, *pattern;
    bool matches;
  };
  const Text texts[] = {{"ENTITLEMENT:ent.string", "NO", true},
                        {"ENTITLEMENT:Version", "10.10", false},
                        {"UXExtensionIdentifier", "com.example.a.ext", true},
                        {"UXExtensionIdentifier", "com.example.A.ext", false},
                        {"OnlyInBundle", "bundle-value", true},
                        {"Name", "BundleName", false},
                        {"UXExtensionVersion", ">=2", true},
                        {"dot.key", "dotted", true},
                        {"Missing", "<>", false},
                        {"EqX", "==x", true},
                        {"EqX", "=x", false},
                        {"Tags", "b", true},
                        {"Tags", "c", false},
                        {"NoTags", "a", false},
                        {"Mixed", "x", true},
                        {"Mixed", "7", false},
                        {"Zero", "0", false},
                        {"One", "1", false},
                        {"Dict", "v", false},
                        {"Bytes", "x", false},
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
                        {"Name", "=?UT-IS:Photo", false}};
  // Keys against true and false, in that order ('1': match).
  const std::pair<const char*, const char*> flags[] = {
      {"ENTITLEMENT:com.corvel.security.app-sandbox", "1-"},
      {"ENTITLEMENT:ent.string", "10"},
      {"ENTITLEMENT:ent.false", "01"},
      {"ENTITLEMENT:ent.zero", "-1"},
      {"ENTITLEMENT:ent.array", "1-"},
      {"ENTITLEMENT:Version", "-1"},
      {"ENTITLEMENT:", "0-"},
      {"entitlement:com.corvel.security.app-sandbox", "0-"},
      {"dot", "-1"},
      {"Missing", "01"},
      {"Empty", "1-"},
      {"Tags", "10"},
      {"NoTags", "10"},
      {"Zero", "01"},
      {"One", "1-"},
      {"Dict", "1-"}};
  const std::string uuid = plugIn->uuid()->string();
  std::string lower = uuid;
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  const std::pair<const char*, Value> others[] = {
      {"com.corvel.uuid", uuid},
      {"com.corvel.uuid", lower},
      {"UXExtensionIdentifier", Strings({"com.example.x", "com.example.a.ext"})},
      {"Missing", Strings({"x"})},
      {"Missing", Value{{"org.example.photo", 1}}},
      {"Tags", Strings({"c", "a"})},
      {"NoTags", Strings({"a"})},
      {"One", 2},
      {"Name", 1.0},
      {"Name", 0},
      {"Name", 2},
      {"Name", 0.5},
      {"Name", Date{0}},
      {"Name", Data{'P'}},
      {"Name", *plugIn->uuid()},
      {"Name", Value::EmptyArray()},
      {"Name", Value(Array{Value(1), Value(true)})},
      {"Name", Value(Array{Strings({"Photo"})})},
      {"Name", Strings({"", "Photo"})},
      {"Rule", Value{{"org.example.photo", 2}}},
      {"Rule", Value{{"org.example.photo", 3}}},
      {"Rule", Value{{"org.example.other", 1}}},
      {"Rule", Value{{"org.example.other", 0}}},
      {"Rule", Value::EmptyDictionary()},
      {"RuleTrue", Value{{"org.example.other", 9}}},
      {"Name", Value{{"Photo", 1}}},
      {"Tags", Value{{"a", 1}}}};
  const char* othersMatch = "101001001000000000110011100";
  ASSERT_EQ(std::string(othersMatch).size(), std::size(others));
  ScopedLogCapture quiet;
  for (const Text& row : texts) {
    EXPECT_EQ(plugIn->match(Value{{row.key, row.pattern}}), row.matches)
        << row.key << " " << row.pattern;
  }
  for (const auto& [key, answers] : flags) {
    for (int i = 0; i < 2; ++i) {
      if (answers[i] == '-') continue;
      EXPECT_EQ(plugIn->match(Value{{key, i == 0}}), answers[i] == '1') << key << " " << (i == 0);
    }
  }
  for (size_t i = 0; i < std::size(others); ++i) {
    const auto& [key, pattern] = others[i];
    EXPECT_EQ(plugIn->match(Value{{key, pattern}}), othersMatch[i] == '1')
        << key << " " << pattern.description();
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
