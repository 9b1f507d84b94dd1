// A real registry in a temporary folder with plug-in bundles registered in
// it, for tests of services that read the registered bundles. For tests
// only; not thread-safe.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/value.h"
#include "registry/registry.h"

namespace dr::test {

// Opens a new registry database in `folder` (made when missing); fails the
// test and answers null when it cannot.
std::unique_ptr<Registry> OpenTestRegistry(const std::string& folder);

// The information dictionary of a plug-in bundle `bundleIdentifier` at
// `version` (none when absent) whose executable is named `executable`, with
// the entries of `extra` added.
Value PlugInBundleInfo(const std::string& bundleIdentifier,
                       const std::optional<std::string>& version, const std::string& executable,
                       const Value& extra = Value());

}  // namespace dr::test
