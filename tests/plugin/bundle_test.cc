#include "plugin/bundle.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>

#include "tests/support/bundle_fixture.h"

namespace dr {
namespace {

using std::nullopt;
using Opt = std::optional<std::string>;

TEST(BundleTest, PathsOfBundlesOnDisk) {
  test::BundleFixture dir;
  const std::string app = dir.makeBundle(
      "Host.app", Value{{"BNBundleIdentifier", "com.example.host"}, {"BNBundleExecutable", "Host"}},
      "Host");
  const std::string bare = dir.makeBundle("Bare.appex", Value{{"BNBundleVersion", "1"}});
  const std::string noInfo = dir.makeBundle("NoInfo.appex", Value());
  const std::string escape = dir.makeBundle("Escape.appex", Value{{"BNBundleExecutable", "../x"}});
  dir.makeFolder("Escape.appex/Contents/Exec");
  dir.writeFile("Escape.appex/Contents/x", "");
  const std::string broken = dir.makeBundle("Broken.appex", Value());
  dir.writeFile("Broken.appex/Contents/Info.pdoc", "<pdoc><dict><key>a");
  const std::string listInfo = dir.makeBundle("List.appex", Value(Array{1}));
  const std::string tool = dir.writeFile("bin/tool", "#!/bin/sh\n");

  struct Row {
    const char* what;
    std::shared_ptr<DRBundle> bundle;
    Opt path, executable, identifier, plugIns;
    bool hasInfo;
  };
  const Opt exe = app + "/Contents/Exec/Host", id = "com.example.host";
  const Opt plugIns = app + "/Contents/PlugIns";
  auto self = [](const std::string& p) { return p + "/PlugIns"; };
  const Row rows[] = {
      {"app by path", DRBundle::initWithPath(app), app, exe, id, plugIns, true},
      {"app by path with a trailing slash", DRBundle::initWithURL(app + "/"), app, exe, id, plugIns,
       true},
      {"app by executable", DRBundle::initWithExecutablePath(*exe), app, exe, id, plugIns, true},
      // Without an executable the bundle stands for it, and is its own support folder.
      {"no executable", DRBundle::initWithPath(bare), bare, bare, nullopt, self(bare), true},
      {"no information", DRBundle::initWithPath(noInfo), noInfo, noInfo, nullopt, self(noInfo),
       false},
      {"unreadable information", DRBundle::initWithPath(broken), broken, broken, nullopt,
       self(broken), false},
      {"information not a dictionary", DRBundle::initWithPath(listInfo), listInfo, listInfo,
       nullopt, self(listInfo), false},
      {"executable name leaving Exec", DRBundle::initWithPath(escape), escape, escape, nullopt,
       self(escape), true},
      {"free-standing executable", DRBundle::initWithExecutableURL(tool), tool, tool, nullopt,
       self(tool), false},
      {"nothing there", DRBundle::initWithPath(dir.path("missing")), nullopt, nullopt, nullopt,
       nullopt, false},
      {"executable that does not exist", DRBundle::initWithExecutablePath(dir.path("nope")),
       nullopt, nullopt, nullopt, nullopt, false},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    ASSERT_NE(r.bundle, nullptr);
    EXPECT_EQ(r.bundle->path(), r.path);
    EXPECT_EQ(r.bundle->url(), r.path);
    EXPECT_EQ(r.bundle->executablePath(), r.executable);
    EXPECT_EQ(r.bundle->bundleIdentifier(), r.identifier);
    EXPECT_EQ(r.bundle->plugInsPath(), r.plugIns);
    EXPECT_EQ(r.bundle->infoDictionary().isDictionary(), r.hasInfo);
  }
  EXPECT_EQ(DRBundle::initWithPath(app)->bundleDirectory("Resources"), app + "/Contents/Resources");
}

TEST(BundleTest, MainBundleOfAFreeStandingProgramIsItself) {
  char buf[PATH_MAX];
  ssize_t n = ::readlink("/proc/self/exe", buf, sizeof buf - 1);
  ASSERT_GT(n, 0);
  std::string self(buf, static_cast<size_t>(n));
  auto main = DRBundle::initForMainBundle();
  EXPECT_EQ(main->path(), self);
  EXPECT_EQ(main->executablePath(), self);
}

// A reader handle that counts how often it is asked.
class CountingHandle : public BundleHandle {
 public:
  mutable int asked = 0;
  std::optional<std::string> stringProperty(int32_t property) const override {
    ++asked;
    if (property == kBundlePathProperty) return "/Apps/A.app";
    if (property == kBundleExecutablePathProperty) return "/Apps/A.app/Contents/Exec/A";
    return nullopt;
  }
  Value infoDictionary() const override { return Value(); }
};

TEST(BundleTest, SupportPathIsComputedOnce) {
  auto handle = std::make_shared<CountingHandle>();
  auto bundle = DRBundle::initWithIPCBundle(handle);
  EXPECT_EQ(bundle->supportPath(), "/Apps/A.app/Contents");
  const int asked = handle->asked;
  EXPECT_EQ(bundle->supportPath(), "/Apps/A.app/Contents");
  EXPECT_EQ(bundle->plugInsPath(), "/Apps/A.app/Contents/PlugIns");
  EXPECT_EQ(handle->asked, asked);
  EXPECT_EQ(bundle->stringProperty(7), nullopt);
}

}  // namespace
}  // namespace dr
