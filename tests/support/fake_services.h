// In-memory code signing, preferences and usage reports that record calls.
#pragma once

#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/code_signing.h"
#include "platform/preferences.h"
#include "platform/usage_reports.h"

namespace dr::testing {

// Entitlements by pid; a pid not set has none.
class FakeCodeSigning : public CodeSigning {
 public:
  std::map<pid_t, Value> entitlements;

  std::shared_ptr<const SigningTask> taskForPid(pid_t pid) override;
  Result<Value> entitlementsForExecutable(const std::string& executablePath) override;
};

// Values by (domain, key) for the current host.
class FakePreferences : public Preferences {
 public:
  std::map<std::pair<std::string, std::string>, Value> values;

  void synchronizeCurrentHost(std::string_view) override {}
  Value copyCurrentHostValue(std::string_view key, std::string_view domain) override;
};

struct SentUsageReport {
  std::string domain;
  int level = 0;
  UsageReportKeys keys;
};

// Records reports. Thread-safe.
class FakeUsageReports : public UsageReports {
 public:
  void sendReport(std::string_view domain, int level, const UsageReportKeys& keys) override;
  std::vector<SentUsageReport> reports() const;

 private:
  mutable std::mutex mu_;
  std::vector<SentUsageReport> reports_;
};

}  // namespace dr::testing
