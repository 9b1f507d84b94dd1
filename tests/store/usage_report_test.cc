#include "store/usage_report.h"

#include <gtest/gtest.h>

#include "tests/support/fake_services.h"

namespace dr {
namespace {

TEST(UsageReportTest, ReportsCarryTheFiveKeysInOrder) {
  testing::FakeUsageReports sink;
  const std::tuple<Value, Value, Value, int, std::string> cases[] = {
      // identifier, version, extension point, action: values reported, "" for no report
      {"com.corvel.w", 3, "com.corvel.widget", kUsageInstalled,
       "Installed com.corvel.w-3 0 Corvel com.corvel.widget"},
      {"com.corvelish.tool", "1.2", "p", kUsageUninstalled,
       "Uninstalled com.corvelish.tool-1.2 0 ThirdParty p"},
      {"Com.corvel.x", "2", "p", kUsageEnabled, "Enabled Com.corvel.x-2 0 ThirdParty p"},
      {"com.corvel.x", "2", "p", 9, "<Undefined action> com.corvel.x-2 0 Corvel p"},
      {"com.corvel.x", Value(), "p", kUsageInstalled, ""},
      {Value(), "1", "p", kUsageInstalled, ""},
      {"com.corvel.x", "1", Value(), kUsageInstalled, ""},
  };
  for (const auto& [identifier, version, point, action, expected] : cases) {
    const size_t before = sink.reports().size();
    sendUsageReport(&sink, identifier, version, point, action);
    const std::vector<testing::SentUsageReport> sent = sink.reports();
    ASSERT_EQ(sent.size(), before + (expected.empty() ? 0 : 1)) << expected;
    if (expected.empty()) continue;
    std::string keys, values;
    for (const auto& [k, v] : sent.back().keys) keys += k + " ", values += v + " ";
    EXPECT_EQ(std::tuple(sent.back().domain, sent.back().level, keys, values),
              std::tuple(std::string("com.corvel.appextension.state"), 5,
                         std::string("com.corvel.message.action com.corvel.message.name "
                                     "com.corvel.message.reorder_direction "
                                     "com.corvel.message.source com.corvel.message.type "),
                         expected + " "));
  }
}

}  // namespace
}  // namespace dr
