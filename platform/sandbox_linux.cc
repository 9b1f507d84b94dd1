// Sandbox on Linux: confinement from the entitlements and the Flatpak
// marker, tokens signed with the key (wire/token.h) that drd keeps in the
// user's state folder.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>
#include <optional>
#include <string>

#include "core/log.h"
#include "platform/file_system.h"
#include "platform/sandbox.h"

namespace dr {
namespace {

constexpr const char* kKeyFileName = "sandbox.key";

class LinuxSandbox final : public Sandbox {
 public:
  LinuxSandbox(SandboxOptions options, CodeSigning* signing)
      : options_(std::move(options)), signing_(signing) {}

  bool isSandboxed(pid_t pid) override {
    Result<Value> entitlement = signing_->taskForPid(pid)->entitlementValue(kAppSandboxEntitlement);
    if (!entitlement.ok() || IsEntitlementHeld(*entitlement)) return true;
    std::string flatpakInfo = options_.procRoot + "/" + std::to_string(pid) + "/root/.flatpak-info";
    struct stat st;
    return ::stat(flatpakInfo.c_str(), &st) == 0 || errno != ENOENT;
  }

  Result<std::string> issueFileExtension(std::string_view extensionClass, const std::string& path,
                                         uint32_t flags) override {
    if (!token::ValidClass(extensionClass)) return PosixError(EINVAL, "extension class");
    if (path.find('\0') != std::string::npos) return PosixError(EINVAL, "path holds NUL");
    std::string resolvedPath;
    std::string_view granted = path;
    if (flags & kExtensionCanonicalPath) {
      Result<std::string> resolved = CanonicalPath(path);
      if (!resolved.ok()) return resolved.error();
      resolvedPath = std::move(resolved).value();
      granted = resolvedPath;
    } else if (path.empty() || path[0] != '/') {
      return PosixError(EINVAL, "relative path " + path);
    }
    Result<const token::Signer*> signer = loadKey();
    if (!signer.ok()) return signer.error();
    return (*signer)->issue(extensionClass, granted);
  }

  Result<std::string> grantedPath(std::string_view text) override {
    Result<const token::Signer*> signer = loadKey();
    if (!signer.ok()) return signer.error();
    return token::Verify(text, key_);
  }

 private:
  // The key, made or read once and then kept: drd is the only issuer, and
  // tokens it has handed out must stay valid while it runs.
  Result<const token::Signer*> loadKey() {
    std::lock_guard<std::mutex> lock(mu_);
    if (!signer_) {
      Result<token::Key> key = token::ReadKey(options_.keyPath);
      if (!key.ok() && key.error().code() == ENOENT) {
        std::optional<token::Key> former = formerKey();
        key = token::MakeKey(options_.keyPath, former);
        // Moved once: the former file goes only when the new one holds it.
        if (key.ok() && former && *key == *former &&
            ::unlink(options_.formerKeyPath.c_str()) == 0) {
          SystemLog("moved the sandbox key from %@ to %@", options_.formerKeyPath,
                    options_.keyPath);
        }
      }
      if (!key.ok()) return key.error();  // not kept: the next call tries again
      key_ = *key;
      signer_.emplace(key_);
    }
    return &*signer_;
  }

  // The key at the former place, when there is one to move: it is used for
  // the new key file and then removed. An unsafe one is left alone.
  std::optional<token::Key> formerKey() const {
    if (options_.formerKeyPath.empty()) return std::nullopt;
    Result<token::Key> former = token::ReadKey(options_.formerKeyPath);
    if (!former.ok()) {
      if (former.error().code() != ENOENT)
        SystemLog("not moving the sandbox key: %@", former.error().localizedDescription());
      return std::nullopt;
    }
    return *former;
  }

  SandboxOptions options_;
  CodeSigning* signing_;
  std::mutex mu_;
  token::Key key_{};                     // guarded by mu_; set with signer_
  std::optional<token::Signer> signer_;  // guarded by mu_
};

}  // namespace

SandboxOptions SandboxOptionsFromEnvironment(const EnvironmentLookup& getenv) {
  SandboxOptions options;
  options.keyPath = SandboxKeyPath(getenv);
  options.formerKeyPath = SocketDirectory(getenv) + "/" + kKeyFileName;
  return options;
}

std::unique_ptr<Sandbox> MakeLinuxSandbox(SandboxOptions options, CodeSigning* signing) {
  return std::make_unique<LinuxSandbox>(std::move(options), signing);
}

Result<std::string> consumeExtension(std::string_view text, const SandboxOptions& options) {
  Result<token::Key> key = token::ReadKey(options.keyPath);
  if (!key.ok()) return key.error();
  return token::Verify(text, *key);
}

}  // namespace dr
