#include "tests/support/fake_services.h"

#include <cerrno>

namespace dr::testing {

std::shared_ptr<const SigningTask> FakeCodeSigning::taskForPid(pid_t pid) {
  auto it = entitlements.find(pid);
  return std::make_shared<ReadSigningTask>(
      pid, it == entitlements.end() ? Value::EmptyDictionary() : it->second);
}

Result<Value> FakeCodeSigning::entitlementsForExecutable(const std::string&) {
  return Value::EmptyDictionary();
}

Value FakePreferences::copyCurrentHostValue(std::string_view key, std::string_view domain) {
  auto it = values.find({std::string(domain), std::string(key)});
  return it == values.end() ? Value() : it->second;
}

void FakeUsageReports::sendReport(std::string_view domain, int level, const UsageReportKeys& keys) {
  std::lock_guard<std::mutex> lock(mu_);
  reports_.push_back({std::string(domain), level, keys});
}

std::vector<SentUsageReport> FakeUsageReports::reports() const {
  std::lock_guard<std::mutex> lock(mu_);
  return reports_;
}

}  // namespace dr::testing
