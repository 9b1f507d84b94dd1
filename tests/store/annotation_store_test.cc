// The annotation store over real files: load and reset, merging writes,
// election reports, failing saves, saved bytes equal to the whole table and
// the default location.
#include "store/annotation_store.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
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

using testing::TempFolder;
using testing::WriteTestFile;

// A record of plug-in `id` at `version`; without `point` it names no
// extension point. Its annotation key is its identifier.
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
std::string Doc(const Value& data) { return Xml(Value{{"version", 16}, {"data", data}}); }
std::string Read(const std::string& path) {
  return FileSystem::Default()->readFile(path).value_or("(none)");
}
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
  // The file holds exactly the bytes of the whole table written at once.
  void ExpectFileIsTable(const DRDAnnotationStore& store) {
    EXPECT_EQ(Read(file_), Doc(Value(store.annotations())));
  }

  TempFolder folder_;
  const std::string file_ = folder_ / "Annotations";
  testing::FakeUsageReports reports_;
  std::chrono::milliseconds retryInterval_{std::chrono::minutes(1)};
};

TEST_F(AnnotationStoreTest, LoadsVersion16AndResetsAnythingElse) {
  Value table{{"viewer", Value{{"election", 1}, {"extension", Value{{"zoom", 2.5}}}}}};
  const std::string found = "Dromon error 7: found database version ";
  struct Row {
    std::optional<std::string> bytes;  // none: no file
    bool loads;
    std::string error;  // start of the logged error; "" for no log line
  } rows[] = {
      {Doc(table), true, ""},
      {R"({"version": 16, "data": {"viewer": {"election": 1, "extension": {"zoom": 2.5}}}})", true,
       ""},
      {std::nullopt, false, ""},
      {Xml(Value{{"version", 15}, {"data", table}}), false, found + "15 needed version 16"},
      {Xml(Value{{"version", 17}, {"data", table}}), false, found + "17 needed version 16"},
      {Xml(Value{{"version", "16"}, {"data", table}}), false, found + "0 needed version 16"},
      {Xml(Value(Array{16})), false, found + "0 needed version 16"},
      {Xml(Value{{"version", 16}, {"data", Value(Array{table})}}), false,
       found + "16 without a data dictionary"},
      {std::string("\x01\xff not a document"), false, "pdoc error 1"},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.bytes.value_or("no file"));
    ::unlink(file_.c_str());
    if (r.bytes) {
      ASSERT_TRUE(WriteTestFile(file_, *r.bytes));
    }
    ScopedLogCapture log;
    auto store = Open(file_);
    const Value loaded = r.loads ? table : Value::EmptyDictionary();
    EXPECT_EQ(Value(store->annotations()), loaded);
    ASSERT_EQ(log.lines().size(), r.error.empty() ? 0u : 1u);
    if (!r.error.empty()) {
      const std::string line = log.lines()[0];
      EXPECT_TRUE(
          line.starts_with("unable to load annotation database:" + file_ + " error:" + r.error) &&
          line.ends_with(" (resetting)"))
          << line;
    }
    // Loading never rewrites the file; the next save replaces it whole, as XML.
    EXPECT_EQ(Read(file_), r.bytes.value_or("(none)"));
    ASSERT_TRUE(store->saveDb().ok());
    EXPECT_EQ(Read(file_), Doc(loaded));
  }
}

TEST_F(AnnotationStoreTest, WritesMergeAndReportOnlyChangedElections) {
  auto stored = [](int election, int zoom) {
    return Value{{"election", election}, {"extension", Value{{"zoom", zoom}}}, {"legacy", "kept"}};
  };
  ASSERT_TRUE(WriteTestFile(file_, Doc(Value{{"com.example.viewer", stored(-1, 1)}})));
  auto store = Open(file_);
  auto viewer = Record("com.example.viewer");
  auto unnamed = Record("com.example.viewer", nullptr);  // same key, no extension point name
  auto other = Record("com.example.viewer", "com.example.point", "4");  // same key, other version
  ASSERT_TRUE(viewer && unnamed && other);
  struct Step {
    const DRDPlugIn* record;
    Value set, stored;
    const char* report;  // the action reported, or nullptr for none
  } steps[] = {
      {viewer.get(), Value{{"election", 1}}, stored(1, 1), "Enabled"},
      {viewer.get(), Value{{"election", 1}}, stored(1, 1), nullptr},
      {viewer.get(), Value{{"extension", Value{{"zoom", 2}}}}, stored(1, 2), nullptr},
      {viewer.get(), Value{{"election", 0}}, stored(0, 2), "Disabled"},
      {viewer.get(), Value{{"election", 2}, {"extension", Value{{"zoom", 1}}}}, stored(2, 1),
       "Disabled"},
      {unnamed.get(), Value{{"election", 1}}, stored(1, 1), nullptr},
      {viewer.get(), Value{{"election", 1.0}}, stored(1, 1), nullptr},
      {viewer.get(), Value(), Value(), nullptr},
      {other.get(), Value{{"election", 1}}, Value{{"election", 1}}, "Enabled"},
  };
  for (const Step& s : steps) {
    SCOPED_TRACE(s.set.description());
    size_t before = reports_.reports().size();
    store->setAnnotationForPlugIn(s.set, *s.record);
    EXPECT_EQ(store->annotationForPlugIn(*viewer), s.stored);
    EXPECT_EQ(OnDisk()["data"]["com.example.viewer"], s.stored);  // every write is saved
    std::vector<testing::SentUsageReport> sent = reports_.reports();
    ASSERT_EQ(sent.size(), before + (s.report ? 1 : 0));
    if (s.report) {
      UsageReportKeys expected = {
          {"com.corvel.message.action", s.report},
          {"com.corvel.message.name", "com.example.viewer-" + *s.record->version()},
          {"com.corvel.message.reorder_direction", "0"},
          {"com.corvel.message.source", "ThirdParty"},
          {"com.corvel.message.type", "com.example.point"}};
      EXPECT_EQ(sent.back().keys, expected);
    }
  }
  EXPECT_TRUE(store->annotationForPlugIn(*Record("com.example.other")).isAbsent());
  EXPECT_EQ(Open(file_)->annotations(), store->annotations());  // a second store sees the same
}

// Each step saves the whole table as memory holds it, never text from before
// a change whose save failed: entries added out of order, keys needing
// escapes, nested settings, merges, erasures, and an entry the file cannot
// hold, which fails every save with the writer's message until it is gone.
TEST_F(AnnotationStoreTest, SavesWriteTheWholeTableOrKeepTheOldFile) {
  FailingWrites failing;
  failing.fail = false;
  auto store = Open(file_, &failing);
  const Value nested{{"list", Value(Array{1, "a<b", Value::EmptyDictionary()})},
                     {"inner", Value{{"r", 0.5}}}};
  const Value unwritable{{"extension", Value{{"id", Uuid::random()}}}};
  const std::string kDiskFull = "file error 512";
  const std::string kUuid = "pdoc error 2: at /data/com.example.d/extension/id: a UUID";
  struct Step {
    std::string id;
    Value set;
    bool writesFail;
    std::string logged;  // the start of the logged error; "" when saved
  } steps[] = {
      {"com.example.m", Value{{"election", 1}}, false, ""},
      {"com.example.a", Value{{"election", -1}, {"extension", nested}}, false, ""},
      {"com.example.a&b<c>", Value{{"election", 1}}, false, ""},
      {"com.example.m", Value{{"extension", nested}}, false, ""},
      {"com.example.a", Value{{"extension", Value{{"inner", "x & y\r"}}}}, false, ""},
      {"com.example.a", Value{{"election", -1}}, true, kDiskFull},
      {"com.example.b", Value{{"election", 1}}, true, kDiskFull},
      {"com.example.a", Value(), true, kDiskFull},
      {"com.example.none", Value(), false, ""},
      {"com.example.a&b<c>", Value(), false, ""},
      {"com.example.a", Value{{"election", 1}}, true, kDiskFull},
      {"com.example.d", unwritable, false, kUuid},
      {"com.example.c", Value{{"election", 0}}, false, kUuid},
      {"com.example.d", Value(), false, ""},
      {"com.example.m", Value(), false, ""},
  };
  for (const Step& s : steps) {
    SCOPED_TRACE(s.id + " " + s.set.description());
    failing.fail = s.writesFail;
    const std::string before = Read(file_);
    ScopedLogCapture log;
    store->setAnnotationForPlugIn(s.set, *Record(s.id));
    std::vector<std::string> lines = log.lines();
    if (s.logged.empty()) {
      for (const std::string& line : lines) {  // at most that it saved at last
        EXPECT_TRUE(line.starts_with("saved annotations:" + file_ + " after ")) << line;
      }
      ExpectFileIsTable(*store);
    } else {
      ASSERT_EQ(lines.size(), 1u);
      EXPECT_TRUE(
          lines[0].starts_with("unable to save annotations:" + file_ + " error:" + s.logged))
          << lines[0];
      EXPECT_EQ(Read(file_), before);
    }
  }
  EXPECT_EQ(OnDisk()["data"], (Value{{"com.example.a", Value{{"election", 1}}},
                                     {"com.example.b", Value{{"election", 1}}},
                                     {"com.example.c", Value{{"election", 0}}}}));
  auto reopened = Open(file_);
  reopened->setAnnotations(Dictionary{{"com.example.y", Value{{"election", 1}}}});
  reopened->setAnnotationForPlugIn(Value{{"election", 2}}, *Record("com.example.x"));
  ExpectFileIsTable(*reopened);
  EXPECT_EQ(reopened->annotations().size(), 2u);
}

// A failed save is retried without a next change, and saves what memory
// holds. (The reliability tests break the real folder under drd.)
TEST_F(AnnotationStoreTest, FailedSavesAreRetried) {
  FailingWrites failing;
  retryInterval_ = std::chrono::milliseconds(50);
  auto store = Open(file_, &failing);
  ScopedLogCapture log;
  store->setAnnotationForPlugIn(Value{{"election", 1}}, *Record("com.example.c"));
  failing.fail = false;
  for (int i = 0; i < 1000 && log.lines().size() < 2; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_TRUE(log.lines()[1].starts_with("saved annotations:" + file_ + " after "))
      << log.lines()[1];
  EXPECT_EQ(OnDisk()["data"].size(), 1u);
}

TEST_F(AnnotationStoreTest, DefaultLocationIsAPrivateFolderInTheStateHome) {
  const std::string root = folder_.path(), dir = "/com.corvel.dromon";
  struct Row {
    std::map<std::string, std::string> env;
    std::string file;
    std::vector<std::string> madeFolders;  // each must be 0700
  } rows[] = {
      {{{"XDG_STATE_HOME", root + "/xdg/state/"}, {"HOME", root + "/unused"}},
       root + "/xdg/state" + dir + "/Annotations",
       {root + "/xdg", root + "/xdg/state", root + "/xdg/state" + dir}},
      {{{"XDG_STATE_HOME", "relative/state"}, {"HOME", root + "/home"}},
       root + "/home/.local/state" + dir + "/Annotations",
       {root + "/home/.local/state" + dir}},
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

TEST(AnnotationStoreDeathTest, NoUsableStateFolderStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  TempFolder folder;
  ASSERT_TRUE(WriteTestFile(folder / "plain", "not a folder"));
  const std::pair<std::string, std::string> rows[] = {
      // XDG_STATE_HOME, message (a pattern)
      {"", Format("unable to locate user directory: errno %d", ENOENT)},
      {"/" + std::string(1100, 's'),
       Format("unable to locate user directory: errno %d", ENAMETOOLONG)},
      {folder / "plain",
       "unable to create plugin annotations directory:.*/plain/com.corvel.dromon "
       "error:file error 512: mkdir .*: Not a directory"}};
  for (const auto& [state, message] : rows) {
    AnnotationStoreOptions options;
    options.getenv = [&](const char* name) {
      return std::string_view(name) == "XDG_STATE_HOME" && !state.empty() ? state.c_str() : nullptr;
    };
    EXPECT_DEATH(DRDAnnotationStore::initWithDatabase(std::nullopt, options), message);
    // The stop can be replaced, for a daemon that ends in its own way.
    options.onFatal = [](std::string_view) { ::_exit(3); };
    EXPECT_EXIT(DRDAnnotationStore::defaultDatabaseURL(options), ::testing::ExitedWithCode(3),
                message);
  }
}

}  // namespace
}  // namespace dr
