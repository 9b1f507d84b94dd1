// Client authorization and activation: whether a host may use a plug-in,
// granting a host process the plug-in's service, and finding the plug-in's
// busy running instances.
#include <cstdlib>
#include <string>
#include <utility>
#include <vector>

#include "core/format.h"
#include "core/log.h"
#include "plugin/bundle.h"
#include "plugin/plugin.h"
#include "plugin/plugin_keys.h"
#include "wire/protocol.h"

namespace dr {

std::optional<std::string> DRDPlugIn::allowForClient(const PlugInClient& client) const {
  Value restriction = client.entitlementValueForKey(kAllowedPluginsEntitlement);
  if (restriction.isPresent()) {
    if (!restriction.isDictionary()) return "invalid host restriction entitlement";
    if (!match(restriction)) return "the host's plug-in entitlement does not allow this plug-in";
  }
  // A host entitlement that is not a string names nothing and is ignored.
  if (auto demanded = plugInDictionary()[kUXExtensionHostEntitlementKey].string()) {
    if (!client.hasEntitlement(*demanded))
      return Format("the host does not have the \"%@\" entitlement", *demanded);
  }
  return std::nullopt;
}

Status DRDPlugIn::enableForPid(pid_t pid) const {
  Dictionary environment;
  const char* testSdk = services_.getenv ? services_.getenv(kTestSdkEnvironmentVariable)
                                         : std::getenv(kTestSdkEnvironmentVariable);
  if (testSdk != nullptr) environment.insert_or_assign(kTestSdkEnvironmentVariable, testSdk);

  Value declared = bundleInfoDictionary()[kIPCServiceKey];
  Dictionary service = declared.isDictionary() ? declared.dictionary() : Dictionary{};
  // Variables are passed on only as strings; a declaration of another type,
  // or an entry that is not a string, is left out rather than sent as is.
  auto own = service.find(kEnvironmentVariablesKey);
  if (own != service.end()) {
    for (const auto& [name, value] : own->second.dictionary())
      if (value.isString()) environment.insert_or_assign(name, value);
  }
  service.insert_or_assign(kEnvironmentVariablesKey, Value(std::move(environment)));
  Value overlay{{kIPCServiceKey, Value(std::move(service))},
                {kBNBundlePackageTypeKey, kIPCServicePackageType}};

  const std::optional<std::string> path = url();
  const std::optional<Uuid> id = uuid();
  SystemLog("enabling pid=%d for plug-in %@(%@) %@ %@", pid, identifier(), version(), id, path);

  std::optional<std::string> executable;
  if (path) {
    BundleReader* reader =
        services_.bundleReader ? services_.bundleReader : BundleReader::Default();
    if (auto bundle = DRBundle::initWithURL(*path, reader)) executable = bundle->executablePath();
  }
  if (!executable) {
    return DRMakeErrorWithFormat(message::kErrorMalformed,
                                 "cannot obtain executable path for plug-in %@(%@)", identifier(),
                                 id);
  }
  // The platform service manager answers 0 or an error number.
  int result = serviceManager()->addExternalService(pid, *executable, overlay);
  if (result != 0) {
    SystemLog("ipc error %d allowing pid %d to use plug-in %@(%@) %@ at %@", result, pid,
              identifier(), version(), id, path);
    return DRMakeErrorWithFormat(message::kErrorMalformed,
                                 "unable to enable plug-in %@(%@) for pid %d", identifier(), id,
                                 pid);
  }
  return Status::OK();
}

std::optional<BusyInstance> DRDPlugIn::checkBusy() const {
  // Without a bundle identifier there is nothing to ask the service manager.
  auto bundleIdentifier = bundleInfoDictionary()[kBNBundleIdentifierKey].string();
  if (!bundleIdentifier) return std::nullopt;
  const std::string bundleId(*bundleIdentifier);

  auto instances = serviceManager()->busyExtensionInstances({bundleId});
  if (!instances.ok()) {
    SystemLog("ipc failed to report dirty state for \"%@\"", bundleId);
    return std::nullopt;
  }
  const std::optional<std::string> ownVersion = version();
  for (const BusyExtensionInstance& instance : *instances) {
    if (!instance.bundleIdentifier || !instance.bundlePath) {
      SystemLog("ipc reported incomplete bundle \"%s\" for plug-in %@", instance.bundleIdentifier,
                identifier());
      continue;
    }
    // A process runs as each plug-in of its bundle; each has its own record,
    // whose version is the one compared.
    std::optional<std::string> version;
    if (instance.plugIn && *instance.plugIn == uuid()) {
      version = ownVersion;
    } else if (instance.plugIn && services_.plugInVersion) {
      version = services_.plugInVersion(*instance.plugIn);
    }
    if (version && version != ownVersion) continue;
    return BusyInstance{instance.pid, instance.bundlePath, instance.bundleIdentifier,
                        std::move(version)};
  }
  return std::nullopt;
}

}  // namespace dr
