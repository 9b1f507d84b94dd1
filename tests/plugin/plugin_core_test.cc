// The plug-in record's core (set-up, layers, identity, old-style conversion,
// the SDK merge, diagnosis, the form it travels in), the version order and
// bundles on disk. Values are written as JSON.
#include "plugin/plugin_core.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>

#include "core/log.h"
#include "plugin/bundle.h"
#include "plugin/helpers.h"
#include "tests/plugin/plugin_fixture.h"
#include "tests/support/bundle_fixture.h"

namespace dr::test {
namespace {

const char* const kId = "com.example.viewer";
const char* const kPath = "/p/Viewer.appex";
using Lines = std::vector<std::string>;
using Opt = std::optional<std::string>;
Value Ux(const Value& top) { return Value{{"UXExtension", top}}; }

std::shared_ptr<DRPlugInCore> Make(const Value& info, const char* path = kPath,
                                   std::optional<Uuid> uuid = nullopt) {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, info, Value(), uuid);
}

TEST(PlugInCoreTest, SetupRefusesMalformedInputWithItsLogLine) {
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
}

class SubRecord : public DRPlugInCore {};

TEST(PlugInCoreTest, IdentityIsTheUuidAloneAndAnnotationsAreCopied) {
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
  DRPlugInCore none;
  EXPECT_DEATH(none.isEqual(c.get()), "self.uuid");
  EXPECT_DEATH(none.hash(), "self.uuid");

  c->setAnnotationValue("election", 1);  // never creates annotations
  EXPECT_TRUE(c->annotations().isAbsent());
  const Value original = J(R"({"election": 0, "extension": {"k": "v"}})");
  c->setAnnotations(original);
  c->setAnnotationValue("election", 1);
  c->setAnnotationValue("extension", Value());
  EXPECT_TRUE(c->annotations() == J(R"({"election": 1})") &&
              original == J(R"({"election": 0, "extension": {"k": "v"}})"));
}

// A protocol that is not a string is never the data one; a string never
// makes a plug-in dedicated; embedded code that is not a name is still
// hybrid but has no path; a version that is a number reads as its text.
TEST(PlugInCoreTest, DerivedPropertiesAndFlags) {
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
}

// Entries of "Multiple" convert as whole top dictionaries, nested ones too;
// of an old key beside its new name the one enumerated later wins. With both
// styles present the dictionary is used as it is.
TEST(PlugInCoreTest, NormalizeConvertsOldStyleDictionaries) {
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
}

// The plug-in wins, except that CleanTimeout is the SDK's, PassProxy and
// dictionaries merge at every depth and Shared is a set union; kinds that
// cannot merge keep the plug-in's own value.
TEST(PlugInCoreTest, MergeLetsThePlugInWinExceptByTheSpecialRules) {
  const char* rows[][3] = {
      {R"({"CleanTimeout": 10, "Dedicated": true, "a": [1], "b": {"c": "d"}})",
       R"({"CleanTimeout": 5, "Dedicated": false})",
       R"({"CleanTimeout": 10, "Dedicated": false, "a": [1], "b": {"c": "d"}})"},
      {R"({"U": {"D": {"CleanTimeout": 3, "PassProxy": {"m": 1, "s": "A"}, "keep": "sdk"}}})",
       R"({"U": {"D": {"CleanTimeout": 4, "PassProxy": {"n": 2, "s": "C"}, "keep": "mine"}}})",
       R"({"U": {"D": {"CleanTimeout": 3, "PassProxy": {"m": 1, "n": 2, "s": "C"},
                       "keep": "mine"}}})"},
      {R"({"k": {"a": 1}, "PassProxy": "x", "Shared": ["a"]})",
       R"({"k": "s", "PassProxy": {"m": 1}, "Shared": "b"})",
       R"({"k": "s", "PassProxy": {"m": 1}, "Shared": "b"})"},
      {R"({"PassProxy": {"m": 1}})", R"({"PassProxy": 7})", R"({"PassProxy": 7})"},
      {R"("junk")", R"({"k": 1})", R"({"k": 1})"},
      {R"({"Shared": ["a", "b", "a"]})", R"({"Shared": ["b", "c", 1, 1]})",
       R"({"Shared": ["b", "c", 1, "a"]})"}};
  for (const auto& [sdk, target, expected] : rows) {
    const Value s = J(sdk), t = J(target);
    EXPECT_EQ(DRPlugInCore::mergeDictionaryInto(s, t), J(expected)) << sdk;
    EXPECT_EQ(s.description() + t.description(), J(sdk).description() + J(target).description());
  }
  EXPECT_FALSE(DRPlugInCore::sdkOverridesKey("cleantimeout"));
}

// SDK files of odd shapes never crash, and what they break is refused; a
// protocol of the wrong kind still counts.
TEST(PlugInCoreTest, DiagnoseNamesWhatIsMissing) {
  ScopedEnv noTestSdk("DRTEST_SDK", nullopt);
  std::string deep = "1";  // 62 levels inside the information dictionary
  for (int i = 1; i < 61; ++i) deep = "[" + deep + "]";
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
}

// The form leaves out the information file's own path (the record keeps it)
// and reads back into an equal record; values of the wrong kind read as
// absent; a form without a usable UUID gets a fresh one.
TEST(PlugInCoreTest, FormRebuildsAnEqualRecord) {
  auto p = Make(J(R"({"UXExtension": {"UXExtensionProtocol": "P"}, "BNBundleVersion": "4.1",
                      "BNBundleInfoPdocURL": "/p/Viewer.appex/Contents/Info.pdoc"})"));
  p->canonicalize();
  const Value plain = p->exportForm();
  EXPECT_TRUE(plain["version"] == Value("4.1") && plain["annotations"] == J("{}"));
  EXPECT_FALSE(plain["bundleInfo"].has("BNBundleInfoPdocURL"));
  EXPECT_TRUE(p->bundleInfoDictionary().has("BNBundleInfoPdocURL"));
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
  // Updating takes only the annotations; absent or not a dictionary clears them.
  q->updateFromForm(J(R"({"annotations": {"election": 0}, "identifier": "other"})"));
  EXPECT_TRUE(q->annotations() == J(R"({"election": 0})") && q->identifier() == kId);
  q->updateFromForm(J(R"({"annotations": "junk"})"));
  EXPECT_TRUE(q->annotations().isAbsent());
}

// Capitals sort first; leading zeros never change a run's value; canonically
// equivalent text is equal; digits of any script (and full-width ones) order
// like ASCII digits; invalid UTF-8 never crashes.
TEST(HelpersTest, CompareVersionStringOrdersVersions) {
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
  EXPECT_EQ(DRMakeErrorWithFormat(7, "found %d needed %d", 15, 16).localizedDescription(),
            "found 15 needed 16");
  EXPECT_EQ(DRMakeErrorWithFormat(4, nullptr, 1, 2).localizedDescription(), "Dromon error 4");
}

// Without a usable executable a bundle stands for it, and is its own support
// folder; a free-standing program is its own main bundle.
TEST(HelpersTest, BundlesOnDisk) {
  BundleFixture dir;
  const std::string app = dir.makeBundle(
      "Host.app", J(R"({"BNBundleIdentifier": "com.example.host", "BNBundleExecutable": "Host"})"),
      "Host");
  const std::string exe = app + "/Contents/Exec/Host";
  for (auto b : {DRBundle::initWithURL(app + "/"), DRBundle::initWithExecutablePath(exe)}) {
    EXPECT_TRUE(b->url() == app && b->executablePath() == exe &&
                b->plugInsPath() == app + "/Contents/PlugIns");
  }
  dir.makeBundle("Escape.appex", J(R"({"BNBundleExecutable": "../x"})"));
  dir.makeFolder("Escape.appex/Contents/Exec");
  dir.writeFile("Escape.appex/Contents/x", "");
  dir.makeBundle("Bare.appex", J(R"({"BNBundleVersion": "1"})"));
  dir.makeBundle("List.appex", J("[1]"));
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
                 DRBundle::initWithExecutablePath(dir.path("nope"))}) {
    EXPECT_FALSE(b->url() || b->executablePath() || b->plugInsPath());
  }
  char self[PATH_MAX];
  ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
  ASSERT_GT(n, 0);
  auto main = DRBundle::initForMainBundle();
  EXPECT_EQ(main->path(), std::string(self, static_cast<size_t>(n)));
  EXPECT_EQ(main->executablePath(), main->path());
}

}  // namespace
}  // namespace dr::test
