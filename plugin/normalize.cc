// Normalisation of old-style information dictionaries and the merge of an
// SDK dictionary under a plug-in's own.
//
// Old style keeps the top dictionary under "Dromon" with shorter key names:
//
//   "Attributes" → "UXExtensionAttributes"  (its keys converted too:
//       "com.corvel.identifier" → "UXExtensionIdentifier",
//       "com.corvel.protocol"   → "UXExtensionPointName",
//       "com.corvel.version"    → "UXExtensionVersion")
//   "Protocol"   → "UXExtensionProtocol"
//   "SDK"        → "UXExtensionPointIdentifier"
//   "Multiple"   → "Multiple", each entry converted as a whole top dictionary
//
// The conversions are defined on dictionaries only. Any other value passes
// through unchanged, so a wrong type in an old-style dictionary is refused
// later exactly as the same wrong type in a new-style one would be.
#include <string>
#include <unordered_set>

#include "plugin/helpers.h"
#include "plugin/plugin_core.h"
#include "plugin/plugin_keys.h"

namespace dr {
namespace {

// Stores `value` under `key`; when the dictionary holds both an old key and
// its new name, the one enumerated later wins (keys enumerate in ascending
// byte order, so "Protocol" loses to "UXExtensionProtocol").
void Store(Dictionary& d, std::string_view key, Value value) {
  d.insert_or_assign(std::string(key), std::move(value));
}

}  // namespace

Value DRPlugInCore::normalizeInfoDictionary(const Value& info) {
  if (info.has(kUXExtensionKey)) return info;
  if (info.has(kDromonKey)) {
    return dictionaryChangingTo(info, kUXExtensionKey, newDromonDictionaryFrom(info[kDromonKey]));
  }
  return Value();
}

Value DRPlugInCore::newDromonDictionaryFrom(const Value& old) {
  if (!old.isDictionary()) return old;
  Dictionary out;
  for (const auto& [key, value] : old.dictionary()) {
    if (key == kOldAttributesKey) {
      Store(out, kUXExtensionAttributesKey, newAttributesFrom(value));
    } else if (key == kOldProtocolKey) {
      Store(out, kUXExtensionProtocolKey, value);
    } else if (key == kOldSdkKey) {
      Store(out, kUXExtensionPointIdentifierKey, value);
    } else if (key == kMultipleKey) {
      Store(out, kMultipleKey, newMultiplesFrom(value));
    } else {
      Store(out, key, value);
    }
  }
  return Value(std::move(out));
}

Value DRPlugInCore::newMultiplesFrom(const Value& multiple) {
  if (!multiple.isDictionary()) return multiple;
  Dictionary out;
  for (const auto& [identifier, entry] : multiple.dictionary()) {
    out.emplace(identifier, newDromonDictionaryFrom(entry));
  }
  return Value(std::move(out));
}

Value DRPlugInCore::newAttributesFrom(const Value& old) {
  if (!old.isDictionary()) return old;
  Dictionary out;
  for (const auto& [key, value] : old.dictionary()) {
    if (key == kOldIdentifierAttributeKey) {
      Store(out, kUXExtensionIdentifierKey, value);
    } else if (key == kOldProtocolAttributeKey) {
      Store(out, kUXExtensionPointNameKey, value);
    } else if (key == kOldVersionAttributeKey) {
      Store(out, kUXExtensionVersionKey, value);
    } else {
      Store(out, key, value);
    }
  }
  return Value(std::move(out));
}

bool DRPlugInCore::sdkOverridesKey(std::string_view key) { return key == kCleanTimeoutKey; }

// Where the SDK's value and the plug-in's have kinds that cannot merge (a
// dictionary against a string, a "PassProxy" that is not a dictionary, a
// "Shared" that is not an array), the plug-in's own value stays.
Value DRPlugInCore::mergeDictionaryInto(const Value& sdk, const Value& target) {
  Dictionary result = target.dictionary();
  for (const auto& [key, sdkValue] : sdk.dictionary()) {
    const Value& targetValue = target[key];
    if (targetValue.isAbsent() || sdkOverridesKey(key)) {
      result.insert_or_assign(key, sdkValue);
    } else if (key == kPassProxyKey) {
      result.insert_or_assign(key, mergeProxyPassInto(sdkValue, targetValue));
    } else if (key == kSharedKey) {
      result.insert_or_assign(key, mergeSharedResourcesInto(sdkValue, targetValue));
    } else if (sdkValue.isDictionary() && targetValue.isDictionary()) {
      result.insert_or_assign(key, mergeDictionaryInto(sdkValue, targetValue));
    }
  }
  return Value(std::move(result));
}

Value DRPlugInCore::mergeProxyPassInto(const Value& sdkValue, const Value& targetValue) {
  if (!sdkValue.isDictionary() || !targetValue.isDictionary()) return targetValue;
  Dictionary result = sdkValue.dictionary();
  for (const auto& [message, spec] : targetValue.dictionary())
    result.insert_or_assign(message, spec);
  return Value(std::move(result));
}

Value DRPlugInCore::mergeSharedResourcesInto(const Value& sdkValue, const Value& targetValue) {
  if (!sdkValue.isArray() || !targetValue.isArray()) return targetValue;
  Array result;
  // Paths are strings: those are found by hash; anything else by a scan.
  std::unordered_set<std::string> strings;
  auto add = [&](const Value& v) {
    if (std::optional<std::string_view> s = v.string()) {
      if (strings.emplace(*s).second) result.push_back(v);
      return;
    }
    for (const Value& kept : result) {
      if (kept == v) return;
    }
    result.push_back(v);
  };
  for (const Value& v : targetValue.array()) add(v);
  for (const Value& v : sdkValue.array()) add(v);
  return Value(std::move(result));
}

}  // namespace dr
