// The Linux service manager: a ServiceManager that tells which running
// processes come from registered plug-in bundles by reading /proc and asking
// the registry. Safe from any thread.
#pragma once

#include <memory>

#include "platform/service_manager.h"

namespace dr {

class BundleReader;
class ProcessInfo;
class Registry;

struct ServiceManagerOptions {
  // The registered plug-in bundles; null: none. Must outlive the manager.
  const Registry* registry = nullptr;
  // Reads /proc/<pid>/exe; null: ProcessInfo::Default().
  ProcessInfo* processInfo = nullptr;
  // Finds the bundle of a granted executable; null: BundleReader::Default().
  BundleReader* bundleReader = nullptr;
};

// The Linux service manager. The registered bundles it has seen (at
// construction and at every call) are remembered for the life of the
// manager, so the instances of an uninstalled plug-in can still be stopped.
std::unique_ptr<ServiceManager> NewServiceManager(const ServiceManagerOptions& options);

// A service manager that knows no registry: SDK dictionaries and grants work,
// and no process counts as an instance of a registered bundle. Never null;
// lives for the whole process.
ServiceManager* DefaultServiceManager();

}  // namespace dr
