// Plug-in records over registry entries: which are admitted, the tokens their
// form carries, which hosts may use them, enabling one for a host and asking
// whether one is busy.
#include "plugin/plugin.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>

#include "core/format.h"
#include "core/log.h"
#include "platform/sandbox.h"
#include "registry/service_manager_linux.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/fake_services.h"

namespace dr::test {
namespace {

using PlugInTest = PlugInFixture;

// Sandboxed plug-ins only, unless data or Effecta ones; registration times
// clamp into whole seconds; the hub protocol version defaults to 2.
TEST_F(PlugInTest, AdmitsSandboxedPlugInsAndTakesTheEntrysFields) {
  // plug-in dictionary | attributes | entitlements ("": none) | registered | what it must be or
  // the last modified time and hub protocol version
  const char* rows = R"({}|{}|{"com.corvel.security.app-sandbox": "NO"}|1.9|1 2; {}|{}||0|sandboxed;
      {}|{}|{"com.corvel.security.app-sandbox": 0.0}|0|sandboxed;
      {"UXExtensionProtocol": "#Data", "HubProtocolVersion": 5}|{}||-1.9|-1 5;
      {}|{"UXExtensionPointName": "Effecta"}||1e300|9223372036854775807 2;
      {"UXExtensionPointName": "Effecta"}|{}||0|sandboxed)";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0] + " " + r[1] + " " + r[2]);
    ScopedLogCapture log;
    RegistryEntry::Fields f;
    f.registrationDate = Date{std::stod(r[3])};
    RegistryEntryPtr e =
        entry(PlugInInfo("a", J(r[0]), J(r[1])), r[2].empty() ? Value() : J(r[2]), f);
    auto plugIn = DRDPlugIn::initWithRGData(e, services());
    if (!plugIn) {
      EXPECT_EQ(log.lines(), Lines{"ignoring mis-configured plug-in at " + e->url() +
                                   ": Dromon error 12: plug-ins must be " + r[4]});
      continue;
    }
    EXPECT_EQ(
        std::to_string(plugIn->lastModified()) + " " + std::to_string(plugIn->hubProtocolVersion()),
        r[4]);
  }
  // An entry without a path or a readable information dictionary: nothing, silently.
  ScopedLogCapture log;
  RegistryEntry::Fields f;
  f.plugInIdentifier = "x";
  auto files = std::make_shared<RegistryBundleFiles>(*pdoc::WriteXml(PlugInInfo("a")), nullopt);
  EXPECT_FALSE(DRDPlugIn::initWithRGData(std::make_shared<RegistryEntry>(f, files), services()));
  f.url = folder.path();
  files = std::make_shared<RegistryBundleFiles>("<pdoc><dict><key>", nullopt);
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
  // "Shared" ("": none) | "name=path" relative to the bundle for each token | the failure logged
  const char* rows =
      R"(||; "."|.=.|; {"r/a": true}|r/a=r/a|; 42||; ["r/a", 7, "r/n/b"]|r/a=r/a r/n/b=r/n/b|;
      ["missing"]||/missing in plug-in at @: No such file or directory;
      "../outside"||/../outside in plug-in at @: Permission denied;
      "r/escape"||/r/escape in plug-in at @: Permission denied; "r/alias"|r/alias=r/n/b|)";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0]);
    PlugInServices s = services();
    s.sandbox = sandbox.get();
    Value pd = r[0].empty() ? Value() : Value{{"Shared", J(r[0])}};
    auto plugIn = DRDPlugIn::initWithRGData(entry(PlugInInfo("a", pd), Sandboxed()), s);
    std::string bundle = *plugIn->url();
    registry_test::WriteBytes(bundle + "/r/a", "a");
    registry_test::WriteBytes(bundle + "/r/n/b", "b");
    registry_test::WriteBytes(bundle + "/../outside", "o");
    std::filesystem::create_symlink("../../outside", bundle + "/r/escape");
    std::filesystem::create_symlink("n/b", bundle + "/r/alias");
    ScopedLogCapture log;
    Dictionary form{{"identifier", Value("kept")}};
    plugIn->augmentForm(form);
    EXPECT_EQ(form.size(), r[0].empty() ? 1u : 2u);
    std::string granted;
    for (const auto& [name, token] : form["extensions"].dictionary()) {
      std::string path = consumeExtension(token.stringValue(), options).value_or("(refused)");
      if (path.starts_with(bundle)) path = path == bundle ? "." : path.substr(bundle.size() + 1);
      granted += (granted.empty() ? "" : " ") + name.str() + "=" + path;
    }
    EXPECT_EQ(granted, r[1]);
    std::string failure = r[2];
    if (!failure.empty()) failure = "failed to make extension for " + bundle + failure;
    if (size_t at = failure.find('@'); at != std::string::npos) failure.replace(at, 1, bundle);
    EXPECT_EQ(log.lines(), failure.empty() ? Lines{} : Lines{failure});
  }
}

// The host's restriction is checked before the plug-in's demand; a demand
// that is no string demands nothing; any value but false holds it.
TEST_F(PlugInTest, HostRestrictionAndDemandedEntitlement) {
  const std::string restriction = "com.corvel.developer.dromon.allowedplugins";
  // the host's restriction ("": none) or entitlements | the plug-in's demand | the refusal
  const char* rows = R"(||; []||invalid host restriction entitlement; {}||;
      {"UXExtensionIdentifier": "com.example.a.ext"}||;
      {"UXExtensionIdentifier": "com.example.b.ext"}|"x"|the host's plug-in entitlement does not allow this plug-in;
      {"x": false}|"x"|the host does not have the "x" entitlement; {"x": "NO"}|"x"|; |["x"]|)";
  for (const auto& r : Table(rows)) {
    Value host = r[0].empty() ? J("{}") : J(r[0]);
    if (!r[0].empty() && !host.has("x")) host = Value{{restriction, host}};
    Value pd = r[1].empty() ? Value() : Value{{"UXExtensionHostEntitlement", J(r[1])}};
    EXPECT_EQ(make(PlugInInfo("a", pd))->allowForClient(FakeClient(host)).value_or(""), r[2])
        << r[0] << " " << r[1];
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
  // DRTEST_SDK ("": none) | the bundle's "IPCService" ("": none) | its variables in the overlay
  const char* rows =
      R"(||{}; /sdk|{"EnvironmentVariables": {"DRTEST_SDK": "/own", "A": "1"}, "Other": 5}|
        {"DRTEST_SDK": "/own", "A": "1"}; /sdk|"junk"|{"DRTEST_SDK": "/sdk"};
      /sdk|{"EnvironmentVariables": "junk"}|{"DRTEST_SDK": "/sdk"};
      |{"EnvironmentVariables": {"A": 1, "B": "b", "C": []}}|{"B": "b"})";
  size_t n = 0;
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[1]);
    if (r[0].empty())
      testSdk.reset();
    else
      testSdk = r[0];
    Value service = r[1].empty() ? Value() : J(r[1]);
    auto plugIn = make(PlugInInfo("a").changing("IPCService", service));
    ScopedLogCapture log;
    pid_t pid = ::getpid();  // grants to processes that are gone are dropped
    EXPECT_TRUE(plugIn->enableForPid(pid).ok());
    EXPECT_EQ(log.lines(), Lines{Format("enabling pid=%d for plug-in com.example.a.ext(2.0) %@ %@",
                                        pid, *plugIn->uuid(), *plugIn->url())});
    std::vector<ExternalServiceGrant> grants = manager->externalServiceGrants();
    ASSERT_EQ(grants.size(), ++n);
    EXPECT_EQ(grants.back().hostPid, pid);
    EXPECT_EQ(grants.back().executablePath, *plugIn->url() + "/Contents/Exec/a");
    Value expected = service.isDictionary() ? service : J("{}");
    expected = expected.changing("EnvironmentVariables", J(r[2]));
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
  EXPECT_EQ(log.lines().at(1),
            "ipc error 13 allowing pid 77 to use plug-in com.example.a.ext(2.0) " +
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
  std::map<std::string, Uuid> ids{{"v1", Uuid::random()},
                                  {"v200", Uuid::random()},
                                  {"none", Uuid::random()},
                                  {"unknown", Uuid::random()}};
  versions = {
      {ids["v1"].string(), "1.0"}, {ids["v200"].string(), "2.00"}, {ids["none"].string(), nullopt}};
  auto plugIn = make(PlugInInfo("a"));
  ids["self"] = *plugIn->uuid();
  // instances (pid:plug-in, "-": no path) | the busy one's "pid version" ("!": the query fails)
  const char* rows = R"(||; 1:v1 2:self|2 2.0|; 1:v1 2:v200||; 3:none|3 -|; 3:unknown|3 -|;
      4:-self 5:self|5 2.0|ipc reported incomplete bundle "com.example.a" for plug-in com.example.a.ext;
      6:self|!|ipc failed to report dirty state for "com.example.a")";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0]);
    serviceManager.instances.clear();
    std::istringstream in(r[0]);
    for (std::string i; in >> i;) {
      std::string who = i.substr(i.find(':') + 1);
      std::optional<std::string> path = "/b/A.plugin";
      if (who[0] == '-') path = nullopt, who.erase(0, 1);
      serviceManager.instances.push_back({std::stoi(i), path, "com.example.a", ids[who]});
    }
    serviceManager.busyError.reset();
    if (r[1] == "!") serviceManager.busyError = PosixError(EIO, "proc");
    serviceManager.busyQueries.clear();
    ScopedLogCapture log;
    std::optional<BusyInstance> busy = plugIn->checkBusy();
    EXPECT_EQ(busy ? std::to_string(busy->pid) + " " + busy->version.value_or("-") : "",
              r[1] == "!" ? "" : r[1]);
    EXPECT_EQ(log.lines(), r[2].empty() ? Lines{} : Lines{r[2]});
    EXPECT_EQ(serviceManager.busyQueries, std::vector<Lines>{{"com.example.a"}});
  }
  // Without a bundle identifier nothing can be asked.
  serviceManager.busyQueries.clear();
  EXPECT_EQ(make(PlugInInfo("a").changing("BNBundleIdentifier", Value()))->checkBusy(), nullopt);
  EXPECT_TRUE(serviceManager.busyQueries.empty());
}

}  // namespace
}  // namespace dr::test
