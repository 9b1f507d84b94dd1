// A service manager whose SDK registry is a table in memory, for tests of
// the plug-in model. It counts the lookups it answers.
#pragma once

#include <map>
#include <string>

#include "core/status.h"
#include "core/value.h"
#include "platform/service_manager.h"

namespace dr::test {

class FakeServiceManager : public ServiceManager {
 public:
  // identifier → what sdkDictionary answers (a Value, or an Error).
  std::map<std::string, Result<Value>> sdks;
  int lookups = 0;

  Result<Value> sdkDictionary(const std::string& identifier) override {
    ++lookups;
    auto it = sdks.find(identifier);
    return it == sdks.end() ? Result<Value>(Value()) : it->second;
  }
};

}  // namespace dr::test
