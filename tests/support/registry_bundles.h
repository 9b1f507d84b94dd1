// Plug-in bundles and applications built on disk for registry tests.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "core/value.h"
#include "tests/support/process_fixtures.h"

namespace dr::registry_test {

using TempFolder = testing::TempFolder;

void WriteBytes(const std::string& path, std::string_view bytes);
// The whole file, or "" when it cannot be read.
std::string ReadBytes(const std::string& path);
// The permission bits of `path`, or 0 when it does not exist.
mode_t ModeOf(const std::string& path);

// A bundle at `path` with `info` as XML Contents/Info.pdoc (and Entitlements.pdoc if present).
std::string MakeBundle(const std::string& path, const Value& info,
                       const Value& entitlements = Value());

// Info of a bundle "com.example.<name>" whose one plug-in is named by UXExtensionIdentifier.
Value PlugInInfo(const std::string& name);

}  // namespace dr::registry_test
