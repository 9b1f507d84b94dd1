#include "store/annotation_store.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "core/log.h"
#include "platform/pdoc_file.h"
#include "plugin/plugin.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using namespace std::chrono_literals;

// A record of plug-in `id`, its annotation key, of an extension point or none.
std::shared_ptr<DRDPlugIn> Record(const std::string& id, bool named = true) {
  const Value attributes = named ? Value{{"UXExtensionPointName", "p"}} : Value::EmptyDictionary();
  auto record = std::make_shared<DRDPlugIn>();
  record->setupWithNameUrlBundleInfoInfoUuid(
      id, "/p/" + id, Value{{"UXExtension", Value{{"UXExtensionAttributes", attributes}}}}, Value(),
      std::nullopt);
  return record;
}

std::string Doc(const Value& data) {
  return *pdoc::WriteXml(Value{{"version", 16}, {"data", data}});
}

struct FailingWrites : FileSystemWrapper {
  FailingWrites() : FileSystemWrapper(FileSystem::Default()) {}
  std::atomic<bool> fail = false;  // fails every write while set
  Status writeFileAtomically(const std::string& path, std::string_view bytes,
                             mode_t mode) override {
    if (fail) return Error(kFileErrorDomain, kFileWriteError, "disk full");
    return FileSystemWrapper::writeFileAtomically(path, bytes, mode);
  }
};

class AnnotationStoreTest : public ::testing::Test {
 protected:
  std::unique_ptr<DRDAnnotationStore> Open(std::chrono::milliseconds retry = 1min) {
    AnnotationStoreOptions options;
    options.fileSystem = &fs_;
    options.saveRetryInterval = retry;
    return DRDAnnotationStore::initWithDatabase(file_, std::move(options));
  }
  std::string Read() const { return FileSystem::Default()->readFile(file_).value_or("none"); }

  testing::TempFolder folder_;
  const std::string file_ = folder_ / "Annotations";
  FailingWrites fs_;
};

// Loading never rewrites the file; the next save replaces it whole, as XML.
// Rows: the file, the error logged.
TEST_F(AnnotationStoreTest, LoadsVersion16AndResetsAnythingElse) {
  const Value table{{"viewer", Value{{"election", 1}, {"extension", Value{{"zoom", 2.5}}}}}};
  const std::string found = "Dromon error 7: found database version ";
  const std::pair<std::optional<std::string>, std::string> rows[] = {
      {Doc(table), ""},
      {std::nullopt, ""},
      {*pdoc::WriteXml(Value{{"version", "16"}, {"data", table}}), found + "0 needed version 16"},
      {Doc(Value(Array{table})), found + "16 without a data dictionary"},
  };
  for (const auto& [bytes, error] : rows) {
    ::unlink(file_.c_str());
    ASSERT_TRUE(!bytes || testing::WriteTestFile(file_, *bytes));
    ScopedLogCapture log;
    auto store = Open();
    const Value loaded = bytes && error.empty() ? table : Value::EmptyDictionary();
    EXPECT_EQ(Value(store->annotations()), loaded);
    EXPECT_EQ(log.lines().size() == 1 &&
                  log.contains("unable to load annotation database:" + file_ + " error:" + error),
              !error.empty());
    EXPECT_EQ(Read(), bytes.value_or("none"));
    ASSERT_TRUE(store->saveDb().ok());
    EXPECT_EQ(Read(), Doc(loaded));
  }
}

// Each change saves the whole table as memory holds it, never text from
// before a change whose save failed: entries out of order, keys needing
// escapes, merges, erasures, and an entry the file cannot hold, which fails
// every save with the writer's message until it is gone. A failed save is
// retried without a next change. Steps: plug-in, annotation set, whether
// writes fail, the error logged.
TEST_F(AnnotationStoreTest, SavesWriteTheWholeTableOrKeepTheOldFileAndAreRetried) {
  auto store = Open(std::chrono::milliseconds(50));
  const std::string full = "file error 512", uuid = "pdoc error 2: at /data/d/extension/id";
  const std::tuple<std::string, Value, bool, std::string> steps[] = {
      {"m", Value{{"election", 1}}, false, ""},
      {"a", Value{{"election", -1}, {"extension", Value{{"list", Value(Array{1, "a<b\r"})}}}},
       false, ""},
      {"b", Value{{"election", 1}}, true, full},
      {"a", Value(), true, full},
      {"b", Value{{"election", 1}}, false, ""},  // the same election as it is
      {"none", Value(), false, ""},
      {"d", Value{{"extension", Value{{"id", Uuid::random()}}}}, false, uuid},
      {"c", Value{{"election", 0}}, false, uuid},
      {"d", Value(), false, ""},
  };
  for (const auto& [id, set, fail, error] : steps) {
    SCOPED_TRACE(id + " " + set.description());
    fs_.fail = fail;
    const std::string before = Read();
    ScopedLogCapture log;
    store->setAnnotationForPlugIn(set, *Record(id, id != "m"));
    EXPECT_EQ(Read(), error.empty() ? Doc(Value(store->annotations())) : before);
    const std::vector<std::string> lines = log.lines();  // the failure, or that it saved at last
    EXPECT_TRUE(error.empty() ? lines.size() <= 1 : lines.size() == 1);
    EXPECT_TRUE(lines.empty() ||
                lines[0].starts_with(error.empty() ? "saved annotations:" + file_ + " after "
                                                   : "unable to save annotations:" + file_ +
                                                         " error:" + error));
  }
  EXPECT_EQ(store->annotations().size(), 3u);  // b, c and m
  fs_.fail = true;
  ScopedLogCapture log;
  store->setAnnotationForPlugIn(Value{{"election", 2}}, *Record("x"));
  fs_.fail = false;
  for (int i = 0; i < 1000 && log.lines().size() < 2; ++i) std::this_thread::sleep_for(10ms);
  EXPECT_TRUE(log.lines().size() == 2 &&
              log.lines()[1].starts_with("saved annotations:" + file_ + " after 1 failed"));
  EXPECT_EQ(Read(), Doc(Value(store->annotations())));
}

// A relative XDG_STATE_HOME is ignored; no usable state folder stops the
// process (the stop can be replaced).
TEST_F(AnnotationStoreTest, DefaultLocationIsInTheStateHome) {
  const std::string home = folder_.path();
  AnnotationStoreOptions options;
  options.getenv = [&](std::string_view name) -> const char* {
    return name == "XDG_STATE_HOME" ? "relative" : name == "HOME" ? home.c_str() : nullptr;
  };
  options.onFatal = [](std::string_view) { ::_exit(3); };
  EXPECT_EQ(DRDAnnotationStore::initWithDatabase(std::nullopt, options)->annotationsURL(),
            home + "/.local/state/com.corvel.dromon/Annotations");
  options.getenv = [](std::string_view) { return nullptr; };
  EXPECT_EXIT(DRDAnnotationStore::defaultDatabaseURL(options), ::testing::ExitedWithCode(3),
              "unable to locate user directory: errno 2");
}

}  // namespace
}  // namespace dr
