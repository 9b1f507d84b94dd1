#include "pdoc/pdoc.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>

#include "tests/support/registry_bundles.h"

namespace dr::pdoc {
namespace {

// Equal and of the same kinds: Value's == treats 2 and 2.0 alike, the XML
// tells them apart; NaN equals nothing, its description does.
bool Identical(const Value& a, const Value& b) {
  return a.type() == b.type() && WriteXml(a).value_or("a") == WriteXml(b).value_or("b") &&
         (a == b || a.description() == b.description());
}

std::string Nested(const std::string& open, const std::string& close, int levels) {
  std::string s;
  for (int i = 0; i < levels; ++i) s += open;
  for (int i = 0; i < levels; ++i) s += close;
  return s;
}

std::string InPdoc(const std::string& body) { return "<pdoc>" + body + "</pdoc>"; }

TEST(PdocTest, WritesXmlThatReadsBackAsTheSameValue) {
  const Value rows[] = {
      Value(int64_t{-3}),
      Value(std::numeric_limits<int64_t>::min()),
      Value(std::numeric_limits<uint64_t>::max()),
      Value(-0.1),
      Value(2.0),
      Value(1e300),
      Value(std::numeric_limits<double>::infinity()),
      Value(std::nan("")),
      Value(true),
      Value(Date{1769860800}),
      Value(Date{1769860800.125}),
      Value(Date{-1.5}),
      Value(Data{}),
      Value(Data{0, 1, 2, 0xFF, 0xFE}),
      Value("  padded\n\tline & <tag> \"q\" ]]> \r\n "),
      Value(""),
      Value{{"clé", "ünïcødé ✓ 𝄞"}, {"", "empty key"}},
      Value::EmptyArray(),
      Value::EmptyDictionary(),
      Value{{"a", Value(Array{Value::EmptyDictionary(), Value(Array{1, "x", false})})},
            {"b", Value{{"c", Value{{"d", 1.5}}}}}}};
  for (const Value& value : rows) {
    Result<std::string> xml = WriteXml(value);
    ASSERT_TRUE(xml) << value.description() << ": " << xml.error().description();
    Result<Value> back = Parse(*xml);
    ASSERT_TRUE(back) << *xml << back.error().description();
    EXPECT_TRUE(Identical(value, *back)) << *xml << "read back as " << back->description();
  }
}

TEST(PdocTest, WritesIndentedXmlWithKeysAscending) {
  Value value{{"zeta", 1}, {"alpha", Value(Array{"a", Value::EmptyDictionary()})}, {"mid", 2.0}};
  EXPECT_EQ(*WriteXml(value),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
            "<pdoc version=\"1.0\">\n"
            "  <dict>\n"
            "    <key>alpha</key><array>\n"
            "      <string>a</string>\n"
            "      <dict/>\n"
            "    </array>\n"
            "    <key>mid</key><real>2.0</real>\n"
            "    <key>zeta</key><integer>1</integer>\n"
            "  </dict>\n"
            "</pdoc>\n");
}

TEST(PdocTest, ReadsBothForms) {
  const uint64_t kBig = uint64_t{1} << 63;
  const struct {
    std::string input;
    Value expected;
  } rows[] = {
      {"\n  " + InPdoc("<integer>+42</integer>"), Value(42)},
      {"\xEF\xBB\xBF{\"bom\": 1}", Value{{"bom", 1}}},  // editors' byte-order mark
      {InPdoc("<integer>-9223372036854775808</integer>"), Value(INT64_MIN)},
      {InPdoc("<integer>9223372036854775808</integer>"), Value(kBig)},
      {InPdoc("<real>-inf</real>"), Value(-std::numeric_limits<double>::infinity())},
      {InPdoc("<real>3</real>"), Value(3.0)},
      {InPdoc("<date>1970-01-01T00:00:01.5Z</date>"), Value(Date{1.5})},
      {InPdoc("<data>\n  AAEC\n  /w==\n</data>"), Value(Data{0, 1, 2, 0xFF})},
      {InPdoc("<string> a &amp; &#x41;<![CDATA[<b>]]> </string>"), Value(" a & A<b> ")},
      {"<!DOCTYPE pdoc><!-- note --><pdoc version=\"1.0\"><dict>\n <key>k</key>\n <string/>\n"
       "<key>é</key><array><true/><false/><dict/></array></dict></pdoc>",
       Value{{"k", ""}, {"é", Value(Array{true, false, Value::EmptyDictionary()})}}},
      {" {\"n\": -1, \"u\": 9223372036854775808, \"r\": 2.0, \"e\": 1E3, \"s\": \"\\u00e9\\n\"}",
       Value{{"n", -1}, {"u", kBig}, {"r", 2.0}, {"e", 1000.0}, {"s", "é\n"}}},
      {"[[], {}, true, [\"x\", {\"k\": [false]}]]",
       Value(Array{Value::EmptyArray(), Value::EmptyDictionary(), true,
                   Value(Array{"x", Value{{"k", Value(Array{false})}}})})},
  };
  for (const auto& row : rows) {
    Result<Value> value = Parse(row.input);
    ASSERT_TRUE(value) << row.input << ": " << value.error().description();
    EXPECT_TRUE(Identical(row.expected, *value))
        << row.input << " read as " << value->description();
  }
  // kMaxDepth levels are allowed in both forms.
  EXPECT_TRUE(Parse(Nested("[", "]", kMaxDepth)));
  EXPECT_TRUE(Parse(InPdoc(Nested("<array>", "</array>", kMaxDepth))));
}

TEST(PdocTest, RefusesMalformedAndHostileInput) {
  const std::string kLaughs =
      "<?xml version=\"1.0\"?><!DOCTYPE pdoc [<!ENTITY a \"aaaaaaaaaa\">"
      "<!ENTITY b \"&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;\"><!ENTITY c \"&b;&b;&b;&b;&b;&b;&b;&b;\">]>"
      "<pdoc><string>&c;</string></pdoc>";
  const struct {
    std::string input;
    std::string fragment;  // of the message; "" to check only domain and code
  } rows[] = {
      {"", "empty"},
      {" \n\t", "empty"},
      {"plain text", "neither XML nor JSON"},
      {std::string("\x00\xff<pdoc>", 8), "neither"},
      {"<pdoc><dict><key>a</key>", ""},
      {"<pdoc><integer>1</integer></pdoc><x/>", ""},
      {"<\xff\xfe\x01garbage", ""},
      {kLaughs, "entity declarations are not allowed"},
      {"<!DOCTYPE pdoc [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><pdoc><string>&x;</string>"
       "</pdoc>",
       "entity"},
      {"<!DOCTYPE pdoc SYSTEM \"http://localhost/x.dtd\"><pdoc><string>&x;</string></pdoc>",
       "undeclared entity"},
      {InPdoc(Nested("<array>", "</array>", 100000)), "nesting deeper than 256"},
      {InPdoc(Nested("<array>", "</array>", kMaxDepth + 1)), "nesting deeper"},
      {"<document><string/></document>", "not <pdoc>"},
      {"<pdoc version=\"2.0\"><string/></pdoc>", "version"},
      {"<pdoc></pdoc>", "holds no value"},
      {InPdoc("<true/><false/>"), "more than one value"},
      {InPdoc("<widget/>"), "unknown element <widget>"},
      {InPdoc("junk<true/>"), "unexpected text \"junk\""},
      {InPdoc("<true>yes</true>"), "must be empty"},
      {InPdoc("<string><true/></string>"), "cannot hold elements"},
      {InPdoc("<dict><key>a</key><true/><key>a</key><false/></dict>"), "duplicate key \"a\""},
      {InPdoc("<dict><key>a</key></dict>"), "key \"a\" has no value"},
      {InPdoc("<dict><true/></dict>"), "where a <key> belongs"},
      {InPdoc("<array><key>a</key></array>"), "<key> outside"},
      {"<pdoc>\n<array>\n<integer>12x</integer>\n</array>\n</pdoc>",
       "line 3: <integer> value \"12x\" is not an integer"},
      {InPdoc("<integer></integer>"), "not an integer"},
      {InPdoc("<integer>18446744073709551616</integer>"), "not an integer"},
      {InPdoc("<integer>-9223372036854775809</integer>"), "not an integer"},
      {InPdoc("<integer>1.5</integer>"), "not an integer"},
      {InPdoc("<real>1.5.2</real>"), "not a real"},
      {InPdoc("<date>2026-02-30T00:00:00Z</date>"), "not a date"},
      {InPdoc("<date>2026-01-31 12:00:00</date>"), "not a date"},
      {InPdoc("<data>AAE!</data>"), "not base64"},
      {Nested("[", "]", 100000), "nesting deeper than 256"},
      {Nested("{\"a\":", "}", 100000), "nesting deeper"},
      {Nested("[", "]", kMaxDepth + 1), "nesting deeper"},
      {"{\"a\": 1, \"a\": 2}", "duplicate key \"a\""},
      {"{\"c\": 1, \"a\": 2, \"c\": 3}", "duplicate key \"c\""},
      {"{\"a\": null}", "null is not allowed"},
      {"[1] x", ""},
      {"{\"a\": 1", ""},
      {"[\"a\\u0000b\"]", "NUL"},
      {"{\"a\\u0000\": 1}", "NUL"},
      {"[99999999999999999999]", "integer out of range"},
      {"[-9223372036854775809]", "integer out of range"},
      {"[1e400]", ""},
      {"[\"\xff\"]", ""}};
  for (const auto& row : rows) {
    Result<Value> value = Parse(row.input);
    ASSERT_FALSE(value) << row.input.substr(0, 200) << " read as " << value->description();
    EXPECT_EQ(value.error().domain(), kPdocErrorDomain);
    EXPECT_EQ(value.error().code(), kMalformed);
    EXPECT_NE(value.error().localizedDescription().find(row.fragment), std::string::npos)
        << row.input.substr(0, 200) << ": " << value.error().description();
  }
}

TEST(PdocTest, RefusesToWriteWhatPdocCannotHold) {
  const struct {
    Value value;
    std::string fragment;
  } rows[] = {
      {Value(), "absent"},
      {Value(Array{1, Value()}), "at /1: an absent value"},
      {Value{{"id", Uuid::random()}}, "at /id: a UUID"},
      {Value(std::string("caf\xc3")), "not valid UTF-8"},
      {Value(std::string("\xc0\xaf")), "not valid UTF-8"},      // overlong '/'
      {Value(std::string("\xed\xa0\x80")), "not valid UTF-8"},  // a surrogate
      {Value{{std::string("k\xff"), 1}}, "a key is not valid UTF-8"},
      {Value(std::string("bell\x07")), "U+0007"},
      {Value(std::string("nul\0", 4)), "U+0000"},
      {Value(Array{Value("\xef\xbf\xbf")}), "U+FFFF"},
      {Value(Date{std::nan("")}), "date"},
  };
  for (const auto& row : rows) {
    Result<std::string> xml = WriteXml(row.value);
    ASSERT_FALSE(xml) << *xml;
    EXPECT_EQ(xml.error().domain(), kPdocErrorDomain);
    EXPECT_EQ(xml.error().code(), kUnwritable);
    EXPECT_NE(xml.error().localizedDescription().find(row.fragment), std::string::npos)
        << xml.error().description();
  }
}

// Entries written one at a time, joined in key order, must give exactly the
// bytes of the dictionary written whole, at any depth; a stand-in entry's
// text marks where the entries go.
TEST(PdocTest, EntriesWrittenAloneJoinToTheWholeDictionary) {
  const Value nested{
      {"list", Value(Array{1, "two", Value::EmptyArray(), Value::EmptyDictionary()})},
      {"inner", Value{{"deep", Value{{"x", -1.5}}}}}};
  const Dictionary rows[] = {
      {{"only", 1}},
      {{"b", 2}, {"a", 1}, {"B", 3}, {"", "empty key"}, {"\xc3\xa9t\xc3\xa9", "accented key"}},
      {{"a&b<c>d", "x & y"}, {"cr\rkey", "line\r\n"}, {"quote\"'", "<tag>"}},
      {{"settings", nested},
       {"when", Value(Date{1769860800.125})},
       {"bytes", Value(Data{0, 1, 255})},
       {"big", Value(std::numeric_limits<uint64_t>::max())},
       {"flag", false},
       {"empty", Value::EmptyDictionary()}},
  };
  const Value standIn(true);
  for (const Dictionary& dict : rows) {
    for (int depth = 1; depth <= 3; ++depth) {
      SCOPED_TRACE(Value(dict).description() + " at depth " + std::to_string(depth));
      // The dictionary, or the stand-in, wrapped to lie `depth` levels down.
      auto wrap = [depth](Value inner) {
        for (int d = 1; d < depth; ++d) inner = Value{{"w", inner}};
        return inner;
      };
      std::string whole = *WriteXml(wrap(Value(dict)));
      std::string joined;
      for (const auto& [key, value] : dict) {
        Result<std::string> entry = WriteXmlEntry(key, value, depth);
        ASSERT_TRUE(entry) << entry.error().description();
        joined += *entry;
      }
      std::string frame = *WriteXml(wrap(Value(Dictionary{{"", standIn}})));
      std::string mark = *WriteXmlEntry("", standIn, depth);
      size_t at = frame.find(mark);
      ASSERT_NE(at, std::string::npos);
      EXPECT_EQ(frame.replace(at, mark.size(), joined), whole);
    }
  }
  // What WriteXml refuses, an entry refuses too.
  Result<std::string> uuid = WriteXmlEntry("id", Value{{"u", Uuid::random()}}, 2);
  ASSERT_FALSE(uuid);
  EXPECT_NE(uuid.error().localizedDescription().find("at /id/u: a UUID"), std::string::npos)
      << uuid.error().description();
  EXPECT_FALSE(WriteXmlEntry("k\xff", 1, 2));
  EXPECT_FALSE(WriteXmlEntry("k", Value(), 2));
}

}  // namespace
}  // namespace dr::pdoc
