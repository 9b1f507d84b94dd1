#include "store/user_prefs.h"

#include <gtest/gtest.h>

#include "core/log.h"
#include "platform/pdoc_file.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

// Another host's file is not this host's; a broken one, or one holding no
// dictionary, reads as no exclusions and is logged once.
TEST(UserPrefsTest, OnlyThisHostsFileIsReadAndABrokenOneIsLoggedOnce) {
  testing::TempFolder folder;
  PreferencesOptions options = PreferencesOptionsFromEnvironment(
      [&](std::string_view name) { return name == "HOME" ? folder.path().c_str() : nullptr; });
  EXPECT_EQ(options.directory, folder / ".config/dromon");
  options.hostId = "0123abcd";
  std::unique_ptr<Preferences> preferences = MakeFilePreferences(options);
  DRDUserPrefs prefs{preferences.get()};
  const std::string host = options.directory + "/ByHost/com.corvel.dromon.userprefs.";
  ASSERT_TRUE(testing::WriteTestFile(host + "ffff.pdoc", "{\"exclusions\": [1]}"));
  EXPECT_TRUE(prefs.exclusions().isAbsent());
  for (const char* bytes : {"<pdoc><dict><key>exclusions", "[1, 2]"}) {
    ScopedLogCapture log;
    ASSERT_TRUE(testing::WriteTestFile(host + "0123abcd.pdoc", bytes));
    EXPECT_TRUE(prefs.exclusions().isAbsent() && prefs.exclusions().isAbsent()) << bytes;
    EXPECT_EQ(log.lines().size(), 1u) << bytes;
  }
}

}  // namespace
}  // namespace dr
