#include "client/drkit/output.h"

#include <gtest/gtest.h>

namespace dr::drkit {
namespace {

const Uuid kUuid = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");

// What raw prints can be sent again (a JSON integer >= 0 as unsigned, the
// protocol's integer); what drd cannot carry is refused.
TEST(DrkitOutputTest, JsonKeepsEveryValueKindAndRefusesTheRest) {
  const Value message(Array{Value("text \"quoted\" é"), Value(uint64_t{18446744073709551615u}),
                            Value(int64_t{-3}), Value(1.5), Value(true), Value(kUuid),
                            Value(Data{0, 1, 2, 255}), Value(Data{}), Value(Date{1700000000.5}),
                            Value{{"$uuid", "x"}, {"y", 1}}, Value::EmptyArray()});
  Result<Value> back = FromJson(ToJson(message));
  ASSERT_TRUE(back) << back.error().description();
  EXPECT_EQ(*back, message);
  EXPECT_EQ(FromJson("[2]")->array()[0].type(), Value::Type::kUInt);
  std::string deep = std::string(100, '[') + std::string(100, ']');
  for (const std::string& bad :
       {std::string("{"), std::string(R"([1, null])"), deep,
        std::string(R"({"$data": "not base64!"})"), std::string(R"({"$date": "today"})"),
        std::string(R"({"$what": 1})")}) {
    EXPECT_FALSE(FromJson(bad)) << bad;
  }
}

// An election that is not a number counts as none.
TEST(DrkitOutputTest, PlugInLinesAndErrors) {
  Value form{{"identifier", "com.example.a"},
             {"version", "1.10"},
             {"path", "/x/A.appex"},
             {"uuid", kUuid.string()},
             {"lastmodified", 86400}};
  const std::vector<std::pair<Value, char>> rows = {
      {Value(1.0), '+'}, {Value(2), '-'}, {Value("1"), ' '}, {Value(), ' '}};
  for (const auto& [election, mark] : rows) {
    std::optional<client::PlugIn> p =
        client::PlugIn::FromForm(form.changing("annotations", Value{{"election", election}}));
    ASSERT_TRUE(p);
    EXPECT_EQ(PlugInLines(*p, false), std::string(1, mark) + " com.example.a (1.10)\n");
  }
  EXPECT_EQ(PlugInLines(*client::PlugIn::FromForm(form), true),
            "  com.example.a (1.10)\n    uuid: 1B4E28BA-2FA1-11D2-883F-0016D3CCA427\n"
            "    path: /x/A.appex\n    registered: 1970-01-02 00:00:00 UTC\n");
  for (const char* key : {"identifier", "path", "uuid"}) {
    EXPECT_FALSE(client::PlugIn::FromForm(form.changing(key, Value(1)))) << key;
  }
  EXPECT_EQ(DescribeError(Error(client::kDaemonErrorDomain, 99, "new")),
            "new (drd error, code 99)");
  EXPECT_EQ(DescribeError(Error(kPosixErrorDomain, 2, "connect: gone")), "connect: gone");
}

}  // namespace
}  // namespace dr::drkit
