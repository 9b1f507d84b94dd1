// Old-style conversion, the SDK merge, canonicalisation and diagnosis.
#include <gtest/gtest.h>

#include <algorithm>

#include "core/log.h"
#include "model/plugin_core.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/fake_service_manager.h"

namespace dr {
namespace {

const char* const kId = "com.example.viewer";

Value Empty() { return Value::EmptyDictionary(); }
Value List(Array a) { return Value(std::move(a)); }

std::shared_ptr<DRPlugInCore> Make(const Value& info, const char* path = "/p/Viewer.appex") {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, info, Value(), std::nullopt);
}

TEST(NormalizeTest, ConvertsOldStyleDictionaries) {
  const Value oldStyle{{"Dromon",
                        {{"SDK", "com.example.sdk"},
                         {"Protocol", "P"},
                         {"Attributes",
                          {{"com.corvel.version", "2"},
                           {"com.corvel.identifier", "I"},
                           {"com.corvel.protocol", "N"},
                           {"other", 1}}},
                         {"Custom", true}}}};
  Value normal = DRPlugInCore::normalizeInfoDictionary(oldStyle);
  EXPECT_EQ(normal["UXExtension"], (Value{{"UXExtensionPointIdentifier", "com.example.sdk"},
                                          {"UXExtensionProtocol", "P"},
                                          {"UXExtensionAttributes",
                                           {{"UXExtensionVersion", "2"},
                                            {"UXExtensionIdentifier", "I"},
                                            {"UXExtensionPointName", "N"},
                                            {"other", 1}}},
                                          {"Custom", true}}));
  EXPECT_EQ(normal["Dromon"], oldStyle["Dromon"]);  // still marks an old-style bundle

  // Entries of "Multiple" are converted as whole top dictionaries, nested ones too.
  const Value multiple{
      {"Dromon",
       {{"Multiple", {{"a", {{"Protocol", "PA"}, {"Multiple", {{"b", {{"SDK", "S"}}}}}}}}}}}};
  EXPECT_EQ(DRPlugInCore::normalizeInfoDictionary(multiple)["UXExtension"],
            (Value{{"Multiple",
                    {{"a",
                      {{"UXExtensionProtocol", "PA"},
                       {"Multiple", {{"b", {{"UXExtensionPointIdentifier", "S"}}}}}}}}}}));

  // With both styles present the dictionary is used as it is.
  const Value both{{"UXExtension", {{"k", 1}}}, {"Dromon", {{"Protocol", "P"}}}};
  EXPECT_TRUE(DRPlugInCore::normalizeInfoDictionary(both).sameNode(both));
  EXPECT_TRUE(DRPlugInCore::normalizeInfoDictionary(Value{{"x", 1}}).isAbsent());

  // An old key beside its new name: the one enumerated later (ascending
  // bytes) wins, so "UXExtensionProtocol" beats "Protocol" but
  // "com.corvel.version" beats "UXExtensionVersion".
  const Value clash{
      {"Dromon",
       {{"Protocol", "old"},
        {"UXExtensionProtocol", "new"},
        {"Attributes", {{"com.corvel.version", "old"}, {"UXExtensionVersion", "new"}}}}}};
  Value top = DRPlugInCore::normalizeInfoDictionary(clash)["UXExtension"];
  EXPECT_EQ(top["UXExtensionProtocol"], Value("new"));
  EXPECT_EQ(top["UXExtensionAttributes"]["UXExtensionVersion"], Value("old"));
}

TEST(MergeTest, PlugInWinsExceptByTheSpecialRules) {
  struct Row {
    const char* what;
    Value sdk, target, expected;
  };
  const Row rows[] = {
      {"CleanTimeout is the SDK's; others the plug-in's",
       {{"CleanTimeout", 10}, {"Dedicated", true}},
       {{"CleanTimeout", 5}, {"Dedicated", false}},
       {{"CleanTimeout", 10}, {"Dedicated", false}}},
      {"keys only the SDK has come whatever their type",
       {{"a", List({1})}, {"b", {{"c", "d"}}}, {"e", "f"}},
       {{"x", 1}},
       {{"a", List({1})}, {"b", {{"c", "d"}}}, {"e", "f"}, {"x", 1}}},
      {"PassProxy merges per message",
       {{"PassProxy", {{"s1", "A"}, {"s2", "B"}}}},
       {{"PassProxy", {{"s2", "C"}}}},
       {{"PassProxy", {{"s1", "A"}, {"s2", "C"}}}}},
      {"dictionaries merge at every depth, with the rules",
       {{"UXExtension",
         {{"CleanTimeout", 10},
          {"Deep", {{"CleanTimeout", 3}, {"PassProxy", {{"m", 1}}}, {"keep", "sdk"}}},
          {"new", 1}}}},
       {{"UXExtension",
         {{"CleanTimeout", 5},
          {"Deep", {{"CleanTimeout", 4}, {"PassProxy", {{"n", 2}}}, {"keep", "mine"}}}}}},
       {{"UXExtension",
         {{"CleanTimeout", 10},
          {"Deep", {{"CleanTimeout", 3}, {"PassProxy", {{"m", 1}, {"n", 2}}}, {"keep", "mine"}}},
          {"new", 1}}}}},
      // Kinds that cannot merge keep the plug-in's own value.
      {"SDK dictionary against a plug-in string", {{"k", {{"a", 1}}}}, {{"k", "s"}}, {{"k", "s"}}},
      {"PassProxy that is not a dictionary",
       {{"PassProxy", "x"}},
       {{"PassProxy", {{"m", 1}}}},
       {{"PassProxy", {{"m", 1}}}}},
      {"plug-in PassProxy not a dictionary",
       {{"PassProxy", {{"m", 1}}}},
       {{"PassProxy", 7}},
       {{"PassProxy", 7}}},
      {"Shared that is not an array",
       {{"Shared", List({"a"})}},
       {{"Shared", "b"}},
       {{"Shared", "b"}}},
      {"SDK is not a dictionary", Value("junk"), {{"k", 1}}, {{"k", 1}}},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
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
  const Row rows[] = {
      {"/p/A.appex",
       Empty(),
       Value(),
       {{"UXExtensionProtocol", "UXObject"}, {"PrincipalClass", "UXObject"}, {"Shared", dot}},
       "standard",
       "1"},
      // An app extension keeps its own protocol and class but not its shared list.
      {"/p/A.appex",
       {{"UXExtensionProtocol", "P"}, {"PrincipalClass", "C"}, {"Shared", mine}},
       Value(),
       {{"UXExtensionProtocol", "P"}, {"PrincipalClass", "C"}, {"Shared", dot}},
       "standard",
       "1"},
      {"/p/A.bundle", {{"Shared", mine}}, Value(), {{"Shared", mine}}, "standard", "1"},
      {"/p/A.bundle",
       {{"EmbeddedCode", "E"}, {"UXExtensionAttributes", {{"com.corvel.format", "standard"}}}},
       Value(),
       Empty(),
       "hybrid",
       "1"},
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
  EXPECT_FALSE(p->diagnose().has_value());
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
    std::vector<std::string> lines = log.lines();
    if (r.line) {
      EXPECT_EQ(lines, std::vector<std::string>{r.line});
    } else {
      EXPECT_TRUE(lines.empty());
    }
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
  const char* const protocolMissing = "missing \"UXExtensionProtocol\" key in Info.pdoc or SDK";
  const char* const attributesMissing = "missing \"UXExtensionAttributes\" key in Info.pdoc or SDK";
  struct Row {
    const char* what;
    const char* path;
    Value pd;
    Value sdk;  // registered for "com.example.sdk"
    const char* error;
  };
  const Value point{{"UXExtensionPointIdentifier", "com.example.sdk"}};
  const Row rows[] = {
      {"plain bundle without protocol", "/p/A.bundle", point, Value(), protocolMissing},
      {"app extension gets the default", "/p/A.appex", point, Value(), nullptr},
      {"protocol from the SDK", "/p/A.bundle", point,
       Value{{"UXExtension", {{"UXExtensionProtocol", "P"}}}}, nullptr},
      {"invalid SDK key skips the defaults",
       "/p/A.appex",
       {{"UXExtensionPointIdentifier", 1}},
       Value(),
       protocolMissing},
      {"attributes that are not a dictionary",
       "/p/A.appex",
       {{"UXExtensionAttributes", "x"}, {"UXExtensionProtocol", "P"}},
       Value(),
       attributesMissing},
      // SDK files of odd shapes never crash; what they break is refused.
      {"SDK top is a string", "/p/A.appex", point, Value{{"UXExtension", "x"}}, nullptr},
      {"SDK brings a Multiple", "/p/A.appex", point,
       Value{{"UXExtension", {{"Multiple", {{"other", Empty()}}}}}}, protocolMissing},
      {"SDK attributes are a string", "/p/A.bundle", point,
       Value{{"UXExtension", {{"UXExtensionAttributes", "s"}, {"UXExtensionProtocol", "P"}}}},
       attributesMissing},
      {"SDK protocol wrong kind still counts", "/p/A.bundle", point,
       Value{{"UXExtension", {{"UXExtensionProtocol", List({"a"})}}}}, nullptr},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    test::FakeServiceManager sm;
    if (r.sdk.isPresent()) sm.sdks.emplace("com.example.sdk", r.sdk);
    auto p = Make(Value{{"UXExtension", r.pd}}, r.path);
    ASSERT_NE(p, nullptr);
    ScopedLogCapture log;
    p->resolveSDK(&sm);
    std::optional<Error> error = p->diagnose();
    if (r.error == nullptr) {
      EXPECT_FALSE(error.has_value()) << error->description();
      continue;
    }
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->domain(), "Dromon");
    EXPECT_EQ(error->code(), 12);
    EXPECT_EQ(error->ownDescription(), r.error);
  }

  DRPlugInCore empty;
  std::optional<Error> error = empty.diagnose();
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(error->ownDescription(),
            "missing identifier (no UXExtensionIdentifier, nor even BNBundleIdentifier)");
}

}  // namespace
}  // namespace dr
