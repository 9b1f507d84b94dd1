#include "plugin/plugin_core.h"

#include <cstdio>
#include <cstdlib>
#include <functional>

#include "core/format.h"
#include "core/log.h"
#include "plugin/helpers.h"
#include "plugin/plugin_keys.h"

namespace dr {

std::shared_ptr<DRPlugInCore> DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(
    const std::optional<std::string>& name, const std::optional<std::string>& url,
    const Value& bundleInfo, const Value& info, const std::optional<Uuid>& uuid) {
  auto record = std::make_shared<DRPlugInCore>();
  if (!record->setupWithNameUrlBundleInfoInfoUuid(name, url, bundleInfo, info, uuid)) {
    return nullptr;
  }
  return record;
}

bool DRPlugInCore::setupWithNameUrlBundleInfoInfoUuid(const std::optional<std::string>& name,
                                                      const std::optional<std::string>& url,
                                                      const Value& bundleInfo,
                                                      const Value& /*info*/,
                                                      const std::optional<Uuid>& uuid) {
  if (!url) return false;
  if (!name) {
    SystemLog("missing identifier in plug-in at %@", *url);
    return false;
  }
  if (bundleInfo.isAbsent()) {
    SystemLog("missing Info dictionary in plug-in %@ at %@", *name, *url);
    return false;
  }
  setIdentifier(name);
  setUrl(url);
  // An information dictionary that is not a dictionary at all normalises to
  // absent and is refused here like any other malformed one.
  if (!setDictionaries(normalizeInfoDictionary(bundleInfo))) {
    SystemLog("malformed plug-in dictionary in plug-in %@ at %@: %@", *name, *url, bundleInfo);
    return false;
  }
  setUuid(uuid ? *uuid : Uuid::random());
  return true;
}

bool DRPlugInCore::setDictionaries(const Value& dict) {
  if (!dict.isDictionary()) return false;
  const std::string id = identifier().value_or("");
  std::lock_guard<std::mutex> lock(mu_);
  changedLocked();
  bundleInfoDictionary_ = dict;
  topDictionary_ = dict[kUXExtensionKey];
  if (!topDictionary_.isDictionary()) return false;
  plugInDictionary_ = topDictionary_;
  if (topDictionary_.has(kMultipleKey)) plugInDictionary_ = topDictionary_[kMultipleKey][id];
  return plugInDictionary_.isDictionary();
}

void DRPlugInCore::setTopDictionary(const Value& top) {
  Value current = topDictionary();
  if (current.isDictionary() && !current.sameNode(top)) {
    setBundleInfoDictionary(dictionaryChangingTo(bundleInfoDictionary(), kUXExtensionKey, top));
  }
  set(topDictionary_, top);
}

void DRPlugInCore::setPlugInDictionary(const Value& pd) {
  Value current = plugInDictionary();
  if (current.isDictionary() && !current.sameNode(pd)) {
    Value top = topDictionary();
    if (top.has(kMultipleKey)) {
      Value multiple = dictionaryChangingTo(top[kMultipleKey], identifier().value_or(""), pd);
      setTopDictionary(dictionaryChangingTo(top, kMultipleKey, multiple));
    } else {
      setTopDictionary(pd);
    }
  }
  set(plugInDictionary_, pd);
}

Value DRPlugInCore::attributes() const { return plugInDictionary()[kUXExtensionAttributesKey]; }

std::optional<std::string> DRPlugInCore::version() const { return versionOf(plugInDictionary()); }

std::optional<std::string> DRPlugInCore::versionOf(const Value& plugInDictionary) {
  const Value& v = plugInDictionary[kUXExtensionAttributesKey][kUXExtensionVersionKey];
  // A version written as a number (JSON Info.pdoc files allow it) reads as
  // its decimal text, so it still orders and travels as a version string.
  if (v.isString()) return v.stringValue();
  if (v.isNumber() && !v.isBool()) return v.description();
  return std::nullopt;
}

Value DRPlugInCore::protocolSpec() const { return plugInDictionary()[kUXExtensionProtocolKey]; }

Value DRPlugInCore::sdkSpec() const { return plugInDictionary()[kUXExtensionPointIdentifierKey]; }

std::optional<std::string> DRPlugInCore::embeddedCodePath() const {
  Value code = plugInDictionary()[kEmbeddedCodeKey];
  // Only a name can name a bundle in Contents/PlugIns; any other value gives
  // no path (the plug-in still counts as hybrid).
  if (!code.isString()) return std::nullopt;
  return Format("%@/Contents/PlugIns/%@", path(), code);
}

Value DRPlugInCore::embeddedProtocolSpec() const {
  Value pd = plugInDictionary();
  return pd.has(kEmbeddedProtocolKey) ? pd[kEmbeddedProtocolKey] : pd[kUXExtensionProtocolKey];
}

bool DRPlugInCore::isAppExtension() const {
  std::optional<std::string> p = path();
  return p && p->ends_with(kAppExtensionSuffix);
}

bool DRPlugInCore::isMultiplexed() const { return topDictionary().has(kMultipleKey); }

bool DRPlugInCore::isHybrid() const { return plugInDictionary().has(kEmbeddedCodeKey); }

// Only a number (a boolean included) other than 0 makes a plug-in dedicated;
// a string such as "YES" reads false.
bool DRPlugInCore::isDedicated() const { return plugInDictionary()[kDedicatedKey].boolValue(); }

// A protocol specification that is not a string (an array or dictionary) is
// never the data protocol.
bool DRPlugInCore::isData() const {
  Value spec = protocolSpec();
  return spec.isString() && spec.stringValue() == kDataProtocol;
}

const Uuid& DRPlugInCore::requireUuid(const std::optional<Uuid>& uuid) const {
  // Comparing or hashing a record without identity is a programming error;
  // the check stays in release builds.
  if (!uuid) {
    std::fprintf(stderr, "DRPlugInCore: assertion failed: self.uuid\n");
    std::abort();
  }
  return *uuid;
}

bool DRPlugInCore::isEqual(const DRPlugInCore* other) const {
  std::optional<Uuid> mine = uuid();
  const Uuid& id = requireUuid(mine);
  if (other == nullptr) return false;
  std::optional<Uuid> theirs = other->uuid();
  return theirs && *theirs == id;
}

size_t DRPlugInCore::hash() const {
  std::optional<Uuid> mine = uuid();
  const Uuid& id = requireUuid(mine);
  return std::hash<std::string_view>()(
      std::string_view(reinterpret_cast<const char*>(id.bytes.data()), id.bytes.size()));
}

void DRPlugInCore::setAnnotationValue(std::string_view key, const Value& value) {
  std::lock_guard<std::mutex> lock(mu_);
  if (annotations_.isAbsent()) return;
  annotations_ = dictionaryChangingTo(annotations_, key, value);
}

}  // namespace dr
