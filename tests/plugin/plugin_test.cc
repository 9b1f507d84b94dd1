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

namespace dr::test {
namespace {

using PlugInTest = PlugInFixture;

TEST_F(PlugInTest, AdmitsOnlySandboxedPlugInsUnlessDataOrEffecta) {
  const char* kSandbox = "com.corvel.security.app-sandbox";
  const char* kUnsandboxed = "Dromon error 12: plug-ins must be sandboxed";
  const Value kEffecta{{"UXExtensionPointName", "Effecta"}};
  const Value noProtocol{
      {"UXExtension",
       Value{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", "com.example.a.ext"}}}}}};
  struct Row {
    Value info, entitlements;  // entitlements absent: no entitlements file
    const char* refusal;       // the reason logged; nullptr: admitted
  };
  const Row rows[] = {
      {PlugInInfo("a"), Value{{kSandbox, "NO"}}, nullptr},
      {PlugInInfo("a"), Value(), kUnsandboxed},
      {PlugInInfo("a"), Value{{kSandbox, false}}, kUnsandboxed},
      {PlugInInfo("a"), Value{{kSandbox, 0.0}}, kUnsandboxed},
      {PlugInInfo("a", Value{{"UXExtensionProtocol", "#Data"}}), Value(), nullptr},
      {PlugInInfo("a", Value(), kEffecta), Value(), nullptr},
      {PlugInInfo("a", kEffecta), Value(), kUnsandboxed},  // Effecta outside the attributes
      {noProtocol, Sandboxed(),
       "Dromon error 12: missing \"UXExtensionProtocol\" key in Info.pdoc or SDK"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.info.description() + " " + row.entitlements.description());
    ScopedLogCapture log;
    RegistryEntryPtr e = entry(row.info, row.entitlements);
    EXPECT_EQ(DRDPlugIn::initWithRGData(e, services()) == nullptr, row.refusal != nullptr);
    if (row.refusal) {
      EXPECT_TRUE(
          log.contains("ignoring mis-configured plug-in at " + e->url() + ": " + row.refusal))
          << log.lines()[0];
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

// Registration times are clamped into whole seconds; the hub protocol version
// defaults to 2, or 1 for an old-style bundle.
TEST_F(PlugInTest, TakesRegistrationTimeAndProtocolVersion) {
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
}

TEST_F(PlugInTest, AnnotationKeyFollowsOnlyAStringReplacement) {
  const std::pair<Value, std::string> rows[] = {
      {Value(), "com.example.a.ext"},
      {"com.example.old", "com.example.old"},
      {Value(Array{Value("com.example.old")}), "com.example.a.ext"},
      {Value{{"com.example.old", true}}, "com.example.a.ext"},
  };
  for (const auto& [replacement, key] : rows) {
    auto plugIn = make(PlugInInfo("a"),
                       Sandboxed().changing("com.corvel.developer.replace-plugin", replacement));
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->annotationKey(), key) << replacement.description();
  }
}

// Tokens come from the real sandbox and are checked by consuming them, so
// each must grant exactly the resource it is filed under: never one outside
// the bundle, and for a link inside it where the link leads.
TEST_F(PlugInTest, FormGetsOneTokenPerDeclaredResource) {
  SandboxOptions options{.keyPath = folder / "keys/sandbox.key"};
  testing::FakeCodeSigning signing;
  std::unique_ptr<Sandbox> sandbox = MakeLinuxSandbox(options, &signing);
  PlugInServices s = services();
  s.sandbox = sandbox.get();
  using Names = std::vector<std::string>;
  struct Row {
    Value shared;        // absent: no "Shared"
    Names granted;       // "name=path" relative to the bundle, for each token
    const char* failed;  // the resource a failure is logged for, and why
  };
  const Row rows[] = {
      {Value(), {}, nullptr},
      {".", {".=."}, nullptr},
      {Value(Array{Value("Resources/a"), Value(7), Value("Resources/nested/b")}),
       {"Resources/a=Resources/a", "Resources/nested/b=Resources/nested/b"},
       nullptr},
      {Value{{"Resources/a", true}}, {"Resources/a=Resources/a"}, nullptr},
      {42, {}, nullptr},
      {Value(Array{Value("missing")}), {}, "/missing in plug-in at @: No such file or directory"},
      {"../outside", {}, "/../outside in plug-in at @: Permission denied"},
      {"Resources/escape", {}, "/Resources/escape in plug-in at @: Permission denied"},
      {"Resources/alias", {"Resources/alias=Resources/nested/b"}, nullptr},
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
    EXPECT_EQ(form.size(), row.shared.isPresent() ? 2u : 1u);
    Names granted;
    for (const auto& [name, token] : form["extensions"].dictionary()) {
      std::string path = consumeExtension(token.stringValue(), options).value_or("(refused)");
      if (path.starts_with(bundle)) path = path == bundle ? "." : path.substr(bundle.size() + 1);
      granted.push_back(name.str() + "=" + path);
    }
    EXPECT_EQ(granted, row.granted);
    ASSERT_EQ(log.lines().size(), row.failed ? 1u : 0u);
    if (row.failed) {
      std::string expected = "failed to make extension for " + bundle + row.failed;
      expected.replace(expected.find('@'), 1, bundle);
      EXPECT_NE(log.lines()[0].find(expected), std::string::npos) << log.lines()[0];
    }
  }
}

}  // namespace
}  // namespace dr::test
