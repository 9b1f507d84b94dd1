// The plug-in record's core: set-up from bundle information, its layers and
// identity, old-style conversion, the SDK merge, canonicalisation, diagnosis
// and the form a record travels in.
#include "plugin/plugin_core.h"

#include <gtest/gtest.h>

#include <algorithm>

#include "core/log.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/fake_service_manager.h"

namespace dr {
namespace {

const char* const kId = "com.example.viewer";
const char* const kPath = "/p/Viewer.appex";
using Lines = std::vector<std::string>;

Value Empty() { return Value::EmptyDictionary(); }
Value Ux(const Value& top) { return Value{{"UXExtension", top}}; }
Value List(Array a) { return Value(std::move(a)); }

std::shared_ptr<DRPlugInCore> Make(const Value& bundleInfo, const char* path = kPath,
                                   std::optional<Uuid> uuid = std::nullopt) {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, bundleInfo, Value(), uuid);
}

// A complete record: set up, merged and canonicalised.
std::shared_ptr<DRPlugInCore> Complete() {
  test::FakeServiceManager sm;
  sm.sdks.emplace("com.example.sdk", Value{{"UXExtension", {{"CleanTimeout", 3}}}});
  auto p = DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(
      kId, "/p/Viewer.appex",
      Value{{"UXExtension",
             {{"UXExtensionPointIdentifier", "com.example.sdk"}, {"EmbeddedCode", "E.bundle"}}},
            {"BNBundleVersion", "4.1"},
            {"BNBundleInfoPdocURL", "/p/Viewer.appex/Contents/Info.pdoc"}},
      Value(), std::nullopt);
  p->resolveSDK(&sm);
  return p;
}

TEST(PlugInCoreTest, SetupRefusesMalformedInputWithItsLogLine) {
  struct Row {
    std::optional<std::string> name, url;
    Value bundleInfo;
    const char* line;  // nullptr: none; "": the malformed line with the dictionary as given
  };
  const std::string malformed =
      "malformed plug-in dictionary in plug-in com.example.viewer at /p/Viewer.appex: ";
  const Row rows[] = {
      {kId, std::nullopt, Ux(Empty()), nullptr},
      {std::nullopt, kPath, Ux(Empty()), "missing identifier in plug-in at /p/Viewer.appex"},
      {kId, kPath, Value(),
       "missing Info dictionary in plug-in com.example.viewer at /p/Viewer.appex"},
      {kId, kPath, Value("junk"), ""},
      {kId, kPath, Value(Array{1}), ""},
      {kId, kPath, Value{{"BNBundleVersion", "1"}}, ""},
      {kId, kPath, Value{{"UXExtension", "x"}}, ""},
      {kId, kPath, Ux({{"Multiple", "x"}}), ""},
      {kId, kPath, Ux({{"Multiple", {{"other", Empty()}}}}), ""},
      {kId, kPath, Ux({{"Multiple", {{kId, 3}}}}), ""},
      {kId, kPath, Value{{"Dromon", "x"}}, ""},
      {kId, kPath, Value{{"Dromon", {{"Multiple", {{kId, Value(Array{})}}}}}}, ""},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.bundleInfo.description());
    ScopedLogCapture log;
    EXPECT_EQ(DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(r.name, r.url, r.bundleInfo, Value(),
                                                              std::nullopt),
              nullptr);
    std::vector<std::string> expected;
    if (r.line) expected.push_back(*r.line ? r.line : malformed + r.bundleInfo.description());
    EXPECT_EQ(log.lines(), expected);
  }
}

// The three layers (bundle information, top dictionary, plug-in dictionary)
// share nodes; a setter writes through to the layers above by node identity.
TEST(PlugInCoreTest, LayersShareNodesAndSettersWriteThrough) {
  const Value other{{"UXExtensionProtocol", "Q"}}, mine{{"UXExtensionProtocol", "P"}};
  const Value replacement{{"UXExtensionProtocol", "NEW"}};
  const Value singleInfo = Ux(mine);
  const Value multiInfo = Ux({{"Multiple", {{kId, mine}, {"other", other}}}});
  auto multi = Make(multiInfo);
  ASSERT_NE(multi, nullptr);
  EXPECT_TRUE(multi->bundleInfoDictionary().sameNode(multiInfo));
  EXPECT_TRUE(multi->topDictionary().sameNode(multiInfo["UXExtension"]));
  EXPECT_EQ(multi->plugInDictionary(), mine);
  EXPECT_TRUE(multi->isMultiplexed());
  multi->setPlugInDictionary(replacement);
  Value top = multi->topDictionary();
  EXPECT_TRUE(top["Multiple"][kId].sameNode(replacement));
  EXPECT_TRUE(top["Multiple"]["other"].sameNode(other));
  EXPECT_TRUE(multi->bundleInfoDictionary()["UXExtension"].sameNode(top));
  EXPECT_EQ(multiInfo["UXExtension"]["Multiple"][kId], mine);  // input untouched
  multi->setPlugInDictionary(Value());                         // absent removes the entry above
  EXPECT_EQ(multi->topDictionary()["Multiple"], (Value{{"other", other}}));

  auto single = Make(singleInfo);
  EXPECT_FALSE(single->isMultiplexed());
  EXPECT_TRUE(single->plugInDictionary().sameNode(single->topDictionary()));
  Value before = single->bundleInfoDictionary();
  single->setPlugInDictionary(single->plugInDictionary());  // the node held: nothing changes
  EXPECT_TRUE(single->bundleInfoDictionary().sameNode(before));
  Value copy(Dictionary(single->topDictionary().dictionary()));
  single->setTopDictionary(copy);  // equal contents in a new node do
  EXPECT_TRUE(single->bundleInfoDictionary()["UXExtension"].sameNode(copy));
  single->setPlugInDictionary(replacement);
  EXPECT_TRUE(single->topDictionary().sameNode(replacement));
  EXPECT_TRUE(single->bundleInfoDictionary()["UXExtension"].sameNode(replacement));
  single->setPlugInDictionary(Value());
  EXPECT_FALSE(single->bundleInfoDictionary().has("UXExtension"));

  DRPlugInCore empty;  // the first set writes nothing above
  empty.setPlugInDictionary(replacement);
  empty.setTopDictionary(replacement);
  EXPECT_TRUE(empty.bundleInfoDictionary().isAbsent());
}

class SubRecord : public DRPlugInCore {};

TEST(PlugInCoreTest, IdentityIsTheUuidAlone) {
  const Uuid id = Uuid::random();
  auto a = Make(Ux({{"x", 1}}), kPath, id);
  auto b = Make(Ux({{"y", 2}}), "/elsewhere/Other.bundle", id);
  auto sub = std::make_shared<SubRecord>();
  ASSERT_TRUE(sub->setupWithNameUrlBundleInfoInfoUuid("other", "/q", Ux(Empty()), Value(), id));
  EXPECT_TRUE(a->isEqual(b) && a->isEqual(sub.get()) && sub->isEqual(a));
  EXPECT_TRUE(a->hash() == b->hash() && a->hash() == sub->hash());
  EXPECT_FALSE(a->isEqual(nullptr));
  auto c = Make(Ux(Empty()));  // without a given UUID each record gets a fresh one
  EXPECT_FALSE(c->isEqual(Make(Ux(Empty()))));
  EXPECT_FALSE(c->isEqual(std::make_shared<DRPlugInCore>()));
  DRPlugInCore none;
  EXPECT_DEATH(none.isEqual(c.get()), "self.uuid");
  EXPECT_DEATH(none.hash(), "self.uuid");
}

TEST(PlugInCoreTest, DerivedPropertiesAndFlags) {
  struct Row {
    const char* path;
    Value pd;
    const char* flags;  // the true flags: a(pp extension) h(ybrid) d(edicated) x (data)
    std::string embeddedCodePath;
    Value embeddedProtocol;
  };
  const Value dataList(Array{"#Data"});
  const Value embed{{"EmbeddedCode", "C.bundle"}, {"UXExtensionProtocol", "P"}};
  // A protocol that is not a string is never the data one; a string never
  // makes a plug-in dedicated; embedded code that is not a name is still
  // hybrid but has no path.
  const Row rows[] = {
      {"/A/B.appex", Empty(), "a", "", Value()},
      {"/A/B.APPEX", Empty(), "", "", Value()},
      {"/A/B", {{"UXExtensionProtocol", "#Data"}}, "x", "", "#Data"},
      {"/A/B", {{"UXExtensionProtocol", dataList}}, "", "", dataList},
      {"/A/B", {{"Dedicated", true}}, "d", "", Value()},
      {"/A/B", {{"Dedicated", "YES"}}, "", "", Value()},
      {"/A/B.appex", embed.changing("EmbeddedProtocol", "E"), "ah",
       "/A/B.appex/Contents/PlugIns/C.bundle", "E"},
      {"/A/B", embed, "h", "/A/B/Contents/PlugIns/C.bundle", "P"},
      {"/A/B", {{"EmbeddedCode", 4}}, "h", "", Value()},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.path + (" " + r.pd.description()));
    auto p = Make(Ux(r.pd), r.path);
    ASSERT_NE(p, nullptr);
    const std::string flags = std::string(p->isAppExtension() ? "a" : "") +
                              (p->isHybrid() ? "h" : "") + (p->isDedicated() ? "d" : "") +
                              (p->isData() ? "x" : "");
    EXPECT_EQ(flags, r.flags);
    EXPECT_EQ(p->embeddedCodePath().value_or(""), r.embeddedCodePath);
    EXPECT_EQ(p->embeddedProtocolSpec(), r.embeddedProtocol);
  }
  // A number reads as its text.
  EXPECT_EQ(Make(Ux({{"UXExtensionAttributes", {{"UXExtensionVersion", 7}}}}))->version(), "7");
}

TEST(PlugInCoreTest, SetAnnotationValueCopiesAndNeverCreates) {
  auto p = Make(Ux(Empty()));
  p->setAnnotationValue("election", 1);
  EXPECT_TRUE(p->annotations().isAbsent());
  const Value original{{"election", 0}, {"extension", {{"k", "v"}}}};
  p->setAnnotations(original);
  p->setAnnotationValue("election", 1);
  p->setAnnotationValue("extension", Value());
  EXPECT_EQ(p->annotations(), (Value{{"election", 1}}));
  EXPECT_EQ(original, (Value{{"election", 0}, {"extension", {{"k", "v"}}}}));
}

// Entries of "Multiple" are converted as whole top dictionaries, nested ones
// too; of an old key beside its new name the one enumerated later (ascending
// bytes) wins.
TEST(NormalizeTest, ConvertsOldStyleDictionaries) {
  const struct {
    Value old, converted;
  } rows[] = {
      {{{"SDK", "S"},
        {"Protocol", "P"},
        {"Attributes",
         {{"com.corvel.version", "2"},
          {"com.corvel.identifier", "I"},
          {"com.corvel.protocol", "N"}}},
        {"Custom", true}},
       {{"UXExtensionPointIdentifier", "S"},
        {"UXExtensionProtocol", "P"},
        {"UXExtensionAttributes",
         {{"UXExtensionVersion", "2"},
          {"UXExtensionIdentifier", "I"},
          {"UXExtensionPointName", "N"}}},
        {"Custom", true}}},
      {{{"Multiple", {{"a", {{"Protocol", "PA"}, {"Multiple", {{"b", {{"SDK", "S"}}}}}}}}}},
       {{"Multiple",
         {{"a",
           {{"UXExtensionProtocol", "PA"},
            {"Multiple", {{"b", {{"UXExtensionPointIdentifier", "S"}}}}}}}}}}},
      {{{"Protocol", "old"},
        {"UXExtensionProtocol", "new"},
        {"Attributes", {{"com.corvel.version", "old"}, {"UXExtensionVersion", "new"}}}},
       {{"UXExtensionProtocol", "new"},
        {"UXExtensionAttributes", {{"UXExtensionVersion", "old"}}}}},
  };
  for (const auto& r : rows) {
    Value normal = DRPlugInCore::normalizeInfoDictionary(Value{{"Dromon", r.old}});
    EXPECT_EQ(normal["UXExtension"], r.converted);
    EXPECT_EQ(normal["Dromon"], r.old);  // still marks an old-style bundle
  }
  // With both styles present the dictionary is used as it is.
  const Value both{{"UXExtension", {{"k", 1}}}, {"Dromon", {{"Protocol", "P"}}}};
  EXPECT_TRUE(DRPlugInCore::normalizeInfoDictionary(both).sameNode(both));
  EXPECT_TRUE(DRPlugInCore::normalizeInfoDictionary(Value{{"x", 1}}).isAbsent());
}

// The plug-in wins, except that CleanTimeout is the SDK's and PassProxy and
// dictionaries merge at every depth; keys only the SDK has come whatever
// their kind; kinds that cannot merge keep the plug-in's own value.
TEST(MergeTest, PlugInWinsExceptByTheSpecialRules) {
  auto pp = [](const Value& v) { return Value{{"PassProxy", v}}; };
  struct Row {
    Value sdk, target, expected;
  };
  const Row rows[] = {
      {{{"CleanTimeout", 10}, {"Dedicated", true}, {"a", List({1})}, {"b", {{"c", "d"}}}},
       {{"CleanTimeout", 5}, {"Dedicated", false}},
       {{"CleanTimeout", 10}, {"Dedicated", false}, {"a", List({1})}, {"b", {{"c", "d"}}}}},
      {pp({{"s1", "A"}, {"s2", "B"}}), pp({{"s2", "C"}}), pp({{"s1", "A"}, {"s2", "C"}})},
      {{{"U", {{"D", {{"CleanTimeout", 3}, {"PassProxy", {{"m", 1}}}, {"keep", "sdk"}}}}}},
       {{"U", {{"D", {{"CleanTimeout", 4}, {"PassProxy", {{"n", 2}}}, {"keep", "mine"}}}}}},
       {{"U",
         {{"D", {{"CleanTimeout", 3}, {"PassProxy", {{"m", 1}, {"n", 2}}}, {"keep", "mine"}}}}}}},
      {{{"k", {{"a", 1}}}, {"PassProxy", "x"}, {"Shared", List({"a"})}},
       {{"k", "s"}, {"PassProxy", {{"m", 1}}}, {"Shared", "b"}},
       {{"k", "s"}, {"PassProxy", {{"m", 1}}}, {"Shared", "b"}}},
      {pp({{"m", 1}}), pp(7), pp(7)},
      {Value("junk"), {{"k", 1}}, {{"k", 1}}},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.sdk.description());
    const std::string sdkBefore = r.sdk.description(), targetBefore = r.target.description();
    EXPECT_EQ(DRPlugInCore::mergeDictionaryInto(r.sdk, r.target), r.expected);
    EXPECT_EQ(r.sdk.description() + r.target.description(), sdkBefore + targetBefore);
  }
  EXPECT_FALSE(DRPlugInCore::sdkOverridesKey("cleantimeout"));
  // Shared resources are a set union.
  Value merged = DRPlugInCore::mergeDictionaryInto(Value{{"Shared", List({"a", "b", "a"})}},
                                                   Value{{"Shared", List({"b", "c", 1, 1})}});
  Array got = merged["Shared"].array();
  std::sort(got.begin(), got.end(),
            [](const Value& a, const Value& b) { return a.description() < b.description(); });
  EXPECT_EQ(Value(got), List({1, "a", "b", "c"}));
}

// An app extension keeps its own protocol and class but not its shared list;
// the version comes from the attributes, else the bundle, else "1"; every
// layer, of a multiplexed bundle too, holds the very same dictionary.
TEST(CanonicalizeTest, FillsDefaults) {
  struct Row {
    const char* path;
    Value pd, bundleVersion;
    Value expected;  // protocol, principal class and shared list; absent ones must be absent
    Value format, version;
  };
  const Value dot = List({"."}), mine = List({"x"});
  const Value own{{"UXExtensionProtocol", "P"}, {"PrincipalClass", "C"}};
  const Value fallback = own.changing("UXExtensionProtocol", "UXObject")
                             .changing("PrincipalClass", "UXObject")
                             .changing("Shared", dot);
  const Value hybrid{{"EmbeddedCode", "E"},
                     {"UXExtensionAttributes", {{"com.corvel.format", "standard"}}}};
  const Row rows[] = {
      {"/p/A.appex", Empty(), Value(), fallback, "standard", "1"},
      {"/p/A.appex", own.changing("Shared", mine), Value(), own.changing("Shared", dot), "standard",
       "1"},
      {"/p/A.bundle", {{"Shared", mine}}, Value(), {{"Shared", mine}}, "standard", "1"},
      {"/p/A.bundle", hybrid, Value(), Empty(), "hybrid", "1"},
      {"/p/A.bundle", Empty(), 7, Empty(), "standard", 7},
      {"/p/A.bundle",
       {{"UXExtensionAttributes", {{"UXExtensionVersion", "2.5"}}}},
       "9",
       Empty(),
       "standard",
       "2.5"},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.path + (" " + r.pd.description()));
    auto p = Make(Value{{"UXExtension", r.pd}, {"BNBundleVersion", r.bundleVersion}}, r.path);
    ASSERT_NE(p, nullptr);
    p->canonicalize();
    Value pd = p->plugInDictionary();
    for (const char* key : {"UXExtensionProtocol", "PrincipalClass", "Shared"}) {
      EXPECT_EQ(pd[key], r.expected[key]) << key;
    }
    EXPECT_EQ(p->attributes()["com.corvel.format"], r.format);
    EXPECT_EQ(p->attributes()["UXExtensionVersion"], r.version);
    EXPECT_TRUE(p->bundleInfoDictionary()["UXExtension"].sameNode(pd));
    EXPECT_EQ(p->bundleInfoDictionary()["BNBundleVersion"], r.bundleVersion);
  }
  auto p = Make(Ux({{"Multiple", {{kId, Empty()}, {"other", {{"k", 1}}}}}}));
  p->canonicalize();
  Value entry = p->bundleInfoDictionary()["UXExtension"]["Multiple"][kId];
  EXPECT_TRUE(entry.sameNode(p->plugInDictionary()));
  EXPECT_EQ(entry["UXExtensionAttributes"]["UXExtensionVersion"], Value("1"));
  EXPECT_EQ(p->topDictionary()["Multiple"]["other"], (Value{{"k", 1}}));
}

TEST(ResolveSdkTest, MergesTheRegisteredSdkOrLogsAndFallsBack) {
  test::ScopedEnv noTestSdk("DRTEST_SDK", std::nullopt);
  const Value sdk = Ux({{"UXExtensionProtocol", "FromSdk"}, {"CleanTimeout", 10}});
  struct Row {
    Value sdkKey;
    Result<Value> registered;
    const char* line;
    bool canonicalized;
  };
  const Row rows[] = {
      {"com.example.sdk", sdk, nullptr, true},
      {Value(), Value(), nullptr, true},
      {Value(5), Value(), "invalid SDK key:5", false},
      {"com.example.sdk", Value(), "plug-in sdk \"com.example.sdk\" not registered", true},
      {"com.example.sdk", Value(List({1})), "plug-in sdk \"com.example.sdk\" not registered", true},
      {"com.example.sdk", Error("pdoc", 1, "/s/com.example.sdk.pdoc: bad"),
       "plug-in sdk \"com.example.sdk\" not registered: /s/com.example.sdk.pdoc: bad", true},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.line ? r.line : r.sdkKey.description());
    test::FakeServiceManager sm;
    sm.sdks.emplace("com.example.sdk", r.registered);
    auto p = Make(Ux({{"UXExtensionPointIdentifier", r.sdkKey}, {"CleanTimeout", 5}}));
    ScopedLogCapture log;
    p->resolveSDK(&sm);
    EXPECT_EQ(log.lines(), r.line ? Lines{r.line} : Lines{});
    EXPECT_EQ(p->attributes().has("com.corvel.format"), r.canonicalized);
    const bool merged = r.registered.ok() && r.registered->isDictionary();
    EXPECT_EQ(p->plugInDictionary()["CleanTimeout"], Value(merged ? 10 : 5));
    EXPECT_EQ(p->protocolSpec(),
              merged ? Value("FromSdk") : Value(r.canonicalized ? "UXObject" : Value()));
    EXPECT_TRUE(p->bundleInfoDictionary()["UXExtension"].sameNode(p->plugInDictionary()));
  }
}

// The test folder's SDK wins; one there that is no dictionary, broken or
// missing falls back to the registered one, silently.
TEST(ResolveSdkTest, TestFolderComesFirstAndFallsBackSilently) {
  test::BundleFixture dir;
  dir.writePdoc("sdks/com.example.sdk", Ux({{"UXExtensionProtocol", "T"}}));
  dir.writePdoc("sdks/com.example.list", List({1}));
  dir.writeFile("sdks/com.example.broken", "<pdoc><dict><key>");
  test::ScopedEnv testSdk("DRTEST_SDK", dir.path("sdks"));
  test::FakeServiceManager sm;
  const Value registered = Ux({{"UXExtensionProtocol", "R"}});
  const char* ids[] = {"com.example.list", "com.example.broken", "com.example.missing",
                       "com.example.sdk"};
  for (const char* id : ids) sm.sdks.emplace(id, registered);
  ScopedLogCapture log;
  for (const char* id : ids) {
    EXPECT_EQ(DRPlugInCore::readSDKDictionary(id, &sm)["UXExtension"]["UXExtensionProtocol"],
              Value(id == ids[3] ? "T" : "R"))
        << id;
  }
  EXPECT_EQ(sm.lookups, 3);
  EXPECT_TRUE(log.lines().empty());
}

TEST(DiagnoseTest, NamesWhatIsMissing) {
  test::ScopedEnv noTestSdk("DRTEST_SDK", std::nullopt);
  const std::string protocolMissing = "missing \"UXExtensionProtocol\" key in Info.pdoc or SDK";
  const std::string attributesMissing = "missing \"UXExtensionAttributes\" key in Info.pdoc or SDK";
  struct Row {
    const char* path;
    Value pd;
    Value sdk;          // registered for "com.example.sdk"
    std::string error;  // "" for none
  };
  const Value point{{"UXExtensionPointIdentifier", "com.example.sdk"}};
  const Value own{{"UXExtensionProtocol", "P"}};
  Value deep = Empty();  // 62 levels inside the information dictionary
  for (int i = 1; i < 60; ++i) deep = Value{{"d", deep}};
  // An invalid SDK key skips the defaults; SDK files of odd shapes never
  // crash, and what they break is refused; a protocol of the wrong kind
  // still counts.
  const Row rows[] = {
      {"/p/A.bundle", point, Value(), protocolMissing},
      {"/p/A.appex", point, Value(), ""},
      {"/p/A.bundle", point, Ux(own), ""},
      {"/p/A.appex", {{"UXExtensionPointIdentifier", 1}}, Value(), protocolMissing},
      {"/p/A.appex", own.changing("UXExtensionAttributes", "x"), Value(), attributesMissing},
      {"/p/A.appex", point, Ux("x"), ""},
      {"/p/A.appex", point, Ux({{"Multiple", {{"other", Empty()}}}}), protocolMissing},
      {"/p/A.bundle", point, Ux(own.changing("UXExtensionAttributes", "s")), attributesMissing},
      {"/p/A.bundle", point, Ux({{"UXExtensionProtocol", List({"a"})}}), ""},
      {"/p/A.appex", point, Ux({{"Deep", deep}}),
       "Info.pdoc and SDK cannot be carried in a reply: it nests deeper than the 61 levels a "
       "reply can carry"},
      {"/p/A\xff.appex", point, Value(),
       "its path or a name is not UTF-8 or holds NUL: \"/p/A\\xFF.appex\""},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.path + (" " + r.pd.description() + " " + r.sdk.description()));
    test::FakeServiceManager sm;
    if (r.sdk.isPresent()) sm.sdks.emplace("com.example.sdk", r.sdk);
    auto p = Make(Ux(r.pd), r.path);
    ASSERT_NE(p, nullptr);
    ScopedLogCapture log;
    p->resolveSDK(&sm);
    Status status = p->diagnose();
    EXPECT_EQ(status.ok() ? "" : status.error().ownDescription(), r.error);
    EXPECT_TRUE(status.ok() ||
                (status.error().domain() == "Dromon" && status.error().code() == 12));
  }
  Status status = DRPlugInCore().diagnose();
  ASSERT_FALSE(status.ok());
  EXPECT_EQ(status.error().ownDescription(),
            "missing identifier (no UXExtensionIdentifier, nor even BNBundleIdentifier)");
}

// The exported form leaves out the information file's own path (the record
// keeps it); every exported key is read back into its own place.
TEST(FormTest, ExportAndRebuildGiveAnEqualRecord) {
  auto p = Complete();
  p->setHubProtocolVersion(2);
  p->setLastModified(1700000000);
  p->setOnSystemVolume(true);
  p->setContainingUrl("/Apps/Host.app");
  p->setLocalizedName("Viewer");
  p->setLocalizedShortName("View");
  p->setLocalizedContainingName("Host");
  Value form = p->exportForm();
  EXPECT_EQ(form["version"], Value("4.1"));
  EXPECT_EQ(form["annotations"], Value::EmptyDictionary());  // never absent
  EXPECT_FALSE(form["bundleInfo"].has("BNBundleInfoPdocURL"));
  EXPECT_TRUE(p->bundleInfoDictionary().has("BNBundleInfoPdocURL"));
  EXPECT_EQ(form["info"]["CleanTimeout"], Value(3));
  auto q = DRPlugInCore::initWithForm(
      form.changing("hash", Value(Data{1, 2, 3})).changing("requirement", "anchor"));
  ASSERT_NE(q, nullptr);
  EXPECT_TRUE(q->isEqual(p));
  EXPECT_EQ(q->cdhash(), (Data{1, 2, 3}));
  EXPECT_EQ(q->requirement(), "anchor");
  EXPECT_EQ(q->exportForm(), form);
}

// Values of the wrong kind read as if the key were absent; a form without a
// usable UUID gets a fresh one.
TEST(FormTest, OptionalKeysDefaultsAndRefusedForms) {
  auto p = Complete();
  Value form = p->exportForm();
  for (const char* key : {"containingPath", "localizedContainingDisplayName",
                          "localizedDisplayName", "localizedShortName", "hash", "requirement"}) {
    EXPECT_FALSE(form.has(key)) << key;
  }
  struct Row {
    const char* key;
    Value value;
    uint64_t hub;
    bool systemResident, sameUuid;
  };
  const Row rows[] = {
      {"hubProtocolVersion", Value(), 1, false, true},
      {"hubProtocolVersion", 5, 5, false, true},
      {"hubProtocolVersion", "7", 1, false, true},
      {"lastmodified", "12", 0, false, true},
      {"systemResident", "true", 0, false, true},
      {"systemResident", 1, 0, true, true},
      {"uuid", Value(), 0, false, false},
      {"uuid", "not-a-uuid", 0, false, false},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.key + (" " + r.value.description()));
    auto q = DRPlugInCore::initWithForm(form.changing(r.key, r.value));
    ASSERT_NE(q, nullptr);
    EXPECT_EQ(q->hubProtocolVersion(), r.hub);
    EXPECT_EQ(q->lastModified(), 0);
    EXPECT_EQ(q->onSystemVolume(), r.systemResident);
    EXPECT_EQ(q->isEqual(p), r.sameUuid);
    EXPECT_TRUE(q->uuid().has_value());
  }
  const std::pair<Value, const char*> refused[] = {
      {form.changing("path", Value()), nullptr},
      {form.changing("identifier", Value()), "missing identifier in plug-in at"},
      {form.changing("bundleInfo", "x"), "malformed plug-in dictionary"},
      {Value("form"), nullptr},
  };
  for (const auto& [bad, line] : refused) {
    ScopedLogCapture log;
    EXPECT_EQ(DRPlugInCore::initWithForm(bad), nullptr) << (line ? line : "");
    ASSERT_EQ(log.lines().size(), line ? 1u : 0u);
    EXPECT_TRUE(!line || log.contains(line));
  }
}

// Only the annotations are taken; absent or not a dictionary clears them.
TEST(FormTest, UpdateFromFormReplacesOnlyAnnotations) {
  auto p = Complete();
  p->updateFromForm(Value{{"annotations", {{"election", 0}}}, {"identifier", "other"}});
  EXPECT_EQ(p->annotations(), (Value{{"election", 0}}));
  EXPECT_EQ(p->identifier(), kId);
  for (const Value& form : {Value{{"identifier", "other"}}, Value{{"annotations", "junk"}}}) {
    p->setAnnotations(Value{{"election", 1}});
    p->updateFromForm(form);
    EXPECT_TRUE(p->annotations().isAbsent()) << form.description();
  }
}

// A record whose extension-point identifier was not a string is never
// canonicalised and may have no version; its form still carries a string.
TEST(FormTest, ExportWithoutVersionStillCarriesAString) {
  auto p = DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(
      kId, "/p/A.bundle", Value{{"UXExtension", {{"UXExtensionPointIdentifier", 1}}}}, Value(),
      std::nullopt);
  ScopedLogCapture log;
  p->resolveSDK();
  EXPECT_EQ(p->exportForm()["version"], Value(""));
}

}  // namespace
}  // namespace dr
