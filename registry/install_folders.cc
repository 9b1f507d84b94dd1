// The install-folder watcher on inotify.
//
// Places: a "location" is a bundle's path as it lies in an install folder
// (F/X.appex or F/A.app/Contents/PlugIns/P.appex), which may be a symbolic
// link; the registry knows the bundle under its canonical path. known_ maps
// each location this watcher has registered (or tried to) to that canonical
// path, so that a location that goes away names the bundle to unregister.
//
// Debounce: every event marks a unit dirty (a bundle location, an
// application, or a whole folder) with a deadline `settle` ahead; further
// events push the deadline back, and the unit is looked at once it passes.
// New folders are watched as soon as their creation is seen, so that the
// writes that follow keep their unit dirty until the writer is done.
//
// Rejected: watching whole trees recursively (a bundle's Exec/ and
// Resources/ do not matter, and every watch costs kernel memory), and
// comparing contents instead of stamps at start (a parse per bundle).
#include "registry/install_folders.h"

#include <dirent.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <condition_variable>
#include <map>
#include <mutex>
#include <set>
#include <thread>

#include "core/format.h"
#include "core/log.h"
#include "platform/file_system.h"

namespace dr {
namespace {

using Clock = std::chrono::steady_clock;

constexpr uint32_t kFolderEvents = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                                   IN_CLOSE_WRITE | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF |
                                   IN_ONLYDIR;

bool EndsWith(const std::string& s, const char* suffix) {
  const std::string_view tail(suffix);
  return s.size() > tail.size() && s.ends_with(tail);
}

bool IsFolder(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// One name in a folder, and whether it is a folder itself (not a link).
struct Name {
  std::string name;
  bool plainFolder;
};

// The names in `folder` that end in `suffix`; an error when it cannot be
// read.
Result<std::vector<Name>> NamesIn(const std::string& folder, const char* suffix) {
  DIR* dir = ::opendir(folder.c_str());
  if (dir == nullptr) return PosixError(errno, "open");
  std::vector<Name> names;
  while (dirent* e = ::readdir(dir)) {
    std::string name = e->d_name;
    if (EndsWith(name, suffix)) names.push_back({std::move(name), e->d_type == DT_DIR});
  }
  ::closedir(dir);
  return names;
}

class LinuxInstallFolders final : public InstallFolders {
 public:
  explicit LinuxInstallFolders(InstallFolderOptions options) : o_(std::move(options)) {
    if (!o_.log) o_.log = [](const std::string& line) { SystemLogLine(line); };
    for (const std::string& path : o_.folders) folders_.push_back({path});
  }

  ~LinuxInstallFolders() override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      stopping_ = true;
    }
    attached_.notify_all();
    if (stop_ >= 0) {
      uint64_t one = 1;
      (void)!::write(stop_, &one, sizeof one);
    }
    if (thread_.joinable()) thread_.join();
    if (inotify_ >= 0) ::close(inotify_);
    if (stop_ >= 0) ::close(stop_);
  }

  void attach(Registry* registry) override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      attachedRegistry_ = registry;
    }
    attached_.notify_all();
  }

  bool start() {
    inotify_ = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    stop_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (inotify_ < 0 || stop_ < 0) {
      o_.log(Format("install folders: cannot watch: %@", PosixError(errno, "inotify")));
    }
    try {
      thread_ = std::thread([this] { run(); });
    } catch (const std::system_error&) {
      return false;
    }
    return true;
  }

 private:
  enum class Unit { kFolder, kApp, kBundle };
  struct Folder {
    std::string path;
    bool readable = true;  // false while it cannot be read: its bundles are kept
    bool missing = false;  // it does not exist: a parent is watched
  };
  struct Watch {
    Unit unit;
    std::string key;  // the location, or the application's path; "" for a folder
    size_t folder;
    bool ancestor = false;  // watches a parent of a folder that does not exist
  };
  struct Dirty {
    Clock::time_point deadline;
    Unit unit;
    size_t folder;
  };
  struct Known {
    std::string canonical;
    size_t folder;
  };
  struct Found {
    std::string location, canonical;
    size_t folder;
    std::string stamp;
  };

  void run() {
    const auto started = Clock::now();
    for (size_t i = 0; i < folders_.size(); ++i) scanFolder(i);
    {
      std::unique_lock<std::mutex> lock(mu_);
      attached_.wait(lock, [this] { return attachedRegistry_ != nullptr || stopping_; });
      if (stopping_) return;
      registry_ = attachedRegistry_;
    }
    for (const Found& f : found_) registerFound(f.location, f.canonical, f.folder, f.stamp);
    found_.clear();
    reconcileRegistry();
    if (!folders_.empty()) {
      o_.log(Format("install folders: %@ bundles in %@ folders reconciled in %@ ms",
                    static_cast<int64_t>(known_.size()), static_cast<int64_t>(folders_.size()),
                    static_cast<int64_t>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                             Clock::now() - started)
                                             .count())));
    }
    if (inotify_ < 0 || stop_ < 0) return;
    for (;;) {
      int timeout = -1;
      if (!dirty_.empty()) {
        auto first = Clock::time_point::max();
        for (const auto& [key, d] : dirty_) first = std::min(first, d.deadline);
        auto wait = std::chrono::ceil<std::chrono::milliseconds>(first - Clock::now()).count();
        timeout = static_cast<int>(std::clamp<int64_t>(wait, 0, INT_MAX));
      }
      pollfd fds[2] = {{inotify_, POLLIN, 0}, {stop_, POLLIN, 0}};
      if (::poll(fds, 2, timeout) < 0 && errno != EINTR) {
        o_.log(Format("install folders: %@; no longer watching", PosixError(errno, "poll")));
        return;
      }
      if (fds[1].revents != 0) return;
      if (fds[0].revents != 0) readEvents();
      processDue();
    }
  }

  // The bundles the registry has from install folders that were not found
  // in one (gone while drd was down, or their folder is no longer listed).
  void reconcileRegistry() {
    std::set<std::string> found;
    for (const auto& [location, known] : known_) found.insert(known.canonical);
    for (const InstalledBundle& b : registry_->installedBundles()) {
      if (found.count(b.path) != 0) continue;
      bool keep = false;
      for (const Folder& f : folders_) keep |= !f.readable && f.path == b.installFolder;
      if (keep) continue;
      if (Status s = registry_->unregisterInstalledBundle(b.path); !s.ok()) {
        o_.log(Format("install folder \"%@\": %@", b.installFolder, s));
      }
    }
  }

  // ---- Units ---------------------------------------------------------------

  void scanFolder(size_t i) {
    Folder& f = folders_[i];
    struct stat st {};
    const int error = ::stat(f.path.c_str(), &st) != 0 ? errno : S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
    if (error != 0 && error != ENOENT && error != ENOTDIR) {
      logOnce(f.path, "",
              Format("install folder \"%@\": cannot read it: %@ (skipped)", f.path,
                     PosixError(error, "stat")));
      f.readable = false;
      return;
    }
    f.missing = error != 0;
    if (f.missing) {
      // Not there (yet): its bundles are gone, and its nearest existing
      // parent is watched for it to appear.
      f.readable = true;
      forgetUnder(f.path + "/");
      watchAncestor(i);
      return;
    }
    auto names = NamesIn(f.path, "");
    if (!names.ok()) {
      logOnce(f.path, "",
              Format("install folder \"%@\": cannot read it: %@ (skipped)", f.path, names.error()));
      f.readable = false;
      return;
    }
    f.readable = true;
    failed_.erase(f.path);
    addWatch(f.path, {Unit::kFolder, "", i});
    // A bundle that is a plain folder lies at the folder's canonical path
    // plus its name: only links need resolving, one lookup each.
    const std::string canonical = CanonicalPath(f.path).value_or("");
    std::set<std::string> seen;
    for (const auto& [name, plainFolder] : *names) {
      const std::string location = f.path + "/" + name;
      if (EndsWith(name, ".appex")) {
        seen.insert(location);
        processBundle(location, i, plainFolder && !canonical.empty() ? canonical + "/" + name : "");
      } else if (EndsWith(name, ".app")) {
        seen.insert(location);
        scanApp(location, i);
      }
    }
    forgetUnder(f.path + "/", &seen);
  }

  void scanApp(const std::string& app, size_t i) {
    const std::string plugIns = app + "/Contents/PlugIns";
    // Watched at the deepest level there is, so that its Contents/PlugIns/
    // is seen when it is made.
    for (const std::string& level : {plugIns, app + "/Contents", app}) {
      if (IsFolder(level)) {
        addWatch(level, {Unit::kApp, app, i});
        break;
      }
    }
    std::set<std::string> seen;
    if (IsFolder(plugIns)) {
      auto names = NamesIn(plugIns, ".appex");
      if (!names.ok()) {
        logOnce(app, "",
                Format("install folder \"%@\": cannot read \"%@\": %@ (skipped)", folders_[i].path,
                       plugIns, names.error()));
        return;
      }
      const std::string canonical = CanonicalPath(plugIns).value_or("");
      for (const auto& [name, plainFolder] : *names) {
        seen.insert(plugIns + "/" + name);
        processBundle(plugIns + "/" + name, i,
                      plainFolder && !canonical.empty() ? canonical + "/" + name : "");
      }
    }
    forgetUnder(plugIns + "/", &seen);
  }

  // `known`: the canonical path of a bundle that is a plain folder, when
  // the scan knows it; "" to resolve `location`.
  void processBundle(const std::string& location, size_t i, const std::string& known = "") {
    const std::string& folder = folders_[i].path;
    auto canonical = known.empty() ? CanonicalPath(location) : Result<std::string>(known);
    if (!canonical.ok()) {
      const auto code = canonical.error().code();
      if (canonical.error().domain() == kPosixErrorDomain && (code == ENOENT || code == ENOTDIR)) {
        gone(location);
        return;
      }
      // A link loop, a dangling or unreadable link: skipped, the registry
      // keeps what it had.
      logOnce(location, "",
              Format("install folder \"%@\": cannot resolve \"%@\": %@ (skipped)", folder, location,
                     canonical.error()));
      return;
    }
    if (known.empty() && !IsFolder(*canonical)) {
      gone(location);
      return;
    }
    if (auto it = known_.find(location); it != known_.end() && it->second.canonical != *canonical) {
      gone(location);  // the link now points elsewhere
    }
    known_[location] = {*canonical, i};
    // Contents/ when there is one (tried directly: one call for the usual
    // case), else the bundle folder, to see Contents/ being made.
    if (!addWatch(*canonical + "/Contents", {Unit::kBundle, location, i}, /*mayBeMissing=*/true)) {
      addWatch(*canonical, {Unit::kBundle, location, i});
    }

    const std::string stamp = BundleFileStamp(*canonical);
    if (auto it = failed_.find(location); it != failed_.end() && it->second.first == stamp) {
      return;  // the same files failed before; logged then
    }
    if (registry_ == nullptr) {
      // The first scan runs while the registry is being opened; what it
      // found is registered once the registry is there.
      found_.push_back({location, *canonical, i, stamp});
      return;
    }
    registerFound(location, *canonical, i, stamp);
  }

  void registerFound(const std::string& location, const std::string& canonical, size_t i,
                     const std::string& stamp) {
    const std::string& folder = folders_[i].path;
    Result<InstallOutcome> outcome = registry_->registerInstalledBundle(canonical, folder, stamp);
    if (outcome.ok()) {
      failed_.erase(location);
      return;
    }
    // A refused bundle is tried again at its next change; a database that
    // was busy, at the next event or start.
    const bool refused = outcome.error().domain() == kRegistryErrorDomain &&
                         outcome.error().code() == kRegistryRefused;
    logOnce(location, refused ? stamp : std::string("\n"),
            Format("install folder \"%@\": %@", folder, outcome.error()));
    if (!refused) failed_.erase(location);
  }

  // The bundle at `location` is no longer there.
  void gone(const std::string& location) {
    failed_.erase(location);
    removeWatches(location);
    auto it = known_.find(location);
    if (it == known_.end()) return;
    const Known known = it->second;
    known_.erase(it);
    for (const auto& [other, k] : known_) {
      if (k.canonical == known.canonical) return;  // still installed through another link
    }
    if (registry_ == nullptr) {
      std::erase_if(found_, [&](const Found& f) { return f.location == location; });
      return;
    }
    if (Status s = registry_->unregisterInstalledBundle(known.canonical); !s.ok()) {
      o_.log(Format("install folder \"%@\": %@", folders_[known.folder].path, s));
    }
  }

  // Every known location below `prefix` is gone, but for those whose first
  // component below `prefix` is in `keep` (seen there, or an application
  // whose plug-ins were just listed).
  void forgetUnder(const std::string& prefix, const std::set<std::string>* keep = nullptr) {
    std::vector<std::string> stale;
    for (auto it = known_.lower_bound(prefix); it != known_.end() && it->first.starts_with(prefix);
         ++it) {
      const std::string& location = it->first;
      const std::string first = location.substr(0, location.find('/', prefix.size()));
      if (keep == nullptr || keep->count(first) == 0) stale.push_back(location);
    }
    for (const std::string& location : stale) gone(location);
  }

  // ---- inotify -------------------------------------------------------------

  // False when `path` cannot be watched (logged, unless `mayBeMissing` and
  // it is not there).
  bool addWatch(const std::string& path, Watch watch, bool mayBeMissing = false) {
    if (inotify_ < 0) return true;
    int wd = ::inotify_add_watch(inotify_, path.c_str(), kFolderEvents);
    if (wd < 0) {
      if (mayBeMissing && (errno == ENOENT || errno == ENOTDIR)) return false;
      logOnce(path, "",
              Format("install folders: cannot watch \"%@\": %@%@", path,
                     PosixError(errno, "inotify_add_watch"),
                     errno == ENOSPC ? " (raise fs.inotify.max_user_watches)" : ""));
      return false;
    }
    if (!watch.key.empty()) byKey_[watch.key].insert(wd);
    // One inode may be watched for several units (a folder that is the
    // parent of another, missing, one).
    auto& units = watches_[wd];
    for (const Watch& u : units) {
      if (u.unit == watch.unit && u.key == watch.key && u.ancestor == watch.ancestor) return true;
    }
    units.push_back(std::move(watch));
    return true;
  }

  void removeWatches(const std::string& key) {
    auto it = byKey_.find(key);
    if (it == byKey_.end()) return;
    for (int wd : it->second) {
      auto w = watches_.find(wd);
      if (w == watches_.end()) continue;
      std::erase_if(w->second, [&](const Watch& u) { return u.key == key; });
      if (w->second.empty()) {
        ::inotify_rm_watch(inotify_, wd);
        watches_.erase(w);
      }
    }
    byKey_.erase(it);
  }

  // Watches the nearest existing parent of folder `i`, which does not exist.
  void watchAncestor(size_t i) {
    std::string path = folders_[i].path;
    while (path.size() > 1) {
      path = path.substr(0, std::max<size_t>(path.rfind('/'), 1));
      if (IsFolder(path)) {
        addWatch(path, {Unit::kFolder, "", i, /*ancestor=*/true});
        return;
      }
    }
  }

  void markDirty(const std::string& key, Unit unit, size_t folder) {
    dirty_[key] = {Clock::now() + o_.settle, unit, folder};
  }

  void readEvents() {
    alignas(inotify_event) char buffer[16384];
    for (;;) {
      ssize_t n = ::read(inotify_, buffer, sizeof buffer);
      if (n <= 0) return;
      for (ssize_t at = 0; at < n;) {
        const auto* e = reinterpret_cast<const inotify_event*>(buffer + at);
        at += static_cast<ssize_t>(sizeof(inotify_event) + e->len);
        handle(*e, e->len ? std::string(e->name) : std::string());
      }
    }
  }

  void handle(const inotify_event& e, const std::string& name) {
    if (e.mask & IN_Q_OVERFLOW) {
      // Events were lost: every folder is looked at again.
      for (size_t i = 0; i < folders_.size(); ++i) markDirty(folders_[i].path, Unit::kFolder, i);
      return;
    }
    auto it = watches_.find(e.wd);
    if (it == watches_.end()) return;
    const std::vector<Watch> units = it->second;
    if (e.mask & IN_IGNORED) {
      watches_.erase(it);
      for (const Watch& w : units) {
        if (auto k = byKey_.find(w.key); k != byKey_.end()) k->second.erase(e.wd);
      }
    }
    for (const Watch& w : units) handleFor(w, e, name);
  }

  void handleFor(const Watch& w, const inotify_event& e, const std::string& name) {
    const bool made = (e.mask & (IN_CREATE | IN_MOVED_TO)) && (e.mask & IN_ISDIR);
    const std::string& folder = folders_[w.folder].path;
    if (w.ancestor) {
      // Something changed above folders that do not exist yet: whichever
      // appeared is scanned (parents may be shared, so all are looked at).
      for (size_t i = 0; i < folders_.size(); ++i) {
        if (folders_[i].missing) markDirty(folders_[i].path, Unit::kFolder, i);
      }
      return;
    }
    // The unit the event concerns, and whether it is a bundle.
    std::string key;
    Unit unit = w.unit;
    switch (w.unit) {
      case Unit::kFolder:
        if (name.empty()) {
          key = folder;
        } else if (EndsWith(name, ".appex")) {
          key = folder + "/" + name;
          unit = Unit::kBundle;
        } else if (EndsWith(name, ".app")) {
          key = folder + "/" + name;
          unit = Unit::kApp;
        } else {
          return;
        }
        break;
      case Unit::kApp:
        if (EndsWith(name, ".appex")) {
          key = w.key + "/Contents/PlugIns/" + name;
          unit = Unit::kBundle;
        } else {
          key = w.key;
        }
        break;
      case Unit::kBundle:
        key = w.key;
        break;
    }
    markDirty(key, unit, w.folder);
    // A folder just made is watched at once, so that the writes into it
    // that follow keep its unit dirty until they end.
    if (made && unit != Unit::kFolder) preWatch(key, unit, w.folder);
  }

  // Watches the deepest existing level of a unit just made.
  void preWatch(const std::string& key, Unit unit, size_t folder) {
    const std::vector<std::string> levels =
        unit == Unit::kApp
            ? std::vector<std::string>{key + "/Contents/PlugIns", key + "/Contents", key}
            : std::vector<std::string>{key + "/Contents", key};
    for (const std::string& level : levels) {
      if (IsFolder(level)) {
        addWatch(level, {unit, key, folder});
        return;
      }
    }
  }

  void processDue() {
    const auto now = Clock::now();
    std::vector<std::pair<std::string, Dirty>> due;
    for (auto it = dirty_.begin(); it != dirty_.end();) {
      if (it->second.deadline <= now) {
        due.emplace_back(it->first, it->second);
        it = dirty_.erase(it);
      } else {
        ++it;
      }
    }
    for (const auto& [key, d] : due) {
      switch (d.unit) {
        case Unit::kFolder:
          scanFolder(d.folder);
          break;
        case Unit::kApp:
          if (IsFolder(key)) {
            scanApp(key, d.folder);
          } else {
            removeWatches(key);
            forgetUnder(key + "/");
          }
          break;
        case Unit::kBundle:
          processBundle(key, d.folder);
          break;
      }
    }
  }

  // Logs `line` unless the same line was logged for `key` with the same
  // `stamp` last time.
  void logOnce(const std::string& key, const std::string& stamp, const std::string& line) {
    auto& last = failed_[key];
    if (last.first == stamp && last.second == line) return;
    last = {stamp, line};
    o_.log(line);
  }

  InstallFolderOptions o_;
  std::vector<Folder> folders_;
  int inotify_ = -1;
  int stop_ = -1;
  std::map<int, std::vector<Watch>> watches_;
  std::map<std::string, std::set<int>> byKey_;
  std::map<std::string, Dirty> dirty_;
  std::map<std::string, Known> known_;  // by location
  // The last failure logged per location or folder: the stamp of its files
  // then, and the line.
  std::map<std::string, std::pair<std::string, std::string>> failed_;
  Registry* registry_ = nullptr;  // once attached; the watcher thread's
  std::vector<Found> found_;      // by the first scan, before the registry came
  std::mutex mu_;
  std::condition_variable attached_;
  Registry* attachedRegistry_ = nullptr;  // guarded by mu_
  bool stopping_ = false;                 // guarded by mu_
  std::thread thread_;                    // last: started once the rest is built
};

}  // namespace

std::unique_ptr<InstallFolders> InstallFolders::Start(InstallFolderOptions options) {
  auto watcher = std::make_unique<LinuxInstallFolders>(std::move(options));
  if (!watcher->start()) return nullptr;
  return watcher;
}

}  // namespace dr
