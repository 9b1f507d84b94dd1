// Plug-in bundles on disk and registry entries over them, for tests of the
// daemon's plug-in records. Entries are built directly (so every field can be
// chosen) from the same bytes the registry would store.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "core/value.h"
#include "pdoc/pdoc.h"
#include "plugin/plugin.h"
#include "registry/registry.h"
#include "tests/support/fake_service_manager.h"
#include "tests/support/registry_bundles.h"

namespace dr::test {

inline constexpr const char* kPoint = "com.example.point";

// A sandboxed plug-in "com.example.<name>.ext" in the bundle
// "com.example.<name>", version 2.0, executable "<name>"; `pd` entries are
// added to its plug-in dictionary and `attrs` entries to its attributes.
inline Value PlugInInfo(const std::string& name, const Value& pd = Value(),
                        const Value& attrs = Value()) {
  Dictionary a = attrs.dictionary();
  a.insert_or_assign("UXExtensionIdentifier", "com.example." + name + ".ext");
  Dictionary p = pd.dictionary();
  p.insert_or_assign("UXExtensionPointIdentifier", kPoint);
  if (!p.contains("UXExtensionProtocol")) p.insert_or_assign("UXExtensionProtocol", "Viewer");
  p.insert_or_assign("UXExtensionAttributes", Value(std::move(a)));
  return Value{{"BNBundleIdentifier", "com.example." + name},
               {"BNBundleVersion", "2.0"},
               {"BNBundleExecutable", name},
               {"UXExtension", Value(std::move(p))}};
}

inline Value Sandboxed() { return Value{{"com.corvel.security.app-sandbox", true}}; }

class PlugInFixture : public ::testing::Test {
 protected:
  PlugInFixture() { serviceManager.sdks.insert_or_assign(kPoint, Value::EmptyDictionary()); }

  // Lays out a new bundle (info, entitlements, and the executable that
  // "BNBundleExecutable" names) and answers the registry entry of its one
  // plug-in; `f` gives the fields beyond the bundle's files.
  RegistryEntryPtr entry(const Value& info, const Value& entitlements = Value(),
                         RegistryEntry::Fields f = {}, std::string path = "") {
    f.uuid = Uuid::random();
    f.url = path.empty() ? folder / ("p" + std::to_string(++bundles_) + "/A.plugin") : path;
    registry_test::MakeBundle(f.url, info, entitlements);
    if (auto exe = info["BNBundleExecutable"].string()) {
      std::string exePath = f.url + "/Contents/Exec/" + std::string(*exe);
      registry_test::WriteBytes(exePath, "#!/bin/sh\n");
      EXPECT_EQ(::chmod(exePath.c_str(), 0755), 0);
    }
    f.plugInIdentifier =
        info["UXExtension"]["UXExtensionAttributes"]["UXExtensionIdentifier"].stringValue();
    if (f.plugInIdentifier.empty()) f.plugInIdentifier = info["BNBundleIdentifier"].stringValue();
    std::optional<std::string> entBytes;
    if (entitlements.isPresent()) entBytes = pdoc::WriteXml(entitlements).value_or("");
    auto files = std::make_shared<RegistryBundleFiles>(pdoc::WriteXml(info).value_or(""),
                                                       std::move(entBytes));
    return std::make_shared<RegistryEntry>(std::move(f), std::move(files));
  }

  std::shared_ptr<DRDPlugIn> make(const Value& info, const Value& entitlements = Sandboxed(),
                                  RegistryEntry::Fields f = {}) {
    return DRDPlugIn::initWithRGData(entry(info, entitlements, std::move(f)), services());
  }

  virtual PlugInServices services() {
    PlugInServices s;
    s.serviceManager = &serviceManager;
    s.getenv = [](const char*) -> const char* { return nullptr; };
    return s;
  }

  registry_test::TempFolder folder;
  FakeServiceManager serviceManager;

 private:
  int bundles_ = 0;
};

}  // namespace dr::test
