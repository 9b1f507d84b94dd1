#include "plugin/plugin.h"

#include <gtest/gtest.h>

#include <filesystem>

#include <optional>
#include <string>
#include <vector>

#include "core/log.h"
#include "platform/sandbox.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/fake_services.h"
#include "tests/support/test_registry.h"

namespace dr::test {
namespace {

using PlugInTest = PlugInFixture;

TEST_F(PlugInTest, AdmitsOnlySandboxedPlugInsUnlessDataOrEffecta) {
  const char* kSandbox = "com.corvel.security.app-sandbox";
  const char* kUnsandboxed = "Dromon error 12: plug-ins must be sandboxed";
  const Value kEffecta{{"UXExtensionPointName", "Effecta"}};
  struct Row {
    const char* what;
    Value info, entitlements;  // entitlements absent: no entitlements file
    const char* refusal;       // the reason logged; nullptr: admitted
  };
  const Row rows[] = {
      {"sandbox as the string NO", PlugInInfo("a"), Value{{kSandbox, "NO"}}, nullptr},
      {"no entitlements file", PlugInInfo("a"), Value(), kUnsandboxed},
      {"sandbox false", PlugInInfo("a"), Value{{kSandbox, false}}, kUnsandboxed},
      {"sandbox 0", PlugInInfo("a"), Value{{kSandbox, 0.0}}, kUnsandboxed},
      {"data plug-in", PlugInInfo("a", Value{{"UXExtensionProtocol", "#Data"}}), Value(), nullptr},
      {"Effecta plug-in", PlugInInfo("a", Value(), kEffecta), Value(), nullptr},
      {"Effecta outside the attributes", PlugInInfo("a", kEffecta), Value(), kUnsandboxed},
      {"no protocol, though sandboxed",
       Value{{"UXExtension", Value{{"UXExtensionAttributes",
                                    Value{{"UXExtensionIdentifier", "com.example.a.ext"}}}}}},
       Sandboxed(), "missing \"UXExtensionProtocol\" key in Info.pdoc or SDK"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    ScopedLogCapture log;
    RegistryEntryPtr e = entry(row.info, row.entitlements);
    EXPECT_EQ(DRDPlugIn::initWithRGData(e, services()) == nullptr, row.refusal != nullptr);
    if (row.refusal) {
      EXPECT_TRUE(log.contains("ignoring mis-configured plug-in at " + e->url() + ": "));
      EXPECT_TRUE(log.contains(row.refusal));
    }
  }

  // An entry without a path or a readable information dictionary: nothing, silently.
  ScopedLogCapture log;
  RegistryEntry::Fields f;
  f.plugInIdentifier = "x";
  auto files =
      std::make_shared<RegistryBundleFiles>(pdoc::WriteXml(PlugInInfo("a")).value(), std::nullopt);
  EXPECT_FALSE(DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, files), services()));
  f.url = folder.path();
  auto broken = std::make_shared<RegistryBundleFiles>("<pdoc><dict><key>", std::nullopt);
  EXPECT_FALSE(DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, broken), services()));
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(PlugInTest, TakesRegistryFactsAndProtocolVersion) {
  Value oldStyle{
      {"BNBundleIdentifier", "com.example.old"},
      {"Dromon", Value{{"SDK", kPoint}, {"Protocol", "Viewer"}, {"Attributes", Value{}}}}};
  struct Row {
    Value info;
    double registered;
    uint64_t hubProtocolVersion;
    int64_t lastModified;
  };
  const Row rows[] = {
      {PlugInInfo("a"), 1.9, 2, 1},
      {PlugInInfo("a"), -1.9, 2, -1},
      {PlugInInfo("a", Value{{"HubProtocolVersion", 5}}), 0.0, 5, 0},
      {oldStyle, 1700000000.99, 1, 1700000000},
      {PlugInInfo("a"), 1e300, 2, INT64_MAX},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.registered);
    RegistryEntry::Fields f;
    f.registrationDate = Date{row.registered};
    auto plugIn = make(row.info, Sandboxed(), f);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->hubProtocolVersion(), row.hubProtocolVersion);
    EXPECT_EQ(plugIn->lastModified(), row.lastModified);
  }

  RegistryEntry::Fields f;
  f.onSystemVolume = true;
  f.containingApplication = RegistryApplication{"/apps/Host.app", "Host"};
  f.displayName = "Viewer";
  f.shortName = "View";
  RegistryEntryPtr e = entry(PlugInInfo("a"), Sandboxed(), f);
  auto plugIn = DRDPlugIn::initWithRGData(e, services());
  ASSERT_TRUE(plugIn);
  EXPECT_EQ(plugIn->rgproxy(), e);
  EXPECT_EQ(plugIn->uuid(), e->uuid());
  EXPECT_EQ(plugIn->identifier(), "com.example.a.ext");
  EXPECT_TRUE(plugIn->onSystemVolume());
  EXPECT_EQ(plugIn->containingUrl(), "/apps/Host.app");
  EXPECT_EQ(plugIn->localizedContainingName(), "Host");
  EXPECT_EQ(plugIn->localizedName(), "Viewer");
  EXPECT_EQ(plugIn->localizedShortName(), "View");
}

TEST_F(PlugInTest, AnnotationKeyFollowsOnlyAStringReplacement) {
  const char* kReplace = "com.corvel.developer.replace-plugin";
  const std::pair<Value, std::string> rows[] = {
      {Value(), "com.example.a.ext"},
      {"com.example.old", "com.example.old"},
      {Value(Array{Value("com.example.old")}), "com.example.a.ext"},
      {true, "com.example.a.ext"},
      {Value{{"com.example.old", true}}, "com.example.a.ext"},
  };
  for (const auto& [replacement, key] : rows) {
    SCOPED_TRACE(replacement.description());
    auto plugIn = make(PlugInInfo("a"), Sandboxed().changing(kReplace, replacement));
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->annotationKey(), key);
  }

  // The same through the real registry, which reads the bundle's files.
  auto registry = OpenTestRegistry(folder / "db");
  ASSERT_TRUE(registry);
  std::string path = makeBundle(PlugInInfo("a"), Sandboxed().changing(kReplace, "com.example.b"));
  ASSERT_TRUE(registry->registerBundle(path).ok());
  auto plugIn = DRDPlugIn::initWithRGData(registry->entryForUrl(path), services());
  ASSERT_TRUE(plugIn);
  EXPECT_EQ(plugIn->annotationKey(), "com.example.b");
  EXPECT_EQ(plugIn->version(), "2.0");
}

// Tokens come from the real sandbox and are checked by consuming them, so
// each must grant exactly the resource it is filed under.
TEST_F(PlugInTest, FormGetsOneTokenPerDeclaredResource) {
  SandboxOptions options{.keyPath = folder / "keys/sandbox.key"};
  testing::FakeCodeSigning signing;
  std::unique_ptr<Sandbox> sandbox = MakeLinuxSandbox(options, &signing);
  PlugInServices s = services();
  s.sandbox = sandbox.get();
  struct Row {
    Value shared;                                   // absent: no "Shared"
    std::optional<std::vector<std::string>> names;  // keys of "extensions"; none: no key
    const char* failed;  // the resource a failure is logged for; nullptr: none
    const char* why = "";
    // The path each token grants, relative to the bundle; empty: the name.
    std::vector<std::string> granted = {};
  };
  using Names = std::vector<std::string>;
  const Row rows[] = {
      {Value(), std::nullopt, nullptr},
      {".", Names{"."}, nullptr},
      {Value(Array{Value("Resources/a"), Value(7), Value("Resources/nested/b")}),
       Names{"Resources/a", "Resources/nested/b"}, nullptr},
      {Value{{"Resources/a", true}}, Names{"Resources/a"}, nullptr},
      {42, Names{}, nullptr},
      {Value(Array{Value("missing")}), Names{}, "/missing", "No such file or directory"},
      {"../outside", Names{}, "/../outside", "Permission denied"},              // resolves outside
      {"Resources/escape", Names{}, "/Resources/escape", "Permission denied"},  // a link out
      // A link inside the bundle: the token grants where it leads.
      {"Resources/alias", Names{"Resources/alias"}, nullptr, "", {"Resources/nested/b"}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.shared.description());
    Value pd = row.shared.isPresent() ? Value{{"Shared", row.shared}} : Value();
    auto plugIn = DRDPlugIn::initWithRGData(entry(PlugInInfo("a", pd), Sandboxed()), s);
    ASSERT_TRUE(plugIn);
    std::string bundle = *plugIn->url();
    registry_test::WriteBytes(bundle + "/Resources/a", "a");
    registry_test::WriteBytes(bundle + "/Resources/nested/b", "b");
    registry_test::WriteBytes(bundle + "/../outside", "o");
    std::error_code ignored;
    std::filesystem::create_symlink("../../outside", bundle + "/Resources/escape", ignored);
    std::filesystem::create_symlink("nested/b", bundle + "/Resources/alias", ignored);

    ScopedLogCapture log;
    Dictionary form{{"identifier", Value("kept")}};
    plugIn->augmentForm(form);
    EXPECT_EQ(form.size(), row.names ? 2u : 1u);
    Names keys;
    for (const auto& [name, token] : form["extensions"].dictionary()) {
      const std::string relative = row.granted.empty() ? name.str() : row.granted[keys.size()];
      keys.push_back(name.str());
      Result<std::string> granted = consumeExtension(token.stringValue(), options);
      EXPECT_EQ(granted.value_or(""), relative == "." ? bundle : bundle + "/" + relative);
    }
    if (row.names) {
      EXPECT_EQ(keys, *row.names);
    }
    std::vector<std::string> lines;
    if (row.failed)
      lines.push_back("failed to make extension for " + bundle + row.failed + " in plug-in at " +
                      bundle + ": " + row.why);
    ASSERT_EQ(log.lines().size(), lines.size());
    if (row.failed) {
      EXPECT_NE(log.lines()[0].find(lines[0]), std::string::npos) << log.lines()[0];
    }
  }
}

}  // namespace
}  // namespace dr::test
