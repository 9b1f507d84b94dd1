// BundleReader: finds bundles on disk and answers their paths and
// information dictionaries.
//
// A bundle is a folder laid out as
//
//   Name.appex/Contents/Info.pdoc                   the information dictionary
//   Name.appex/Contents/Exec/<BNBundleExecutable>   the executable
//
// A handle is made in one of two modes: from a path that names a bundle
// (kBundlePath), or from the path of an executable inside a bundle's
// Contents/Exec/ folder (kExecutablePath). A handle for which the reader found
// nothing is still a handle; its properties are then absent. Handles are
// immutable snapshots taken when they are made and may be shared between
// threads; BundleReader::Default() is safe to use from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "core/value.h"

namespace dr {

// Numbers of the string properties a handle answers.
inline constexpr int32_t kBundlePathProperty = 2;
inline constexpr int32_t kBundleExecutablePathProperty = 3;

class BundleHandle {
 public:
  virtual ~BundleHandle() = default;

  // The string property `property`: kBundlePathProperty is the bundle's
  // folder, kBundleExecutablePathProperty the path of its executable when that
  // file exists. Absent for any other number and for what was not found.
  virtual std::optional<std::string> stringProperty(int32_t property) const = 0;

  // The bundle's information dictionary; absent when the bundle has none or
  // its file is not a readable dictionary.
  virtual Value infoDictionary() const = 0;
};

class BundleReader {
 public:
  enum class Mode {
    kBundlePath = 1,      // the path names the bundle itself
    kExecutablePath = 2,  // the path names an executable in <bundle>/Contents/Exec/
  };

  virtual ~BundleReader() = default;

  // The handle for `path` read in `mode`. Never null.
  virtual std::shared_ptr<const BundleHandle> bundleAtPath(const std::string& path, Mode mode) = 0;

  // The handle of the running program's own bundle, found from its
  // executable; a program that lies in no bundle stands for itself, as a
  // free-standing executable does in kBundlePath mode. Never null.
  virtual std::shared_ptr<const BundleHandle> mainBundle() = 0;

  // The reader of the real file system. Never null; lives for the whole
  // process.
  static BundleReader* Default();
};

}  // namespace dr
