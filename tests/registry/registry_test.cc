#include "registry/registry.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <filesystem>
#include <map>
#include <thread>
#include <tuple>

#include "core/format.h"
#include "pdoc/pdoc.h"
#include "tests/support/registry_bundles.h"

namespace dr {
namespace {

using namespace std::chrono_literals;
using registry_test::MakeBundle;
using registry_test::ModeOf;
using registry_test::PlugInInfo;
using registry_test::ReadBytes;
using registry_test::TempFolder;
using registry_test::WriteBytes;

// Keeps every event with the thread it arrived on.
class Recorder : public RegistryObserver {
 public:
  struct Event {
    bool install;
    std::vector<Uuid> uuids;
    std::thread::id thread;
  };
  void pluginsDidInstall(const RegistryEntries& e) override { add(true, e); }
  void pluginsDidUninstall(const RegistryEntries& e) override { add(false, e); }

  // The events, once there are at least `n` (or after 5 s).
  std::vector<Event> waitFor(size_t n) {
    std::unique_lock<std::mutex> lock(mu_);
    cv_.wait_for(lock, 5s, [&] { return events_.size() >= n; });
    return events_;
  }

 private:
  void add(bool install, const RegistryEntries& entries) {
    Event e{install, {}, std::this_thread::get_id()};
    for (const auto& entry : entries) e.uuids.push_back(entry->uuid());
    std::lock_guard<std::mutex> lock(mu_);
    events_.push_back(std::move(e));
    cv_.notify_all();
  }
  std::mutex mu_;
  std::condition_variable cv_;
  std::vector<Event> events_;
};

std::vector<Uuid> UuidsOf(const RegistryEntries& entries) {
  std::vector<Uuid> out;
  for (const auto& e : entries) out.push_back(e->uuid());
  return out;
}

std::vector<std::string> IdentifiersOf(const RegistryEntries& entries) {
  std::vector<std::string> out;
  for (const auto& e : entries) out.push_back(e->plugInIdentifier());
  return out;
}

// A bundle of three plug-ins whose dictionaries hold "k": 1, 2 and 3.
Value ThreePlugIns() {
  return Value{{"UXExtension", Value{{"Multiple", Value{{"m.a", Value{{"k", 1}}},
                                                        {"m.b", Value{{"k", 2}}},
                                                        {"m.c", Value{{"k", 3}}}}}}}};
}

class RegistryTest : public ::testing::Test {
 protected:
  RegistryOptions Options() const {
    RegistryOptions o;
    o.databasePath = DatabasePath();
    o.systemRoots = {dir_ / "sys"};
    o.busyTimeout = 300ms;
    return o;
  }
  std::string DatabasePath() const { return dir_ / "data/dromon/registry.sqlite3"; }

  std::unique_ptr<Registry> Open() {
    auto r = Registry::Open(Options());
    if (!r) {
      ADD_FAILURE() << r.error().description();
      return nullptr;
    }
    return std::move(*r);
  }

  // Expects `registry` to hold the entries `before`, each recorded as it was.
  void ExpectEntries(Registry& registry, const RegistryEntries& before) {
    auto recorded = [](const RegistryEntry& e) {
      return std::make_tuple(e.uuid(), e.url(), e.plugInIdentifier(), e.multiple(),
                             e.bundleIdentifier(), e.bundleVersion(), e.registrationDate(),
                             e.onSystemVolume(), e.containingApplication(), e.displayName(),
                             e.shortName(), e.infoDictionary(), e.plugInDictionary(),
                             e.entitlements());
    };
    ASSERT_EQ(UuidsOf(registry.allEntries()), UuidsOf(before));
    for (const RegistryEntryPtr& e : before) {
      RegistryEntryPtr again = registry.entryForUuid(e->uuid());
      ASSERT_NE(again, nullptr) << e->description();
      EXPECT_TRUE(recorded(*again) == recorded(*e)) << e->description();
    }
  }
  void ExpectKeptAcrossReopening(std::unique_ptr<Registry>& registry) {
    const RegistryEntries before = registry->allEntries();
    registry.reset();
    registry = Open();
    ExpectEntries(*registry, before);
  }

  // `registry` with a new Recorder subscribed.
  std::shared_ptr<Recorder> Observe(Registry& registry) {
    auto recorder = std::make_shared<Recorder>();
    registry.addObserver(recorder);
    return recorder;
  }

  TempFolder dir_;
};

TEST_F(RegistryTest, RegistersOneEntryPerPlugInNamedAsDeclaredAndKeepsItInPrivateFiles) {
  const Value section{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", "com.x.attr"}}}};
  const Value noString{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", 7}}}};
  const Value a{{"Kind", "a"}}, b{{"Kind", "b"}};
  const Value old{{"Attributes", Value{{"com.corvel.identifier", "com.x.old"}}}};
  const Value base{{"BNBundleIdentifier", "com.x.bundle"},
                   {"BNBundleVersion", 7},  // a number reads as its text
                   {"BNBundleName", "N"},
                   {"BNBundleShortName", "S"}};
  auto ux = [&](const Value& v) { return base.changing("UXExtension", v); };
  auto dr = [&](const Value& v) { return base.changing("Dromon", v); };
  struct Row {
    Value info;
    std::vector<std::string> identifiers;
    std::vector<Value> sections;
    bool multiple;
  };
  const Row rows[] = {
      {ux(section), {"com.x.attr"}, {section}, false},
      {ux(a), {"com.x.bundle"}, {a}, false},  // else the bundle identifier
      {ux(noString), {"com.x.bundle"}, {noString}, false},
      {ux(Value{{"Multiple", Value{{"z.two", b}, {"a.one", a}}}}),
       {"a.one", "z.two"},
       {a, b},
       true},
      {dr(old), {"com.x.old"}, {old}, false},
      {dr(a), {"com.x.bundle"}, {a}, false},
      {dr(Value{{"Multiple", Value{{"m.one", a}}}}), {"m.one"}, {a}, true},
      {ux(section).changing("Dromon", old), {"com.x.attr"}, {section}, false},  // the new wins
  };
  const Value entitlements{{"com.corvel.security.app-sandbox", true}};
  auto registry = Open();
  int n = 0;
  for (const Row& row : rows) {
    SCOPED_TRACE(row.info.description());
    const std::string path = MakeBundle(dir_ / Format("b%d.appex", n++), row.info, entitlements);
    const double before = static_cast<double>(time(nullptr));
    ASSERT_TRUE(registry->registerBundle(path).ok());
    RegistryEntries entries = registry->entriesForUrl(path);
    EXPECT_EQ(IdentifiersOf(entries), row.identifiers);
    ASSERT_EQ(entries.size(), row.sections.size());
    for (size_t i = 0; i < entries.size(); ++i) {
      const RegistryEntry& e = *entries[i];
      EXPECT_TRUE(std::forward_as_tuple(e.plugInDictionary(), e.multiple(), e.url(),
                                        e.infoDictionary(), e.entitlements(), e.bundleIdentifier(),
                                        e.bundleVersion(), e.displayName(), e.shortName()) ==
                  std::make_tuple(row.sections[i], row.multiple, path, row.info, entitlements,
                                  "com.x.bundle", "7", "N", "S"))
          << e.description();
      EXPECT_GE(e.registrationDate().seconds, before - 1);
      EXPECT_LE(e.registrationDate().seconds, before + 60);
      EXPECT_EQ(registry->entryForUuid(e.uuid()), entries[i]);
    }
    EXPECT_TRUE(entries.size() != 2 || entries[0]->uuid() != entries[1]->uuid());
  }
  EXPECT_EQ(registry->allEntries().size(), 9u);
  ExpectKeptAcrossReopening(registry);
  EXPECT_EQ(ModeOf(DatabasePath()), 0600u);
  EXPECT_EQ(ModeOf(dir_ / "data/dromon"), 0700u);
  EXPECT_EQ(ModeOf(dir_ / "data"), 0700u);
  // Unchanged files: still the same registration after reopening.
  const RegistryEntryPtr first = registry->entriesForUrl(dir_ / "b0.appex").at(0);
  ASSERT_TRUE(registry->registerBundle(dir_ / "b0.appex").ok());
  EXPECT_EQ(registry->entriesForUrl(dir_ / "b0.appex").at(0), first);
}

TEST_F(RegistryTest, RefusesWhatIsNoPlugInBundleAndStoresNothing) {
  auto file = [&](const char* name, std::string_view bytes) {
    WriteBytes(dir_ / name, bytes);
    return dir_ / name;
  };
  auto folder = [&](const char* name, const char* inside) {
    std::filesystem::create_directories(dir_ / name + "/" + inside);
    return dir_ / name;
  };
  auto info = [&](const char* name, std::string_view bytes) {
    WriteBytes(dir_ / name + "/Contents/Info.pdoc", bytes);
    return dir_ / name;
  };
  auto bundle = [&](const char* name, const Value& v) { return MakeBundle(dir_ / name, v); };
  auto entitlements = [&](const char* name, std::string_view bytes) {
    WriteBytes(MakeBundle(dir_ / name, PlugInInfo("e")) + "/Contents/Entitlements.pdoc", bytes);
    return dir_ / name;
  };
  auto ux = [](const Value& v) { return Value{{"UXExtension", v}}; };
  const std::string invalid = "Contents/Info.pdoc is not a valid pdoc document: ";
  const std::string noSection =
      "Contents/Info.pdoc holds neither \"UXExtension\" nor \"Dromon\" as a dictionary";
  const std::string noMultiple = "\"Multiple\" is not a dictionary of plug-ins";
  Value deep = Value::EmptyDictionary();  // 62 levels inside the Info.pdoc dictionary
  for (int i = 1; i < 61; ++i) deep = Value{{"d", deep}};
  const struct {
    std::string url;
    std::string reason;  // ending in ": ", followed by a parser's or the system's text
  } rows[] = {
      {dir_ / "missing.appex", "resolve: No such file or directory"},
      {"x.appex", "not an absolute path"},
      {file("f.appex", "x"), "not a plug-in bundle (not a folder)"},
      {folder("c.appex", "Contents"), "not a plug-in bundle (no Contents/Info.pdoc)"},
      {folder("u.appex", "Contents/Info.pdoc"), "not a plug-in bundle (no Contents/Info.pdoc)"},
      {bundle("p\xff.appex", PlugInInfo("p")),
       "its path \"" + dir_ / "p\xff.appex" + "\" is not UTF-8"},
      {bundle("d.appex", Value{{"D", deep}, {"UXExtension", PlugInInfo("d")["UXExtension"]}}),
       "Contents/Info.pdoc cannot be carried in a reply: it nests deeper than the 61 levels a "
       "reply can carry"},
      {info("g.appex", "\x01\x02 not a document"), invalid},
      {info("t.appex", "<?xml version=\"1.0\"?><pdoc version=\"1.0\"><dict><key>a"), invalid},
      {bundle("a.appex", Value(Array{Value("a")})),
       "Contents/Info.pdoc does not hold a dictionary"},
      {bundle("n.appex", Value{{"BNBundleIdentifier", "a"}}), noSection},
      {bundle("s.appex", Value{{"UXExtension", "x"}, {"Dromon", 1}}), noSection},
      {bundle("m1.appex", ux(Value{{"Multiple", "x"}})), noMultiple},
      {bundle("m2.appex", ux(Value{{"Multiple", Value::EmptyDictionary()}})), noMultiple},
      {bundle("m3.appex", ux(Value{{"Multiple", Value{{"a", Value{{"k", 1}}}, {"b", 2}}}})),
       "plug-in \"b\" of \"Multiple\" is not a dictionary"},
      {bundle("i.appex", ux(Value{{"UXExtensionAttributes", 1}})),
       "the plug-in has no identifier (no \"UXExtensionIdentifier\" attribute and no "
       "\"BNBundleIdentifier\")"},
      {entitlements("e1.appex", "{ nope"),
       "Contents/Entitlements.pdoc is not a valid pdoc document: "},
      {entitlements("e2.appex", "[true]"), "Contents/Entitlements.pdoc does not hold a dictionary"},
  };
  auto registry = Open();
  auto recorder = Observe(*registry);
  for (const auto& row : rows) {
    Status s = registry->registerBundle(row.url);
    ASSERT_FALSE(s.ok()) << row.url;
    EXPECT_EQ(s.error().domain(), kRegistryErrorDomain);
    EXPECT_EQ(s.error().code(), kRegistryRefused);
    const std::string expected = "cannot register \"" + row.url + "\": " + row.reason;
    const std::string text = s.error().localizedDescription();
    if (row.reason.ends_with(": ")) {
      EXPECT_TRUE(text.starts_with(expected) && text.size() > expected.size()) << text;
    } else {
      EXPECT_EQ(text, expected);
    }
  }
  EXPECT_TRUE(registry->allEntries().empty());
  // Events leave in commit order: if a refused bundle had produced one, it
  // would come before this install.
  ASSERT_TRUE(registry->registerBundle(MakeBundle(dir_ / "good.appex", PlugInInfo("g"))).ok());
  auto events = recorder->waitFor(1);
  ASSERT_EQ(events.size(), 1u);
  EXPECT_TRUE(events[0].install);
  registry.reset();
  EXPECT_EQ(IdentifiersOf(Open()->allEntries()), std::vector<std::string>{"com.example.g.ext"});
}

TEST_F(RegistryTest, ReRegisteringReplacesOnlyChangedBundlesAndTellsLiveObserversInOrder) {
  const Value info = PlugInInfo("r"), a{{"a", 1}};
  const struct {
    const char* name;
    Value info, entitlements;  // the files written anew; none when `info` is absent
    bool replaced;
  } rows[] = {
      {"same files", Value(), Value(), false},
      {"same bytes written again", info, a, false},
      {"information changed", info.changing("BNBundleVersion", "2.0"), a, true},
      {"entitlements changed", info, Value{{"b", 1}}, true},
      {"entitlements removed", info, Value(), true},
  };
  auto registry = Open();
  auto recorder = Observe(*registry);
  auto removed = Observe(*registry);
  registry->removeObserver(removed.get());
  std::weak_ptr<Recorder> destroyed = Observe(*registry);
  EXPECT_TRUE(destroyed.expired());  // the registry does not keep observers alive
  std::vector<std::pair<bool, std::vector<Uuid>>> expected;
  int n = 0;
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const std::string path = MakeBundle(dir_ / Format("r%d.appex", n++), info, a);
    ASSERT_TRUE(registry->registerBundle(path).ok());
    const RegistryEntries before = registry->entriesForUrl(path);
    expected.push_back({true, UuidsOf(before)});
    if (row.info.isPresent()) {
      std::filesystem::remove_all(path);
      MakeBundle(path, row.info, row.entitlements);
    }
    ASSERT_TRUE(registry->registerBundle(path).ok());
    const RegistryEntries after = registry->entriesForUrl(path);
    ASSERT_EQ(after.size(), 1u);
    if (row.replaced) {
      EXPECT_NE(after[0]->uuid(), before[0]->uuid());
      EXPECT_EQ(registry->entryForUuid(before[0]->uuid()), nullptr);
      expected.push_back({false, UuidsOf(before)});
      expected.push_back({true, UuidsOf(after)});
    } else {
      EXPECT_EQ(after[0], before[0]);  // the very entry, date and all
    }
  }
  EXPECT_EQ(registry->entriesForUrl(dir_ / "r2.appex")[0]->bundleVersion(), "2.0");
  EXPECT_EQ(registry->entriesForUrl(dir_ / "r4.appex")[0]->entitlements(),
            Value::EmptyDictionary());
  // Events leave in commit order, on one thread of the registry's own.
  auto events = recorder->waitFor(expected.size());
  ASSERT_EQ(events.size(), expected.size());
  for (size_t i = 0; i < events.size(); ++i) {
    EXPECT_EQ(events[i].install, expected[i].first) << i;
    EXPECT_EQ(events[i].uuids, expected[i].second) << i;
    EXPECT_NE(events[i].thread, std::this_thread::get_id());
    EXPECT_EQ(events[i].thread, events[0].thread);
  }
  registry.reset();  // delivers anything still queued
  EXPECT_TRUE(removed->waitFor(0).empty());
}

TEST_F(RegistryTest, UnregisteringRemovesEveryEntryOfTheBundle) {
  auto registry = Open();
  auto recorder = Observe(*registry);
  const std::string many = MakeBundle(dir_ / "many.appex", ThreePlugIns());
  const std::string other = MakeBundle(dir_ / "other.appex", PlugInInfo("o"));
  const std::string gone = MakeBundle(dir_ / "gone.appex", PlugInInfo("g"));
  std::filesystem::create_directory_symlink(many, dir_ / "link.appex");
  for (const auto& p : {many, other, gone}) ASSERT_TRUE(registry->registerBundle(p).ok());
  const std::vector<Uuid> manyUuids = UuidsOf(registry->entriesForUrl(many));
  ASSERT_EQ(manyUuids.size(), 3u);

  // Through a link to it; then a bundle already deleted from disk.
  EXPECT_TRUE(registry->unregisterBundle(dir_ / "link.appex").ok());
  std::filesystem::remove_all(gone);
  EXPECT_TRUE(registry->unregisterBundle(gone).ok());
  EXPECT_EQ(IdentifiersOf(registry->allEntries()), std::vector<std::string>{"com.example.o.ext"});
  for (const Uuid& u : manyUuids) EXPECT_EQ(registry->entryForUuid(u), nullptr);

  for (const std::string& url : {many, gone, dir_ / "never.appex", std::string("rel.appex")}) {
    Status s = registry->unregisterBundle(url);
    ASSERT_FALSE(s.ok()) << url;
    EXPECT_EQ(s.error().code(), kRegistryNotRegistered);
    EXPECT_EQ(s.error().localizedDescription(),
              "cannot unregister \"" + url + "\": no plug-in is registered there");
  }
  auto events = recorder->waitFor(5);
  ASSERT_EQ(events.size(), 5u);
  EXPECT_FALSE(events[3].install);
  EXPECT_EQ(events[3].uuids, manyUuids);
  EXPECT_FALSE(events[4].install);
  EXPECT_EQ(events[4].uuids.size(), 1u);
  registry.reset();
  EXPECT_EQ(Open()->allEntries().size(), 1u);
}

TEST_F(RegistryTest, RecordsContainingApplicationNamesAndSystemVolumeAcrossReopening) {
  const Value both{{"BNBundleDisplayName", "Mail Pro"}, {"BNBundleName", "Mail"}};
  const Value nameOnly{{"BNBundleName", "Mail"}, {"BNBundleDisplayName", 3}};
  struct Row {
    const char* bundle;  // below the temporary folder
    const char* app;     // its expected application, "" for none
    Value appInfo;       // absent: the application has no Info.pdoc
    std::optional<std::string> appName;
    bool system;
  };
  const Row rows[] = {
      {"A.app/Contents/PlugIns/p.appex", "A.app", both, "Mail Pro", false},
      {"B.app/Contents/PlugIns/p.appex", "B.app", nameOnly, "Mail", false},
      {"C.app/Contents/PlugIns/deeper/p.appex", "C.app", Value(), std::nullopt, false},
      {"D.app/Contents/Resources/p.appex", "", Value(), std::nullopt, false},
      {"E.app/Contents/PlugIns/In.app/Contents/PlugIns/p.appex", "E.app/Contents/PlugIns/In.app",
       both, "Mail Pro", false},
      {"F.app/Contents/PlugIns/In.app/Contents/Resources/p.appex", "F.app", nameOnly, "Mail",
       false},
      {"free/p.appex", "", Value(), std::nullopt, false},
      {"sys/lib/p.appex", "", Value(), std::nullopt, true},
      {"sys/G.app/Contents/PlugIns/p.appex", "sys/G.app", both, "Mail Pro", true},
      {"system/p.appex", "", Value(), std::nullopt, false},
  };
  auto registry = Open();
  for (const Row& row : rows) {
    SCOPED_TRACE(row.bundle);
    const std::string app = dir_ / row.app;
    if (row.appInfo.isPresent()) MakeBundle(app, row.appInfo);
    const std::string path = MakeBundle(dir_ / row.bundle, PlugInInfo("c"));
    ASSERT_TRUE(registry->registerBundle(path).ok());
    RegistryEntryPtr e = registry->entryForUrl(path);
    ASSERT_NE(e, nullptr);
    EXPECT_EQ(e->onSystemVolume(), row.system);
    if (*row.app == '\0') {
      EXPECT_FALSE(e->containingApplication().has_value());
      continue;
    }
    EXPECT_EQ(e->containingApplication(), (RegistryApplication{app, row.appName}));
    EXPECT_EQ(UuidsOf(registry->entriesWithinApplication(app)), std::vector<Uuid>{e->uuid()});
  }
  EXPECT_TRUE(registry->entriesWithinApplication(dir_ / "D.app").empty());
  EXPECT_TRUE(registry->entriesWithinApplication(dir_ / "nothing.app").empty());
  ExpectKeptAcrossReopening(registry);
}

TEST_F(RegistryTest, FindsEntriesByAnySpellingOfTheirPath) {
  auto registry = Open();
  const std::string a = MakeBundle(dir_ / "in/a.appex", PlugInInfo("a"));
  const std::string b = MakeBundle(dir_ / "in/b.appex", PlugInInfo("b"));
  std::filesystem::create_directory_symlink(dir_ / "in", dir_ / "alias");
  ASSERT_TRUE(registry->registerBundle(dir_ / "alias/./b.appex/").ok());
  ASSERT_TRUE(registry->registerBundle(a).ok());
  EXPECT_EQ(registry->entryForUrl(b)->url(), b);  // stored under its canonical path
  EXPECT_EQ(IdentifiersOf(registry->allEntries()),
            (std::vector<std::string>{"com.example.b.ext", "com.example.a.ext"}));
  for (const std::string& url : {a, dir_ / "alias/a.appex", dir_ / "in/../in/a.appex", a + "/",
                                 dir_.path() + "//in/a.appex"}) {
    ASSERT_NE(registry->entryForUrl(url), nullptr) << url;
    EXPECT_EQ(registry->entryForUrl(url)->plugInIdentifier(), "com.example.a.ext") << url;
  }
  for (const std::string& url : {dir_ / "in", std::string("in/a.appex"), std::string()}) {
    EXPECT_EQ(registry->entryForUrl(url), nullptr) << url;
    EXPECT_TRUE(registry->entriesForUrl(url).empty()) << url;
  }
  EXPECT_EQ(registry->entryForUuid(Uuid::random()), nullptr);
}

TEST_F(RegistryTest, RegistrationAcknowledgedBeforeSigkillSurvives) {
  const std::string path = MakeBundle(dir_ / "k.appex", PlugInInfo("k"));
  Open().reset();  // the database exists before the child writes to it
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    close(fds[0]);
    auto registry = Registry::Open(Options());
    if (registry && (*registry)->registerBundle(path).ok()) {
      char yes = 'y';
      if (write(fds[1], &yes, 1) != 1) _exit(2);
    }
    for (;;) pause();
  }
  close(fds[1]);
  char reply = 0;
  ASSERT_EQ(read(fds[0], &reply, 1), 1);
  close(fds[0]);
  kill(child, SIGKILL);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status));
  auto registry = Open();
  ASSERT_NE(registry, nullptr);
  EXPECT_EQ(IdentifiersOf(registry->entriesForUrl(path)),
            std::vector<std::string>{"com.example.k.ext"});
}

// Runs `sql` on its own connection to `path`; answers sqlite3_exec's code.
// `out` gets the first column of the last row a statement answered.
int RunSql(const std::string& path, const char* sql, int64_t* out = nullptr) {
  sqlite3* db = nullptr;
  int rc = sqlite3_open(path.c_str(), &db);
  auto keep = [](void* to, int, char** values, char**) {
    if (to && values[0]) *static_cast<int64_t*>(to) = std::stoll(values[0]);
    return 0;
  };
  if (rc == SQLITE_OK) rc = sqlite3_exec(db, sql, keep, out, nullptr);
  sqlite3_close(db);
  return rc;
}

// The one integer `sql` answers on the database at `path`, or -1.
int64_t QueryInt(const std::string& path, const char* sql) {
  int64_t out = -1;
  return RunSql(path, sql, &out) == SQLITE_OK ? out : -1;
}

TEST_F(RegistryTest, DamagedOrForeignDatabaseIsReportedAndLeftAsItIs) {
  {
    auto registry = Open();
    const Value big = PlugInInfo("x").changing("Padding", std::string(3000, 'p'));
    for (int i = 0; i < 30; ++i) {
      ASSERT_TRUE(registry->registerBundle(MakeBundle(dir_ / Format("x%d.appex", i), big)).ok());
    }
  }
  const std::string good = ReadBytes(DatabasePath());
  ASSERT_GT(good.size(), 100000u);
  ASSERT_FALSE(std::filesystem::exists(DatabasePath() + "-wal"));
  const std::string leftAlone = "; it was left as it is";
  const struct {
    const char* name;
    std::string bytes;  // written over the database
    const char* sql;    // then run on it
    int64_t code;
    std::string text;  // part of the error's text
  } rows[] = {
      {"not a database", std::string(8192, 'g'), nullptr, kRegistryCorrupt,
       "file is not a database (the file is damaged or is not a registry "
       "database; it was left as it is)"},
      {"cut to 50 bytes", good.substr(0, 50), nullptr, kRegistryCorrupt, ""},
      {"cut in half", good.substr(0, good.size() / 2), nullptr, kRegistryCorrupt, leftAlone},
      {"a page overwritten", good.substr(0, 8192) + std::string(4096, '\xff') + good.substr(12288),
       nullptr, kRegistryCorrupt, leftAlone},
      {"another program's database", "", "CREATE TABLE notes (text TEXT)", kRegistryCorrupt,
       "the file holds another kind of database; it was left as it is"},
      {"a newer schema", good, "PRAGMA user_version = 99", kRegistryStorage,
       "schema version 99 is newer than this program knows (3); it was left as it is"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    WriteBytes(DatabasePath(), row.bytes);
    ASSERT_EQ(row.sql ? RunSql(DatabasePath(), row.sql) : SQLITE_OK, SQLITE_OK);
    const std::string damaged = ReadBytes(DatabasePath());
    auto registry = Registry::Open(Options());
    ASSERT_FALSE(registry.ok());
    EXPECT_EQ(registry.error().code(), row.code) << registry.error().description();
    const std::string text = registry.error().localizedDescription();
    EXPECT_TRUE(text.starts_with("registry database \"" + DatabasePath() + "\": ")) << text;
    EXPECT_NE(text.find(row.text), std::string::npos) << text;
    EXPECT_EQ(ReadBytes(DatabasePath()), damaged);
  }
}

// What each stored bundle's bytes parse to, by path.
std::map<std::string, std::pair<Value, Value>> ParsedRows(const std::string& path) {
  std::map<std::string, std::pair<Value, Value>> out;
  sqlite3* db = nullptr;
  sqlite3_stmt* s = nullptr;
  EXPECT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_prepare_v2(db, "SELECT path, info, entitlements FROM bundles", -1, &s, nullptr),
            SQLITE_OK);
  auto parse = [&](int column) {
    std::string_view bytes(static_cast<const char*>(sqlite3_column_blob(s, column)),
                           static_cast<size_t>(sqlite3_column_bytes(s, column)));
    auto v = pdoc::Parse(bytes);
    return v && v->isDictionary() ? *v : Value();
  };
  while (sqlite3_step(s) == SQLITE_ROW) {
    Value entitlements =
        sqlite3_column_type(s, 2) == SQLITE_NULL ? Value::EmptyDictionary() : parse(2);
    if (entitlements.isAbsent()) entitlements = Value::EmptyDictionary();
    out[reinterpret_cast<const char*>(sqlite3_column_text(s, 0))] = {parse(1), entitlements};
  }
  sqlite3_finalize(s);
  sqlite3_close(db);
  return out;
}

// Three bundles: one plain with entitlements, one of two plug-ins, one with
// no entitlements. Answers their paths.
std::vector<std::string> RegisterThree(Registry& registry, const TempFolder& dir) {
  const std::vector<std::string> paths = {
      MakeBundle(dir / "a.appex", PlugInInfo("a"), Value{{"com.example.e", true}}),
      MakeBundle(dir / "m.appex", ThreePlugIns(), Value{{"com.example.e", "x"}}),
      MakeBundle(dir / "n.appex", PlugInInfo("n").changing("BNBundleName", "Ñame")),
  };
  for (const std::string& path : paths) EXPECT_TRUE(registry.registerBundle(path).ok()) << path;
  return paths;
}

TEST_F(RegistryTest, DatabaseOfTheFirstSchemaOpensWithTheSameEntriesAndGainsParsedCopies) {
  auto registry = Open();
  RegisterThree(*registry, dir_);
  EXPECT_EQ(QueryInt(DatabasePath(), "SELECT count(*) FROM bundles WHERE parsed IS NULL"), 0);
  // The file as the first schema left it: no parsed copies, no install
  // folders, version 1.
  const RegistryEntries before = registry->allEntries();
  registry.reset();
  ASSERT_EQ(
      RunSql(DatabasePath(),
             "ALTER TABLE bundles DROP COLUMN parsed; ALTER TABLE bundles DROP COLUMN origin; "
             "ALTER TABLE bundles DROP COLUMN stamp; DROP TABLE removed; "
             "PRAGMA user_version = 1"),
      SQLITE_OK);
  ASSERT_EQ(QueryInt(DatabasePath(),
                     "SELECT count(*) FROM pragma_table_info('bundles') "
                     "WHERE name = 'parsed'"),
            0);
  registry = Open();
  ASSERT_NE(registry, nullptr);
  EXPECT_EQ(QueryInt(DatabasePath(), "PRAGMA user_version"), 3);
  EXPECT_EQ(QueryInt(DatabasePath(), "SELECT count(*) FROM bundles WHERE parsed IS NULL"), 0);
  ExpectEntries(*registry, before);
  ExpectKeptAcrossReopening(registry);
}

TEST_F(RegistryTest, ManyBundlesDecodedOnTwoThreadsReadAsRegistered) {
  // Enough bundles for opening to share the decoding between two threads,
  // some of them without a parsed copy, so both kinds interleave.
  auto registry = Open();
  for (int i = 0; i < 100; ++i) {
    const Value info = i % 3 == 0 ? ThreePlugIns().changing("BNBundleIdentifier", Format("b%d", i))
                                  : PlugInInfo(Format("p%d", i));
    ASSERT_TRUE(registry
                    ->registerBundle(MakeBundle(dir_ / Format("b%d.appex", i), info,
                                                i % 2 == 0 ? Value{{"e", i}} : Value()))
                    .ok());
  }
  ASSERT_EQ(RunSql(DatabasePath(), "UPDATE bundles SET parsed = NULL WHERE id % 7 = 0"), SQLITE_OK);
  ExpectKeptAcrossReopening(registry);
}

TEST_F(RegistryTest, ParsedCopyThatIsMissingDamagedOrStaleGivesWayToTheStoredBytes) {
  const std::string a = dir_ / "a.appex";
  const std::string m = dir_ / "m.appex";
  const struct {
    const char* name;
    std::string sql;  // run on the closed database
  } rows[] = {
      {"untouched", ""},
      {"no copy", "UPDATE bundles SET parsed = NULL"},
      {"empty copy", "UPDATE bundles SET parsed = X''"},
      {"another magic", "UPDATE bundles SET parsed = X'00' || substr(parsed, 2)"},
      {"cut short", "UPDATE bundles SET parsed = substr(parsed, 1, length(parsed) - 3)"},
      {"a byte of the values changed",
       "UPDATE bundles SET parsed = substr(parsed, 1, 30) || X'41' || substr(parsed, 32)"},
      {"copy of another bundle",
       "UPDATE bundles SET parsed = (SELECT parsed FROM bundles WHERE path = '" + m +
           "') WHERE path = '" + a + "'"},
      {"information bytes replaced",
       "UPDATE bundles SET info = (SELECT info FROM bundles WHERE path = '" + m +
           "') WHERE path = '" + a + "'"},
      {"information bytes no longer a document", "UPDATE bundles SET info = X'3C3C'"},
      {"entitlements removed", "UPDATE bundles SET entitlements = NULL"},
      {"entitlements no longer a dictionary",
       "UPDATE bundles SET entitlements = CAST('<pdoc><true/></pdoc>' AS BLOB)"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::filesystem::remove_all(dir_ / "data");
    auto registry = Open();
    RegisterThree(*registry, dir_);
    registry.reset();
    if (!row.sql.empty()) {
      ASSERT_EQ(RunSql(DatabasePath(), row.sql.c_str()), SQLITE_OK);
    }
    const auto expected = ParsedRows(DatabasePath());
    registry = Open();
    ASSERT_NE(registry, nullptr);
    ASSERT_EQ(registry->allEntries().size(), 5u);
    for (const RegistryEntryPtr& e : registry->allEntries()) {
      SCOPED_TRACE(e->description());
      const auto& [info, entitlements] = expected.at(e->url());
      EXPECT_EQ(e->infoDictionary(), info);
      EXPECT_EQ(e->infoDictionary().isAbsent(), info.isAbsent());
      EXPECT_EQ(e->entitlements(), entitlements);
      EXPECT_EQ(e->plugInDictionary(), e->multiple()
                                           ? info["UXExtension"]["Multiple"][e->plugInIdentifier()]
                                           : info["UXExtension"]);
    }
  }
}

TEST_F(RegistryTest, DatabaseHeldByAnotherConnectionFailsClearlyAfterTheTimeout) {
  Open().reset();
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(DatabasePath().c_str(), &other), SQLITE_OK);
  std::unique_ptr<sqlite3, decltype(&sqlite3_close)> closer(other, &sqlite3_close);
  ASSERT_EQ(sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);
  auto registry = Open();
  ASSERT_NE(registry, nullptr);
  const std::string path = MakeBundle(dir_ / "h.appex", PlugInInfo("h"));
  Status s = registry->registerBundle(path);
  ASSERT_FALSE(s.ok());
  EXPECT_EQ(s.error().code(), kRegistryBusy);
  EXPECT_EQ(s.error().localizedDescription(),
            "cannot register \"" + path + "\": registry database \"" + DatabasePath() +
                "\": cannot begin a change: database is locked (the file is in use by another "
                "process)");
  EXPECT_TRUE(registry->allEntries().empty());
  ASSERT_EQ(sqlite3_exec(other, "ROLLBACK", nullptr, nullptr, nullptr), SQLITE_OK);
  EXPECT_TRUE(registry->registerBundle(path).ok());
  registry.reset();

  // A connection that keeps the file to itself blocks even opening.
  ASSERT_EQ(sqlite3_exec(other, "PRAGMA locking_mode=EXCLUSIVE; BEGIN EXCLUSIVE;", nullptr, nullptr,
                         nullptr),
            SQLITE_OK);
  auto blocked = Registry::Open(Options());
  ASSERT_FALSE(blocked.ok());
  EXPECT_EQ(blocked.error().code(), kRegistryBusy) << blocked.error().description();
}

TEST_F(RegistryTest, LookupsStayConsistentWhileRegistering) {
  const Value multiple = ThreePlugIns().changing("BNBundleIdentifier", "com.x.m");
  std::vector<std::string> paths;
  for (int i = 0; i < 8; ++i) paths.push_back(MakeBundle(dir_ / Format("m%d.appex", i), multiple));
  auto registry = Open();
  std::atomic<bool> done{false};
  std::atomic<int> faults{0};
  std::vector<std::thread> readers;
  for (int t = 0; t < 4; ++t) {
    readers.emplace_back([&, t] {
      while (!done) {
        for (const RegistryEntryPtr& e : registry->allEntries()) {
          // The dictionaries are parsed on first use, from whichever thread.
          if (e->plugInDictionary()["k"].intValue() < 1 || !e->infoDictionary().isDictionary() ||
              !e->entitlements().isDictionary()) {
            ++faults;
          }
          RegistryEntryPtr same = registry->entryForUuid(e->uuid());
          if (same && same != e) ++faults;
        }
        size_t n = registry->entriesForUrl(paths[t]).size();
        if (n != 0 && n != 3) ++faults;  // never half a bundle
      }
    });
  }
  for (int round = 0; round < 5; ++round) {
    for (size_t i = 0; i < paths.size(); ++i) {
      MakeBundle(paths[i], multiple.changing("BNBundleVersion", Format("%d", round)));
      EXPECT_TRUE(registry->registerBundle(paths[i]).ok());
      if ((i + round) % 3 == 0) {
        EXPECT_TRUE(registry->unregisterBundle(paths[i]).ok());
      }
    }
  }
  done = true;
  for (auto& r : readers) r.join();
  EXPECT_EQ(faults.load(), 0);
  size_t expected = 0;
  for (size_t i = 0; i < paths.size(); ++i) expected += (i + 4) % 3 == 0 ? 0 : 3;
  EXPECT_EQ(registry->allEntries().size(), expected);
}

TEST(RegistryOptionsTest, ComeFromTheEnvironment) {
  struct Row {
    std::map<std::string, std::string> env;
    std::string path;
    std::vector<std::string> roots;
    std::vector<std::string> installFolders;
  };
  const std::vector<std::string> xdg = {"/x/dromon/PlugIns", "/usr/local/share/dromon/PlugIns",
                                        "/usr/share/dromon/PlugIns"};
  const Row rows[] = {
      {{{"DR_REGISTRY", "/r/db"}, {"XDG_DATA_HOME", "/x"}, {"HOME", "/h"}}, "/r/db", {"/usr"}, xdg},
      {{{"XDG_DATA_HOME", "/x"}, {"HOME", "/h"}}, "/x/dromon/registry.sqlite3", {"/usr"}, xdg},
      {{{"XDG_DATA_HOME", "rel"}, {"HOME", "/h"}, {"DR_SYSTEM_ROOTS", ""}, {"DR_PLUGIN_PATH", ""}},
       "/h/.local/share/dromon/registry.sqlite3",
       {"/usr"},
       {}},
      {{{"HOME", "/h"},
        {"DR_SYSTEM_ROOTS", "/a::rel:/b/"},
        {"XDG_DATA_DIRS", "/d"},
        {"DR_PLUGIN_PATH", "/p/:rel::/q/../r"}},
       "/h/.local/share/dromon/registry.sqlite3",
       {"/a", "/b/"},
       {"/p", "/r"}},
      {{{"HOME", "/h"}, {"XDG_DATA_DIRS", "/d:/e"}},
       "/h/.local/share/dromon/registry.sqlite3",
       {"/usr"},
       {"/h/.local/share/dromon/PlugIns", "/d/dromon/PlugIns", "/e/dromon/PlugIns"}},
  };
  for (const Row& row : rows) {
    auto options = RegistryOptionsFromEnvironment([&](const char* name) -> const char* {
      auto it = row.env.find(name);
      return it == row.env.end() ? nullptr : it->second.c_str();
    });
    ASSERT_TRUE(options.ok());
    EXPECT_EQ(options->databasePath, row.path);
    EXPECT_EQ(options->systemRoots, row.roots);
    EXPECT_EQ(options->installFolders, row.installFolders);
  }
}

}  // namespace
}  // namespace dr
