#include "platform/types.h"

#include <gtest/gtest.h>

#include <limits>

#include "registry/registry.h"
#include "registry/types_linux.h"
#include "tests/support/bundle_fixture.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

Value Declaring(std::initializer_list<std::pair<Value, Value>> declarations) {
  Array out;
  for (const auto& [type, to] : declarations)
    out.push_back(Value{{"TypeIdentifier", type}, {"ConformsTo", to}});
  return Value{{"TypeDeclarations", Value(std::move(out))}};
}

// Rows of two strings ask whether the first type conforms to the second, over
// mime data of two folders (the first the more important) and a registered
// bundle's declarations; the others whether an activation rule takes a
// pattern of offered types.
TEST(TypeServiceTest, ConformanceAndActivationRulesFollowMimeDataAndDeclarations) {
  test::BundleFixture dir;
  dir.writeFile("one/mime/subclasses",
                "# comment\n\nodd\nimage/svg+xml application/xml\r\napplication/xml text/plain \n");
  dir.writeFile("one/mime/aliases", "image/x-alias image/png\n");
  dir.writeFile("two/mime/aliases", "image/x-alias image/gif\n");
  const Value odd = Value(Array{1, "", "org.example.picture"});  // its good parts are kept
  const Value declarations = Declaring({{"org.example.photo", "org.example.picture"},
                                        {"org.example.raw", Value(Array{"org.example.photo"})},
                                        {"Image/X-Raw", "image/png"},
                                        {"org.example.cycle1", "org.example.cycle2"},
                                        {"org.example.cycle2", "org.example.cycle1"},
                                        {"org.example.odd", odd},
                                        {5, "org.example.picture"},
                                        {"", "org.example.picture"}});
  dir.makeBundle("P.appex", test::PlugInBundleInfo("com.example.p", "1", "run", declarations));
  auto registry = test::OpenTestRegistry(dir.path("data"));
  ASSERT_TRUE(registry->registerBundle(dir.path("P.appex")).ok());
  auto types =
      NewTypeService({{dir.path("one"), dir.path("two"), dir.path("absent")}, registry.get()});
  const Value nan(std::numeric_limits<double>::quiet_NaN());
  auto count = [](Value n) { return Value{{"image/png", n}}; };
  const struct {
    Value a, b;
    bool expected;
  } rows[] = {
      {"Image/SVG+XML", "text/plain", true},  // media types ignore case
      {"org.example.Photo", "org.example.photo", false},
      {"image/x-alias", "image/png", true},
      {"text/markdown", "text/plain", true},
      {"org.example.photo", "application/octet-stream", true},
      {"inode/directory", "application/octet-stream", false},
      {"image/svg+xml", "application/*", true},
      {"org.example.photo", "image/*", false},
      {"org.example.raw", "org.example.picture", true},
      {"image/x-raw", "image/png", true},
      {"org.example.cycle1", "org.example.none", false},
      {"org.example.odd", "org.example.picture", true},
      {"", "", false},
      {"image/png", "", false},
      {count(2), count(2.5), false},
      {Value{{"image/*", 2}}, Value{{"image/svg+xml", 2}}, true},
      {count(2), Value{{"image/png", 1}, {"text/plain", 1}}, false},
      {count(2), Value{{"image/png", 1}, {"text/plain", 0}}, true},
      {Value{{"image/png", "5"}, {"image/*", 3}}, count(1), true},
      // Odd shapes take nothing.
      {"image/png", count(1), false},
      {count(5), count("1"), false},
      {count(5), count(-1), false},
      {count(5), count(nan), false},
      {true, count(Value(Array{1})), false},
      {true, Value(Array{"image/png"}), false},
      {count("5"), count(1), false},
      {count(nan), count(1), false},
  };
  for (const auto& r : rows) {
    SCOPED_TRACE(r.a.description() + " -> " + r.b.description());
    EXPECT_EQ(r.a.isString() && r.b.isString() ? types->conformsTo(*r.a.string(), *r.b.string())
                                               : types->evaluateActivationRule(r.a, r.b),
              r.expected);
  }
  ASSERT_TRUE(registry->unregisterBundle(dir.path("P.appex")).ok());
  EXPECT_FALSE(types->conformsTo("org.example.photo", "org.example.picture"));
}

}  // namespace
}  // namespace dr
