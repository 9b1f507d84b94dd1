// Discovery's choices that end-to-end tests cannot steer: which copy of an
// identifier wins by version, place and registration time, replacement
// marks, and the one-way workaround bit.
#include "plugin/discovery.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/plugin/plugin_fixture.h"

namespace dr::test {
namespace {

class FakeHost : public PlugInClient {
 public:
  pid_t pid() const override { return 42; }
  Value entitlementValueForKey(std::string_view) const override { return Value(); }
  bool hasEntitlement(std::string_view) const override { return false; }
};

struct Copy {
  std::string version;
  bool system;
  double registered;  // seconds since 1970
};

class DiscoveryTest : public PlugInFixture {
 protected:
  // A copy of plug-in `name` ("com.example.<name>.ext") at `version`.
  DRDPlugInPtr copy(const std::string& name, const Copy& c, const Value& entitlements = Value()) {
    RegistryEntry::Fields f;
    f.onSystemVolume = c.system;
    f.registrationDate = Date{c.registered};
    if (!c.system) f.containingApplication = RegistryApplication{folder / "App.app", "App"};
    Value info = PlugInInfo(name).changing("BNBundleVersion", Value(c.version));
    Dictionary granted = Sandboxed().dictionary();
    for (const auto& [k, v] : entitlements.dictionary()) granted[k] = v;
    return make(info, Value(std::move(granted)), std::move(f));
  }
  // An internal filter: outside any application and the system volume.
  DRDPlugInPtr filter(int n) {
    RegistryEntry::Fields f;
    f.registrationDate = Date{static_cast<double>(n)};
    std::string path = folder / ("Effecta/InternalFilters.app/f" + std::to_string(n) + ".appex");
    return DRDPlugIn::initWithRGData(entry(PlugInInfo("f"), Sandboxed(), f, path), services());
  }
  Discovery discovery(uint64_t flags, DiscoveryServices services = {}, bool old = false) {
    DiscoveryHost h;
    h.client = &host;
    h.needs17732150Workaround = old;
    return Discovery(h, Value(), flags, Value(), std::move(services));
  }

  FakeHost host;
};

// Newer versions win; then a system copy over an app copy, unless the app
// copy was registered later; equal times keep the first. Every version
// (0x1) keeps unequal versions, and with duplicates (0x4) equal ones too.
TEST_F(DiscoveryTest, DuplicatesOfOneIdentifier) {
  struct Row {
    Copy first, second;
    uint64_t flags;
    const char* returned;  // "first", "second" or "first+second"
  } rows[] = {
      {{"1.2", true, 100}, {"1.10", true, 50}, 0, "second"},
      {{"1.10", true, 50}, {"1.2", true, 100}, 0, "first"},
      {{"1", false, 200}, {"1", true, 100}, 0, "second"},
      {{"1", false, 100}, {"1", false, 200}, 0, "second"},
      {{"1", false, 100}, {"1", false, 100}, 0, "first"},
      {{"1", false, 200}, {"1", false, 100}, 0, "first"},
      {{"1", true, 100}, {"1", false, 200}, 0, "second"},
      {{"1.2", true, 100}, {"1.10", true, 50}, 0x1, "first+second"},
      {{"1", true, 100}, {"1", true, 50}, 0x1, "first"},
      {{"1", true, 100}, {"1", true, 50}, 0x5, "first+second"},
      {{"1", true, 100}, {"1", true, 50}, 0x4, "first"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.first.version + " " + row.second.version + " " + std::to_string(row.flags));
    Discovery d = discovery(row.flags);
    DRDPlugInPtr a = copy("p", row.first), b = copy("p", row.second);
    d.examine(a);
    d.examine(b);
    std::string returned;
    const Value matches = d.finish().value();
    for (const Value& form : matches.array()) {
      returned +=
          (returned.empty() ? "" : "+") +
          std::string(form["uuid"].stringValue() == a->uuid()->string() ? "first" : "second");
    }
    EXPECT_EQ(returned, row.returned);
    for (const Discovery::Verdict& v : d.verdicts()) {  // the copy left out names the winner
      EXPECT_TRUE(v.outcome != DiscoveryOutcome::kSuperseded || v.by == (v.plugIn == a ? b : a));
    }
  }
}

TEST_F(DiscoveryTest, ReplacementMarksSurviveAVeto) {
  const char* kReplace = "com.corvel.developer.replace-plugin";
  DRDPlugInPtr old = copy("old", {"1", true, 1});
  DRDPlugInPtr replacer =
      copy("new", {"1", true, 1},
           Value{{kReplace, Value(Array{Value("com.example.old.ext"), Value(7)})}});
  DRDPlugInPtr self = copy("self", {"1", true, 1}, Value{{kReplace, "com.example.self.ext"}});
  DiscoveryServices services;
  // The replacer itself is vetoed; the replaced form still names it.
  services.mayUse = [](std::string_view id) { return id != "com.example.new.ext"; };
  Discovery d = discovery(0, services);
  for (const DRDPlugInPtr& p : {old, replacer, self}) d.examine(p);
  Value matches = d.finish().value();
  ASSERT_EQ(matches.size(), 2u);
  EXPECT_EQ(matches.at(0)["overrider"].stringValue(), replacer->uuid()->string());
  EXPECT_FALSE(matches.at(0).has("overriding"));
  EXPECT_EQ(matches.at(1)["overrider"].stringValue(), self->uuid()->string());
  EXPECT_EQ(matches.at(1)["overriding"].stringValue(), "com.example.self.ext");
  EXPECT_EQ(d.verdicts()[1].outcome, DiscoveryOutcome::kVetoed);
}

TEST(WorkaroundTest, OlderListedHostsNeedIt) {
  const std::pair<const char*, const char*> need[] = {
      {"com.corvel.Brivane", "10.1.4"},    {"com.corvel.Brivane", "9.9"},
      {"com.corvel.BrivaneTrial", "10.1"}, {"com.corvel.Quellor", "4.1.9"},
      {"com.corvel.vorelapp", "5.1"},      {"com.corvel.OdelloApp", "10"}};
  const std::pair<const char*, const char*> needNot[] = {
      {"com.corvel.Brivane", "10.2"},     {"com.corvel.Brivane", "10.10"},
      {"com.corvel.Brivane", "10.2.1"},   {"com.corvel.Quellor", "4.2"},
      {"com.corvel.brivane", "1.0"},      {"com.example.other", "1.0"},
      {"com.corvel.BrivaneTrialX", "1.0"}};
  for (const auto& [id, version] : need)
    EXPECT_TRUE(Needs17732150Workaround(id, version)) << id << " " << version;
  for (const auto& [id, version] : needNot)
    EXPECT_FALSE(Needs17732150Workaround(id, version)) << id << " " << version;
}

// Only an old host finds an internal filter, and from then on equal copies
// are all kept when every version is asked for.
TEST_F(DiscoveryTest, WorkaroundBitStaysSetForLaterCandidates) {
  DRDPlugInPtr first = filter(1), second = filter(2);
  ASSERT_TRUE(first && second);
  Discovery plain = discovery(0x1);
  plain.examine(first);
  EXPECT_EQ(plain.verdicts()[0].outcome, DiscoveryOutcome::kNotInApplication);
  std::vector<std::string> logged;
  DiscoveryServices services;
  services.log = [&](const std::string& line) { logged.push_back(line); };
  Discovery d = discovery(0x1, services, true);
  d.examine(first);
  d.examine(second);
  EXPECT_EQ(d.flags() & 0x4, 0x4u);
  EXPECT_EQ(d.finish().size(), 2u);
  ASSERT_FALSE(logged.empty());
  EXPECT_NE(logged[0].find("found a 17732150 PlugIn: " + *first->path()), std::string::npos);
}

// An internal filter that fails the rules comes first: for an old host its
// visibility check still sets the bit that keeps equal copies below. The
// chosen candidates must give the same answer, flags and log as all.
TEST_F(DiscoveryTest, ExaminingTheChosenCandidatesAnswersAsExaminingAll) {
  auto named = [&](const std::string& name, const char* point, double registered) {
    RegistryEntry::Fields g;
    g.registrationDate = Date{registered};
    g.containingApplication = RegistryApplication{folder / "App.app", "App"};
    return make(PlugInInfo(name, Value(), Value{{"UXExtensionPointName", point}}), Sandboxed(),
                std::move(g));
  };
  const std::vector<DRDPlugInPtr> records{filter(0), named("a", "viewer", 1),
                                          named("b", "editor", 1), named("a", "viewer", 2),
                                          named("c", "viewer", 1)};
  for (const DRDPlugInPtr& r : records) ASSERT_TRUE(r);
  const PlugInSet set(records);
  const Value viewer{{"UXExtensionPointName", "viewer"}};
  struct Row {
    Value rules;
    uint64_t flags;
    bool workaround;
  } rows[] = {
      {viewer, 0x1, false},
      {viewer, 0x1, true},
      {viewer, 0, true},
      {Value{{"UXExtensionPointName", "=viewer"}}, 0x9, true},
      {Value{{"UXExtensionPointName", "editor"}}, message::kDiscoverAll, true},
      {Value{{"UXExtensionPointName", ">=a"}}, 0x1, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.rules.description() + " " + std::to_string(row.flags) +
                 (row.workaround ? " old" : ""));
    auto run = [&](const std::vector<DRDPlugInPtr>& examined, std::vector<std::string>& logged) {
      DiscoveryServices services;
      services.log = [&](const std::string& line) { logged.push_back(line); };
      services.debug = services.log;
      DiscoveryHost h;
      h.client = &host;
      h.needs17732150Workaround = row.workaround;
      Discovery d(h, row.rules, row.flags, Value(), services);
      for (const DRDPlugInPtr& p : examined) d.examine(p);
      return std::make_pair(d.finish().value(), d.flags());
    };
    std::optional<std::vector<uint32_t>> chosen =
        CandidatesToExamine(set, row.rules, row.flags, row.workaround);
    std::vector<DRDPlugInPtr> some = records;
    if (chosen) {
      some.clear();
      for (uint32_t i : *chosen) some.push_back(records[i]);
    }
    std::vector<std::string> allLogged, someLogged;
    EXPECT_EQ(run(some, someLogged), run(records, allLogged));
    EXPECT_EQ(someLogged, allLogged);
    if (row.workaround && row.flags == 0x1 && row.rules == viewer) {
      EXPECT_EQ(run(records, allLogged).first.size(), 3u);  // both copies of "a", and "c"
      EXPECT_LT(some.size(), records.size());
    }
  }
}

}  // namespace
}  // namespace dr::test
