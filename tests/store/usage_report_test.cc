// Usage reports of plug-in events, read back from the report file.
#include "store/usage_report.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <sstream>
#include <vector>

#include "platform/file_system.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::TempFolder;

TEST(UsageReportTest, ReportsCarryTheFiveKeysInOrder) {
  TempFolder folder;
  UsageReportOptions options{folder / "usage.log"};
  auto sink = MakeUsageReports(options);
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
  std::vector<std::string> expected;
  for (const Case& c : cases) {
    sendUsageReport(sink.get(), c.identifier, c.version, c.extensionPoint, c.action);
    if (*c.expected) expected.push_back(c.expected);
  }

  std::istringstream lines(FileSystem::Default()->readFile(*options.logPath).value());
  const std::vector<std::string> kKeys = {"com.corvel.message.action", "com.corvel.message.name",
                                          "com.corvel.message.reorder_direction",
                                          "com.corvel.message.source", "com.corvel.message.type"};
  size_t n = 0;
  for (std::string line; std::getline(lines, line); ++n) {
    ASSERT_LT(n, expected.size()) << line;
    auto json = nlohmann::ordered_json::parse(line);
    EXPECT_EQ(json["domain"].get<std::string>() + " " + json["level"].dump(),
              "com.corvel.appextension.state 5");
    std::vector<std::string> keys;
    std::string values;
    for (auto& [k, v] : json["keys"].items()) {
      keys.push_back(k);
      values += (values.empty() ? "" : "|") + v.get<std::string>();
    }
    EXPECT_EQ(keys, kKeys);
    EXPECT_EQ(values, expected[n]);
  }
  EXPECT_EQ(n, expected.size());
}

TEST(UsageReportTest, DevelopmentBuildFoldersAreRecognised) {
  EXPECT_TRUE(IsDevelopmentBuildPath("Build/Products"));
  EXPECT_FALSE(IsDevelopmentBuildPath("/home/u/build/products/W.appex"));
  EXPECT_FALSE(IsDevelopmentBuildPath("/home/u/Build/W.appex"));
}

}  // namespace
}  // namespace dr
