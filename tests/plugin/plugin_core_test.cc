#include "plugin/plugin_core.h"

#include <gtest/gtest.h>

#include "core/log.h"

namespace dr {
namespace {

const char* const kId = "com.example.viewer";
const char* const kPath = "/p/Viewer.appex";

// Value{} is absent; an empty dictionary must be asked for.
Value Empty() { return Value::EmptyDictionary(); }

Value Single(Value pd) { return Value{{"UXExtension", std::move(pd)}}; }

std::shared_ptr<DRPlugInCore> Make(const Value& bundleInfo, const char* path = kPath,
                                   std::optional<Uuid> uuid = std::nullopt) {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, bundleInfo, Value(), uuid);
}

TEST(PlugInCoreTest, SetupRefusesMalformedInputWithItsLogLine) {
  struct Row {
    const char* what;
    std::optional<std::string> name;
    std::optional<std::string> url;
    Value bundleInfo;
    const char* line;  // the one expected log line; nullptr: none
  };
  const std::string malformed =
      "malformed plug-in dictionary in plug-in com.example.viewer at "
      "/p/Viewer.appex: ";
  const std::string junk = malformed + "junk";
  const Row rows[] = {
      {"no url", kId, std::nullopt, Single(Empty()), nullptr},
      {"no name", std::nullopt, kPath, Single(Empty()),
       "missing identifier in plug-in at /p/Viewer.appex"},
      {"no info", kId, kPath, Value(),
       "missing Info dictionary in plug-in com.example.viewer at /p/Viewer.appex"},
      {"info is a string", kId, kPath, Value("junk"), junk.c_str()},
      {"info is an array", kId, kPath, Value(Array{1}), ""},
      {"neither style", kId, kPath, Value{{"BNBundleVersion", "1"}}, ""},
      {"top is a string", kId, kPath, Value{{"UXExtension", "x"}}, ""},
      {"top is an array", kId, kPath, Value{{"UXExtension", Value(Array{})}}, ""},
      {"Multiple is a string", kId, kPath, Single({{"Multiple", "x"}}), ""},
      {"Multiple lacks this plug-in", kId, kPath, Single({{"Multiple", {{"other", Empty()}}}}), ""},
      {"entry is a number", kId, kPath, Single({{"Multiple", {{kId, 3}}}}), ""},
      {"old style top is a string", kId, kPath, Value{{"Dromon", "x"}}, ""},
      {"old style Multiple is a number", kId, kPath, Value{{"Dromon", {{"Multiple", 5}}}}, ""},
      {"old style entry is an array", kId, kPath,
       Value{{"Dromon", {{"Multiple", {{kId, Value(Array{})}}}}}}, ""},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    ScopedLogCapture log;
    EXPECT_EQ(DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(r.name, r.url, r.bundleInfo, Value(),
                                                              std::nullopt),
              nullptr);
    // A malformed dictionary is shown as it was given, not normalised.
    const std::string expected = r.line && !*r.line ? malformed + r.bundleInfo.description()
                                 : r.line           ? r.line
                                                    : "";
    EXPECT_EQ(log.lines(),
              r.line ? std::vector<std::string>{expected} : std::vector<std::string>{});
  }
}

TEST(PlugInCoreTest, SetupBuildsTheThreeLayers) {
  Value mine{{"UXExtensionProtocol", "P"}};
  Value top{{"Multiple", {{kId, mine}, {"com.example.other", {{"UXExtensionProtocol", "Q"}}}}}};
  Value info{{"UXExtension", top}, {"BNBundleVersion", "3"}};
  auto multi = Make(info);
  ASSERT_NE(multi, nullptr);
  EXPECT_TRUE(multi->bundleInfoDictionary().sameNode(info));
  EXPECT_TRUE(multi->topDictionary().sameNode(top));
  EXPECT_EQ(multi->plugInDictionary(), mine);
  EXPECT_TRUE(multi->isMultiplexed());
  auto single = Make(Single(mine));
  EXPECT_TRUE(single->plugInDictionary().sameNode(single->topDictionary()));
  EXPECT_FALSE(single->isMultiplexed());
}

TEST(PlugInCoreTest, LayerSettersWriteThroughByNodeIdentity) {
  const Value other{{"UXExtensionProtocol", "Q"}};
  const Value replacement{{"UXExtensionProtocol", "NEW"}};
  const Value singleInfo = Single({{"UXExtensionProtocol", "P"}});
  const Value multiInfo = Single({{"Multiple", {{kId, {{"a", 1}}}, {"other", other}}}});

  {  // one plug-in: the new dictionary becomes the top dictionary itself
    auto r = Make(singleInfo);
    r->setPlugInDictionary(replacement);
    EXPECT_TRUE(r->plugInDictionary().sameNode(replacement));
    EXPECT_TRUE(r->topDictionary().sameNode(replacement));
    EXPECT_TRUE(r->bundleInfoDictionary()["UXExtension"].sameNode(replacement));
    EXPECT_EQ(singleInfo["UXExtension"]["UXExtensionProtocol"], Value("P"));  // input untouched
  }
  {  // several plug-ins: only this plug-in's entry changes
    auto r = Make(multiInfo);
    r->setPlugInDictionary(replacement);
    Value top = r->topDictionary();
    EXPECT_TRUE(top["Multiple"][kId].sameNode(replacement));
    EXPECT_TRUE(top["Multiple"]["other"].sameNode(other));
    EXPECT_TRUE(r->bundleInfoDictionary()["UXExtension"].sameNode(top));
    EXPECT_EQ(multiInfo["UXExtension"]["Multiple"][kId], (Value{{"a", 1}}));
  }
  {  // the node already held changes nothing above; equal contents in a new node do
    auto r = Make(singleInfo);
    Value before = r->bundleInfoDictionary();
    r->setPlugInDictionary(r->plugInDictionary());
    EXPECT_TRUE(r->bundleInfoDictionary().sameNode(before));
    Value copy(Dictionary(r->topDictionary().dictionary()));
    r->setTopDictionary(copy);
    EXPECT_FALSE(r->bundleInfoDictionary().sameNode(before));
    EXPECT_TRUE(r->bundleInfoDictionary()["UXExtension"].sameNode(copy));
  }
  {  // absent removes the entry from the layer above
    auto r = Make(multiInfo);
    r->setPlugInDictionary(Value());
    EXPECT_FALSE(r->topDictionary()["Multiple"].has(kId));
    EXPECT_TRUE(r->topDictionary()["Multiple"].has("other"));
    auto s = Make(singleInfo);
    s->setPlugInDictionary(Value());
    EXPECT_FALSE(s->bundleInfoDictionary().has("UXExtension"));
  }
  {  // an empty record: the first set writes nothing above
    DRPlugInCore r;
    r.setPlugInDictionary(replacement);
    EXPECT_TRUE(r.topDictionary().isAbsent());
    EXPECT_TRUE(r.bundleInfoDictionary().isAbsent());
    r.setTopDictionary(replacement);
    EXPECT_TRUE(r.bundleInfoDictionary().isAbsent());
  }
}

class SubRecord : public DRPlugInCore {};

TEST(PlugInCoreTest, IdentityIsTheUuidAlone) {
  const Uuid id = Uuid::random();
  auto a = Make(Single({{"x", 1}}), kPath, id);
  auto b = Make(Single({{"y", 2}}), "/elsewhere/Other.bundle", id);
  auto sub = std::make_shared<SubRecord>();
  ASSERT_TRUE(sub->setupWithNameUrlBundleInfoInfoUuid("other", "/q", Single(Empty()), Value(), id));
  EXPECT_TRUE(a->isEqual(b) && a->isEqual(sub.get()) && sub->isEqual(a));
  EXPECT_EQ(a->hash(), b->hash());
  EXPECT_EQ(a->hash(), sub->hash());
  EXPECT_FALSE(a->isEqual(nullptr));
  // Without a given UUID each record gets a fresh one.
  auto c = Make(Single(Empty()));
  EXPECT_FALSE(c->isEqual(Make(Single(Empty()))));
  EXPECT_FALSE(c->isEqual(std::make_shared<DRPlugInCore>()));
}

TEST(PlugInCoreDeathTest, ComparingARecordWithoutUuidStops) {
  DRPlugInCore empty;
  auto other = Make(Single(Empty()));
  EXPECT_DEATH(empty.isEqual(other.get()), "self.uuid");
  EXPECT_DEATH(empty.hash(), "self.uuid");
}

TEST(PlugInCoreTest, DerivedPropertiesAndFlags) {
  struct Row {
    const char* path;
    Value pd;
    const char* flags;             // the true flags: a(pp extension) h(ybrid) d(edicated) x (data)
    std::string embeddedCodePath;  // "" for none
    Value embeddedProtocol;
  };
  const Value dataList(Array{"#Data"});
  const Value embed{{"EmbeddedCode", "C.bundle"}, {"UXExtensionProtocol", "P"}};
  const Row rows[] = {
      {"/A/B.appex", Empty(), "a", "", Value()},
      {"/A/B.APPEX", Empty(), "", "", Value()},
      {"/A/B", {{"UXExtensionProtocol", "#Data"}}, "x", "", "#Data"},
      // A protocol specification that is not a string is never the data one.
      {"/A/B", {{"UXExtensionProtocol", dataList}}, "", "", dataList},
      {"/A/B", {{"Dedicated", true}}, "d", "", Value()},
      // A string never makes a plug-in dedicated.
      {"/A/B", {{"Dedicated", "YES"}}, "", "", Value()},
      {"/A/B.appex", embed.changing("EmbeddedProtocol", "E"), "ah",
       "/A/B.appex/Contents/PlugIns/C.bundle", "E"},
      {"/A/B", embed, "h", "/A/B/Contents/PlugIns/C.bundle", "P"},
      // Embedded code that is not a name is still hybrid but has no path.
      {"/A/B", {{"EmbeddedCode", 4}}, "h", "", Value()},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.path + (" " + r.pd.description()));
    auto p = Make(Single(r.pd), r.path);
    ASSERT_NE(p, nullptr);
    const std::string flags = std::string(p->isAppExtension() ? "a" : "") +
                              (p->isHybrid() ? "h" : "") + (p->isDedicated() ? "d" : "") +
                              (p->isData() ? "x" : "");
    EXPECT_EQ(flags, r.flags);
    EXPECT_EQ(p->embeddedCodePath().value_or(""), r.embeddedCodePath);
    EXPECT_EQ(p->embeddedProtocolSpec(), r.embeddedProtocol);
  }

  // A number reads as its text.
  EXPECT_EQ(Make(Single({{"UXExtensionAttributes", {{"UXExtensionVersion", 7}}}}))->version(), "7");
}

TEST(PlugInCoreTest, SetAnnotationValueCopiesAndNeverCreates) {
  auto p = Make(Single(Empty()));
  p->setAnnotationValue("election", 1);
  EXPECT_TRUE(p->annotations().isAbsent());

  const Value original{{"election", 0}, {"extension", {{"k", "v"}}}};
  p->setAnnotations(original);
  p->setAnnotationValue("election", 1);
  EXPECT_EQ(p->annotations()["election"], Value(1));
  p->setAnnotationValue("extension", Value());
  EXPECT_FALSE(p->annotations().has("extension"));
  EXPECT_EQ(original["election"], Value(0));  // the old dictionary is untouched
  EXPECT_TRUE(original.has("extension"));
}

}  // namespace
}  // namespace dr
