#include "tests/support/test_registry.h"

#include <gtest/gtest.h>

namespace dr::test {

std::unique_ptr<Registry> OpenTestRegistry(const std::string& folder) {
  RegistryOptions options;
  options.databasePath = folder + "/registry.sqlite3";
  options.systemRoots = {folder + "/system"};
  Result<std::unique_ptr<Registry>> registry = Registry::Open(options);
  if (!registry.ok()) {
    ADD_FAILURE() << registry.error().description();
    return nullptr;
  }
  return std::move(*registry);
}

Value PlugInBundleInfo(const std::string& bundleIdentifier,
                       const std::optional<std::string>& version, const std::string& executable,
                       const Value& extra) {
  Dictionary info = extra.dictionary();
  info["BNBundleIdentifier"] = bundleIdentifier;
  if (version) info["BNBundleVersion"] = *version;
  info["BNBundleExecutable"] = executable;
  info["UXExtension"] =
      Value{{"UXExtensionPointIdentifier", "com.example.point"},
            {"UXExtensionAttributes", Value{{"UXExtensionIdentifier", bundleIdentifier + ".ext"}}}};
  return Value(std::move(info));
}

}  // namespace dr::test
