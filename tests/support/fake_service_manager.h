// A service manager answering SDKs, busy instances and removals from tables; it records calls.
#pragma once

#include <sys/types.h>

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "core/status.h"
#include "core/value.h"
#include "platform/service_manager.h"

namespace dr::test {

class FakeServiceManager : public ServiceManager {
 public:
  // identifier → what sdkDictionary answers (a Value, or an Error).
  std::map<std::string, Result<Value>> sdks;
  int lookups = 0;

  std::vector<ExternalServiceGrant> grants;

  // busyExtensionInstances: those of `instances` asked for, in order, or `busyError`.
  std::vector<BusyExtensionInstance> instances;
  std::optional<Error> busyError;
  std::vector<std::vector<std::string>> busyQueries;
  // Run first by busyExtensionInstances on the asking thread (to hold a request there).
  std::function<void()> onBusyQuery;

  // (identifier, version) → removal result; kNoInstanceRunning otherwise.
  std::map<std::pair<std::string, std::string>, int> removeResults;
  std::vector<std::pair<std::string, std::string>> removals;

  Result<Value> sdkDictionary(const std::string& identifier) override {
    ++lookups;
    auto it = sdks.find(identifier);
    return it == sdks.end() ? Result<Value>(Value()) : it->second;
  }

  int addExternalService(pid_t hostPid, const std::string& executablePath,
                         const Value& overlay) override {
    ExternalServiceGrant g;
    g.hostPid = hostPid;
    g.executablePath = executablePath;
    g.overlay = overlay;
    grants.push_back(std::move(g));
    return 0;
  }

  Result<std::vector<BusyExtensionInstance>> busyExtensionInstances(
      const std::vector<std::string>& bundleIdentifiers) override {
    if (onBusyQuery) onBusyQuery();
    busyQueries.push_back(bundleIdentifiers);
    if (busyError) return *busyError;
    std::vector<BusyExtensionInstance> out;
    for (const BusyExtensionInstance& i : instances) {
      for (const std::string& id : bundleIdentifiers) {
        if (i.bundleIdentifier == id) {
          out.push_back(i);
          break;
        }
      }
    }
    return out;
  }

  int removeExternalServiceInstance(const std::string& bundleIdentifier,
                                    const std::string& bundleVersion) override {
    removals.emplace_back(bundleIdentifier, bundleVersion);
    auto it = removeResults.find({bundleIdentifier, bundleVersion});
    return it == removeResults.end() ? kNoInstanceRunning : it->second;
  }

  std::vector<ExternalServiceGrant> externalServiceGrants() const override { return grants; }
};

}  // namespace dr::test
