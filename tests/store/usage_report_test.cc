// Usage reports of plug-in events: the five keys in order, or no report.
#include "store/usage_report.h"

#include <gtest/gtest.h>

#include "tests/support/fake_services.h"

namespace dr {
namespace {

using namespace std::string_literals;

TEST(UsageReportTest, ReportsCarryTheFiveKeysInOrder) {
  testing::FakeUsageReports sink;
  const struct {
    Value identifier, version, extensionPoint;
    int action;
    const char* expected;  // action|name|direction|source|type; "": no report
  } cases[] = {
      {"com.corvel.sample.widget", 3, "com.corvel.widget", kUsageInstalled,
       "Installed|com.corvel.sample.widget-3|0|Corvel|com.corvel.widget"},
      {"com.corvelish.tool", "1.2", "com.corvel.share", kUsageUninstalled,
       "Uninstalled|com.corvelish.tool-1.2|0|ThirdParty|com.corvel.share"},
      {"com.example.x", "2", "p", kUsageEnabled, "Enabled|com.example.x-2|0|ThirdParty|p"},
      {"Com.corvel.x", "2", "p", 9, "<Undefined action>|Com.corvel.x-2|0|ThirdParty|p"},
      {"com.corvel.x", Value(), "p", kUsageInstalled, ""},
      {Value(), "1", "p", kUsageInstalled, ""},
      {"com.corvel.x", "1", Value(), kUsageInstalled, ""},
  };
  for (const auto& c : cases) {
    const size_t before = sink.reports().size();
    sendUsageReport(&sink, c.identifier, c.version, c.extensionPoint, c.action);
    const std::vector<testing::SentUsageReport> sent = sink.reports();
    ASSERT_EQ(sent.size(), before + (*c.expected ? 1 : 0)) << c.expected;
    if (!*c.expected) continue;
    std::string keys, values;
    for (const auto& [k, v] : sent.back().keys) keys += k + " ", values += "|" + v;
    EXPECT_EQ(std::tuple(sent.back().domain, sent.back().level, keys, values),
              std::tuple("com.corvel.appextension.state"s, 5,
                         "com.corvel.message.action com.corvel.message.name "
                         "com.corvel.message.reorder_direction com.corvel.message.source "
                         "com.corvel.message.type "s,
                         "|"s + c.expected));
  }
}

}  // namespace
}  // namespace dr
