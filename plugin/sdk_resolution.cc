// Completing a plug-in's configuration: the SDK merge, the defaults every
// plug-in gets, and the check of what every plug-in must have.
#include <cstdlib>
#include <string>

#include "core/format.h"
#include "core/log.h"
#include "core/utf8.h"
#include "platform/pdoc_file.h"
#include "plugin/plugin_core.h"
#include "plugin/plugin_keys.h"
#include "registry/registry.h"
#include "wire/protocol.h"

namespace dr {
void DRPlugInCore::resolveSDK(ServiceManager* serviceManager) {
  Value sdk = sdkSpec();
  if (sdk.isPresent()) {
    if (!sdk.isString()) {
      SystemLog("invalid SDK key:%@", sdk);
      return;
    }
    Value sdkDictionary = readSDKDictionary(sdk.stringValue(), serviceManager);
    if (sdkDictionary.isPresent()) {
      // The answer is not looked at: a merge that breaks the layers leaves a
      // record that canonicalize skips and diagnose refuses.
      setDictionaries(mergeDictionaryInto(sdkDictionary, bundleInfoDictionary()));
    }
  }
  canonicalize();
}

Value DRPlugInCore::readSDKDictionary(const std::string& sdk, ServiceManager* serviceManager) {
  const char* testFolder = std::getenv(kTestSdkEnvironmentVariable);
  // The file is named exactly as the identifier; an identifier that is not a
  // plain file name cannot name one in that folder. An empty value counts as
  // unset rather than as the root folder.
  if (testFolder != nullptr && *testFolder != '\0' && sdk.find('/') == std::string::npos) {
    Result<Value> dict = pdoc::ReadFile(std::string(testFolder) + "/" + sdk);
    if (dict.ok() && dict->isDictionary()) return *dict;
  }
  Result<Value> registered = serviceManager->sdkDictionary(sdk);
  if (!registered.ok() || !registered->isDictionary()) {
    // A registered file that cannot be read counts as no registration, with
    // the reason on the same line.
    std::string line = Format("plug-in sdk \"%@\" not registered", sdk);
    if (!registered.ok()) line += ": " + registered.error().localizedDescription();
    SystemLogLine(line);
    return Value();
  }
  return *registered;
}

void DRPlugInCore::canonicalize() {
  // Dictionaries are immutable nodes, so the final attributes and plug-in
  // dictionary are built first and set once; all three layers then hold that
  // very node, the state in-place changes after the set would have reached.
  Value attributesValue = attributes();
  Value pdValue = plugInDictionary();
  // A plug-in dictionary or attributes value of the wrong kind is left as it
  // is, for diagnose to refuse.
  if (!pdValue.isDictionary()) return;
  if (attributesValue.isPresent() && !attributesValue.isDictionary()) return;

  Dictionary attrs = attributesValue.dictionary();
  Dictionary pd = pdValue.dictionary();
  if (isAppExtension()) {
    if (!pd.contains(kUXExtensionProtocolKey))
      pd[kUXExtensionProtocolKey] = kDefaultProtocolAndClass;
    if (!pd.contains(kPrincipalClassKey)) pd[kPrincipalClassKey] = kDefaultProtocolAndClass;
    pd[kSharedKey] = Value(Array{Value(kAppExtensionSharedPath)});
  }
  attrs[kFormatAttributeKey] = pd.contains(kEmbeddedCodeKey) ? kHybridFormat : kStandardFormat;
  if (!attrs.contains(kUXExtensionVersionKey)) {
    Value bundleVersion = bundleInfoDictionary()[kBNBundleVersionKey];
    attrs[kUXExtensionVersionKey] =
        bundleVersion.isPresent() ? bundleVersion : Value(kLastResortVersion);
  }
  pd[kUXExtensionAttributesKey] = Value(std::move(attrs));
  setPlugInDictionary(Value(std::move(pd)));
}

Status DRPlugInCore::diagnose() {
  if (!identifier()) {
    return DRMakeErrorWithFormat(
        message::kErrorInvalidPlugIn,
        "missing identifier (no UXExtensionIdentifier, nor even BNBundleIdentifier)");
  }
  const char* missing = nullptr;
  if (protocolSpec().isAbsent()) {
    missing = kUXExtensionProtocolKey;
  } else if (!attributes().isDictionary()) {
    // Attributes of the wrong kind are as good as none.
    missing = kUXExtensionAttributesKey;
  }
  if (missing) {
    return DRMakeErrorWithFormat(message::kErrorInvalidPlugIn,
                                 "missing \"%@\" key in Info.pdoc or SDK", missing);
  }
  // A "bundleInfo" (and "info", the plug-in dictionary, within it) nested
  // deeper than a reply can carry it, or text a reply cannot carry (stored
  // by an older drd, or from the SDK), would make every reply carrying the
  // form fail, for every host.
  if (std::optional<std::string> why = WhyCannotTravel(bundleInfoDictionary())) {
    return DRMakeErrorWithFormat(message::kErrorInvalidPlugIn,
                                 "Info.pdoc and SDK cannot be carried in a reply: %@", *why);
  }
  for (const std::optional<std::string>& text :
       {url(), containingUrl(), localizedName(), localizedShortName(), localizedContainingName()}) {
    if (text && !TextCanTravel(*text)) {
      return DRMakeErrorWithFormat(message::kErrorInvalidPlugIn,
                                   "its path or a name is not UTF-8 or holds NUL: \"%@\"",
                                   EscapeInvalidUtf8(*text));
    }
  }
  return Status::OK();
}

}  // namespace dr
