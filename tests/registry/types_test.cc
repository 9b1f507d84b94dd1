#include "platform/types.h"

#include <gtest/gtest.h>

#include <limits>
#include <map>

#include "registry/registry.h"
#include "registry/types_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

Value Declare(const char* type, const Value& to) {
  return Value{{"TypeIdentifier", type}, {"ConformsTo", to}};
}
Value Declaring(std::initializer_list<Value> declarations) {
  return Value{{"TypeDeclarations", Value(Array(declarations))}};
}

// Shared-mime-info data of its own in two data folders (the first the more
// important), and two registered bundles declaring types.
class TypeServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_.writeFile("one/mime/subclasses",
                   "# comment\nimage/svg+xml application/xml\napplication/xml text/plain\n"
                   "application/x-a application/x-b\r\napplication/x-b application/x-c \nodd\n");
    dir_.writeFile("one/mime/aliases", "image/x-png-alias image/png\ntext/x-old text/x-new\n");
    dir_.writeFile("two/mime/aliases", "image/x-png-alias image/gif\n");
    dir_.writeFile("two/mime/subclasses",
                   "text/x-new text/x-base\napplication/x-loop-a application/x-loop-b\n"
                   "application/x-loop-b application/x-loop-a\n");
    const Value photo = Declaring({
        Declare("org.example.photo", "org.example.picture"),
        Declare("org.example.raw", Value(Array{"org.example.photo", "image/x-raw"})),
        Declare("org.example.cycle1", "org.example.cycle2"),
        Declare("org.example.cycle2", "org.example.cycle1"),
        // Odd declarations are skipped, their good parts kept.
        Value{{"TypeIdentifier", 5}, {"ConformsTo", "org.example.picture"}},
        Value("org.example.loose"),
        Declare("org.example.odd",
                Value(Array{1, Value::EmptyDictionary(), "org.example.picture"})),
    });
    make("Photo", photo);
    make("Raw", Declaring({Declare("Image/X-Raw", "image/png")}));
    types_ = NewTypeService(
        {{dir_.path("one"), dir_.path("two"), dir_.path("absent")}, registry_.get()});
  }
  void make(const std::string& name, const Value& declarations) {
    dir_.makeBundle(name + ".appex",
                    test::PlugInBundleInfo("com.example." + name, "1", "run", declarations));
    ASSERT_TRUE(registry_->registerBundle(dir_.path(name + ".appex")).ok());
  }

  test::BundleFixture dir_;
  std::unique_ptr<Registry> registry_ = test::OpenTestRegistry(dir_.path("data"));
  std::unique_ptr<TypeService> types_;
};

// Rows of two strings ask whether the first type conforms to the second;
// the others whether an activation rule takes a pattern of offered types.
TEST_F(TypeServiceTest, ConformanceAndActivationRulesFollowMimeDataImplicitRulesAndDeclarations) {
  const Value nan(std::numeric_limits<double>::quiet_NaN());
  const Value huge(std::numeric_limits<uint64_t>::max());
  auto count = [](Value n) { return Value{{"image/png", n}}; };
  const struct {
    Value a, b;
    bool expected;
  } rows[] = {
      {"Image/PNG", "image/png", true},  // media types ignore case
      {"org.example.Photo", "org.example.photo", false},
      {"image/svg+xml", "text/plain", true},  // subclass, then subclass again
      {"application/x-a", "application/x-c", true},
      {"application/x-c", "application/x-a", false},
      // An alias is its canonical type; the most important folder's wins.
      {"image/x-png-alias", "image/png", true},
      {"image/x-png-alias", "image/gif", false},
      {"image/png", "image/x-png-alias", true},
      {"text/x-old", "text/x-base", true},  // alias, then another folder's subclass
      {"text/markdown", "text/plain", true},
      {"text/markdown", "text/html", false},
      {"org.example.photo", "application/octet-stream", true},
      {"inode/directory", "application/octet-stream", false},
      {"image/svg+xml", "application/*", true},
      {"text/plain", "image/*", false},
      {"org.example.photo", "image/*", false},
      {"application/x-loop-a", "application/x-unrelated", false},
      {"org.example.photo", "org.example.picture", true},
      {"org.example.picture", "org.example.photo", false},
      {"org.example.raw", "image/png", true},  // across two bundles' declarations
      {"org.example.raw", "image/*", true},
      {"org.example.cycle1", "org.example.none", false},
      {"org.example.odd", "org.example.picture", true},
      {"", "", false},
      {"image/png", "", false},
      {true, Value::EmptyDictionary(), true},
      {false, count(1), false},
      {count(2), count(2), true},
      {count(2), count(2.5), false},
      {Value{{"application/xml", 1}}, Value{{"image/svg+xml", 1}}, true},
      {Value{{"image/*", 2}}, Value{{"image/svg+xml", 2}}, true},
      {count(2), Value{{"image/png", 1}, {"text/plain", 1}}, false},
      {Value{{"image/png", 1}, {"image/*", 5}}, count(4), true},
      {count(2), Value{{"image/png", 1}, {"text/plain", 0}}, true},
      {Value::EmptyDictionary(), count(1), false},
      {count(5), count(huge), false},
      {count(huge), count(1000), true},
      {count(1), count(true), true},
      // Odd shapes take nothing.
      {"image/png", count(1), false},
      {Value(Array{"image/png"}), count(1), false},
      {Value(), Value::EmptyDictionary(), false},
      {count(5), count("1"), false},
      {count(5), count(-1), false},
      {count(5), count(nan), false},
      {true, count(Value(Array{1})), false},
      {true, Value(Array{"image/png"}), false},
      {count(1), Value(), false},
      {count("5"), count(1), false},
      {count(nan), count(1), false},
      {count(-1), count(1), false},
      {Value{{"image/png", "5"}, {"image/*", 3}}, count(1), true},
  };
  for (const auto& r : rows) {
    SCOPED_TRACE(r.a.description() + " -> " + r.b.description());
    EXPECT_EQ(r.a.isString() && r.b.isString() ? types_->conformsTo(*r.a.string(), *r.b.string())
                                               : types_->evaluateActivationRule(r.a, r.b),
              r.expected);
  }
  // Declarations follow the registry.
  ASSERT_TRUE(registry_->unregisterBundle(dir_.path("Raw.appex")).ok());
  EXPECT_FALSE(types_->conformsTo("org.example.raw", "image/png"));
  make("Late", Declaring({Declare("org.example.late", "org.example.photo")}));
  EXPECT_TRUE(types_->conformsTo("org.example.late", "org.example.picture"));
}

TEST(TypeDataFoldersTest, ComeFromTheEnvironment) {
  const std::vector<std::string> usr = {"/usr/local/share", "/usr/share"};
  const std::pair<std::map<std::string, std::string>, std::vector<std::string>> rows[] = {
      {{{"HOME", "/h"}, {"XDG_DATA_HOME", ""}, {"XDG_DATA_DIRS", ""}},
       {"/h/.local/share", usr[0], usr[1]}},
      {{{"HOME", "/h"}, {"XDG_DATA_HOME", "/d"}, {"XDG_DATA_DIRS", "/a::rel:/b"}},
       {"/d", "/a", "/b"}},
      {{{"XDG_DATA_HOME", "relative"}}, usr},
  };
  for (const auto& [env, expected] : rows) {
    EXPECT_EQ(DataFoldersFromEnvironment([&](const char* name) {
                auto it = env.find(name);
                return it == env.end() ? nullptr : it->second.c_str();
              }),
              expected);
  }
}

}  // namespace
}  // namespace dr
