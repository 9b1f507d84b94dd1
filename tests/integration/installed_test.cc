#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <thread>

#include <gtest/gtest.h>

#include "tests/integration/drkit_runner.h"
#include "tests/integration/world.h"

namespace dr::testing {
namespace {

namespace fs = std::filesystem;
using registry_test::WriteBytes;

// Registered plug-ins as sorted "identifier@version" once `expected` (up to 10 s), else the last.
std::string Installed(const World& w, const std::string& expected = "") {
  std::string seen;
  for (auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
       seen != expected && std::chrono::steady_clock::now() < deadline;) {
    std::vector<std::string> items;
    for (const Value forms = w.everything(); const Value& form : forms.array()) {
      items.push_back(form["identifier"].stringValue() + "@" + form["version"].stringValue());
    }
    std::sort(items.begin(), items.end());
    seen.clear();
    for (const std::string& item : items) seen += (seen.empty() ? "" : " ") + item;
    if (seen != expected) std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
  return seen;
}

class InstalledTest : public ::testing::Test {
 protected:
  std::string folder(const std::string& relative = "") const {
    return w.path("installed") + (relative.empty() ? "" : "/" + relative);
  }
  uint64_t remove(const std::string& path) const {
    return ErrorCode(w.call(Request("remove", {{"paths", Value(Array{Value(path)})}})));
  }
  std::string plugIn(const std::string& name, const std::string& version = "1.0",
                     const std::string& where = "installed") const {
    return w.makePlugIn(where + "/" + name + ".appex", name, version);
  }

  World w;
};

// The registry follows a running drd's folders within the settle time, once a bundle is whole.
TEST_F(InstalledTest, FollowsTheFoldersWhileRunning) {
  plugIn("present");
  plugIn("added", "1.0", "elsewhere");
  fs::create_directories(folder("Broken.appex/Contents"));
  WriteBytes(folder("Broken.appex/Contents/Info.pdoc"), "<?xml version=\"1.0\"?><pdoc");
  ASSERT_TRUE(w.start({"DR_PLUGIN_PATH=" + folder() + ":" + w.path("later/PlugIns")})) << w.log();
  ASSERT_EQ(ErrorCode(w.add({w.path("elsewhere/added.appex")})), 0u);

  struct Step {
    const char* what;
    std::function<void()> change;
    std::string expected;
  };
  const std::string app = folder("Tools.app/Contents/PlugIns/");
  const Step steps[] = {
      {"present at start, the broken bundle left out", [] {}, "added@1.0 present@1.0"},
      {"dropped in while running", [&] { plugIn("dropped"); }, "added@1.0 dropped@1.0 present@1.0"},
      {"an application copied in",
       [&] {
         w.makeApp("installed/Tools.app", "com.example.tools");
         w.makePlugIn("installed/Tools.app/Contents/PlugIns/tool.appex", "tool");
       },
       "added@1.0 dropped@1.0 present@1.0 tool@1.0"},
      {"replaced in place by a new version", [&] { plugIn("present", "2.0"); },
       "added@1.0 dropped@1.0 present@2.0 tool@1.0"},
      {"half-written",
       [&] {
         fs::create_directories(folder("half.appex/Contents"));
         WriteBytes(folder("half.appex/Contents/Info.pdoc"), "<?xml version=\"1.0\"?><pdoc vers");
         plugIn("marker");
       },
       "added@1.0 dropped@1.0 marker@1.0 present@2.0 tool@1.0"},
      {"then finished", [&] { plugIn("half"); },
       "added@1.0 dropped@1.0 half@1.0 marker@1.0 present@2.0 tool@1.0"},
      {"a file beside the broken bundle's Info.pdoc, and a marker gone",
       [&] {
         WriteBytes(folder("Broken.appex/Contents/notes"), "x");
         fs::remove_all(folder("marker.appex"));
       },
       "added@1.0 dropped@1.0 half@1.0 present@2.0 tool@1.0"},
      {"deleted", [&] { fs::remove_all(folder("dropped.appex")); },
       "added@1.0 half@1.0 present@2.0 tool@1.0"},
      {"a plug-in deleted from an application", [&] { fs::remove_all(app + "tool.appex"); },
       "added@1.0 half@1.0 present@2.0"},
      {"removed by the user", [&] { ASSERT_EQ(remove(folder("half.appex")), 0u); },
       "added@1.0 present@2.0"},
      {"a symbolic link to a bundle elsewhere",
       [&] {
         plugIn("linked", "1.0", "outside");
         fs::create_directory_symlink(w.path("outside/linked.appex"), folder("link.appex"));
       },
       "added@1.0 linked@1.0 present@2.0"},
      {"a folder made after start", [&] { w.makePlugIn("later/PlugIns/late.appex", "late"); },
       "added@1.0 late@1.0 linked@1.0 present@2.0"},
      {"the removed bundle changed: back again", [&] { plugIn("half", "1.1"); },
       "added@1.0 half@1.1 late@1.0 linked@1.0 present@2.0"},
      {"the link removed", [&] { fs::remove(folder("link.appex")); },
       "added@1.0 half@1.1 late@1.0 present@2.0"},
  };
  for (const Step& step : steps) {
    SCOPED_TRACE(step.what);
    step.change();
    EXPECT_EQ(Installed(w, step.expected), step.expected) << w.log();
  }
  EXPECT_NE(w.log().find("INSTALLED:linked.bundle linked(1.0)"), std::string::npos);
  EXPECT_NE(w.log().find(w.path("outside/linked.appex")), std::string::npos);
  EXPECT_EQ(Occurrences(w.log(), folder("Broken.appex")), 1u) << w.log();
}

// Changes made while drd was down are found at start; removals and "add"ed bundles stay.
TEST_F(InstalledTest, RestartReconciles) {
  plugIn("kept");
  plugIn("deleted");
  plugIn("updated");
  plugIn("removed");
  plugIn("added", "1.0", "elsewhere");
  ASSERT_TRUE(w.start({"DR_PLUGIN_PATH=" + folder()})) << w.log();
  ASSERT_EQ(ErrorCode(w.add({w.path("elsewhere/added.appex")})), 0u);
  const std::string all = "added@1.0 deleted@1.0 kept@1.0 removed@1.0 updated@1.0";
  ASSERT_EQ(Installed(w, all), all);
  ASSERT_EQ(remove(folder("removed.appex")), 0u);
  const Value kept = w.uuidOf("kept");

  ASSERT_TRUE(w.stop());
  fs::remove_all(folder("deleted.appex"));
  plugIn("updated", "2.0");
  ASSERT_TRUE(w.start({"DR_PLUGIN_PATH=" + folder()})) << w.log();
  EXPECT_EQ(Installed(w, "added@1.0 kept@1.0 updated@2.0"), "added@1.0 kept@1.0 updated@2.0");
  EXPECT_EQ(w.uuidOf("kept"), kept) << "an unchanged bundle is registered again";
  Ran from = RunDrkit(w.root(), {"explain", "kept"});
  EXPECT_NE(from.out.find("    install folder: " + folder() + "\n"), std::string::npos) << from.out;
  Ran removed = RunDrkit(w.root(), {"explain", folder("removed.appex")});
  EXPECT_NE(removed.out.find(": not registered: removed by the user on "), std::string::npos)
      << removed.out;

  ASSERT_TRUE(w.stop());
  w.makePlugIn("data/dromon/PlugIns/stray.appex", "stray");
  ASSERT_TRUE(w.start({"DR_PLUGIN_PATH="})) << w.log();
  EXPECT_EQ(Installed(w, "added@1.0"), "added@1.0");
  std::this_thread::sleep_for(std::chrono::milliseconds(1500));
  EXPECT_EQ(Installed(w, "added@1.0"), "added@1.0");
}

}  // namespace
}  // namespace dr::testing
