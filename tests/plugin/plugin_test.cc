#include "plugin/plugin.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <random>
#include <sstream>

#include "core/format.h"
#include "core/log.h"
#include "pdoc/pdoc.h"
#include "platform/code_signing.h"
#include "platform/sandbox.h"
#include "plugin/bundle.h"
#include "plugin/discovery.h"
#include "plugin/helpers.h"
#include "plugin/plugin_core.h"
#include "plugin/plugin_keys.h"
#include "plugin/plugin_set.h"
#include "registry/service_manager_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/fake_service_manager.h"
#include "tests/support/fake_services.h"
#include "tests/support/fake_types.h"
#include "tests/support/registry_bundles.h"

namespace dr::test {
namespace {

using std::nullopt;
using Lines = std::vector<std::string>;
constexpr const char* kPoint = "com.example.point";

Value J(std::string_view json) { return pdoc::Parse("[" + std::string(json) + "]")->at(0); }

// A table as text: rows end at ';' (white space around them is dropped), cells at '|'.
std::vector<Lines> Table(std::string_view text) {
  std::vector<Lines> rows;
  std::istringstream in{std::string(text)};
  for (std::string row; std::getline(in, row, ';');) {
    row.erase(0, row.find_first_not_of(" \n"));
    row.erase(row.find_last_not_of(" \n") + 1);
    if (row.empty()) continue;
    std::istringstream cells(row + "|");
    for (rows.emplace_back(); std::getline(cells, row, '|');) rows.back().push_back(row);
  }
  return rows;
}

struct FakeClient : PlugInClient {
  explicit FakeClient(Value e = Value()) : held(std::move(e)) {}
  pid_t pid() const override { return 4242; }
  Value entitlementValueForKey(std::string_view k) const override { return held[k]; }
  bool hasEntitlement(std::string_view k) const override { return IsEntitlementHeld(held[k]); }
  Value held;  // the entitlements
};

// Plug-in "com.example.<name>.ext" in bundle "com.example.<name>" 2.0, executable
// "<name>", with `pd` and `attrs` added to its plug-in dictionary and attributes.
Value PlugInInfo(const std::string& name, const Value& pd = {}, const Value& attrs = {}) {
  Value p = Value(pd.dictionary()).changing("UXExtensionPointIdentifier", kPoint);
  if (!p.has("UXExtensionProtocol")) p = p.changing("UXExtensionProtocol", "Viewer");
  const std::string id = "com.example." + name;
  p = p.changing("UXExtensionAttributes",
                 Value(attrs.dictionary()).changing("UXExtensionIdentifier", id + ".ext"));
  return Value{{"BNBundleIdentifier", id},
               {"BNBundleVersion", "2.0"},
               {"BNBundleExecutable", name},
               {"UXExtension", p}};
}

Value Sandboxed() { return Value{{"com.corvel.security.app-sandbox", true}}; }

class PlugInTest : public ::testing::Test {
 protected:
  PlugInTest() { serviceManager.sdks.insert_or_assign(kPoint, Value::EmptyDictionary()); }

  RegistryEntryPtr entry(const Value& info, const Value& entitlements = Value(),
                         RegistryEntry::Fields f = {}, std::string path = "") {
    f.uuid = Uuid::random();
    f.url = path.empty() ? folder / ("p" + std::to_string(++bundles_) + "/A.plugin") : path;
    registry_test::MakeBundle(f.url, info, entitlements);
    const std::string exe = f.url + "/Contents/Exec/" + info["BNBundleExecutable"].stringValue();
    registry_test::WriteBytes(exe, "#!/bin/sh\n");
    EXPECT_EQ(::chmod(exe.c_str(), 0755), 0);
    f.plugInIdentifier =
        info["UXExtension"]["UXExtensionAttributes"]["UXExtensionIdentifier"].stringValue();
    std::optional<std::string> entBytes;
    if (entitlements.isPresent()) entBytes = pdoc::WriteXml(entitlements).value_or("");
    return std::make_shared<RegistryEntry>(
        std::move(f), std::make_shared<RegistryBundleFiles>(*pdoc::WriteXml(info), entBytes));
  }

  std::shared_ptr<DRDPlugIn> make(const Value& info, const Value& entitlements = Sandboxed(),
                                  RegistryEntry::Fields f = {}) {
    return DRDPlugIn::initWithRGData(entry(info, entitlements, std::move(f)), services());
  }

  PlugInServices services() {
    PlugInServices s;
    s.serviceManager = manager ? manager : &serviceManager;
    s.getenv = [this](const char* name) -> const char* {
      return testSdk && std::string_view(name) == "DRTEST_SDK" ? testSdk->c_str() : nullptr;
    };
    s.types = types;
    s.sandbox = sandbox;
    if (versions.empty()) return s;
    s.plugInVersion = [this](const Uuid& uuid) { return versions[uuid.string()]; };
    return s;
  }

  registry_test::TempFolder folder;
  FakeServiceManager serviceManager;
  ServiceManager* manager = nullptr;  // instead of serviceManager
  FakeTypeService* types = nullptr;   // none: a type conforms only to itself
  Sandbox* sandbox = nullptr;
  std::optional<std::string> testSdk;                          // the daemon's DRTEST_SDK
  std::map<std::string, std::optional<std::string>> versions;  // other plug-ins', by UUID

  DRDPlugInPtr copy(const std::string& name, const std::string& version, bool system,
                    double registered, const Value& attrs = {}, const Value& pd = {},
                    const Value& entitlements = Sandboxed()) {
    RegistryEntry::Fields f;
    f.onSystemVolume = system;
    f.registrationDate = Date{registered};
    if (!system) f.containingApplication = RegistryApplication{folder / "App.app", "App"};
    return make(PlugInInfo(name, pd, attrs).changing("BNBundleVersion", Value(version)),
                entitlements, std::move(f));
  }
  DiscoveryHost host(bool old = false) { return {&client, nullopt, "", old}; }
  FakeClient client;

 private:
  int bundles_ = 0;
};

const char* const kId = "com.example.viewer";
const char* const kPath = "/p/Viewer.appex";
Value Ux(const Value& top) { return Value{{"UXExtension", top}}; }

std::shared_ptr<DRPlugInCore> Make(const Value& info, const char* path = kPath,
                                   std::optional<Uuid> uuid = nullopt) {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, info, Value(), uuid);
}

class SubRecord : public DRPlugInCore {};

TEST(PlugInCoreTest, SetupIdentityAndAnnotations) {
  const std::string at = std::string(kId) + " at " + kPath;
  EXPECT_FALSE(DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, {}, Ux(J("{}")), {}, {}));
  for (const char* info :
       {"[1]", R"({"UXExtension": "x"})", R"({"UXExtension": {"Multiple": "x"}})",
        R"({"UXExtension": {"Multiple": {"other": {}}}})", R"({"Dromon": "x"})"}) {
    ScopedLogCapture log;
    EXPECT_FALSE(Make(J(info))) << info;
    EXPECT_EQ(log.lines(), Lines{"malformed plug-in dictionary in plug-in " + at + ": " +
                                 J(info).description()});
  }
  ScopedLogCapture log;
  EXPECT_FALSE(Make(Value()));
  EXPECT_FALSE(DRPlugInCore::initWithNameUrlBundleInfoInfoUuid({}, kPath, Ux(J("{}")), {}, {}));
  EXPECT_EQ(log.lines(), (Lines{"missing Info dictionary in plug-in " + at,
                                "missing identifier in plug-in at /p/Viewer.appex"}));
  const Uuid id = Uuid::random();
  auto a = Make(J(R"({"UXExtension": {"x": 1}})"), kPath, id);
  auto b = Make(J(R"({"UXExtension": {"y": 2}})"), "/elsewhere/O.bundle", id);
  auto sub = std::make_shared<SubRecord>();
  ASSERT_TRUE(sub->setupWithNameUrlBundleInfoInfoUuid("other", "/q", Ux(J("{}")), Value(), id));
  EXPECT_TRUE(a->isEqual(b) && a->isEqual(sub.get()) && sub->isEqual(a));
  EXPECT_TRUE(a->hash() == b->hash() && a->hash() == sub->hash());
  auto c = Make(Ux(J("{}")));  // without a given UUID each record gets a fresh one
  EXPECT_TRUE(
      !c->isMultiplexed() &&
      Make(J(R"({"UXExtension": {"Multiple": {"com.example.viewer": {}}}})"))->isMultiplexed());
  EXPECT_FALSE(a->isEqual(nullptr) || c->isEqual(Make(Ux(J("{}")))) ||
               c->isEqual(std::make_shared<DRPlugInCore>()));
  c->setAnnotationValue("election", 1);  // never creates annotations
  EXPECT_TRUE(c->annotations().isAbsent());
  const Value original = J(R"({"election": 0, "extension": {"k": "v"}})");
  c->setAnnotations(original);
  c->setAnnotationValue("election", 1);
  c->setAnnotationValue("extension", Value());
  EXPECT_TRUE(c->annotations() == J(R"({"election": 1})") &&
              original == J(R"({"election": 0, "extension": {"k": "v"}})"));
}

TEST(PlugInCoreTest, DerivedPropertiesNormalizingAndMerging) {
  // path | plug-in dictionary | flags: a(pp extension) h(ybrid) d(edicated) x (data) |
  // embedded code path | version | embedded protocol
  const char* rows = R"(/A/B.appex|{}|a|||; /A/B.APPEX|{}||||; /A/B|{"Dedicated": true}|d|||;
      /A/B|{"UXExtensionProtocol": "#Data"}|x|||"#Data"; /A/B|{"UXExtensionProtocol": ["#Data"]}||||["#Data"];
      /A/B|{"Dedicated": "YES", "UXExtensionAttributes": {"UXExtensionVersion": 7}}|||7|;
      /A/B.appex|{"EmbeddedCode": "C", "UXExtensionProtocol": "P", "EmbeddedProtocol": "E",
        "UXExtensionAttributes": {"UXExtensionVersion": true}}|ah|/A/B.appex/Contents/PlugIns/C||"E";
      /A/B|{"EmbeddedCode": "C", "UXExtensionProtocol": "P"}|h|/A/B/Contents/PlugIns/C||"P";
      /A/B|{"EmbeddedCode": 4}|h|||)";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0] + " " + r[1]);
    auto p = Make(Ux(J(r[1])), r[0].c_str());
    EXPECT_EQ(std::string(p->isAppExtension() ? "a" : "") + (p->isHybrid() ? "h" : "") +
                  (p->isDedicated() ? "d" : "") + (p->isData() ? "x" : ""),
              r[2]);
    EXPECT_EQ(p->embeddedCodePath().value_or(""), r[3]);
    EXPECT_EQ(p->version().value_or(""), r[4]);
    EXPECT_EQ(p->exportForm()["version"], Value(r[4]));
    EXPECT_EQ(p->embeddedProtocolSpec(), r[5].empty() ? Value() : J(r[5]));
  }
  const Value old = J(R"({"SDK": "S", "Protocol": "old", "UXExtensionProtocol": "new", "C": 1,
      "Attributes": {"com.corvel.version": "old", "UXExtensionVersion": "new",
                     "com.corvel.identifier": "I", "com.corvel.protocol": "N"},
      "Multiple": {"a": {"Protocol": "PA", "Multiple": {"b": {"SDK": "S"}}}}})");
  Value normal = DRPlugInCore::normalizeInfoDictionary(Value{{"Dromon", old}});
  EXPECT_EQ(normal["UXExtension"], J(R"({"UXExtensionPointIdentifier": "S",
      "UXExtensionProtocol": "new", "C": 1,
      "UXExtensionAttributes": {"UXExtensionVersion": "old", "UXExtensionIdentifier": "I",
                                "UXExtensionPointName": "N"},
      "Multiple": {"a": {"UXExtensionProtocol": "PA",
                         "Multiple": {"b": {"UXExtensionPointIdentifier": "S"}}}}})"));
  EXPECT_EQ(normal["Dromon"], old);  // still marks an old-style bundle
  const Value both = J(R"({"UXExtension": {"k": 1}, "Dromon": {"Protocol": "P"}})");
  EXPECT_TRUE(DRPlugInCore::normalizeInfoDictionary(both).sameNode(both));
  EXPECT_TRUE(DRPlugInCore::normalizeInfoDictionary(J(R"({"x": 1})")).isAbsent());
  // the SDK's | the plug-in's | merged
  const char* merges = R"({"CleanTimeout": 10, "Dedicated": true, "a": [1], "b": {"c": "d"}}|
      {"CleanTimeout": 5, "Dedicated": false}|{"CleanTimeout": 10, "Dedicated": false, "a": [1], "b": {"c": "d"}};
      {"U": {"D": {"CleanTimeout": 3, "PassProxy": {"m": 1, "s": "A"}, "keep": "sdk"}}}|
      {"U": {"D": {"CleanTimeout": 4, "PassProxy": {"n": 2, "s": "C"}, "keep": "mine"}}}|
      {"U": {"D": {"CleanTimeout": 3, "PassProxy": {"m": 1, "n": 2, "s": "C"}, "keep": "mine"}}};
      {"k": {"a": 1}, "PassProxy": "x", "Shared": ["a"]}|{"k": "s", "PassProxy": {"m": 1}, "Shared": "b"}|
      {"k": "s", "PassProxy": {"m": 1}, "Shared": "b"}; {"PassProxy": {"m": 1}}|{"PassProxy": 7}|{"PassProxy": 7};
      "junk"|{"k": 1}|{"k": 1}; {"Shared": ["a", "b", "a"]}|{"Shared": ["b", "c", 1, 1]}|{"Shared": ["b", "c", 1, "a"]})";
  for (const auto& r : Table(merges)) {
    const Value s = J(r[0]), t = J(r[1]);
    EXPECT_EQ(DRPlugInCore::mergeDictionaryInto(s, t), J(r[2])) << r[0];
    EXPECT_EQ(s.description() + t.description(), J(r[0]).description() + J(r[1]).description());
  }
  EXPECT_FALSE(DRPlugInCore::sdkOverridesKey("cleantimeout"));
}

TEST(PlugInCoreTest, DiagnoseAndForm) {
  ScopedEnv noTestSdk("DRTEST_SDK", nullopt);
  const std::string deep = std::string(60, '[') + std::string(60, ']');  // 62 levels in all
  // path | plug-in dictionary | the SDK's UXExtension ("": none) | the missing key, or the error
  const std::string rows =
      R"(/p/A.appex|{"UXExtensionPointIdentifier": 1, "UXExtensionProtocol": "P",
        "UXExtensionAttributes": 1}||UXExtensionAttributes;
      /p/A.appex|{"UXExtensionPointIdentifier": "com.example.sdk"}|{"Multiple": {"o": {}}}|UXExtensionProtocol;
      /p/A.appex|{"UXExtensionPointIdentifier": "com.example.sdk"}|"x"|;
      /p/A.bundle|{"UXExtensionPointIdentifier": "com.example.sdk"}|{"UXExtensionProtocol": "P",
        "UXExtensionAttributes": "s"}|UXExtensionAttributes;
      /p/A.bundle|{"UXExtensionPointIdentifier": "com.example.sdk"}|{"UXExtensionProtocol": ["a"]}|;
      /p/A.appex|{"UXExtensionPointIdentifier": "com.example.sdk"}|{"Deep": )" +
      deep +
      R"(}|Info.pdoc and SDK cannot be carried in a reply: it nests deeper than the 61 levels a reply can carry;
      /p/A)"
      "\xff"
      R"(.appex|{"UXExtensionPointIdentifier": "com.example.sdk"}||its path or a name is not UTF-8 or holds NUL: "/p/A\xFF.appex")";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0] + " " + r[1] + " " + r[2]);
    FakeServiceManager sm;
    if (!r[2].empty()) sm.sdks.emplace("com.example.sdk", Ux(J(r[2])));
    auto p = Make(Ux(J(r[1])), r[0].c_str());
    p->resolveSDK(&sm);
    Status status = p->diagnose();
    EXPECT_EQ(status.ok() ? "" : status.error().ownDescription(),
              r[3].starts_with("UX") ? "missing \"" + r[3] + "\" key in Info.pdoc or SDK" : r[3]);
    EXPECT_TRUE(status.ok() || status.error().code() == 12) << status.error().domain();
  }
  EXPECT_EQ(DRPlugInCore().diagnose().error().ownDescription(),
            "missing identifier (no UXExtensionIdentifier, nor even BNBundleIdentifier)");
  auto p = Make(J(R"({"UXExtension": {"UXExtensionProtocol": "P"}, "BNBundleVersion": "4.1",
                      "BNBundleInfoPdocURL": "/p/Viewer.appex/Contents/Info.pdoc"})"));
  p->canonicalize();
  const Value plain = p->exportForm();
  EXPECT_TRUE(plain["version"] == Value("4.1") && plain["annotations"] == J("{}"));
  EXPECT_TRUE(!plain["bundleInfo"].has("BNBundleInfoPdocURL") &&
              p->bundleInfoDictionary().has("BNBundleInfoPdocURL"));
  auto with = [&](const char* json) {
    Value form = plain, changes = J(json);
    for (const auto& [k, v] : changes.dictionary()) form = form.changing(k.str(), v);
    return form;
  };
  const Value full = with(R"({"hubProtocolVersion": 2, "lastmodified": 1700000000,
      "systemResident": true, "containingPath": "/Apps/Host.app", "localizedDisplayName": "V",
      "localizedShortName": "W", "localizedContainingDisplayName": "H", "annotations": {"k": 1}})");
  auto q = DRPlugInCore::initWithForm(
      full.changing("hash", Data{1, 2}).changing("requirement", "r").changing("systemResident", 1));
  ASSERT_NE(q, nullptr);
  EXPECT_TRUE(q->isEqual(p) && q->cdhash() == Data({1, 2}) && q->requirement() == "r");
  EXPECT_EQ(q->exportForm(), full);
  auto w = DRPlugInCore::initWithForm(with(R"({"hubProtocolVersion": "7", "lastmodified": "12",
      "systemResident": "1", "uuid": "not-a-uuid", "hash": "x", "requirement": 1,
      "containingPath": 2, "localizedDisplayName": 3, "annotations": []})"));
  ASSERT_NE(w, nullptr);
  EXPECT_EQ(w->exportForm(),  // a hub protocol version that is no number reads as 1
            plain.changing("uuid", w->uuid()->string()).changing("hubProtocolVersion", 1));
  EXPECT_FALSE(w->isEqual(p));
  EXPECT_FALSE(DRPlugInCore::initWithForm(plain.changing("path", Value())) ||
               DRPlugInCore::initWithForm(Value("form")));
  ScopedLogCapture log;
  EXPECT_EQ(DRPlugInCore::initWithForm(plain.changing("identifier", Value())), nullptr);
  EXPECT_EQ(log.lines(), Lines{"missing identifier in plug-in at /p/Viewer.appex"});
  q->updateFromForm(J(R"({"annotations": {"election": 0}, "identifier": "other"})"));
  EXPECT_TRUE(q->annotations() == J(R"({"election": 0})") && q->identifier() == kId);
  q->updateFromForm(J(R"({"annotations": "junk"})"));
  EXPECT_TRUE(q->annotations().isAbsent());
}

TEST(HelpersTest, VersionOrderAndBundlesOnDisk) {
  const char* rows =
      "1.10|>|1.9; 2.0|<|10.0; 1.0|<|1.0.1; 1.0a|<|1.0b; |=|; |<|0; A|<|a; 1.0|<|1.0A; 01|=|1; "
      "1.01|=|1.1; 1.002|<|1.10; 2|>|1a; 1a2|<|1a10; x01|=|x001; \xd9\xa2|<|3; \xd9\xa2|<|Z; "
      "1.99999999999999999999999|<|1.100000000000000000000000; v1.100|>|v1.19; "
      "123456789012345678901234567890|<|123456789012345678901234567891; "
      "caf\xc3\xa9|=|cafe\xcc\x81; \xef\xbc\x91\xef\xbc\x90|>|9; \xef\xbc\x91'|<|1~; "
      "1.\xff\xfe|=|1.\xff\xfe; 1.\xc3\xa9|<|1.f; c|>|\xef\xbc\x91; 1.\xff\xfe|>|1.";
  for (const auto& row : Table(rows)) {
    const int expected = row[1] == "<" ? -1 : row[1] == ">" ? 1 : 0;
    EXPECT_EQ(compareVersionString(row[0], row[2]), expected) << row[0] << row[1] << row[2];
    EXPECT_EQ(compareVersionString(row[2], row[0]), -expected) << row[0] << row[1] << row[2];
  }
  EXPECT_TRUE(dictionaryChangingTo(Value("text"), "a", 1).isAbsent());
  EXPECT_EQ(dictionaryChangingTo(J(R"({"a": 1})"), "b", Value()), J(R"({"a": 1})"));
  EXPECT_EQ(DRMakeErrorWithFormat(4, nullptr, 1, 2).localizedDescription(), "Dromon error 4");
  BundleFixture dir;
  const std::string app = dir.makeBundle(
      "Host.app", J(R"({"BNBundleIdentifier": "com.example.host", "BNBundleExecutable": "Host"})"),
      "Host");
  const std::string exe = app + "/Contents/Exec/Host";
  for (auto b : {DRBundle::initWithURL(app + "/"), DRBundle::initWithExecutablePath(exe)})
    EXPECT_TRUE(b->url() == app && b->executablePath() == exe &&
                b->plugInsPath() == app + "/Contents/PlugIns");
  for (const auto& r :
       Table(R"(Escape|{"BNBundleExecutable": "../x"}; Bare|{"BNBundleVersion": "1"}; List|[1])"))
    dir.makeBundle(r[0] + ".appex", J(r[1]));
  dir.makeFolder("Escape.appex/Contents/Exec");
  dir.writeFile("Escape.appex/Contents/x", "");
  dir.makeBundle("Broken.appex", Value());
  dir.writeFile("Broken.appex/Contents/Info.pdoc", "<pdoc><dict><key>a");
  dir.writeFile("bin/tool", "#!/bin/sh\n");
  for (const char* name :
       {"Escape.appex", "Bare.appex", "List.appex", "Broken.appex", "bin/tool"}) {
    const std::string path = dir.path(name);
    auto b = *name == 'b' ? DRBundle::initWithExecutableURL(path) : DRBundle::initWithPath(path);
    EXPECT_TRUE(b->url() == path && b->executablePath() == path &&
                b->plugInsPath() == path + "/PlugIns")
        << name;
  }
  for (auto b : {DRBundle::initWithPath(dir.path("missing")),
                 DRBundle::initWithExecutablePath(dir.path("nope"))})
    EXPECT_FALSE(b->url() || b->executablePath() || b->plugInsPath());
  auto main = DRBundle::initForMainBundle();
  EXPECT_EQ(main->path(), std::filesystem::read_symlink("/proc/self/exe").string());
  EXPECT_EQ(main->executablePath(), main->path());
}

TEST_F(PlugInTest, AdmitsSandboxedPlugInsAndTakesTheEntrysFields) {
  // plug-in dict | attributes | entitlements | registered | last modified and hub, or refusal
  const char* rows = R"({}|{}|{"com.corvel.security.app-sandbox": "NO"}|1.9|1 2; {}|{}||0|sandboxed;
      {}|{}|{"com.corvel.security.app-sandbox": 0.0}|0|sandboxed;
      {"UXExtensionProtocol": "#Data", "HubProtocolVersion": 5}|{}||-1.9|-1 5;
      {}|{"UXExtensionPointName": "Effecta"}||1e300|9223372036854775807 2;
      {"UXExtensionPointName": "Effecta"}|{}||0|sandboxed)";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0] + " " + r[1] + " " + r[2]);
    ScopedLogCapture log;
    RegistryEntry::Fields f;
    f.registrationDate = Date{std::stod(r[3])};
    RegistryEntryPtr e =
        entry(PlugInInfo("a", J(r[0]), J(r[1])), r[2].empty() ? Value() : J(r[2]), f);
    auto p = DRDPlugIn::initWithRGData(e, services());
    Lines got = log.lines();
    if (p) got.push_back(Format("%d %d", p->lastModified(), p->hubProtocolVersion()));
    EXPECT_EQ(got, Lines{p ? r[4]
                           : "ignoring mis-configured plug-in at " + e->url() +
                                 ": Dromon error 12: plug-ins must be " + r[4]});
  }
}

TEST_F(PlugInTest, FormTokensAndHostsThePlugInAllows) {
  SandboxOptions options{.keyPath = folder / "keys/sandbox.key"};
  testing::FakeCodeSigning signing;
  std::unique_ptr<Sandbox> real = MakeLinuxSandbox(options, &signing);
  sandbox = real.get();
  // "Shared" ("": none) | "name=path" relative to the bundle for each token | the failure logged
  const char* rows =
      R"(||; "."|.=.|; {"r/a": true}|r/a=r/a|; 42||; ["r/a", 7, "r/n/b"]|r/a=r/a r/n/b=r/n/b|;
      ["missing"]||/missing in plug-in at @: No such file or directory;
      "../outside"||/../outside in plug-in at @: Permission denied;
      "r/escape"||/r/escape in plug-in at @: Permission denied; "r/alias"|r/alias=r/n/b|)";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0]);
    Value pd = r[0].empty() ? Value() : Value{{"Shared", J(r[0])}};
    auto plugIn = make(PlugInInfo("a", pd));
    std::string bundle = *plugIn->url();
    for (const char* file : {"/r/a", "/r/n/b", "/../outside"})
      registry_test::WriteBytes(bundle + file, "x");
    std::filesystem::create_symlink("../../outside", bundle + "/r/escape");
    std::filesystem::create_symlink("n/b", bundle + "/r/alias");
    ScopedLogCapture log;
    Dictionary form{{"identifier", Value("kept")}};
    plugIn->augmentForm(form);
    EXPECT_EQ(form.size(), r[0].empty() ? 1u : 2u);
    std::string granted;
    for (const auto& [name, token] : form["extensions"].dictionary()) {
      std::string path = consumeExtension(token.stringValue(), options).value_or("(refused)");
      if (path.starts_with(bundle)) path = path == bundle ? "." : path.substr(bundle.size() + 1);
      granted += (granted.empty() ? "" : " ") + name.str() + "=" + path;
    }
    EXPECT_EQ(granted, r[1]);
    std::string failure = r[2].empty() ? "" : "failed to make extension for " + bundle + r[2];
    if (size_t at = failure.find('@'); at != std::string::npos) failure.replace(at, 1, bundle);
    EXPECT_EQ(log.lines(), failure.empty() ? Lines{} : Lines{failure});
  }
  const std::string restriction = "com.corvel.developer.dromon.allowedplugins";
  // the host's restriction ("": none) or entitlements | the plug-in's demand | the refusal
  const char* hosts = R"(||; []||invalid host restriction entitlement; {}||;
      {"UXExtensionIdentifier": "com.example.a.ext"}||;
      {"UXExtensionIdentifier": "com.example.b.ext"}|"x"|the host's plug-in entitlement does not allow this plug-in;
      {"x": false}|"x"|the host does not have the "x" entitlement; {"x": "NO"}|"x"|; |["x"]|)";
  for (const auto& r : Table(hosts)) {
    Value host = r[0].empty() ? J("{}") : J(r[0]);
    if (!r[0].empty() && !host.has("x")) host = Value{{restriction, host}};
    Value pd = r[1].empty() ? Value() : Value{{"UXExtensionHostEntitlement", J(r[1])}};
    EXPECT_EQ(make(PlugInInfo("a", pd))->allowForClient(FakeClient(host)).value_or(""), r[2])
        << r[0] << " " << r[1];
  }
}

TEST_F(PlugInTest, EnablingSendsTheServiceOverlayOrFailsWithItsLogLines) {
  registry_test::WriteBytes(folder / ("sdks/" + std::string(kPoint) + ".pdoc"),
                            *pdoc::WriteXml(J("{}")));
  ScopedEnv sdkPath{"DR_SDK_PATH", folder / "sdks"};
  std::unique_ptr<ServiceManager> real = NewServiceManager({});
  manager = real.get();
  // DRTEST_SDK ("": none) | the bundle's "IPCService" ("": none) | its variables in the overlay
  const char* rows =
      R"(||{}; /sdk|{"EnvironmentVariables": {"DRTEST_SDK": "/own", "A": "1"}, "Other": 5}|
        {"DRTEST_SDK": "/own", "A": "1"}; /sdk|"junk"|{"DRTEST_SDK": "/sdk"};
      /sdk|{"EnvironmentVariables": "junk"}|{"DRTEST_SDK": "/sdk"};
      |{"EnvironmentVariables": {"A": 1, "B": "b", "C": []}}|{"B": "b"})";
  size_t n = 0;
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[1]);
    testSdk = r[0].empty() ? nullopt : std::optional(r[0]);
    Value service = r[1].empty() ? Value() : J(r[1]);
    auto plugIn = make(PlugInInfo("a").changing("IPCService", service));
    ScopedLogCapture log;
    pid_t pid = ::getpid();  // grants to processes that are gone are dropped
    EXPECT_TRUE(plugIn->enableForPid(pid).ok());
    EXPECT_EQ(log.lines().size(), 1u);
    std::vector<ExternalServiceGrant> grants = manager->externalServiceGrants();
    ASSERT_EQ(grants.size(), ++n);
    EXPECT_TRUE(grants.back().hostPid == pid &&
                grants.back().executablePath == *plugIn->url() + "/Contents/Exec/a");
    Value expected =
        (service.isDictionary() ? service : J("{}")).changing("EnvironmentVariables", J(r[2]));
    EXPECT_EQ(grants.back().overlay,
              (Value{{"IPCService", expected}, {"BNBundlePackageType", "IPC!"}}));
  }
  auto plugIn = make(PlugInInfo("a"));
  const std::string id = "com.example.a.ext(" + plugIn->uuid()->string() + ")";
  const std::string path = *plugIn->url();
  ASSERT_EQ(::chmod((path + "/Contents/Exec/a").c_str(), 0644), 0);
  ScopedLogCapture log;
  EXPECT_EQ(plugIn->enableForPid(77).description(),
            Error("Dromon", 4, "unable to enable plug-in " + id + " for pid 77").description());
  EXPECT_EQ(log.lines().at(1),
            "ipc error 13 allowing pid 77 to use plug-in com.example.a.ext(2.0) " +
                plugIn->uuid()->string() + " at " + path);
  EXPECT_EQ(manager->externalServiceGrants().size(), n);
}

TEST_F(PlugInTest, CheckBusyFindsTheFirstInstanceOfThisVersion) {
  std::map<std::string, Uuid> ids;
  for (const char* who : {"v1", "v200", "none", "unknown"}) ids[who] = Uuid::random();
  versions = {
      {ids["v1"].string(), "1.0"}, {ids["v200"].string(), "2.00"}, {ids["none"].string(), nullopt}};
  auto plugIn = make(PlugInInfo("a"));
  ids["self"] = *plugIn->uuid();
  // instances (pid:plug-in, "-": no path) | the busy one's "pid version" ("!": the query fails)
  const char* rows = R"(||; 1:v1 2:self|2 2.0|; 1:v1 2:v200||; 3:none|3 -|; 3:unknown|3 -|;
      4:-self 5:self|5 2.0|ipc reported incomplete bundle "com.example.a" for plug-in com.example.a.ext;
      6:self|!|ipc failed to report dirty state for "com.example.a")";
  for (const auto& r : Table(rows)) {
    SCOPED_TRACE(r[0]);
    serviceManager.instances.clear();
    std::istringstream in(r[0]);
    for (std::string i; in >> i;) {
      std::string who = i.substr(i.find(':') + 1);
      std::optional<std::string> path = "/b/A.plugin";
      if (who[0] == '-') path = nullopt, who.erase(0, 1);
      serviceManager.instances.push_back({std::stoi(i), path, "com.example.a", ids[who]});
    }
    serviceManager.busyError = r[1] == "!" ? std::optional(PosixError(EIO, "proc")) : nullopt;
    serviceManager.busyQueries.clear();
    ScopedLogCapture log;
    std::optional<BusyInstance> busy = plugIn->checkBusy();
    EXPECT_EQ(busy ? std::to_string(busy->pid) + " " + busy->version.value_or("-") : "",
              r[1] == "!" ? "" : r[1]);
    EXPECT_EQ(log.lines(), r[2].empty() ? Lines{} : Lines{r[2]});
    EXPECT_EQ(serviceManager.busyQueries, std::vector<Lines>{{"com.example.a"}});
  }
}

TEST_F(PlugInTest, MatchRulesAndTheRuleIndex) {
  FakeTypeService typeService;
  typeService.parents["org.example.photo"] = {"org.example.picture"};
  types = &typeService;
  const Value attrs = J(R"({"Version": "10.10", "Two": "2", "Name": "Photo", "Empty": "",
      "EqX": "=x", "Tags": ["a", "b"], "NoTags": [], "Mixed": [7, "x"], "Zero": 0, "One": 1,
      "Dict": {"k": "v"}, "Bytes": "data", "dot.key": "dotted", "Type": "org.example.photo",
      "Super": "org.example.picture", "Rule": {"org.example.picture": 2}, "RuleTrue": true})");
  auto plugIn =
      make(PlugInInfo("a", {}, attrs.changing("Bytes", Data{'x'}))
               .changing("OnlyInBundle", "bundle-value")
               .changing("Name", "BundleName"),
           J(R"({"com.corvel.security.app-sandbox": true, "ent.string": "NO", "ent.false": false,
            "ent.zero": 0, "ent.array": []})"));
  const char* rows = R"(
    ENTITLEMENT:ent.string|"NO"|1; ENTITLEMENT:Version|"10.10"|0; OnlyInBundle|"bundle-value"|1;
    UXExtensionIdentifier|"com.example.a.ext"|1; UXExtensionIdentifier|"com.example.A.ext"|0;
    Name|"BundleName"|0; UXExtensionVersion|">=2"|1; dot.key|"dotted"|1; Missing|"<>"|0;
    EqX|"==x"|1; EqX|"=x"|0; Tags|"b"|1; Tags|"c"|0; NoTags|"a"|0; Mixed|"x"|1; Mixed|"7"|0;
    Zero|"0"|0; One|"1"|0; Dict|"v"|0; Bytes|"x"|0; Type|"?UT-CONFORMS:org.example.picture"|1;
    Type|"?UT-CONFORMS:org.example.photo"|1; Super|"?UT-CONFORMS:org.example.photo"|0;
    Super|"?UT-IS:org.example.photo"|1; Type|"?UT-IS:org.example.picture"|0;
    Type|"?UT-CONFORMS:"|0; Tags|"?UT-CONFORMS:b"|1; Type|"?"|0; Type|"?UT-LIKE:x"|0;
    Type|"?ut-is:org.example.photo"|0; Name|"=?UT-IS:Photo"|0;
    ENTITLEMENT:com.corvel.security.app-sandbox|true|1; ENTITLEMENT:ent.string|true|1;
    ENTITLEMENT:ent.string|false|0; ENTITLEMENT:ent.false|true|0; ENTITLEMENT:ent.false|false|1;
    ENTITLEMENT:ent.zero|false|1; ENTITLEMENT:ent.array|true|1; ENTITLEMENT:Version|false|1;
    ENTITLEMENT:|true|0; entitlement:com.corvel.security.app-sandbox|true|0; dot|false|1;
    Missing|true|0; Missing|false|1; Empty|true|1; Tags|true|1; Tags|false|0; NoTags|true|1;
    NoTags|false|0; Zero|true|0; Zero|false|1; One|true|1; Dict|true|1;
    UXExtensionIdentifier|["com.example.x", "com.example.a.ext"]|1; Missing|["x"]|0;
    Missing|{"org.example.photo": 1}|0; Tags|["c", "a"]|1; NoTags|["a"]|0; One|2|0; Name|1.0|1;
    Name|0|0; Name|2|0; Name|0.5|0; Name|[]|0; Name|[1, true]|0; Name|[["Photo"]]|0;
    Name|["", "Photo"]|1; Rule|{"org.example.photo": 2}|1; Rule|{"org.example.photo": 3}|0;
    Rule|{"org.example.other": 1}|0; Rule|{"org.example.other": 0}|1; Rule|{}|1;
    RuleTrue|{"org.example.other": 9}|1; Name|{"Photo": 1}|0; Tags|{"a": 1}|0)";
  ScopedLogCapture quiet;
  for (const auto& row : Table(rows))
    EXPECT_EQ(plugIn->match(Value{{row[0], J(row[1])}}), row[2] == "1") << row[0] << " " << row[1];
  const std::string uuid = plugIn->uuid()->string();
  std::string lower = uuid;
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  EXPECT_TRUE(plugIn->match(Value{{"com.corvel.uuid", uuid}}));
  EXPECT_FALSE(plugIn->match(Value{{"com.corvel.uuid", lower}}));
  for (const Value& v : {Value(Date{0}), Value(Data{'P'}), Value(*plugIn->uuid())})
    EXPECT_FALSE(plugIn->match(Value{{"Name", v}})) << v.description();
  const char* operators[] = {"", "=", "<>", "<", "<=", ">", ">="};
  const char* orderings = R"(Version|10.9|0010011; Version|10.10|1100101; Version|10.010|1100101;
      Version|10.11|0011100; Version| 10.11|0010011; Two|10|0011100; Name|photo|0011100;
      Name|Photo|1100101; Name||0010011; Empty||1100101; Empty|a|0011100; Tags|a|1110111;
      NoTags|a|0000000; Missing|a|0000000)";
  for (const auto& row : Table(orderings))
    for (size_t i = 0; i < std::size(operators); ++i)
      EXPECT_EQ(plugIn->match(Value{{row[0], operators[i] + row[1]}}), row[2][i] == '1')
          << row[0] << operators[i] << row[1];
  EXPECT_TRUE(plugIn->match(Value()) && plugIn->match(J("{}")) &&
              plugIn->match(J(R"({"Name": "Photo", "Two": "2"})")));
  EXPECT_FALSE(plugIn->match(J(R"({"Name": "Photo", "Two": "3"})")) ||
               plugIn->match(J(R"(["Name"])")) || plugIn->match(Value(true)));
  std::vector<DRDPlugInPtr> records;
  const Value values = J(R"(["viewer", "Viewer", "1.1", "1.01", ["editor", "viewer", "=viewer"],
      ["x", 3], 3, "\u0661.\u0661", ["v\u00efewer", "editor"], true, ""])");
  for (const Value& v : values.array())
    records.push_back(make(PlugInInfo("p" + std::to_string(records.size()), {}, {{"K", v}})));
  records.push_back(make(PlugInInfo("none")));
  records.push_back(make(PlugInInfo("top").changing("K", "viewer")));  // in the bundle information
  const char* indexed = R"(
    {"K": "viewer"}|1; {"K": "=viewer"}|1; {"K": "1.001"}|1; {"K": "1.1"}|1; {"K": ""}|1;
    {"K": "nothing"}|1; {"K": ["editor", 3, "x"]}|1; {"K": []}|1;
    {"K": "viewer", "UXExtensionIdentifier": "com.example.p0.ext"}|1;
    {"K": "1.1", "UXExtensionPointIdentifier": "com.example.point"}|1;
    {"ENTITLEMENT:com.corvel.security.app-sandbox": "1"}|1;
    {"K": "viewer", "BNBundleVersion": ">=1", "Missing": false}|1;
    {"K": "<>viewer"}|0; {"K": ["viewer", "<2"]}|0; {"K": "v\u00efewer"}|0; {"K": true}|0;
    {"K": false}|0; {"K": 3}|0; {"K": "viewer", "Other": "?UT-CONFORMS:x"}|0;
    {"K": ["viewer", "?UT-IS:x"]}|0; {"K": "viewer", "Other": {"a": 1}}|0; {}|0)";
  PlugInSet set(records);
  for (const auto& row : Table(indexed)) {
    const Value rules = J(row[0]);
    std::optional<std::vector<uint32_t>> chosen = set.mayMatch(rules);
    ASSERT_EQ(chosen.has_value(), row[1] == "1") << row[0];
    if (!chosen) continue;
    EXPECT_TRUE(std::is_sorted(chosen->begin(), chosen->end())) << row[0];
    EXPECT_EQ(std::adjacent_find(chosen->begin(), chosen->end()), chosen->end()) << row[0];
    for (uint32_t i = 0; i < records.size(); ++i)
      EXPECT_TRUE(!records[i]->match(rules) ||
                  std::binary_search(chosen->begin(), chosen->end(), i))
          << row[0] << ": record " << i;
    EXPECT_LT(chosen->size(), records.size()) << row[0];
  }
  EXPECT_FALSE(set.mayMatch(Value()));
  EXPECT_TRUE(records[7]->match(J(R"({"K": "1.1"})")));  // the one in another script
}

TEST_F(PlugInTest, DuplicatesWorkaroundBitAndChosenCandidates) {
  // version | (s)ystem or (a)pp | registered, for each copy; flags; the copies returned
  const char* copies = R"(1.2|s|100|1.10|s|50|0|2; 1.10|s|50|1.2|s|100|0|1; 1|a|200|1|s|100|0|2;
      1|a|100|1|a|200|0|2; 1|a|100|1|a|100|0|1; 1|a|200|1|a|100|0|1; 1|s|100|1|a|200|0|2;
      1.2|s|100|1.10|s|50|1|12; 1|s|100|1|s|50|1|1; 1|s|100|1|s|50|5|12; 1|s|100|1|s|50|4|1)";
  for (const auto& r : Table(copies)) {
    SCOPED_TRACE(r[0] + r[1] + r[2] + " " + r[3] + r[4] + r[5] + " " + r[6]);
    Discovery d(host(), Value(), std::stoul(r[6]), Value(), {});
    DRDPlugInPtr a = copy("p", r[0], r[1] == "s", std::stod(r[2]));
    DRDPlugInPtr b = copy("p", r[3], r[4] == "s", std::stod(r[5]));
    for (const DRDPlugInPtr& p : {a, b}) d.examine(p);
    std::string returned;
    const Value found = d.finish().value();
    for (const Value& form : found.array())
      returned += form["uuid"].stringValue() == a->uuid()->string() ? "1" : "2";
    EXPECT_EQ(returned, r[7]);
    for (const Discovery::Verdict& v : d.verdicts()) {  // the copy left out names the winner
      EXPECT_TRUE(v.outcome != DiscoveryOutcome::kSuperseded || v.by == (v.plugIn == a ? b : a));
    }
  }
  const char* hosts = R"(com.corvel.Brivane|10.1.4|1; com.corvel.Brivane|9.9|1;
      com.corvel.BrivaneTrial|10.1|1; com.corvel.Quellor|4.1.9|1; com.corvel.vorelapp|5.1|1;
      com.corvel.OdelloApp|10|1; com.corvel.Brivane|10.2|0; com.corvel.Brivane|10.10|0;
      com.corvel.Brivane|10.2.1|0; com.corvel.Quellor|4.2|0; com.corvel.brivane|1.0|0;
      com.example.other|1.0|0; com.corvel.BrivaneTrialX|1.0|0)";
  for (const auto& row : Table(hosts))
    EXPECT_EQ(Needs17732150Workaround(row[0], row[1]), row[2] == "1") << row[0] << " " << row[1];
  std::vector<DRDPlugInPtr> records;  // two internal filters, then copies in an application
  for (int n : {0, 5}) {
    RegistryEntry::Fields f;
    f.registrationDate = Date{n * 1.0};
    std::string path = folder / ("Effecta/InternalFilters.app/f" + std::to_string(n) + ".appex");
    records.push_back(
        DRDPlugIn::initWithRGData(entry(PlugInInfo("f"), Sandboxed(), f, path), services()));
  }
  for (const auto& r : Table("a|1|viewer; b|1|editor; a|2|viewer; c|1|viewer"))
    records.push_back(copy(r[0], "2.0", false, std::stod(r[1]), Value{{"K", r[2]}}));
  const PlugInSet set(records);
  // rules | flags | old host | plug-ins found
  const char* rows = R"({"K": "viewer"}|1|0|2; {"K": "viewer"}|1|1|3; {"K": "viewer"}|0|1|2;
      {"K": "=viewer"}|9|1|0; {"K": "editor"}|512|1|1; {"K": ">=a"}|1|1|4; {}|1|1|6; {}|1|0|3)";
  for (const auto& row : Table(rows)) {
    const Value rules = J(row[0]);
    const uint64_t flags = std::stoul(row[1]);
    const bool old = row[2] == "1";
    SCOPED_TRACE(row[0] + " " + row[1] + " " + row[2]);
    auto run = [&](const std::vector<DRDPlugInPtr>& examined, Lines& logged) {
      DiscoveryServices services;
      services.log = [&](const std::string& line) { logged.push_back(line); };
      services.debug = services.log;
      Discovery d(host(old), rules, flags, Value(), services);
      for (const DRDPlugInPtr& p : examined) d.examine(p);
      return std::make_pair(d.finish().value(), d.flags());
    };
    const auto chosen = CandidatesToExamine(set, rules, flags, old);
    std::vector<DRDPlugInPtr> some = chosen ? std::vector<DRDPlugInPtr>{} : records;
    for (uint32_t i : chosen.value_or(std::vector<uint32_t>{})) some.push_back(records[i]);
    Lines allLogged, someLogged;
    auto all = run(records, allLogged);
    EXPECT_EQ(run(some, someLogged), all);
    EXPECT_EQ(someLogged, allLogged);
    EXPECT_EQ(all.first.size(), std::stoul(row[3]));
    const bool bit = old && !(flags & message::kDiscoverAll);
    EXPECT_EQ((all.second & message::kDiscoverDuplicates) != 0, bit);
    const std::string found = "found a 17732150 PlugIn: " + *records[0]->path();
    EXPECT_EQ(!allLogged.empty() && allLogged[0].find(found) != std::string::npos, bit);
  }
}

TEST_F(PlugInTest, SplicedReplyIsTheReplyEncodedAfresh) {
  testing::FakeCodeSigning signing;
  std::unique_ptr<Sandbox> real = MakeLinuxSandbox({.keyPath = folder / "key"}, &signing);
  sandbox = real.get();
  const Value values = J(R"([true, -2147483648, "Ω-ω", 613566756.5, [], {}, [{"b": [[-1.25]]}, "a"],
      {"extensions": [false, {"é": 7}], "b": {"overrider": "zeta", "a": [1e300, ""]}}])");
  std::mt19937 rng;
  for (uint32_t seed = 1; seed <= 16; ++seed) {
    SCOPED_TRACE(seed);
    rng.seed(seed);
    std::vector<DRDPlugInPtr> records;
    std::map<const DRDPlugIn*, Value> annotations;
    for (int i = 0; i < 8; ++i) {
      const auto r = static_cast<uint32_t>(rng());  // its bits make each choice
      Value pd{{"Extra", values.array()[r % 8]}};
      if (r & 8) pd = pd.changing("Shared", r & 16 ? "." : "missing");
      const std::string replaced = "com.example." + std::string(1, "abcd"[r >> 5 & 3]) + ".ext";
      records.push_back(copy(
          std::string(1, "abcd"[r >> 7 & 3]), std::to_string(r >> 9 & 3), r >> 11 & 1, r >> 12 & 3,
          {}, pd,
          r >> 14 & 1 ? Sandboxed() : Sandboxed().changing(kReplacePluginEntitlement, replaced)));
      ASSERT_TRUE(records.back());
      if (r >> 15 & 1)
        annotations[records.back().get()] = Value{{"election", values.array()[r >> 16 & 7]}};
    }
    DiscoveryServices hooks;
    hooks.annotations = [&](const DRDPlugIn& p) {
      return annotations.contains(&p) ? annotations[&p] : DRPlugInCore::NoAnnotations();
    };
    Discovery discovery(host(), Value(), rng() % 2, Value(), hooks);
    for (const DRDPlugInPtr& record : records) discovery.examine(record);
    const DiscoveredForms forms = discovery.finish();
    drm1::Splice spliced(drm1::kMaxReplyBodySize);
    spliced.container(drm1::kTagDictionary, 1, 1);
    spliced.key("matches");
    forms.splice(spliced);
    ASSERT_TRUE(spliced.seal(9, 4, drm1::kFlagIsReply).ok());
    const size_t from = rng() % spliced.size();  // where a write resumes
    std::vector<iovec> parts(spliced.size());
    parts.resize(spliced.gather(from, parts.data(), parts.size()));
    std::string tail;
    for (const iovec& p : parts) tail.append(static_cast<char*>(p.iov_base), p.iov_len);
    const std::string bytes = std::move(spliced).flatten();
    const Value afresh{{"matches", forms.value()}};
    EXPECT_EQ(bytes, *drm1::EncodeFrame(9, 4, drm1::kFlagIsReply, afresh));
    EXPECT_EQ(*drm1::DecodeBody(std::string_view(bytes).substr(drm1::kHeaderSize)), afresh);
    EXPECT_EQ(tail, bytes.substr(from));
  }
}

}  // namespace
}  // namespace dr::test
