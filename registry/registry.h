// Registry: the store of record for installed plug-ins (one entry per plug-in,
// named by a UUID), with install and uninstall events.
// Threads: every member is safe to call from any thread; lookups run while a
// registration is under way and see either the state before it or after it.
// Entries are immutable and shared (RegistryEntryPtr) and may be read from any
// thread, also after the registry is gone. Failure: open, register and
// unregister answer a Status whose text says why; lookups never fail.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/status.h"
#include "core/value.h"
#include "platform/file_system.h"
#include "wire/drm1.h"

namespace dr {

// Errors of the registry.
inline constexpr const char* kRegistryErrorDomain = "registry";
// The bundle cannot be registered (not a folder, no or broken Info.pdoc, no
// plug-in section, ...). Nothing was stored.
inline constexpr int64_t kRegistryRefused = 1;
// Unregistering a path with no registered plug-ins.
inline constexpr int64_t kRegistryNotRegistered = 2;
// The database is held by another process and stayed so for the busy timeout.
inline constexpr int64_t kRegistryBusy = 3;
// The database file is damaged or is not a registry database. It is left as
// it was: nothing is overwritten or deleted.
inline constexpr int64_t kRegistryCorrupt = 4;
// Any other failure of the database (I/O, full disk, a newer schema, ...).
inline constexpr int64_t kRegistryStorage = 5;

// What the registry holds must be able to travel in a reply: a bundle whose
// path, dictionaries or names could not is refused (kRegistryRefused), since
// a reply carrying it could not be sent and every host's discovery would fail
// with it.
//
// How a plug-in nests in a reply, level by level (a value of scalars only is
// one level deep, as Value::depth counts): the reply is level 1, its
// "matches" level 2, each plug-in's form level 3, and what a form holds (its
// "bundleInfo", the information dictionary, and its "annotations") level 4.
// A message nests at most drm1::kMaxDepth levels, so each of these may nest
// only as deep as the levels left from where it lies.
inline constexpr size_t kFormLevelInReply = 3;
// The most levels a form may nest. A plug-in whose form would nest deeper is
// refused by diagnose, as no reply could carry it.
inline constexpr size_t kMaxFormDepth = drm1::kMaxDepth - kFormLevelInReply + 1;
// The most levels the information dictionary may nest: it lies one level
// inside the form.
inline constexpr size_t kMaxTravellingDepth = kMaxFormDepth - 1;
// Whether `text` can travel in a message: UTF-8 without NUL.
bool TextCanTravel(std::string_view text);
// Why `value` could not travel inside a plug-in's form (a string or key that
// is not UTF-8 or holds NUL, or nesting deeper than kMaxTravellingDepth), or
// nothing when it can.
std::optional<std::string> WhyCannotTravel(const Value& value);

// The application that contains a plug-in bundle: the nearest enclosing
// "*.app" folder whose Contents/PlugIns/ holds the bundle.
struct RegistryApplication {
  std::string url;  // canonical path of the application folder
  // "BNBundleDisplayName", else "BNBundleName" of the application's
  // Info.pdoc; nothing when neither is a string.
  std::optional<std::string> displayName;
  bool operator==(const RegistryApplication&) const = default;
};

// The stored files of one registered bundle, shared by all its entries:
// either their dictionaries, already parsed (at registration, or decoded from
// the database's parsed copy), or their bytes, parsed when a dictionary is
// first asked for (once, thread-safe) and then released.
class RegistryBundleFiles {
 public:
  RegistryBundleFiles(std::string infoBytes, std::optional<std::string> entitlementsBytes);
  // Dictionaries already parsed: `info` absent or a dictionary,
  // `entitlements` a dictionary.
  struct Parsed {};
  RegistryBundleFiles(Parsed, Value info, Value entitlements);

  // The information dictionary (Contents/Info.pdoc); absent when the stored
  // bytes no longer read as a dictionary.
  const Value& infoDictionary() const;
  // The entitlements (Contents/Entitlements.pdoc); an empty dictionary when
  // the bundle has none or the stored bytes no longer read as a dictionary.
  const Value& entitlements() const;

 private:
  void parse() const;

  mutable std::once_flag parsed_;
  mutable std::string infoBytes_;                         // released once parsed
  mutable std::optional<std::string> entitlementsBytes_;  // released once parsed
  mutable Value info_;
  mutable Value entitlements_;
};

// One installed plug-in as the registry records it.
class RegistryEntry {
 public:
  struct Fields {
    Uuid uuid;                     // assigned by the registry at registration
    std::string url;               // canonical path of the plug-in bundle
    std::string plugInIdentifier;  // never empty
    // True when the plug-in is one of the bundle's "Multiple" plug-ins; its
    // plug-in dictionary is then its entry there.
    bool multiple = false;
    std::optional<std::string> bundleIdentifier;  // "BNBundleIdentifier"
    std::optional<std::string> bundleVersion;     // "BNBundleVersion"
    Date registrationDate;
    bool onSystemVolume = false;
    std::optional<RegistryApplication> containingApplication;
    std::optional<std::string> displayName;  // "BNBundleDisplayName", else "BNBundleName"
    std::optional<std::string> shortName;    // "BNBundleShortName"
    // The install folder the bundle was found in (or "add"-ed from);
    // nothing for a bundle "add"-ed from anywhere else.
    std::optional<std::string> installFolder;
  };

  RegistryEntry(Fields fields, std::shared_ptr<const RegistryBundleFiles> files);

  const Uuid& uuid() const { return f_.uuid; }
  const std::string& url() const { return f_.url; }
  const std::string& plugInIdentifier() const { return f_.plugInIdentifier; }
  bool multiple() const { return f_.multiple; }
  const std::optional<std::string>& bundleIdentifier() const { return f_.bundleIdentifier; }
  const std::optional<std::string>& bundleVersion() const { return f_.bundleVersion; }
  Date registrationDate() const { return f_.registrationDate; }
  bool onSystemVolume() const { return f_.onSystemVolume; }
  const std::optional<RegistryApplication>& containingApplication() const {
    return f_.containingApplication;
  }
  const std::optional<std::string>& displayName() const { return f_.displayName; }
  const std::optional<std::string>& shortName() const { return f_.shortName; }
  const std::optional<std::string>& installFolder() const { return f_.installFolder; }

  // The bundle's information dictionary (parsed on first use).
  const Value& infoDictionary() const { return files_->infoDictionary(); }
  // The plug-in's own section of the information dictionary: the top
  // dictionary ("UXExtension", else the old-style "Dromon"), or for one of
  // several plug-ins its entry under the top dictionary's "Multiple". Absent
  // when the information dictionary is.
  const Value& plugInDictionary() const;
  // Entitlement name to value (parsed on first use); empty when none.
  const Value& entitlements() const { return files_->entitlements(); }

  // "<plug-in identifier> <uuid> at <path>", for logs.
  std::string description() const;

 private:
  const Fields f_;
  const std::shared_ptr<const RegistryBundleFiles> files_;
  mutable std::once_flag plugInOnce_;
  mutable Value plugIn_;
};

using RegistryEntryPtr = std::shared_ptr<const RegistryEntry>;
using RegistryEntries = std::vector<RegistryEntryPtr>;

// Receives the registry's events on the registry's own event thread, one at a
// time, in the order the changes were committed. Each event carries the
// entries that were installed or uninstalled together, never an empty array.
class RegistryObserver {
 public:
  virtual ~RegistryObserver() = default;
  virtual void pluginsDidInstall(const RegistryEntries& entries) = 0;
  virtual void pluginsDidUninstall(const RegistryEntries& entries) = 0;
};

// An installed bundle the user removed: it stays unregistered until its
// files change (another stamp) or it leaves its install folder.
struct RemovedBundle {
  std::string path;                            // canonical path of the bundle
  std::string installFolder;                   // the install folder it lies in
  std::string stamp;                           // BundleFileStamp of its files when removed
  std::vector<std::string> plugInIdentifiers;  // of its entries when removed
  Date removed;
};

// What the registry knows of a bundle that came from an install folder.
struct InstalledBundle {
  std::string path;  // canonical
  std::string installFolder;
  std::string stamp;  // of the registered files, or of the removed ones
  bool removedByUser = false;
};

// The stamp of a bundle's files: size, modification time and inode of
// Contents/Info.pdoc and Contents/Entitlements.pdoc, as text. Two stat calls,
// no read: equal stamps mean files the registry need not read again. Empty
// when Info.pdoc cannot be stat-ed.
std::string BundleFileStamp(const std::string& path);

// How registerInstalledBundle ended.
enum class InstallOutcome {
  kRegistered,     // new entries (an install event, after an uninstall one for old ones)
  kUnchanged,      // the registered files are the ones there: nothing happened
  kRemovedByUser,  // the user removed these very files: nothing happened
};

struct RegistryOptions {
  // The database file. Its folder is created (0700) when missing; a new
  // database file is made 0600.
  std::string databasePath;
  // Folders that make up the system volume: an entry's onSystemVolume tells
  // whether its bundle lies at or below one of them.
  std::vector<std::string> systemRoots{"/usr"};
  // Reads the bundles' files; never null.
  FileSystem* fileSystem = FileSystem::Default();
  // How long to wait for a database held by another process before failing
  // with kRegistryBusy.
  std::chrono::milliseconds busyTimeout{5000};
  // The install folders: a bundle registered by "add" whose canonical path
  // is an installed place in one of them (directly inside it, or a
  // "*.appex" directly in Contents/PlugIns/ of a "*.app" directly inside
  // it) takes that folder as its origin.
  std::vector<std::string> installFolders;
};

// The options from the environment: DR_REGISTRY, else
// $XDG_DATA_HOME/dromon/registry.sqlite3 (XDG_DATA_HOME defaulting to
// $HOME/.local/share); DR_SYSTEM_ROOTS (colon-separated; unset or empty means
// /usr); DR_PLUGIN_PATH (colon-separated install folders; set but empty
// means none; unset means $XDG_DATA_HOME/dromon/PlugIns, then dromon/PlugIns
// in each $XDG_DATA_DIRS folder). Relative folders are ignored, as XDG asks. Fails when no location
// can be made (no HOME and no XDG_DATA_HOME).
Result<RegistryOptions> RegistryOptionsFromEnvironment(
    const std::function<const char*(const char*)>& getenv = nullptr);

class Registry {
 public:
  virtual ~Registry() = default;

  // Opens (creating when missing) the registry database at
  // options.databasePath and loads its entries. A damaged file fails with
  // kRegistryCorrupt, a held one with kRegistryBusy after the busy timeout.
  static Result<std::unique_ptr<Registry>> Open(const RegistryOptions& options);

  // Events after each committed change go to `observer` until it is removed
  // or destroyed; a destroyed observer is never called.
  virtual void addObserver(std::weak_ptr<RegistryObserver> observer) = 0;
  // After this returns, `observer` receives no event that has not started.
  virtual void removeObserver(const RegistryObserver* observer) = 0;

  // Every entry, in registration order (a bundle's entries by identifier).
  virtual RegistryEntries allEntries() const = 0;
  // The entry named `uuid`, or null.
  virtual RegistryEntryPtr entryForUuid(const Uuid& uuid) const = 0;
  // The entries of the bundle at `url` (any spelling of the path that
  // resolves to it), by identifier; empty when none.
  virtual RegistryEntries entriesForUrl(const std::string& url) const = 0;
  // The first of entriesForUrl(url), or null.
  virtual RegistryEntryPtr entryForUrl(const std::string& url) const = 0;
  // The entries whose containing application is the one at `appUrl`, in
  // registration order; empty when none (also for no application at all).
  // The application's name is on each entry's containingApplication().
  virtual RegistryEntries entriesWithinApplication(const std::string& appUrl) const = 0;

  // Registers the plug-in bundle at `url` (an absolute path). OK means the
  // bundle's plug-ins are registered and will survive a crash. Unchanged
  // files: OK, nothing changes, no event. Changed files: the old entries are
  // replaced by new ones with new UUIDs (an uninstall event, then an install
  // event). Errors: kRegistryRefused (nothing stored), kRegistryBusy,
  // kRegistryStorage.
  virtual Status registerBundle(const std::string& url) = 0;
  // Removes every entry of the bundle at `url` (the bundle need not exist any
  // more). Errors: kRegistryNotRegistered, kRegistryBusy, kRegistryStorage.
  virtual Status unregisterBundle(const std::string& url) = 0;

  // ---- Install folders -------------------------------------------------
  // "remove" (unregisterBundle) of a bundle that came from an install folder
  // also remembers it as removed by the user, across restarts; "add"
  // (registerBundle) forgets that again.

  // Every bundle that came from an install folder, registered or removed by
  // the user, in no particular order.
  virtual std::vector<InstalledBundle> installedBundles() const = 0;
  // The installed bundles the user removed, in no particular order.
  virtual std::vector<RemovedBundle> removedBundles() const = 0;

  // Registers the bundle at canonical `path`, found in `installFolder`, as
  // "add" does, unless `stamp` (BundleFileStamp(path), taken by the caller
  // before) shows files already registered from there (kUnchanged: nothing
  // is read) or files the user removed (kRemovedByUser). Errors as
  // registerBundle's.
  virtual Result<InstallOutcome> registerInstalledBundle(const std::string& path,
                                                         const std::string& installFolder,
                                                         const std::string& stamp) = 0;
  // The bundle at canonical `path` left its install folder: its entries are
  // unregistered when they came from an install folder (an uninstall event),
  // and a removal by the user is forgotten. OK also when there was nothing
  // to do. Errors: kRegistryBusy, kRegistryStorage.
  virtual Status unregisterInstalledBundle(const std::string& path) = 0;
};

}  // namespace dr
