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
  const struct {
    Opt name, url;
    Value info;
    std::string line;  // "": "malformed ..." and the dictionary
  } rows[] = {{nullopt, kPath, Ux(J("{}")), "missing identifier in plug-in at /p/Viewer.appex"},
              {kId, kPath, Value(), "missing Info dictionary in plug-in " + at},
              {kId, kPath, J("[1]"), ""},
              {kId, kPath, J(R"({"UXExtension": "x"})"), ""},
              {kId, kPath, J(R"({"UXExtension": {"Multiple": "x"}})"), ""},
              {kId, kPath, J(R"({"UXExtension": {"Multiple": {"other": {}}}})"), ""},
              {kId, kPath, J(R"({"Dromon": "x"})"), ""}};
  for (const auto& r : rows) {
    ScopedLogCapture log;
    EXPECT_EQ(DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(r.name, r.url, r.info, Value(), {}),
              nullptr);
    EXPECT_EQ(log.lines(), Lines{r.line.empty() ? "malformed plug-in dictionary in plug-in " + at +
                                                      ": " + r.info.description()
                                                : r.line});
  }
  ScopedLogCapture log;
  EXPECT_EQ(DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, {}, Ux(J("{}")), Value(), {}),
            nullptr);  // no path: silently
  EXPECT_TRUE(log.lines().empty());
}

// The layers (bundle information, top dictionary, plug-in dictionary) share
// nodes; a setter writes through to the layers above by node identity.
TEST(PlugInCoreTest, LayersShareNodesAndSettersWriteThrough) {
  const Value info = J(R"({"UXExtension": {"Multiple": {"com.example.viewer": {"P": 1},
                                                         "other": {"Q": 2}}}})");
  const Value repl = J(R"({"NEW": 3})");
  auto multi = Make(info);
  EXPECT_TRUE(multi->isMultiplexed() && multi->topDictionary().sameNode(info["UXExtension"]));
  multi->setPlugInDictionary(repl);
  Value top = multi->topDictionary();
  EXPECT_TRUE(top["Multiple"][kId].sameNode(repl) &&
              top["Multiple"]["other"].sameNode(info["UXExtension"]["Multiple"]["other"]) &&
              multi->bundleInfoDictionary()["UXExtension"].sameNode(top));
  EXPECT_EQ(info["UXExtension"]["Multiple"][kId], J(R"({"P": 1})"));  // input untouched
  multi->setPlugInDictionary(Value());  // absent removes the entry above
  EXPECT_EQ(multi->topDictionary()["Multiple"], J(R"({"other": {"Q": 2}})"));

  auto single = Make(Ux(repl));
  Value before = single->bundleInfoDictionary();
  single->setPlugInDictionary(single->plugInDictionary());  // the node held: nothing changes
  EXPECT_TRUE(single->bundleInfoDictionary().sameNode(before) && !single->isMultiplexed());
  Value copy(Dictionary(repl.dictionary()));
  single->setTopDictionary(copy);  // equal contents in a new node do
  EXPECT_TRUE(single->bundleInfoDictionary()["UXExtension"].sameNode(copy));
  DRPlugInCore empty;  // the first set writes nothing above
  empty.setPlugInDictionary(repl);
  empty.setTopDictionary(repl);
  EXPECT_TRUE(empty.bundleInfoDictionary().isAbsent());
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
  EXPECT_EQ(c->annotations(), J(R"({"election": 1})"));
  EXPECT_EQ(original, J(R"({"election": 0, "extension": {"k": "v"}})"));
}

// A protocol that is not a string is never the data one; a string never
// makes a plug-in dedicated; embedded code that is not a name is still
// hybrid but has no path; a version that is a number reads as its text.
TEST(PlugInCoreTest, DerivedPropertiesAndFlags) {
  const struct {
    const char *path, *pd;
    const char* flags;  // a(pp extension) h(ybrid) d(edicated) x (data)
    Opt codePath, version;
    Value protocol;
  } rows[] = {
      {"/A/B.appex", "{}", "a", nullopt, nullopt, Value()},
      {"/A/B.APPEX", "{}", "", nullopt, nullopt, Value()},
      {"/A/B", R"({"UXExtensionProtocol": "#Data"})", "x", nullopt, nullopt, "#Data"},
      {"/A/B", R"({"UXExtensionProtocol": ["#Data"]})", "", nullopt, nullopt, J(R"(["#Data"])")},
      {"/A/B", R"({"Dedicated": true})", "d", nullopt, nullopt, Value()},
      {"/A/B", R"({"Dedicated": "YES", "UXExtensionAttributes": {"UXExtensionVersion": 7}})", "",
       nullopt, "7", Value()},
      {"/A/B.appex",
       R"({"EmbeddedCode": "C", "UXExtensionProtocol": "P", "EmbeddedProtocol": "E",
           "UXExtensionAttributes": {"UXExtensionVersion": true}})",
       "ah", "/A/B.appex/Contents/PlugIns/C", nullopt, "E"},
      {"/A/B", R"({"EmbeddedCode": "C", "UXExtensionProtocol": "P"})", "h",
       "/A/B/Contents/PlugIns/C", nullopt, "P"},
      {"/A/B", R"({"EmbeddedCode": 4})", "h", nullopt, nullopt, Value()}};
  for (const auto& r : rows) {
    SCOPED_TRACE(r.path + std::string(" ") + r.pd);
    auto p = Make(Ux(J(r.pd)), r.path);
    EXPECT_EQ(std::string(p->isAppExtension() ? "a" : "") + (p->isHybrid() ? "h" : "") +
                  (p->isDedicated() ? "d" : "") + (p->isData() ? "x" : ""),
              r.flags);
    EXPECT_EQ(p->embeddedCodePath(), r.codePath);
    EXPECT_EQ(p->embeddedProtocolSpec(), r.protocol);
    EXPECT_EQ(p->version(), r.version);
    EXPECT_EQ(p->exportForm()["version"], Value(r.version.value_or("")));
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

// The test folder's SDK wins; one there that is no dictionary, broken or
// missing falls back to the registered one, silently.
TEST(PlugInCoreTest, TestFolderSdkComesFirstAndFallsBackSilently) {
  BundleFixture dir;
  dir.writePdoc("sdks/com.example.sdk", J(R"({"UXExtension": {"UXExtensionProtocol": "T"}})"));
  dir.writePdoc("sdks/com.example.list", J("[1]"));
  dir.writeFile("sdks/com.example.broken", "<pdoc><dict><key>");
  ScopedEnv testSdk("DRTEST_SDK", dir.path("sdks"));
  FakeServiceManager sm;
  const char* ids[] = {"com.example.list", "com.example.broken", "com.example.missing",
                       "com.example.sdk"};
  for (const char* id : ids) sm.sdks.emplace(id, Ux(Value{{"UXExtensionProtocol", "R"}}));
  ScopedLogCapture log;
  for (const char* id : ids) {
    EXPECT_EQ(DRPlugInCore::readSDKDictionary(id, &sm)["UXExtension"]["UXExtensionProtocol"],
              Value(id == ids[3] ? "T" : "R"))
        << id;
  }
  EXPECT_EQ(sm.lookups, 3);
  EXPECT_TRUE(log.lines().empty());
}

// SDK files of odd shapes never crash, and what they break is refused; a
// protocol of the wrong kind still counts.
TEST(PlugInCoreTest, DiagnoseNamesWhatIsMissing) {
  ScopedEnv noTestSdk("DRTEST_SDK", nullopt);
  const std::string missing = "missing \"UXExtensionAttributes\" key in Info.pdoc or SDK";
  const std::string noProtocol = "missing \"UXExtensionProtocol\" key in Info.pdoc or SDK";
  const char* point = R"({"UXExtensionPointIdentifier": "com.example.sdk"})";
  std::string deep = "1";  // 62 levels inside the information dictionary
  for (int i = 1; i < 61; ++i) deep = "[" + deep + "]";
  const struct {
    const char* path;
    std::string pd, sdk;  // sdk: the UXExtension registered for "com.example.sdk"
    std::string error;    // "" for none
  } rows[] = {
      {"/p/A.appex",
       R"({"UXExtensionPointIdentifier": 1, "UXExtensionProtocol": "P", "UXExtensionAttributes": 1})",
       "", missing},
      {"/p/A.appex", point, R"({"Multiple": {"other": {}}})", noProtocol},
      {"/p/A.appex", point, R"("x")", ""},
      {"/p/A.bundle", point, R"({"UXExtensionProtocol": "P", "UXExtensionAttributes": "s"})",
       missing},
      {"/p/A.bundle", point, R"({"UXExtensionProtocol": ["a"]})", ""},
      {"/p/A.appex", point, R"({"Deep": )" + deep + "}",
       "Info.pdoc and SDK cannot be carried in a reply: it nests deeper than the 61 levels a "
       "reply can carry"},
      {"/p/A\xff.appex", point, "",
       "its path or a name is not UTF-8 or holds NUL: \"/p/A\\xFF.appex\""}};
  for (const auto& r : rows) {
    SCOPED_TRACE(r.path + (" " + r.pd + " " + r.sdk));
    FakeServiceManager sm;
    if (!r.sdk.empty()) sm.sdks.emplace("com.example.sdk", Ux(J(r.sdk)));
    auto p = Make(Ux(J(r.pd)), r.path);
    p->resolveSDK(&sm);
    Status status = p->diagnose();
    EXPECT_EQ(status.ok() ? "" : status.error().ownDescription(), r.error);
    EXPECT_TRUE(status.ok() ||
                (status.error().domain() == "Dromon" && status.error().code() == 12));
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
  p->setHubProtocolVersion(2);
  p->setLastModified(1700000000);
  p->setOnSystemVolume(true);
  p->setContainingUrl("/Apps/Host.app");
  p->setLocalizedName("Viewer");
  p->setLocalizedShortName("View");
  p->setLocalizedContainingName("Host");
  const Value form = p->exportForm();
  EXPECT_EQ(form["version"], Value("4.1"));
  EXPECT_EQ(form["annotations"], J("{}"));  // never absent
  EXPECT_FALSE(form["bundleInfo"].has("BNBundleInfoPdocURL"));
  EXPECT_TRUE(p->bundleInfoDictionary().has("BNBundleInfoPdocURL"));
  auto q =
      DRPlugInCore::initWithForm(form.changing("hash", Data{1, 2}).changing("requirement", "r"));
  ASSERT_NE(q, nullptr);
  EXPECT_TRUE(q->isEqual(p));
  EXPECT_EQ(q->exportForm(), form);
  EXPECT_EQ(q->cdhash(), (Data{1, 2}));
  EXPECT_EQ(q->requirement(), "r");
  const Value odd = J(R"({"hubProtocolVersion": "7", "lastmodified": "12", "systemResident": "1",
      "uuid": "not-a-uuid", "hash": "x", "requirement": 1, "containingPath": 2,
      "localizedDisplayName": 3, "annotations": []})");
  Value wrong = plain;
  for (const auto& [k, v] : odd.dictionary()) wrong = wrong.changing(k.str(), v);
  auto w = DRPlugInCore::initWithForm(wrong);
  ASSERT_NE(w, nullptr);
  EXPECT_EQ(w->exportForm(),  // a hub protocol version that is no number reads as 1
            plain.changing("uuid", w->uuid()->string()).changing("hubProtocolVersion", 1));
  EXPECT_FALSE(w->isEqual(p));
  EXPECT_EQ(
      DRPlugInCore::initWithForm(plain.changing("hubProtocolVersion", 5))->hubProtocolVersion(),
      5u);
  EXPECT_TRUE(DRPlugInCore::initWithForm(plain.changing("systemResident", 1))->onSystemVolume());
  for (const Value& bad : {plain.changing("path", Value()), Value("form")}) {
    EXPECT_EQ(DRPlugInCore::initWithForm(bad), nullptr);
  }
  ScopedLogCapture log;
  EXPECT_EQ(DRPlugInCore::initWithForm(plain.changing("identifier", Value())), nullptr);
  EXPECT_EQ(log.lines(), Lines{"missing identifier in plug-in at /p/Viewer.appex"});
  // Updating takes only the annotations; absent or not a dictionary clears them.
  q->updateFromForm(J(R"({"annotations": {"election": 0}, "identifier": "other"})"));
  EXPECT_EQ(q->annotations(), J(R"({"election": 0})"));
  EXPECT_EQ(q->identifier(), kId);
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

// Without an executable the bundle stands for it, and is its own support
// folder; a free-standing program is its own main bundle.
TEST(HelpersTest, BundlesOnDisk) {
  BundleFixture dir;
  const std::string app = dir.makeBundle(
      "Host.app", J(R"({"BNBundleIdentifier": "com.example.host", "BNBundleExecutable": "Host"})"),
      "Host");
  const std::string escape = dir.makeBundle("Escape.appex", J(R"({"BNBundleExecutable": "../x"})"));
  const std::string bare = dir.makeBundle("Bare.appex", J(R"({"BNBundleVersion": "1"})"));
  const std::string list = dir.makeBundle("List.appex", J("[1]"));
  const std::string broken = dir.makeBundle("Broken.appex", Value());
  dir.writeFile("Broken.appex/Contents/Info.pdoc", "<pdoc><dict><key>a");
  dir.makeFolder("Escape.appex/Contents/Exec");
  dir.writeFile("Escape.appex/Contents/x", "");
  const std::string tool = dir.writeFile("bin/tool", "#!/bin/sh\n");
  const Opt exe = app + "/Contents/Exec/Host";
  const struct {
    std::shared_ptr<DRBundle> bundle;
    Opt path, executable, plugIns;
  } rows[] = {{DRBundle::initWithURL(app + "/"), app, exe, app + "/Contents/PlugIns"},
              {DRBundle::initWithExecutablePath(*exe), app, exe, app + "/Contents/PlugIns"},
              {DRBundle::initWithPath(escape), escape, escape, escape + "/PlugIns"},
              {DRBundle::initWithPath(bare), bare, bare, bare + "/PlugIns"},
              {DRBundle::initWithPath(list), list, list, list + "/PlugIns"},
              {DRBundle::initWithPath(broken), broken, broken, broken + "/PlugIns"},
              {DRBundle::initWithExecutableURL(tool), tool, tool, tool + "/PlugIns"},
              {DRBundle::initWithPath(dir.path("missing")), nullopt, nullopt, nullopt},
              {DRBundle::initWithExecutablePath(dir.path("nope")), nullopt, nullopt, nullopt}};
  for (const auto& r : rows) {
    EXPECT_EQ(r.bundle->url(), r.path);
    EXPECT_EQ(r.bundle->executablePath(), r.executable) << r.path.value_or("-");
    EXPECT_EQ(r.bundle->plugInsPath(), r.plugIns) << r.path.value_or("-");
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
