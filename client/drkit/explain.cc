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
#include "pdoc/pdoc.h"
#include "platform/code_signing.h"
#include "platform/policy.h"
#include "platform/sandbox.h"
#include "platform/service_manager.h"
#include "platform/types.h"
#include "plugin/bundle.h"
#include "plugin/discovery.h"
#include "registry/registry.h"
#include "registry/service_manager_linux.h"
#include "registry/types_linux.h"
#include "store/annotation_store.h"
#include "store/discovery_services.h"
#include "store/user_prefs.h"

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
  Result<std::string> grantedPath(std::string_view) override {
    return Error(kSandboxErrorDomain, kExtensionForged, "no key");
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
  if (!registryOptions.ok()) return Fail(io, registryOptions.error().localizedDescription());
  struct stat st {};
  if (::stat(registryOptions->databasePath.c_str(), &st) != 0) {
    // Opening would make an empty one; nothing is registered anyway.
    return Fail(io, "no registry at " + registryOptions->databasePath);
  }
  Result<std::unique_ptr<Registry>> registry = Registry::Open(*registryOptions);
  if (!registry.ok())
    return Fail(io, "cannot open the registry: " + registry.error().description());

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
    if (!own.ok()) return Fail(io, "cannot read the entitlements of " + inv.host);
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
    if (!MayDiscoverAll(client, client.hasEntitlement(kAppSandboxEntitlement))) {
      return Fail(io, std::string("drd would refuse this host's request: ") + kDiscoverAllRefused +
                          " (" + client::ErrorCodeName(client::kErrorNotPermitted) + ", code " +
                          std::to_string(client::kErrorNotPermitted) + ")");
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

  const std::string hostIdentifier = host.bundleIdentifier;
  DiscoveryServices hooks =
      MakeDiscoveryServices([&](const DRDPlugIn& p) { return annotations->annotationForPlugIn(p); },
                            [&]() -> Policy::PlugInJudge {
                              return [&](std::string_view plugIn) {
                                return policy->mayHostUsePlugIn(hostIdentifier, plugIn);
                              };
                            },
                            [&](const std::string& line) { log.add(line); },
                            [&](const std::string& line) { log.add(line); });
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

  // One report, printed as text or as JSON.
  Dictionary report;
  report["host"] = hostName;
  report["target"] = target;
  report["registered"] = !wanted.empty();
  if (inv.rules.isPresent()) report["rules"] = inv.rules;
  if (inv.flags) report["flags"] = inv.flags;
  Array plugIns;
  // An installed bundle the user removed is not registered, but known.
  Array removed;
  for (const RemovedBundle& r : (*registry)->removedBundles()) {
    const auto& ids = r.plugInIdentifiers;
    if (byPath ? r.path == targetPath : std::find(ids.begin(), ids.end(), target) != ids.end()) {
      removed.push_back(Value{{"path", r.path},
                              {"installFolder", r.installFolder},
                              {"removedAt", static_cast<int64_t>(r.removed.seconds)}});
    }
  }
  if (!removed.empty()) report["removed"] = Value(std::move(removed));
  for (const RegistryEntryPtr& entry : wanted) {
    const Discovery::Verdict* verdict = nullptr;
    for (const Discovery::Verdict& v : discovery.verdicts()) {
      if (entryOf[v.plugIn.get()] == entry) verdict = &v;
    }
    Dictionary p;
    p["identifier"] = entry->plugInIdentifier();
    p["uuid"] = entry->uuid().string();
    p["path"] = entry->url();
    p["registered"] = static_cast<int64_t>(entry->registrationDate().seconds);
    if (entry->installFolder()) p["installFolder"] = *entry->installFolder();
    if (!verdict) {
      p["discovery"] = "never offered";
      p["detail"] = "drd cannot make a record of it";
    } else {
      const DRDPlugIn& record = *verdict->plugIn;
      p["version"] = record.version().value_or("?");
      p["election"] = ElectionText(annotations->annotationForPlugIn(record)["election"]);
      p["discovery"] = DiscoveryOutcomeName(verdict->outcome);
      if (!verdict->detail.empty()) p["detail"] = verdict->detail;
      if (verdict->by) p["by"] = Describe(*verdict->by);
    }
    plugIns.push_back(Value(std::move(p)));
  }
  report["plugins"] = Value(std::move(plugIns));
  if (inv.verbose) {
    Array lines;
    for (const std::string& line : log.lines()) lines.push_back(Value(line));
    report["log"] = Value(std::move(lines));
  }
  const int status = wanted.empty() ? 1 : 0;
  if (inv.json) {
    io.out << Json(io, Value(std::move(report))) << "\n";
    return status;
  }

  const Value r(std::move(report));
  io.out << "host: " << hostName << "\n";
  if (inv.rules.isPresent()) io.out << "rules: " << ToJson(inv.rules, false) << "\n";
  if (inv.flags) io.out << "flags: 0x" << std::hex << inv.flags << std::dec << "\n";
  if (wanted.empty() && !r.has("removed")) io.out << target << ": not registered\n";
  for (const Value& gone : r["removed"].array()) {
    io.out << target << ": not registered: removed by the user on "
           << FormatTime(gone["removedAt"].intValue()) << "\n"
           << "    path: " << gone["path"].stringValue() << "\n"
           << "    install folder: " << gone["installFolder"].stringValue() << "\n"
           << "    it comes back when its files change, or when it leaves the install folder "
              "and comes back\n";
  }
  for (const Value& p : r["plugins"].array()) {
    io.out << p["identifier"].stringValue() << " " << p["uuid"].stringValue() << "\n"
           << "    path: " << p["path"].stringValue() << "\n"
           << "    registered: " << FormatTime(p["registered"].intValue()) << "\n";
    if (p.has("installFolder")) {
      io.out << "    install folder: " << p["installFolder"].stringValue() << "\n";
    }
    if (p.has("version")) {
      io.out << "    version: " << p["version"].stringValue() << "\n"
             << "    election: " << p["election"].stringValue() << "\n";
    }
    io.out << "    discovery: " << p["discovery"].stringValue();
    if (p.has("detail")) io.out << ": " << p["detail"].stringValue();
    if (p.has("by")) io.out << " by " << p["by"].stringValue();
    io.out << "\n";
  }
  io.out << "note: holds exist only inside a running drd and are not shown\n";
  for (const Value& line : r["log"].array()) io.out << "log: " << line.stringValue() << "\n";
  return status;
}

}  // namespace dr::drkit
