// The daemon's plug-in record: construction from a registry entry,
// entitlements, the annotation key, admission and resource tokens.
#include "plugin/plugin.h"

#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <optional>
#include <string_view>

#include "core/format.h"
#include "core/log.h"
#include "platform/code_signing.h"
#include "platform/file_system.h"
#include "platform/sandbox.h"
#include "plugin/plugin_keys.h"
#include "registry/service_manager_linux.h"
#include "wire/protocol.h"

namespace dr {
namespace {

// Whole seconds since 1970, truncated toward zero. A date that is not a
// number reads 0 and one out of range saturates, rather than being undefined.
int64_t WholeSeconds(Date date) {
  double s = std::trunc(date.seconds);
  if (std::isnan(s)) return 0;
  if (s >= 9223372036854775807.0) return std::numeric_limits<int64_t>::max();
  if (s <= -9223372036854775808.0) return std::numeric_limits<int64_t>::min();
  return static_cast<int64_t>(s);
}

// The resource names "Shared" declares: a string alone, the strings of an
// array, or (another collection) the keys of a dictionary; any other value
// declares none. Elements that are not strings are skipped.
std::vector<std::string> ResourceNames(const Value& resources) {
  std::vector<std::string> names;
  if (auto s = resources.string()) {
    names.emplace_back(*s);
  } else if (resources.isArray()) {
    for (const Value& element : resources.array())
      if (auto e = element.string()) names.emplace_back(*e);
  } else if (resources.isDictionary()) {
    for (const auto& [key, unused] : resources.dictionary()) names.emplace_back(key);
  }
  return names;
}

}  // namespace

std::shared_ptr<DRDPlugIn> DRDPlugIn::initWithRGData(const RegistryEntryPtr& entry,
                                                     const PlugInServices& services) {
  // Every item the record needs comes from the platform registry's entry.
  if (!entry || entry->url().empty() || !entry->infoDictionary().isPresent()) return nullptr;

  auto plugIn = std::make_shared<DRDPlugIn>(services);
  if (!plugIn->setupWithNameUrlBundleInfoInfoUuid(entry->plugInIdentifier(), entry->url(),
                                                  entry->infoDictionary(),
                                                  entry->plugInDictionary(), entry->uuid())) {
    return nullptr;
  }
  plugIn->setRgproxy(entry);
  plugIn->setLastModified(WholeSeconds(entry->registrationDate()));
  plugIn->setOnSystemVolume(entry->onSystemVolume());
  plugIn->resolveSDK(plugIn->serviceManager());

  Value hubVersion = plugIn->topDictionary()[kHubProtocolVersionKey];
  if (hubVersion.isPresent()) {
    plugIn->setHubProtocolVersion(hubVersion.uintValue());
  } else {
    plugIn->setHubProtocolVersion(plugIn->bundleInfoDictionary().has(kDromonKey) ? 1 : 2);
  }

  if (const auto& app = entry->containingApplication()) {
    plugIn->setContainingUrl(app->url);
    plugIn->setLocalizedContainingName(app->displayName);
  }
  plugIn->setLocalizedName(entry->displayName());
  plugIn->setLocalizedShortName(entry->shortName());

  if (Status status = plugIn->diagnose(); !status.ok()) {
    SystemLog("ignoring mis-configured plug-in at %@: %@", entry->url(), status.error());
    return nullptr;
  }
  return plugIn;
}

ServiceManager* DRDPlugIn::serviceManager() const {
  return services_.serviceManager ? services_.serviceManager : DefaultServiceManager();
}

Value DRDPlugIn::formExtensions() const {
  Value shared = plugInDictionary()[kSharedKey];
  return shared.isAbsent() ? Value() : issueResourceExtensions(shared);
}

void DRDPlugIn::augmentForm(Dictionary& form) const {
  Value extensions = formExtensions();
  if (extensions.isPresent()) form.insert_or_assign(kFormExtensionsKey, std::move(extensions));
}

Value DRDPlugIn::issueResourceExtensions(const Value& resources) const {
  Dictionary tokens;
  const std::string bundlePath = url().value_or(std::string());
  for (const std::string& name : ResourceNames(resources)) {
    std::string path = name == kAppExtensionSharedPath ? bundlePath : bundlePath + "/" + name;
    int errnum = ENOSYS;  // no sandbox service: nothing can be issued
    if (services_.sandbox != nullptr) {
      // Resolved once: the path checked is the path granted, even if a link
      // in it changes meanwhile. A plug-in names its resources, so a name
      // such as "../../.ssh" must not win hosts a token for a file outside
      // its bundle, nor may the bundle itself once its folder was swapped
      // for a link since it was registered (under its canonical path).
      Result<std::string> resolved = CanonicalPathWithin(path, bundlePath);
      Result<std::string> token = resolved.ok()
                                      ? services_.sandbox->issueFileExtension(
                                            kReadOnlyFileExtensionClass, *resolved, /*flags=*/0)
                                      : Result<std::string>(resolved.error());
      if (token.ok()) {
        tokens.insert_or_assign(name, Value(std::move(token).value()));
        continue;
      }
      const Error& e = token.error();
      errnum = e.domain() == kPosixErrorDomain ? static_cast<int>(e.code()) : EINVAL;
    }
    SystemLog("failed to make extension for %@ in plug-in at %@: %s", path, bundlePath,
              std::strerror(errnum));
  }
  return Value(std::move(tokens));
}

Value DRDPlugIn::entitlements() const {
  return rgproxy_ ? rgproxy_->entitlements() : Value::EmptyDictionary();
}

Value DRDPlugIn::valueForEntitlement(std::string_view name) const { return entitlements()[name]; }

bool DRDPlugIn::hasEntitlement(std::string_view name) const {
  return IsEntitlementHeld(valueForEntitlement(name));
}

std::string DRDPlugIn::annotationKey() const {
  Value replaced = valueForEntitlement(kReplacePluginEntitlement);
  if (auto s = replaced.string()) return std::string(*s);
  return identifier().value_or(std::string());
}

Status DRDPlugIn::diagnose() {
  if (Status status = DRPlugInCore::diagnose(); !status.ok()) return status;
  if (isData()) return Status::OK();
  if (attributes()[kUXExtensionPointNameKey] == Value(kUnsandboxedExtensionPointName))
    return Status::OK();
  if (!hasEntitlement(kAppSandboxEntitlement))
    return DRMakeError(message::kErrorInvalidPlugIn, "plug-ins must be sandboxed");
  return Status::OK();
}

}  // namespace dr
