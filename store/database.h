// DRDatabase: the daemon's one view of the installed plug-ins.
//
// The registry is the store of record; the database turns its entries into
// DRDPlugIn records, caches every record it built by UUID for the life of the
// process (one record per UUID, shared by all callers), registers and
// unregisters bundles, follows the registry's install and uninstall events,
// and fronts the annotation store. The cache and the store are touched only
// on the "DRDatabase" serial queue; lookups enter it synchronously, one entry
// at a time, and registry calls that may be slow are made off it.
//
// Held by std::shared_ptr (the registry holds its observer weakly); the
// delegate is held weakly. Failures are answered (none, or a failed Status),
// with the system-log lines the daemon defines; nothing throws.
#pragma once

#include <atomic>
#include <cstring>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "core/queue.h"
#include "core/status.h"
#include "core/value.h"
#include "platform/notifications.h"
#include "platform/usage_reports.h"
#include "plugin/plugin.h"
#include "plugin/plugin_set.h"
#include "registry/registry.h"
#include "store/annotation_store.h"

namespace dr {

// Told which plug-ins were uninstalled (registry entries, not records).
class DRDatabaseDelegate {
 public:
  virtual ~DRDatabaseDelegate() = default;
  virtual void removedPlugIns(const RegistryEntries& entries) = 0;
};

struct DatabaseOptions {
  // The registry; required, and must outlive the database.
  Registry* registry = nullptr;
  // Where annotation changes are posted; null: nothing is posted.
  NotificationCenter* notifications = nullptr;
  // Install, uninstall and election reports; null: none are sent.
  UsageReports* usageReports = nullptr;
  // The services records are built with.
  PlugInServices plugInServices;
  // The annotation store's options (its usage reports are this one's).
  AnnotationStoreOptions annotationStore;
};

class DRDatabase : public RegistryObserver, public std::enable_shared_from_this<DRDatabase> {
 public:
  static constexpr const char* kAnnotationChangeNotification =
      "com.corvel.dromon.annotation-change";

  // The database over options.registry, with the annotation file at `path`
  // (none: the default location), subscribed to the registry's events.
  // REQUIRES: options.registry is set.
  static std::shared_ptr<DRDatabase> initWithDatabase(const std::optional<std::string>& path,
                                                      DatabaseOptions options);
  ~DRDatabase() override;

  // The record of `entry`: the cached one, else a new one (none when the
  // entry cannot make one; nothing is cached then, so the next lookup tries
  // again). Enters the queue.
  DRDPlugInPtr plugInForProxy(const RegistryEntryPtr& entry);
  // REQUIRES: on the "DRDatabase" queue.
  DRDPlugInPtr createPlugInForProxy(const RegistryEntryPtr& entry);
  // Elects the plug-in unless the user already chose. REQUIRES: on the queue.
  void autoElect(const DRDPlugIn& record);

  // Every installed plug-in that makes a record: the records of
  // installedPlugIns, unfiltered (discovery applies the host's rules).
  std::vector<DRDPlugInPtr> findPlugIns();
  // The same records, in the same order, as a set with rule indexes. While
  // neither the registry nor the cache changes, every call answers the one
  // set, so its indexes are built once and the registry's entries are not
  // listed again. The registry is known to change when addPlugIn or
  // removePlugIn returns (so a caller that registers and then discovers sees
  // its change) and when the registry's events arrive, which covers a change
  // made to the registry directly. An entry without a cached record is built
  // (or tried again) as findPlugIns does, and such a set is not kept.
  std::shared_ptr<const PlugInSet> installedPlugIns();
  // The plug-in named `uuid`, or none (logged).
  DRDPlugInPtr findPlugIn(const Uuid& uuid);
  // The plug-in whose bundle is at `url`, or none (logged).
  DRDPlugInPtr findPlugInAtPath(const std::string& url);
  // The plug-ins of the application at `url`; none when it has none.
  std::optional<std::vector<DRDPlugInPtr>> plugInsWithinApplication(const std::string& url);

  // Registers / unregisters the bundle at `url`; an error of code
  // message::kErrorRegistration when the registry refuses (its reason is
  // logged). The registry's events then update the cache.
  Status addPlugIn(const std::string& url);
  Status removePlugIn(const std::string& url);

  Value annotationForPlugIn(const DRDPlugIn& record);
  // Stores (merges) or erases (absent) the annotation, then posts the change
  // notification, every time.
  void setAnnotationForPlugIn(const Value& annotation, const DRDPlugIn& record);

  // Registry events.
  void pluginsDidInstall(const RegistryEntries& entries) override;
  void pluginsDidUninstall(const RegistryEntries& entries) override;

  void setDelegate(std::weak_ptr<DRDatabaseDelegate> delegate);
  // The cached record of `uuid`, without building one. Enters the queue.
  DRDPlugInPtr cachedPlugIn(const Uuid& uuid);

 protected:
  DRDatabase(const std::optional<std::string>& path, DatabaseOptions options);
  // Subscribes to the registry; the factories call it once the object is
  // owned by a shared_ptr.
  void subscribe();

 private:
  DatabaseOptions options_;
  std::unique_ptr<DRDAnnotationStore> annotations_;  // on sync_ only
  // Random UUIDs: their first eight bytes are as good a hash as any.
  struct UuidHash {
    size_t operator()(const Uuid& u) const {
      size_t h;
      std::memcpy(&h, u.bytes.data(), sizeof h);
      return h;
    }
  };
  // Every discovery looks up each installed plug-in here, so hashed.
  std::unordered_map<Uuid, DRDPlugInPtr, UuidHash> cache_;  // on sync_ only
  // Raised at every change of cache_, so a set made from it is known stale.
  uint64_t cacheGeneration_ = 0;  // on sync_ only
  // Raised after every change the database makes to the registry and at
  // each of the registry's events.
  std::atomic<uint64_t> registryChanges_{0};
  void registryChanged();
  // The last set installedPlugIns made wholly from cached records, with the
  // registry changes and the cache generation it was made from; on sync_.
  std::shared_ptr<const PlugInSet> installed_;
  uint64_t installedChanges_ = 0;
  uint64_t installedGeneration_ = 0;
  std::mutex delegateMu_;
  std::weak_ptr<DRDatabaseDelegate> delegate_;  // guarded by delegateMu_
  SerialQueue sync_{"DRDatabase"};
};

}  // namespace dr
