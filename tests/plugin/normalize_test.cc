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

TEST(NormalizeTest, ConvertsOldStyleDictionaries) {
  const struct {
    Value old, converted;
  } rows[] = {
      {{{"SDK", "com.example.sdk"},
        {"Protocol", "P"},
        {"Attributes",
         {{"com.corvel.version", "2"},
          {"com.corvel.identifier", "I"},
          {"com.corvel.protocol", "N"},
          {"other", 1}}},
        {"Custom", true}},
       {{"UXExtensionPointIdentifier", "com.example.sdk"},
        {"UXExtensionProtocol", "P"},
        {"UXExtensionAttributes",
         {{"UXExtensionVersion", "2"},
          {"UXExtensionIdentifier", "I"},
          {"UXExtensionPointName", "N"},
          {"other", 1}}},
        {"Custom", true}}},
      // Entries of "Multiple" are converted as whole top dictionaries, nested ones too.
      {{{"Multiple", {{"a", {{"Protocol", "PA"}, {"Multiple", {{"b", {{"SDK", "S"}}}}}}}}}},
       {{"Multiple",
         {{"a",
           {{"UXExtensionProtocol", "PA"},
            {"Multiple", {{"b", {{"UXExtensionPointIdentifier", "S"}}}}}}}}}}},
      // An old key beside its new name: the one enumerated later (ascending
      // bytes) wins.
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

TEST(MergeTest, PlugInWinsExceptByTheSpecialRules) {
  auto pp = [](const Value& v) { return Value{{"PassProxy", v}}; };
  struct Row {
    Value sdk, target, expected;
  };
  const Row rows[] = {
      // CleanTimeout is the SDK's; the rest the plug-in's; keys only the SDK
      // has come whatever their kind.
      {{{"CleanTimeout", 10}, {"Dedicated", true}, {"a", List({1})}, {"b", {{"c", "d"}}}},
       {{"CleanTimeout", 5}, {"Dedicated", false}, {"x", 1}},
       {{"CleanTimeout", 10},
        {"Dedicated", false},
        {"a", List({1})},
        {"b", {{"c", "d"}}},
        {"x", 1}}},
      // PassProxy merges per message.
      {pp({{"s1", "A"}, {"s2", "B"}}), pp({{"s2", "C"}}), pp({{"s1", "A"}, {"s2", "C"}})},
      // Dictionaries merge at every depth, with the rules.
      {{{"U",
         {{"D", {{"CleanTimeout", 3}, {"PassProxy", {{"m", 1}}}, {"keep", "sdk"}}}, {"new", 1}}}},
       {{"U", {{"D", {{"CleanTimeout", 4}, {"PassProxy", {{"n", 2}}}, {"keep", "mine"}}}}}},
       {{"U",
         {{"D", {{"CleanTimeout", 3}, {"PassProxy", {{"m", 1}, {"n", 2}}}, {"keep", "mine"}}},
          {"new", 1}}}}},
      // Kinds that cannot merge keep the plug-in's own value.
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
    EXPECT_EQ(r.sdk.description(), sdkBefore);
    EXPECT_EQ(r.target.description(), targetBefore);
  }
  EXPECT_TRUE(DRPlugInCore::sdkOverridesKey("CleanTimeout"));
  EXPECT_FALSE(DRPlugInCore::sdkOverridesKey("cleantimeout"));
}

TEST(MergeTest, SharedResourcesAreASetUnion) {
  Value merged =
      DRPlugInCore::mergeDictionaryInto(Value{{"Nested", {{"Shared", List({"a", "b", "a"})}}}},
                                        Value{{"Nested", {{"Shared", List({"b", "c", 1, 1})}}}});
  Array got = merged["Nested"]["Shared"].array();
  ASSERT_EQ(got.size(), 4u);
  for (const Value& want : {Value("a"), Value("b"), Value("c"), Value(1)}) {
    EXPECT_EQ(std::count(got.begin(), got.end(), want), 1) << want.description();
  }
}

TEST(CanonicalizeTest, FillsDefaults) {
  struct Row {
    const char* path;
    Value pd;
    Value bundleVersion;
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
      // An app extension keeps its own protocol and class but not its shared list.
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
    Value info{{"UXExtension", r.pd}, {"BNBundleVersion", r.bundleVersion}};
    auto p = Make(info, r.path);
    ASSERT_NE(p, nullptr);
    p->canonicalize();
    Value pd = p->plugInDictionary();
    for (const char* key : {"UXExtensionProtocol", "PrincipalClass", "Shared"}) {
      EXPECT_EQ(pd[key], r.expected[key]) << key;
    }
    EXPECT_EQ(p->attributes()["com.corvel.format"], r.format);
    EXPECT_EQ(p->attributes()["UXExtensionVersion"], r.version);
    // All three layers hold the very same plug-in dictionary.
    EXPECT_TRUE(p->topDictionary().sameNode(pd));
    EXPECT_TRUE(p->bundleInfoDictionary()["UXExtension"].sameNode(pd));
    EXPECT_EQ(p->bundleInfoDictionary()["BNBundleVersion"], r.bundleVersion);
  }
}

TEST(CanonicalizeTest, ReachesEveryLayerOfAMultiplexedBundle) {
  Value info{{"UXExtension", {{"Multiple", {{kId, Empty()}, {"other", {{"k", 1}}}}}}}};
  auto p = Make(info);
  p->canonicalize();
  Value entry = p->bundleInfoDictionary()["UXExtension"]["Multiple"][kId];
  EXPECT_TRUE(entry.sameNode(p->plugInDictionary()));
  EXPECT_EQ(entry["UXExtensionAttributes"]["UXExtensionVersion"], Value("1"));
  EXPECT_EQ(p->topDictionary()["Multiple"]["other"], (Value{{"k", 1}}));
}

TEST(ResolveSdkTest, MergesTheRegisteredSdkAndCanonicalizes) {
  test::ScopedEnv noTestSdk("DRTEST_SDK", std::nullopt);
  test::FakeServiceManager sm;
  sm.sdks.emplace("com.example.sdk",
                  Value{{"UXExtension",
                         {{"UXExtensionProtocol", "FromSdk"},
                          {"CleanTimeout", 10},
                          {"UXExtensionAttributes", {{"UXExtensionPointName", "viewer"}}}}}});
  auto p = Make(Value{{"UXExtension",
                       {{"UXExtensionPointIdentifier", "com.example.sdk"}, {"CleanTimeout", 5}}}},
                "/p/Viewer.bundle");
  ScopedLogCapture log;
  p->resolveSDK(&sm);
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(p->protocolSpec(), Value("FromSdk"));
  EXPECT_EQ(p->plugInDictionary()["CleanTimeout"], Value(10));
  EXPECT_EQ(p->attributes()["UXExtensionPointName"], Value("viewer"));
  EXPECT_EQ(p->version(), "1");
  EXPECT_TRUE(p->bundleInfoDictionary()["UXExtension"].sameNode(p->plugInDictionary()));
  EXPECT_TRUE(p->diagnose().ok());
}

TEST(ResolveSdkTest, LogsAndFallsBack) {
  test::ScopedEnv noTestSdk("DRTEST_SDK", std::nullopt);
  struct Row {
    const char* what;
    Value sdkKey;
    Result<Value> registered;
    const char* line;
    bool canonicalized;
  };
  const Row rows[] = {
      {"no extension point", Value(), Value(), nullptr, true},
      {"not a string", Value(5), Value(), "invalid SDK key:5", false},
      {"not registered", Value("com.example.sdk"), Value(),
       "plug-in sdk \"com.example.sdk\" not registered", true},
      {"registry answers a non-dictionary", Value("com.example.sdk"), Value(List({1})),
       "plug-in sdk \"com.example.sdk\" not registered", true},
      {"registered file unreadable", Value("com.example.sdk"),
       Error("pdoc", 1, "/s/com.example.sdk.pdoc: bad"),
       "plug-in sdk \"com.example.sdk\" not registered: /s/com.example.sdk.pdoc: bad", true},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    test::FakeServiceManager sm;
    sm.sdks.emplace("com.example.sdk", r.registered);
    auto p = Make(Value{{"UXExtension", {{"UXExtensionPointIdentifier", r.sdkKey}}}});
    ScopedLogCapture log;
    p->resolveSDK(&sm);
    EXPECT_EQ(log.lines(), r.line ? Lines{r.line} : Lines{});
    EXPECT_EQ(p->attributes().has("com.corvel.format"), r.canonicalized);
  }
}

TEST(ResolveSdkTest, TestFolderComesFirstAndFallsBackSilently) {
  test::BundleFixture dir;
  dir.writePdoc("sdks/com.example.sdk", Value{{"UXExtension", {{"UXExtensionProtocol", "T"}}}});
  dir.writePdoc("sdks/com.example.list", List({1}));
  dir.writeFile("sdks/com.example.broken", "<pdoc><dict><key>");
  test::ScopedEnv testSdk("DRTEST_SDK", dir.path("sdks"));
  test::FakeServiceManager sm;
  const Value registered{{"UXExtension", {{"UXExtensionProtocol", "R"}}}};
  for (const char* id :
       {"com.example.sdk", "com.example.list", "com.example.broken", "com.example.missing"}) {
    sm.sdks.emplace(id, registered);
  }

  ScopedLogCapture log;
  EXPECT_EQ(
      DRPlugInCore::readSDKDictionary("com.example.sdk", &sm)["UXExtension"]["UXExtensionProtocol"],
      Value("T"));
  EXPECT_EQ(sm.lookups, 0);
  for (const char* id : {"com.example.list", "com.example.broken", "com.example.missing"}) {
    SCOPED_TRACE(id);
    EXPECT_EQ(DRPlugInCore::readSDKDictionary(id, &sm), registered);
  }
  EXPECT_EQ(sm.lookups, 3);
  EXPECT_TRUE(log.lines().empty());
}

TEST(DiagnoseTest, NamesWhatIsMissing) {
  test::ScopedEnv noTestSdk("DRTEST_SDK", std::nullopt);
  const std::string protocolMissing = "missing \"UXExtensionProtocol\" key in Info.pdoc or SDK";
  const std::string attributesMissing = "missing \"UXExtensionAttributes\" key in Info.pdoc or SDK";
  struct Row {
    const char* what;
    const char* path;
    Value pd;
    Value sdk;          // registered for "com.example.sdk"
    std::string error;  // "" for none
  };
  const Value point{{"UXExtensionPointIdentifier", "com.example.sdk"}};
  const Value own{{"UXExtensionProtocol", "P"}};
  Value deep = Empty();  // 62 levels inside the information dictionary
  for (int i = 1; i < 60; ++i) deep = Value{{"d", deep}};
  const Row rows[] = {
      {"plain bundle without protocol", "/p/A.bundle", point, Value(), protocolMissing},
      {"app extension gets the default", "/p/A.appex", point, Value(), ""},
      {"protocol from the SDK", "/p/A.bundle", point, Ux(own), ""},
      {"invalid SDK key skips the defaults",
       "/p/A.appex",
       {{"UXExtensionPointIdentifier", 1}},
       Value(),
       protocolMissing},
      {"attributes not a dictionary", "/p/A.appex", own.changing("UXExtensionAttributes", "x"),
       Value(), attributesMissing},
      // SDK files of odd shapes never crash; what they break is refused.
      {"SDK top is a string", "/p/A.appex", point, Ux("x"), ""},
      {"SDK brings a Multiple", "/p/A.appex", point, Ux({{"Multiple", {{"other", Empty()}}}}),
       protocolMissing},
      {"SDK attributes are a string", "/p/A.bundle", point,
       Ux(own.changing("UXExtensionAttributes", "s")), attributesMissing},
      {"SDK protocol wrong kind still counts", "/p/A.bundle", point,
       Ux({{"UXExtensionProtocol", List({"a"})}}), ""},
      // What a reply could not carry: every reply offering it would fail.
      {"SDK nests too deep", "/p/A.appex", point, Ux({{"Deep", deep}}),
       "Info.pdoc and SDK cannot be carried in a reply: it nests deeper than the 61 levels a "
       "reply can carry"},
      {"path not UTF-8", "/p/A\xff.appex", point, Value(),
       "its path or a name is not UTF-8 or holds NUL: \"/p/A\\xFF.appex\""},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    test::FakeServiceManager sm;
    if (r.sdk.isPresent()) sm.sdks.emplace("com.example.sdk", r.sdk);
    auto p = Make(Ux(r.pd), r.path);
    ASSERT_NE(p, nullptr);
    ScopedLogCapture log;
    p->resolveSDK(&sm);
    Status status = p->diagnose();
    EXPECT_EQ(status.ok() ? "" : status.error().ownDescription().value_or(""), r.error);
    EXPECT_TRUE(status.ok() ||
                (status.error().domain() == "Dromon" && status.error().code() == 12));
  }

  DRPlugInCore empty;
  Status status = empty.diagnose();
  ASSERT_FALSE(status.ok());
  EXPECT_EQ(status.error().ownDescription(),
            "missing identifier (no UXExtensionIdentifier, nor even BNBundleIdentifier)");
}

}  // namespace
}  // namespace dr
