// Change notifications through counter files, seen by an inotify observer.
#include "platform/notifications.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <vector>

#include "platform/file_system.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using namespace std::chrono_literals;
using testing::TempFolder;
using testing::WriteTestFile;

std::string Contents(const std::string& path) {
  return FileSystem::Default()->readFile(path).value_or("<missing>");
}

TEST(NotificationsTest, PostsCountUpAndAreSeenByAnObserver) {
  TempFolder folder;
  NotificationOptions options{folder / "notify"};
  auto observer = NotificationObserver::Open(options.directory);
  ASSERT_TRUE(observer.ok()) << observer.error().description();
  auto center = MakeFileNotificationCenter(options);

  for (uint64_t expected = 1; expected <= 3; ++expected) {
    ASSERT_TRUE(center->post("com.example.change").ok());
    EXPECT_EQ(Contents(options.directory + "/com.example.change"), std::to_string(expected) + "\n");
    auto seen = (*observer)->waitForPost(5s);
    ASSERT_TRUE(seen.ok());
    ASSERT_TRUE(seen->has_value()) << "post " << expected << " not seen";
    EXPECT_EQ((*seen)->name, "com.example.change");
    EXPECT_EQ((*seen)->count, expected);
  }
  // Nothing more was posted, and a wait for more ends at its timeout.
  auto none = (*observer)->waitForPost(50ms);
  ASSERT_TRUE(none.ok());
  EXPECT_FALSE(none->has_value());

  struct stat st;
  ASSERT_EQ(::stat(options.directory.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
}

TEST(NotificationsTest, CountContinuesFromAnEarlierProcessAndOnlyPlainNamesArePosted) {
  TempFolder folder;
  ASSERT_TRUE(WriteTestFile(folder / "n", "41\n"));
  ASSERT_TRUE(WriteTestFile(folder / "garbage", "not a number\n"));
  auto center = MakeFileNotificationCenter(NotificationOptions{folder.path()});
  ASSERT_TRUE(center->post("n").ok());
  ASSERT_TRUE(center->post("garbage").ok());
  EXPECT_EQ(Contents(folder / "n"), "42\n");
  EXPECT_EQ(Contents(folder / "garbage"), "1\n");

  for (const std::string& name :
       std::vector<std::string>{"", ".", "..", "a/b", "/abs", "../escape", std::string("nul\0x", 5),
                                std::string(300, 'n')}) {
    Status s = center->post(name);
    ASSERT_FALSE(s.ok()) << name;
    EXPECT_EQ(s.error().code(), EINVAL);
  }
  EXPECT_TRUE(center->post(".hidden is fine").ok());
}

}  // namespace
}  // namespace dr
