#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "core/format.h"
#include "core/log.h"
#include "platform/code_signing.h"
#include "plugin/plugin.h"
#include "registry/service_manager_linux.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/bundle_fixture.h"

namespace dr::test {
namespace {

// A host as the daemon's client connection presents it.
class FakeClient : public PlugInClient {
 public:
  explicit FakeClient(Value entitlements) : entitlements_(std::move(entitlements)) {}
  pid_t pid() const override { return 4242; }
  Value entitlementValueForKey(std::string_view key) const override { return entitlements_[key]; }
  bool hasEntitlement(std::string_view key) const override {
    return IsEntitlementHeld(entitlements_[key]);
  }

 private:
  Value entitlements_;
};

using AuthorizationTest = PlugInFixture;

// The host's restriction is checked before the plug-in's demand; a demand
// that is no string demands nothing; any value but false holds it.
TEST_F(AuthorizationTest, HostRestrictionAndDemandedEntitlement) {
  const char* kAllowed = "com.corvel.developer.dromon.allowedplugins";
  const std::string kInvalid = "invalid host restriction entitlement";
  const std::string kOutside = "the host's plug-in entitlement does not allow this plug-in";
  const std::string kLacks = "the host does not have the \"x\" entitlement";
  const Value onlyA{{kAllowed, Value{{"UXExtensionIdentifier", "com.example.a.ext"}}}};
  const Value onlyB{{kAllowed, Value{{"UXExtensionIdentifier", "com.example.b.ext"}}}};
  struct Row {
    Value host, demand;  // the host's entitlements; the plug-in's demand (absent: none)
    std::optional<std::string> refusal;
  };
  const Row rows[] = {
      {Value::EmptyDictionary(), Value(), std::nullopt},
      {Value{{kAllowed, Value::EmptyArray()}}, Value(), kInvalid},
      {Value{{kAllowed, false}}, Value(), kInvalid},
      {Value{{kAllowed, Value::EmptyDictionary()}}, Value(), std::nullopt},
      {onlyA, Value(), std::nullopt},
      {onlyB, Value(), kOutside},
      {onlyB, "x", kOutside},
      {Value{{"x", false}}, "x", kLacks},
      {Value{{"x", true}}, "x", std::nullopt},
      {Value{{"x", "NO"}}, "x", std::nullopt},
      {Value::EmptyDictionary(), Value(Array{Value("x")}), std::nullopt},
  };
  for (const Row& row : rows) {
    Value pd = row.demand.isPresent() ? Value{{"UXExtensionHostEntitlement", row.demand}} : Value();
    auto plugIn = make(PlugInInfo("a", pd));
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->allowForClient(FakeClient(row.host)), row.refusal)
        << row.host.description() << " " << row.demand.description();
  }
}

// Enabling goes through the real service manager, which checks the
// executable and records the grant with the overlay it was sent.
class EnableTest : public PlugInFixture {
 protected:
  void SetUp() override {
    registry_test::WriteBytes(folder / ("sdks/" + std::string(kPoint) + ".pdoc"),
                              pdoc::WriteXml(Value::EmptyDictionary()).value());
  }
  PlugInServices services() override {
    PlugInServices s = PlugInFixture::services();
    s.serviceManager = manager.get();
    s.getenv = [this](const char* name) -> const char* {
      return testSdk && std::string_view(name) == "DRTEST_SDK" ? testSdk->c_str() : nullptr;
    };
    return s;
  }
  ScopedEnv sdkPath{"DR_SDK_PATH", folder / "sdks"};
  std::unique_ptr<ServiceManager> manager = NewServiceManager({});
  std::optional<std::string> testSdk;
};

// The overlay's variables: the daemon's test SDK folder, then the plug-in's
// own string variables over it.
TEST_F(EnableTest, SendsTheServiceOverlayWithTheEnvironment) {
  struct Row {
    std::optional<std::string> testSdk;  // the daemon's DRTEST_SDK
    Value ipcService;                    // the bundle's "IPCService"; absent: none
    Value expected;                      // the overlay's "IPCService"
  };
  auto env = [](const Value& variables) { return Value{{"EnvironmentVariables", variables}}; };
  const Value kSdk = env(Value{{"DRTEST_SDK", "/sdk"}});
  const Row rows[] = {
      {std::nullopt, Value(), env(Value::EmptyDictionary())},
      {"/sdk", Value(), kSdk},
      {"/sdk", env(Value{{"DRTEST_SDK", "/own"}, {"A", "1"}}).changing("Other", 5),
       env(Value{{"A", "1"}, {"DRTEST_SDK", "/own"}}).changing("Other", 5)},
      {"/sdk", "junk", kSdk},
      {"/sdk", env("junk"), kSdk},
      {std::nullopt, env(Value{{"A", 1}, {"B", "b"}, {"C", Value::EmptyArray()}}),
       env(Value{{"B", "b"}})},
  };
  size_t n = 0;
  for (const Row& row : rows) {
    SCOPED_TRACE(row.ipcService.description());
    testSdk = row.testSdk;
    auto plugIn = make(PlugInInfo("a").changing("IPCService", row.ipcService));
    ASSERT_TRUE(plugIn);
    ScopedLogCapture log;
    pid_t pid = ::getpid();  // grants to processes that are gone are dropped
    EXPECT_TRUE(plugIn->enableForPid(pid).ok());
    EXPECT_EQ(
        log.lines(),
        (std::vector<std::string>{Format("enabling pid=%d for plug-in com.example.a.ext(2.0) %@ %@",
                                         pid, *plugIn->uuid(), *plugIn->url())}));
    std::vector<ExternalServiceGrant> grants = manager->externalServiceGrants();
    ASSERT_EQ(grants.size(), ++n);
    EXPECT_EQ(grants.back().hostPid, pid);
    EXPECT_EQ(grants.back().executablePath, *plugIn->url() + "/Contents/Exec/a");
    EXPECT_EQ(grants.back().overlay,
              (Value{{"IPCService", row.expected}, {"BNBundlePackageType", "IPC!"}}));
  }
}

// The service manager refuses (the executable cannot be run), or the bundle
// is gone: an error, its log lines, and no grant.
TEST_F(EnableTest, RefusalsAreErrorsWithTheirLogLines) {
  auto plugIn = make(PlugInInfo("a"));
  ASSERT_TRUE(plugIn);
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
  EXPECT_TRUE(manager->externalServiceGrants().empty());
}

// Other plug-ins' versions come from the database; here from a table.
class CheckBusyTest : public PlugInFixture {
 protected:
  PlugInServices services() override {
    PlugInServices s = PlugInFixture::services();
    s.plugInVersion = [this](const Uuid& uuid) -> std::optional<std::string> {
      auto it = versions.find(uuid.string());
      return it == versions.end() ? std::nullopt : it->second;
    };
    return s;
  }
  std::map<std::string, std::optional<std::string>> versions;
};

// Instances of other versions are skipped; one without a version or a
// record counts; an incomplete one is skipped with a log line.
TEST_F(CheckBusyTest, FindsTheFirstInstanceOfAPlugInOfThisVersion) {
  auto plugIn = make(PlugInInfo("a"));
  ASSERT_TRUE(plugIn);
  const Uuid self = *plugIn->uuid(), v1 = Uuid::random(), v200 = Uuid::random(),
             none = Uuid::random(), unknown = Uuid::random();
  versions = {{v1.string(), "1.0"}, {v200.string(), "2.00"}, {none.string(), std::nullopt}};
  auto at = [&](pid_t pid, Uuid as, std::optional<std::string> path = "/b/A.plugin") {
    return BusyExtensionInstance{pid, std::move(path), "com.example.a", as};
  };
  struct Row {
    std::vector<BusyExtensionInstance> instances;
    bool fails;
    pid_t busy;  // the pid of the answer; 0: none
    std::optional<std::string> version;
    const char* line;
  };
  const Row rows[] = {
      {{}, false, 0, std::nullopt, nullptr},
      {{at(1, v1), at(2, self)}, false, 2, "2.0", nullptr},
      {{at(1, v1), at(2, v200)}, false, 0, "", nullptr},
      {{at(3, none)}, false, 3, std::nullopt, nullptr},
      {{at(3, unknown)}, false, 3, std::nullopt, nullptr},
      {{at(4, self, std::nullopt), at(5, self)},
       false,
       5,
       "2.0",
       "ipc reported incomplete bundle \"com.example.a\" for plug-in com.example.a.ext"},
      {{at(6, self)},
       true,
       0,
       std::nullopt,
       "ipc failed to report dirty state for \"com.example.a\""},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.busy);
    serviceManager.instances = row.instances;
    serviceManager.busyError.reset();
    if (row.fails) serviceManager.busyError = PosixError(EIO, "proc");
    serviceManager.busyQueries.clear();
    ScopedLogCapture log;
    std::optional<BusyInstance> busy = plugIn->checkBusy();
    EXPECT_EQ(busy ? busy->pid : 0, row.busy);
    if (busy) {
      EXPECT_EQ(busy->version, row.version);
    }
    EXPECT_EQ(log.lines(),
              row.line ? std::vector<std::string>{row.line} : std::vector<std::string>{});
    EXPECT_EQ(serviceManager.busyQueries,
              (std::vector<std::vector<std::string>>{{"com.example.a"}}));
  }
  // Without a bundle identifier nothing can be asked.
  auto anonymous = make(PlugInInfo("a").changing("BNBundleIdentifier", Value()));
  ASSERT_TRUE(anonymous);
  serviceManager.busyQueries.clear();
  serviceManager.busyError.reset();
  EXPECT_EQ(anonymous->checkBusy(), std::nullopt);
  EXPECT_TRUE(serviceManager.busyQueries.empty());
}

}  // namespace
}  // namespace dr::test
