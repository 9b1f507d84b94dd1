#include "store/usage_report.h"

#include "core/format.h"

namespace dr {
namespace {

constexpr const char* kActionKey = "com.corvel.message.action";
constexpr const char* kNameKey = "com.corvel.message.name";
constexpr const char* kReorderDirectionKey = "com.corvel.message.reorder_direction";
constexpr const char* kSourceKey = "com.corvel.message.source";
constexpr const char* kTypeKey = "com.corvel.message.type";

// Identifiers of drd's own vendor; the final dot keeps "com.corvelish" out.
constexpr std::string_view kFirstPartyPrefix = "com.corvel.";
constexpr const char* kFirstPartySource = "Corvel";
constexpr const char* kThirdPartySource = "ThirdParty";

constexpr std::string_view kDevelopmentBuildFolder = "Build/Products";

}  // namespace

std::string_view UsageActionWord(int action) {
  switch (action) {
    case kUsageInstalled:
      return "Installed";
    case kUsageUninstalled:
      return "Uninstalled";
    case kUsageEnabled:
      return "Enabled";
    case kUsageDisabled:
      return "Disabled";
    default:
      return "<Undefined action>";
  }
}

void sendUsageReport(UsageReports* sink, const Value& identifier, const Value& version,
                     const Value& extensionPoint, int action) {
  // No sink: reports are switched off.
  if (sink == nullptr) return;
  if (identifier.isAbsent() || version.isAbsent() || extensionPoint.isAbsent()) return;
  std::string id = identifier.description();
  bool firstParty = id.starts_with(kFirstPartyPrefix);
  UsageReportKeys keys = {
      {kActionKey, std::string(UsageActionWord(action))},
      {kNameKey, Format("%@-%@", identifier, version)},
      {kReorderDirectionKey, "0"},
      {kSourceKey, firstParty ? kFirstPartySource : kThirdPartySource},
      {kTypeKey, extensionPoint.description()},
  };
  sink->sendReport(kUsageReportDomain, kUsageReportLevel, keys);
}

bool IsDevelopmentBuildPath(std::string_view path) {
  return path.find(kDevelopmentBuildFolder) != std::string_view::npos;
}

}  // namespace dr
