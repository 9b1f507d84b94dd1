// DRBundle: questions about one bundle on disk — where it lies, where its
// executable is, its information dictionary and identifier, and its support
// folders — answered through the platform's bundle reader.
//
// The initialisers never fail: a bundle object whose reader found nothing
// answers absent for every property. A bundle object is immutable after it is
// made, except for the one-time caching of supportPath, and may be used from
// any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/value.h"
#include "platform/bundle_reader.h"

namespace dr {

class DRBundle {
 public:
  // Wraps a reader handle; every other initialiser ends here.
  explicit DRBundle(std::shared_ptr<const BundleHandle> handle);
  DRBundle(const DRBundle&) = delete;
  DRBundle& operator=(const DRBundle&) = delete;

  static std::shared_ptr<DRBundle> initWithIPCBundle(std::shared_ptr<const BundleHandle> handle);
  // The running program's own bundle.
  static std::shared_ptr<DRBundle> initForMainBundle(
      BundleReader* reader = BundleReader::Default());
  // The bundle at `path` (the path names the bundle folder).
  static std::shared_ptr<DRBundle> initWithPath(const std::string& path,
                                                BundleReader* reader = BundleReader::Default());
  static std::shared_ptr<DRBundle> initWithURL(const std::string& url,
                                               BundleReader* reader = BundleReader::Default());
  // The bundle whose Contents/Exec/ folder holds the executable at `path`; an
  // executable in no bundle stands for itself.
  static std::shared_ptr<DRBundle> initWithExecutablePath(
      const std::string& path, BundleReader* reader = BundleReader::Default());
  static std::shared_ptr<DRBundle> initWithExecutableURL(
      const std::string& url, BundleReader* reader = BundleReader::Default());

  // The reader's string property `property` (kBundlePathProperty,
  // kBundleExecutablePathProperty).
  std::optional<std::string> stringProperty(int32_t property) const;
  std::optional<std::string> path() const;
  std::optional<std::string> url() const { return path(); }
  // The executable's path, or the bundle's own path when it has none.
  std::optional<std::string> executablePath() const;
  // Absent when the bundle has none.
  Value infoDictionary() const;
  // The string under "BNBundleIdentifier" of the information dictionary.
  std::optional<std::string> bundleIdentifier() const;
  // <path>/Contents for a bundle whose executable lies in an Exec folder;
  // otherwise the executable's path itself. Computed once, then kept.
  std::optional<std::string> supportPath() const;
  // supportPath with `name` appended as a path component.
  std::optional<std::string> bundleDirectory(const std::string& name) const;
  // bundleDirectory("PlugIns").
  std::optional<std::string> plugInsPath() const;

 private:
  std::shared_ptr<const BundleHandle> bundle() const;

  mutable std::mutex mu_;
  std::shared_ptr<const BundleHandle> bundle_;
  mutable std::optional<std::string> supportPath_;
};

}  // namespace dr
