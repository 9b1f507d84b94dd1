#include "platform/service_manager.h"

#include <gtest/gtest.h>

#include "tests/support/bundle_fixture.h"

namespace dr {
namespace {

TEST(ServiceManagerTest, SdkDictionaryFromTheFirstFolderThatHasIt) {
  test::BundleFixture dir;
  dir.writePdoc("one/com.example.both.pdoc", Value{{"from", "one"}});
  dir.writePdoc("two/com.example.both.pdoc", Value{{"from", "two"}});
  dir.writePdoc("two/com.example.second.pdoc", Value{{"from", "two"}});
  dir.writeFile("one/com.example.broken.pdoc", "<pdoc><dict>");
  dir.writePdoc("two/com.example.broken.pdoc", Value{{"from", "two"}});
  dir.writePdoc("one/com.example.list.pdoc", Value(Array{1}));
  dir.writePdoc("escape.pdoc", Value{{"from", "outside"}});
  test::ScopedEnv path("DR_SDK_PATH",
                       dir.path("one") + "::" + dir.path("two") + ":" + dir.path("absent"));
  ServiceManager* sm = ServiceManager::Default();

  struct Row {
    const char* identifier;
    Value expected;
    bool error;
  };
  const Row rows[] = {
      {"com.example.both", Value{{"from", "one"}}, false},
      {"com.example.second", Value{{"from", "two"}}, false},
      {"com.example.none", Value(), false},
      // The first file found is the registration, even when it is broken.
      {"com.example.broken", Value(), true},
      {"com.example.list", Value(), true},
      // An identifier names a file in a folder, never a path elsewhere.
      {"../escape", Value(), false},
      {"", Value(), false},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.identifier);
    Result<Value> got = sm->sdkDictionary(r.identifier);
    ASSERT_EQ(got.ok(), !r.error);
    if (got.ok()) {
      EXPECT_EQ(*got, r.expected);
    }
  }
}

TEST(ServiceManagerTest, DefaultFoldersFollowXdgDataHome) {
  test::BundleFixture dir;
  dir.writePdoc("data/dromon/SDKs/com.example.user.pdoc", Value{{"from", "user"}});
  test::ScopedEnv noPath("DR_SDK_PATH", std::nullopt);
  test::ScopedEnv data("XDG_DATA_HOME", dir.path("data"));
  Result<Value> got = ServiceManager::Default()->sdkDictionary("com.example.user");
  ASSERT_TRUE(got.ok());
  EXPECT_EQ(*got, (Value{{"from", "user"}}));
}

}  // namespace
}  // namespace dr
