#include "store/extension_issuing.h"

#include <cerrno>

#include "platform/file_system.h"

namespace dr {

Result<std::string> issueReadExtensionForURL(Sandbox* sandbox, const std::string& path,
                                             const std::string& bundle) {
  // Without a sandbox there is no key to sign with.
  if (!sandbox) return PosixError(ENOKEY, "no sandbox to issue a token for " + path);
  Result<std::string> resolved = CanonicalPathWithin(path, bundle);
  Result<std::string> token =
      resolved.ok() ? sandbox->issueFileExtension(kReadOnlyFileExtensionClass, *resolved,
                                                  /*flags=*/0)
                    : Result<std::string>(resolved.error());
  if (!token.ok() && token.error().domain() != kPosixErrorDomain) {
    return PosixError(EINVAL, token.error().description());
  }
  return token;
}

}  // namespace dr
