#include "platform/service_manager.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "core/log.h"
#include "registry/registry.h"
#include "registry/service_manager_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

TEST(ServiceManagerTest, SdkDictionaryFromTheFirstFolderThatHasIt) {
  test::BundleFixture dir;
  dir.writePdoc("one/com.example.both.pdoc", Value{{"from", "one"}});
  dir.writePdoc("two/com.example.both.pdoc", Value{{"from", "two"}});
  dir.writePdoc("two/com.example.second.pdoc", Value{{"from", "two"}});
  dir.writeFile("one/com.example.broken.pdoc", "<pdoc><dict>");
  dir.writePdoc("two/com.example.broken.pdoc", Value{{"from", "two"}});
  dir.writePdoc("one/com.example.list.pdoc", Value(Array{1}));
  dir.writePdoc("escape.pdoc", Value{{"from", "outside"}});
  test::ScopedEnv path("DR_SDK_PATH",
                       dir.path("one") + "::" + dir.path("two") + ":" + dir.path("absent"));
  ServiceManager* sm = DefaultServiceManager();

  struct Row {
    const char* identifier;
    Value expected;
    bool error;
  };
  const Row rows[] = {
      {"com.example.both", Value{{"from", "one"}}, false},
      {"com.example.second", Value{{"from", "two"}}, false},
      {"com.example.none", Value(), false},
      // The first file found is the registration, even when it is broken.
      {"com.example.broken", Value(), true},
      {"com.example.list", Value(), true},
      // An identifier names a file in a folder, never a path elsewhere.
      {"../escape", Value(), false},
      {"", Value(), false},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.identifier);
    Result<Value> got = sm->sdkDictionary(r.identifier);
    ASSERT_EQ(got.ok(), !r.error);
    if (got.ok()) {
      EXPECT_EQ(*got, r.expected);
    }
  }
  // Without a path, the folder under XDG_DATA_HOME.
  dir.writePdoc("data/dromon/SDKs/com.example.user.pdoc", Value{{"from", "user"}});
  test::ScopedEnv noPath("DR_SDK_PATH", std::nullopt);
  test::ScopedEnv data("XDG_DATA_HOME", dir.path("data"));
  EXPECT_EQ(sm->sdkDictionary("com.example.user").value_or(Value()), (Value{{"from", "user"}}));
}

using Child = testing::RunningProgram;

// Plug-in bundles on disk, registered in a real registry:
//   A.appex      com.example.a 1.0
//   B.appex      com.example.b 2.0
//   Outer.appex  com.example.outer 1.0, holding
//     Contents/PlugIns/Inner.appex  com.example.inner 3.0
//   Loose.appex  com.example.loose 1.0, not registered
class ServiceManagerProcessTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = std::filesystem::canonical(dir_.root()).string();
    make("A.appex", "com.example.a", "1.0");
    make("B.appex", "com.example.b", "2.0");
    make("Outer.appex", "com.example.outer", "1.0");
    make("Outer.appex/Contents/PlugIns/Inner.appex", "com.example.inner", "3.0");
    make("Loose.appex", "com.example.loose", "1.0");
    registry_ = test::OpenTestRegistry(root_ + "/data");
    ASSERT_TRUE(registry_);
    for (const char* b : {"A", "B", "Outer", "Outer.appex/Contents/PlugIns/Inner"}) {
      ASSERT_TRUE(registry_->registerBundle(bundle(b)).ok()) << b;
    }
    sm_ = NewServiceManager({.registry = registry_.get()});
  }

  void make(const std::string& relative, const std::string& id, const std::string& version) {
    dir_.makeBundle(relative, test::PlugInBundleInfo(id, version, "run"), "run");
  }
  // The bundle folder of "A" (A.appex) and so on.
  std::string bundle(const std::string& name) const { return root_ + "/" + name + ".appex"; }
  std::string exe(const std::string& name) const { return bundle(name) + "/Contents/Exec/run"; }

  test::BundleFixture dir_;
  std::string root_;
  std::unique_ptr<Registry> registry_;
  std::unique_ptr<ServiceManager> sm_;
};

TEST_F(ServiceManagerProcessTest, BusyInstancesAreTheLiveProcessesOfTheAskedBundles) {
  const std::string inner = "Outer.appex/Contents/PlugIns/Inner";
  Child a(exe("A")), b(exe("B")), innerChild(exe(inner)), loose(exe("Loose"));
  Child zombie(exe("A")), reaped(exe("A"));
  ::kill(zombie.pid(), SIGKILL);  // a zombie until the end of the test
  siginfo_t info;
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(zombie.pid()), &info, WEXITED | WNOWAIT), 0);
  ::kill(reaped.pid(), SIGKILL);
  reaped.wait();

  auto plugIn = [&](const std::string& name) {
    return registry_->entryForUrl(bundle(name))->uuid();
  };
  const BusyExtensionInstance instA{a.pid(), bundle("A"), "com.example.a", plugIn("A")};
  const BusyExtensionInstance instB{b.pid(), bundle("B"), "com.example.b", plugIn("B")};
  const BusyExtensionInstance instInner{innerChild.pid(), bundle(inner), "com.example.inner",
                                        plugIn(inner)};
  struct Row {
    std::vector<std::string> identifiers;
    std::vector<BusyExtensionInstance> expected;
  };
  const Row rows[] = {
      // An exited process is not busy, whether reaped or still a zombie.
      {{"com.example.a"}, {instA}},
      {{"com.example.a", "com.example.b"}, {instA, instB}},
      // A process in a nested bundle belongs to that bundle only.
      {{"com.example.outer"}, {}},
      {{"com.example.inner"}, {instInner}},
      // Unregistered bundles have no instances.
      {{"com.example.loose"}, {}},
      {{"com.example.none"}, {}},
      {{}, {}},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(::testing::PrintToString(r.identifiers));
    std::vector<BusyExtensionInstance> expected = r.expected;
    std::sort(expected.begin(), expected.end(),
              [](const auto& x, const auto& y) { return x.pid < y.pid; });
    Result<std::vector<BusyExtensionInstance>> got = sm_->busyExtensionInstances(r.identifiers);
    ASSERT_TRUE(got.ok()) << got.error().description();
    EXPECT_EQ(*got, expected);
  }
}

TEST_F(ServiceManagerProcessTest, AddServiceChecksTheExecutableAndRecordsTheGrant) {
  dir_.makeFolder("Plain");
  const Value overlay{{"BNBundlePackageType", "IPC!"}};
  struct Row {
    pid_t pid;
    std::string path;
    int expected;
  };
  const Row rows[] = {
      {::getpid(), exe("A"), 0},
      {::getpid(), exe("A") + "-missing", ENOENT},
      {::getpid(), bundle("A") + "/Contents/Info.pdoc", EACCES},  // mode 0644
      {::getpid(), bundle("A") + "/Contents/Exec", EACCES},       // a folder
      {::getpid(), bundle("A") + "/Contents/Info.pdoc/run", ENOENT},
      {::getpid(), "", ENOENT},
      {0, exe("A"), ESRCH},
      // Not in the registry: identified by its Info.pdoc.
      {::getpid(), root_ + "/Loose.appex/Contents/Exec/../Exec/run", 0},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.path);
    EXPECT_EQ(sm_->addExternalService(r.pid, r.path, overlay), r.expected);
  }
  // Granting the same executable to the same process again replaces it.
  const Value overlay2{{"BNBundlePackageType", "IPC!"}, {"IPCService", Value::EmptyDictionary()}};
  EXPECT_EQ(sm_->addExternalService(::getpid(), exe("A"), overlay2), 0);

  const std::vector<ExternalServiceGrant> expected = {
      {::getpid(), bundle("Loose"), "com.example.loose", "1.0", exe("Loose"), overlay},
      {::getpid(), bundle("A"), "com.example.a", "1.0", exe("A"), overlay2},
  };
  EXPECT_EQ(sm_->externalServiceGrants(), expected);

  // A grant to a host that has exited is dropped at the next grant.
  pid_t gone;
  {
    Child host(exe("B"));
    gone = host.pid();
  }
  EXPECT_EQ(sm_->addExternalService(gone, exe("B"), overlay), 0);
  EXPECT_EQ(sm_->externalServiceGrants().size(), 3u);
  EXPECT_EQ(sm_->addExternalService(::getpid(), exe("B"), overlay), 0);
  for (const ExternalServiceGrant& g : sm_->externalServiceGrants()) EXPECT_NE(g.hostPid, gone);
}

TEST_F(ServiceManagerProcessTest, RemoveStopsOnlyThatVersionsInstances) {
  ScopedLogCapture log;
  Child a(exe("A")), b(exe("B"));
  ASSERT_EQ(sm_->addExternalService(::getpid(), exe("A"), Value::EmptyDictionary()), 0);
  ASSERT_EQ(sm_->addExternalService(::getpid(), exe("B"), Value::EmptyDictionary()), 0);

  EXPECT_EQ(sm_->removeExternalServiceInstance("com.example.a", "2.0"), kNoInstanceRunning);
  EXPECT_EQ(sm_->removeExternalServiceInstance("com.example.c", "1.0"), kNoInstanceRunning);
  EXPECT_EQ(::kill(a.pid(), 0), 0);
  EXPECT_EQ(sm_->externalServiceGrants().size(), 2u);

  EXPECT_EQ(sm_->removeExternalServiceInstance("com.example.a", "1.0"), 0);
  EXPECT_EQ(a.wait(), SIGTERM);
  EXPECT_TRUE(log.contains("stopped pid " + std::to_string(a.pid()) +
                           ", an instance of com.example.a 1.0 at " + bundle("A")));
  EXPECT_EQ(::kill(b.pid(), 0), 0);
  ASSERT_EQ(sm_->externalServiceGrants().size(), 1u);
  EXPECT_EQ(sm_->externalServiceGrants()[0].bundleIdentifier, "com.example.b");
  // Nothing runs any more.
  EXPECT_EQ(sm_->removeExternalServiceInstance("com.example.a", "1.0"), kNoInstanceRunning);
}

TEST_F(ServiceManagerProcessTest, RemoveStopsInstancesOfBundlesNoLongerRegistered) {
  // Uninstalling is what asks for the removal, so the registry has already
  // forgotten the bundle; a never-registered bundle is known by its grant.
  ScopedLogCapture log;
  Child b(exe("B")), loose(exe("Loose"));
  ASSERT_EQ(sm_->addExternalService(::getpid(), exe("Loose"), Value::EmptyDictionary()), 0);
  ASSERT_TRUE(registry_->unregisterBundle(bundle("B")).ok());

  EXPECT_EQ(sm_->busyExtensionInstances({"com.example.b"})->size(), 0u);
  EXPECT_EQ(sm_->removeExternalServiceInstance("com.example.b", "2.0"), 0);
  EXPECT_EQ(b.wait(), SIGTERM);
  EXPECT_EQ(sm_->removeExternalServiceInstance("com.example.loose", "1.0"), 0);
  EXPECT_EQ(loose.wait(), SIGTERM);
  EXPECT_TRUE(sm_->externalServiceGrants().empty());
}

}  // namespace
}  // namespace dr
