// DRPlugInCore: the record of one plug-in — who it is (identifier, bundle
// path, UUID), how it is configured (its information dictionary, seen in three
// layers) and what else is known about it (names, registration time, volume,
// and, in a record rebuilt from a form, code-signature data and annotations).
//
// The three dictionary layers:
//
//   bundleInfoDictionary        the bundle's information dictionary, normalised
//                               and merged with its SDK dictionary
//     ["UXExtension"]           = topDictionary
//       ["Multiple"][identifier] = plugInDictionary  (when "Multiple" is there;
//                                 otherwise plugInDictionary is topDictionary)
//
// Dictionaries are immutable shared nodes, so a layer setter writes through
// by building new upper layers that hold the new node itself.
//
// Records are held by std::shared_ptr and may be subclassed (the daemon's own
// records add registry data and checks of their own). Every stored property
// is read and written atomically (one mutex per record; getters answer
// copies). Nothing coordinates reads of several properties: a caller that
// needs a consistent picture reads each property once. Failures of setup are
// answered false (the factories answer an empty pointer) after a system-log
// line; nothing throws.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "core/status.h"
#include "core/value.h"
#include "platform/service_manager.h"
#include "registry/service_manager_linux.h"
#include "wire/drm1.h"

namespace dr {

class DRPlugInCore {
 public:
  // An empty record: every object field absent, both integers 0,
  // onSystemVolume false.
  DRPlugInCore() = default;
  virtual ~DRPlugInCore() = default;
  DRPlugInCore(const DRPlugInCore&) = delete;
  DRPlugInCore& operator=(const DRPlugInCore&) = delete;

  // ---- Construction ------------------------------------------------------

  // A set-up record, or empty when setup refuses (and has logged why).
  static std::shared_ptr<DRPlugInCore> initWithNameUrlBundleInfoInfoUuid(
      const std::optional<std::string>& name, const std::optional<std::string>& url,
      const Value& bundleInfo, const Value& info, const std::optional<Uuid>& uuid);
  // A record rebuilt from a form, or empty when the form is refused.
  static std::shared_ptr<DRPlugInCore> initWithForm(const Value& form);

  // Sets up identifier, url, the three layers (after normalising bundleInfo)
  // and uuid (a fresh random one when none is given). `info` is not used.
  // False, with a system-log line except for a missing url, when the record
  // cannot be set up.
  bool setupWithNameUrlBundleInfoInfoUuid(const std::optional<std::string>& name,
                                          const std::optional<std::string>& url,
                                          const Value& bundleInfo, const Value& info,
                                          const std::optional<Uuid>& uuid);
  // Rebuilds the record from a form; see exportForm.
  bool setupWithForm(const Value& form);

  // Rebuilds the three layers from `dict` directly (no write-through). False
  // when `dict`, its "UXExtension" entry or this plug-in's entry is not a
  // dictionary; the layers assigned before the failing step keep their new
  // values. REQUIRES: identifier is set.
  bool setDictionaries(const Value& dict);

  // ---- Stored properties -------------------------------------------------

  bool onSystemVolume() const { return get(onSystemVolume_); }
  void setOnSystemVolume(bool v) { set(onSystemVolume_, v); }

  Value topDictionary() const { return get(topDictionary_); }
  // Writes through: when the field holds a dictionary that is not the very
  // node `top`, bundleInfoDictionary becomes a new dictionary holding `top`
  // under "UXExtension" (absent removes the key).
  void setTopDictionary(const Value& top);

  Value plugInDictionary() const { return get(plugInDictionary_); }
  // Writes through: when the field holds a dictionary that is not the very
  // node `pd`, topDictionary is set (with write-through) to a new dictionary
  // holding `pd` in this plug-in's place.
  void setPlugInDictionary(const Value& pd);

  std::optional<std::string> identifier() const { return get(identifier_); }
  void setIdentifier(std::optional<std::string> v) { set(identifier_, std::move(v)); }

  // The file-system path of the plug-in's bundle.
  std::optional<std::string> url() const { return get(url_); }
  void setUrl(std::optional<std::string> v) { set(url_, std::move(v)); }

  // The path of the containing application's bundle; absent for a
  // free-standing plug-in.
  std::optional<std::string> containingUrl() const { return get(containingUrl_); }
  void setContainingUrl(std::optional<std::string> v) { set(containingUrl_, std::move(v)); }

  Value bundleInfoDictionary() const { return get(bundleInfoDictionary_); }
  void setBundleInfoDictionary(Value v) { set(bundleInfoDictionary_, std::move(v)); }

  uint64_t hubProtocolVersion() const { return get(hubProtocolVersion_); }
  void setHubProtocolVersion(uint64_t v) { set(hubProtocolVersion_, v); }

  std::optional<std::string> localizedName() const { return get(localizedName_); }
  void setLocalizedName(std::optional<std::string> v) { set(localizedName_, std::move(v)); }
  std::optional<std::string> localizedShortName() const { return get(localizedShortName_); }
  void setLocalizedShortName(std::optional<std::string> v) {
    set(localizedShortName_, std::move(v));
  }
  std::optional<std::string> localizedContainingName() const {
    return get(localizedContainingName_);
  }
  void setLocalizedContainingName(std::optional<std::string> v) {
    set(localizedContainingName_, std::move(v));
  }

  // The user's annotations as carried by a form; absent in the daemon's own
  // records, which keep annotations in the annotation store.
  Value annotations() const { return get(annotations_); }
  void setAnnotations(Value v) { set(annotations_, std::move(v)); }

  // Registration time, whole seconds since 1970-01-01 00:00 UTC.
  int64_t lastModified() const { return get(lastModified_); }
  void setLastModified(int64_t v) { set(lastModified_, v); }

  std::optional<Uuid> uuid() const { return get(uuid_); }
  void setUuid(std::optional<Uuid> v) { set(uuid_, v); }

  // Code-directory hash and code-signing requirement, as carried by a form.
  std::optional<Data> cdhash() const { return get(cdhash_); }
  void setCdhash(std::optional<Data> v) { set(cdhash_, std::move(v)); }
  std::optional<std::string> requirement() const { return get(requirement_); }
  void setRequirement(std::optional<std::string> v) { set(requirement_, std::move(v)); }

  // ---- Derived properties, computed on every read ------------------------

  std::optional<std::string> path() const { return url(); }
  std::optional<std::string> containingPath() const { return containingUrl(); }
  // plugInDictionary["UXExtensionAttributes"].
  Value attributes() const;
  // attributes["UXExtensionVersion"]: the string, or the decimal text of a
  // number; absent for anything else.
  std::optional<std::string> version() const;
  // plugInDictionary["UXExtensionProtocol"], of any type.
  Value protocolSpec() const;
  // plugInDictionary["UXExtensionPointIdentifier"]; names the SDK. Any type:
  // resolveSDK refuses one that is not a string.
  Value sdkSpec() const;
  // <path>/Contents/PlugIns/<"EmbeddedCode">; absent without "EmbeddedCode".
  std::optional<std::string> embeddedCodePath() const;
  // plugInDictionary["EmbeddedProtocol"], or protocolSpec without it.
  Value embeddedProtocolSpec() const;
  // The instant lastModified seconds after 1970-01-01 00:00 UTC.
  Date timestamp() const { return Date{static_cast<double>(lastModified())}; }

  bool isAppExtension() const;  // path ends with ".appex" (case-sensitive)
  bool isMultiplexed() const;   // topDictionary has "Multiple"
  bool isHybrid() const;        // plugInDictionary has "EmbeddedCode"
  bool isDedicated() const;     // plugInDictionary["Dedicated"] reads true
  bool isData() const;          // protocolSpec is the string "#Data"

  // ---- Identity: the UUID alone ------------------------------------------

  // True when `other` is a record (of any subclass) with this record's UUID.
  // REQUIRES: this record has a uuid (checked; stops the process).
  bool isEqual(const DRPlugInCore* other) const;
  bool isEqual(const std::shared_ptr<const DRPlugInCore>& other) const {
    return isEqual(other.get());
  }
  // REQUIRES: this record has a uuid (checked; stops the process).
  size_t hash() const;

  // Replaces annotations by a copy in which `key` maps to `value` (absent
  // removes it). A record without annotations stays without.
  void setAnnotationValue(std::string_view key, const Value& value);

  // ---- Normalisation, SDK merge, canonicalisation, validation ------------

  // The information dictionary in the new style: `info` itself when it has
  // "UXExtension"; a copy with "UXExtension" converted from "Dromon" (which
  // stays) when it has that; otherwise absent.
  static Value normalizeInfoDictionary(const Value& info);
  // Old-style conversions; each answers a new dictionary. A value that is not
  // a dictionary is answered unchanged.
  static Value newDromonDictionaryFrom(const Value& old);
  static Value newMultiplesFrom(const Value& multiple);
  static Value newAttributesFrom(const Value& old);

  // Merges the SDK dictionary named by sdkSpec in, then canonicalises. Logs
  // and stops (no canonicalisation) when sdkSpec is not a string.
  void resolveSDK(ServiceManager* serviceManager = DefaultServiceManager());
  // The SDK dictionary of the extension point `sdk`: first the file named
  // `sdk` in the folder $DRTEST_SDK, then the service manager's registry.
  // Absent (logged) when it is not registered.
  static Value readSDKDictionary(const std::string& sdk,
                                 ServiceManager* serviceManager = DefaultServiceManager());
  // `target` completed by `sdk`, key by key at every depth: the target's
  // values win, except under "CleanTimeout"; "PassProxy" and "Shared" merge
  // by their own rules. Neither input changes.
  static Value mergeDictionaryInto(const Value& sdk, const Value& target);
  static bool sdkOverridesKey(std::string_view key);
  // `sdkValue`'s messages, with `targetValue`'s replacing those of the same name.
  static Value mergeProxyPassInto(const Value& sdkValue, const Value& targetValue);
  // The union of both arrays, each element once: the target's elements in
  // their order, then those only the SDK has.
  static Value mergeSharedResourcesInto(const Value& sdkValue, const Value& targetValue);

  // Fills in the defaults: protocol, principal class and shared resources of
  // an app extension, the format, the version.
  void canonicalize();
  // OK, or the first thing missing that every plug-in needs.
  virtual Status diagnose();

  // ---- Form ---------------------------------------------------------------

  // The record as a form (a new dictionary). Never fails.
  // REQUIRES: identifier, url, plugInDictionary and uuid present.
  Value exportForm() const;
  // The same form as a mutable dictionary, for a caller that adds entries
  // before wrapping it (no absent values in it).
  Dictionary formEntries() const;

  // A form's nesting level in a "match" reply: the body is level 1 and its
  // "matches" array level 2.
  static constexpr int kFormDepth = 3;
  // The form's entries that stay the same from request to request (all but
  // "annotations"), encoded as they sit in a "match" reply, and the two a
  // request's replacement marks carry, so that a reply copies neither.
  struct EncodedForm {
    drm1::EncodedEntries entries;
    Value identifier;  // string
    Value uuid;        // string
    // The entry before which each of kFormRequestKeys sorts in.
    std::array<uint32_t, 4> requestKeyAt;
  };
  // Made on first use (any thread; several may ask at once) and kept until
  // the record next changes. Never fails: a form the wire cannot carry keeps
  // the refusal in its entries.
  std::shared_ptr<const EncodedForm> encodedForm() const;
  // What a form's "annotations" holds for a plug-in without any: one shared
  // empty dictionary rather than a new node per form.
  static const Value& NoAnnotations();
  // annotations := form["annotations"]; absent (or not a dictionary) clears.
  void updateFromForm(const Value& form);

 private:
  template <typename T>
  T get(const T& field) const {
    std::lock_guard<std::mutex> lock(mu_);
    return field;
  }
  template <typename T>
  void set(T& field, T value) {
    std::lock_guard<std::mutex> lock(mu_);
    std::swap(field, value);  // the old value dies outside the lock
    changedLocked();
  }
  // Drops the encoded form. REQUIRES: mu_ held.
  void changedLocked() {
    encodedForm_.reset();
    ++generation_;
  }
  // The form's entries; "annotations" only when `annotations`. REQUIRES: mu_ held.
  Dictionary formEntriesLocked(bool annotations) const;
  const Uuid& requireUuid(const std::optional<Uuid>& uuid) const;
  // version() of a plug-in dictionary.
  static std::optional<std::string> versionOf(const Value& plugInDictionary);

  mutable std::mutex mu_;
  bool onSystemVolume_ = false;
  Value topDictionary_;
  Value plugInDictionary_;
  std::optional<std::string> identifier_;
  std::optional<std::string> url_;
  std::optional<std::string> containingUrl_;
  Value bundleInfoDictionary_;
  uint64_t hubProtocolVersion_ = 0;
  std::optional<std::string> localizedName_;
  std::optional<std::string> localizedShortName_;
  std::optional<std::string> localizedContainingName_;
  Value annotations_;
  int64_t lastModified_ = 0;
  std::optional<Uuid> uuid_;
  std::optional<Data> cdhash_;
  std::optional<std::string> requirement_;
  mutable std::shared_ptr<const EncodedForm> encodedForm_;  // guarded by mu_
  uint64_t generation_ = 0;  // guarded by mu_: counts changes, so a stale form is not kept
};

}  // namespace dr
