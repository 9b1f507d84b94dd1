#include "platform/service_manager.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

#include "core/log.h"
#include "registry/registry.h"
#include "registry/service_manager_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

using Child = testing::RunningProgram;

// Busy: the live processes of the asked bundles (not a zombie's, not a nested
// bundle's). Granted: a checked executable, named by the registry or its own
// Info.pdoc. Stopped: that version's instances, even once unregistered. The
// bundles: com.example.A 1.0, com.example.B 2.0 and com.example.Outer holding
// com.example.Inner, registered; com.example.Loose, not.
TEST(ServiceManagerTest, BusyInstancesGrantsSdksAndRemovalFollowTheLiveProcesses) {
  test::BundleFixture dir;
  const std::string root = std::filesystem::canonical(dir.root()).string();
  auto bundle = [&](const std::string& name) { return root + "/" + name + ".appex"; };
  auto exe = [&](const std::string& name) { return bundle(name) + "/Contents/Exec/run"; };
  std::unique_ptr<Registry> registry = test::OpenTestRegistry(root + "/data");
  for (const char* name : {"A", "B", "Outer", "Outer.appex/Contents/PlugIns/Inner", "Loose"}) {
    const std::string id = std::filesystem::path(name).filename().string();
    dir.makeBundle(name + std::string(".appex"),
                   test::PlugInBundleInfo("com.example." + id, id == "B" ? "2.0" : "1.0", "run"),
                   "run");
    ASSERT_TRUE(id == "Loose" || registry->registerBundle(bundle(name)).ok()) << name;
  }
  std::unique_ptr<ServiceManager> sm = NewServiceManager({.registry = registry.get()});
  ScopedLogCapture log;
  const std::string inner = "Outer.appex/Contents/PlugIns/Inner";
  Child a(exe("A")), b(exe("B")), in(exe(inner)), loose(exe("Loose")), zombie(exe("A"));
  ::kill(zombie.pid(), SIGKILL);  // a zombie until the end of the test
  siginfo_t info;
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(zombie.pid()), &info, WEXITED | WNOWAIT), 0);
  auto busy = [&](const std::string& name, const char* id, pid_t pid) {
    return BusyExtensionInstance{pid, bundle(name), id,
                                 registry->entryForUrl(bundle(name))->uuid()};
  };
  const std::pair<std::vector<std::string>, std::vector<BusyExtensionInstance>> queries[] = {
      {{"com.example.A"}, {busy("A", "com.example.A", a.pid())}},
      {{"com.example.Outer", "com.example.Inner"}, {busy(inner, "com.example.Inner", in.pid())}},
      {{"com.example.Loose", "com.example.none"}, {}},
      {{}, {}},
  };
  for (const auto& [identifiers, expected] : queries) {
    EXPECT_EQ(
        sm->busyExtensionInstances(identifiers).value_or(std::vector<BusyExtensionInstance>{}),
        expected);
  }
  const Value overlay{{"BNBundlePackageType", "IPC!"}};
  const std::pair<std::string, int> grants[] = {
      {exe("A") + "-missing", ENOENT},
      {bundle("A") + "/Contents/Info.pdoc", EACCES},  // mode 0644
      {bundle("A") + "/Contents/Exec", EACCES},       // a folder
      {"", ENOENT},
      {exe("A"), 0},
      {root + "/Loose.appex/Contents/Exec/../Exec/run", 0},
      {exe("A"), 0},  // the same again replaces it
  };
  for (const auto& [path, expected] : grants) {
    EXPECT_EQ(sm->addExternalService(::getpid(), path, overlay), expected) << path;
  }
  EXPECT_EQ(sm->addExternalService(0, exe("A"), overlay), ESRCH);
  EXPECT_EQ(sm->externalServiceGrants(),
            (std::vector<ExternalServiceGrant>{
                {::getpid(), bundle("Loose"), "com.example.Loose", "1.0", exe("Loose"), overlay},
                {::getpid(), bundle("A"), "com.example.A", "1.0", exe("A"), overlay}}));
  // An SDK registration is the first folder's file, even one holding no
  // dictionary; an identifier names no path.
  dir.writePdoc("sdk/com.example.list.pdoc", Value(Array{1}));
  test::ScopedEnv path("DR_SDK_PATH", dir.path("sdk"));
  EXPECT_FALSE(sm->sdkDictionary("com.example.list").ok());
  EXPECT_EQ(sm->sdkDictionary("../sdk/com.example.list").value_or(Value(1)), Value());

  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.A", "2.0"), kNoInstanceRunning);
  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.A", "1.0"), 0);
  EXPECT_EQ(a.wait(), SIGTERM);
  EXPECT_TRUE(log.contains("stopped pid " + std::to_string(a.pid()) +
                           ", an instance of com.example.A 1.0 at " + bundle("A")));
  ASSERT_TRUE(registry->unregisterBundle(bundle("B")).ok());
  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.B", "2.0"), 0);
  EXPECT_EQ(b.wait(), SIGTERM);
  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.Loose", "1.0"), 0);
  EXPECT_EQ(loose.wait(), SIGTERM);
  EXPECT_TRUE(sm->externalServiceGrants().empty());
}

}  // namespace
}  // namespace dr
