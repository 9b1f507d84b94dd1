#include "store/extension_issuing.h"

#include <cerrno>

namespace dr {

std::optional<std::string> issueReadExtensionForURL(Sandbox* sandbox, const std::string& path) {
  Result<std::string> token =
      sandbox->issueFileExtension(kReadOnlyFileExtensionClass, path, kExtensionCanonicalPath);
  if (!token.ok()) {
    const Error& e = token.error();
    errno = e.domain() == kPosixErrorDomain ? static_cast<int>(e.code()) : EINVAL;
    return std::nullopt;
  }
  return std::move(token).value();
}

}  // namespace dr
