// The administrator's plug-in deny list, read from its file and re-read
// when the file changes.
#include "platform/policy.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>

#include "core/log.h"
#include "platform/pdoc_file.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::RunningProgram;
using testing::TempFolder;
using testing::WriteTestFile;

class PolicyTest : public ::testing::Test {
 protected:
  PolicyTest() : options_{folder_ / "policy.pdoc"}, policy_(MakeFilePolicy(options_)) {}

  // Written beside and renamed over, as an editor or a profile tool does.
  void write(const Value& v) { ASSERT_TRUE(pdoc::WriteFile(options_.path, v).ok()); }

  TempFolder folder_;
  PolicyOptions options_;
  std::unique_ptr<Policy> policy_;
};

const Value kPolicy = Value{
    {"DeniedPlugIns", Value(Array{Value("com.example.bad"), Value(7)})},
    {"DeniedPlugInsByHost", Value{{"com.example.host", Value(Array{Value("com.example.private")})},
                                  {"com.example.odd", Value("com.example.private")}}},
};

TEST_F(PolicyTest, DeniesByIdentifierForAllHostsAndPerHost) {
  write(kPolicy);
  struct Case {
    const char* host;
    const char* plugIn;
    bool allowed;
  } cases[] = {{"com.example.host", "com.example.bad", false},
               {"", "com.example.bad", false},
               {"com.example.host", "com.example.private", false},
               {"com.example.other", "com.example.private", true},
               {"", "com.example.private", true},
               {"com.example.odd", "com.example.private", true},  // no array: denies nothing
               {"com.example.host", "com.example.good", true},
               {"com.example.host", "7", true}};
  for (const Case& c : cases) {
    EXPECT_EQ(policy_->mayHostUsePlugIn(c.host, c.plugIn), c.allowed) << c.host << " " << c.plugIn;
  }
}

TEST_F(PolicyTest, ChangesAreSeenAtTheNextQuestionAndABrokenFileKeepsTheLastPolicy) {
  auto allowed = [&](const char* plugIn) { return policy_->mayHostUsePlugIn("h", plugIn); };
  EXPECT_TRUE(allowed("com.example.bad"));  // no file
  write(kPolicy);
  EXPECT_FALSE(allowed("com.example.bad"));
  {
    ScopedLogCapture log;
    ASSERT_TRUE(WriteTestFile(options_.path, "<pdoc><dict><key>DeniedPlugIns"));
    EXPECT_FALSE(allowed("com.example.bad"));
    EXPECT_FALSE(allowed("com.example.bad"));
    EXPECT_EQ(log.lines().size(), 1u);
    EXPECT_TRUE(log.contains(options_.path));
    // A policy that starts out broken denies nothing.
    EXPECT_TRUE(MakeFilePolicy(options_)->mayHostUsePlugIn("h", "com.example.bad"));
  }
  write(Value{{"DeniedPlugIns", Value(Array{Value("com.example.bad2")})}});
  EXPECT_TRUE(allowed("com.example.bad"));
  EXPECT_FALSE(allowed("com.example.bad2"));
  ASSERT_EQ(::unlink(options_.path.c_str()), 0);
  EXPECT_TRUE(allowed("com.example.bad2"));
}

TEST_F(PolicyTest, ProcessIsJudgedAsTheHostOfItsBundle) {
  write(kPolicy);
  std::string bundle = folder_ / "Host.app";
  ASSERT_TRUE(WriteTestFile(bundle + "/Contents/Info.pdoc",
                            R"({"BNBundleIdentifier": "com.example.host"})"));
  RunningProgram host(bundle + "/Contents/Exec/host");
  RunningProgram loose(folder_ / "bin/loose");
  ASSERT_GT(host.pid(), 0);
  ASSERT_GT(loose.pid(), 0);
  EXPECT_FALSE(policy_->mayProcessUsePlugIn(host.pid(), "com.example.private"));
  EXPECT_TRUE(policy_->mayProcessUsePlugIn(loose.pid(), "com.example.private"));
  EXPECT_FALSE(policy_->mayProcessUsePlugIn(loose.pid(), "com.example.bad"));

  // A judge answers the same for its process, by the policy in force when it
  // was made: one discovery sees one version of the file.
  Policy::PlugInJudge judge = policy_->judgeForProcess(host.pid());
  EXPECT_FALSE(judge("com.example.private"));
  EXPECT_FALSE(judge("com.example.bad"));
  EXPECT_TRUE(judge("com.example.good"));
  write(Value{{"DeniedPlugIns", Value(Array{Value("com.example.good")})}});
  EXPECT_FALSE(judge("com.example.private"));
  EXPECT_TRUE(judge("com.example.good"));
  Policy::PlugInJudge next = policy_->judgeForProcess(host.pid());
  EXPECT_TRUE(next("com.example.private"));
  EXPECT_FALSE(next("com.example.good"));
}

}  // namespace
}  // namespace dr
