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
  std::optional<Error> error;
  Value form = p->exportForm(&error);
  EXPECT_FALSE(error.has_value());
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
