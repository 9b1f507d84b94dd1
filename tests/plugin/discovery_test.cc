// Choosing plug-ins for a host: the match rules, the rule index that only
// prefilters (it must keep every record DRDPlugIn::match accepts), and
// discovery's choices end-to-end tests cannot steer: which copy of an
// identifier wins, replacement marks and the one-way workaround bit.
#include "plugin/discovery.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>

#include "core/log.h"
#include "plugin/helpers.h"
#include "plugin/plugin_set.h"
#include "tests/plugin/plugin_fixture.h"

namespace dr::test {
namespace {

class DiscoveryTest : public PlugInFixture {
 protected:
  // A copy of plug-in "com.example.<name>.ext" with entitlements beyond the sandbox.
  DRDPlugInPtr copy(const std::string& name, const std::string& version, bool system,
                    double registered, const Value& entitlements = {}, const Value& attrs = {}) {
    RegistryEntry::Fields f;
    f.onSystemVolume = system;
    f.registrationDate = Date{registered};
    if (!system) f.containingApplication = RegistryApplication{folder / "App.app", "App"};
    Value granted = Sandboxed();
    for (const auto& [k, v] : entitlements.dictionary()) granted = granted.changing(k.str(), v);
    return make(PlugInInfo(name, {}, attrs).changing("BNBundleVersion", Value(version)), granted,
                std::move(f));
  }
  DiscoveryHost host(bool old = false) {
    DiscoveryHost h;
    h.client = &client;
    h.needs17732150Workaround = old;
    return h;
  }
  FakeClient client;
};

// Entitlement keys consult only the entitlement; then the identifier, UUID,
// attributes and bundle information; a key the plug-in lacks fails all but
// false; array values match on any string element; "?" introduces a type
// operator; a dictionary pattern is an activation rule.
TEST_F(DiscoveryTest, MatchRulesEveryKeyPatternAndOperator) {
  FakeTypeService typeService;
  typeService.parents["org.example.photo"] = {"org.example.picture"};
  types = &typeService;
  const Value attrs = J(R"({"Version": "10.10", "Two": "2", "Name": "Photo", "Empty": "",
      "EqX": "=x", "Tags": ["a", "b"], "NoTags": [], "Mixed": [7, "x"], "Zero": 0, "One": 1,
      "Dict": {"k": "v"}, "Bytes": "data", "dot.key": "dotted", "Type": "org.example.photo",
      "Super": "org.example.picture", "Rule": {"org.example.picture": 2}, "RuleTrue": true})");
  auto plugIn =
      make(PlugInInfo("a", {}, attrs.changing("Bytes", Data{'x'}))
               .changing("OnlyInBundle", "bundle-value")
               .changing("Name", "BundleName"),
           J(R"({"com.corvel.security.app-sandbox": true, "ent.string": "NO", "ent.false": false,
            "ent.zero": 0, "ent.array": []})"));
  ASSERT_TRUE(plugIn);
  // key | pattern (JSON) | matches
  const char* rows = R"(
    ENTITLEMENT:ent.string|"NO"|1; ENTITLEMENT:Version|"10.10"|0; OnlyInBundle|"bundle-value"|1;
    UXExtensionIdentifier|"com.example.a.ext"|1; UXExtensionIdentifier|"com.example.A.ext"|0;
    Name|"BundleName"|0; UXExtensionVersion|">=2"|1; dot.key|"dotted"|1; Missing|"<>"|0;
    EqX|"==x"|1; EqX|"=x"|0; Tags|"b"|1; Tags|"c"|0; NoTags|"a"|0; Mixed|"x"|1; Mixed|"7"|0;
    Zero|"0"|0; One|"1"|0; Dict|"v"|0; Bytes|"x"|0; Type|"?UT-CONFORMS:org.example.picture"|1;
    Type|"?UT-CONFORMS:org.example.photo"|1; Super|"?UT-CONFORMS:org.example.photo"|0;
    Super|"?UT-IS:org.example.photo"|1; Type|"?UT-IS:org.example.picture"|0;
    Type|"?UT-CONFORMS:"|0; Tags|"?UT-CONFORMS:b"|1; Type|"?"|0; Type|"?UT-LIKE:x"|0;
    Type|"?ut-is:org.example.photo"|0; Name|"=?UT-IS:Photo"|0;
    ENTITLEMENT:com.corvel.security.app-sandbox|true|1; ENTITLEMENT:ent.string|true|1;
    ENTITLEMENT:ent.string|false|0; ENTITLEMENT:ent.false|true|0; ENTITLEMENT:ent.false|false|1;
    ENTITLEMENT:ent.zero|false|1; ENTITLEMENT:ent.array|true|1; ENTITLEMENT:Version|false|1;
    ENTITLEMENT:|true|0; entitlement:com.corvel.security.app-sandbox|true|0; dot|false|1;
    Missing|true|0; Missing|false|1; Empty|true|1; Tags|true|1; Tags|false|0; NoTags|true|1;
    NoTags|false|0; Zero|true|0; Zero|false|1; One|true|1; Dict|true|1;
    UXExtensionIdentifier|["com.example.x", "com.example.a.ext"]|1; Missing|["x"]|0;
    Missing|{"org.example.photo": 1}|0; Tags|["c", "a"]|1; NoTags|["a"]|0; One|2|0; Name|1.0|1;
    Name|0|0; Name|2|0; Name|0.5|0; Name|[]|0; Name|[1, true]|0; Name|[["Photo"]]|0;
    Name|["", "Photo"]|1; Rule|{"org.example.photo": 2}|1; Rule|{"org.example.photo": 3}|0;
    Rule|{"org.example.other": 1}|0; Rule|{"org.example.other": 0}|1; Rule|{}|1;
    RuleTrue|{"org.example.other": 9}|1; Name|{"Photo": 1}|0; Tags|{"a": 1}|0)";
  ScopedLogCapture quiet;
  for (const auto& row : Table(rows)) {
    EXPECT_EQ(plugIn->match(Value{{row[0], J(row[1])}}), row[2] == "1") << row[0] << " " << row[1];
  }
  const std::string uuid = plugIn->uuid()->string();
  std::string lower = uuid;
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  EXPECT_TRUE(plugIn->match(Value{{"com.corvel.uuid", uuid}}));
  EXPECT_FALSE(plugIn->match(Value{{"com.corvel.uuid", lower}}));
  for (const Value& v : {Value(Date{0}), Value(Data{'P'}), Value(*plugIn->uuid())}) {
    EXPECT_FALSE(plugIn->match(Value{{"Name", v}})) << v.description();
  }
  // Each comparison operator against an operand the value sorts after, is
  // equal to, or sorts before; answers in the order of `operators`.
  const char* operators[] = {"", "=", "<>", "<", "<=", ">", ">="};
  const char* orderings = R"(Version|10.9|0010011; Version|10.10|1100101; Version|10.010|1100101;
      Version|10.11|0011100; Version| 10.11|0010011; Two|10|0011100; Name|photo|0011100;
      Name|Photo|1100101; Name||0010011; Empty||1100101; Empty|a|0011100; Tags|a|1110111;
      NoTags|a|0000000; Missing|a|0000000)";
  for (const auto& row : Table(orderings)) {
    for (size_t i = 0; i < std::size(operators); ++i) {
      std::string pattern = operators[i] + row[1];
      EXPECT_EQ(plugIn->match(Value{{row[0], pattern}}), row[2][i] == '1') << row[0] << pattern;
    }
  }
  // Whole rules: none, empty, all keys, one failing key, not a dictionary.
  EXPECT_TRUE(plugIn->match(Value()) && plugIn->match(J("{}")) &&
              plugIn->match(J(R"({"Name": "Photo", "Two": "2"})")));
  EXPECT_FALSE(plugIn->match(J(R"({"Name": "Photo", "Two": "3"})")) ||
               plugIn->match(J(R"(["Name"])")) || plugIn->match(Value(true)));
  // Without a type service a type conforms only to itself.
  auto plain = DRDPlugIn::initWithRGData(plugIn->rgproxy(), PlugInServices{});
  ASSERT_TRUE(plain);
  EXPECT_TRUE(plain->matchKeyPattern("Type", "?UT-IS:org.example.photo"));
  EXPECT_FALSE(plain->matchKeyPattern("Type", "?UT-CONFORMS:org.example.picture"));
  EXPECT_TRUE(plain->matchKeyPattern("Rule", J(R"({"org.example.picture": 1})")));
}

// Plain names, the equality operator, equal versions (in any script), and
// arrays of them, also beside other rules, narrow; ordering and type
// operators, activation rules, patterns not ASCII and no rules do not.
TEST_F(DiscoveryTest, RuleIndexSelectsEveryRecordTheRulesMatch) {
  const Lines texts = Table(
      "|0|00|1|01|10|1.1|1.01|01.01|1.10|1.1.0|v1|v01|V1|a0b|a00b|a0|a|1a2|"
      "01a02|1 .1|1.|.1|0.1|00.1|100|0100|0a")[0];
  for (const std::string& a : texts) {
    for (const std::string& b : texts) {
      EXPECT_EQ(*VersionEqualityKey(a) == *VersionEqualityKey(b), compareVersionString(a, b) == 0)
          << '"' << a << "\" vs \"" << b << '"';
    }
  }
  EXPECT_FALSE(VersionEqualityKey("v\u00efewer") || VersionEqualityKey("\u0661.\u0661"));

  std::vector<DRDPlugInPtr> records;
  const Value values = J(R"(["viewer", "Viewer", "1.1", "1.01", ["editor", "viewer", "=viewer"],
      ["x", 3], 3, "\u0661.\u0661", ["v\u00efewer", "editor"], true, ""])");
  for (const Value& v : values.array()) {
    records.push_back(make(PlugInInfo("p" + std::to_string(records.size()), {}, {{"K", v}})));
  }
  records.push_back(make(PlugInInfo("none")));
  records.push_back(make(PlugInInfo("top").changing("K", "viewer")));  // in the bundle information
  const char* rows = R"(
    {"K": "viewer"}|1; {"K": "=viewer"}|1; {"K": "1.001"}|1; {"K": "1.1"}|1; {"K": ""}|1;
    {"K": "nothing"}|1; {"K": ["editor", 3, "x"]}|1; {"K": []}|1;
    {"K": "viewer", "UXExtensionIdentifier": "com.example.p0.ext"}|1;
    {"K": "1.1", "UXExtensionPointIdentifier": "com.example.point"}|1;
    {"ENTITLEMENT:com.corvel.security.app-sandbox": "1"}|1;
    {"K": "viewer", "BNBundleVersion": ">=1", "Missing": false}|1;
    {"K": "<>viewer"}|0; {"K": ["viewer", "<2"]}|0; {"K": "v\u00efewer"}|0; {"K": true}|0;
    {"K": false}|0; {"K": 3}|0; {"K": "viewer", "Other": "?UT-CONFORMS:x"}|0;
    {"K": ["viewer", "?UT-IS:x"]}|0; {"K": "viewer", "Other": {"a": 1}}|0; {}|0)";
  PlugInSet set(records);
  for (const auto& row : Table(rows)) {
    const Value rules = J(row[0]);
    std::optional<std::vector<uint32_t>> chosen = set.mayMatch(rules);
    ASSERT_EQ(chosen.has_value(), row[1] == "1") << row[0];
    if (!chosen) continue;
    EXPECT_TRUE(std::is_sorted(chosen->begin(), chosen->end())) << row[0];
    EXPECT_EQ(std::adjacent_find(chosen->begin(), chosen->end()), chosen->end()) << row[0];
    for (uint32_t i = 0; i < records.size(); ++i) {
      EXPECT_TRUE(!records[i]->match(rules) ||
                  std::binary_search(chosen->begin(), chosen->end(), i))
          << row[0] << ": record " << i;
    }
    EXPECT_LT(chosen->size(), records.size()) << row[0];
  }
  EXPECT_FALSE(set.mayMatch(Value()));
  EXPECT_TRUE(records[7]->match(J(R"({"K": "1.1"})")));  // the one in another script
  // Keys beyond the limit are not indexed; keys indexed before still are.
  PlugInSet fresh(records);
  for (size_t i = 0; i < PlugInSet::kMaxIndexedKeys; ++i) {
    EXPECT_TRUE(fresh.mayMatch(Value{{"Key" + std::to_string(i), "v"}})) << i;
  }
  EXPECT_FALSE(fresh.mayMatch(Value{{"OneMore", "v"}}));
  EXPECT_TRUE(fresh.mayMatch(Value{{"Key0", "v"}}));
}

// Newer versions win; then a system copy over an app copy, unless the app
// copy was registered later; equal times keep the first. Every version
// (0x1) keeps unequal versions, and with duplicates (0x4) equal ones too.
TEST_F(DiscoveryTest, DuplicatesOfOneIdentifier) {
  // version | (s)ystem or (a)pp | registered, for each copy; flags; the copies returned
  const char* rows = R"(1.2|s|100|1.10|s|50|0|2; 1.10|s|50|1.2|s|100|0|1; 1|a|200|1|s|100|0|2;
      1|a|100|1|a|200|0|2; 1|a|100|1|a|100|0|1; 1|a|200|1|a|100|0|1; 1|s|100|1|a|200|0|2;
      1.2|s|100|1.10|s|50|1|12; 1|s|100|1|s|50|1|1; 1|s|100|1|s|50|5|12; 1|s|100|1|s|50|4|1)";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0] + r[1] + r[2] + " " + r[3] + r[4] + r[5] + " " + r[6]);
    Discovery d(host(), Value(), std::stoul(r[6]), Value(), {});
    DRDPlugInPtr a = copy("p", r[0], r[1] == "s", std::stod(r[2]));
    DRDPlugInPtr b = copy("p", r[3], r[4] == "s", std::stod(r[5]));
    d.examine(a);
    d.examine(b);
    std::string returned;
    const Value found = d.finish();
    for (const Value& form : found.array())
      returned += form["uuid"].stringValue() == a->uuid()->string() ? "1" : "2";
    EXPECT_EQ(returned, r[7]);
    for (const Discovery::Verdict& v : d.verdicts()) {  // the copy left out names the winner
      EXPECT_TRUE(v.outcome != DiscoveryOutcome::kSuperseded || v.by == (v.plugIn == a ? b : a));
    }
  }
}

// The replacer itself is vetoed; the replaced form still names it.
TEST_F(DiscoveryTest, ReplacementMarksSurviveAVeto) {
  const char* kReplace = "com.corvel.developer.replace-plugin";
  DRDPlugInPtr old = copy("old", "1", true, 1);
  DRDPlugInPtr replacer =
      copy("new", "1", true, 1, Value{{kReplace, J(R"(["com.example.old.ext", 7])")}});
  DRDPlugInPtr self = copy("self", "1", true, 1, Value{{kReplace, "com.example.self.ext"}});
  DiscoveryServices services;
  services.mayUse = [](const Value& form) {
    return form["identifier"].stringValue() != "com.example.new.ext";
  };
  Discovery d(host(), Value(), 0, Value(), services);
  for (const DRDPlugInPtr& p : {old, replacer, self}) d.examine(p);
  Value matches = d.finish();
  ASSERT_EQ(matches.size(), 2u);
  EXPECT_EQ(matches.at(0)["overrider"].stringValue(), replacer->uuid()->string());
  EXPECT_FALSE(matches.at(0).has("overriding"));
  EXPECT_EQ(matches.at(1)["overrider"].stringValue(), self->uuid()->string());
  EXPECT_EQ(matches.at(1)["overriding"].stringValue(), "com.example.self.ext");
  EXPECT_EQ(d.verdicts()[1].outcome, DiscoveryOutcome::kVetoed);
}

// Older listed hosts need the workaround. Only such a host finds an internal
// filter (one that fails the rules too: its visibility check still sets the
// bit that keeps equal copies below); the chosen candidates must give the
// same answer, flags and log as all.
TEST_F(DiscoveryTest, WorkaroundBitAndChosenCandidates) {
  const char* hosts = R"(com.corvel.Brivane|10.1.4|1; com.corvel.Brivane|9.9|1;
      com.corvel.BrivaneTrial|10.1|1; com.corvel.Quellor|4.1.9|1; com.corvel.vorelapp|5.1|1;
      com.corvel.OdelloApp|10|1; com.corvel.Brivane|10.2|0; com.corvel.Brivane|10.10|0;
      com.corvel.Brivane|10.2.1|0; com.corvel.Quellor|4.2|0; com.corvel.brivane|1.0|0;
      com.example.other|1.0|0; com.corvel.BrivaneTrialX|1.0|0)";
  for (const auto& row : Table(hosts)) {
    EXPECT_EQ(Needs17732150Workaround(row[0], row[1]), row[2] == "1") << row[0] << " " << row[1];
  }
  std::vector<DRDPlugInPtr> records;  // two internal filters, then copies in an application
  for (int n : {0, 5}) {
    RegistryEntry::Fields f;
    f.registrationDate = Date{n * 1.0};
    std::string path = folder / ("Effecta/InternalFilters.app/f" + std::to_string(n) + ".appex");
    records.push_back(
        DRDPlugIn::initWithRGData(entry(PlugInInfo("f"), Sandboxed(), f, path), services()));
  }
  for (const auto& r : Table("a|1|viewer; b|1|editor; a|2|viewer; c|1|viewer"))
    records.push_back(copy(r[0], "2.0", false, std::stod(r[1]), {}, Value{{"K", r[2]}}));
  for (const DRDPlugInPtr& r : records) ASSERT_TRUE(r);
  const PlugInSet set(records);
  // rules | flags | old host | plug-ins found
  const char* rows = R"({"K": "viewer"}|1|0|2; {"K": "viewer"}|1|1|3; {"K": "viewer"}|0|1|2;
      {"K": "=viewer"}|9|1|0; {"K": "editor"}|512|1|1; {"K": ">=a"}|1|1|4; {}|1|1|6; {}|1|0|3)";
  for (const auto& row : Table(rows)) {
    const Value rules = J(row[0]);
    const uint64_t flags = std::stoul(row[1]);
    const bool old = row[2] == "1";
    SCOPED_TRACE(row[0] + " " + row[1] + " " + row[2]);
    auto run = [&](const std::vector<DRDPlugInPtr>& examined, Lines& logged) {
      DiscoveryServices services;
      services.log = [&](const std::string& line) { logged.push_back(line); };
      services.debug = services.log;
      Discovery d(host(old), rules, flags, Value(), services);
      for (const DRDPlugInPtr& p : examined) d.examine(p);
      return std::make_pair(d.finish(), d.flags());
    };
    std::vector<DRDPlugInPtr> some = records;
    if (auto chosen = CandidatesToExamine(set, rules, flags, old)) {
      some.clear();
      for (uint32_t i : *chosen) some.push_back(records[i]);
    }
    Lines allLogged, someLogged;
    auto all = run(records, allLogged);
    EXPECT_EQ(run(some, someLogged), all);
    EXPECT_EQ(someLogged, allLogged);
    EXPECT_EQ(all.first.size(), std::stoul(row[3]));
    const bool bit = old && !(flags & message::kDiscoverAll);
    EXPECT_EQ((all.second & message::kDiscoverDuplicates) != 0, bit);
    EXPECT_EQ(!allLogged.empty() && allLogged[0].find("found a 17732150 PlugIn: " +
                                                      *records[0]->path()) != std::string::npos,
              bit);
  }
}

}  // namespace
}  // namespace dr::test
