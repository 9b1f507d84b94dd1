#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "core/log.h"
#include "pdoc/pdoc.h"
#include "platform/bundle_reader.h"
#include "platform/file_system.h"
#include "platform/process_info.h"
#include "platform/service_manager.h"
#include "registry/registry.h"
#include "registry/service_manager_linux.h"
#include "wire/locations.h"

namespace dr {
namespace {

static_assert(kNoInstanceRunning == ESRCH, "the no-instance answer is the ESRCH error number");

constexpr const char* kSdkPathVariable = "DR_SDK_PATH";
constexpr const char* kSystemSdkFolder = "/usr/share/dromon/SDKs";
constexpr const char* kSdkFileSuffix = ".pdoc";
// An SDK file, like every other pdoc file drd reads, is small.
constexpr size_t kMaxSdkFileBytes = size_t{16} << 20;
constexpr const char* kProcFolder = "/proc";
// What the kernel appends to /proc/<pid>/exe once the executable is deleted.
constexpr std::string_view kDeletedSuffix = " (deleted)";
constexpr const char* kBundleIdentifierKey = "BNBundleIdentifier";
constexpr const char* kBundleVersionKey = "BNBundleVersion";

std::vector<std::string> SdkFolders() {
  std::string list = EnvironmentValue(nullptr, kSdkPathVariable);
  if (list.empty()) {
    std::string data = DataHome();
    list = (data.empty() ? "" : data + "/dromon/SDKs:") + kSystemSdkFolder;
  }
  return SplitFolderList(list);
}

// The pids of the user's own processes, in ascending order. drd serves one
// user: another user's process is never reported busy nor signalled, even
// when it runs a registered plug-in (and even when drd runs as root).
Result<std::vector<pid_t>> RunningPids() {
  DIR* dir = ::opendir(kProcFolder);  // glibc opens it O_CLOEXEC
  if (dir == nullptr) return PosixError(errno, std::string("opendir ") + kProcFolder);
  std::vector<pid_t> pids;
  while (struct dirent* e = ::readdir(dir)) {
    const char* name = e->d_name;
    if (*name < '1' || *name > '9') continue;
    char* end = nullptr;
    long pid = std::strtol(name, &end, 10);
    struct stat st;
    if (*end == '\0' && pid > 0 && pid <= INT_MAX && ::fstatat(::dirfd(dir), name, &st, 0) == 0 &&
        st.st_uid == ::geteuid()) {
      pids.push_back(static_cast<pid_t>(pid));
    }
  }
  ::closedir(dir);
  std::sort(pids.begin(), pids.end());
  return pids;
}

// The registered bundle (of `bundles`, keyed by canonical path) that holds
// `path` most closely: a bundle nested in another bundle's folder owns what
// lies inside it. Null when none holds it.
template <typename Map>
const typename Map::value_type* InnermostBundle(const Map& bundles, std::string path) {
  for (size_t slash = path.rfind('/'); slash != std::string::npos && slash > 0;
       slash = path.rfind('/')) {
    path.resize(slash);
    auto it = bundles.find(path);
    if (it != bundles.end()) return &*it;
  }
  return nullptr;
}

// The error number of a grant whose executable cannot be run: only "missing"
// and "not executable" are answered.
int ExecutableError(int errnum) {
  switch (errnum) {
    case ENOENT:
    case ENOTDIR:
    case ELOOP:
    case ENAMETOOLONG:
      return ENOENT;
    default:
      return EACCES;
  }
}

// The identifier and version of one registered bundle's plug-ins (all
// entries of a bundle share them), and the entries themselves.
struct BundleRecord {
  std::optional<std::string> identifier;
  std::optional<std::string> version;
  std::vector<Uuid> plugIns;
};
using BundleRecords = std::map<std::string, BundleRecord>;
// A plug-in's identity as removal names it; a record without a version has "".
using PlugInVersion = std::pair<std::string, std::string>;

class LinuxServiceManager final : public ServiceManager {
 public:
  explicit LinuxServiceManager(const ServiceManagerOptions& options)
      : registry_(options.registry),
        processInfo_(options.processInfo ? options.processInfo : ProcessInfo::Default()),
        bundleReader_(options.bundleReader ? options.bundleReader : BundleReader::Default()),
        // What is registered now is learnt when first needed: the entries are
        // kept, not yet turned into records, as drd starts faster without.
        startupEntries_(registry_ ? registry_->allEntries() : std::vector<RegistryEntryPtr>{}) {}

  Result<Value> sdkDictionary(const std::string& identifier) override {
    // An identifier names one file inside a folder, never a path elsewhere.
    if (identifier.empty() || identifier.find('/') != std::string::npos ||
        identifier.find('\0') != std::string::npos) {
      return Value();
    }
    for (const std::string& folder : SdkFolders()) {
      std::string path = folder + "/" + identifier + kSdkFileSuffix;
      struct stat st;
      if (::stat(path.c_str(), &st) != 0) continue;
      if (std::optional<Value> known = knownSdk(path, st)) return *known;
      Result<std::string> bytes = FileSystem::Default()->readFile(path, kMaxSdkFileBytes);
      if (!bytes.ok()) return bytes.error();
      Result<Value> sdk = pdoc::Parse(*bytes);
      if (!sdk.ok())
        return Error(sdk.error().domain(), sdk.error().code(),
                     path + ": " + sdk.error().localizedDescription());
      if (!sdk->isDictionary()) {
        return Error(kPdocErrorDomain, pdoc::kMalformed, path + ": not a dictionary");
      }
      rememberSdk(path, st, *sdk);
      return *sdk;
    }
    return Value();
  }

  int addExternalService(pid_t hostPid, const std::string& executablePath,
                         const Value& overlay) override {
    if (hostPid < 1) return ESRCH;
    if (executablePath.empty() || executablePath.find('\0') != std::string::npos) return ENOENT;
    struct stat st;
    if (::stat(executablePath.c_str(), &st) != 0) return ExecutableError(errno);
    // access(X_OK) passes a folder, and for root any file with one x bit.
    if (!S_ISREG(st.st_mode)) return EACCES;
    if (::access(executablePath.c_str(), X_OK) != 0) return ExecutableError(errno);

    ExternalServiceGrant grant;
    grant.hostPid = hostPid;
    grant.executablePath = CanonicalPath(executablePath).value_or(executablePath);
    grant.overlay = overlay;
    identify(grant);

    std::lock_guard lock(mu_);
    // A grant to a process that has exited serves nobody.
    std::erase_if(grants_, [&](const ExternalServiceGrant& g) {
      return (g.hostPid == hostPid && g.executablePath == grant.executablePath) ||
             (::kill(g.hostPid, 0) != 0 && errno == ESRCH);
    });
    if (grant.bundlePath) {
      remember({});
      learn(*grant.bundlePath, grant.bundleIdentifier, grant.bundleVersion);
    }
    grants_.push_back(std::move(grant));
    return 0;
  }

  Result<std::vector<BusyExtensionInstance>> busyExtensionInstances(
      const std::vector<std::string>& bundleIdentifiers) override {
    BundleRecords registered = registeredBundles();
    {
      std::lock_guard lock(mu_);
      remember(registered);
    }
    std::vector<BusyExtensionInstance> busy;
    if (registered.empty() || bundleIdentifiers.empty()) return busy;
    const std::set<std::string> wanted(bundleIdentifiers.begin(), bundleIdentifiers.end());
    Result<std::vector<pid_t>> pids = RunningPids();
    if (!pids.ok()) return pids.error();
    for (pid_t pid : *pids) {
      std::optional<std::string> exe = executableOf(pid);
      if (!exe) continue;
      const BundleRecords::value_type* bundle = InnermostBundle(registered, *exe);
      if (!bundle || !bundle->second.identifier || !wanted.count(*bundle->second.identifier))
        continue;
      for (const Uuid& plugIn : bundle->second.plugIns)
        busy.push_back({pid, bundle->first, bundle->second.identifier, plugIn});
    }
    return busy;
  }

  int removeExternalServiceInstance(const std::string& bundleIdentifier,
                                    const std::string& bundleVersion) override {
    const PlugInVersion target(bundleIdentifier, bundleVersion);
    BundleRecords registered = registeredBundles();
    std::map<std::string, std::set<PlugInVersion>> known;
    {
      std::lock_guard lock(mu_);
      remember(registered);
      std::erase_if(grants_, [&](const ExternalServiceGrant& g) {
        return g.bundleIdentifier == bundleIdentifier &&
               g.bundleVersion.value_or("") == bundleVersion;
      });
      known = known_;
    }
    // A bundle counts as this plug-in's when it was registered as it at any
    // time the manager looked, or a grant named it so: after an update the
    // old version's instances must stop although the path now holds the new.
    bool signalled = false;
    int refused = 0;
    Result<std::vector<pid_t>> pids = RunningPids();
    if (!pids.ok()) return pids.error().code() > 0 ? static_cast<int>(pids.error().code()) : EIO;
    for (pid_t pid : *pids) {
      if (pid == ::getpid()) continue;
      std::optional<std::string> exe = executableOf(pid);
      if (!exe) continue;
      const auto* bundle = InnermostBundle(known, *exe);
      if (!bundle || !bundle->second.count(target)) continue;
      if (::kill(pid, SIGTERM) == 0) {
        signalled = true;
        SystemLog("stopped pid %d, an instance of %@ %@ at %@", pid, bundleIdentifier,
                  bundleVersion, bundle->first);
      } else if (errno != ESRCH && refused == 0) {
        refused = errno;
      }
    }
    if (signalled) return 0;
    return refused != 0 ? refused : kNoInstanceRunning;
  }

  std::vector<ExternalServiceGrant> externalServiceGrants() const override {
    std::lock_guard lock(mu_);
    return grants_;
  }

 private:
  // The registry's bundles now, by canonical path.
  BundleRecords registeredBundles() const {
    BundleRecords bundles;
    if (!registry_) return bundles;
    for (const RegistryEntryPtr& entry : registry_->allEntries()) {
      auto [it, added] = bundles.try_emplace(
          entry->url(), BundleRecord{entry->bundleIdentifier(), entry->bundleVersion(), {}});
      it->second.plugIns.push_back(entry->uuid());
    }
    return bundles;
  }

  // Adds what is registered now, and what was when the manager was made, to
  // known_. REQUIRES: mu_ held.
  void remember(const BundleRecords& registered) {
    for (const RegistryEntryPtr& entry : startupEntries_)
      learn(entry->url(), entry->bundleIdentifier(), entry->bundleVersion());
    startupEntries_ = {};
    for (const auto& [path, record] : registered) learn(path, record.identifier, record.version);
  }

  // REQUIRES: mu_ held.
  void learn(const std::string& path, const std::optional<std::string>& identifier,
             const std::optional<std::string>& version) {
    auto& versions = known_[path];
    if (identifier) versions.emplace(*identifier, version.value_or(""));
  }

  // The bundle that holds a granted executable, and its identifier and
  // version: the registry's record when the bundle is registered, else what
  // its Info.pdoc says.
  void identify(ExternalServiceGrant& grant) const {
    std::shared_ptr<const BundleHandle> bundle =
        bundleReader_->bundleAtPath(grant.executablePath, BundleReader::Mode::kExecutablePath);
    grant.bundlePath = bundle->stringProperty(kBundlePathProperty);
    if (!grant.bundlePath) return;
    if (RegistryEntryPtr entry = registry_ ? registry_->entryForUrl(*grant.bundlePath) : nullptr) {
      grant.bundleIdentifier = entry->bundleIdentifier();
      grant.bundleVersion = entry->bundleVersion();
      return;
    }
    Value info = bundle->infoDictionary();
    if (auto id = info[kBundleIdentifierKey].string()) grant.bundleIdentifier = std::string(*id);
    if (auto v = info[kBundleVersionKey].string()) grant.bundleVersion = std::string(*v);
  }

  // The executable `pid` runs, or nothing when it cannot be read (the process
  // exited or is a zombie, a kernel thread, or not ours to inspect). A deleted
  // executable keeps its old path: the program it started from still runs.
  std::optional<std::string> executableOf(pid_t pid) const {
    Result<std::string> exe = processInfo_->executablePath(pid);
    if (!exe.ok() || exe->empty()) return std::nullopt;
    std::string path = std::move(*exe);
    if (path.ends_with(kDeletedSuffix) && ::access(path.c_str(), F_OK) != 0)
      path.resize(path.size() - kDeletedSuffix.size());
    return path;
  }

  // An SDK file read before that is still the same file with the same size
  // and times (so unchanged) answers the dictionary read then. Every plug-in
  // of an extension point names the same file, and records are built by the
  // thousand when drd starts.
  struct SdkFile {
    dev_t device;
    ino_t inode;
    off_t size;
    struct timespec modified, changed;
    Value dictionary;
    bool same(const struct stat& st) const {
      return device == st.st_dev && inode == st.st_ino && size == st.st_size &&
             modified.tv_sec == st.st_mtim.tv_sec && modified.tv_nsec == st.st_mtim.tv_nsec &&
             changed.tv_sec == st.st_ctim.tv_sec && changed.tv_nsec == st.st_ctim.tv_nsec;
    }
  };

  std::optional<Value> knownSdk(const std::string& path, const struct stat& st) {
    std::lock_guard lock(sdkMu_);
    auto it = sdkFiles_.find(path);
    if (it == sdkFiles_.end() || !it->second.same(st)) return std::nullopt;
    return it->second.dictionary;
  }

  void rememberSdk(const std::string& path, const struct stat& st, const Value& dictionary) {
    std::lock_guard lock(sdkMu_);
    sdkFiles_.insert_or_assign(
        path, SdkFile{st.st_dev, st.st_ino, st.st_size, st.st_mtim, st.st_ctim, dictionary});
  }

  const Registry* const registry_;
  ProcessInfo* const processInfo_;
  BundleReader* const bundleReader_;

  std::mutex sdkMu_;
  std::map<std::string, SdkFile> sdkFiles_;  // guarded by sdkMu_

  mutable std::mutex mu_;
  std::vector<ExternalServiceGrant> grants_;  // guarded by mu_
  // Every bundle path seen registered or granted, with each plug-in version
  // it was seen as. Guarded by mu_; never shrinks, and holds one entry per
  // bundle ever installed while the daemon runs.
  std::map<std::string, std::set<PlugInVersion>> known_;
  // The registry's entries when the manager was made, until remember()
  // adds them to known_. Guarded by mu_.
  std::vector<RegistryEntryPtr> startupEntries_;
};

}  // namespace

std::unique_ptr<ServiceManager> NewServiceManager(const ServiceManagerOptions& options) {
  return std::make_unique<LinuxServiceManager>(options);
}

ServiceManager* DefaultServiceManager() {
  static LinuxServiceManager* manager = new LinuxServiceManager(ServiceManagerOptions{});
  return manager;
}

}  // namespace dr
