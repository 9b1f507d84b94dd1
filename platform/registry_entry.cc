// Registry entries, their lazily parsed dictionaries, and the registry's
// options from the environment.
#include <unistd.h>

#include <cstdlib>
#include <vector>

#include "core/format.h"
#include "platform/locations.h"
#include "platform/pdoc.h"
#include "platform/registry.h"
#include "platform/registry_scan.h"

namespace dr {

RegistryBundleFiles::RegistryBundleFiles(std::string infoBytes,
                                         std::optional<std::string> entitlementsBytes)
    : infoBytes_(std::move(infoBytes)), entitlementsBytes_(std::move(entitlementsBytes)) {}

void RegistryBundleFiles::parse() const {
  std::call_once(parsed_, [this] {
    // The bytes were checked at registration; a stored file that no longer
    // reads (a changed parser, a tampered database) yields no dictionary, and
    // the daemon then skips the plug-in.
    if (auto info = pdoc::Parse(infoBytes_); info && info->isDictionary()) info_ = *info;
    entitlements_ = Value::EmptyDictionary();
    if (entitlementsBytes_) {
      if (auto e = pdoc::Parse(*entitlementsBytes_); e && e->isDictionary()) entitlements_ = *e;
    }
    // The parsed values are all that is read from now on.
    std::string().swap(infoBytes_);
    entitlementsBytes_.reset();
  });
}

const Value& RegistryBundleFiles::infoDictionary() const {
  parse();
  return info_;
}

const Value& RegistryBundleFiles::entitlements() const {
  parse();
  return entitlements_;
}

RegistryEntry::RegistryEntry(Fields fields, std::shared_ptr<const RegistryBundleFiles> files)
    : f_(std::move(fields)), files_(std::move(files)) {}

const Value& RegistryEntry::plugInDictionary() const {
  std::call_once(plugInOnce_, [this] {
    plugIn_ =
        registry_internal::PlugInDictionaryOf(infoDictionary(), f_.plugInIdentifier, f_.multiple);
  });
  return plugIn_;
}

std::string RegistryEntry::description() const {
  return Format("%@ %@ at %@", f_.plugInIdentifier, f_.uuid, f_.url);
}

Result<RegistryOptions> RegistryOptionsFromEnvironment(
    const std::function<const char*(const char*)>& getenv) {
  auto get = [&](const char* name) -> std::string {
    const char* value = getenv ? getenv(name) : std::getenv(name);
    return value ? value : "";
  };
  RegistryOptions options;
  if (std::string registry = get("DR_REGISTRY"); !registry.empty()) {
    options.databasePath = registry;
  } else {
    std::string dataHome = DataHome(getenv);
    if (dataHome.empty()) {
      return Error(kRegistryErrorDomain, kRegistryStorage,
                   "no location for the registry database: neither DR_REGISTRY, "
                   "XDG_DATA_HOME nor a home folder is known");
    }
    options.databasePath = dataHome + "/dromon/registry.sqlite3";
  }
  if (std::string roots = get("DR_SYSTEM_ROOTS"); !roots.empty()) {
    options.systemRoots = SplitFolderList(roots);
  }
  return options;
}

}  // namespace dr
