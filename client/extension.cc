#include "client/include/drd/extension.h"

#include <string_view>

#include "platform/sandbox.h"

namespace dr::client {

// The public constants restate the sandbox's own, so hosts need no internal
// header; they must not drift apart.
static_assert(std::string_view(kExtensionErrorDomain) == std::string_view(kSandboxErrorDomain));
static_assert(kExtensionMalformed == dr::kExtensionMalformed);
static_assert(kExtensionForged == dr::kExtensionForged);
static_assert(kExtensionWrongClass == dr::kExtensionWrongClass);

Result<std::string> consumeExtension(std::string_view token, const std::string& socketDirectory) {
  SandboxOptions options =
      SandboxOptionsFromEnvironment([&socketDirectory](const char* name) -> const char* {
        return std::string_view(name) == "DR_SOCKET_DIR" ? socketDirectory.c_str() : nullptr;
      });
  return dr::consumeExtension(token, options);
}

}  // namespace dr::client
