// Plug-in records over registry entries: which are admitted, the tokens their
// form carries, which hosts may use them, enabling one for a host and asking
// whether one is busy.
#include "plugin/plugin.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "core/format.h"
#include "core/log.h"
#include "platform/sandbox.h"
#include "registry/service_manager_linux.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/fake_services.h"

namespace dr::test {
namespace {

using Lines = std::vector<std::string>;
using PlugInTest = PlugInFixture;

// Sandboxed plug-ins only, unless data or Effecta ones; registration times
// clamp into whole seconds; the hub protocol version defaults to 2, or 1 for
// an old-style bundle.
TEST_F(PlugInTest, AdmitsSandboxedPlugInsAndTakesTheEntrysFields) {
  const std::string unsandboxed = "Dromon error 12: plug-ins must be sandboxed";
  const struct {
    Value info;
    const char* entitlements;  // "": no entitlements file
    std::string refusal;       // the reason logged; "": admitted
    double registered = 0;
    int64_t lastModified = 0;
    uint64_t hub = 2;
  } rows[] = {
      {PlugInInfo("a"), R"({"com.corvel.security.app-sandbox": "NO"})", "", 1.9, 1},
      {PlugInInfo("a"), "", unsandboxed},
      {PlugInInfo("a"), R"({"com.corvel.security.app-sandbox": 0.0})", unsandboxed},
      {PlugInInfo("a", J(R"({"UXExtensionProtocol": "#Data", "HubProtocolVersion": 5})")), "", "",
       -1.9, -1, 5},
      {PlugInInfo("a", {}, J(R"({"UXExtensionPointName": "Effecta"})")), "", "", 1e300, INT64_MAX},
      {PlugInInfo("a", J(R"({"UXExtensionPointName": "Effecta"})")), "", unsandboxed},
      {J(R"({"Dromon": {"SDK": "com.example.point", "Protocol": "P", "Attributes": {}},
            "BNBundleIdentifier": "com.example.old"})"),
       R"({"com.corvel.security.app-sandbox": 1})", "", 1700000000.99, 1700000000, 1},
      {J(R"({"UXExtension": {"UXExtensionAttributes": {"UXExtensionIdentifier": "a"}}})"), "{}",
       "Dromon error 12: missing \"UXExtensionProtocol\" key in Info.pdoc or SDK"}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.info.description() + " " + row.entitlements);
    ScopedLogCapture log;
    RegistryEntry::Fields f;
    f.registrationDate = Date{row.registered};
    RegistryEntryPtr e = entry(row.info, *row.entitlements ? J(row.entitlements) : Value(), f);
    auto plugIn = DRDPlugIn::initWithRGData(e, services());
    EXPECT_EQ(log.lines(), row.refusal.empty() ? Lines{}
                                               : Lines{"ignoring mis-configured plug-in at " +
                                                       e->url() + ": " + row.refusal});
    if (!plugIn) continue;
    EXPECT_EQ(plugIn->hubProtocolVersion(), row.hub);
    EXPECT_EQ(plugIn->lastModified(), row.lastModified);
  }
  // An entry without a path or a readable information dictionary: nothing, silently.
  ScopedLogCapture log;
  RegistryEntry::Fields f;
  f.plugInIdentifier = "x";
  auto files = std::make_shared<RegistryBundleFiles>(*pdoc::WriteXml(PlugInInfo("a")), nullopt);
  EXPECT_FALSE(DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, files), services()));
  f.url = folder.path();
  files = std::make_shared<RegistryBundleFiles>("<pdoc><dict><key>", std::nullopt);
  EXPECT_FALSE(DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, files), services()));
  EXPECT_TRUE(log.lines().empty());
}

// Tokens come from the real sandbox and are checked by consuming them, so
// each must grant exactly the resource it is filed under: never one outside
// the bundle, and for a link inside it where the link leads.
TEST_F(PlugInTest, FormGetsOneTokenPerDeclaredResource) {
  SandboxOptions options{.keyPath = folder / "keys/sandbox.key"};
  testing::FakeCodeSigning signing;
  std::unique_ptr<Sandbox> sandbox = MakeLinuxSandbox(options, &signing);
  const struct {
    const char* shared;   // "": no "Shared"
    std::string granted;  // "name=path" relative to the bundle, for each token
    const char* failed;   // the resource a failure is logged for, and why
  } rows[] = {{"", "", nullptr},
              {R"(".")", ".=.", nullptr},
              {R"(["Resources/a", 7, "Resources/nested/b"])",
               "Resources/a=Resources/a Resources/nested/b=Resources/nested/b", nullptr},
              {R"({"Resources/a": true})", "Resources/a=Resources/a", nullptr},
              {"42", "", nullptr},
              {R"(["missing"])", "", "/missing in plug-in at @: No such file or directory"},
              {R"("../outside")", "", "/../outside in plug-in at @: Permission denied"},
              {R"("Resources/escape")", "", "/Resources/escape in plug-in at @: Permission denied"},
              {R"("Resources/alias")", "Resources/alias=Resources/nested/b", nullptr}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.shared);
    Value pd = *row.shared ? Value{{"Shared", J(row.shared)}} : Value();
    PlugInServices s = services();
    s.sandbox = sandbox.get();
    auto plugIn = DRDPlugIn::initWithRGData(entry(PlugInInfo("a", pd), Sandboxed()), s);
    ASSERT_TRUE(plugIn);
    std::string bundle = *plugIn->url();
    registry_test::WriteBytes(bundle + "/Resources/a", "a");
    registry_test::WriteBytes(bundle + "/Resources/nested/b", "b");
    registry_test::WriteBytes(bundle + "/../outside", "o");
    std::filesystem::create_symlink("../../outside", bundle + "/Resources/escape");
    std::filesystem::create_symlink("nested/b", bundle + "/Resources/alias");
    ScopedLogCapture log;
    Dictionary form{{"identifier", Value("kept")}};
    plugIn->augmentForm(form);
    EXPECT_EQ(form.size(), *row.shared ? 2u : 1u);
    std::string granted;
    for (const auto& [name, token] : form["extensions"].dictionary()) {
      std::string path = consumeExtension(token.stringValue(), options).value_or("(refused)");
      if (path.starts_with(bundle)) path = path == bundle ? "." : path.substr(bundle.size() + 1);
      granted += (granted.empty() ? "" : " ") + name.str() + "=" + path;
    }
    EXPECT_EQ(granted, row.granted);
    std::string failure = row.failed ? "failed to make extension for " + bundle + row.failed : "";
    if (row.failed) failure.replace(failure.find('@'), 1, bundle);
    ASSERT_EQ(log.lines().size(), row.failed ? 1u : 0u);
    EXPECT_TRUE(!row.failed || log.lines()[0].starts_with(failure)) << log.lines()[0];
  }
}

// The host's restriction is checked before the plug-in's demand; a demand
// that is no string demands nothing; any value but false holds it.
TEST_F(PlugInTest, HostRestrictionAndDemandedEntitlement) {
  const std::string invalid = "invalid host restriction entitlement";
  const std::string outside = "the host's plug-in entitlement does not allow this plug-in";
  const char* allowed = R"({"com.corvel.developer.dromon.allowedplugins": )";
  const struct {
    std::string host, demand;  // the host's entitlements, the plug-in's demand ("": none)
    std::string refusal;       // "": allowed
  } rows[] = {{"{}", "", ""},
              {std::string(allowed) + "[]}", "", invalid},
              {std::string(allowed) + "{}}", "", ""},
              {std::string(allowed) + R"({"UXExtensionIdentifier": "com.example.a.ext"}})", "", ""},
              {std::string(allowed) + R"({"UXExtensionIdentifier": "com.example.b.ext"}})",
               R"("x")", outside},
              {R"({"x": false})", R"("x")", "the host does not have the \"x\" entitlement"},
              {R"({"x": "NO"})", R"("x")", ""},
              {"{}", R"(["x"])", ""}};
  for (const auto& row : rows) {
    Value pd = row.demand.empty() ? Value() : Value{{"UXExtensionHostEntitlement", J(row.demand)}};
    auto plugIn = make(PlugInInfo("a", pd));
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->allowForClient(FakeClient(J(row.host))).value_or(""), row.refusal)
        << row.host << " " << row.demand;
  }
}

// Enabling goes through the real service manager, which checks the
// executable and records the grant with the overlay it was sent: the
// daemon's test SDK folder, then the plug-in's own string variables over it.
TEST_F(PlugInTest, EnablingSendsTheServiceOverlayOrFailsWithItsLogLines) {
  registry_test::WriteBytes(folder / (std::string("sdks/") + kPoint + ".pdoc"),
                            *pdoc::WriteXml(J("{}")));
  ScopedEnv sdkPath{"DR_SDK_PATH", folder / "sdks"};
  std::unique_ptr<ServiceManager> real = NewServiceManager({});
  manager = real.get();
  const struct {
    std::optional<std::string> testSdk;
    const char *ipcService, *expected;  // the bundle's "IPCService" ("": none); the overlay's
  } rows[] = {{nullopt, "", "{}"},
              {"/sdk", R"({"EnvironmentVariables": {"DRTEST_SDK": "/own", "A": "1"}, "Other": 5})",
               R"({"EnvironmentVariables": {"DRTEST_SDK": "/own", "A": "1"}, "Other": 5})"},
              {"/sdk", R"("junk")", R"({"EnvironmentVariables": {"DRTEST_SDK": "/sdk"}})"},
              {"/sdk", R"({"EnvironmentVariables": "junk"})",
               R"({"EnvironmentVariables": {"DRTEST_SDK": "/sdk"}})"},
              {nullopt, R"({"EnvironmentVariables": {"A": 1, "B": "b", "C": []}})",
               R"({"EnvironmentVariables": {"B": "b"}})"}};
  size_t n = 0;
  for (const auto& row : rows) {
    SCOPED_TRACE(row.ipcService);
    testSdk = row.testSdk;
    auto plugIn = make(*row.ipcService ? PlugInInfo("a").changing("IPCService", J(row.ipcService))
                                       : PlugInInfo("a"));
    ASSERT_TRUE(plugIn);
    ScopedLogCapture log;
    pid_t pid = ::getpid();  // grants to processes that are gone are dropped
    EXPECT_TRUE(plugIn->enableForPid(pid).ok());
    EXPECT_EQ(log.lines(), Lines{Format("enabling pid=%d for plug-in com.example.a.ext(2.0) %@ %@",
                                        pid, *plugIn->uuid(), *plugIn->url())});
    std::vector<ExternalServiceGrant> grants = manager->externalServiceGrants();
    ASSERT_EQ(grants.size(), ++n);
    EXPECT_EQ(grants.back().hostPid, pid);
    EXPECT_EQ(grants.back().executablePath, *plugIn->url() + "/Contents/Exec/a");
    Value expected = J(row.expected);
    if (!expected.has("EnvironmentVariables"))
      expected = expected.changing("EnvironmentVariables", J("{}"));
    EXPECT_EQ(grants.back().overlay,
              (Value{{"IPCService", expected}, {"BNBundlePackageType", "IPC!"}}));
  }
  // The service manager refuses (the executable cannot be run), or the
  // bundle is gone: an error, its log lines, and no grant.
  auto plugIn = make(PlugInInfo("a"));
  const std::string id = "com.example.a.ext(" + plugIn->uuid()->string() + ")";
  const std::string path = *plugIn->url();
  ASSERT_EQ(::chmod((path + "/Contents/Exec/a").c_str(), 0644), 0);
  ScopedLogCapture log;
  EXPECT_EQ(plugIn->enableForPid(77).description(),
            Error("Dromon", 4, "unable to enable plug-in " + id + " for pid 77").description());
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.lines()[1], "ipc error 13 allowing pid 77 to use plug-in com.example.a.ext(2.0) " +
                                plugIn->uuid()->string() + " at " + path);
  std::filesystem::remove_all(path);
  log.clear();
  EXPECT_EQ(plugIn->enableForPid(77).description(),
            Error("Dromon", 4, "cannot obtain executable path for plug-in " + id).description());
  EXPECT_EQ(log.lines().size(), 1u);  // "enabling ...", and no service-manager line
  EXPECT_EQ(manager->externalServiceGrants().size(), n);
}

// Instances of other versions are skipped; one without a version or a
// record counts; an incomplete one is skipped with a log line.
TEST_F(PlugInTest, CheckBusyFindsTheFirstInstanceOfThisVersion) {
  auto plugIn = make(PlugInInfo("a"));
  const Uuid self = *plugIn->uuid(), v1 = Uuid::random(), v200 = Uuid::random(),
             none = Uuid::random(), unknown = Uuid::random();
  versions = {{v1.string(), "1.0"}, {v200.string(), "2.00"}, {none.string(), nullopt}};
  plugIn = DRDPlugIn::initWithRGData(plugIn->rgproxy(), services());
  auto at = [&](pid_t pid, Uuid as, std::optional<std::string> path = "/b/A.plugin") {
    return BusyExtensionInstance{pid, std::move(path), "com.example.a", as};
  };
  const struct {
    std::vector<BusyExtensionInstance> instances;
    std::string busy;  // "pid version"; "": none; "!": the query fails
    const char* line;
  } rows[] = {{{}, "", nullptr},
              {{at(1, v1), at(2, self)}, "2 2.0", nullptr},
              {{at(1, v1), at(2, v200)}, "", nullptr},
              {{at(3, none)}, "3 -", nullptr},
              {{at(3, unknown)}, "3 -", nullptr},
              {{at(4, self, nullopt), at(5, self)},
               "5 2.0",
               "ipc reported incomplete bundle \"com.example.a\" for plug-in com.example.a.ext"},
              {{at(6, self)}, "!", "ipc failed to report dirty state for \"com.example.a\""}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.busy);
    serviceManager.instances = row.instances;
    serviceManager.busyError.reset();
    if (row.busy == "!") serviceManager.busyError = PosixError(EIO, "proc");
    serviceManager.busyQueries.clear();
    ScopedLogCapture log;
    std::optional<BusyInstance> busy = plugIn->checkBusy();
    EXPECT_EQ(busy ? std::to_string(busy->pid) + " " + busy->version.value_or("-") : "",
              row.busy == "!" ? "" : row.busy);
    EXPECT_EQ(log.lines(), row.line ? Lines{row.line} : Lines{});
    EXPECT_EQ(serviceManager.busyQueries, std::vector<Lines>{{"com.example.a"}});
  }
  // Without a bundle identifier nothing can be asked.
  serviceManager.busyQueries.clear();
  EXPECT_EQ(make(PlugInInfo("a").changing("BNBundleIdentifier", Value()))->checkBusy(), nullopt);
  EXPECT_TRUE(serviceManager.busyQueries.empty());
}

}  // namespace
}  // namespace dr::test
