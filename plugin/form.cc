// The form: a plug-in record written out as a plain dictionary, so that it can
// travel to a host and be rebuilt into a record there.
//
//   "hubProtocolVersion"  unsigned    always  (read back: 1 when absent)
//   "path"                string      always  the bundle path
//   "systemResident"      boolean     always
//   "identifier"          string      always
//   "version"             string      always  (not read back: derived again)
//   "bundleInfo"          dictionary  always  without "BNBundleInfoPdocURL"
//   "info"                dictionary  always  the plug-in dictionary (not read back)
//   "uuid"                string      always  canonical 36-character text
//   "lastmodified"        signed      always
//   "annotations"         dictionary  always  ({} when the record has none)
//   "containingPath", "localizedContainingDisplayName", "localizedDisplayName",
//   "localizedShortName"  string      when the record has them
//
// Read back only: "hash" (data) and "requirement" (string). The form's
// "bundleInfo" is already merged and canonicalised, so a rebuilt record needs
// no SDK lookup.
#include "core/value.h"
#include "plugin/helpers.h"
#include "plugin/plugin_core.h"
#include "plugin/plugin_keys.h"

namespace dr {
namespace {

std::optional<std::string> StringOf(const Value& v) {
  std::optional<std::string_view> s = v.string();
  return s ? std::optional<std::string>(std::string(*s)) : std::nullopt;
}

// A dictionary, or absent for anything else.
Value DictionaryOf(const Value& v) { return v.isDictionary() ? v : Value(); }

}  // namespace

const Value& DRPlugInCore::NoAnnotations() {
  static const Value empty = Value::EmptyDictionary();
  return empty;
}

Value DRPlugInCore::exportForm() const { return Value(formEntries()); }

// One lock for the whole form rather than one per property (a form is made
// for every plug-in a match returns), which also makes the form one
// consistent picture of the record.
Dictionary DRPlugInCore::formEntries() const {
  std::lock_guard<std::mutex> lock(mu_);
  return formEntriesLocked(true);
}

// The keys go in ascending order, each at the end of the dictionary.
Dictionary DRPlugInCore::formEntriesLocked(bool annotations) const {
  Dictionary form;
  auto add = [&form](const char* key, Value value) {
    if (value.isPresent()) form.emplace_hint(form.end(), key, std::move(value));
  };
  if (annotations) {
    add(kFormAnnotationsKey, annotations_.isDictionary() ? annotations_ : NoAnnotations());
  }
  // Copied only when there is something to leave out.
  add(kFormBundleInfoKey,
      bundleInfoDictionary_.has(kBNBundleInfoPdocURLKey)
          ? dictionaryChangingTo(bundleInfoDictionary_, kBNBundleInfoPdocURLKey, Value())
          : bundleInfoDictionary_);
  add(kFormContainingPathKey, containingUrl_);
  add(kFormHubProtocolVersionKey, hubProtocolVersion_);
  add(kFormIdentifierKey, identifier_);
  add(kFormInfoKey, plugInDictionary_);
  add(kFormLastModifiedKey, lastModified_);
  add(kFormLocalizedContainingNameKey, localizedContainingName_);
  add(kFormLocalizedNameKey, localizedName_);
  add(kFormLocalizedShortNameKey, localizedShortName_);
  add(kFormPathKey, url_);
  add(kFormSystemResidentKey, onSystemVolume_);
  if (uuid_) add(kFormUuidKey, uuid_->string());
  // A record whose canonicalisation was skipped may have no version; the key
  // still carries a string, the empty one, which orders before every version.
  add(kFormVersionKey, versionOf(plugInDictionary_).value_or(""));
  return form;
}

// Encoded outside the lock; of two threads that both make it, the first
// to finish keeps its own, and one made from a record that changed
// meanwhile is answered but not kept.
std::shared_ptr<const DRPlugInCore::EncodedForm> DRPlugInCore::encodedForm() const {
  Dictionary entries;
  uint64_t generation;
  {
    std::lock_guard<std::mutex> lock(mu_);
    if (encodedForm_) return encodedForm_;
    entries = formEntriesLocked(false);
    generation = generation_;
  }
  auto made = std::make_shared<EncodedForm>();
  made->entries = drm1::EncodeEntries(entries, kFormDepth + 1);
  const Value form(std::move(entries));
  made->identifier = form[kFormIdentifierKey];
  made->uuid = form[kFormUuidKey];
  for (size_t i = 0; i < kFormRequestKeys.size(); ++i) {
    made->requestKeyAt[i] = static_cast<uint32_t>(made->entries.lowerBound(kFormRequestKeys[i]));
  }
  std::lock_guard<std::mutex> lock(mu_);
  if (encodedForm_) return encodedForm_;
  if (generation == generation_) encodedForm_ = made;
  return made;
}

std::shared_ptr<DRPlugInCore> DRPlugInCore::initWithForm(const Value& form) {
  auto record = std::make_shared<DRPlugInCore>();
  if (!record->setupWithForm(form)) return nullptr;
  return record;
}

// A value of the wrong kind under "hubProtocolVersion", "lastmodified" or
// "systemResident" reads as if the key were absent (1, 0 and false).
bool DRPlugInCore::setupWithForm(const Value& form) {
  std::optional<std::string> uuidText = StringOf(form[kFormUuidKey]);
  if (!setupWithNameUrlBundleInfoInfoUuid(StringOf(form[kFormIdentifierKey]),
                                          StringOf(form[kFormPathKey]), form[kFormBundleInfoKey],
                                          form[kFormInfoKey],
                                          uuidText ? Uuid::parse(*uuidText) : std::nullopt)) {
    return false;
  }
  const Value& hub = form[kFormHubProtocolVersionKey];
  setHubProtocolVersion(hub.isNumber() ? hub.uintValue() : 1);
  const Value& hash = form[kFormHashKey];
  setCdhash(hash.isData() ? std::optional<Data>(hash.dataValue()) : std::nullopt);
  setRequirement(StringOf(form[kFormRequirementKey]));
  setLastModified(form[kFormLastModifiedKey].intValue());
  if (std::optional<std::string> containing = StringOf(form[kFormContainingPathKey])) {
    setContainingUrl(containing);
  }
  setOnSystemVolume(form[kFormSystemResidentKey].boolValue());
  setAnnotations(DictionaryOf(form[kFormAnnotationsKey]));
  setLocalizedName(StringOf(form[kFormLocalizedNameKey]));
  setLocalizedShortName(StringOf(form[kFormLocalizedShortNameKey]));
  setLocalizedContainingName(StringOf(form[kFormLocalizedContainingNameKey]));
  return true;
}

// Annotations that are not a dictionary clear the record's, as absent ones do.
void DRPlugInCore::updateFromForm(const Value& form) {
  setAnnotations(DictionaryOf(form[kFormAnnotationsKey]));
}

}  // namespace dr
