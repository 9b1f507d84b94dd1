#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <string>
#include <string_view>

#include "platform/bundle_reader.h"
#include "platform/pdoc_file.h"

namespace dr {
namespace {

constexpr std::string_view kInfoFile = "/Contents/Info.pdoc";
constexpr std::string_view kExecFolder = "/Contents/Exec/";
constexpr std::string_view kExecutableKey = "BNBundleExecutable";

// `path` without trailing slashes ("/" stays "/").
std::string TrimSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

bool Exists(const std::string& path, bool* isDirectory = nullptr) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return false;
  if (isDirectory) *isDirectory = S_ISDIR(st.st_mode);
  return true;
}

bool IsFile(const std::string& path) {
  bool dir = false;
  return Exists(path, &dir) && !dir;
}

// The last component of `path` and the path before it; false when `path`
// has no slash.
bool SplitLast(std::string_view path, std::string_view* parent, std::string_view* name) {
  size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return false;
  *parent = path.substr(0, slash);
  *name = path.substr(slash + 1);
  return true;
}

class LinuxBundleHandle final : public BundleHandle {
 public:
  LinuxBundleHandle() = default;

  // A handle for the bundle (a folder) or free-standing executable at
  // `bundlePath`, which exists.
  LinuxBundleHandle(std::string bundlePath, bool isDirectory) : bundlePath_(std::move(bundlePath)) {
    if (!isDirectory) return;  // a free-standing executable
    Result<Value> info = pdoc::ReadFile(*bundlePath_ + std::string(kInfoFile));
    if (info.ok() && info->isDictionary()) info_ = *info;
    std::optional<std::string_view> exe = info_[kExecutableKey].string();
    // A name that is not one plain file name cannot lie in Contents/Exec/.
    if (!exe || exe->empty() || exe->find('/') != std::string_view::npos || *exe == "." ||
        *exe == "..") {
      return;
    }
    std::string exePath = *bundlePath_ + std::string(kExecFolder) + std::string(*exe);
    if (IsFile(exePath)) executablePath_ = std::move(exePath);
  }

  std::optional<std::string> stringProperty(int32_t property) const override {
    if (property == kBundlePathProperty) return bundlePath_;
    if (property == kBundleExecutablePathProperty) return executablePath_;
    return std::nullopt;
  }

  Value infoDictionary() const override { return info_; }

 private:
  std::optional<std::string> bundlePath_;
  std::optional<std::string> executablePath_;
  Value info_;
};

class LinuxBundleReader final : public BundleReader {
 public:
  std::shared_ptr<const BundleHandle> bundleAtPath(const std::string& path, Mode mode) override {
    // Every connection asks for its peer's bundle, so the path is looked at
    // once: the name's shape first, then one stat.
    std::string p = TrimSlashes(path);
    if (mode == Mode::kBundlePath) {
      bool dir = false;
      if (p.empty() || !Exists(p, &dir)) return std::make_shared<LinuxBundleHandle>();
      return std::make_shared<LinuxBundleHandle>(p, dir);
    }
    // <bundle>/Contents/Exec/<file>
    std::string_view exec, file, contents, execName, bundle, contentsName;
    if (!SplitLast(p, &exec, &file) || !SplitLast(exec, &contents, &execName) ||
        execName != "Exec" || !SplitLast(contents, &bundle, &contentsName) ||
        contentsName != "Contents" || bundle.empty() || !IsFile(p)) {
      return std::make_shared<LinuxBundleHandle>();
    }
    // A folder holds the file, so the bundle is one.
    return std::make_shared<LinuxBundleHandle>(std::string(bundle), /*isDirectory=*/true);
  }

  std::shared_ptr<const BundleHandle> mainBundle() override {
    char buf[PATH_MAX];
    ssize_t n = ::readlink("/proc/self/exe", buf, sizeof buf - 1);
    if (n <= 0) return std::make_shared<LinuxBundleHandle>();
    std::string exe(buf, static_cast<size_t>(n));
    std::shared_ptr<const BundleHandle> handle = bundleAtPath(exe, Mode::kExecutablePath);
    if (handle->stringProperty(kBundlePathProperty)) return handle;
    return bundleAtPath(exe, Mode::kBundlePath);
  }
};

}  // namespace

BundleReader* BundleReader::Default() {
  static LinuxBundleReader* reader = new LinuxBundleReader();
  return reader;
}

}  // namespace dr
