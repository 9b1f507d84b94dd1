#include "store/extension_issuing.h"

#include <cerrno>

#include "platform/file_system.h"

namespace dr {

std::optional<std::string> issueReadExtensionForURL(Sandbox* sandbox, const std::string& path,
                                                    const std::string& bundle) {
  Result<std::string> resolved = CanonicalPathWithin(path, bundle);
  Result<std::string> token =
      resolved.ok() ? sandbox->issueFileExtension(kReadOnlyFileExtensionClass, *resolved,
                                                  /*flags=*/0)
                    : Result<std::string>(resolved.error());
  if (!token.ok()) {
    const Error& e = token.error();
    errno = e.domain() == kPosixErrorDomain ? static_cast<int>(e.code()) : EINVAL;
    return std::nullopt;
  }
  return std::move(token).value();
}

}  // namespace dr
