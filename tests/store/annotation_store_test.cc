// The annotation store over real files: load, reset and save, merging writes,
// election reports, failing saves, saved bytes equal to the whole table
// written at once, the default location and a crash in the middle of a stream
// of saves.
#include "store/annotation_store.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "core/format.h"
#include "core/log.h"
#include "platform/pdoc_file.h"
#include "plugin/plugin.h"
#include "tests/support/fake_services.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::FakeUsageReports;
using testing::TempFolder;
using testing::WriteTestFile;

// A record of plug-in `id` at version 3; without `point` it names no
// extension point. Built without a registry entry, so its annotation key is
// its identifier.
std::shared_ptr<DRDPlugIn> Record(const std::string& id, const char* point = "com.example.point",
                                  const char* version = "3") {
  Dictionary attributes{{"UXExtensionVersion", version}};
  if (point != nullptr) attributes["UXExtensionPointName"] = point;
  Value info{{"UXExtension", Value{{"UXExtensionAttributes", Value(attributes)}}}};
  auto record = std::make_shared<DRDPlugIn>();
  if (!record->setupWithNameUrlBundleInfoInfoUuid(id, "/p/" + id, info, Value(), std::nullopt)) {
    return nullptr;
  }
  return record;
}

std::string Xml(const Value& doc) { return *pdoc::WriteXml(doc); }

mode_t ModeOf(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

// Fails every write while `fail` is set.
class FailingWrites : public FileSystemWrapper {
 public:
  FailingWrites() : FileSystemWrapper(FileSystem::Default()) {}
  std::atomic<bool> fail = true;
  Status writeFileAtomically(const std::string& path, std::string_view bytes,
                             mode_t mode) override {
    if (fail) return Error(kFileErrorDomain, kFileWriteError, "disk full");
    return FileSystemWrapper::writeFileAtomically(path, bytes, mode);
  }
};

class AnnotationStoreTest : public ::testing::Test {
 protected:
  std::unique_ptr<DRDAnnotationStore> Open(const std::string& path,
                                           FileSystem* fs = FileSystem::Default()) {
    AnnotationStoreOptions options;
    options.fileSystem = fs;
    options.usageReports = &reports_;
    options.saveRetryInterval = retryInterval_;
    return DRDAnnotationStore::initWithDatabase(path, std::move(options));
  }
  Value OnDisk() const { return pdoc::ReadFile(file_).value_or(Value()); }

  TempFolder folder_;
  const std::string file_ = folder_ / "Annotations";
  FakeUsageReports reports_;
  std::chrono::milliseconds retryInterval_{std::chrono::minutes(1)};
};

TEST_F(AnnotationStoreTest, LoadsVersion16AndResetsAnythingElse) {
  Value table{{"viewer", Value{{"election", 1}, {"extension", Value{{"zoom", 2.5}}}}}};
  Value empty = Value::EmptyDictionary();
  const std::string dromon = "Dromon error 7: found database version ";
  struct Row {
    const char* what;
    std::optional<std::string> bytes;  // none: no file
    Value loaded;
    std::string error;  // start of the logged error; "" for no log line
  } rows[] = {
      {"version 16", Xml(Value{{"version", 16}, {"data", table}}), table, ""},
      {"JSON form", R"({"version": 16, "data": {"viewer": {"election": 1,
           "extension": {"zoom": 2.5}}}})",
       table, ""},
      {"no file", std::nullopt, empty, ""},
      {"version 15", Xml(Value{{"version", 15}, {"data", table}}), empty,
       dromon + "15 needed version 16 (resetting)"},
      {"version 17", Xml(Value{{"version", 17}, {"data", table}}), empty,
       dromon + "17 needed version 16 (resetting)"},
      {"no version", Xml(Value{{"data", table}}), empty,
       dromon + "0 needed version 16 (resetting)"},
      {"version as text", Xml(Value{{"version", "16"}, {"data", table}}), empty,
       dromon + "0 needed version 16 (resetting)"},
      {"array at the top", Xml(Value(Array{16})), empty,
       dromon + "0 needed version 16 (resetting)"},
      {"no data", Xml(Value{{"version", 16}}), empty,
       dromon + "16 without a data dictionary (resetting)"},
      {"data is an array", Xml(Value{{"version", 16}, {"data", Value(Array{table})}}), empty,
       dromon + "16 without a data dictionary (resetting)"},
      {"garbage", std::string("\x01\xff not a document"), empty, "pdoc error 1"},
      {"empty file", std::string(), empty, "pdoc error 1"},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    ::unlink(file_.c_str());
    if (r.bytes) {
      ASSERT_TRUE(WriteTestFile(file_, *r.bytes));
    }
    ScopedLogCapture log;
    auto store = Open(file_);
    EXPECT_EQ(Value(store->annotations()), r.loaded);
    std::vector<std::string> lines = log.lines();
    if (r.error.empty()) {
      EXPECT_TRUE(lines.empty());
    } else {
      ASSERT_EQ(lines.size(), 1u);
      EXPECT_TRUE(
          lines[0].starts_with("unable to load annotation database:" + file_ + " error:" + r.error))
          << lines[0];
      EXPECT_TRUE(lines[0].ends_with(" (resetting)")) << lines[0];
    }
    // Loading never rewrites the file; the next save replaces it whole, in
    // the XML form.
    EXPECT_EQ(FileSystem::Default()->readFile(file_).value_or("(none)"),
              r.bytes.value_or("(none)"));
    ASSERT_TRUE(store->saveDb().ok());
    EXPECT_EQ(OnDisk(), (Value{{"version", 16}, {"data", r.loaded}}));
    Result<std::string> bytes = FileSystem::Default()->readFile(file_);
    EXPECT_TRUE(bytes->starts_with("<?xml")) << *bytes;
  }
}

TEST_F(AnnotationStoreTest, WritesMergeAndReportOnlyChangedElections) {
  Value zoom1{{"zoom", 1}}, zoom2{{"zoom", 2}};
  ASSERT_TRUE(WriteTestFile(
      file_,
      Xml(Value{
          {"version", 16},
          {"data", Value{{"com.example.viewer",
                          Value{{"election", -1}, {"extension", zoom1}, {"legacy", "kept"}}}}}})));
  auto store = Open(file_);
  auto viewer = Record("com.example.viewer");
  auto unnamed = Record("com.example.viewer", nullptr);  // same key, no extension point name
  ASSERT_TRUE(viewer && unnamed);
  struct Step {
    const char* what;
    const DRDPlugIn* record;
    Value set;
    Value stored;
    const char* report;  // the action reported, or nullptr for none
  } steps[] = {
      {"elect over -1", viewer.get(), Value{{"election", 1}},
       Value{{"election", 1}, {"extension", zoom1}, {"legacy", "kept"}}, "Enabled"},
      {"same election again", viewer.get(), Value{{"election", 1}},
       Value{{"election", 1}, {"extension", zoom1}, {"legacy", "kept"}}, nullptr},
      {"settings only", viewer.get(), Value{{"extension", zoom2}},
       Value{{"election", 1}, {"extension", zoom2}, {"legacy", "kept"}}, nullptr},
      {"election 0", viewer.get(), Value{{"election", 0}},
       Value{{"election", 0}, {"extension", zoom2}, {"legacy", "kept"}}, "Disabled"},
      {"election 2 is not 1", viewer.get(), Value{{"election", 2}, {"extension", zoom1}},
       Value{{"election", 2}, {"extension", zoom1}, {"legacy", "kept"}}, "Disabled"},
      {"no extension point name", unnamed.get(), Value{{"election", 1}},
       Value{{"election", 1}, {"extension", zoom1}, {"legacy", "kept"}}, nullptr},
      {"unchanged after an unreported change", viewer.get(), Value{{"election", 1.0}},
       Value{{"election", 1}, {"extension", zoom1}, {"legacy", "kept"}}, nullptr},
      {"erase", viewer.get(), Value(), Value(), nullptr},
      {"elect with nothing stored", viewer.get(), Value{{"election", 1}}, Value{{"election", 1}},
       "Enabled"},
  };
  for (const Step& s : steps) {
    SCOPED_TRACE(s.what);
    size_t before = reports_.reports().size();
    store->setAnnotationForPlugIn(s.set, *s.record);
    EXPECT_EQ(store->annotationForPlugIn(*viewer), s.stored);
    EXPECT_EQ(OnDisk()["data"]["com.example.viewer"], s.stored);  // every write is saved
    std::vector<testing::SentUsageReport> sent = reports_.reports();
    ASSERT_EQ(sent.size(), before + (s.report ? 1 : 0));
    if (s.report) {
      UsageReportKeys expected = {{"com.corvel.message.action", s.report},
                                  {"com.corvel.message.name", "com.example.viewer-3"},
                                  {"com.corvel.message.reorder_direction", "0"},
                                  {"com.corvel.message.source", "ThirdParty"},
                                  {"com.corvel.message.type", "com.example.point"}};
      EXPECT_EQ(sent.back().keys, expected);
    }
  }
}

TEST_F(AnnotationStoreTest, PlugInsWithOneKeyShareOneAnnotation) {
  auto store = Open(file_);
  auto v1 = Record("com.example.viewer", "com.example.point", "1");
  auto v2 = Record("com.example.viewer", "com.example.point", "2");
  auto other = Record("com.example.other");
  store->setAnnotationForPlugIn(Value{{"extension", Value{{"a", 1}}}}, *v1);
  EXPECT_EQ(store->annotationForPlugIn(*v2), (Value{{"extension", Value{{"a", 1}}}}));
  store->setAnnotationForPlugIn(Value{{"election", 1}}, *v2);
  EXPECT_EQ(store->annotationForPlugIn(*v1),
            (Value{{"election", 1}, {"extension", Value{{"a", 1}}}}));
  EXPECT_TRUE(store->annotationForPlugIn(*other).isAbsent());
  ASSERT_EQ(reports_.reports().size(), 1u);
  EXPECT_EQ(reports_.reports()[0].keys[1].second, "com.example.viewer-2");
  // A second store over the same file sees the same table.
  EXPECT_EQ(Open(file_)->annotations(), store->annotations());
}

TEST_F(AnnotationStoreTest, FailedSavesKeepMemoryAndLogEachTime) {
  FailingWrites failing;
  ASSERT_TRUE(WriteTestFile(folder_ / "plain", "not a folder"));
  struct Row {
    const char* what;
    std::string path;
    FileSystem* fs;
    size_t loadLines;  // a missing file is silent, an unreadable one is not
  } rows[] = {
      {"writes fail", file_, &failing, 0},
      {"folder is a regular file", folder_ / "plain/Annotations", FileSystem::Default(), 1},
      {"folder does not exist", folder_ / "missing/Annotations", FileSystem::Default(), 0},
  };
  const std::string before =
      Xml(Value{{"version", 16}, {"data", Value{{"old", Value{{"election", 1}}}}}});
  ASSERT_TRUE(WriteTestFile(file_, before));
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    ScopedLogCapture log;
    auto store = Open(r.path, r.fs);
    EXPECT_EQ(log.lines().size(), r.loadLines);
    log.clear();
    store->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.a"));
    store->setAnnotationForPlugIn(Value{{"election", -1}}, *Record("com.example.b"));
    std::vector<std::string> lines = log.lines();
    ASSERT_EQ(lines.size(), 2u);
    for (const std::string& line : lines) {
      EXPECT_TRUE(
          line.starts_with("unable to save annotations:" + r.path + " error:file error 512"))
          << line;
    }
    EXPECT_EQ(store->annotations().size(), r.fs == &failing ? 3u : 2u);
  }
  EXPECT_EQ(FileSystem::Default()->readFile(file_).value_or(""), before);
  EXPECT_EQ(ModeOf(folder_ / "missing"), 0u);  // -d never makes folders

  // Once writes work again, the next save writes everything kept in memory;
  // without a next change, the retry does.
  ScopedLogCapture log;
  auto store = Open(file_, &failing);
  store->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.a"));
  failing.fail = false;
  store->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.b"));
  EXPECT_EQ(OnDisk()["data"].size(), 3u);
  failing.fail = true;
  retryInterval_ = std::chrono::milliseconds(1);
  store = Open(file_, &failing);
  store->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.c"));
  failing.fail = false;
  for (int i = 0; i < 1000 && log.lines().size() < 4; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  const std::vector<std::string> lines = log.lines();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_EQ(lines[1], "saved annotations:" + file_ + " after 1 failed attempts");
  EXPECT_TRUE(lines[3].starts_with("saved annotations:" + file_ + " after ")) << lines[3];
  EXPECT_EQ(OnDisk()["data"].size(), 4u);
}

// Every save must write exactly the bytes of the whole table written at once,
// whatever the changes before it: entries added out of order, keys that need
// escaping, nested settings, merges, erasures down to an empty table, a
// reloaded file and a table replaced whole.
TEST_F(AnnotationStoreTest, SavesWriteTheBytesOfTheWholeTable) {
  auto fileIsTable = [&](const DRDAnnotationStore& store) {
    EXPECT_EQ(FileSystem::Default()->readFile(file_).value_or("(none)"),
              Xml(Value{{"version", 16}, {"data", Value(store.annotations())}}));
  };
  const Value nested{{"list", Value(Array{1, "a<b", Value::EmptyDictionary()})},
                     {"inner", Value{{"r", 0.5}}}};
  struct Step {
    const char* what;
    std::string id;
    Value set;
  } steps[] = {
      {"first entry", "com.example.m", Value{{"election", 1}}},
      {"before it", "com.example.a", Value{{"election", -1}, {"extension", nested}}},
      {"after it", "com.example.z", Value{{"extension", Value::EmptyDictionary()}}},
      {"key needing escapes", "com.example.a&b<c>", Value{{"election", 1}}},
      {"merge into the middle", "com.example.m", Value{{"extension", nested}}},
      {"nested change", "com.example.a", Value{{"extension", Value{{"inner", "x & y\r"}}}}},
      {"erase the first", "com.example.a", Value()},
      {"erase a missing key", "com.example.none", Value()},
      {"erase the escaped", "com.example.a&b<c>", Value()},
      {"erase the middle", "com.example.m", Value()},
      {"erase the last", "com.example.z", Value()},
      {"add to the empty table", "com.example.b", Value{{"election", 0}}},
  };
  auto store = Open(file_);
  for (const Step& s : steps) {
    SCOPED_TRACE(s.what);
    auto record = Record(s.id);
    ASSERT_TRUE(record);
    store->setAnnotationForPlugIn(s.set, *record);
    fileIsTable(*store);
  }
  EXPECT_EQ(store->annotations().size(), 1u);

  auto reopened = Open(file_);
  reopened->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.c"));
  fileIsTable(*reopened);
  reopened->setAnnotations(Dictionary{{"com.example.y", Value{{"election", 1}}}});
  reopened->setAnnotationForPlugIn(Value{{"election", 2}}, *Record("com.example.x"));
  fileIsTable(*reopened);
  EXPECT_EQ(reopened->annotations().size(), 2u);
}

// A change whose save failed is kept in memory and in the next save, which
// writes the table as memory holds it, never text from before the change. An
// entry the file cannot hold fails every save, with the writer's message,
// until it is gone.
TEST_F(AnnotationStoreTest, FailedSavesLeaveNoStaleTextForTheNextSave) {
  FailingWrites failing;
  auto store = Open(file_, &failing);
  const Value unwritable{{"extension", Value{{"id", Uuid::random()}}}};
  struct Step {
    const char* what;
    std::string id;
    Value set;
    bool writesFail;
    std::string logged;  // the start of the logged error; "" when saved
  } steps[] = {
      {"saved", "com.example.a", Value{{"election", 1}}, false, ""},
      {"changed, not saved", "com.example.a", Value{{"election", -1}}, true, "file error 512"},
      {"added, not saved", "com.example.b", Value{{"election", 1}}, true, "file error 512"},
      {"erased, not saved", "com.example.a", Value(), true, "file error 512"},
      {"saved again", "com.example.c", Value{{"election", 1}}, false, ""},
      {"re-added, not saved", "com.example.a", Value{{"election", 1}}, true, "file error 512"},
      {"unwritable", "com.example.d", unwritable, false,
       "pdoc error 2: at /data/com.example.d/extension/id: a UUID"},
      {"still unwritable", "com.example.c", Value{{"election", 0}}, false,
       "pdoc error 2: at /data/com.example.d/extension/id: a UUID"},
      {"unwritable gone", "com.example.d", Value(), false, ""},
  };
  for (const Step& s : steps) {
    SCOPED_TRACE(s.what);
    failing.fail = s.writesFail;
    const std::string before = FileSystem::Default()->readFile(file_).value_or("(none)");
    ScopedLogCapture log;
    store->setAnnotationForPlugIn(s.set, *Record(s.id));
    std::vector<std::string> lines = log.lines();
    if (s.logged.empty()) {
      for (const std::string& line : lines) {  // at most that it saved at last
        EXPECT_TRUE(line.starts_with("saved annotations:" + file_ + " after ")) << line;
      }
      EXPECT_EQ(FileSystem::Default()->readFile(file_).value_or("(none)"),
                Xml(Value{{"version", 16}, {"data", Value(store->annotations())}}));
    } else {
      ASSERT_EQ(lines.size(), 1u);
      EXPECT_TRUE(
          lines[0].starts_with("unable to save annotations:" + file_ + " error:" + s.logged))
          << lines[0];
      EXPECT_EQ(FileSystem::Default()->readFile(file_).value_or("(none)"), before);
    }
  }
  EXPECT_EQ(OnDisk()["data"], (Value{{"com.example.a", Value{{"election", 1}}},
                                     {"com.example.b", Value{{"election", 1}}},
                                     {"com.example.c", Value{{"election", 0}}}}));
}

TEST_F(AnnotationStoreTest, DefaultLocationIsAPrivateFolderInTheStateHome) {
  std::string root = folder_.path();
  struct Row {
    std::map<std::string, std::string> env;
    std::string file;
    std::vector<std::string> madeFolders;  // each must be 0700
  } rows[] = {
      {{{"XDG_STATE_HOME", root + "/xdg/state/"}, {"HOME", root + "/unused"}},
       root + "/xdg/state/com.corvel.dromon/Annotations",
       {root + "/xdg", root + "/xdg/state", root + "/xdg/state/com.corvel.dromon"}},
      {{{"HOME", root + "/home"}},
       root + "/home/.local/state/com.corvel.dromon/Annotations",
       {root + "/home/.local/state/com.corvel.dromon"}},
      {{{"XDG_STATE_HOME", "relative/state"}, {"HOME", root + "/home2"}},
       root + "/home2/.local/state/com.corvel.dromon/Annotations",
       {root + "/home2/.local/state/com.corvel.dromon"}},
  };
  ::umask(022);
  for (const Row& r : rows) {
    SCOPED_TRACE(r.file);
    AnnotationStoreOptions options;
    options.getenv = [&](const char* name) {
      auto it = r.env.find(name);
      return it == r.env.end() ? nullptr : it->second.c_str();
    };
    auto store = DRDAnnotationStore::initWithDatabase(std::nullopt, options);
    EXPECT_EQ(store->annotationsURL(), r.file);
    for (const std::string& folder : r.madeFolders) EXPECT_EQ(ModeOf(folder), 0700u) << folder;
    store->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.a"));
    EXPECT_EQ(ModeOf(r.file), 0600u);
  }
}

// `text` as a regular expression; '@' stands for a temporary folder, which
// differs in the child that runs a death test.
std::string Escaped(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '@') {
      out += "/[^ ]*";
      continue;
    }
    if (std::string_view(".[]()*+?{}|^$\\").find(c) != std::string_view::npos) out += '\\';
    out += c;
  }
  return out;
}

TEST(AnnotationStoreDeathTest, NoUsableStateFolderStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  TempFolder folder;
  ASSERT_TRUE(WriteTestFile(folder / "plain", "not a folder"));
  struct Row {
    std::map<std::string, std::string> env;
    std::string message;
  } rows[] = {
      {{}, Format("unable to locate user directory: errno %d", ENOENT)},
      {{{"XDG_STATE_HOME", "/" + std::string(1100, 's')}},
       Format("unable to locate user directory: errno %d", ENAMETOOLONG)},
      {{{"XDG_STATE_HOME", folder / "plain"}},
       "unable to create plugin annotations directory:@/plain/com.corvel.dromon error:file error "
       "512: mkdir @/plain/com.corvel.dromon: Not a directory"},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.message);
    AnnotationStoreOptions options;
    options.getenv = [&](const char* name) {
      auto it = r.env.find(name);
      return it == r.env.end() ? nullptr : it->second.c_str();
    };
    EXPECT_DEATH(DRDAnnotationStore::initWithDatabase(std::nullopt, options), Escaped(r.message));
    // The stop can be replaced, for a daemon that ends in its own way.
    options.onFatal = [](std::string_view) { ::_exit(3); };
    EXPECT_EXIT(DRDAnnotationStore::defaultDatabaseURL(options), ::testing::ExitedWithCode(3),
                Escaped(r.message));
  }
}

// A child process saves one new annotation after another and acknowledges
// each through a pipe once the call returned; it is killed with SIGKILL at
// some point. The file must still parse and hold every acknowledged
// annotation, also after further children continued on it.
TEST_F(AnnotationStoreTest, SigkillDuringSavesKeepsEveryAcknowledgedAnnotation) {
  std::vector<std::string> acknowledged;
  // Delays after the last awaited acknowledgement, so that the kill lands at
  // different points of a save (one save with its fsyncs takes milliseconds).
  const int delaysUs[] = {300, 1500, 4000, 7000, 11000};
  for (int round = 0; round < 5; ++round) {
    int fds[2];
    ASSERT_EQ(::pipe(fds), 0);
    pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      ::close(fds[0]);
      auto store = DRDAnnotationStore::initWithDatabase(file_);
      for (int i = 0;; ++i) {
        auto record = Record(Format("r%d.p%d", round, i));
        if (!record) ::_exit(2);
        store->setAnnotationForPlugIn(Value{{"election", 1}, {"extension", Value{{"n", i}}}},
                                      *record);
        char ack = 1;
        if (::write(fds[1], &ack, 1) != 1) ::_exit(1);
      }
    }
    ::close(fds[1]);
    int acks = 0;
    char ack;
    while (acks < 3 + 5 * round && ::read(fds[0], &ack, 1) == 1) ++acks;
    ::usleep(delaysUs[round]);
    ::kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    while (::read(fds[0], &ack, 1) == 1) ++acks;  // acknowledged before the kill
    ::close(fds[0]);
    ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;
    for (int i = 0; i < acks; ++i) acknowledged.push_back(Format("r%d.p%d", round, i));

    Result<Value> doc = pdoc::ReadFile(file_);
    ASSERT_TRUE(doc.ok()) << doc.error().description();
    EXPECT_EQ((*doc)["version"], 16);
    for (const std::string& key : acknowledged) {
      EXPECT_EQ((*doc)["data"][key]["election"], 1) << key;
    }
    // Beyond those, at most the one save in flight at each kill is there.
    EXPECT_LE((*doc)["data"].size(), acknowledged.size() + round + 1);
  }
}

}  // namespace
}  // namespace dr
