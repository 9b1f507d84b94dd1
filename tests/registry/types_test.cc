#include "platform/types.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "registry/registry.h"
#include "registry/types_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

// Shared-mime-info data of its own in three data folders (most important
// first), and two registered bundles declaring types.
class TypeServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_.writeFile("home/mime/subclasses", "image/x-home-special image/png\n");
    dir_.writeFile("home/mime/aliases", "image/x-png-alias image/png\n");
    dir_.writeFile("one/mime/subclasses",
                   "# comment\n"
                   "image/svg+xml application/xml\n"
                   "application/xml text/plain\n"
                   "application/x-chain-a application/x-chain-b\r\n"
                   "application/x-chain-b application/x-chain-c\n"
                   "broken-line-without-parent\n");
    dir_.writeFile("one/mime/aliases", "image/x-png-alias image/gif\ntext/x-old text/x-new\n");
    dir_.writeFile("two/mime/subclasses",
                   "text/x-new text/x-base\n"
                   "application/x-loop-a application/x-loop-b\n"
                   "application/x-loop-b application/x-loop-a\n");

    const Value photo{
        {"TypeDeclarations",
         Value(Array{
             Value{{"TypeIdentifier", "org.example.photo"}, {"ConformsTo", "org.example.picture"}},
             Value{{"TypeIdentifier", "org.example.raw"},
                   {"ConformsTo", Value(Array{"org.example.photo", "image/x-raw"})}},
             Value{{"TypeIdentifier", "org.example.cycle1"}, {"ConformsTo", "org.example.cycle2"}},
             Value{{"TypeIdentifier", "org.example.cycle2"}, {"ConformsTo", "org.example.cycle1"}},
             // Odd declarations are skipped, their good parts kept.
             Value{{"TypeIdentifier", 5}, {"ConformsTo", "org.example.picture"}},
             Value("org.example.loose"),
             Value{
                 {"TypeIdentifier", "org.example.odd"},
                 {"ConformsTo", Value(Array{1, Value::EmptyDictionary(), "org.example.picture"})}},
         })}};
    const Value raw{{"TypeDeclarations", Value(Array{Value{{"TypeIdentifier", "Image/X-Raw"},
                                                           {"ConformsTo", "image/png"}}})}};
    dir_.makeBundle("Photo.appex", test::PlugInBundleInfo("com.example.photo", "1", "run", photo));
    dir_.makeBundle("Raw.appex", test::PlugInBundleInfo("com.example.raw", "1", "run", raw));
    registry_ = test::OpenTestRegistry(dir_.path("data"));
    ASSERT_TRUE(registry_);
    ASSERT_TRUE(registry_->registerBundle(dir_.path("Photo.appex")).ok());
    ASSERT_TRUE(registry_->registerBundle(dir_.path("Raw.appex")).ok());
    types_ = NewTypeService(
        {{dir_.path("home"), dir_.path("one"), dir_.path("two"), dir_.path("absent")},
         registry_.get()});
  }

  test::BundleFixture dir_;
  std::unique_ptr<Registry> registry_;
  std::unique_ptr<TypeService> types_;
};

TEST_F(TypeServiceTest, ConformanceFollowsMimeDataImplicitRulesAndDeclarations) {
  struct Row {
    const char* type;
    const char* to;
    bool expected;
  };
  const Row rows[] = {
      {"image/png", "image/png", true},
      {"Image/PNG", "image/png", true},  // media types ignore case
      {"org.example.Photo", "org.example.photo", false},
      {"image/svg+xml", "application/xml", true},
      {"application/x-chain-a", "application/x-chain-c", true},
      {"application/x-chain-c", "application/x-chain-a", false},
      {"image/svg+xml", "text/plain", true},  // subclass, then subclass again
      {"image/x-home-special", "image/png", true},
      // An alias is its canonical type; the most important folder's wins.
      {"image/x-png-alias", "image/png", true},
      {"image/x-png-alias", "image/gif", false},
      {"image/png", "image/x-png-alias", true},
      {"text/x-old", "text/x-base", true},  // alias, then another folder's subclass
      {"text/markdown", "text/plain", true},
      {"text/markdown", "text/html", false},
      {"image/png", "application/octet-stream", true},
      {"org.example.photo", "application/octet-stream", true},
      {"inode/directory", "application/octet-stream", false},
      {"inode/directory", "inode/directory", true},
      {"image/png", "image/*", true},
      {"image/svg+xml", "application/*", true},
      {"text/plain", "image/*", false},
      {"application/octet-stream", "image/*", false},
      {"org.example.photo", "image/*", false},
      {"application/x-loop-a", "application/x-unrelated", false},
      {"org.example.photo", "org.example.picture", true},
      {"org.example.picture", "org.example.photo", false},
      {"org.example.raw", "org.example.picture", true},
      {"org.example.raw", "image/png", true},  // across two bundles' declarations
      {"org.example.raw", "image/*", true},
      {"org.example.cycle1", "org.example.none", false},
      {"org.example.odd", "org.example.picture", true},
      {"org.example.unknown", "org.example.picture", false},
      {"", "", false},
      {"image/png", "", false},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(std::string(r.type) + " -> " + r.to);
    EXPECT_EQ(types_->conformsTo(r.type, r.to), r.expected);
  }
}

TEST_F(TypeServiceTest, DeclarationsFollowTheRegistry) {
  EXPECT_TRUE(types_->conformsTo("org.example.raw", "image/png"));
  ASSERT_TRUE(registry_->unregisterBundle(dir_.path("Raw.appex")).ok());
  EXPECT_FALSE(types_->conformsTo("org.example.raw", "image/png"));

  const Value late{{"TypeDeclarations", Value(Array{Value{{"TypeIdentifier", "org.example.late"},
                                                          {"ConformsTo", "org.example.photo"}}})}};
  dir_.makeBundle("Late.appex", test::PlugInBundleInfo("com.example.late", "1", "run", late));
  ASSERT_TRUE(registry_->registerBundle(dir_.path("Late.appex")).ok());
  EXPECT_TRUE(types_->conformsTo("org.example.late", "org.example.picture"));
}

TEST_F(TypeServiceTest, ActivationRules) {
  const Value nan(std::numeric_limits<double>::quiet_NaN());
  const Value huge(std::numeric_limits<uint64_t>::max());
  struct Row {
    const char* what;
    Value rule;
    Value pattern;
    bool expected;
  };
  const Row rows[] = {
      {"true takes anything", true, Value{{"image/png", 3}}, true},
      {"true takes nothing offered", true, Value::EmptyDictionary(), true},
      {"false", false, Value{{"image/png", 1}}, false},
      {"below the maximum", Value{{"image/png", 2}}, Value{{"image/png", 1}}, true},
      {"at the maximum", Value{{"image/png", 2}}, Value{{"image/png", 2}}, true},
      {"above the maximum", Value{{"image/png", 2}}, Value{{"image/png", 3}}, false},
      {"fraction above", Value{{"image/png", 2}}, Value{{"image/png", 2.5}}, false},
      {"through a subclass", Value{{"application/xml", 1}}, Value{{"image/svg+xml", 1}}, true},
      {"through MAJOR/*", Value{{"image/*", 2}}, Value{{"image/svg+xml", 2}}, true},
      {"one type not covered", Value{{"image/png", 2}}, Value{{"image/png", 1}, {"text/plain", 1}},
       false},
      {"each type its own key", Value{{"image/png", 2}, {"text/plain", 5}},
       Value{{"image/png", 1}, {"text/markdown", 4}}, true},
      {"some key is large enough", Value{{"image/png", 1}, {"image/*", 5}}, Value{{"image/png", 4}},
       true},
      {"zero counts ignored", Value{{"image/png", 2}}, Value{{"image/png", 1}, {"text/plain", 0}},
       true},
      {"empty pattern", Value{{"image/png", 1}}, Value::EmptyDictionary(), true},
      {"empty rule, empty pattern", Value::EmptyDictionary(), Value::EmptyDictionary(), true},
      {"empty rule", Value::EmptyDictionary(), Value{{"image/png", 1}}, false},
      {"huge count", Value{{"image/png", 5}}, Value{{"image/png", huge}}, false},
      {"huge maximum", Value{{"image/png", huge}}, Value{{"image/png", 1000}}, true},
      {"true counts one", Value{{"image/png", 1}}, Value{{"image/png", true}}, true},
      // Odd shapes accept nothing.
      {"rule a string", "image/png", Value{{"image/png", 1}}, false},
      {"rule the number 1", 1, Value{{"image/png", 1}}, false},
      {"rule an array", Value(Array{"image/png"}), Value{{"image/png", 1}}, false},
      {"rule absent", Value(), Value::EmptyDictionary(), false},
      {"count a string", Value{{"image/png", 5}}, Value{{"image/png", "1"}}, false},
      {"count negative", Value{{"image/png", 5}}, Value{{"image/png", -1}}, false},
      {"count NaN", Value{{"image/png", 5}}, Value{{"image/png", nan}}, false},
      {"count an array", true, Value{{"image/png", Value(Array{1})}}, false},
      {"pattern an array", true, Value(Array{"image/png"}), false},
      {"pattern absent", Value{{"image/png", 1}}, Value(), false},
      {"maximum a string", Value{{"image/png", "5"}}, Value{{"image/png", 1}}, false},
      {"maximum NaN", Value{{"image/png", nan}}, Value{{"image/png", 1}}, false},
      {"maximum negative", Value{{"image/png", -1}}, Value{{"image/png", 1}}, false},
      {"odd maximum, good key", Value{{"image/png", "5"}, {"image/*", 3}}, Value{{"image/png", 1}},
       true},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.what);
    EXPECT_EQ(types_->evaluateActivationRule(r.rule, r.pattern), r.expected);
  }
}

TEST(TypeDataFoldersTest, ComeFromTheEnvironment) {
  struct Row {
    std::map<std::string, std::string> env;
    std::vector<std::string> expected;
  };
  const Row rows[] = {
      {{{"HOME", "/h"}}, {"/h/.local/share", "/usr/local/share", "/usr/share"}},
      {{{"HOME", "/h"}, {"XDG_DATA_HOME", "/d"}, {"XDG_DATA_DIRS", "/a::rel:/b"}},
       {"/d", "/a", "/b"}},
      {{{"HOME", "/h"}, {"XDG_DATA_HOME", ""}, {"XDG_DATA_DIRS", ""}},
       {"/h/.local/share", "/usr/local/share", "/usr/share"}},
      {{{"XDG_DATA_HOME", "relative"}}, {"/usr/local/share", "/usr/share"}},
  };
  for (const Row& r : rows) {
    std::vector<std::string> got = DataFoldersFromEnvironment([&](const char* name) {
      auto it = r.env.find(name);
      return it == r.env.end() ? nullptr : it->second.c_str();
    });
    EXPECT_EQ(got, r.expected);
  }
}

}  // namespace
}  // namespace dr
