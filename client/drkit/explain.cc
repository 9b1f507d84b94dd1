// drkit explain: runs discovery as drd would for one host, over the registry
// on disk, and tells the fate of each plug-in of one bundle or identifier.
//
// Read-only: the registry is opened but never changed, the annotation file
// is read (its folder is made if missing, as drd would), no token is issued
// and nothing is posted. What lives only inside
// a running drd (its holds, its cache) is not seen, and plug-ins on hold are
// reported as drd would report them without the hold.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <mutex>

#include "client/drkit/commands.h"
#include "client/drkit/output.h"
#include "core/log.h"
#include "daemon/discovery.h"
#include "daemon/ipc_client.h"
#include "daemon/user_prefs.h"
#include "model/bundle.h"
#include "platform/code_signing.h"
#include "platform/pdoc.h"
#include "platform/policy.h"
#include "platform/registry.h"
#include "platform/sandbox.h"
#include "platform/service_manager.h"
#include "platform/types.h"
#include "store/annotation_store.h"

namespace dr::drkit {
namespace {

// The host's version key, read to tell the older hosts that need the
// matching workaround.
constexpr const char* kHostShortVersionKey = "BNBundleShortVersionString";

// The host as discovery sees it: a process whose entitlements are those of
// its application bundle (none for a program outside any bundle).
class ExplainHost final : public PlugInClient {
 public:
  explicit ExplainHost(Value entitlements) : entitlements_(std::move(entitlements)) {}
  pid_t pid() const override { return ::getpid(); }
  Value entitlementValueForKey(std::string_view key) const override { return entitlements_[key]; }
  bool hasEntitlement(std::string_view key) const override {
    return IsEntitlementHeld(entitlementValueForKey(key));
  }

 private:
  Value entitlements_;
};

// Collects the log lines of discovery and record building; printed only
// with -v, since most are about other plug-ins.
class LogLines {
 public:
  LogLines() {
    previous_ = SetLogSink([this](std::string_view line) { add(std::string(line)); });
  }
  ~LogLines() { SetLogSink(previous_); }
  void add(std::string line) {
    std::lock_guard<std::mutex> lock(mu_);
    lines_.push_back(std::move(line));
  }
  std::vector<std::string> lines() const {
    std::lock_guard<std::mutex> lock(mu_);
    return lines_;
  }

 private:
  mutable std::mutex mu_;
  std::vector<std::string> lines_;
  LogSink previous_;
};

// Forms are made as drd makes them, but the resource tokens in them are
// never shown, so none is issued (and no key file is made).
class NoTokenSandbox final : public Sandbox {
 public:
  bool isSandboxed(pid_t) override { return false; }
  Result<std::string> issueFileExtension(std::string_view, const std::string&, uint32_t) override {
    return std::string();
  }
};

std::string ElectionText(const Value& election) {
  if (election == Value(client::kElectionUse)) return "elected";
  if (!election.isNumber() || election == Value(client::kElectionDefault)) return "not chosen";
  return "ignored";
}

bool IsPathTarget(const std::string& target) {
  return target.find('/') != std::string::npos || target == "." || target == "..";
}

std::string Canonical(const std::string& path) {
  char resolved[PATH_MAX];
  return ::realpath(path.c_str(), resolved) ? std::string(resolved) : AbsolutePath(path);
}

std::string Describe(const DRDPlugIn& p) {
  return p.identifier().value_or("?") + " (" + p.version().value_or("?") + ") " +
         (p.uuid() ? p.uuid()->string() : std::string("?"));
}

}  // namespace

int RunExplain(const Invocation& inv, Io& io) {
  LogLines log;
  const std::string& target = inv.operands[0];
  const bool byPath = IsPathTarget(target);
  const std::string targetPath = byPath ? Canonical(target) : std::string();

  Result<RegistryOptions> registryOptions = RegistryOptionsFromEnvironment();
  if (!registryOptions) return Fail(io, registryOptions.error().localizedDescription());
  struct stat st {};
  if (::stat(registryOptions->databasePath.c_str(), &st) != 0) {
    // Opening would make an empty one; nothing is registered anyway.
    return Fail(io, "no registry at " + registryOptions->databasePath);
  }
  Result<std::unique_ptr<Registry>> registry = Registry::Open(*registryOptions);
  if (!registry) return Fail(io, "cannot open the registry: " + registry.error().description());

  // The host.
  std::unique_ptr<CodeSigning> signing =
      MakeLinuxCodeSigning(ProcessInfo::Default(), FileSystem::Default());
  DiscoveryHost host;
  Value entitlements = Value::EmptyDictionary();
  std::string hostName = "a program outside any application";
  if (!inv.host.empty()) {
    std::shared_ptr<DRBundle> app = DRBundle::initWithPath(Canonical(inv.host));
    if (!app || !app->path()) return Fail(io, "no application at " + inv.host);
    Result<Value> own = signing->entitlementsForExecutable(app->executablePath().value_or(""));
    if (!own) return Fail(io, "cannot read the entitlements of " + inv.host);
    entitlements = *own;
    host.plugInsPath = app->plugInsPath();
    host.bundleIdentifier = app->bundleIdentifier().value_or("");
    const Value version = app->infoDictionary()[kHostShortVersionKey];
    host.needs17732150Workaround =
        !host.bundleIdentifier.empty() && version.isString() &&
        Needs17732150Workaround(host.bundleIdentifier, version.stringValue());
    hostName = *app->path() + " (" + host.bundleIdentifier + ")";
  }
  ExplainHost client(entitlements);
  host.client = &client;
  if (inv.flags & client::kDiscoverAll) {
    const bool sandboxed = client.hasEntitlement(kAppSandboxEntitlement);
    if (!client.hasEntitlement(kManagerEntitlement) || sandboxed) {
      return Fail(io,
                  "drd would refuse this host's request: unauthorized discovery flag "
                  "(DRDiscoverAll) (drd error 11)");
    }
  }

  // What discovery reads besides the registry.
  std::unique_ptr<ServiceManager> serviceManager = NewServiceManager({registry->get()});
  std::unique_ptr<TypeService> types =
      NewTypeService({DataFoldersFromEnvironment(), registry->get()});
  NoTokenSandbox sandbox;
  PlugInServices services;
  services.sandbox = &sandbox;
  services.serviceManager = serviceManager.get();
  services.types = types.get();
  std::unique_ptr<Preferences> preferences =
      MakeFilePreferences(PreferencesOptionsFromEnvironment());
  std::unique_ptr<Policy> policy = MakeFilePolicy(PolicyOptionsFromEnvironment());
  std::unique_ptr<DRDAnnotationStore> annotations =
      DRDAnnotationStore::initWithDatabase(std::nullopt);

  DiscoveryServices hooks;
  hooks.addAnnotation = [&](const DRDPlugIn& p, Dictionary& form) {
    Value a = annotations->annotationForPlugIn(p);
    form["annotations"] = a.isDictionary() ? a : Value::EmptyDictionary();
  };
  hooks.mayUse = [&](const Value& form) {
    return policy->mayHostUsePlugIn(host.bundleIdentifier, form["identifier"].stringValue());
  };
  hooks.log = [&](const std::string& line) { log.add(line); };
  hooks.debug = [&](const std::string& line) { log.add(line); };
  Discovery discovery(std::move(host), inv.rules, inv.flags,
                      DRDUserPrefs(preferences.get()).exclusions(), std::move(hooks));

  // Every registered plug-in is a candidate, in the registry's order, as in
  // drd; those of the target are reported.
  std::vector<RegistryEntryPtr> wanted;
  std::map<const DRDPlugIn*, RegistryEntryPtr> entryOf;
  for (const RegistryEntryPtr& entry : (*registry)->allEntries()) {
    DRDPlugInPtr record = DRDPlugIn::initWithRGData(entry, services);
    const bool isTarget =
        byPath ? entry->url() == targetPath
               : entry->plugInIdentifier() == target || (record && record->identifier() == target);
    if (isTarget) wanted.push_back(entry);
    if (!record) continue;
    entryOf[record.get()] = entry;
    discovery.examine(record);
  }
  discovery.finish();

  io.out << "host: " << hostName << "\n";
  if (inv.rules.isPresent()) io.out << "rules: " << ToJson(inv.rules, false) << "\n";
  if (inv.flags) io.out << "flags: 0x" << std::hex << inv.flags << std::dec << "\n";
  int status = 0;
  // An installed bundle the user removed is not registered, but known.
  std::vector<RemovedBundle> removed;
  for (RemovedBundle& r : (*registry)->removedBundles()) {
    const auto& ids = r.plugInIdentifiers;
    if (byPath ? r.path == targetPath : std::find(ids.begin(), ids.end(), target) != ids.end()) {
      removed.push_back(std::move(r));
    }
  }
  if (wanted.empty() && removed.empty()) {
    io.out << target << ": not registered\n";
    status = 1;
  }
  for (const RemovedBundle& r : removed) {
    io.out << target << ": not registered: removed by the user on "
           << FormatTime(static_cast<int64_t>(r.removed.seconds)) << "\n"
           << "    path: " << r.path << "\n"
           << "    install folder: " << r.installFolder << "\n"
           << "    it comes back when its files change, or when it leaves the install folder "
              "and comes back\n";
    status = 1;
  }
  for (const RegistryEntryPtr& entry : wanted) {
    const Discovery::Verdict* verdict = nullptr;
    for (const Discovery::Verdict& v : discovery.verdicts()) {
      if (entryOf[v.plugIn.get()] == entry) verdict = &v;
    }
    io.out << entry->plugInIdentifier() << " " << entry->uuid().string() << "\n"
           << "    path: " << entry->url() << "\n"
           << "    registered: "
           << FormatTime(static_cast<int64_t>(entry->registrationDate().seconds)) << "\n";
    if (entry->installFolder()) io.out << "    install folder: " << *entry->installFolder() << "\n";
    if (!verdict) {
      io.out << "    discovery: never offered: drd cannot make a record of it\n";
      continue;
    }
    const DRDPlugIn& p = *verdict->plugIn;
    io.out << "    version: " << p.version().value_or("?") << "\n";
    const Value annotation = annotations->annotationForPlugIn(p);
    io.out << "    election: " << ElectionText(annotation["election"]) << "\n";
    io.out << "    discovery: " << DiscoveryOutcomeName(verdict->outcome);
    if (!verdict->detail.empty()) io.out << ": " << verdict->detail;
    if (verdict->by) io.out << " by " << Describe(*verdict->by);
    io.out << "\n";
  }
  io.out << "note: holds exist only inside a running drd and are not shown\n";
  if (inv.verbose) {
    for (const std::string& line : log.lines()) io.out << "log: " << line << "\n";
  }
  return status;
}

}  // namespace dr::drkit
