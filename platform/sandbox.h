// Sandbox: whether a process runs confined, and the file extension tokens
// through which a confined process is granted read access to a path.
//
// A process is confined when it holds the sandbox entitlement or runs inside
// a Flatpak. A token is a printable ASCII text, without NUL, that names a
// path and is signed with a per-user secret key (wire/token.h); the key
// file is made at first use. A Sandbox is
// thread-safe. Failures are errors in kPosixErrorDomain whose code is the
// errno, or, for refused tokens, errors in kSandboxErrorDomain.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "core/status.h"
#include "platform/code_signing.h"
#include "wire/locations.h"
#include "wire/token.h"

namespace dr {

// The entitlement that confines a process (and that every plug-in must hold).
inline constexpr const char* kAppSandboxEntitlement = "com.corvel.security.app-sandbox";

// Flags of issueFileExtension.
inline constexpr uint32_t kExtensionCanonicalPath = 1u << 0;  // grant the canonical path

struct SandboxOptions {
  // The secret key file (its folder is made 0700). Tokens are opened by drd
  // for hosts that may reach its socket folder, so the key never lies there.
  std::string keyPath;
  // Where older versions kept the key: a key found there when keyPath has
  // none is moved to keyPath once, so tokens already handed out stay valid.
  std::string formerKeyPath = {};
  std::string procRoot = "/proc";  // where processes are looked up
};

// keyPath = $XDG_STATE_HOME/com.corvel.dromon/sandbox.key (XDG_STATE_HOME
// defaulting to ~/.local/state); formerKeyPath = <socket folder>/sandbox.key.
SandboxOptions SandboxOptionsFromEnvironment(const EnvironmentLookup& getenv = nullptr);

class Sandbox {
 public:
  virtual ~Sandbox() = default;

  // Whether `pid` is confined. A process whose entitlements cannot be read,
  // or whose root cannot be inspected, counts as confined: a confined
  // process is granted less, so doubt errs on that side.
  virtual bool isSandboxed(pid_t pid) = 0;

  // A token of `extensionClass` for `path`. With kExtensionCanonicalPath the
  // token names the canonical path (a path that does not exist fails with
  // that errno); without it `path` must be absolute and is named as given.
  // EINVAL for an empty or unusable class or a path holding NUL.
  virtual Result<std::string> issueFileExtension(std::string_view extensionClass,
                                                 const std::string& path, uint32_t flags) = 0;

  // The path a read-only token grants when this sandbox issued it (with the
  // same key); a refusal in kSandboxErrorDomain otherwise.
  virtual Result<std::string> grantedPath(std::string_view token) = 0;
};

// A Sandbox reading entitlements through `signing`, which must outlive it.
std::unique_ptr<Sandbox> MakeLinuxSandbox(SandboxOptions options, CodeSigning* signing);

// The consuming side for a host that may read the path itself: checks
// `token` against the key at options.keyPath and answers the canonical path a
// read-only token grants. Refuses (never crashes on) anything else:
// malformed, truncated, altered or forged tokens, tokens of another class,
// and every token while no key exists.
Result<std::string> consumeExtension(std::string_view token, const SandboxOptions& options);

}  // namespace dr
