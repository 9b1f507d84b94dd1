// In-memory stand-ins for the platform services of code signing, sandbox,
// preferences, notifications, usage reports and policy, for unit tests of
// the daemon's own logic. Each records what it was asked and answers what
// the test set. Not thread-safe unless noted; tests set them up before use.
#pragma once

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/code_signing.h"
#include "platform/notifications.h"
#include "platform/policy.h"
#include "platform/preferences.h"
#include "platform/sandbox.h"
#include "platform/usage_reports.h"

namespace dr::testing {

// Entitlements by pid; a pid not set has none; failingPids fail to read.
class FakeCodeSigning : public CodeSigning {
 public:
  std::map<pid_t, Value> entitlements;
  std::set<pid_t> failingPids;

  std::shared_ptr<const SigningTask> taskForPid(pid_t pid) override;
  Result<Value> entitlementsForExecutable(const std::string& executablePath) override;
};

// Confined pids are listed; tokens are "token:<class>:<path>", and paths in
// failingPaths fail with ENOENT.
class FakeSandbox : public Sandbox {
 public:
  std::set<pid_t> sandboxedPids;
  std::set<std::string> failingPaths;
  std::vector<std::string> issuedPaths;

  bool isSandboxed(pid_t pid) override { return sandboxedPids.contains(pid); }
  Result<std::string> issueFileExtension(std::string_view extensionClass, const std::string& path,
                                         uint32_t flags) override;
  // The path of a read-only token this sandbox issued.
  Result<std::string> grantedPath(std::string_view token) override;
};

// Values by (domain, key) for the current host.
class FakePreferences : public Preferences {
 public:
  std::map<std::pair<std::string, std::string>, Value> values;
  int synchronizations = 0;

  void synchronizeCurrentHost(std::string_view) override { ++synchronizations; }
  Value copyCurrentHostValue(std::string_view key, std::string_view domain) override;
};

// Records posted names. Thread-safe.
class FakeNotificationCenter : public NotificationCenter {
 public:
  Status post(std::string_view name) override;
  std::vector<std::string> posted() const;

 private:
  mutable std::mutex mu_;
  std::vector<std::string> posted_;
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

// Denies the listed (host, plug-in) pairs; an empty host stands for any.
// hostsByPid names the host of a pid.
class FakePolicy : public Policy {
 public:
  std::set<std::pair<std::string, std::string>> denied;
  std::map<pid_t, std::string> hostsByPid;

  bool mayHostUsePlugIn(std::string_view host, std::string_view plugIn) override;
  std::string hostOfProcess(pid_t pid) override;
};

}  // namespace dr::testing
