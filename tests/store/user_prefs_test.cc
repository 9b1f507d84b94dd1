// The user's exclusions, read from the current host's preferences file.
#include "store/user_prefs.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include "core/log.h"
#include "platform/pdoc_file.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::TempFolder;
using testing::WriteTestFile;

class UserPrefsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(FileSystem::Default()->makeDirectories(options_.directory + "/ByHost").ok());
  }
  TempFolder folder_;
  PreferencesOptions options_{folder_ / "config/dromon", "0123abcd"};
  const std::string hostFile_ =
      options_.directory + "/ByHost/com.corvel.dromon.userprefs.0123abcd.pdoc";
  std::unique_ptr<Preferences> preferences_ = MakeFilePreferences(options_);
  DRDUserPrefs prefs_{preferences_.get()};
};

// Preferences for any host, or for another host, are not this host's; a
// change (by another process) is seen at the next read, whatever its kind.
TEST_F(UserPrefsTest, OnlyThisHostsFileIsReadAndChangesAreSeenAtTheNextRead) {
  const Value rules = Value(Array{Value{{"UXExtensionIdentifier", "com.example.hidden"}}});
  for (const char* name :
       {"/com.corvel.dromon.userprefs.pdoc", "/ByHost/com.corvel.dromon.userprefs.ffff.pdoc"}) {
    ASSERT_TRUE(pdoc::WriteFile(options_.directory + name, Value{{"exclusions", rules}}).ok());
  }
  EXPECT_TRUE(prefs_.exclusions().isAbsent());
  pid_t pid = ::fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) ::_exit(pdoc::WriteFile(hostFile_, Value{{"exclusions", rules}}).ok() ? 0 : 1);
  int status;
  ASSERT_EQ(::waitpid(pid, &status, 0), pid);
  ASSERT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(prefs_.exclusions(), rules);
  ASSERT_TRUE(pdoc::WriteFile(hostFile_, Value{{"exclusions", Value("odd")}}).ok());
  EXPECT_EQ(prefs_.exclusions(), Value("odd"));
}

TEST_F(UserPrefsTest, BrokenFileReadsAsNoExclusionsAndIsLoggedOnce) {
  for (const char* bytes : {"<pdoc><dict><key>exclusions", "[1, 2]"}) {
    ScopedLogCapture log;
    ASSERT_TRUE(WriteTestFile(hostFile_, bytes));
    EXPECT_TRUE(prefs_.exclusions().isAbsent() && prefs_.exclusions().isAbsent()) << bytes;
    ASSERT_EQ(log.lines().size(), 1u) << bytes;
    EXPECT_TRUE(log.contains(hostFile_));
  }
}

TEST(PreferencesOptionsTest, LocationsComeFromTheEnvironment) {
  const char* xdg = "/cfg";
  auto env = [&](std::string_view name) -> const char* {
    return name == "HOME" ? "/home/u" : name == "XDG_CONFIG_HOME" ? xdg : nullptr;
  };
  PreferencesOptions options = PreferencesOptionsFromEnvironment(env);
  EXPECT_EQ(options.directory, "/cfg/dromon");
  EXPECT_FALSE(options.hostId.empty());
  EXPECT_EQ(options.hostId.find_first_of(" \n/"), std::string::npos);
  xdg = nullptr;
  EXPECT_EQ(PreferencesOptionsFromEnvironment(env).directory, "/home/u/.config/dromon");
}

}  // namespace
}  // namespace dr
