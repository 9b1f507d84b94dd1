// Test helpers for the registry: plug-in bundles and applications built on
// disk. For tests only; not thread-safe.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "core/value.h"
#include "tests/support/process_fixtures.h"

namespace dr::registry_test {

using TempFolder = testing::TempFolder;

// Writes `bytes` to `path`, creating missing folders.
void WriteBytes(const std::string& path, std::string_view bytes);
// The whole file, or "" when it cannot be read.
std::string ReadBytes(const std::string& path);
// The permission bits of `path`, or 0 when it does not exist.
mode_t ModeOf(const std::string& path);

// A bundle folder at `path` whose Contents/Info.pdoc holds `info` in the XML
// form, with Contents/Entitlements.pdoc when `entitlements` is present.
// Answers `path`.
std::string MakeBundle(const std::string& path, const Value& info,
                       const Value& entitlements = Value());

// The information dictionary of a plug-in bundle "com.example.<name>" whose
// one plug-in is named by its attributes' "UXExtensionIdentifier".
Value PlugInInfo(const std::string& name);

}  // namespace dr::registry_test
