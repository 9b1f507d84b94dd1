#include "store/database.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "core/log.h"
#include "tests/support/fake_service_manager.h"
#include "tests/support/fake_services.h"
#include "tests/support/registry_bundles.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

using registry_test::MakeBundle;
using namespace std::chrono_literals;

const Value kSandboxed = Value{{"com.corvel.security.app-sandbox", true}};

Value Info(const std::string& id) {
  return Value{
      {"BNBundleIdentifier", id},
      {"BNBundleVersion", "3"},
      {"UXExtension", Value{{"UXExtensionPointIdentifier", "com.example.point"},
                            {"UXExtensionAttributes", Value{{"UXExtensionIdentifier", id},
                                                            {"UXExtensionPointName", "Point"}}}}}};
}

class Delegate : public DRDatabaseDelegate {
 public:
  void removedPlugIns(const RegistryEntries& entries) override {
    for (const auto& e : entries) removed.push_back(e->plugInIdentifier());
  }
  std::vector<std::string> removed;  // written on the registry's event thread
};

class DatabaseTest : public ::testing::Test {
 protected:
  void SetUp() override {
    registry_ = test::OpenTestRegistry(folder_.path());
    ASSERT_TRUE(registry_);
    DatabaseOptions options;
    options.registry = registry_.get();
    options.notifications = &notifications_;
    options.usageReports = &reports_;
    services_.serviceManager = &serviceManager_;
    options.plugInServices = services_;
    db_ = DRDatabase::initWithDatabase(folder_ / "Annotations", options);
    db_->setDelegate(delegate_);
  }

  // Registers a bundle and answers its one entry.
  RegistryEntryPtr Add(const std::string& name, const Value& info,
                       const Value& entitlements = kSandboxed) {
    std::string path = MakeBundle(folder_ / (name + ".appex"), info, entitlements);
    EXPECT_TRUE(db_->addPlugIn(path).ok());
    return registry_->entryForUrl(path);
  }

  // Waits for the registry's event thread to have logged `fragment`.
  static bool WaitFor(const ScopedLogCapture& log, const std::string& fragment) {
    for (int i = 0; i < 300; ++i) {
      if (log.contains(fragment)) return true;
      std::this_thread::sleep_for(10ms);
    }
    return false;
  }

  std::vector<std::string> ReportActions() const {
    std::vector<std::string> actions;
    for (const auto& r : reports_.reports()) actions.push_back(r.keys.front().second);
    return actions;
  }

  // Install reports arrive from the registry's thread at any time; only the
  // election reports are counted here.
  size_t ElectionReports() const {
    size_t n = 0;
    for (const std::string& a : ReportActions()) n += a == "Enabled" || a == "Disabled";
    return n;
  }

  // Destroyed in reverse: the database first, then the registry, whose
  // destruction drains its event thread, and only then what events reach.
  registry_test::TempFolder folder_;
  testing::FakeNotificationCenter notifications_;
  testing::FakeUsageReports reports_;
  test::FakeServiceManager serviceManager_;
  PlugInServices services_;
  std::shared_ptr<Delegate> delegate_ = std::make_shared<Delegate>();
  std::unique_ptr<Registry> registry_;
  std::shared_ptr<DRDatabase> db_;
};

TEST_F(DatabaseTest, LooksUpEachPlugInOnceAndRetriesWhatCannotBeBuilt) {
  RegistryEntryPtr good = Add("good", Info("com.example.good"));
  RegistryEntryPtr unsandboxed = Add("open", Info("com.example.open"), Value());
  ASSERT_TRUE(good && unsandboxed);
  ScopedLogCapture log;
  DRDPlugInPtr first = db_->findPlugIn(good->uuid());
  ASSERT_TRUE(first);
  EXPECT_EQ(db_->findPlugIn(good->uuid()), first);
  EXPECT_EQ(db_->findPlugInAtPath(good->url()), first);
  EXPECT_EQ(db_->plugInForProxy(good), first);
  // A plug-in the daemon refuses is never cached: each lookup tries again.
  EXPECT_FALSE(db_->findPlugIn(unsandboxed->uuid()));
  EXPECT_FALSE(db_->findPlugIn(unsandboxed->uuid()));
  EXPECT_FALSE(db_->cachedPlugIn(unsandboxed->uuid()));
  EXPECT_EQ(db_->findPlugIns(), std::vector<DRDPlugInPtr>{first});

  const Uuid unknown = Uuid::random();
  log.clear();
  EXPECT_FALSE(db_->findPlugIn(unknown));
  EXPECT_FALSE(db_->findPlugInAtPath(folder_ / "nowhere.appex"));
  // Install lines from the registry's event thread may arrive meanwhile.
  std::vector<std::string> lines;
  for (const std::string& line : log.lines()) {
    if (line.starts_with("Registrar cannot find")) lines.push_back(line);
  }
  EXPECT_EQ(lines, (std::vector<std::string>{
                       "Registrar cannot find plug-in with UUID:" + unknown.string(),
                       "Registrar cannot find plug-in at path:" + (folder_ / "nowhere.appex")}));
  Status add = db_->addPlugIn(folder_ / "missing.appex");
  ASSERT_FALSE(add.ok());
  EXPECT_EQ(add.error(), Error("Dromon", 2, "Registrar failed to register the plug-in"));
  Status remove = db_->removePlugIn(folder_ / "missing.appex");
  ASSERT_FALSE(remove.ok());
  EXPECT_EQ(remove.error(), Error("Dromon", 2, "Registrar failed to deregister the plug-in"));
}

// At the first lookup a plug-in that asks for it is elected, unless the user
// declined it; no change notification, but an election report.
TEST_F(DatabaseTest, AutoElectsAtFirstLookupUnlessTheUserChose) {
  const Value autoElect = kSandboxed.changing("com.corvel.developer.auto-elect-plugin", true);
  const struct {
    const char* name;
    Value stored;  // the annotation before the first lookup
    int64_t election;
  } rows[] = {
      {"fresh", Value(), 1},
      {"zero", Value{{"election", 0}, {"extension", Value{{"k", "v"}}}}, 1},
      {"declined", Value{{"election", -1}}, -1},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    RegistryEntryPtr entry = Add(row.name, Info(std::string("com.example.") + row.name), autoElect);
    ASSERT_TRUE(entry);
    if (row.stored.isPresent()) {  // through a record of the same identifier that is not cached
      DRDPlugInPtr probe = DRDPlugIn::initWithRGData(entry, services_);
      ASSERT_TRUE(probe);
      db_->setAnnotationForPlugIn(row.stored, *probe);
    }
    const size_t posted = notifications_.posted().size(), elections = ElectionReports();
    DRDPlugInPtr record = db_->findPlugIn(entry->uuid());
    ASSERT_TRUE(record);
    Value annotation = db_->annotationForPlugIn(*record);
    EXPECT_EQ(annotation["election"].intValue(), row.election);
    EXPECT_EQ(annotation["extension"], row.stored["extension"]);
    EXPECT_EQ(notifications_.posted().size(), posted);
    EXPECT_EQ(ElectionReports(), elections + (row.election == 1 ? 1 : 0));
  }
}

TEST_F(DatabaseTest, EveryAnnotationWritePostsTheChangeNotification) {
  RegistryEntryPtr entry = Add("a", Info("com.example.a"));
  DRDPlugInPtr record = db_->findPlugIn(entry->uuid());
  ASSERT_TRUE(record);
  const Value annotation = Value{{"extension", Value{{"x", 1}}}};
  db_->setAnnotationForPlugIn(annotation, *record);
  db_->setAnnotationForPlugIn(annotation, *record);  // unchanged: posted anyway
  EXPECT_EQ(notifications_.posted(),
            (std::vector<std::string>(2, "com.corvel.dromon.annotation-change")));
  EXPECT_EQ(db_->annotationForPlugIn(*record), annotation);
}

// Installs and uninstalls are logged and reported (a development build only
// logged); an uninstalled plug-in leaves the cache and reaches the delegate.
TEST_F(DatabaseTest, InstallAndUninstallEventsLogReportAndEvict) {
  ScopedLogCapture log;
  RegistryEntryPtr entry = Add("ev", Info("com.example.ev"));
  ASSERT_TRUE(entry);
  const std::string what =
      "com.example.ev com.example.ev(3) " + entry->uuid().string() + " " + entry->url();
  ASSERT_TRUE(WaitFor(log, "INSTALLED:" + what));
  ASSERT_TRUE(db_->findPlugIn(entry->uuid()));
  ASSERT_TRUE(db_->addPlugIn(
      MakeBundle(folder_ / "Build/Products/dev.appex", Info("com.example.dev"), kSandboxed)).ok());
  ASSERT_TRUE(WaitFor(log, "INSTALLED:com.example.dev"));
  ASSERT_TRUE(db_->removePlugIn(entry->url()).ok());
  ASSERT_TRUE(WaitFor(log, "UNINSTALLED:" + what));
  for (int i = 0; i < 300 && delegate_->removed.empty(); ++i) std::this_thread::sleep_for(10ms);
  EXPECT_EQ(delegate_->removed, std::vector<std::string>{"com.example.ev"});
  EXPECT_FALSE(db_->cachedPlugIn(entry->uuid()));
  EXPECT_EQ(ReportActions(), (std::vector<std::string>{"Installed", "Uninstalled"}));
  EXPECT_EQ(reports_.reports().front().keys[1].second, "com.example.ev-3");
  EXPECT_EQ(reports_.reports().back().keys[4].second, "Point");
}

TEST_F(DatabaseTest, InstalledSetIsKeptUntilTheRegistryOrTheCacheChanges) {
  RegistryEntryPtr a = Add("a", Info("com.example.a"));
  Add("open", Info("com.example.open"), Value());  // makes no record
  ASSERT_TRUE(a);
  ScopedLogCapture log;

  // The first set builds the records; the refused plug-in is tried (and
  // logged) every time, so no set with it is kept.
  std::shared_ptr<const PlugInSet> first = db_->installedPlugIns();
  ASSERT_EQ(first->size(), 1u);
  EXPECT_NE(db_->installedPlugIns(), first);
  EXPECT_TRUE(log.contains("ignoring mis-configured plug-in"));
  ASSERT_TRUE(db_->removePlugIn(folder_ / "open.appex").ok());
  // Events change the registry as far as the set knows: let them all pass.
  ASSERT_TRUE(WaitFor(log, "UNINSTALLED:com.example.open"));

  // Once every record is cached, the set is answered again as it is.
  std::shared_ptr<const PlugInSet> cached = db_->installedPlugIns();
  ASSERT_EQ(cached->size(), 1u);
  EXPECT_EQ(cached->records().front(), first->records().front());
  EXPECT_EQ(db_->installedPlugIns(), cached);

  // A plug-in added is seen at once, before the registry's event arrives.
  RegistryEntryPtr b = Add("b", Info("com.example.b"));
  ASSERT_TRUE(b);
  std::shared_ptr<const PlugInSet> grown = db_->installedPlugIns();
  ASSERT_EQ(grown->size(), 2u);
  EXPECT_EQ(*grown->records().back()->uuid(), b->uuid());

  // And one removed is gone at once.
  ASSERT_TRUE(db_->removePlugIn(a->url()).ok());
  std::shared_ptr<const PlugInSet> shrunk = db_->installedPlugIns();
  ASSERT_EQ(shrunk->size(), 1u);
  EXPECT_EQ(*shrunk->records().front()->uuid(), b->uuid());
  EXPECT_EQ(db_->findPlugIns(), shrunk->records());
}

}  // namespace
}  // namespace dr
