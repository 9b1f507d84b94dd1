// A real registry in a temporary folder with bundles registered, for tests reading them.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/value.h"
#include "registry/registry.h"

namespace dr::test {

// A new registry database in `folder` (made if missing); null and a test failure if not.
std::unique_ptr<Registry> OpenTestRegistry(const std::string& folder);

// Info of bundle `bundleIdentifier` at `version` (none if absent), executable `executable`, plus
// `extra`.
Value PlugInBundleInfo(const std::string& bundleIdentifier,
                       const std::optional<std::string>& version, const std::string& executable,
                       const Value& extra = Value());

}  // namespace dr::test
