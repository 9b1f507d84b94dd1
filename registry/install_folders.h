// InstallFolders: keeps the registry in step with the install folders, so
// that bundles a package manager or an installer puts there are registered
// without anyone asking, and unregistered when they go.
//
// An install folder holds plug-in bundles ("*.appex") and applications
// ("*.app", whose Contents/PlugIns/*.appex count) directly inside it;
// nothing deeper is looked at. A symbolic link in the folder counts under
// the canonical path of the bundle it points to.
//
// At start the folders are reconciled with the registry (an unchanged
// bundle costs a few stat calls; the end is logged with the time it took);
// then inotify watches each folder, each installed application's
// Contents/PlugIns/ and each bundle's Contents/, and a change takes effect
// once the bundle has been quiet for `settle`. A folder that does not exist
// yet is picked up when it appears.
//
// Threads: everything runs on the watcher's own thread, never on the
// caller's; a slow or removable disk holds up no request. Failure: a bundle
// that cannot be registered, an unreadable or looping folder is logged (once
// per change of its files) and skipped; the others carry on.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "registry/registry.h"

namespace dr {

struct InstallFolderOptions {
  // Lexically normal absolute folders, in order (RegistryOptions'
  // installFolders); none: the entries that came from install folders are
  // unregistered, and nothing is watched.
  std::vector<std::string> folders;
  // How long a bundle must be quiet before a change to it is acted on.
  std::chrono::milliseconds settle{500};
  // Receives each log line; null: the system log.
  std::function<void(const std::string&)> log;
};

class InstallFolders {
 public:
  // Starts the watcher thread. It scans the folders at once, and once a
  // registry is attached reconciles it with them and then follows their
  // changes until the object is destroyed. Scanning while the registry is
  // being opened hides part of the cost of a start.
  static std::unique_ptr<InstallFolders> Start(InstallFolderOptions options);
  // The registry to keep in step (must outlive the watcher); its observers
  // should be subscribed first, so that they see the reconcile's changes.
  virtual void attach(Registry* registry) = 0;
  // Stops the watcher: a scan under way ends first.
  virtual ~InstallFolders() = default;
};

}  // namespace dr
