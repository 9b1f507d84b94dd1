#include "platform/file_system.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

namespace dr {
namespace {

// A fresh folder under /tmp, removed with everything in it afterwards.
class FileSystemTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/file_system_test.XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    dir_ = pattern;
  }
  void TearDown() override { std::filesystem::remove_all(dir_); }

  std::string Path(const std::string& name) const { return dir_ + "/" + name; }

  static std::string Contents(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
  }

  static mode_t Mode(const std::string& path) {
    struct stat st;
    return ::stat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
  }

  // The names in `folder`, to see that no temporary was left behind.
  static std::vector<std::string> Names(const std::string& folder) {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(folder)) {
      names.push_back(entry.path().filename());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

  FileSystem* fs_ = FileSystem::Default();
  std::string dir_;
};

TEST_F(FileSystemTest, AtomicWriteReplacesTheFileWithTheGivenMode) {
  const std::string path = Path("state");
  ASSERT_TRUE(fs_->writeFileAtomically(path, "old contents", 0644));

  const std::string bytes("new\0bytes", 9);
  ASSERT_TRUE(fs_->writeFileAtomically(path, bytes, 0600));
  EXPECT_EQ(Contents(path), bytes);
  EXPECT_EQ(Mode(path), 0600u);
  EXPECT_EQ(Names(dir_), std::vector<std::string>{"state"});
}

TEST_F(FileSystemTest, FailedAtomicWriteLeavesEverythingAsItWas) {
  // The target is a folder holding a file: the temporary is written, and the
  // rename over the folder fails.
  ASSERT_TRUE(fs_->makeDirectories(Path("target")));
  ASSERT_TRUE(fs_->writeFileAtomically(Path("target/inner"), "inner"));
  // The target's folder is a regular file: the temporary cannot be created.
  ASSERT_TRUE(fs_->writeFileAtomically(Path("plain"), "plain"));

  for (const char* target : {"target", "plain/state"}) {
    Status status = fs_->writeFileAtomically(Path(target), "replacement");
    ASSERT_FALSE(status) << target;
    EXPECT_EQ(status.error().domain(), kFileErrorDomain);
    EXPECT_EQ(status.error().code(), kFileWriteError);
  }
  EXPECT_EQ(Names(dir_), (std::vector<std::string>{"plain", "target"}));
  EXPECT_EQ(Names(Path("target")), std::vector<std::string>{"inner"});
  EXPECT_EQ(Contents(Path("target/inner")), "inner");
  EXPECT_EQ(Contents(Path("plain")), "plain");
}

TEST_F(FileSystemTest, ReadsWholeFilesAndRefusesTheRest) {
  ASSERT_TRUE(fs_->writeFileAtomically(Path("ten"), "0123456789"));
  ASSERT_TRUE(fs_->makeDirectories(Path("folder")));
  const struct {
    std::string name;
    size_t maxBytes;
    int64_t code;  // 0: read succeeds
  } rows[] = {
      {"ten", 10, 0},
      {"ten", 9, kFileReadError},
      {"missing", 100, kFileReadNoSuchFileError},
      {"missing/below", 100, kFileReadNoSuchFileError},
      {"folder", 100, kFileReadError},
      {"ten/below", 100, kFileReadError},
  };
  for (const auto& row : rows) {
    Result<std::string> bytes = fs_->readFile(Path(row.name), row.maxBytes);
    if (row.code == 0) {
      ASSERT_TRUE(bytes) << row.name << ": " << bytes.error().description();
      EXPECT_EQ(*bytes, "0123456789");
    } else {
      ASSERT_FALSE(bytes) << row.name;
      EXPECT_EQ(bytes.error().domain(), kFileErrorDomain) << row.name;
      EXPECT_EQ(bytes.error().code(), row.code) << row.name;
    }
  }
}

TEST_F(FileSystemTest, MakesNestedFoldersOnlyWhereNoFileIsInTheWay) {
  ASSERT_TRUE(fs_->makeDirectories(Path("a/b/c"), 0700));
  EXPECT_EQ(Mode(Path("a")), 0700u);
  EXPECT_EQ(Mode(Path("a/b/c")), 0700u);
  EXPECT_TRUE(fs_->makeDirectories(Path("a/b/c"))) << "existing folders are fine";

  ASSERT_TRUE(fs_->writeFileAtomically(Path("a/file"), "x"));
  for (const char* path : {"a/file", "a/file/d"}) {
    Status status = fs_->makeDirectories(Path(path));
    ASSERT_FALSE(status) << path;
    EXPECT_EQ(status.error().domain(), kFileErrorDomain);
    EXPECT_EQ(status.error().code(), kFileWriteError);
  }
  EXPECT_EQ(Contents(Path("a/file")), "x");
}

}  // namespace
}  // namespace dr
