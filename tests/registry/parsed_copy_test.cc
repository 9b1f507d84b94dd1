#include "registry/parsed_copy.h"

#include <gtest/gtest.h>

#include "pdoc/pdoc.h"

namespace dr::registry_internal {
namespace {

// A value nested `depth` levels deep: {"d": {"d": ... 1}}.
Value Nested(int depth) {
  Value v = 1;
  for (int i = 1; i < depth; ++i) v = Value{{"d", v}};
  return v;
}

TEST(RegistryCacheTest, CopyDecodesToWhatParsingTheBytesGives) {
  const std::string xml = *pdoc::WriteXml(Value{
      {"BNBundleIdentifier", "com.example.ü"},
      {"UXExtension",
       Value{{"UXExtensionAttributes",
              Value{{"n", -3},
                    {"u", uint64_t{1} << 63},
                    {"f", 2.5},
                    {"b", true},
                    {"when", Date{1.0e9}},
                    {"bytes", Data{0, 1, 255}},
                    {"list", Value(Array{"a", Value(Array{}), Value::EmptyDictionary()})}}}}}});
  const std::string json = R"({"UXExtension": {"k": [1, 2.0, "x"]}})";
  const std::string entitlements = *pdoc::WriteXml(Value{{"com.example.sandbox", true}});
  const struct {
    const char* name;
    std::string info;
    std::optional<std::string> entitlements;
  } rows[] = {
      {"XML with every kind of value", xml, entitlements},
      {"JSON, no entitlements", json, std::nullopt},
      {"entitlements that are not a dictionary", json, "<pdoc><string>x</string></pdoc>"},
      {"information that does not parse", "not a document", entitlements},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const ParsedFiles parsed = ParseFiles(row.info, row.entitlements);
    auto copy = EncodeParsedCopy(parsed, row.info, row.entitlements);
    ASSERT_TRUE(copy.has_value());
    auto decoded = DecodeParsedCopy(*copy, row.info, row.entitlements);
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(decoded->info, parsed.info);
    EXPECT_EQ(decoded->info.isAbsent(), parsed.info.isAbsent());
    EXPECT_EQ(decoded->entitlements, parsed.entitlements);
    EXPECT_TRUE(decoded->entitlements.isDictionary());
  }
}

TEST(RegistryCacheTest, CopyThatIsDamagedOrMadeFromOtherBytesIsRefused) {
  const std::string info = *pdoc::WriteXml(Value{{"UXExtension", Value{{"k", "v"}}}});
  const std::string entitlements = *pdoc::WriteXml(Value{{"e", 1}});
  const std::string copy = *EncodeParsedCopy(ParseFiles(info, entitlements), info, entitlements);
  // Any one byte changed, anywhere in the copy.
  for (size_t i = 0; i < copy.size(); ++i) {
    std::string damaged = copy;
    damaged[i] = static_cast<char>(damaged[i] ^ 0x20);
    EXPECT_FALSE(DecodeParsedCopy(damaged, info, entitlements).has_value()) << "byte " << i;
  }
  const struct {
    const char* name;
    std::string copy, info;
    std::optional<std::string> entitlements;
  } rows[] = {
      {"empty", "", info, entitlements},
      {"cut short", copy.substr(0, copy.size() - 1), info, entitlements},
      {"header only", copy.substr(0, 12), info, entitlements},
      {"longer", copy + '\0', info, entitlements},
      {"information changed", copy, info + " ", entitlements},
      {"entitlements changed", copy, info, entitlements + " "},
      {"entitlements gone", copy, info, std::nullopt},
      {"entitlements moved into the information", copy, info + entitlements, std::string()},
  };
  for (const auto& row : rows) {
    EXPECT_FALSE(DecodeParsedCopy(row.copy, row.info, row.entitlements).has_value()) << row.name;
  }
}

TEST(RegistryCacheTest, ValuesTheCopyCannotCarryMakeNoCopy) {
  const struct {
    const char* name;
    Value info;
  } rows[] = {
      {"nested deeper than the binary encoding allows", Value{{"UXExtension", Nested(100)}}},
      {"text holding NUL", Value{{"k", std::string("a\0b", 3)}}},
  };
  for (const auto& row : rows) {
    EXPECT_FALSE(
        EncodeParsedCopy(ParsedFiles{row.info, Value::EmptyDictionary()}, "bytes", std::nullopt)
            .has_value())
        << row.name;
  }
}

}  // namespace
}  // namespace dr::registry_internal
