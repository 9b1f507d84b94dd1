#include "platform/file_system.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/pdoc_file.h"
#include "tests/support/registry_bundles.h"

namespace dr {
namespace {

using registry_test::ModeOf;
using registry_test::ReadBytes;
using registry_test::TempFolder;
using registry_test::WriteBytes;
using Names = std::vector<std::string>;

// The names in `folder`, to see that no temporary was left behind.
Names NamesIn(const std::string& folder) {
  Names names;
  for (const auto& e : std::filesystem::directory_iterator(folder)) {
    names.push_back(e.path().filename());
  }
  std::sort(names.begin(), names.end());
  return names;
}

TEST(FileSystemTest, WritesReplaceAtomicallyOrLeaveEverythingAsItWas) {
  TempFolder dir;
  FileSystem* fs = FileSystem::Default();
  ASSERT_TRUE(fs->writeFileAtomically(dir / "state", "old contents", 0644).ok());
  const std::string bytes("new\0bytes", 9);
  ASSERT_TRUE(fs->writeFileAtomically(dir / "state", bytes, 0600).ok());
  EXPECT_EQ(ReadBytes(dir / "state"), bytes);
  EXPECT_EQ(ModeOf(dir / "state"), 0600u);
  ASSERT_TRUE(fs->replaceFile(dir / "state", bytes + "!", 0640).ok());  // the write without syncs
  EXPECT_EQ(ReadBytes(dir / "state"), bytes + "!");
  EXPECT_EQ(ModeOf(dir / "state"), 0640u);

  ASSERT_TRUE(fs->makeDirectories(dir / "a/b/c", 0700).ok());
  EXPECT_EQ(ModeOf(dir / "a"), 0700u);
  EXPECT_EQ(ModeOf(dir / "a/b/c"), 0700u);
  EXPECT_TRUE(fs->makeDirectories(dir / "a/b/c").ok()) << "existing folders are fine";
  ASSERT_TRUE(fs->writeFileAtomically(dir / "a/b/c/inner", "inner").ok());
  ASSERT_TRUE(fs->writeFileAtomically(dir / "plain", "plain").ok());
  const struct {
    bool folder;  // else a file
    const char* path;
  } refused[] = {
      {false, "a"},            // the rename over a folder fails
      {false, "plain/state"},  // the temporary cannot be made
      {true, "plain"},
      {true, "plain/d"},
  };
  for (const auto& row : refused) {
    std::vector<Status> statuses;
    if (row.folder) {
      statuses.push_back(fs->makeDirectories(dir / row.path));
    } else {
      statuses.push_back(fs->writeFileAtomically(dir / row.path, "replacement"));
      statuses.push_back(fs->replaceFile(dir / row.path, "replacement"));
    }
    for (const Status& status : statuses) {
      ASSERT_FALSE(status.ok()) << row.path;
      EXPECT_EQ(status.error().domain(), kFileErrorDomain);
      EXPECT_EQ(status.error().code(), kFileWriteError);
    }
  }
  EXPECT_EQ(NamesIn(dir.path()), (Names{"a", "plain", "state"}));
  EXPECT_EQ(NamesIn(dir / "a"), Names{"b"});
  EXPECT_EQ(ReadBytes(dir / "a/b/c/inner"), "inner");
  EXPECT_EQ(ReadBytes(dir / "plain"), "plain");
}

TEST(FileSystemTest, ReadsWholeFilesAndRefusesTheRest) {
  TempFolder dir;
  ASSERT_TRUE(FileSystem::Default()->writeFileAtomically(dir / "ten", "0123456789").ok());
  ASSERT_TRUE(FileSystem::Default()->makeDirectories(dir / "folder").ok());
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);  // no writer: opening it may block
  const struct {
    std::string name;
    size_t maxBytes;
    int64_t code;  // 0: read succeeds
  } rows[] = {
      {"ten", 10, 0},
      {"ten", 9, kFileReadError},
      {"missing", 100, kFileReadNoSuchFileError},
      {"missing/below", 100, kFileReadNoSuchFileError},
      {"folder", 100, kFileReadNoSuchFileError},
      {"fifo", 100, kFileReadNoSuchFileError},
      {"ten/below", 100, kFileReadError},
  };
  for (const auto& row : rows) {
    Result<std::string> bytes = FileSystem::Default()->readFile(dir / row.name, row.maxBytes);
    ASSERT_EQ(bytes.ok(), row.code == 0) << row.name;
    if (row.code == 0) {
      EXPECT_EQ(*bytes, "0123456789");
    } else {
      EXPECT_EQ(bytes.error().domain(), kFileErrorDomain) << row.name;
      EXPECT_EQ(bytes.error().code(), row.code) << row.name;
    }
  }
}

// After a crash between creating a temporary and renaming it, only files
// named exactly as a write to that target names its temporaries go.
TEST(FileSystemTest, RemovesOnlyTheLeftoverTemporariesOfItsTarget) {
  TempFolder dir;
  FileSystem* fs = FileSystem::Default();
  const std::string uuid = "0F1E2D3C-4B5A-4978-8695-A4B3C2D1E0F9";
  const std::string lower = "0f1e2d3c-4b5a-4978-8695-a4b3c2d1e0f9";
  ASSERT_TRUE(fs->writeFileAtomically(dir / "Annotations", "kept").ok());
  struct Entry {
    std::string name;
    bool folder;
    bool removed;
  };
  const Entry entries[] = {
      {"Annotations.tmp-" + uuid, false, true},
      {"Annotations.tmp-" + lower, false, true},
      {"Annotations.tmp-" + uuid + "x", false, false},  // not a name a write makes
      {"Annotations.tmp-notauuid", false, false},
      {"Annotations.tmp-", false, false},
      {"Other.tmp-" + uuid, false, false},  // another target's
      {"XAnnotations.tmp-" + uuid, false, false},
      {"Annotations.tmp-1F1E2D3C-4B5A-4978-8695-A4B3C2D1E0F9", true, false},  // a folder
  };
  for (const Entry& e : entries) {
    if (e.folder) {
      std::filesystem::create_directory(dir / e.name);
    } else {
      ASSERT_TRUE(fs->writeFileAtomically(dir / e.name, "partial").ok());
    }
  }
  std::filesystem::create_symlink(dir / "Annotations",
                                  dir / ("Annotations.tmp-" + uuid.substr(0, 35) + "0"));

  Result<size_t> removed = fs->removeLeftoverTemporaries(dir / "Annotations");
  ASSERT_TRUE(removed) << removed.error().description();
  EXPECT_EQ(*removed, 2u);
  Names expected = {"Annotations", "Annotations.tmp-" + uuid.substr(0, 35) + "0"};
  for (const Entry& e : entries) {
    if (!e.removed) expected.push_back(e.name);
  }
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(NamesIn(dir.path()), expected);
  EXPECT_EQ(ReadBytes(dir / "Annotations"), "kept");

  // Nothing left: none removed; no folder: none either.
  EXPECT_EQ(*fs->removeLeftoverTemporaries(dir / "Annotations"), 0u);
  EXPECT_EQ(*fs->removeLeftoverTemporaries(dir / "missing/Annotations"), 0u);
}

// Canonical paths are granted in extension tokens and compared as registry
// keys, so every way of naming a file must resolve as realpath(3) does.
TEST(FileSystemTest, CanonicalPathResolvesAsRealpath) {
  TempFolder dir;
  WriteBytes(dir / "real/Plug.appex/Contents/Info.pdoc", "{}");
  WriteBytes(dir / "real/name (deleted)", "a name the kernel also uses for a removed file");
  std::filesystem::create_directory_symlink(dir / "real", dir / "link");
  std::filesystem::create_directory_symlink("link", dir / "relative-link");
  std::filesystem::create_symlink(dir / "missing", dir / "dangling");
  ASSERT_EQ(::mkfifo((dir / "real/fifo").c_str(), 0600), 0);  // must not block
  const std::string plugIn = dir / "real/Plug.appex";
  struct Row {
    std::string path;
    std::string canonical;  // empty: fails with `errnum`
    int errnum;
  } rows[] = {
      {plugIn, plugIn, 0},
      {dir / "link/Plug.appex", plugIn, 0},
      {dir / "link", dir / "real", 0},
      {dir.path() + "//real///Plug.appex", plugIn, 0},
      {"/proc/self/root", "/", 0},
      {dir / "relative-link/Plug.appex/", plugIn, 0},
      {dir / "real/./Plug.appex/Contents/..", plugIn, 0},
      {dir / "link/../real/Plug.appex", plugIn, 0},
      {dir / "real/name (deleted)", dir / "real/name (deleted)", 0},
      {dir / "real/fifo", dir / "real/fifo", 0},
      {"/", "/", 0},
      {dir / "real/missing", "", ENOENT},
      {dir / "dangling", "", ENOENT},
      {dir / "real/Plug.appex/Contents/Info.pdoc/x", "", ENOTDIR},
      {"", "", ENOENT},
      {std::string("/tm\0p", 5), "", EINVAL},
  };
  for (const Row& row : rows) {
    Result<std::string> resolved = CanonicalPath(row.path);
    if (row.canonical.empty()) {
      ASSERT_FALSE(resolved) << row.path;
      EXPECT_EQ(resolved.error().domain(), kPosixErrorDomain) << row.path;
      EXPECT_EQ(resolved.error().code(), row.errnum) << row.path;
    } else {
      ASSERT_TRUE(resolved) << row.path << ": " << resolved.error().description();
      EXPECT_EQ(*resolved, row.canonical) << row.path;
    }
  }
}

TEST(PdocFileTest, FilesRoundTripAndKeepTheirErrorDomains) {
  TempFolder dir;
  const std::string path = dir / "Info.pdoc";
  Value value{{"BNBundleIdentifier", "org.example.plugin"}, {"count", 2}};
  ASSERT_TRUE(pdoc::WriteFile(path, value).ok());
  EXPECT_EQ(ModeOf(path), 0600u);
  Result<Value> back = pdoc::ReadFile(path);
  ASSERT_TRUE(back);
  EXPECT_EQ(value, *back);

  Result<Value> missing = pdoc::ReadFile(dir / "missing.pdoc");
  ASSERT_FALSE(missing);
  EXPECT_EQ(missing.error().domain(), kFileErrorDomain);
  EXPECT_EQ(missing.error().code(), kFileReadNoSuchFileError);

  ASSERT_TRUE(FileSystem::Default()->writeFileAtomically(path, "{\"a\": null}").ok());
  Result<Value> broken = pdoc::ReadFile(path);
  ASSERT_FALSE(broken);
  EXPECT_EQ(broken.error().domain(), kPdocErrorDomain);
  EXPECT_NE(broken.error().localizedDescription().find(path), std::string::npos);

  EXPECT_FALSE(pdoc::WriteFile(path, Value(Uuid::random())).ok());
  EXPECT_NE(pdoc::ReadFile(path).error().localizedDescription().find("null"), std::string::npos)
      << "a refused write must leave the file alone";
}

}  // namespace
}  // namespace dr
