#include "registry/registry.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <limits>
#include <map>
#include <set>
#include <sstream>
#include <thread>
#include <tuple>

#include "core/format.h"
#include "core/log.h"
#include "pdoc/pdoc.h"
#include "platform/service_manager.h"
#include "platform/types.h"
#include "registry/service_manager_linux.h"
#include "registry/types_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/registry_bundles.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

using namespace std::string_literals;
using namespace registry_test;

std::vector<Uuid> UuidsOf(const RegistryEntries& entries) {
  std::vector<Uuid> out;
  for (const auto& e : entries) out.push_back(e->uuid());
  return out;
}

auto Fields(const RegistryEntry& e) {
  return std::make_tuple(e.uuid(), e.url(), e.plugInIdentifier(), e.multiple(),
                         e.bundleIdentifier(), e.bundleVersion(), e.registrationDate(),
                         e.onSystemVolume(), e.containingApplication(), e.displayName(),
                         e.shortName(), e.infoDictionary(), e.plugInDictionary(), e.entitlements());
}

Value ThreePlugIns() {
  return *pdoc::Parse(
      R"({"UXExtension": {"Multiple": {"m.a": {"k": 1}, "m.b": {"k": 2}, "m.c": {"k": 3}}}})");
}

// sqlite3_exec's code; the first column of the last row answered in `out`.
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

  TempFolder dir_;
  const std::string db_ = dir_ / "data/dromon/registry.sqlite3";
};

TEST_F(RegistryTest, RegistersReRegistersAndUnregistersTellingObserversInCommitOrder) {
  const Value ent{{"com.corvel.security.app-sandbox", true}};
  auto bundle = [&](const char* name, const Value& v) { return MakeBundle(dir_ / name, v, ent); };
  const Value attr{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", "com.x.attr"}}}};
  const Value noString{{"UXExtensionAttributes", Value{{"UXExtensionIdentifier", 7}}}};
  const Value a{{"Kind", "a"}}, b{{"Kind", "b"}}, two{{"z.two", b}, {"a.one", a}};
  const Value old{{"Attributes", Value{{"com.corvel.identifier", "com.x.old"}}}};
  const Value base = *pdoc::Parse(R"({"BNBundleIdentifier": "com.x.bundle", "BNBundleVersion": 7,
      "BNBundleName": "N", "BNBundleShortName": "S"})");
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
      {bundle("n.appex", Value{{"BNBundleIdentifier", "a"}}), "Contents/Info.pdoc holds neither"},
      {bundle("m1.appex", multiple("x")), "\"Multiple\" is not a dictionary of plug-ins"},
      {bundle("m3.appex", multiple(Value{{"a", a}, {"b", 2}})), "plug-in \"b\" of \"Multiple\" is"},
      {bundle("i.appex", Value{{"UXExtension", noString}}), "the plug-in has no identifier"},
      {bundle("b0.appex", ux(attr)), "", {{"com.x.attr", attr}}},
      {bundle("b1.appex", ux(a)), "", {{"com.x.bundle", a}}},  // else the bundle identifier
      {bundle("b2.appex", ux(noString)), "", {{"com.x.bundle", noString}}},
      {bundle("b3.appex", ux(Value{{"Multiple", two}})), "", {{"a.one", a}, {"z.two", b}}, true},
      {bundle("b4.appex", dr(old)), "", {{"com.x.old", old}}},
      {bundle("b5.appex", dr(Value{{"Multiple", Value{{"m.one", a}}}})), "", {{"m.one", a}}, true},
      {bundle("b6.appex", ux(attr).changing("Dromon", old)), "", {{"com.x.attr", attr}}},
  };
  const Value info = PlugInInfo("r"), e{{"a", 1}};
  // name | the files written anew (none when the information is absent) | replaced
  const std::tuple<const char*, Value, Value, bool> again[] = {
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
  for (const auto& [name, newInfo, newEntitlements, replaced] : again) {
    SCOPED_TRACE(name);
    const std::string path = MakeBundle(dir_ / Format("r%d.appex", n++), info, e);
    ASSERT_TRUE(registry->registerBundle(path).ok());
    const RegistryEntries before = registry->entriesForUrl(path);
    installed.push_back({true, UuidsOf(before)});
    if (newInfo.isPresent())
      std::filesystem::remove_all(path), MakeBundle(path, newInfo, newEntitlements);
    ASSERT_TRUE(registry->registerBundle(path).ok());
    const RegistryEntries after = registry->entriesForUrl(path);
    ASSERT_EQ(after.size(), 1u);
    EXPECT_EQ(after[0] == before[0], !replaced);  // the very entry, date and all
    if (replaced) {
      EXPECT_EQ(registry->entryForUuid(before[0]->uuid()), nullptr);
      installed.insert(installed.end(), {{false, UuidsOf(before)}, {true, UuidsOf(after)}});
    }
  }
  EXPECT_EQ(registry->entryForUrl(dir_ / "no/../r2.appex")->bundleVersion(), "2.0");
  EXPECT_TRUE(registry->entryForUrl("") == nullptr && registry->entriesForUrl("r2.appex").empty());
  EXPECT_EQ(registry->entryForUrl(dir_ / "r4.appex")->entitlements(), Value::EmptyDictionary());
  const std::string many = MakeBundle(dir_ / "many.appex", ThreePlugIns());
  ASSERT_TRUE(registry->registerBundle(many).ok());
  const std::vector<Uuid> manyUuids = UuidsOf(registry->entriesForUrl(many));
  std::filesystem::create_directory_symlink(many, dir_ / "link.appex");
  EXPECT_TRUE(registry->unregisterBundle(dir_ / "link.appex").ok());
  installed.insert(installed.end(), {{true, manyUuids}, {false, manyUuids}});
  Status gone = registry->unregisterBundle(many);
  EXPECT_EQ(gone.ok() ? "" : gone.error().localizedDescription(),
            "cannot unregister \"" + many + "\": no plug-in is registered there");
  const RegistryEntries kept = registry->allEntries();
  registry.reset();
  registry = Open();
  ASSERT_EQ(UuidsOf(registry->allEntries()), UuidsOf(kept));
  for (const RegistryEntryPtr& e : kept)
    EXPECT_TRUE(Fields(*registry->entryForUuid(e->uuid())) == Fields(*e)) << e->description();
  // In commit order (a refused bundle's would come first), on one thread of the registry's own.
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
  const pid_t child = fork();
  if (child == 0) {
    auto registry = Registry::Open(Options());
    if (registry.ok() && (*registry)->registerBundle(path).ok() && write(fds[1], "y", 1) != 1)
      _exit(2);
    for (;;) pause();
  }
  close(fds[1]);
  char reply = 0;
  ASSERT_TRUE(child > 0 && read(fds[0], &reply, 1) == 1);
  kill(child, SIGKILL);
  int status = 0;
  ASSERT_TRUE(waitpid(child, &status, 0) == child && WIFSIGNALED(status));
  RegistryEntryPtr entry = Open()->entryForUrl(path);
  EXPECT_EQ(entry ? entry->plugInIdentifier() : "", "com.example.k.ext");
}

TEST_F(RegistryTest, DatabaseIsReadFromItsBytesOrRefusedAndLeftAsItIs) {
  auto registry = Open();
  for (int i = 0; i < 70; ++i) {
    const Value info = i % 3 ? PlugInInfo(Format("p%d", i)) : ThreePlugIns();
    const std::string path =
        MakeBundle(dir_ / Format("x%d.appex", i), info.changing("Padding", std::string(3000, 'p')),
                   i % 2 ? Value() : Value{{"e", i}});
    ASSERT_TRUE(registry->registerBundle(path).ok());
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

TEST(TypeServiceTest, ConformanceAndActivationRulesFollowMimeDataAndDeclarations) {
  test::BundleFixture dir;
  dir.writeFile("one/mime/subclasses",
                "# comment\n\nodd\nimage/svg+xml application/xml\r\napplication/xml text/plain \n");
  dir.writeFile("one/mime/aliases", "image/x-alias image/png\n");
  dir.writeFile("two/mime/aliases", "image/x-alias image/gif\n");
  const Value declarations = *pdoc::Parse(R"({"TypeDeclarations": [
      {"TypeIdentifier": "org.example.photo", "ConformsTo": "org.example.picture"},
      {"TypeIdentifier": "org.example.raw", "ConformsTo": ["org.example.photo"]},
      {"TypeIdentifier": "Image/X-Raw", "ConformsTo": "image/png"},
      {"TypeIdentifier": "org.example.cycle1", "ConformsTo": "org.example.cycle2"},
      {"TypeIdentifier": "org.example.cycle2", "ConformsTo": "org.example.cycle1"},
      {"TypeIdentifier": "org.example.odd", "ConformsTo": [1, "", "org.example.picture"]},
      {"TypeIdentifier": 5, "ConformsTo": "org.example.picture"},
      {"TypeIdentifier": "", "ConformsTo": "org.example.picture"}]})");
  dir.makeBundle("P.appex", test::PlugInBundleInfo("com.example.p", "1", "run", declarations));
  auto registry = test::OpenTestRegistry(dir.path("data"));
  ASSERT_TRUE(registry->registerBundle(dir.path("P.appex")).ok());
  auto types =
      NewTypeService({{dir.path("one"), dir.path("two"), dir.path("absent")}, registry.get()});
  // a | b | conforms: strings name types, JSON ones are activation rules; "N" is NaN
  const char* rows = R"(Image/SVG+XML|text/plain|1; org.example.Photo|org.example.photo|0;
      image/x-alias|image/png|1; text/markdown|text/plain|1; org.example.photo|application/octet-stream|1;
      inode/directory|application/octet-stream|0; image/svg+xml|application/*|1; org.example.photo|image/*|0;
      org.example.raw|org.example.picture|1; image/x-raw|image/png|1; org.example.cycle1|org.example.none|0;
      org.example.odd|org.example.picture|1; ||0; image/png||0; {"image/png": 2}|{"image/png": 2.5}|0;
      {"image/*": 2}|{"image/svg+xml": 2}|1; {"image/png": 2}|{"image/png": 1, "text/plain": 1}|0;
      {"image/png": 2}|{"image/png": 1, "text/plain": 0}|1; {"image/png": "5", "image/*": 3}|{"image/png": 1}|1;
      image/png|{"image/png": 1}|0; {"image/png": 5}|{"image/png": "1"}|0; {"image/png": 5}|{"image/png": -1}|0;
      {"image/png": 5}|{"image/png": N}|0; true|{"image/png": [1]}|0; true|["image/png"]|0;
      {"image/png": "5"}|{"image/png": 1}|0; {"image/png": N}|{"image/png": 1}|0)";
  auto value = [](const std::string& text) {
    if (text.ends_with("N}")) return Value{{"image/png", std::numeric_limits<double>::quiet_NaN()}};
    if (text[0] != '{' && text[0] != '[' && text != "true") return Value(text);
    return pdoc::Parse("[" + text + "]")->at(0);
  };
  std::istringstream in(rows);
  for (std::string row; std::getline(in, row, ';');) {
    row.erase(0, row.find_first_not_of(" \n"));
    const size_t bar = row.find('|'), bar2 = row.find('|', bar + 1);
    SCOPED_TRACE(row);
    const Value a = value(row.substr(0, bar)), b = value(row.substr(bar + 1, bar2 - bar - 1));
    EXPECT_EQ(a.isString() && b.isString() ? types->conformsTo(*a.string(), *b.string())
                                           : types->evaluateActivationRule(a, b),
              row.substr(bar2 + 1) == "1");
  }
  ASSERT_TRUE(registry->unregisterBundle(dir.path("P.appex")).ok());
  EXPECT_FALSE(types->conformsTo("org.example.photo", "org.example.picture"));
}

TEST(ServiceManagerTest, BusyInstancesGrantsSdksAndRemovalFollowTheLiveProcesses) {
  test::BundleFixture dir;
  const std::string root = std::filesystem::canonical(dir.root()).string();
  auto bundle = [&](const std::string& name) { return root + "/" + name + ".appex"; };
  auto exe = [&](const std::string& name) { return bundle(name) + "/Contents/Exec/run"; };
  std::unique_ptr<Registry> registry = test::OpenTestRegistry(root + "/data");
  for (const char* name : {"A", "B", "Outer", "Outer.appex/Contents/PlugIns/Inner", "Loose"}) {
    const std::string id = std::filesystem::path(name).filename().string();
    dir.makeBundle(name + std::string(".appex"),
                   test::PlugInBundleInfo("com.example." + id, id == "B" ? "2.0" : "1.0", "run"),
                   "run");
    ASSERT_TRUE(id == "Loose" || registry->registerBundle(bundle(name)).ok()) << name;
  }
  std::unique_ptr<ServiceManager> sm = NewServiceManager({.registry = registry.get()});
  ScopedLogCapture log;
  const std::string inner = "Outer.appex/Contents/PlugIns/Inner";
  testing::RunningProgram a(exe("A")), b(exe("B")), in(exe(inner)), loose(exe("Loose")),
      zombie(exe("A"));
  ::kill(zombie.pid(), SIGKILL);  // a zombie until the end of the test
  siginfo_t info;
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(zombie.pid()), &info, WEXITED | WNOWAIT), 0);
  auto busy = [&](const std::string& name, const char* id, pid_t pid) {
    return BusyExtensionInstance{pid, bundle(name), id,
                                 registry->entryForUrl(bundle(name))->uuid()};
  };
  const std::pair<std::vector<std::string>, std::vector<BusyExtensionInstance>> queries[] = {
      {{"com.example.A"}, {busy("A", "com.example.A", a.pid())}},
      {{"com.example.Outer", "com.example.Inner"}, {busy(inner, "com.example.Inner", in.pid())}},
      {{"com.example.Loose", "com.example.none"}, {}},
      {{}, {}},
  };
  for (const auto& [identifiers, expected] : queries)
    EXPECT_EQ(
        sm->busyExtensionInstances(identifiers).value_or(std::vector<BusyExtensionInstance>{}),
        expected);
  const Value overlay{{"BNBundlePackageType", "IPC!"}};
  const std::pair<std::string, int> grants[] = {
      {exe("A") + "-missing", ENOENT},
      {bundle("A") + "/Contents/Info.pdoc", EACCES},  // mode 0644
      {bundle("A") + "/Contents/Exec", EACCES},       // a folder
      {"", ENOENT},
      {exe("A"), 0},
      {root + "/Loose.appex/Contents/Exec/../Exec/run", 0},
      {exe("A"), 0},  // the same again replaces it
  };
  for (const auto& [path, expected] : grants)
    EXPECT_EQ(sm->addExternalService(::getpid(), path, overlay), expected) << path;
  EXPECT_EQ(sm->addExternalService(0, exe("A"), overlay), ESRCH);
  EXPECT_EQ(sm->externalServiceGrants(),
            (std::vector<ExternalServiceGrant>{
                {::getpid(), bundle("Loose"), "com.example.Loose", "1.0", exe("Loose"), overlay},
                {::getpid(), bundle("A"), "com.example.A", "1.0", exe("A"), overlay}}));
  dir.writePdoc("sdk/com.example.list.pdoc", Value(Array{1}));
  test::ScopedEnv path("DR_SDK_PATH", dir.path("sdk"));
  EXPECT_FALSE(sm->sdkDictionary("com.example.list").ok());
  EXPECT_EQ(sm->sdkDictionary("../sdk/com.example.list").value_or(Value(1)), Value());

  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.A", "2.0"), kNoInstanceRunning);
  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.A", "1.0"), 0);
  EXPECT_EQ(a.wait(), SIGTERM);
  EXPECT_TRUE(log.contains("stopped pid " + std::to_string(a.pid()) +
                           ", an instance of com.example.A 1.0 at " + bundle("A")));
  ASSERT_TRUE(registry->unregisterBundle(bundle("B")).ok());
  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.B", "2.0"), 0);
  EXPECT_EQ(b.wait(), SIGTERM);
  EXPECT_EQ(sm->removeExternalServiceInstance("com.example.Loose", "1.0"), 0);
  EXPECT_EQ(loose.wait(), SIGTERM);
  EXPECT_TRUE(sm->externalServiceGrants().empty());
}

}  // namespace
}  // namespace dr
