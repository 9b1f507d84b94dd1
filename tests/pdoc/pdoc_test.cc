#include "pdoc/pdoc.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>

namespace dr::pdoc {
namespace {

// Equal and of the same kinds (the XML tells 2 from 2.0; NaN's description equals).
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
      Value(Array{int64_t{-3}, std::numeric_limits<int64_t>::min(),
                  std::numeric_limits<uint64_t>::max(), -0.1, 2.0, 1e300,
                  std::numeric_limits<double>::infinity(), std::nan(""), true}),
      Value(Array{Date{1769860800}, Date{1769860800.125}, Date{-1.5}, Data{}, Data{0, 1, 0xFF}}),
      Value(Array{"  padded\n\tline & <tag> \"q\" ]]> \r\n ", "", Value::EmptyArray()}),
      Value(2.0),
      Value("top"),
      Value::EmptyDictionary(),
      Value{{"clé", "ünïcødé ✓ 𝄞"},
            {"", "empty key"},
            {"a", Value(Array{Value::EmptyDictionary(), Value(Array{1, "x", false})})},
            {"b", Value{{"c", Value{{"d", 1.5}}}}}}};
  for (const Value& value : rows) {
    const std::string xml = WriteXml(value).value_or("(refused)");
    Result<Value> back = Parse(xml);
    ASSERT_TRUE(back.ok()) << value.description() << ": " << xml;
    EXPECT_TRUE(Identical(value, *back)) << xml << "read back as " << back->description();
  }
}

TEST(PdocTest, ReadsBothForms) {
  const uint64_t kBig = uint64_t{1} << 63;
  const struct {
    std::string input;
    Value expected;
  } rows[] = {
      {"\n  " + InPdoc("<integer>+42</integer>"), Value(42)},
      {"\xEF\xBB\xBF{\"bom\": 1}", Value{{"bom", 1}}},  // editors' byte-order mark
      {InPdoc("<array><integer>-9223372036854775808</integer><integer>9223372036854775808"
              "</integer><real>-inf</real><real>3</real><date>1970-01-01T00:00:01.5Z</date>"
              "<data>\n  AAEC\n  /w==\n</data><string> a &amp; &#x41;<![CDATA[<b>]]> </string>"
              "</array>"),
       Value(Array{INT64_MIN, kBig, -std::numeric_limits<double>::infinity(), 3.0, Date{1.5},
                   Data{0, 1, 2, 0xFF}, " a & A<b> "})},
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
    EXPECT_TRUE(value.ok() && Identical(row.expected, *value)) << row.input;
  }
  // kMaxDepth levels are allowed in both forms.
  EXPECT_TRUE(Parse(Nested("[", "]", kMaxDepth)).ok());
  EXPECT_TRUE(Parse(InPdoc(Nested("<array>", "</array>", kMaxDepth))).ok());
}

TEST(PdocTest, RefusesMalformedAndHostileInput) {
  // A fragment of the message ("": only domain and code are checked), and the inputs.
  const std::pair<std::string, std::vector<std::string>> rows[] = {
      {"",
       {"<pdoc><dict><key>a</key>", "<pdoc><integer>1</integer></pdoc><x/>", "<\xff\xfe\x01garbage",
        "[1] x", "{\"a\": 1", "[1e400]", "[\"\xff\"]"}},
      {"empty", {"", " \n\t"}},
      {"neither XML nor JSON", {"plain text", std::string("\x00\xff<pdoc>", 8)}},
      {"entity declarations are not allowed",
       {"<?xml version=\"1.0\"?><!DOCTYPE pdoc [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b \"&a;&a;&a;"
        "&a;&a;&a;&a;&a;&a;&a;\"><!ENTITY c "
        "\"&b;&b;&b;&b;&b;&b;&b;&b;\">]><pdoc><string>&c;</string>"
        "</pdoc>",
        "<!DOCTYPE pdoc [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><pdoc><string>&x;"
        "</string></pdoc>"}},
      {"undeclared entity",
       {"<!DOCTYPE pdoc SYSTEM \"http://localhost/x.dtd\"><pdoc><string>&x;</string></pdoc>"}},
      {"nesting deeper than 256",
       {InPdoc(Nested("<array>", "</array>", 100000)), InPdoc(Nested("<array>", "</array>", 257)),
        Nested("[", "]", 100000), Nested("{\"a\":", "}", 100000), Nested("[", "]", 257)}},
      {"not <pdoc>", {"<document><string/></document>"}},
      {"version", {"<pdoc version=\"2.0\"><string/></pdoc>"}},
      {"holds no value", {"<pdoc></pdoc>"}},
      {"more than one value", {InPdoc("<true/><false/>")}},
      {"unknown element <widget>", {InPdoc("<widget/>")}},
      {"unexpected text \"junk\"", {InPdoc("junk<true/>")}},
      {"must be empty", {InPdoc("<true>yes</true>")}},
      {"cannot hold elements", {InPdoc("<string><true/></string>")}},
      {"duplicate key \"a\"",
       {InPdoc("<dict><key>a</key><true/><key>a</key><false/></dict>"), "{\"a\": 1, \"a\": 2}"}},
      {"duplicate key \"c\"", {"{\"c\": 1, \"a\": 2, \"c\": 3}"}},
      {"key \"a\" has no value", {InPdoc("<dict><key>a</key></dict>")}},
      {"where a <key> belongs", {InPdoc("<dict><true/></dict>")}},
      {"<key> outside", {InPdoc("<array><key>a</key></array>")}},
      {"line 3: <integer> value \"12x\" is not an integer",
       {"<pdoc>\n<array>\n<integer>12x</integer>\n</array>\n</pdoc>"}},
      {"not an integer",
       {InPdoc("<integer></integer>"), InPdoc("<integer>18446744073709551616</integer>"),
        InPdoc("<integer>-9223372036854775809</integer>"), InPdoc("<integer>1.5</integer>")}},
      {"not a real", {InPdoc("<real>1.5.2</real>")}},
      {"not a date",
       {InPdoc("<date>2026-02-30T00:00:00Z</date>"), InPdoc("<date>2026-01-31 12:00:00</date>")}},
      {"not base64", {InPdoc("<data>AAE!</data>")}},
      {"null is not allowed", {"{\"a\": null}"}},
      {"NUL", {"[\"a\\u0000b\"]", "{\"a\\u0000\": 1}"}},
      {"integer out of range", {"[99999999999999999999]", "[-9223372036854775809]"}}};
  for (const auto& [fragment, inputs] : rows) {
    for (const std::string& input : inputs) {
      Result<Value> value = Parse(input);
      ASSERT_FALSE(value.ok()) << input.substr(0, 200) << " read as " << value->description();
      EXPECT_TRUE(value.error().domain() == kPdocErrorDomain && value.error().code() == kMalformed);
      EXPECT_NE(value.error().localizedDescription().find(fragment), std::string::npos)
          << input.substr(0, 200) << ": " << value.error().description();
    }
  }
}

TEST(PdocTest, RefusesToWriteWhatPdocCannotHold) {
  const std::pair<Value, std::string> rows[] = {
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
  for (const auto& [value, fragment] : rows) {
    Result<std::string> xml = WriteXml(value);
    ASSERT_FALSE(xml.ok()) << *xml;
    EXPECT_TRUE(xml.error().domain() == kPdocErrorDomain && xml.error().code() == kUnwritable);
    EXPECT_NE(xml.error().localizedDescription().find(fragment), std::string::npos)
        << xml.error().description();
  }
}

// Keys in ascending order, indented; entries written one at a time, joined
// in key order, must give exactly the bytes of the dictionary written whole,
// at any depth; a stand-in entry's text marks where the entries go.
TEST(PdocTest, WritesIndentedXmlAndEntriesAlone) {
  Value value{{"zeta", 1}, {"alpha", Value(Array{"a", Value::EmptyDictionary()})}, {"mid", 2.0}};
  EXPECT_EQ(*WriteXml(value),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<pdoc version=\"1.0\">\n  <dict>\n    "
            "<key>alpha</key><array>\n      <string>a</string>\n      <dict/>\n    </array>\n    "
            "<key>mid</key><real>2.0</real>\n    <key>zeta</key><integer>1</integer>\n  </dict>"
            "\n</pdoc>\n");
  const Dictionary rows[] = {
      {{"only", 1}},
      {{"b", 2}, {"a", 1}, {"B", 3}, {"", "empty key"}, {"\xc3\xa9t\xc3\xa9", "accented key"}},
      {{"a&b<c>d", "x & y"}, {"cr\rkey", "line\r\n"}, {"quote\"'", "<tag>"}},
      {{"list", Value(Array{1, "two", Value::EmptyArray(), Value{{"deep", Value{{"x", -1.5}}}}})},
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
      for (const auto& [key, value] : dict)
        joined += WriteXmlEntry(key, value, depth).value_or("?");
      std::string frame = *WriteXml(wrap(Value(Dictionary{{"", standIn}})));
      std::string mark = *WriteXmlEntry("", standIn, depth);
      size_t at = frame.find(mark);
      ASSERT_NE(at, std::string::npos);
      EXPECT_EQ(frame.replace(at, mark.size(), joined), whole);
    }
  }
  // What WriteXml refuses, an entry refuses too.
  Result<std::string> uuid = WriteXmlEntry("id", Value{{"u", Uuid::random()}}, 2);
  EXPECT_NE(uuid.error().localizedDescription().find("at /id/u: a UUID"), std::string::npos);
  EXPECT_FALSE(WriteXmlEntry("k\xff", 1, 2).ok());
  EXPECT_FALSE(WriteXmlEntry("k", Value(), 2).ok());
}

}  // namespace
}  // namespace dr::pdoc
