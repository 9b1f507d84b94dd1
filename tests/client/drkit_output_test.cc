#include "client/drkit/output.h"

#include <gtest/gtest.h>

namespace dr::drkit {
namespace {

const Uuid kUuid = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");

// Every kind of value survives the trip to JSON and back, so what raw prints
// can be sent again.
TEST(DrkitOutputTest, JsonKeepsEveryValueKind) {
  const Value message{
      {"s", "text \"quoted\" é"},
      {"u", uint64_t{18446744073709551615u}},
      {"i", int64_t{-3}},
      {"d", 1.5},
      {"b", true},
      {"uuid", kUuid},
      {"data", Value(Data{0, 1, 2, 255})},
      {"empty data", Value(Data{})},
      {"date", Value(Date{1700000000.5})},
      {"list", Value(Array{Value(1), Value::EmptyDictionary(), Value::EmptyArray()})},
  };
  Result<Value> back = FromJson(ToJson(message));
  ASSERT_TRUE(back) << back.error().description();
  EXPECT_EQ(*back, message);
  EXPECT_EQ((*back)["u"].type(), Value::Type::kUInt);
  EXPECT_EQ(ToJson(Value{{"uuids", kUuid}}, false),
            R"({"uuids":{"$uuid":"1B4E28BA-2FA1-11D2-883F-0016D3CCA427"}})");
  // A non-negative JSON integer is sent unsigned, the protocol's integer.
  EXPECT_EQ(FromJson(R"({"version": 2})")->operator[]("version").type(), Value::Type::kUInt);
}

TEST(DrkitOutputTest, JsonRefusesWhatDrdCannotCarry) {
  for (const char* bad :
       {"", "{", "{\"a\": null}", "[1, null]", R"({"$uuid": "x"})", R"({"$data": "not base64!"})",
        R"({"$date": "today"})", R"({"$what": 1})"}) {
    EXPECT_FALSE(FromJson(bad)) << bad;
  }
  std::string deep(100, '[');
  deep += std::string(100, ']');
  EXPECT_FALSE(FromJson(deep));
  // A two-key object is a dictionary, whatever its keys.
  EXPECT_EQ(*FromJson(R"({"$uuid": "x", "y": 1})"), (Value{{"$uuid", "x"}, {"y", uint64_t{1}}}));
}

Value Form(const Value& annotations) {
  return Value{{"identifier", "com.example.a"}, {"version", "1.10"},
               {"path", "/x/A.appex"},          {"uuid", kUuid.string()},
               {"lastmodified", 86400},         {"annotations", annotations}};
}

TEST(DrkitOutputTest, PlugInLinesShowTheElection) {
  const std::vector<std::pair<Value, std::string>> rows = {
      {Value::EmptyDictionary(), "  com.example.a (1.10)\n"},
      {Value{{"election", 1}}, "+ com.example.a (1.10)\n"},
      {Value{{"election", 1.0}}, "+ com.example.a (1.10)\n"},
      {Value{{"election", 0}}, "  com.example.a (1.10)\n"},
      {Value{{"election", -1}}, "- com.example.a (1.10)\n"},
      {Value{{"election", 2}}, "- com.example.a (1.10)\n"},
      {Value{{"election", "1"}}, "  com.example.a (1.10)\n"},
  };
  for (const auto& [annotations, line] : rows) {
    std::optional<client::PlugIn> p = client::PlugIn::FromForm(Form(annotations));
    ASSERT_TRUE(p);
    EXPECT_EQ(PlugInLines(*p, false), line) << annotations.description();
  }
  std::optional<client::PlugIn> p = client::PlugIn::FromForm(Form(Value::EmptyDictionary()));
  EXPECT_EQ(PlugInLines(*p, true),
            "  com.example.a (1.10)\n"
            "    uuid: 1B4E28BA-2FA1-11D2-883F-0016D3CCA427\n"
            "    path: /x/A.appex\n"
            "    registered: 1970-01-02 00:00:00 UTC\n");
}

TEST(DrkitOutputTest, FormsWithoutIdentityAreRefused) {
  for (const char* key : {"identifier", "path", "uuid"}) {
    EXPECT_FALSE(client::PlugIn::FromForm(Form(Value()).changing(key, Value()))) << key;
  }
  EXPECT_FALSE(client::PlugIn::FromForm(Form(Value()).changing("uuid", "not a uuid")));
  EXPECT_FALSE(client::PlugIn::FromForm(Value("a string")));
}

TEST(DrkitOutputTest, ErrorsNameDrdsCode) {
  EXPECT_EQ(DescribeError(Error(client::kDaemonErrorDomain, 9, "no plugin at /x")),
            "no plugin at /x (bad path, code 9)");
  EXPECT_EQ(DescribeError(Error(client::kDaemonErrorDomain, 14, "busy")), "busy (busy, code 14)");
  EXPECT_EQ(DescribeError(Error(client::kDaemonErrorDomain, 99, "new")),
            "new (drd error, code 99)");
  EXPECT_EQ(DescribeError(Error(kPosixErrorDomain, 2, "connect: No such file or directory")),
            "connect: No such file or directory");
}

}  // namespace
}  // namespace dr::drkit
