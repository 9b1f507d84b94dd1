#include "store/database.h"

#include "core/format.h"
#include "core/log.h"
#include "plugin/plugin_keys.h"
#include "store/usage_report.h"
#include "wire/protocol.h"

namespace dr {
namespace {

constexpr const char* kAutoElectEntitlement = "com.corvel.developer.auto-elect-plugin";

}  // namespace

std::shared_ptr<DRDatabase> DRDatabase::initWithDatabase(const std::optional<std::string>& path,
                                                         DatabaseOptions options) {
  std::shared_ptr<DRDatabase> db(new DRDatabase(path, std::move(options)));
  db->subscribe();
  return db;
}

DRDatabase::DRDatabase(const std::optional<std::string>& path, DatabaseOptions options)
    : options_(std::move(options)) {
  options_.annotationStore.usageReports = options_.usageReports;
  annotations_ = DRDAnnotationStore::initWithDatabase(path, options_.annotationStore);
}

// The registry holds its observers weakly, so a database that is gone is
// never called; nothing is withdrawn here, since the registry may be gone too.
DRDatabase::~DRDatabase() = default;

void DRDatabase::subscribe() {
  // A record asks for the versions of the other plug-ins of its bundle (the
  // busy check); the database may be gone by then, its records not.
  options_.plugInServices.plugInVersion =
      [weak = weak_from_this()](const Uuid& uuid) -> std::optional<std::string> {
    std::shared_ptr<DRDatabase> db = weak.lock();
    if (!db) return std::nullopt;
    DRDPlugInPtr record = db->cachedPlugIn(uuid);
    if (!record) {
      if (RegistryEntryPtr entry = db->options_.registry->entryForUuid(uuid)) {
        record = db->plugInForProxy(entry);
      }
    }
    return record ? record->version() : std::nullopt;
  };
  options_.registry->addObserver(weak_from_this());
}

void DRDatabase::setDelegate(std::weak_ptr<DRDatabaseDelegate> delegate) {
  std::lock_guard<std::mutex> lock(delegateMu_);
  delegate_ = std::move(delegate);
}

DRDPlugInPtr DRDatabase::plugInForProxy(const RegistryEntryPtr& entry) {
  return sync_.syncResult([&]() -> DRDPlugInPtr {
    auto it = cache_.find(entry->uuid());
    return it != cache_.end() ? it->second : createPlugInForProxy(entry);
  });
}

DRDPlugInPtr DRDatabase::createPlugInForProxy(const RegistryEntryPtr& entry) {
  sync_.assertCurrent("createPlugInForProxy");
  DRDPlugInPtr record = DRDPlugIn::initWithRGData(entry, options_.plugInServices);
  if (!record) return nullptr;
  if (record->hasEntitlement(kAutoElectEntitlement)) autoElect(*record);
  cache_[*record->uuid()] = record;
  ++cacheGeneration_;
  return record;
}

void DRDatabase::autoElect(const DRDPlugIn& record) {
  sync_.assertCurrent("autoElect");
  Value annotation = annotations_->annotationForPlugIn(record);
  if (!annotation.isDictionary()) annotation = Value::EmptyDictionary();
  const Value& election = annotation[DRDAnnotationStore::kElectionKey];
  if (election.isAbsent() || election.intValue() == 0) {
    // Straight to the store: the database's own setter would enter the queue
    // again. So an automatic election posts no change notification.
    annotations_->setAnnotationForPlugIn(
        annotation.changing(DRDAnnotationStore::kElectionKey, Value(1)), record);
  }
}

std::vector<DRDPlugInPtr> DRDatabase::findPlugIns() { return installedPlugIns()->records(); }

std::shared_ptr<const PlugInSet> DRDatabase::installedPlugIns() {
  // Read before the entries: a change committed after this read leaves the
  // set made below stale.
  const uint64_t changes = registryChanges_.load(std::memory_order_acquire);
  std::shared_ptr<const PlugInSet> unchanged;
  sync_.sync([&] {
    if (installed_ && installedChanges_ == changes && installedGeneration_ == cacheGeneration_) {
      unchanged = installed_;
    }
  });
  if (unchanged) return unchanged;

  const RegistryEntries entries = options_.registry->allEntries();
  // Once the records are built (after the first discovery) every lookup is
  // a cache hit: they are all taken in one entry into the queue rather than
  // one entry per plug-in. Records still to be built are made one entry at
  // a time, as plugInForProxy does.
  std::vector<DRDPlugInPtr> cached(entries.size());
  uint64_t generation = 0;
  sync_.sync([&] {
    generation = cacheGeneration_;
    for (size_t i = 0; i < entries.size(); ++i) {
      auto it = cache_.find(entries[i]->uuid());
      if (it != cache_.end()) cached[i] = it->second;
    }
  });
  std::vector<DRDPlugInPtr> result;
  result.reserve(entries.size());
  bool allCached = true;
  for (size_t i = 0; i < entries.size(); ++i) {
    if (entries[i]->url().empty()) continue;
    allCached = allCached && cached[i] != nullptr;
    DRDPlugInPtr record = cached[i] ? std::move(cached[i]) : plugInForProxy(entries[i]);
    if (record) result.push_back(std::move(record));
  }
  auto set = std::make_shared<const PlugInSet>(std::move(result));
  // A set with a record built just now, or with an entry that made none, is
  // not kept: the next call builds (or tries) again, as the cache would.
  if (allCached) {
    sync_.sync([&] {
      installed_ = set;
      installedChanges_ = changes;
      installedGeneration_ = generation;
    });
  }
  return set;
}

DRDPlugInPtr DRDatabase::findPlugIn(const Uuid& uuid) {
  return sync_.syncResult([&]() -> DRDPlugInPtr {
    auto it = cache_.find(uuid);
    if (it != cache_.end()) return it->second;
    if (RegistryEntryPtr entry = options_.registry->entryForUuid(uuid)) {
      return createPlugInForProxy(entry);
    }
    SystemLog("Registrar cannot find plug-in with UUID:%@", uuid.string());
    return nullptr;
  });
}

DRDPlugInPtr DRDatabase::findPlugInAtPath(const std::string& url) {
  if (RegistryEntryPtr entry = options_.registry->entryForUrl(url)) {
    return findPlugIn(entry->uuid());
  }
  SystemLog("Registrar cannot find plug-in at path:%@", url);
  return nullptr;
}

std::optional<std::vector<DRDPlugInPtr>> DRDatabase::plugInsWithinApplication(
    const std::string& url) {
  RegistryEntries entries = options_.registry->entriesWithinApplication(url);
  if (entries.empty()) return std::nullopt;
  std::vector<DRDPlugInPtr> result;
  result.reserve(entries.size());
  for (const RegistryEntryPtr& entry : entries) {
    if (DRDPlugInPtr record = plugInForProxy(entry)) result.push_back(std::move(record));
  }
  return result;
}

void DRDatabase::registryChanged() { registryChanges_.fetch_add(1, std::memory_order_release); }

Status DRDatabase::addPlugIn(const std::string& url) {
  // Whatever the outcome, the registry may have changed by now; its events
  // come later, while the caller may discover at once.
  const Status status = options_.registry->registerBundle(url);
  registryChanged();
  if (status.ok()) return status;
  // The reply names only the path; the registry's reason (a broken bundle,
  // a database held by another process, a full disk) goes to the log.
  SystemLog("%@", status);
  return DRMakeError(message::kErrorRegistration, "Registrar failed to register the plug-in");
}

Status DRDatabase::removePlugIn(const std::string& url) {
  const Status status = options_.registry->unregisterBundle(url);
  registryChanged();
  if (status.ok()) return status;
  SystemLog("%@", status);
  return DRMakeError(message::kErrorRegistration, "Registrar failed to deregister the plug-in");
}

Value DRDatabase::annotationForPlugIn(const DRDPlugIn& record) {
  return sync_.syncResult([&] { return annotations_->annotationForPlugIn(record); });
}

void DRDatabase::setAnnotationForPlugIn(const Value& annotation, const DRDPlugIn& record) {
  sync_.sync([&] { annotations_->setAnnotationForPlugIn(annotation, record); });
  if (options_.notifications) {
    if (Status s = options_.notifications->post(kAnnotationChangeNotification); !s.ok()) {
      SystemLog("unable to post %@: %@", kAnnotationChangeNotification, s);
    }
  }
}

DRDPlugInPtr DRDatabase::cachedPlugIn(const Uuid& uuid) {
  return sync_.syncResult([&]() -> DRDPlugInPtr {
    auto it = cache_.find(uuid);
    return it == cache_.end() ? nullptr : it->second;
  });
}

void DRDatabase::pluginsDidInstall(const RegistryEntries& entries) {
  registryChanged();
  for (const RegistryEntryPtr& entry : entries) {
    SystemLog("INSTALLED:%@ %@(%@) %@ %@", entry->bundleIdentifier(), entry->plugInIdentifier(),
              entry->bundleVersion(), Value(entry->uuid()), entry->url());
    if (IsDevelopmentBuildPath(entry->url())) continue;
    sendUsageReport(options_.usageReports, Value(entry->plugInIdentifier()),
                    entry->infoDictionary()[kBNBundleVersionKey],
                    entry->plugInDictionary()[kUXExtensionPointIdentifierKey], kUsageInstalled);
  }
}

void DRDatabase::pluginsDidUninstall(const RegistryEntries& entries) {
  registryChanged();
  sync_.sync([&] {
    for (const RegistryEntryPtr& entry : entries) {
      auto it = cache_.find(entry->uuid());
      if (it != cache_.end()) {
        const DRDPlugIn& record = *it->second;
        if (!IsDevelopmentBuildPath(record.path().value_or(""))) {
          sendUsageReport(options_.usageReports, Value(record.identifier()),
                          Value(record.version()), record.attributes()[kUXExtensionPointNameKey],
                          kUsageUninstalled);
        }
      }
      SystemLog("UNINSTALLED:%@ %@(%@) %@ %@", entry->bundleIdentifier(), entry->plugInIdentifier(),
                entry->bundleVersion(), entry->uuid().string(), entry->url());
      if (it != cache_.end()) {
        cache_.erase(it);
        ++cacheGeneration_;
        installed_.reset();  // its records stay alive no longer than needed
      }
    }
  });
  std::shared_ptr<DRDatabaseDelegate> delegate;
  {
    std::lock_guard<std::mutex> lock(delegateMu_);
    delegate = delegate_.lock();
  }
  if (delegate) delegate->removedPlugIns(entries);
}

}  // namespace dr
