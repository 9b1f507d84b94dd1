// Plug-in bundles on disk and registry entries over them, built directly (so
// every field can be chosen) from the bytes the registry would store; values
// written as JSON, and tables as text.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

#include "pdoc/pdoc.h"
#include "platform/code_signing.h"
#include "plugin/plugin.h"
#include "tests/support/fake_service_manager.h"
#include "tests/support/fake_types.h"
#include "tests/support/registry_bundles.h"

namespace dr::test {

using std::nullopt;
using Lines = std::vector<std::string>;
inline constexpr const char* kPoint = "com.example.point";

// A value written as JSON (a scalar too).
inline Value J(std::string_view json) { return pdoc::Parse("[" + std::string(json) + "]")->at(0); }

// A table as text: rows end at ';' (white space around them is dropped), cells at '|'.
inline std::vector<Lines> Table(std::string_view text) {
  std::vector<Lines> rows;
  while (!text.empty()) {
    std::string_view row = text.substr(0, text.find(';'));
    text.remove_prefix(std::min(row.size() + 1, text.size()));
    size_t first = row.find_first_not_of(" \n"), last = row.find_last_not_of(" \n");
    if (first == std::string_view::npos) continue;
    row = row.substr(first, last + 1 - first);
    rows.emplace_back();
    for (size_t bar; (bar = row.find('|')) != std::string_view::npos; row.remove_prefix(bar + 1))
      rows.back().emplace_back(row.substr(0, bar));
    rows.back().emplace_back(row);
  }
  return rows;
}

// A host as the daemon's client connection presents it.
struct FakeClient : PlugInClient {
  explicit FakeClient(Value e = Value()) : entitlements(std::move(e)) {}
  pid_t pid() const override { return 4242; }
  Value entitlementValueForKey(std::string_view k) const override { return entitlements[k]; }
  bool hasEntitlement(std::string_view k) const override {
    return IsEntitlementHeld(entitlements[k]);
  }
  Value entitlements;
};

// A sandboxed plug-in "com.example.<name>.ext" in the bundle
// "com.example.<name>", version 2.0, executable "<name>"; `pd` entries are
// added to its plug-in dictionary and `attrs` entries to its attributes.
inline Value PlugInInfo(const std::string& name, const Value& pd = {}, const Value& attrs = {}) {
  Value p = Value(pd.dictionary()).changing("UXExtensionPointIdentifier", kPoint);
  if (!p.has("UXExtensionProtocol")) p = p.changing("UXExtensionProtocol", "Viewer");
  return Value{{"BNBundleIdentifier", "com.example." + name},
               {"BNBundleVersion", "2.0"},
               {"BNBundleExecutable", name},
               {"UXExtension", p.changing("UXExtensionAttributes",
                                          Value(attrs.dictionary())
                                              .changing("UXExtensionIdentifier",
                                                        "com.example." + name + ".ext"))}};
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
    if (auto name = info["BNBundleExecutable"].string()) {
      std::string exe = f.url + "/Contents/Exec/" + std::string(*name);
      registry_test::WriteBytes(exe, "#!/bin/sh\n");
      EXPECT_EQ(::chmod(exe.c_str(), 0755), 0);
    }
    f.plugInIdentifier =
        info["UXExtension"]["UXExtensionAttributes"]["UXExtensionIdentifier"].stringValue();
    std::optional<std::string> entBytes;
    if (entitlements.isPresent()) entBytes = pdoc::WriteXml(entitlements).value_or("");
    return std::make_shared<RegistryEntry>(
        std::move(f), std::make_shared<RegistryBundleFiles>(*pdoc::WriteXml(info), entBytes));
  }

  std::shared_ptr<DRDPlugIn> make(const Value& info, const Value& entitlements = Sandboxed(),
                                  RegistryEntry::Fields f = {}) {
    return DRDPlugIn::initWithRGData(entry(info, entitlements, std::move(f)), services());
  }

  PlugInServices services() {
    PlugInServices s;
    s.serviceManager = manager ? manager : &serviceManager;
    s.getenv = [this](const char* name) -> const char* {
      return testSdk && std::string_view(name) == "DRTEST_SDK" ? testSdk->c_str() : nullptr;
    };
    s.types = types;
    if (versions.empty()) return s;
    s.plugInVersion = [this](const Uuid& uuid) { return versions[uuid.string()]; };
    return s;
  }

  registry_test::TempFolder folder;
  FakeServiceManager serviceManager;
  ServiceManager* manager = nullptr;   // instead of serviceManager
  FakeTypeService* types = nullptr;    // none: a type conforms only to itself
  std::optional<std::string> testSdk;  // the daemon's DRTEST_SDK
  std::map<std::string, std::optional<std::string>> versions;  // other plug-ins', by UUID

 private:
  int bundles_ = 0;
};

}  // namespace dr::test
