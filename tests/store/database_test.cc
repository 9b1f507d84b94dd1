#include "store/database.h"

#include <gtest/gtest.h>

#include "tests/support/fake_service_manager.h"
#include "tests/support/registry_bundles.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

// Over a real registry: each plug-in's record is built once (one the daemon
// refuses is never cached), and at its first lookup a plug-in that asks for
// it is elected, unless the user declined it (rows: the annotation stored
// before, through a record not cached, and the election after).
TEST(DatabaseTest, BuildsEachRecordOnceAndAutoElectsAtTheFirstLookup) {
  registry_test::TempFolder folder;
  test::FakeServiceManager serviceManager;
  std::unique_ptr<Registry> registry = test::OpenTestRegistry(folder.path());
  DatabaseOptions options;
  options.registry = registry.get();
  options.plugInServices.serviceManager = &serviceManager;
  auto db = DRDatabase::initWithDatabase(folder / "Annotations", options);
  const Value sandboxed{{"com.corvel.security.app-sandbox", true}};
  auto add = [&](const std::string& name, const Value& entitlements) {
    const std::string path = registry_test::MakeBundle(
        folder / (name + ".appex"), registry_test::PlugInInfo(name), entitlements);
    EXPECT_TRUE(db->addPlugIn(path).ok());
    return registry->entryForUrl(path);
  };
  RegistryEntryPtr good = add("good", sandboxed), open = add("open", Value());
  DRDPlugInPtr first = db->findPlugIn(good->uuid());
  EXPECT_TRUE(first && db->findPlugIn(good->uuid()) == first &&
              db->cachedPlugIn(good->uuid()) == first);
  EXPECT_FALSE(db->findPlugIn(open->uuid()) || db->findPlugIn(open->uuid()) ||
               db->cachedPlugIn(open->uuid()));
  EXPECT_EQ(db->findPlugIns(), std::vector<DRDPlugInPtr>{first});

  const Value autoElect = sandboxed.changing("com.corvel.developer.auto-elect-plugin", true);
  const std::tuple<const char*, Value, int64_t> rows[] = {
      {"fresh", Value(), 1},
      {"zero", Value{{"election", 0}, {"extension", Value{{"k", "v"}}}}, 1},
      {"declined", Value{{"election", -1}}, -1},
  };
  for (const auto& [name, stored, election] : rows) {
    RegistryEntryPtr entry = add(name, autoElect);
    db->setAnnotationForPlugIn(stored, *DRDPlugIn::initWithRGData(entry, options.plugInServices));
    const Value annotation = db->annotationForPlugIn(*db->findPlugIn(entry->uuid()));
    EXPECT_EQ(std::pair(annotation["election"].intValue(), annotation["extension"]),
              std::pair(election, stored["extension"]))
        << name;
  }
}

}  // namespace
}  // namespace dr
