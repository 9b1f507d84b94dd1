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
  UserPrefsTest()
      : options_{folder_ / "config/dromon", "0123abcd"},
        preferences_(MakeFilePreferences(options_)),
        prefs_(preferences_.get()) {
    EXPECT_TRUE(FileSystem::Default()->makeDirectories(options_.directory + "/ByHost").ok());
  }

  std::string hostFile() const {
    return options_.directory + "/ByHost/com.corvel.dromon.userprefs.0123abcd.pdoc";
  }

  TempFolder folder_;
  PreferencesOptions options_;
  std::unique_ptr<Preferences> preferences_;
  DRDUserPrefs prefs_;
};

const Value kRules = Value(Array{Value{{"UXExtensionIdentifier", Value("com.example.hidden")}}});

TEST_F(UserPrefsTest, OnlyThisHostsFileIsReadAndChangesAreSeenAtTheNextRead) {
  // Preferences for any host, or for another host, are not this host's.
  for (const char* name :
       {"/com.corvel.dromon.userprefs.pdoc", "/ByHost/com.corvel.dromon.userprefs.ffff.pdoc"}) {
    ASSERT_TRUE(pdoc::WriteFile(options_.directory + name, Value{{"exclusions", kRules}}).ok());
  }
  EXPECT_TRUE(prefs_.exclusions().isAbsent());
  pid_t pid = ::fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) ::_exit(pdoc::WriteFile(hostFile(), Value{{"exclusions", kRules}}).ok() ? 0 : 1);
  int status;
  ASSERT_EQ(::waitpid(pid, &status, 0), pid);
  ASSERT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(prefs_.exclusions(), kRules);
  // Replaced by something that is not an array: answered as it is.
  ASSERT_TRUE(pdoc::WriteFile(hostFile(), Value{{"exclusions", Value("odd")}}).ok());
  EXPECT_EQ(prefs_.exclusions(), Value("odd"));
}

TEST_F(UserPrefsTest, BrokenFileReadsAsNoExclusionsAndIsLoggedOnce) {
  ScopedLogCapture log;
  for (const char* bytes : {"<pdoc><dict><key>exclusions", "[1, 2]"}) {
    SCOPED_TRACE(bytes);
    log.clear();
    ASSERT_TRUE(WriteTestFile(hostFile(), bytes));
    EXPECT_TRUE(prefs_.exclusions().isAbsent());
    EXPECT_TRUE(prefs_.exclusions().isAbsent());
    EXPECT_EQ(log.lines().size(), 1u);
    EXPECT_TRUE(log.contains(hostFile()));
  }
}

TEST(PreferencesOptionsTest, LocationsComeFromTheEnvironment) {
  const char* xdg = "/cfg";
  auto env = [&](const char* name) -> const char* {
    return std::string(name) == "HOME"              ? "/home/u"
           : std::string(name) == "XDG_CONFIG_HOME" ? xdg
                                                    : nullptr;
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
