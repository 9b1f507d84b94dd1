// ServiceManager: the platform's service manager as the daemon sees it: SDK
// dictionaries, grants of a plug-in's service to host processes, and the
// running instances of plug-ins (processes whose executable lies in a plug-in
// bundle). Grants live in memory only; a restarted daemon starts with none.
// Every member is safe to call from any thread. Process answers are
// snapshots of /proc: a process may start or exit right after the call.
// Granting and removing answer a bare errno-style number rather than a
// Status: that number is all their callers use, and it is what drd's log
// lines about grants and removals print.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/status.h"
#include "core/value.h"

namespace dr {

// What removeExternalServiceInstance answers when no instance was running
// (the "no such process" error number).
inline constexpr int kNoInstanceRunning = 3;

// A plug-in's service made available to one host process.
struct ExternalServiceGrant {
  pid_t hostPid = 0;
  // The plug-in bundle that holds the executable and its identifier and
  // version, as the registry records them (else as its Info.pdoc says);
  // missing when the executable lies in no readable bundle.
  std::optional<std::string> bundlePath;
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> bundleVersion;
  std::string executablePath;  // canonical
  Value overlay;               // the service dictionary the daemon sent
  bool operator==(const ExternalServiceGrant&) const = default;
};

// A running process whose executable lies in a registered plug-in bundle, as
// an instance of one plug-in of that bundle.
struct BusyExtensionInstance {
  pid_t pid = 0;
  std::optional<std::string> bundlePath;
  std::optional<std::string> bundleIdentifier;
  // The registry entry of the plug-in; its record says the plug-in's version.
  std::optional<Uuid> plugIn;
  bool operator==(const BusyExtensionInstance&) const = default;
};

class ServiceManager {
 public:
  virtual ~ServiceManager() = default;

  // The SDK dictionary registered for `extensionPointIdentifier`: a
  // dictionary, or absent when none is registered. An error when a file is
  // registered but is not a readable pdoc dictionary. On Linux an SDK is the
  // file <identifier>.pdoc in the first folder of DR_SDK_PATH (colon-separated;
  // default $XDG_DATA_HOME/dromon/SDKs:/usr/share/dromon/SDKs) that has it;
  // the environment is read on every call.
  virtual Result<Value> sdkDictionary(const std::string& extensionPointIdentifier) = 0;

  // Makes the plug-in service whose executable is `executablePath` available
  // to the process `hostPid` with the service dictionary `overlay`, and
  // records the grant. Answers 0, ENOENT when the executable is missing,
  // EACCES when it is not an executable file, ESRCH for a pid below 1. A
  // second grant of the same executable to the same pid replaces the first.
  virtual int addExternalService(pid_t hostPid, const std::string& executablePath,
                                 const Value& overlay) = 0;

  // The running processes whose executable lies in a registered plug-in
  // bundle with one of `bundleIdentifiers` (the innermost registered bundle
  // when bundles nest), in pid order: each process once per plug-in of its
  // bundle, in registry order. Fails only when the process list cannot be
  // read.
  virtual Result<std::vector<BusyExtensionInstance>> busyExtensionInstances(
      const std::vector<std::string>& bundleIdentifiers) = 0;

  // Drops the grants of the plug-in `bundleIdentifier` at `bundleVersion`
  // and sends SIGTERM to its running instances, also when its bundle is no
  // longer registered (uninstalling it is what asks for this). A record
  // without a version matches "". Answers 0 when some instance was signalled,
  // kNoInstanceRunning when none ran, or the errno of a refused signal.
  virtual int removeExternalServiceInstance(const std::string& bundleIdentifier,
                                            const std::string& bundleVersion) = 0;

  // The grants in force, in the order they were made.
  virtual std::vector<ExternalServiceGrant> externalServiceGrants() const = 0;
};

}  // namespace dr
