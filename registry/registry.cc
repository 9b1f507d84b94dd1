// The registry on SQLite.
//
// The database file is the store of record; an in-memory index of every entry,
// loaded at open, answers the lookups. Loading reads columns and decodes each
// bundle's parsed copy; a bundle without a sound copy keeps its bytes, which
// are parsed when its entries' dictionaries are first used. The registry
// assumes it is the only writer of its file (the daemon owns it); a change
// made by another process is seen at the next open.
//
// Install folders: each bundle row records the install folder it came from
// and the stamp of its files; the bundles the user removed from an install
// folder are kept apart (removed_), so that they are not registered again
// while their files stay as they were.
//
// Threads: writes (register, unregister) are serialized by writeMu_, which is
// held across the transaction, the index update and the queuing of the
// events, so events leave in commit order. Lookups take indexMu_ shared and
// see the index before or after a change, never half of one. Events run on
// the "registry-events" queue's thread.
#include <algorithm>
#include <chrono>
#include <map>
#include <mutex>
#include <shared_mutex>

#include "core/format.h"
#include "core/queue.h"
#include "registry/registry.h"
#include "registry/registry_file.h"
#include "registry/scan.h"

namespace dr {
namespace {

using registry_internal::BundleRow;
using registry_internal::CanonicalPath;
using registry_internal::LexicalPath;

// The subscribers, shared with the queued deliveries so that a delivery never
// depends on the registry object itself.
struct ObserverList {
  struct Subscriber {
    const RegistryObserver* id;  // for removal, never dereferenced
    std::weak_ptr<RegistryObserver> observer;
  };
  std::mutex mu;
  std::vector<Subscriber> list;  // guarded by mu

  std::vector<std::shared_ptr<RegistryObserver>> live() {
    std::vector<std::shared_ptr<RegistryObserver>> out;
    std::lock_guard<std::mutex> lock(mu);
    std::erase_if(list, [](const Subscriber& s) { return s.observer.expired(); });
    for (const Subscriber& s : list) {
      if (auto o = s.observer.lock()) out.push_back(std::move(o));
    }
    return out;
  }
};

class SqliteRegistry final : public Registry {
 public:
  SqliteRegistry(const RegistryOptions& options, std::vector<std::string> systemRoots,
                 std::unique_ptr<registry_internal::RegistryFile> db)
      : fs_(options.fileSystem ? options.fileSystem : FileSystem::Default()),
        systemRoots_(std::move(systemRoots)),
        db_(std::move(db)) {
    for (const std::string& folder : options.installFolders) {
      if (std::string normal = LexicalPath(folder); !normal.empty()) {
        installFolders_.push_back(std::move(normal));
      }
    }
  }

  Status load() {
    auto rows = db_->loadAll();
    if (!rows.ok()) return rows.status();
    auto removed = db_->loadRemoved();
    if (!removed.ok()) return removed.status();
    std::unique_lock<std::shared_mutex> lock(indexMu_);
    for (BundleRow& row : *rows) insertIntoIndex(std::move(row));
    for (RemovedBundle& r : *removed) {
      const std::string path = r.path;
      removed_[path] = std::move(r);
    }
    return Status::OK();
  }

  void addObserver(std::weak_ptr<RegistryObserver> observer) override {
    const RegistryObserver* id = observer.lock().get();
    if (id == nullptr) return;
    std::lock_guard<std::mutex> lock(observers_->mu);
    observers_->list.push_back({id, std::move(observer)});
  }

  void removeObserver(const RegistryObserver* observer) override {
    std::lock_guard<std::mutex> lock(observers_->mu);
    std::erase_if(observers_->list,
                  [&](const ObserverList::Subscriber& s) { return s.id == observer; });
  }

  RegistryEntries allEntries() const override {
    std::shared_lock<std::shared_mutex> lock(indexMu_);
    RegistryEntries out;
    out.reserve(byUuid_.size());
    for (const auto& [id, bundle] : bundles_) {
      out.insert(out.end(), bundle.entries.begin(), bundle.entries.end());
    }
    return out;
  }

  RegistryEntryPtr entryForUuid(const Uuid& uuid) const override {
    std::shared_lock<std::shared_mutex> lock(indexMu_);
    auto it = byUuid_.find(uuid);
    return it == byUuid_.end() ? nullptr : it->second;
  }

  RegistryEntries entriesForUrl(const std::string& url) const override {
    const std::vector<std::string> keys = KeysOf(url);
    std::shared_lock<std::shared_mutex> lock(indexMu_);
    if (const Bundle* bundle = findBundle(keys)) return bundle->entries;
    return {};
  }

  RegistryEntryPtr entryForUrl(const std::string& url) const override {
    RegistryEntries entries = entriesForUrl(url);
    return entries.empty() ? nullptr : entries.front();
  }

  RegistryEntries entriesWithinApplication(const std::string& appUrl) const override {
    const std::vector<std::string> keys = KeysOf(appUrl);
    RegistryEntries out;
    std::shared_lock<std::shared_mutex> lock(indexMu_);
    for (const auto& [id, bundle] : bundles_) {
      const auto& app = bundle.entries.front()->containingApplication();
      if (app && std::find(keys.begin(), keys.end(), app->url) != keys.end()) {
        out.insert(out.end(), bundle.entries.begin(), bundle.entries.end());
      }
    }
    return out;
  }

  Status registerBundle(const std::string& url) override {
    // The stamp is taken before the files are read: a write in between
    // leaves a stamp that no longer matches, so the files are read again.
    const std::string stamp = BundleFileStamp(CanonicalPath(url).value_or(url));
    // The bundle is read before taking the write lock: a slow disk holds up
    // no other registration.
    auto scanned = registry_internal::ScanBundle(url, systemRoots_, fs_);
    if (!scanned.ok()) return scanned.status();
    std::optional<std::string> origin = installFolderOf(scanned->path);
    auto registered = registerScanned(url, std::move(*scanned), std::move(origin), stamp, true);
    return registered.status();
  }

  Result<InstallOutcome> registerInstalledBundle(const std::string& path,
                                                 const std::string& installFolder,
                                                 const std::string& stamp) override {
    if (!stamp.empty()) {
      // Unchanged files cost these two stat calls and no read.
      std::shared_lock<std::shared_mutex> lock(indexMu_);
      if (auto it = byPath_.find(path); it != byPath_.end()) {
        const Bundle& b = bundles_.at(it->second);
        if (b.stamp == stamp && b.origin == installFolder) return InstallOutcome::kUnchanged;
      }
      if (auto it = removed_.find(path); it != removed_.end() && it->second.stamp == stamp) {
        return InstallOutcome::kRemovedByUser;
      }
    }
    auto scanned = registry_internal::ScanBundle(path, systemRoots_, fs_);
    if (!scanned.ok()) return scanned.error();
    return registerScanned(path, std::move(*scanned), installFolder, stamp, false);
  }

  Status unregisterInstalledBundle(const std::string& path) override {
    std::lock_guard<std::mutex> write(writeMu_);
    auto it = byPath_.find(path);
    const bool installed = it != byPath_.end() && bundles_.at(it->second).origin.has_value();
    const bool removed = removed_.count(path) != 0;
    if (!installed && !removed) return Status::OK();
    if (Status s = db_->commit(installed ? path : std::string(), nullptr,
                               {removed ? path : std::string(), nullptr});
        !s.ok()) {
      return Error(s.error().domain(), s.error().code(),
                   Format("cannot unregister \"%@\": %@", path, s.error().localizedDescription()));
    }
    RegistryEntries gone;
    {
      std::unique_lock<std::shared_mutex> lock(indexMu_);
      if (installed) gone = eraseFromIndex(path);
      removed_.erase(path);
    }
    post(false, std::move(gone));
    return Status::OK();
  }

  std::vector<InstalledBundle> installedBundles() const override {
    std::shared_lock<std::shared_mutex> lock(indexMu_);
    std::vector<InstalledBundle> out;
    for (const auto& [id, bundle] : bundles_) {
      if (bundle.origin) out.push_back({bundle.path, *bundle.origin, bundle.stamp, false});
    }
    for (const auto& [path, r] : removed_) out.push_back({path, r.installFolder, r.stamp, true});
    return out;
  }

  std::vector<RemovedBundle> removedBundles() const override {
    std::shared_lock<std::shared_mutex> lock(indexMu_);
    std::vector<RemovedBundle> out;
    for (const auto& [path, r] : removed_) out.push_back(r);
    return out;
  }

  Status unregisterBundle(const std::string& url) override {
    const std::vector<std::string> keys = KeysOf(url);
    std::lock_guard<std::mutex> write(writeMu_);
    const Bundle* bundle = findBundle(keys);
    if (bundle == nullptr) {
      return Error(kRegistryErrorDomain, kRegistryNotRegistered,
                   Format("cannot unregister \"%@\": no plug-in is registered there", url));
    }
    const std::string path = bundle->path;
    // An installed bundle stays away until its files change or it leaves
    // its install folder.
    std::optional<RemovedBundle> mark;
    if (bundle->origin) {
      mark = RemovedBundle{path, *bundle->origin, BundleFileStamp(path), {}, Now()};
      if (mark->stamp.empty()) mark->stamp = bundle->stamp;
      for (const auto& entry : bundle->entries) {
        mark->plugInIdentifiers.push_back(entry->plugInIdentifier());
      }
    }
    if (Status s = db_->commit(path, nullptr, {std::string(), mark ? &*mark : nullptr}); !s.ok()) {
      return Error(s.error().domain(), s.error().code(),
                   Format("cannot unregister \"%@\": %@", url, s.error().localizedDescription()));
    }
    RegistryEntries removed;
    {
      std::unique_lock<std::shared_mutex> lock(indexMu_);
      removed = eraseFromIndex(path);
      if (mark) removed_[path] = std::move(*mark);
    }
    post(false, std::move(removed));
    return Status::OK();
  }

 private:
  struct Bundle {
    std::string path;
    std::string contentHash;
    RegistryEntries entries;  // never empty; by identifier
    std::optional<std::string> origin;
    std::string stamp;
  };

  // Stores a scanned bundle with `origin` and `stamp` (`keepOrigin`: an
  // origin it already has stays when `origin` is none), forgetting a
  // removal by the user; replaces its entries when the files changed.
  Result<InstallOutcome> registerScanned(const std::string& url,
                                         registry_internal::ScannedBundle scanned,
                                         std::optional<std::string> origin,
                                         const std::string& stamp, bool keepOrigin) {
    std::lock_guard<std::mutex> write(writeMu_);
    // Only writers change the index, and they hold writeMu_: reading it here
    // needs no other lock.
    const std::string path = scanned.path;
    const bool wasRemoved = removed_.count(path) != 0;
    RegistryEntries old;
    if (auto it = byPath_.find(path); it != byPath_.end()) {
      Bundle& existing = bundles_.at(it->second);
      if (!origin && keepOrigin) origin = existing.origin;
      if (existing.contentHash == scanned.contentHash && existing.origin == origin) {
        if (existing.stamp == stamp && !wasRemoved) return InstallOutcome::kUnchanged;
        if (Status s = db_->updateOrigin(path, origin, stamp); !s.ok()) {
          return Error(s.error().domain(), s.error().code(),
                       Format("cannot register \"%@\": %@", url, s.error().localizedDescription()));
        }
        std::unique_lock<std::shared_mutex> lock(indexMu_);
        existing.stamp = stamp;
        removed_.erase(path);
        return InstallOutcome::kUnchanged;
      }
      old = existing.entries;
    }
    BundleRow row;
    row.bundle = std::move(scanned);
    row.registered = Now();
    row.origin = std::move(origin);
    row.stamp = stamp;
    for (size_t i = 0; i < row.bundle.plugIns.size(); ++i) row.uuids.push_back(Uuid::random());
    if (Status s = db_->commit(old.empty() ? std::string() : path, &row,
                               {wasRemoved ? path : std::string(), nullptr});
        !s.ok()) {
      return Error(s.error().domain(), s.error().code(),
                   Format("cannot register \"%@\": %@", url, s.error().localizedDescription()));
    }
    RegistryEntries installed;
    {
      std::unique_lock<std::shared_mutex> lock(indexMu_);
      if (!old.empty()) eraseFromIndex(path);
      installed = insertIntoIndex(std::move(row));
      removed_.erase(path);
    }
    if (!old.empty()) post(false, std::move(old));
    post(true, std::move(installed));
    return InstallOutcome::kRegistered;
  }

  // The install folder in which canonical `path` is an installed place:
  // directly inside it, or a "*.appex" directly in Contents/PlugIns/ of a
  // "*.app" directly inside it; nothing when none.
  std::optional<std::string> installFolderOf(const std::string& path) const {
    for (const std::string& folder : installFolders_) {
      const std::string root = CanonicalPath(folder).value_or(folder);
      if (!registry_internal::LiesUnder(path, root) || path.size() == root.size()) continue;
      std::vector<std::string_view> parts;
      std::string_view rest(path);
      rest.remove_prefix(root == "/" ? 1 : root.size() + 1);
      for (size_t slash; (slash = rest.find('/')) != std::string_view::npos;) {
        parts.push_back(rest.substr(0, slash));
        rest.remove_prefix(slash + 1);
      }
      parts.push_back(rest);
      if (parts.size() == 1 && parts[0].ends_with(".appex")) {
        return folder;
      }
      if (parts.size() == 4 && parts[0].ends_with(".app") && parts[1] == "Contents" &&
          parts[2] == "PlugIns" && parts[3].ends_with(".appex")) {
        return folder;
      }
    }
    return std::nullopt;
  }

  static Date Now() {
    using namespace std::chrono;
    return Date{duration<double>(system_clock::now().time_since_epoch()).count()};
  }

  // The index keys a caller's path may stand for: the path with links
  // resolved, and the path as written (for a bundle that is gone from disk).
  static std::vector<std::string> KeysOf(const std::string& url) {
    std::vector<std::string> keys;
    if (url.empty() || url.front() != '/') return keys;
    if (auto canonical = CanonicalPath(url)) keys.push_back(*canonical);
    keys.push_back(LexicalPath(url));
    return keys;
  }

  // REQUIRES: indexMu_ or writeMu_ held.
  const Bundle* findBundle(const std::vector<std::string>& keys) const {
    for (const std::string& key : keys) {
      if (auto it = byPath_.find(key); it != byPath_.end()) return &bundles_.at(it->second);
    }
    return nullptr;
  }

  // REQUIRES: indexMu_ held exclusively and writeMu_ held (or at load).
  RegistryEntries insertIntoIndex(BundleRow row) {
    registry_internal::ScannedBundle& b = row.bundle;
    auto files = b.parsed ? std::make_shared<const RegistryBundleFiles>(
                                RegistryBundleFiles::Parsed{}, std::move(b.parsed->info),
                                std::move(b.parsed->entitlements))
                          : std::make_shared<const RegistryBundleFiles>(
                                std::move(b.infoBytes), std::move(b.entitlementsBytes));
    Bundle bundle{b.path, b.contentHash, {}, row.origin, row.stamp};
    for (size_t i = 0; i < b.plugIns.size(); ++i) {
      RegistryEntry::Fields f;
      f.uuid = row.uuids[i];
      f.url = b.path;
      f.plugInIdentifier = b.plugIns[i].identifier;
      f.multiple = b.plugIns[i].multiple;
      f.bundleIdentifier = b.bundleIdentifier;
      f.bundleVersion = b.bundleVersion;
      f.registrationDate = row.registered;
      f.onSystemVolume = b.onSystemVolume;
      f.containingApplication = b.containingApplication;
      f.displayName = b.displayName;
      f.shortName = b.shortName;
      f.installFolder = row.origin;
      auto entry = std::make_shared<const RegistryEntry>(std::move(f), files);
      byUuid_[entry->uuid()] = entry;
      bundle.entries.push_back(std::move(entry));
    }
    RegistryEntries entries = bundle.entries;
    byPath_[bundle.path] = row.id;
    bundles_[row.id] = std::move(bundle);
    return entries;
  }

  // REQUIRES: indexMu_ held exclusively and writeMu_ held.
  RegistryEntries eraseFromIndex(const std::string& path) {
    auto it = byPath_.find(path);
    if (it == byPath_.end()) return {};
    auto node = bundles_.extract(it->second);
    byPath_.erase(it);
    for (const auto& entry : node.mapped().entries) byUuid_.erase(entry->uuid());
    return std::move(node.mapped().entries);
  }

  // REQUIRES: writeMu_ held, so that events are queued in commit order.
  void post(bool install, RegistryEntries entries) {
    if (entries.empty()) return;
    events_.async([observers = observers_, install, entries = std::move(entries)] {
      for (const auto& o : observers->live()) {
        if (install) {
          o->pluginsDidInstall(entries);
        } else {
          o->pluginsDidUninstall(entries);
        }
      }
    });
  }

  FileSystem* const fs_;
  const std::vector<std::string> systemRoots_;
  std::mutex writeMu_;
  const std::unique_ptr<registry_internal::RegistryFile> db_;  // guarded by writeMu_
  mutable std::shared_mutex indexMu_;
  std::map<int64_t, Bundle> bundles_;      // by database id = registration order
  std::map<std::string, int64_t> byPath_;  // canonical bundle path -> id
  std::map<Uuid, RegistryEntryPtr> byUuid_;
  std::map<std::string, RemovedBundle> removed_;  // by canonical path
  std::vector<std::string> installFolders_;       // lexically normal
  const std::shared_ptr<ObserverList> observers_ = std::make_shared<ObserverList>();
  // Last, so that it is destroyed first: pending events are delivered before
  // the rest of the registry goes.
  SerialQueue events_{"registry-events"};
};

// The system roots as the canonical paths bundles are compared with.
std::vector<std::string> NormalizedRoots(const std::vector<std::string>& roots) {
  std::vector<std::string> out;
  for (const std::string& root : roots) {
    if (root.empty() || root.front() != '/') continue;
    out.push_back(CanonicalPath(root).value_or(LexicalPath(root)));
  }
  return out;
}

}  // namespace

Result<std::unique_ptr<Registry>> Registry::Open(const RegistryOptions& options) {
  FileSystem* fs = options.fileSystem ? options.fileSystem : FileSystem::Default();
  auto db = registry_internal::RegistryFile::Open(options.databasePath, options.busyTimeout, fs);
  if (!db.ok()) return db.error();
  auto registry = std::make_unique<SqliteRegistry>(options, NormalizedRoots(options.systemRoots),
                                                   std::move(*db));
  if (Status s = registry->load(); !s.ok()) return s.error();
  return std::unique_ptr<Registry>(std::move(registry));
}

}  // namespace dr
