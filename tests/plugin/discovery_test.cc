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

  Discovery discovery(uint64_t flags, DiscoveryServices services = {}) {
    DiscoveryHost h;
    h.client = &host;
    return Discovery(h, Value(), flags, Value(), std::move(services));
  }

  FakeHost host;
};

TEST_F(DiscoveryTest, DuplicatesOfOneIdentifier) {
  struct Row {
    const char* what;
    Copy first, second;
    uint64_t flags;
    const char* returned;  // "first", "second" or "both"
  } rows[] = {
      {"newer version wins", {"1.2", true, 100}, {"1.10", true, 50}, 0, "second"},
      {"older version loses", {"1.10", true, 50}, {"1.2", true, 100}, 0, "first"},
      {"system copy beats an app copy", {"1", false, 200}, {"1", true, 100}, 0, "second"},
      {"later registration wins", {"1", false, 100}, {"1", false, 200}, 0, "second"},
      {"equal time keeps the first", {"1", false, 100}, {"1", false, 100}, 0, "first"},
      {"earlier registration loses", {"1", false, 200}, {"1", false, 100}, 0, "first"},
      {"later app copy beats a system copy", {"1", true, 100}, {"1", false, 200}, 0, "second"},
      {"all versions keeps both", {"1.2", true, 100}, {"1.10", true, 50}, 0x1, "both"},
      {"all versions collapses equal ones", {"1", true, 100}, {"1", true, 50}, 0x1, "first"},
      {"duplicates too keeps equal ones", {"1", true, 100}, {"1", true, 50}, 0x5, "both"},
      {"duplicates alone changes nothing", {"1", true, 100}, {"1", true, 50}, 0x4, "first"},
  };
  for (const Row& row : rows) {
    Discovery d = discovery(row.flags);
    DRDPlugInPtr a = copy("p", row.first);
    DRDPlugInPtr b = copy("p", row.second);
    d.examine(a);
    d.examine(b);
    Value matches = d.finish();
    std::string returned;
    for (const Value& form : matches.array()) {
      returned +=
          (returned.empty() ? "" : "+") +
          std::string(form["uuid"].stringValue() == a->uuid()->string() ? "first" : "second");
    }
    if (returned == "first+second") returned = "both";
    EXPECT_EQ(returned, row.returned) << row.what;
    // The copy left out names the one that won.
    for (const Discovery::Verdict& v : d.verdicts()) {
      if (v.outcome == DiscoveryOutcome::kSuperseded) {
        EXPECT_EQ(v.by, v.plugIn == a ? b : a) << row.what;
      }
    }
  }
}

TEST_F(DiscoveryTest, ReplacementMarksSurviveAVeto) {
  const Value replaces{{"com.corvel.developer.replace-plugin",
                        Value(Array{Value("com.example.old.ext"), Value(7)})}};
  DRDPlugInPtr old = copy("old", {"1", true, 1});
  DRDPlugInPtr replacer = copy("new", {"1", true, 1}, replaces);
  DRDPlugInPtr self = copy("self", {"1", true, 1},
                           Value{{"com.corvel.developer.replace-plugin", "com.example.self.ext"}});
  DiscoveryServices services;
  // The replacer itself is vetoed; the replaced form still names it.
  services.mayUse = [](const Value& form) {
    return form["identifier"].stringValue() != "com.example.new.ext";
  };
  Discovery d = discovery(0, services);
  for (const DRDPlugInPtr& p : {old, replacer, self}) d.examine(p);
  Value matches = d.finish();
  ASSERT_EQ(matches.size(), 2u);
  EXPECT_EQ(matches.at(0)["overrider"].stringValue(), replacer->uuid()->string());
  EXPECT_FALSE(matches.at(0).has("overriding"));
  EXPECT_EQ(matches.at(1)["overrider"].stringValue(), self->uuid()->string());
  EXPECT_EQ(matches.at(1)["overriding"].stringValue(), "com.example.self.ext");
  EXPECT_EQ(d.verdicts()[1].outcome, DiscoveryOutcome::kVetoed);
}

TEST_F(DiscoveryTest, WorkaroundBitStaysSetForLaterCandidates) {
  // Two copies outside any application and the system volume, one of them
  // an internal filter: only an old host finds it, and from then on equal
  // copies are all kept when every version is asked for.
  auto filter = [&](int n) {
    RegistryEntry::Fields f;
    f.uuid = Uuid::random();
    f.url = registry_test::MakeBundle(
        folder / ("Effecta/InternalFilters.app/f" + std::to_string(n) + ".appex"), PlugInInfo("f"),
        Sandboxed());
    f.plugInIdentifier = "com.example.f.ext";
    f.registrationDate = Date{static_cast<double>(n)};
    auto files = std::make_shared<RegistryBundleFiles>(pdoc::WriteXml(PlugInInfo("f")).value(),
                                                       pdoc::WriteXml(Sandboxed()).value());
    return DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, files), services());
  };
  DRDPlugInPtr first = filter(1), second = filter(2);
  ASSERT_TRUE(first && second);

  Discovery plain = discovery(0x1);
  plain.examine(first);
  EXPECT_EQ(plain.verdicts()[0].outcome, DiscoveryOutcome::kNotInApplication);

  DiscoveryHost old;
  old.client = &host;
  old.needs17732150Workaround = true;
  std::vector<std::string> logged;
  DiscoveryServices services;
  services.log = [&](const std::string& line) { logged.push_back(line); };
  Discovery d(old, Value(), 0x1, Value(), services);
  d.examine(first);
  d.examine(second);
  EXPECT_EQ(d.flags() & 0x4, 0x4u);
  EXPECT_EQ(d.finish().size(), 2u);
  ASSERT_FALSE(logged.empty());
  EXPECT_NE(logged[0].find("found a 17732150 PlugIn: " + *first->path()), std::string::npos);
}

TEST_F(DiscoveryTest, ExaminingTheChosenCandidatesAnswersAsExaminingAll) {
  // An internal filter that fails the rules comes first: for an old host its
  // visibility check still sets the bit that keeps equal copies below.
  RegistryEntry::Fields f;
  f.uuid = Uuid::random();
  f.url = registry_test::MakeBundle(folder / "Effecta/InternalFilters.app/f.appex", PlugInInfo("f"),
                                    Sandboxed());
  f.plugInIdentifier = "com.example.f.ext";
  auto files = std::make_shared<RegistryBundleFiles>(pdoc::WriteXml(PlugInInfo("f")).value(),
                                                     pdoc::WriteXml(Sandboxed()).value());
  std::vector<DRDPlugInPtr> records{
      DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, files), services())};
  auto named = [&](const std::string& name, const char* point, double registered) {
    RegistryEntry::Fields g;
    g.registrationDate = Date{registered};
    g.containingApplication = RegistryApplication{folder / "App.app", "App"};
    return make(PlugInInfo(name, Value(), Value{{"UXExtensionPointName", point}}), Sandboxed(),
                std::move(g));
  };
  records.push_back(named("a", "viewer", 1));
  records.push_back(named("b", "editor", 1));
  records.push_back(named("a", "viewer", 2));  // the same identifier and version
  records.push_back(named("c", "viewer", 1));
  for (const DRDPlugInPtr& r : records) ASSERT_TRUE(r);
  const PlugInSet set(records);

  struct Row {
    const char* what;
    Value rules;
    uint64_t flags;
    bool workaround;
  } rows[] = {
      {"new host", Value{{"UXExtensionPointName", "viewer"}}, 0x1, false},
      {"old host keeps equal copies", Value{{"UXExtensionPointName", "viewer"}}, 0x1, true},
      {"old host, newest copy", Value{{"UXExtensionPointName", "viewer"}}, 0, true},
      {"old host, system only", Value{{"UXExtensionPointName", "=viewer"}}, 0x9, true},
      {"everything", Value{{"UXExtensionPointName", "editor"}}, message::kDiscoverAll, true},
      {"rules not indexed", Value{{"UXExtensionPointName", ">=a"}}, 0x1, true},
  };
  for (const Row& row : rows) {
    DiscoveryHost h;
    h.client = &host;
    h.needs17732150Workaround = row.workaround;
    auto run = [&](const std::vector<DRDPlugInPtr>& examined, std::vector<std::string>& logged) {
      DiscoveryServices services;
      services.log = [&](const std::string& line) { logged.push_back(line); };
      services.debug = services.log;
      Discovery d(h, row.rules, row.flags, Value(), services);
      for (const DRDPlugInPtr& p : examined) d.examine(p);
      return std::make_pair(d.finish(), d.flags());
    };
    std::optional<std::vector<uint32_t>> chosen =
        CandidatesToExamine(set, row.rules, row.flags, row.workaround);
    std::vector<DRDPlugInPtr> some = records;
    if (chosen) {
      some.clear();
      for (uint32_t i : *chosen) some.push_back(records[i]);
    }
    std::vector<std::string> allLogged, someLogged;
    auto all = run(records, allLogged);
    auto picked = run(some, someLogged);
    EXPECT_EQ(picked.first, all.first) << row.what;
    EXPECT_EQ(picked.second, all.second) << row.what;
    EXPECT_EQ(someLogged, allLogged) << row.what;
    if (std::string(row.what) == "old host keeps equal copies") {
      EXPECT_EQ(all.first.size(), 3u);  // both copies of "a", and "c"
      EXPECT_LT(some.size(), records.size());
    }
  }
}

}  // namespace
}  // namespace dr::test
