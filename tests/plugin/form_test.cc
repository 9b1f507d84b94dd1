#include <gtest/gtest.h>

#include "core/log.h"
#include "plugin/plugin_core.h"
#include "tests/support/fake_service_manager.h"

namespace dr {
namespace {

const char* const kId = "com.example.viewer";

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
  EXPECT_EQ(form["uuid"], Value(p->uuid()->string()));
  EXPECT_EQ(form["version"], Value("4.1"));
  EXPECT_EQ(form["annotations"], Value::EmptyDictionary());  // never absent
  EXPECT_FALSE(form["bundleInfo"].has("BNBundleInfoPdocURL"));
  EXPECT_TRUE(p->bundleInfoDictionary().has("BNBundleInfoPdocURL"));  // the record keeps it
  EXPECT_EQ(form["info"]["CleanTimeout"], Value(3));

  auto q = DRPlugInCore::initWithForm(
      form.changing("hash", Value(Data{1, 2, 3})).changing("requirement", "anchor"));
  ASSERT_NE(q, nullptr);
  EXPECT_TRUE(q->isEqual(p));
  EXPECT_EQ(q->cdhash(), (Data{1, 2, 3}));
  EXPECT_EQ(q->requirement(), "anchor");
  EXPECT_EQ(q->containingUrl(), "/Apps/Host.app");
  // Every exported key was read back into its own place.
  EXPECT_EQ(q->exportForm(), form);
}

TEST(FormTest, OptionalKeysDefaultsAndRefusedForms) {
  auto p = Complete();
  Value form = p->exportForm();
  for (const char* key : {"containingPath", "localizedContainingDisplayName",
                          "localizedDisplayName", "localizedShortName", "hash", "requirement"}) {
    EXPECT_FALSE(form.has(key)) << key;
  }
  struct Row {
    const char* what;
    Value form;
    uint64_t hub;
    bool systemResident;
    bool sameUuid;
  };
  const Row rows[] = {
      {"as exported", form, 0, false, true},
      {"no hub version", form.changing("hubProtocolVersion", Value()), 1, false, true},
      {"hub version 5", form.changing("hubProtocolVersion", 5), 5, false, true},
      // Values of the wrong kind read as if the key were absent.
      {"hub version a string", form.changing("hubProtocolVersion", "7"), 1, false, true},
      {"lastmodified a string", form.changing("lastmodified", "12"), 0, false, true},
      {"systemResident a string", form.changing("systemResident", "true"), 0, false, true},
      {"systemResident 1", form.changing("systemResident", 1), 0, true, true},
      {"no uuid", form.changing("uuid", Value()), 0, false, false},
      {"bad uuid", form.changing("uuid", "not-a-uuid"), 0, false, false},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    auto q = DRPlugInCore::initWithForm(r.form);
    ASSERT_NE(q, nullptr);
    EXPECT_EQ(q->hubProtocolVersion(), r.hub);
    EXPECT_EQ(q->lastModified(), 0);
    EXPECT_EQ(q->onSystemVolume(), r.systemResident);
    EXPECT_EQ(q->isEqual(p), r.sameUuid);
    EXPECT_FALSE(q->containingUrl().has_value());
    EXPECT_TRUE(q->uuid().has_value());
  }

  const struct {
    const char* what;
    Value form;
    const char* line;  // nullptr: nothing logged
  } refused[] = {
      {"no path", form.changing("path", Value()), nullptr},
      {"no identifier", form.changing("identifier", Value()), "missing identifier in plug-in at"},
      {"bundleInfo a string", form.changing("bundleInfo", "x"), "malformed plug-in dictionary"},
      {"not a dictionary at all", Value("form"), nullptr},
  };
  for (const auto& r : refused) {
    SCOPED_TRACE(r.what);
    ScopedLogCapture log;
    EXPECT_EQ(DRPlugInCore::initWithForm(r.form), nullptr);
    ASSERT_EQ(log.lines().size(), r.line ? 1u : 0u);
    EXPECT_TRUE(!r.line || log.contains(r.line));
  }
}

TEST(FormTest, UpdateFromFormReplacesOnlyAnnotations) {
  auto p = Complete();
  p->setAnnotations(Value{{"election", 1}});
  p->updateFromForm(Value{{"annotations", {{"election", 0}}}, {"identifier", "other"}});
  EXPECT_EQ(p->annotations(), (Value{{"election", 0}}));
  EXPECT_EQ(p->identifier(), kId);
  for (const Value& form : {Value{{"identifier", "other"}}, Value{{"annotations", "junk"}}}) {
    p->setAnnotations(Value{{"election", 1}});
    p->updateFromForm(form);  // absent or not a dictionary: cleared
    EXPECT_TRUE(p->annotations().isAbsent()) << form.description();
  }
}

TEST(FormTest, ExportWithoutVersionStillCarriesAString) {
  // A record whose extension-point identifier was not a string is never
  // canonicalised and may have no version.
  auto p = DRPlugInCore::initWithNameUrlBundleInfoInfoUuid(
      kId, "/p/A.bundle", Value{{"UXExtension", {{"UXExtensionPointIdentifier", 1}}}}, Value(),
      std::nullopt);
  ScopedLogCapture log;
  p->resolveSDK();
  EXPECT_EQ(p->exportForm()["version"], Value(""));
}

}  // namespace
}  // namespace dr
