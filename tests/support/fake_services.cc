#include "tests/support/fake_services.h"

#include <cerrno>

namespace dr::testing {
namespace {}  // namespace

std::shared_ptr<const SigningTask> FakeCodeSigning::taskForPid(pid_t pid) {
  if (failingPids.contains(pid)) {
    return std::make_shared<ReadSigningTask>(pid, PosixError(ESRCH, "fake entitlements"));
  }
  auto it = entitlements.find(pid);
  return std::make_shared<ReadSigningTask>(
      pid, it == entitlements.end() ? Value::EmptyDictionary() : it->second);
}

Result<Value> FakeCodeSigning::entitlementsForExecutable(const std::string&) {
  return Value::EmptyDictionary();
}

Result<std::string> FakeSandbox::issueFileExtension(std::string_view extensionClass,
                                                    const std::string& path, uint32_t) {
  if (failingPaths.contains(path)) return PosixError(ENOENT, "fake realpath " + path);
  issuedPaths.push_back(path);
  return "token:" + std::string(extensionClass) + ":" + path;
}

Result<std::string> FakeSandbox::grantedPath(std::string_view token) {
  constexpr std::string_view kPrefix = "token:file.read-only:";
  if (!token.starts_with(kPrefix)) return Error(kSandboxErrorDomain, kExtensionForged, "fake");
  return std::string(token.substr(kPrefix.size()));
}

Value FakePreferences::copyCurrentHostValue(std::string_view key, std::string_view domain) {
  auto it = values.find({std::string(domain), std::string(key)});
  return it == values.end() ? Value() : it->second;
}

Status FakeNotificationCenter::post(std::string_view name) {
  if (!IsValidNotificationName(name)) return PosixError(EINVAL, "notification name");
  std::lock_guard<std::mutex> lock(mu_);
  posted_.emplace_back(name);
  return Status::OK();
}

std::vector<std::string> FakeNotificationCenter::posted() const {
  std::lock_guard<std::mutex> lock(mu_);
  return posted_;
}

void FakeUsageReports::sendReport(std::string_view domain, int level, const UsageReportKeys& keys) {
  std::lock_guard<std::mutex> lock(mu_);
  reports_.push_back({std::string(domain), level, keys});
}

std::vector<SentUsageReport> FakeUsageReports::reports() const {
  std::lock_guard<std::mutex> lock(mu_);
  return reports_;
}

bool FakePolicy::mayHostUsePlugIn(std::string_view host, std::string_view plugIn) {
  return !denied.contains({"", std::string(plugIn)}) &&
         !denied.contains({std::string(host), std::string(plugIn)});
}

std::string FakePolicy::hostOfProcess(pid_t pid) {
  auto it = hostsByPid.find(pid);
  return it == hostsByPid.end() ? "" : it->second;
}

}  // namespace dr::testing
