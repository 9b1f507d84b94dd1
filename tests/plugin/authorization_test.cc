#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <vector>

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

TEST_F(AuthorizationTest, HostRestrictionAndDemandedEntitlement) {
  const char* kAllowed = "com.corvel.developer.dromon.allowedplugins";
  const char* kDemand = "UXExtensionHostEntitlement";
  const std::string kInvalid = "invalid host restriction entitlement";
  const std::string kOutside = "the host's plug-in entitlement does not allow this plug-in";
  struct Row {
    const char* what;
    Value host;    // the host's entitlements
    Value demand;  // the plug-in's host entitlement; absent: none
    std::optional<std::string> refusal;
  };
  const Row rows[] = {
      {"unrestricted host, open plug-in", Value::EmptyDictionary(), Value(), std::nullopt},
      {"restriction is an array", Value{{kAllowed, Value::EmptyArray()}}, Value(), kInvalid},
      {"restriction is a string", Value{{kAllowed, "com.example.a.ext"}}, Value(), kInvalid},
      {"restriction is false", Value{{kAllowed, false}}, Value(), kInvalid},
      {"restriction is empty", Value{{kAllowed, Value::EmptyDictionary()}}, Value(), std::nullopt},
      {"restriction names the plug-in",
       Value{{kAllowed, Value{{"UXExtensionIdentifier", "com.example.a.ext"}}}}, Value(),
       std::nullopt},
      {"restriction names another",
       Value{{kAllowed, Value{{"UXExtensionIdentifier", "com.example.b.ext"}}}}, Value(), kOutside},
      {"restriction checked before the demand",
       Value{{kAllowed, Value{{"UXExtensionIdentifier", "com.example.b.ext"}}}},
       "host-entitlement-x", kOutside},
      {"demand not held", Value::EmptyDictionary(), "host-entitlement-x",
       "the host does not have the \"host-entitlement-x\" entitlement"},
      {"demand held as false", Value{{"host-entitlement-x", false}}, "host-entitlement-x",
       "the host does not have the \"host-entitlement-x\" entitlement"},
      {"demand held", Value{{"host-entitlement-x", true}}, "host-entitlement-x", std::nullopt},
      {"demand held as a string", Value{{"host-entitlement-x", "NO"}}, "host-entitlement-x",
       std::nullopt},
      {"demand that is no string", Value::EmptyDictionary(),
       Value(Array{Value("host-entitlement-x")}), std::nullopt},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    Value pd = row.demand.isPresent() ? Value{{kDemand, row.demand}} : Value();
    auto plugIn = make(PlugInInfo("a", pd));
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->allowForClient(FakeClient(row.host)), row.refusal);
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

TEST_F(EnableTest, SendsTheServiceOverlayWithTheEnvironment) {
  struct Row {
    const char* what;
    std::optional<std::string> testSdk;  // the daemon's DRTEST_SDK
    Value ipcService;                    // the bundle's "IPCService"; absent: none
    Value expected;                      // the overlay's "IPCService"
  };
  const Value kNone = Value::EmptyDictionary();
  const Row rows[] = {
      {"nothing to pass", std::nullopt, Value(), Value{{"EnvironmentVariables", kNone}}},
      {"daemon's SDK folder", "/sdk", Value(),
       Value{{"EnvironmentVariables", Value{{"DRTEST_SDK", "/sdk"}}}}},
      {"plug-in's variables win", "/sdk",
       Value{{"EnvironmentVariables", Value{{"DRTEST_SDK", "/own"}, {"A", "1"}}}, {"Other", 5}},
       Value{{"EnvironmentVariables", Value{{"A", "1"}, {"DRTEST_SDK", "/own"}}}, {"Other", 5}}},
      {"service that is no dictionary", "/sdk", "junk",
       Value{{"EnvironmentVariables", Value{{"DRTEST_SDK", "/sdk"}}}}},
      {"variables that are no dictionary", "/sdk", Value{{"EnvironmentVariables", "junk"}},
       Value{{"EnvironmentVariables", Value{{"DRTEST_SDK", "/sdk"}}}}},
      {"variables that are no strings", std::nullopt,
       Value{{"EnvironmentVariables", Value{{"A", 1}, {"B", "b"}, {"C", Value::EmptyArray()}}}},
       Value{{"EnvironmentVariables", Value{{"B", "b"}}}}},
  };
  int n = 0;
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    testSdk = row.testSdk;
    ++n;
    auto plugIn = make(PlugInInfo("a").changing("IPCService", row.ipcService));
    ASSERT_TRUE(plugIn);
    ScopedLogCapture log;
    pid_t pid = ::getpid();  // grants to processes that are gone are dropped
    EXPECT_TRUE(plugIn->enableForPid(pid).ok());
    EXPECT_EQ(log.lines(),
              (std::vector<std::string>{"enabling pid=" + std::to_string(pid) +
                                        " for plug-in com.example.a.ext(2.0) " +
                                        plugIn->uuid()->string() + " " + *plugIn->url()}));
    std::vector<ExternalServiceGrant> grants = manager->externalServiceGrants();
    ASSERT_EQ(grants.size(), static_cast<size_t>(n));
    EXPECT_EQ(grants.back().hostPid, pid);
    EXPECT_EQ(grants.back().executablePath, *plugIn->url() + "/Contents/Exec/a");
    EXPECT_EQ(grants.back().overlay,
              (Value{{"IPCService", row.expected}, {"BNBundlePackageType", "IPC!"}}));
  }
}

TEST_F(EnableTest, RefusalsAreErrorsWithTheirLogLines) {
  auto plugIn = make(PlugInInfo("a"));
  ASSERT_TRUE(plugIn);
  const std::string id = "com.example.a.ext(" + plugIn->uuid()->string() + ")";
  const std::string path = *plugIn->url();

  {  // The service manager refuses: the executable cannot be run.
    ASSERT_EQ(::chmod((path + "/Contents/Exec/a").c_str(), 0644), 0);
    ScopedLogCapture log;
    Status status = plugIn->enableForPid(77);
    ASSERT_FALSE(status.ok());
    const Error* error = &status.error();
    EXPECT_EQ(error->domain(), "Dromon");
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->ownDescription(), "unable to enable plug-in " + id + " for pid 77");
    ASSERT_EQ(log.lines().size(), 2u);
    EXPECT_EQ(log.lines()[1],
              "ipc error 13 allowing pid 77 to use plug-in com.example.a.ext(2.0) " +
                  plugIn->uuid()->string() + " at " + path);
    EXPECT_TRUE(manager->externalServiceGrants().empty());
  }
  {  // The bundle is gone.
    std::filesystem::remove_all(path);
    ScopedLogCapture log;
    Status status = plugIn->enableForPid(77);
    ASSERT_FALSE(status.ok());
    const Error* error = &status.error();
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->ownDescription(), "cannot obtain executable path for plug-in " + id);
    EXPECT_EQ(log.lines().size(), 1u);  // "enabling ...", and no service-manager line
    EXPECT_TRUE(manager->externalServiceGrants().empty());
  }
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

TEST_F(CheckBusyTest, FindsTheFirstInstanceOfAPlugInOfThisVersion) {
  const std::string bundle = "com.example.a";
  auto plugIn = make(PlugInInfo("a"));
  ASSERT_TRUE(plugIn);
  const Uuid self = *plugIn->uuid(), v1 = Uuid::random(), v200 = Uuid::random(),
             none = Uuid::random(), unknown = Uuid::random();
  versions = {{v1.string(), "1.0"}, {v200.string(), "2.00"}, {none.string(), std::nullopt}};
  auto instance = [&](pid_t pid, Uuid as, std::optional<std::string> path = "/b/A.plugin") {
    return BusyExtensionInstance{pid, std::move(path), bundle, as};
  };
  const std::string kIncomplete =
      "ipc reported incomplete bundle \"com.example.a\" for plug-in com.example.a.ext";
  struct Row {
    const char* what;
    std::vector<BusyExtensionInstance> instances;
    bool fails;
    std::optional<pid_t> busy;  // the pid of the answer
    std::optional<std::string> version;
    std::vector<std::string> lines;
  };
  const Row rows[] = {
      {"nothing running", {}, false, std::nullopt, std::nullopt, {}},
      {"another version, then this plug-in",
       {instance(1, v1), instance(2, self)},
       false,
       2,
       "2.0",
       {}},
      {"only other versions", {instance(1, v1), instance(2, v200)}, false, std::nullopt, "", {}},
      {"a plug-in without a version counts", {instance(3, none)}, false, 3, std::nullopt, {}},
      {"an entry without a record counts", {instance(3, unknown)}, false, 3, std::nullopt, {}},
      {"incomplete record skipped",
       {instance(4, self, std::nullopt), instance(5, self)},
       false,
       5,
       "2.0",
       {kIncomplete}},
      {"listing fails",
       {instance(6, self)},
       true,
       std::nullopt,
       std::nullopt,
       {"ipc failed to report dirty state for \"com.example.a\""}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    serviceManager.instances = row.instances;
    serviceManager.busyError.reset();
    if (row.fails) serviceManager.busyError = PosixError(EIO, "proc");
    serviceManager.busyQueries.clear();
    ScopedLogCapture log;
    std::optional<BusyInstance> busy = plugIn->checkBusy();
    EXPECT_EQ(busy ? std::optional<pid_t>(busy->pid) : std::nullopt, row.busy);
    if (busy) {
      EXPECT_EQ(busy->version, row.version);
    }
    EXPECT_EQ(log.lines(), row.lines);
    EXPECT_EQ(serviceManager.busyQueries, (std::vector<std::vector<std::string>>{{bundle}}));
  }

  // Without a bundle identifier nothing can be asked.
  auto anonymous = make(PlugInInfo("a").changing("BNBundleIdentifier", Value()));
  ASSERT_TRUE(anonymous);
  serviceManager.busyQueries.clear();
  serviceManager.instances = {instance(7, self)};
  serviceManager.busyError.reset();
  EXPECT_EQ(anonymous->checkBusy(), std::nullopt);
  EXPECT_TRUE(serviceManager.busyQueries.empty());
}

}  // namespace
}  // namespace dr::test
