// ServiceManager: the platform's service manager as the daemon sees it.
//
// For now it answers one question: the SDK dictionary registered for an
// extension point. On Linux an SDK is registered by placing the file
// <identifier>.pdoc in one of the folders of DR_SDK_PATH (colon-separated;
// default $XDG_DATA_HOME/dromon/SDKs:/usr/share/dromon/SDKs, XDG_DATA_HOME
// defaulting to ~/.local/share); the first folder that has the file wins.
// The environment is read on every call. ServiceManager::Default() is safe to
// use from any thread.
#pragma once

#include <string>

#include "core/status.h"
#include "core/value.h"

namespace dr {

class ServiceManager {
 public:
  virtual ~ServiceManager() = default;

  // The SDK dictionary registered for `extensionPointIdentifier`: a
  // dictionary, or absent when none is registered. An error when a file is
  // registered but is not a readable pdoc dictionary.
  virtual Result<Value> sdkDictionary(const std::string& extensionPointIdentifier) = 0;

  // The other operations come with the process services.

  // The real service manager. Never null; lives for the whole process.
  static ServiceManager* Default();
};

}  // namespace dr
