#include "plugin/plugin_core.h"

#include <gtest/gtest.h>

#include "core/log.h"

namespace dr {
namespace {

const char* const kId = "com.example.viewer";
const char* const kPath = "/p/Viewer.appex";

Value Empty() { return Value::EmptyDictionary(); }
Value Single(Value pd) { return Value{{"UXExtension", std::move(pd)}}; }

std::shared_ptr<DRPlugInCore> Make(const Value& bundleInfo, const char* path = kPath,
                                   std::optional<Uuid> uuid = std::nullopt) {
  return DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(kId, path, bundleInfo, Value(), uuid);
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
      {kId, std::nullopt, Single(Empty()), nullptr},
      {std::nullopt, kPath, Single(Empty()), "missing identifier in plug-in at /p/Viewer.appex"},
      {kId, kPath, Value(),
       "missing Info dictionary in plug-in com.example.viewer at /p/Viewer.appex"},
      {kId, kPath, Value("junk"), ""},
      {kId, kPath, Value(Array{1}), ""},
      {kId, kPath, Value{{"BNBundleVersion", "1"}}, ""},
      {kId, kPath, Value{{"UXExtension", "x"}}, ""},
      {kId, kPath, Single({{"Multiple", "x"}}), ""},
      {kId, kPath, Single({{"Multiple", {{"other", Empty()}}}}), ""},
      {kId, kPath, Single({{"Multiple", {{kId, 3}}}}), ""},
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
  const Value singleInfo = Single(mine);
  const Value multiInfo = Single({{"Multiple", {{kId, mine}, {"other", other}}}});
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
  auto a = Make(Single({{"x", 1}}), kPath, id);
  auto b = Make(Single({{"y", 2}}), "/elsewhere/Other.bundle", id);
  auto sub = std::make_shared<SubRecord>();
  ASSERT_TRUE(sub->setupWithNameUrlBundleInfoInfoUuid("other", "/q", Single(Empty()), Value(), id));
  EXPECT_TRUE(a->isEqual(b) && a->isEqual(sub.get()) && sub->isEqual(a));
  EXPECT_TRUE(a->hash() == b->hash() && a->hash() == sub->hash());
  EXPECT_FALSE(a->isEqual(nullptr));
  auto c = Make(Single(Empty()));  // without a given UUID each record gets a fresh one
  EXPECT_FALSE(c->isEqual(Make(Single(Empty()))));
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
  p->setAnnotationValue("extension", Value());
  EXPECT_EQ(p->annotations(), (Value{{"election", 1}}));
  EXPECT_EQ(original, (Value{{"election", 0}, {"extension", {{"k", "v"}}}}));
}

}  // namespace
}  // namespace dr
