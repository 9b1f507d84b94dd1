// The Linux type service: conformance from the shared-mime-info data and
// the "TypeDeclarations" of registered bundles. Safe from any thread.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/types.h"

namespace dr {

class Registry;

struct TypeServiceOptions {
  // The folders whose mime/ subfolders hold the shared-mime-info data, most
  // important first ($XDG_DATA_HOME, then each of $XDG_DATA_DIRS).
  std::vector<std::string> dataFolders;
  // The registered bundles whose "TypeDeclarations" count; null: none. Must
  // outlive the service.
  const Registry* registry = nullptr;
};

// The data folders from the environment: XDG_DATA_HOME (default
// $HOME/.local/share), then XDG_DATA_DIRS (default /usr/local/share:/usr/share).
// Unset or empty variables take their defaults; relative folders are skipped.
std::vector<std::string> DataFoldersFromEnvironment(
    const std::function<const char*(const char*)>& getenv = nullptr);

// The Linux type service. The shared-mime-info files are read once, at the
// first question; the registry's declarations are re-read whenever its
// entries change.
std::unique_ptr<TypeService> NewTypeService(TypeServiceOptions options);

}  // namespace dr
