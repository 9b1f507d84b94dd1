// UsageReports: the sink of usage reports, small records of key/value texts.
//
// One report is one line of JSON:
//   {"domain": "<domain>", "level": <level>, "keys": {"<key>": "<value>", ...}}
// with the keys in the order given. It is appended to the file in
// UsageReportOptions::logPath when one is set (one write of the whole line
// on a descriptor opened with O_APPEND, so lines of several processes never
// interleave), otherwise written as one system log line of priority info
// that starts with "usage report: ", so that it is never taken for a message
// of drd's (nor one of drd's lines for a report). Thread-safe; a
// failed append is logged and the report dropped.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "wire/locations.h"

namespace dr {

struct UsageReportOptions {
  std::optional<std::string> logPath;  // none: reports go to the system log
};

// logPath from DR_USAGE_LOG when set and not empty.
UsageReportOptions UsageReportOptionsFromEnvironment(const EnvironmentLookup& getenv = nullptr);

using UsageReportKeys = std::vector<std::pair<std::string, std::string>>;

class UsageReports {
 public:
  virtual ~UsageReports() = default;
  virtual void sendReport(std::string_view domain, int level, const UsageReportKeys& keys) = 0;
};

std::unique_ptr<UsageReports> MakeUsageReports(UsageReportOptions options);

// The JSON line of one report, without the newline. Text that is not UTF-8
// has its bad bytes replaced (U+FFFD) rather than failing the report.
std::string UsageReportJson(std::string_view domain, int level, const UsageReportKeys& keys);

}  // namespace dr
