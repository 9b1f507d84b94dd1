#include "registry/registry.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <map>
#include <set>
#include <thread>
#include <tuple>

#include "core/format.h"
#include "pdoc/pdoc.h"
#include "tests/support/registry_bundles.h"

namespace dr {
namespace {

using namespace std::string_literals;
using namespace registry_test;

std::vector<Uuid> UuidsOf(const RegistryEntries& entries) {
  std::vector<Uuid> out;
  for (const auto& e : entries) out.push_back(e->uuid());
  return out;
}

// What an entry records.
auto Fields(const RegistryEntry& e) {
  return std::make_tuple(e.uuid(), e.url(), e.plugInIdentifier(), e.multiple(),
                         e.bundleIdentifier(), e.bundleVersion(), e.registrationDate(),
                         e.onSystemVolume(), e.containingApplication(), e.displayName(),
                         e.shortName(), e.infoDictionary(), e.plugInDictionary(), e.entitlements());
}

// A bundle of three plug-ins whose dictionaries hold "k": 1, 2 and 3.
Value ThreePlugIns() {
  return Value{{"UXExtension", Value{{"Multiple", Value{{"m.a", Value{{"k", 1}}},
                                                        {"m.b", Value{{"k", 2}}},
                                                        {"m.c", Value{{"k", 3}}}}}}}};
}

// Runs `sql` on its own connection to `path`; answers sqlite3_exec's code and
// puts the first column of the last row answered in `out`.
int RunSql(const std::string& path, const std::string& sql, int64_t* out = nullptr) {
  sqlite3* db = nullptr;
  int rc = sqlite3_open(path.c_str(), &db);
  auto keep = [](void* to, int, char** values, char**) {
    if (to && values[0]) *static_cast<int64_t*>(to) = std::stoll(values[0]);
    return 0;
  };
  if (rc == SQLITE_OK) rc = sqlite3_exec(db, sql.c_str(), keep, out, nullptr);
  sqlite3_close(db);
  return rc;
}

using Events = std::vector<std::pair<bool, std::vector<Uuid>>>;  // install?, plug-ins

// Every event and its thread; read once the registry (which delivers all first) is gone.
struct Recorder : RegistryObserver {
  void pluginsDidInstall(const RegistryEntries& e) override { add(true, e); }
  void pluginsDidUninstall(const RegistryEntries& e) override { add(false, e); }
  void add(bool install, const RegistryEntries& entries) {
    events.push_back({install, UuidsOf(entries)});
    threads.insert(std::this_thread::get_id());
  }
  Events events;
  std::set<std::thread::id> threads;
};

class RegistryTest : public ::testing::Test {
 protected:
  // From the environment: the database under XDG_DATA_HOME.
  RegistryOptions Options() const {
    const std::map<std::string, std::string> env = {{"XDG_DATA_HOME", dir_ / "data"},
                                                    {"DR_SYSTEM_ROOTS", dir_ / "sys"},
                                                    {"DR_PLUGIN_PATH", ""}};
    auto o = RegistryOptionsFromEnvironment([&](const char* name) -> const char* {
      return env.count(name) ? env.at(name).c_str() : nullptr;
    });
    o->busyTimeout = std::chrono::milliseconds(300);
    return *o;
  }
  std::unique_ptr<Registry> Open() {
    auto r = Registry::Open(Options());
    EXPECT_TRUE(r.ok()) << r.error().description();
    return r.ok() ? std::move(*r) : nullptr;
  }
  // Reopens `registry`, expecting every entry recorded as it was.
  void ExpectKeptAcrossReopening(std::unique_ptr<Registry>& registry) {
    const RegistryEntries before = registry->allEntries();
    registry.reset();
    registry = Open();
    ASSERT_EQ(UuidsOf(registry->allEntries()), UuidsOf(before));
    for (const RegistryEntryPtr& e : before) {
      SCOPED_TRACE(e->description());
      EXPECT_TRUE(Fields(*registry->entryForUuid(e->uuid())) == Fields(*e));
    }
  }

  TempFolder dir_;
  const std::string db_ = dir_ / "data/dromon/registry.sqlite3";
};

// Each plug-in of a bundle gets an entry, else the bundle is refused and
// nothing stored; registered again, it is replaced only when its files
// changed; unregistered, all its entries go.
TEST_F(RegistryTest, RegistersReRegistersAndUnregistersTellingObserversInCommitOrder) {
  const Value ent{{"com.corvel.security.app-sandbox", true}};
  auto bundle = [&](const char* name, const Value& v) { return MakeBundle(dir_ / name, v, ent); };
  const Value attr{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", "com.x.attr"}}}};
  const Value noString{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", 7}}}};
  const Value a{{"Kind", "a"}}, b{{"Kind", "b"}}, two{{"z.two", b}, {"a.one", a}};
  const Value old{{"Attributes", Value{{"com.corvel.identifier", "com.x.old"}}}};
  // The version a number, which reads as its text.
  const Value base{{"BNBundleIdentifier", "com.x.bundle"},
                   {"BNBundleVersion", 7},
                   {"BNBundleName", "N"},
                   {"BNBundleShortName", "S"}};
  auto ux = [&](const Value& v) { return base.changing("UXExtension", v); };
  auto dr = [&](const Value& v) { return base.changing("Dromon", v); };
  auto multiple = [](const Value& v) { return Value{{"UXExtension", Value{{"Multiple", v}}}}; };
  WriteBytes(dir_ / "f.appex", "x");
  WriteBytes(dir_ / "g.appex/Contents/Info.pdoc", "\x01\x02 not a document");
  const struct {
    std::string url;
    std::string refusal;  // the start of the error's text after the path
    std::vector<std::pair<std::string, Value>> plugIns = {};  // identifier, dictionary
    bool multiple = false;
  } rows[] = {
      {dir_ / "missing.appex", "resolve: No such file or directory"},
      {"x.appex", "not an absolute path"},
      {dir_ / "f.appex", "not a plug-in bundle (not a folder)"},
      {dir_ / "g.appex", "Contents/Info.pdoc is not a valid pdoc document: "},
      {bundle("a.appex", Value(Array{1})), "Contents/Info.pdoc does not hold a dictionary"},
      {bundle("n.appex", Value{{"BNBundleIdentifier", "a"}}),
       "Contents/Info.pdoc holds neither \"UXExtension\" nor \"Dromon\" as a dictionary"},
      {bundle("m1.appex", multiple("x")), "\"Multiple\" is not a dictionary of plug-ins"},
      {bundle("m3.appex", multiple(Value{{"a", a}, {"b", 2}})),
       "plug-in \"b\" of \"Multiple\" is not a dictionary"},
      {bundle("i.appex", Value{{"UXExtension", noString}}),
       "the plug-in has no identifier (no \"UXExtensionIdentifier\" attribute and no "
       "\"BNBundleIdentifier\")"},
      {bundle("b0.appex", ux(attr)), "", {{"com.x.attr", attr}}},
      {bundle("b1.appex", ux(a)), "", {{"com.x.bundle", a}}},  // else the bundle identifier
      {bundle("b2.appex", ux(noString)), "", {{"com.x.bundle", noString}}},
      {bundle("b3.appex", ux(Value{{"Multiple", two}})), "", {{"a.one", a}, {"z.two", b}}, true},
      {bundle("b4.appex", dr(old)), "", {{"com.x.old", old}}},
      {bundle("b5.appex", dr(Value{{"Multiple", Value{{"m.one", a}}}})), "", {{"m.one", a}}, true},
      {bundle("b6.appex", ux(attr).changing("Dromon", old)), "", {{"com.x.attr", attr}}},
  };
  const Value info = PlugInInfo("r"), e{{"a", 1}};
  const struct {
    const char* name;
    Value info, entitlements;  // the files written anew; none when `info` is absent
    bool replaced;
  } again[] = {
      {"same files", Value(), Value(), false},
      {"same bytes written again", info, e, false},
      {"information changed", info.changing("BNBundleVersion", "2.0"), e, true},
      {"entitlements changed", info, Value{{"b", 1}}, true},
      {"entitlements removed", info, Value(), true},
  };
  auto registry = Open();
  auto recorder = std::make_shared<Recorder>(), removed = std::make_shared<Recorder>();
  registry->addObserver(recorder);
  registry->addObserver(removed);
  registry->removeObserver(removed.get());
  registry->addObserver(std::make_shared<Recorder>());  // destroyed: never called
  Events installed;
  for (const auto& row : rows) {
    SCOPED_TRACE(row.url);
    Status s = registry->registerBundle(row.url);
    RegistryEntries entries = registry->entriesForUrl(row.url);
    ASSERT_EQ(std::pair(entries.size(), s.ok()),
              std::pair(row.plugIns.size(), row.refusal.empty()));
    if (!s.ok()) {
      const std::string text = s.error().localizedDescription();
      EXPECT_TRUE(s.error().domain() == kRegistryErrorDomain &&
                  s.error().code() == kRegistryRefused &&
                  text.starts_with("cannot register \"" + row.url + "\": " + row.refusal))
          << text;
      continue;
    }
    installed.push_back({true, UuidsOf(entries)});
    for (size_t i = 0; i < entries.size(); ++i) {
      const RegistryEntry& e = *entries[i];
      EXPECT_TRUE(std::tuple(e.plugInIdentifier(), e.plugInDictionary(), e.multiple(), e.url(),
                             e.entitlements(), e.bundleIdentifier(), e.bundleVersion(),
                             e.displayName(), e.shortName()) ==
                  std::tuple(row.plugIns[i].first, row.plugIns[i].second, row.multiple, row.url,
                             ent, "com.x.bundle"s, "7"s, "N"s, "S"s))
          << e.description();
    }
  }
  int n = 0;
  for (const auto& row : again) {
    SCOPED_TRACE(row.name);
    const std::string path = MakeBundle(dir_ / Format("r%d.appex", n++), info, e);
    ASSERT_TRUE(registry->registerBundle(path).ok());
    const RegistryEntries before = registry->entriesForUrl(path);
    installed.push_back({true, UuidsOf(before)});
    if (row.info.isPresent()) {
      std::filesystem::remove_all(path);
      MakeBundle(path, row.info, row.entitlements);
    }
    ASSERT_TRUE(registry->registerBundle(path).ok());
    const RegistryEntries after = registry->entriesForUrl(path);
    ASSERT_EQ(after.size(), 1u);
    EXPECT_EQ(after[0] == before[0], !row.replaced);  // the very entry, date and all
    if (row.replaced) {
      EXPECT_EQ(registry->entryForUuid(before[0]->uuid()), nullptr);
      installed.insert(installed.end(), {{false, UuidsOf(before)}, {true, UuidsOf(after)}});
    }
  }
  EXPECT_EQ(registry->entryForUrl(dir_ / "no/../r2.appex")->bundleVersion(), "2.0");
  EXPECT_TRUE(registry->entryForUrl("") == nullptr && registry->entriesForUrl("r2.appex").empty());
  EXPECT_EQ(registry->entryForUrl(dir_ / "r4.appex")->entitlements(), Value::EmptyDictionary());
  // Every plug-in of a bundle goes, through a link to it.
  const std::string many = MakeBundle(dir_ / "many.appex", ThreePlugIns());
  ASSERT_TRUE(registry->registerBundle(many).ok());
  const std::vector<Uuid> manyUuids = UuidsOf(registry->entriesForUrl(many));
  std::filesystem::create_directory_symlink(many, dir_ / "link.appex");
  EXPECT_TRUE(registry->unregisterBundle(dir_ / "link.appex").ok());
  installed.insert(installed.end(), {{true, manyUuids}, {false, manyUuids}});
  Status gone = registry->unregisterBundle(many);
  EXPECT_EQ(gone.ok() ? "" : gone.error().localizedDescription(),
            "cannot unregister \"" + many + "\": no plug-in is registered there");
  ExpectKeptAcrossReopening(registry);
  // Events leave in commit order (a refused bundle's would come first), on
  // one thread of the registry's own.
  EXPECT_EQ(recorder->events, installed);
  EXPECT_TRUE(recorder->threads.size() == 1 &&
              !recorder->threads.count(std::this_thread::get_id()));
  EXPECT_TRUE(removed->events.empty());
  EXPECT_EQ(std::tuple(ModeOf(db_), ModeOf(dir_ / "data/dromon"), ModeOf(dir_ / "data")),
            std::tuple(0600u, 0700u, 0700u));
}

TEST_F(RegistryTest, RegistrationAcknowledgedBeforeSigkillSurvives) {
  const std::string path = MakeBundle(dir_ / "k.appex", PlugInInfo("k"));
  Open().reset();  // the database exists before the child writes to it
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    auto registry = Registry::Open(Options());
    if (registry.ok() && (*registry)->registerBundle(path).ok() && write(fds[1], "y", 1) != 1)
      _exit(2);
    for (;;) pause();
  }
  close(fds[1]);
  char reply = 0;
  ASSERT_EQ(read(fds[0], &reply, 1), 1);
  kill(child, SIGKILL);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status));
  RegistryEntryPtr entry = Open()->entryForUrl(path);
  EXPECT_EQ(entry ? entry->plugInIdentifier() : "", "com.example.k.ext");
}

// A damaged or foreign file is refused and left as it is; a parsed copy stands
// for the stored bytes only while made from them (which `expected`, the same
// file with no copy at all, reads); a first-schema file gains them.
TEST_F(RegistryTest, DatabaseIsReadFromItsBytesOrRefusedAndLeftAsItIs) {
  auto registry = Open();
  for (int i = 0; i < 70; ++i) {
    const Value info = i % 3 ? PlugInInfo(Format("p%d", i)) : ThreePlugIns();
    ASSERT_TRUE(registry
                    ->registerBundle(MakeBundle(dir_ / Format("x%d.appex", i),
                                                info.changing("Padding", std::string(3000, 'p')),
                                                i % 2 ? Value() : Value{{"e", i}}))
                    .ok());
  }
  const RegistryEntries before = registry->allEntries();
  registry.reset();
  const std::string good = ReadBytes(db_), left = "; it was left as it is";
  const std::string fromFirst = " FROM bundles WHERE id = 1) WHERE id = 2";
  const struct {
    const char* name;
    std::string sql;                        // run on the database
    int64_t code = 0;                       // of the error opening it
    std::string text = {};                  // part of the error's text
    int64_t withoutCopy = 0;                // bundles left without a parsed copy
    std::optional<std::string> bytes = {};  // written over the database first
  } rows[] = {
      {"not a database", "", kRegistryCorrupt,
       "file is not a database (the file is damaged or is not a registry database" + left, 0,
       std::string(8192, 'g')},
      {"cut in half", "", kRegistryCorrupt, left, 0, good.substr(0, good.size() / 2)},
      {"a page overwritten", "", kRegistryCorrupt, left, 0,
       good.substr(0, 8192) + std::string(4096, '\xff') + good.substr(12288)},
      {"another program's database", "CREATE TABLE notes (text TEXT)", kRegistryCorrupt,
       "the file holds another kind of database" + left, 0, ""},
      {"a newer schema", "PRAGMA user_version = 99", kRegistryStorage,
       "schema version 99 is newer than this program knows (3)" + left},
      {"untouched", ""},
      {"no copy", "UPDATE bundles SET parsed = NULL", 0, "", 70},
      {"some without a copy", "UPDATE bundles SET parsed = NULL WHERE id % 7 = 0", 0, "", 10},
      {"empty copy", "UPDATE bundles SET parsed = X''"},
      {"another magic", "UPDATE bundles SET parsed = X'00' || substr(parsed, 2)"},
      {"a byte of the values changed",
       "UPDATE bundles SET parsed = substr(parsed, 1, 30) || X'41' || substr(parsed, 32)"},
      {"copy of another bundle", "UPDATE bundles SET parsed = (SELECT parsed" + fromFirst},
      {"information bytes replaced", "UPDATE bundles SET info = (SELECT info" + fromFirst},
      {"information bytes no longer a document", "UPDATE bundles SET info = X'3C3C'"},
      {"entitlements removed", "UPDATE bundles SET entitlements = NULL"},
      {"entitlements no longer a dictionary",
       "UPDATE bundles SET entitlements = CAST('<pdoc><true/></pdoc>' AS BLOB)"},
      {"the first schema",
       "ALTER TABLE bundles DROP COLUMN parsed; ALTER TABLE bundles DROP COLUMN origin; "
       "ALTER TABLE bundles DROP COLUMN stamp; DROP TABLE removed; PRAGMA user_version = 1"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    WriteBytes(db_, row.bytes.value_or(good));
    ASSERT_EQ(RunSql(db_, row.sql), SQLITE_OK);
    const std::string found = ReadBytes(db_);
    RegistryOptions bytesOnly = Options();
    bytesOnly.databasePath = db_ + ".bytes";
    WriteBytes(bytesOnly.databasePath, found);
    RunSql(bytesOnly.databasePath, "UPDATE bundles SET parsed = NULL");
    auto opened = Registry::Open(Options()), expected = Registry::Open(bytesOnly);
    if (row.code != 0) {
      ASSERT_FALSE(opened.ok());
      const std::string text = opened.error().localizedDescription();
      EXPECT_TRUE(opened.error().code() == row.code && text.find(row.text) != std::string::npos &&
                  text.starts_with("registry database \"" + db_ + "\": "))
          << text;
      EXPECT_EQ(ReadBytes(db_), found);
      continue;
    }
    ASSERT_TRUE(opened.ok()) << opened.error().description();
    ASSERT_EQ(UuidsOf((*opened)->allEntries()), UuidsOf(before));
    int64_t version = 0, withoutCopy = 0;
    RunSql(db_, "PRAGMA user_version", &version);
    RunSql(db_, "SELECT count(*) FROM bundles WHERE parsed IS NULL", &withoutCopy);
    EXPECT_EQ(std::pair(version, withoutCopy), std::pair(int64_t{3}, row.withoutCopy));
    for (const RegistryEntryPtr& was : before) {
      const RegistryEntryPtr e = (*opened)->entryForUuid(was->uuid());
      EXPECT_TRUE(Fields(*e) == Fields(*(*expected)->entryForUuid(was->uuid())) &&
                  e->registrationDate() == was->registrationDate())
          << e->description();
    }
  }
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
          faults += e->plugInDictionary()["k"].intValue() < 1 ||
                    !e->infoDictionary().isDictionary() || !e->entitlements().isDictionary();
          RegistryEntryPtr same = registry->entryForUuid(e->uuid());
          faults += same && same != e;
        }
        size_t n = registry->entriesForUrl(paths[t]).size();
        faults += n != 0 && n != 3;  // never half a bundle
      }
    });
  }
  for (size_t step = 0; step < 5 * paths.size(); ++step) {
    const std::string& path = paths[step % paths.size()];
    MakeBundle(path, multiple.changing("BNBundleVersion", Format("%d", step)));
    EXPECT_TRUE(registry->registerBundle(path).ok());
    EXPECT_TRUE(step % 3 != 0 || registry->unregisterBundle(path).ok());
  }
  done = true;
  for (auto& r : readers) r.join();
  EXPECT_EQ(faults.load(), 0);
  EXPECT_EQ(registry->allEntries().size(), 15u);  // the last round unregistered three
}

}  // namespace
}  // namespace dr
