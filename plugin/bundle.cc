#include "plugin/bundle.h"

#include <string_view>

#include "plugin/plugin_keys.h"

namespace dr {
namespace {

constexpr std::string_view kExecFolderMarker = "/Exec/";
constexpr const char* kContentsFolder = "Contents";
constexpr const char* kPlugInsFolder = "PlugIns";

std::string AppendComponent(std::string base, std::string_view name) {
  if (base.empty() || base.back() != '/') base += '/';
  base += name;
  return base;
}

}  // namespace

DRBundle::DRBundle(std::shared_ptr<const BundleHandle> handle) : bundle_(std::move(handle)) {}

std::shared_ptr<DRBundle> DRBundle::initWithIPCBundle(std::shared_ptr<const BundleHandle> handle) {
  return std::make_shared<DRBundle>(std::move(handle));
}

std::shared_ptr<DRBundle> DRBundle::initForMainBundle(BundleReader* reader) {
  return initWithIPCBundle(reader->mainBundle());
}

std::shared_ptr<DRBundle> DRBundle::initWithPath(const std::string& path, BundleReader* reader) {
  return initWithIPCBundle(reader->bundleAtPath(path, BundleReader::Mode::kBundlePath));
}

std::shared_ptr<DRBundle> DRBundle::initWithURL(const std::string& url, BundleReader* reader) {
  return initWithPath(url, reader);
}

std::shared_ptr<DRBundle> DRBundle::initWithExecutablePath(const std::string& path,
                                                           BundleReader* reader) {
  std::shared_ptr<const BundleHandle> handle =
      reader->bundleAtPath(path, BundleReader::Mode::kExecutablePath);
  if (!handle || !handle->stringProperty(kBundlePathProperty)) {
    handle = reader->bundleAtPath(path, BundleReader::Mode::kBundlePath);
  }
  return initWithIPCBundle(std::move(handle));
}

std::shared_ptr<DRBundle> DRBundle::initWithExecutableURL(const std::string& url,
                                                          BundleReader* reader) {
  return initWithExecutablePath(url, reader);
}

std::shared_ptr<const BundleHandle> DRBundle::bundle() const {
  std::lock_guard<std::mutex> lock(mu_);
  return bundle_;
}

std::optional<std::string> DRBundle::stringProperty(int32_t property) const {
  std::shared_ptr<const BundleHandle> handle = bundle();
  if (!handle) return std::nullopt;
  return handle->stringProperty(property);
}

std::optional<std::string> DRBundle::path() const { return stringProperty(kBundlePathProperty); }

std::optional<std::string> DRBundle::executablePath() const {
  std::optional<std::string> exe = stringProperty(kBundleExecutablePathProperty);
  return exe ? exe : path();
}

Value DRBundle::infoDictionary() const {
  std::shared_ptr<const BundleHandle> handle = bundle();
  if (!handle) return Value();
  Value info = handle->infoDictionary();
  return info.isDictionary() ? info : Value();
}

std::optional<std::string> DRBundle::bundleIdentifier() const {
  Value id = infoDictionary()[kBNBundleIdentifierKey];
  if (!id.isString()) return std::nullopt;
  return id.stringValue();
}

std::optional<std::string> DRBundle::supportPath() const {
  {
    std::lock_guard<std::mutex> lock(mu_);
    if (supportPath_) return supportPath_;
  }
  // Computed outside the lock: two first calls that race compute the same
  // value. Nothing is kept while the reader knows no executable.
  std::optional<std::string> exe = executablePath();
  if (!exe) return std::nullopt;
  std::optional<std::string> support = *exe;
  if (exe->find(kExecFolderMarker) != std::string::npos) {
    std::optional<std::string> bundlePath = path();
    support = bundlePath ? std::optional<std::string>(AppendComponent(*bundlePath, kContentsFolder))
                         : std::nullopt;
  }
  std::lock_guard<std::mutex> lock(mu_);
  if (!supportPath_) supportPath_ = support;
  return supportPath_;
}

std::optional<std::string> DRBundle::bundleDirectory(const std::string& name) const {
  std::optional<std::string> support = supportPath();
  if (!support) return std::nullopt;
  return AppendComponent(*support, name);
}

std::optional<std::string> DRBundle::plugInsPath() const { return bundleDirectory(kPlugInsFolder); }

}  // namespace dr
