// Usage reports of plug-in events: the five keys in order, or no report.
#include "store/usage_report.h"

#include <gtest/gtest.h>

#include <vector>

#include "platform/file_system.h"
#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

TEST(UsageReportTest, ReportsCarryTheFiveKeysInOrder) {
  testing::FakeUsageReports sink;
  struct Case {
    Value identifier, version, extensionPoint;
    int action;
    const char* expected;  // action|name|direction|source|type; "": no report
  } cases[] = {
      {"com.corvel.sample.widget", 3, "com.corvel.widget", kUsageInstalled,
       "Installed|com.corvel.sample.widget-3|0|Corvel|com.corvel.widget"},
      {"com.corvelish.tool", "1.2", "com.corvel.share", kUsageUninstalled,
       "Uninstalled|com.corvelish.tool-1.2|0|ThirdParty|com.corvel.share"},
      {"com.example.x", "2", "p", kUsageEnabled, "Enabled|com.example.x-2|0|ThirdParty|p"},
      {"com.corvel.x", "2", "p", kUsageDisabled, "Disabled|com.corvel.x-2|0|Corvel|p"},
      {"Com.corvel.x", "2", "p", 9, "<Undefined action>|Com.corvel.x-2|0|ThirdParty|p"},
      {"com.corvel.x", Value(), "p", kUsageInstalled, ""},
      {Value(), "1", "p", kUsageInstalled, ""},
      {"com.corvel.x", "1", Value(), kUsageInstalled, ""},
  };
  const std::vector<std::string> kKeys = {"com.corvel.message.action", "com.corvel.message.name",
                                          "com.corvel.message.reorder_direction",
                                          "com.corvel.message.source", "com.corvel.message.type"};
  for (const Case& c : cases) {
    const size_t before = sink.reports().size();
    sendUsageReport(&sink, c.identifier, c.version, c.extensionPoint, c.action);
    std::vector<testing::SentUsageReport> sent = sink.reports();
    ASSERT_EQ(sent.size(), before + (*c.expected ? 1 : 0)) << c.expected;
    if (!*c.expected) continue;
    EXPECT_EQ(sent.back().domain, "com.corvel.appextension.state");
    EXPECT_EQ(sent.back().level, 5);
    std::vector<std::string> keys;
    std::string values;
    for (const auto& [k, v] : sent.back().keys) {
      keys.push_back(k);
      values += (values.empty() ? "" : "|") + v;
    }
    EXPECT_EQ(keys, kKeys);
    EXPECT_EQ(values, c.expected);
  }
}

// A report reaches the report file as one line.
TEST(UsageReportTest, ReportsAreAppendedToTheFile) {
  testing::TempFolder folder;
  auto sink = MakeUsageReports({folder / "usage.log"});
  sendUsageReport(sink.get(), "com.example.x", "2", "p", kUsageEnabled);
  const std::string line = FileSystem::Default()->readFile(folder / "usage.log").value_or("");
  EXPECT_TRUE(line.ends_with("\n") && line.find("com.example.x-2") != std::string::npos) << line;
}

TEST(UsageReportTest, DevelopmentBuildFoldersAreRecognised) {
  EXPECT_TRUE(IsDevelopmentBuildPath("Build/Products"));
  EXPECT_FALSE(IsDevelopmentBuildPath("/home/u/build/products/W.appex"));
  EXPECT_FALSE(IsDevelopmentBuildPath("/home/u/Build/W.appex"));
}

}  // namespace
}  // namespace dr
