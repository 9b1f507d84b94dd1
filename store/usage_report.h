// Usage reports of plug-in installs, uninstalls and elections.
//
// A report is sent synchronously to the usage-report sink (platform/
// usage_reports.h) from the caller's thread; nothing is kept. Each report
// holds five keys, always in the same order: action, name
// ("<identifier>-<version>"), reorder direction, source and type.
#pragma once

#include <string_view>

#include "core/value.h"
#include "platform/usage_reports.h"

namespace dr {

inline constexpr const char* kUsageReportDomain = "com.corvel.appextension.state";
inline constexpr int kUsageReportLevel = 5;

// What happened to the plug-in.
enum UsageAction : int {
  kUsageInstalled = 0,
  kUsageUninstalled = 1,
  kUsageEnabled = 2,
  kUsageDisabled = 3,
};

// The word a report gives `action`; "<Undefined action>" for any other number.
std::string_view UsageActionWord(int action);

// Sends the report of `action` on the plug-in `identifier` at `version`,
// whose extension point is `extensionPoint`. Sends nothing when any of the
// three is absent.
void sendUsageReport(UsageReports* sink, const Value& identifier, const Value& version,
                     const Value& extensionPoint, int action);

// Whether a bundle at `path` lies in a development build folder; install and
// uninstall reports skip such bundles.
bool IsDevelopmentBuildPath(std::string_view path);

}  // namespace dr
