// DRDPlugIn: the daemon's plug-in record, built from one registry entry and
// holding on to it. Adds the entitlements the registry reports, the key of
// the user's annotations, the admission check (plug-ins must be sandboxed),
// resource sandbox tokens, rule matching and client authorization/activation.
// Built on the database's queue; afterwards only read (any thread); platform
// services are injected through PlugInServices and must outlive the record.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "core/status.h"
#include "core/value.h"
#include "platform/service_manager.h"
#include "plugin/plugin_client.h"
#include "plugin/plugin_core.h"
#include "registry/registry.h"
#include "wire/locations.h"

namespace dr {

class BundleReader;
class Sandbox;
class TypeService;

// The platform services a record uses.
struct PlugInServices {
  // SDK dictionaries, service grants and busy instances; null: Default().
  ServiceManager* serviceManager = nullptr;
  // Issues resource tokens; null: no token can be issued (each resource is
  // logged as failed).
  Sandbox* sandbox = nullptr;
  // Opens the bundle to find its executable; null: BundleReader::Default().
  BundleReader* bundleReader = nullptr;
  // Type conformance and activation rules; null: a type conforms only to
  // itself, and activation rules are evaluated over that.
  TypeService* types = nullptr;
  // The daemon's environment (DRTEST_SDK); null: the process environment.
  EnvironmentLookup getenv;
  // The version of the record of the plug-in registered as `uuid`; none when
  // it has none or no record can be made. Null: only a record's own UUID is
  // known.
  std::function<std::optional<std::string>(const Uuid& uuid)> plugInVersion;
};

// A running instance of a plug-in, as the busy check reports it: the
// process, its bundle, and the version of the plug-in it runs as (none when
// that plug-in's record has none).
struct BusyInstance {
  pid_t pid = 0;
  std::optional<std::string> bundlePath;
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> version;
  bool operator==(const BusyInstance&) const = default;
};

class DRDPlugIn : public DRPlugInCore {
 public:
  // ---- The record ---------------------------------------------------------

  // The record of `entry`, or empty when the entry lacks its bundle path or
  // information dictionary, the base record refuses it, or diagnose refuses
  // it (logged).
  static std::shared_ptr<DRDPlugIn> initWithRGData(const RegistryEntryPtr& entry,
                                                   const PlugInServices& services = {});

  // What a form carries under "extensions" (resource name → token, issued
  // afresh): absent unless the plug-in dictionary declares "Shared".
  Value formExtensions() const;
  // Adds formExtensions() to `form` when there are any.
  void augmentForm(Dictionary& form) const;
  // Read-only sandbox tokens for the named resources of the bundle ("." is
  // the bundle itself), keyed by the names as given; resources whose token
  // fails are logged and left out. `resources`: a string or an array of them.
  Value issueResourceExtensions(const Value& resources) const;

  // The registry's entitlements dictionary (empty when none).
  Value entitlements() const;
  // Absent when the plug-in does not have the entitlement.
  Value valueForEntitlement(std::string_view name) const;
  // Present and not equal to the number 0 (so a string, even "NO", is held).
  bool hasEntitlement(std::string_view name) const;
  // The key of this plug-in's annotations: the "replace-plugin" entitlement
  // when it is a string, else the identifier ("" when there is none).
  std::string annotationKey() const;

  // The base checks, then: data plug-ins and "Effecta" plug-ins are
  // acceptable; every other plug-in must hold the sandbox entitlement.
  Status diagnose() override;

  // ---- Match rules (match_rules.cc) ---------------------------------------
  // Pure reads; malformed rules or patterns of any type never match, and a
  // "?" pattern without a known type operator is logged.

  // True when `rules` is absent, or a dictionary every key of which matches.
  bool match(const Value& rules) const;
  // One rule: the plug-in's value for `key` against `pattern` (any type).
  bool matchKeyPattern(std::string_view key, const Value& pattern) const;
  // `value` against a pattern string or any of an array of pattern strings.
  bool matchValuePatterns(const Value& value, const Value& patterns) const;
  // A string value against one value pattern ("<=1.2", "?UT-IS:x", ...).
  bool matchValuePattern(std::string_view value, std::string_view pattern) const;
  // The plug-in's value as an activation rule against a host's items.
  bool matchDictionaryPattern(const Value& value, const Value& pattern) const;
  // The plug-in's value that a rule with `key` is evaluated against (a copy;
  // absent when it has none).
  Value ruleValue(std::string_view key) const;

  // ---- Authorization and activation (authorization.cc) --------------------

  // Nothing when `client` may use the plug-in, else the reason.
  std::optional<std::string> allowForClient(const PlugInClient& client) const;
  // Makes the plug-in's service available to the process `pid`. OK, or an
  // error (code 4) after a system-log line.
  Status enableForPid(pid_t pid) const;
  // The first running instance of this plug-in (same bundle identifier, and
  // a plug-in of the same version or of none), or nothing; also nothing when
  // instances cannot be listed (logged).
  std::optional<BusyInstance> checkBusy() const;

  // ---- Accessors -----------------------------------------------------------

  const RegistryEntryPtr& rgproxy() const { return rgproxy_; }
  // REQUIRES: during construction only; the record is read-only afterwards.
  void setRgproxy(RegistryEntryPtr entry) { rgproxy_ = std::move(entry); }

  // An empty record; initWithRGData is the way to make a usable one.
  DRDPlugIn() = default;
  explicit DRDPlugIn(PlugInServices services) : services_(std::move(services)) {}

 private:
  ServiceManager* serviceManager() const;
  // The plug-in's value for a rule key, absent when it has none. The answer
  // lies inside `holder`, which keeps it alive: rules are evaluated against
  // every installed plug-in, so the value is not copied out.
  const Value& valueForRuleKey(std::string_view key, Value& holder) const;
  // Whether the type `type` conforms to `to` (the platform's type data).
  bool typeConformsTo(std::string_view type, std::string_view to) const;

  RegistryEntryPtr rgproxy_;
  PlugInServices services_;
};

using DRDPlugInPtr = std::shared_ptr<DRDPlugIn>;

}  // namespace dr
