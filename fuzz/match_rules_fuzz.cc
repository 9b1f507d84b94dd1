// Fuzzes rule matching: random rules against random plug-ins.
//
// The plug-in comes the way the daemon gets it: its bundle's files are read
// by the registry's bundle scan (through an in-memory file system, over real
// empty bundle folders made once), each scanned plug-in becomes a registry
// entry, and DRDPlugIn builds its record from that, merging a fuzzed SDK.
// Then DRDPlugIn::match runs the rules.
//
// Input: one flag byte, then NUL-separated parts (pdoc never holds NUL):
//   flags | Info.pdoc | NUL | Entitlements.pdoc | NUL | SDK pdoc | NUL | rules
// Empty entitlements or SDK parts mean none. The rules are a pdoc document
// when they start with '<' or '{', otherwise a DRM1 body (which also carries
// UUIDs, dates and data). Flag bits: 0 the bundle is an ".appex"; 1 it lies
// in an application; 2 it lies on the system volume; 3-4 the type service
// (none, a table, the real one over this machine's shared-mime-info data).
//
// Besides never crashing, matching must be a pure function of the record
// and the rules: the same answer twice, the conjunction of its rules, no
// rules match, a key is either present (true) or absent (false), and the
// comparison operators must agree with each other ("<>" is not "=", "<=" is
// not ">", ">=" is not "<", and exactly one of "<", "=", ">" holds).
#include <sys/stat.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz/fuzz_support.h"
#include "pdoc/pdoc.h"
#include "platform/types.h"
#include "plugin/plugin.h"
#include "plugin/plugin_keys.h"
#include "registry/registry.h"
#include "registry/scan.h"
#include "registry/types_linux.h"
#include "tests/support/fake_service_manager.h"
#include "tests/support/fake_types.h"
#include "wire/drm1.h"

namespace dr::fuzz {
namespace {

// Serves the fuzzed files; everything else does not exist.
class InputFileSystem : public FileSystem {
 public:
  std::map<std::string, std::string> files;

  Result<std::string> readFile(const std::string& path, size_t maxBytes) override {
    auto it = files.find(path);
    if (it == files.end()) return Error(kFileErrorDomain, kFileReadNoSuchFileError, path);
    if (it->second.size() > maxBytes) return Error(kFileErrorDomain, kFileReadError, "too large");
    return it->second;
  }
  Status writeFileAtomically(const std::string&, std::string_view, mode_t) override {
    return Error(kFileErrorDomain, 0, "read-only");
  }
  Status makeDirectories(const std::string&, mode_t) override {
    return Error(kFileErrorDomain, 0, "read-only");
  }
  Result<size_t> removeLeftoverTemporaries(const std::string&) override {
    return Error(kFileErrorDomain, 0, "read-only");
  }
};

// Answers the fuzzed SDK for every extension point.
class InputServiceManager : public test::FakeServiceManager {
 public:
  Result<Value> sdk = Value();
  Result<Value> sdkDictionary(const std::string&) override { return sdk; }
};

// The bundle folders: <root>/{P,Host.app/Contents/PlugIns/P}.{appex,plugin}.
std::string g_root;
std::unique_ptr<TypeService> g_realTypes;
test::FakeTypeService* g_tableTypes = nullptr;

std::string BundlePath(bool appex, bool inApp) {
  return g_root + (inApp ? "/Host.app/Contents/PlugIns/P" : "/P") + (appex ? ".appex" : ".plugin");
}

void RemoveFolders() {
  for (bool inApp : {true, false})
    for (bool appex : {true, false}) ::rmdir(BundlePath(appex, inApp).c_str());
  for (const char* sub : {"/Host.app/Contents/PlugIns", "/Host.app/Contents", "/Host.app", ""})
    ::rmdir((g_root + sub).c_str());
}

void MakeFolders() {
  char root[] = "/tmp/drd-fuzz-XXXXXX";
  if (::mkdtemp(root) == nullptr) Broken("cannot make a temporary folder");
  g_root = root;
  for (const char* sub : {"/Host.app", "/Host.app/Contents", "/Host.app/Contents/PlugIns"})
    ::mkdir((g_root + sub).c_str(), 0700);
  for (bool inApp : {true, false})
    for (bool appex : {true, false}) ::mkdir(BundlePath(appex, inApp).c_str(), 0700);
  std::atexit(RemoveFolders);
}

Value ReadRules(std::string_view bytes) {
  const size_t first = bytes.find_first_not_of(" \t\r\n");
  if (first != std::string_view::npos && (bytes[first] == '<' || bytes[first] == '{')) {
    return pdoc::Parse(bytes).value_or(Value());
  }
  return drm1::DecodeBody(bytes).value_or(Value());
}

// Checks the comparison operators against each other for `value` and the
// operand `operand`.
void CheckOperators(const DRDPlugIn& plugIn, std::string_view value, std::string_view operand) {
  if (!operand.empty() && std::string_view("<>=?").find(operand.front()) != std::string_view::npos)
    return;  // the operand would read as part of the operator
  auto m = [&](const char* op) {
    return plugIn.matchValuePattern(value, std::string(op) + std::string(operand));
  };
  const bool lt = m("<"), eq = m("="), gt = m(">");
  DRD_FUZZ_CHECK(int(lt) + int(eq) + int(gt) == 1, "not exactly one of <, =, >");
  DRD_FUZZ_CHECK(m("") == eq, "a bare pattern is not =");
  DRD_FUZZ_CHECK(m("<>") == !eq, "<> is not the negation of =");
  DRD_FUZZ_CHECK(m("<=") == !gt, "<= is not the negation of >");
  DRD_FUZZ_CHECK(m(">=") == !lt, ">= is not the negation of <");
}

void CheckRules(const DRDPlugIn& plugIn, const Value& rules) {
  const bool matched = plugIn.match(rules);
  DRD_FUZZ_CHECK(plugIn.match(rules) == matched, "match answered differently the second time");
  DRD_FUZZ_CHECK(plugIn.match(Value()) && plugIn.match(Value::EmptyDictionary()),
                 "no rules did not match");
  if (rules.isDictionary()) {
    bool all = true;
    for (const auto& [key, pattern] : rules.dictionary()) {
      all &= plugIn.matchKeyPattern(key, pattern);
      DRD_FUZZ_CHECK(plugIn.matchKeyPattern(key, true) != plugIn.matchKeyPattern(key, false),
                     "a key is both present and absent");
    }
    DRD_FUZZ_CHECK(all == matched, "match is not the conjunction of its rules");
  }
  // The operators, over a few of the plug-in's text attributes and the
  // rules' text patterns.
  std::vector<std::string_view> operands;
  for (const auto& [key, pattern] : rules.dictionary()) {
    if (auto p = pattern.string()) operands.push_back(*p);
    if (operands.size() == 4) break;
  }
  int values = 0;
  for (const auto& [key, value] : plugIn.attributes().dictionary()) {
    auto text = value.string();
    if (!text) continue;
    for (std::string_view operand : operands) CheckOperators(plugIn, *text, operand);
    if (++values == 4) break;
  }
}

}  // namespace
}  // namespace dr::fuzz

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  using namespace dr;
  fuzz::SilenceLog();
  ::unsetenv(kTestSdkEnvironmentVariable);
  fuzz::MakeFolders();
  auto* table = new test::FakeTypeService();  // lives for the whole run
  table->parents["org.example.photo"] = {"org.example.picture"};
  table->parents["org.example.picture"] = {"org.example.item"};
  fuzz::g_tableTypes = table;
  TypeServiceOptions options;
  options.dataFolders = {"/usr/share"};
  fuzz::g_realTypes = NewTypeService(std::move(options));
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace dr;
  using namespace dr::fuzz;
  if (size == 0) return 0;
  const uint8_t flags = data[0];
  std::string_view rest(reinterpret_cast<const char*>(data) + 1, size - 1);
  auto part = [&rest]() {
    size_t nul = rest.find('\0');
    std::string_view p = rest.substr(0, nul);
    rest.remove_prefix(nul == std::string_view::npos ? rest.size() : nul + 1);
    return p;
  };
  const std::string_view info = part(), entitlements = part(), sdk = part();
  const Value rules = ReadRules(rest);

  const bool appex = flags & 1, inApp = flags & 2, onSystem = flags & 4;
  const std::string url = BundlePath(appex, inApp);
  InputFileSystem fs;
  fs.files[url + "/Contents/Info.pdoc"] = std::string(info);
  if (!entitlements.empty())
    fs.files[url + "/Contents/Entitlements.pdoc"] = std::string(entitlements);
  if (inApp) fs.files[g_root + "/Host.app/Contents/Info.pdoc"] = std::string(info);
  Result<registry_internal::ScannedBundle> bundle =
      registry_internal::ScanBundle(url, {onSystem ? g_root : "/usr"}, &fs);
  if (!bundle.ok()) return 0;

  InputServiceManager serviceManager;
  if (!sdk.empty()) {
    Result<Value> parsed = pdoc::Parse(sdk);
    serviceManager.sdk = parsed.ok() ? Result<Value>(*parsed) : Result<Value>(parsed.error());
  }
  PlugInServices services;
  services.serviceManager = &serviceManager;
  services.getenv = [](const char*) -> const char* { return nullptr; };
  switch ((flags >> 3) & 3) {
    case 1:
      services.types = g_tableTypes;
      break;
    case 2:
      services.types = g_realTypes.get();
      break;
    default:
      break;
  }

  auto files =
      std::make_shared<const RegistryBundleFiles>(bundle->infoBytes, bundle->entitlementsBytes);
  uint8_t n = 0;
  for (const registry_internal::ScannedPlugIn& p : bundle->plugIns) {
    RegistryEntry::Fields f;
    f.uuid.bytes[15] = ++n;
    f.url = bundle->path;
    f.plugInIdentifier = p.identifier;
    f.multiple = p.multiple;
    f.bundleIdentifier = bundle->bundleIdentifier;
    f.bundleVersion = bundle->bundleVersion;
    f.registrationDate = Date{1.7e9};
    f.onSystemVolume = bundle->onSystemVolume;
    f.containingApplication = bundle->containingApplication;
    f.displayName = bundle->displayName;
    f.shortName = bundle->shortName;
    auto entry = std::make_shared<const RegistryEntry>(std::move(f), files);
    std::shared_ptr<DRDPlugIn> plugIn = DRDPlugIn::initWithRGData(entry, services);
    if (!plugIn) continue;
    CheckRules(*plugIn, rules);
    (void)plugIn->exportForm();
  }
  return 0;
}
