#include "registry/parsed_copy.h"

#include <gtest/gtest.h>

#include "pdoc/pdoc.h"

namespace dr::registry_internal {
namespace {

using namespace std::string_literals;

// A copy reads back as the values parsed, and only as itself, whole and made
// from the bytes given; values its encoding cannot carry make no copy.
TEST(ParsedCopyTest, StandsOnlyForTheBytesItWasMadeFrom) {
  const std::string info = *pdoc::WriteXml(
      Value{{"k", Value(Array{-3, uint64_t{1} << 63, 2.5, true, Date{1.0e9}, Data{0, 255}, "ü"})}});
  const std::string copy = *EncodeParsedCopy(ParseFiles(info, info), info, info);
  EXPECT_EQ(DecodeParsedCopy(copy, info, info).value_or(ParsedFiles()).info, *pdoc::Parse(info));
  for (size_t i = 0; i <= copy.size(); ++i) {
    std::string damaged = copy + (i == copy.size() ? "\0"s : "");
    damaged[i] = static_cast<char>(damaged[i] ^ 0x20);
    EXPECT_FALSE(DecodeParsedCopy(damaged, info, info)) << "byte " << i;
  }
  EXPECT_FALSE(DecodeParsedCopy(copy, info, std::nullopt));
  EXPECT_TRUE(EncodeParsedCopy(ParseFiles("no document", std::nullopt), "no document", ""));
  Value deep = 1;
  for (int i = 1; i < 100; ++i) deep = Value{{"d", deep}};
  const Value empty = Value::EmptyDictionary(), nul{{"k", std::string("a\0b", 3)}};
  for (const Value& odd : {deep, nul}) {
    EXPECT_FALSE(EncodeParsedCopy(ParsedFiles{odd, empty}, "bytes", std::nullopt));
  }
}

}  // namespace
}  // namespace dr::registry_internal
