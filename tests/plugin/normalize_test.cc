// Old-style conversion, the SDK merge, canonicalisation and diagnosis.
#include <gtest/gtest.h>

#include <algorithm>

#include "core/log.h"
#include "plugin/plugin_core.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/fake_service_manager.h"

namespace dr {
namespace {

const char* const kId = "com.example.viewer";

using Lines = std::vector<std::string>;

Value Empty() { return Value::EmptyDictionary(); }
Value Ux(const Value& top) { return Value{{"UXExtension", top}}; }
Value List(Array a) { return Value(std::move(a)); }

std::shared_ptr<DRPlugInCore> Make(const Value& info, const char* path = "/p/Viewer.appex") {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, info, Value(), std::nullopt);
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
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.path + (" " + r.pd.description() + " " + r.sdk.description()));
    test::FakeServiceManager sm;
    if (r.sdk.isPresent()) sm.sdks.emplace("com.example.sdk", r.sdk);
    auto p = Make(Ux(r.pd), r.path);
    ASSERT_NE(p, nullptr);
    ScopedLogCapture log;
    p->resolveSDK(&sm);
    std::optional<Error> error = p->diagnose();
    EXPECT_EQ(error ? error->ownDescription() : "", r.error);
    EXPECT_TRUE(!error || (error->domain() == "Dromon" && error->code() == 12));
  }
  std::optional<Error> error = DRPlugInCore().diagnose();
  EXPECT_EQ(error.value_or(Error("", 0)).ownDescription(),
            "missing identifier (no UXExtensionIdentifier, nor even BNBundleIdentifier)");
}

}  // namespace
}  // namespace dr
