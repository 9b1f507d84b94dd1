#include "wire/drm1.h"

#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <string>
#include <vector>

namespace dr::drm1 {
namespace {

// Little-endian helpers for writing frames by hand.
std::string U32(uint32_t v) { return std::string(reinterpret_cast<const char*>(&v), 4); }
std::string U64(uint64_t v) { return std::string(reinterpret_cast<const char*>(&v), 8); }
std::string Str(std::string_view s) {
  return U32(static_cast<uint32_t>(s.size())) + std::string(s);
}
std::string Tag(uint8_t t) { return std::string(1, static_cast<char>(t)); }

std::string HeaderBytes(uint32_t length, uint64_t serial, uint64_t replyTo, uint32_t flags,
                        uint32_t reserved = 0) {
  return "DRM1" + U32(length) + U64(serial) + U64(replyTo) + U32(flags) + U32(reserved);
}

std::string Frame(const std::string& body, uint64_t serial = 1, uint64_t replyTo = 0,
                  uint32_t flags = kFlagWantsReply) {
  return HeaderBytes(static_cast<uint32_t>(body.size()), serial, replyTo, flags) + body;
}

// A dictionary body with one entry "k" holding `value` (already encoded).
std::string OneEntry(const std::string& value) {
  return Tag(kTagDictionary) + U32(1) + Str("k") + value;
}

Result<Value> DecodeWhole(const std::string& bytes) {
  FrameDecoder decoder;
  decoder.feed(bytes);
  Result<std::optional<drm1::Frame>> frame = decoder.next();
  if (!frame) return frame.error();
  if (!frame->has_value()) return Error("test", 0, "incomplete");
  return (*frame)->body;
}

TEST(Drm1Test, EncodesFramesToTheByte) {
  const Uuid u = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  const Value body = Value{{"a", Value(Array{true, false, Value(-2), Value(uint64_t{3})})},
                           {"b", Value(Data{0xAB})},
                           {"c", Value(u)},
                           {"d", Value(Date{1.5})},
                           {"e", "é"}};
  std::string expected = Tag(kTagDictionary) + U32(5) +  //
                         Str("a") + Tag(kTagArray) + U32(4) + Tag(kTagTrue) + Tag(kTagFalse) +
                         Tag(kTagInt) + U64(static_cast<uint64_t>(-2)) + Tag(kTagUInt) + U64(3) +
                         Str("b") + Tag(kTagData) + U32(1) + "\xAB" +  //
                         Str("c") + Tag(kTagUuid) +
                         std::string(reinterpret_cast<const char*>(u.bytes.data()), 16) + Str("d") +
                         Tag(kTagDate);
  double when = 1.5;
  expected += std::string(reinterpret_cast<const char*>(&when), 8);
  expected += Str("e") + Tag(kTagString) + Str("é");

  Result<std::string> frame = EncodeFrame(7, 3, kFlagIsReply, body);
  ASSERT_TRUE(frame) << frame.error().description();
  EXPECT_EQ(*frame,
            HeaderBytes(static_cast<uint32_t>(expected.size()), 7, 3, kFlagIsReply) + expected);

  // Every kind of value comes back as it went, of the same kind.
  const Value more = body.changing("min", std::numeric_limits<int64_t>::min())
                         .changing("umax", std::numeric_limits<uint64_t>::max())
                         .changing("real", -0.25)
                         .changing("empty", "")
                         .changing("list", Array{Value::EmptyArray(), Value::EmptyDictionary()})
                         .changing("blob", Data{});
  Result<Value> back = DecodeWhole(*EncodeFrame(1, 0, 0, more));
  ASSERT_TRUE(back) << back.error().description();
  EXPECT_EQ(*back, more);
  EXPECT_EQ((*back)["umax"].type(), Value::Type::kUInt);
  EXPECT_EQ((*back)["min"].type(), Value::Type::kInt);
  EXPECT_EQ(DecodeWhole(*frame).value_or(Value()), body);
  // Null decodes to absent and so leaves no entry behind.
  EXPECT_EQ(DecodeWhole(Frame(OneEntry(Tag(kTagNull)))).value_or(Value()),
            Value::EmptyDictionary());
}

// `levels` - 1 arrays around a boolean: with the top dictionary, `levels`
// levels of containers.
std::string Nested(int levels) {
  std::string body;
  for (int i = 1; i < levels; ++i) body += Tag(kTagArray) + U32(1);
  return body + Tag(kTagTrue);
}

TEST(Drm1Test, RefusesFramesThatBreakTheRules) {
  const struct {
    std::string bytes;
    const char* fragment;
  } rows[] = {
      {"DRM2" + HeaderBytes(1, 1, 0, 1).substr(4) + Tag(kTagDictionary), "magic"},
      {HeaderBytes(kMaxBodySize + 1, 1, 0, 1), "above 16 MiB"},
      {HeaderBytes(5, 0, 0, 1) + Tag(kTagDictionary) + U32(0), "serial 0"},
      {HeaderBytes(5, 1, 0, 1 | 8) + Tag(kTagDictionary) + U32(0), "flags"},
      {HeaderBytes(5, 1, 0, kFlagIsReply) + Tag(kTagDictionary) + U32(0), "reply-to"},
      {HeaderBytes(5, 1, 9, kFlagWantsReply) + Tag(kTagDictionary) + U32(0), "reply-to"},
      {HeaderBytes(5, 1, 0, 1, 1) + Tag(kTagDictionary) + U32(0), "reserved"},
      {Frame(""), "empty body"},
      {Frame(Tag(kTagArray) + U32(0)), "not a dictionary"},
      {Frame(Tag(kTagDictionary) + U32(0) + "x"), "trailing"},
      {Frame(OneEntry(Tag(0x0C))), "unknown tag 12"},
      {Frame(OneEntry(Tag(kTagInt) + "1234")), "truncated number"},
      {Frame(OneEntry(Tag(kTagString) + U32(100) + "ab")), "exceeds the body"},
      {Frame(OneEntry(Tag(kTagData) + U32(0xFFFFFFFF))), "exceeds the body"},
      {Frame(OneEntry(Tag(kTagArray) + U32(0xFFFFFFFF))), "exceeds the body"},
      {Frame(Tag(kTagDictionary) + U32(0x10000000)), "exceeds the body"},
      {Frame(OneEntry(Tag(kTagUuid) + "short")), "truncated UUID"},
      {Frame(OneEntry(Tag(kTagString) + Str("\xC3\x28"))), "not UTF-8"},
      {Frame(OneEntry(Tag(kTagString) + Str("\xED\xA0\x80"))), "not UTF-8"},  // a surrogate
      {Frame(OneEntry(Tag(kTagString) + Str(std::string("a\0b", 3)))), "NUL"},
      {Frame(Tag(kTagDictionary) + U32(1) + Str(std::string("\0", 1)) + Tag(kTagTrue)),
       "key holds NUL"},
      {Frame(Tag(kTagDictionary) + U32(2) + Str("k") + Tag(kTagTrue) + Str("k") + Tag(kTagFalse)),
       "duplicate key"},
      // Keys out of order are allowed, but not twice.
      {Frame(Tag(kTagDictionary) + U32(3) + Str("k") + Tag(kTagTrue) + Str("b") + Tag(kTagTrue) +
             Str("k") + Tag(kTagFalse)),
       "duplicate key"},
      {Frame(OneEntry(Nested(kMaxDepth + 1))), "deeper than 64"},
      // The top dictionary and the array count too, so these nulls are two
      // values too many, refused at the array's count.
      {Frame(OneEntry(Tag(kTagArray) + U32(kMaxValues) + std::string(kMaxValues, '\0'))),
       "more than 1048576 values"},
      {Frame(OneEntry(Tag(kTagArray) + U32(2) + Tag(kTagArray) + U32(kMaxValues / 2) +
                      std::string(kMaxValues / 2, '\0') + Tag(kTagArray) + U32(kMaxValues / 2) +
                      std::string(kMaxValues / 2, '\0'))),
       "more than 1048576 values"},
  };
  for (const auto& row : rows) {
    Result<Value> v = DecodeWhole(row.bytes);
    ASSERT_FALSE(v) << row.fragment;
    EXPECT_EQ(v.error().domain(), kDrm1ErrorDomain) << row.fragment;
    EXPECT_EQ(v.error().code(), kProtocolError) << row.fragment;
    EXPECT_NE(v.error().localizedDescription().find(row.fragment), std::string::npos)
        << v.error().localizedDescription();
  }
  // 64 levels of containers is the limit, the top dictionary being level 1.
  EXPECT_TRUE(DecodeWhole(Frame(OneEntry(Nested(kMaxDepth)))));
  EXPECT_TRUE(
      DecodeWhole(Frame(OneEntry(Tag(kTagArray) + U32(kMaxValues - 2) +
                                 std::string(kMaxValues - 2, static_cast<char>(kTagTrue))))));
  // Frames from the daemon may be larger and hold any number of values.
  EXPECT_TRUE(DecodeHeader(HeaderBytes(kMaxReplyBodySize, 1, 1, kFlagIsReply), kFromDaemon));
  EXPECT_FALSE(DecodeHeader(HeaderBytes(kMaxReplyBodySize + 1, 1, 1, kFlagIsReply), kFromDaemon));
  FrameDecoder fromDaemon(kFromDaemon);
  fromDaemon.feed(
      Frame(OneEntry(Tag(kTagArray) + U32(kMaxValues) + std::string(kMaxValues, '\0'))));
  EXPECT_TRUE(fromDaemon.next());
}

TEST(Drm1Test, DecoderSplitsAStreamFedInPiecesAndStaysBrokenAfterAnError) {
  std::string stream;
  for (uint64_t serial : {1, 2, 5}) {  // increasing, gaps allowed
    stream += *EncodeFrame(serial, 0, kFlagWantsReply, Value{{"n", serial}});
  }
  FrameDecoder decoder;
  std::vector<uint64_t> serials;
  for (char c : stream) {
    decoder.feed(std::string_view(&c, 1));
    Result<std::optional<drm1::Frame>> f = decoder.next();
    ASSERT_TRUE(f);
    if (f->has_value()) {
      EXPECT_EQ((**f).body["n"].uintValue(), (**f).header.serial);
      serials.push_back((**f).header.serial);
    }
  }
  EXPECT_EQ(serials, (std::vector<uint64_t>{1, 2, 5}));
  EXPECT_EQ(decoder.buffered(), 0u);

  // A serial again is refused at its header, before its body is in.
  decoder.feed(EncodeFrame(5, 0, 0, Value::EmptyDictionary())->substr(0, kHeaderSize));
  Result<std::optional<drm1::Frame>> again = decoder.next();
  ASSERT_FALSE(again);
  EXPECT_NE(again.error().localizedDescription().find("serial 5 not above"), std::string::npos);
  decoder.feed(*EncodeFrame(6, 0, 0, Value::EmptyDictionary()));
  EXPECT_FALSE(decoder.next());
}

TEST(Drm1Test, RefusesToEncodeWhatPeersWouldRefuse) {
  Value deep = Value(true);
  for (int i = 0; i < kMaxDepth; ++i) deep = Value(Array{deep});
  for (const Value& body :
       {Value("not a dictionary"), Value{{std::string("\xC0\x80"), 1}}, Value{{"k", deep}}}) {
    Result<std::string> f = EncodeFrame(1, 0, 0, body);
    ASSERT_FALSE(f) << body.description();
    EXPECT_EQ(f.error().code(), kUnencodable);
  }
}

// Text is read eight bytes at a time, so a NUL or a byte that is not UTF-8
// is placed at each position of a word, across words and in the tail, in a
// value and in a key. A string holding both is refused for its NUL.
TEST(Drm1Test, RefusesTextWhereverTheBadByteFalls) {
  const std::string ascii = "abcdefghijklmnopqrstuvw";  // 23 bytes: two words and a tail
  struct Row {
    std::string text;
    const char* refusal;  // nullptr: encoded
  };
  std::vector<Row> rows = {{ascii, nullptr},
                           {"", nullptr},
                           {ascii + "\xC3\xA9" + ascii, nullptr},
                           {"\x7F" + ascii, nullptr},
                           {ascii + "\xFF" + std::string(1, '\0'), "holds NUL"}};
  for (size_t at : {0, 1, 7, 8, 9, 15, 16, 22}) {
    std::string withNul = ascii, notUtf8 = ascii;
    withNul[at] = '\0';
    notUtf8[at] = '\x80';
    rows.push_back({withNul, "holds NUL"});
    rows.push_back({notUtf8, "is not UTF-8"});
  }
  for (const Row& row : rows) {
    for (const Value& body : {Value{{"k", row.text}}, Value{{row.text, 1}}}) {
      Result<std::string> f = EncodeFrame(1, 0, 0, body);
      if (!row.refusal) {
        ASSERT_TRUE(f) << f.error().description();
        EXPECT_EQ(DecodeWhole(*f).value_or(Value()), body);
        continue;
      }
      ASSERT_FALSE(f) << body.description();
      EXPECT_EQ(f.error().code(), kUnencodable);
      EXPECT_NE(f.error().description().find(row.refusal), std::string::npos)
          << f.error().description();
    }
  }
}

// A body of up to 16 MiB is encoded whole, one byte more is refused: at the
// limit less the header, at the limit, and past it; a reply may pass it.
TEST(Drm1Test, EncodesBodiesUpTo16MiB) {
  // {"k": "<padding>"}: 5 + 4 + 1 + 1 + 4 bytes around the padding.
  constexpr size_t kAround = 15;
  struct Row {
    size_t bodySize;
    bool encoded;
    uint32_t flags = 0;
  } rows[] = {{kMaxBodySize - kHeaderSize, true},
              {kMaxBodySize, true},
              {kMaxBodySize + 1, false},
              {kMaxBodySize + 1, true, kFlagIsReply}};  // replies may be larger
  for (const Row& row : rows) {
    const Value body{{"k", std::string(row.bodySize - kAround, 'x')}};
    Result<std::string> f = EncodeFrame(1, row.flags ? 1 : 0, row.flags, body);
    ASSERT_EQ(f.ok(), row.encoded) << row.bodySize;
    if (row.encoded) {
      EXPECT_EQ(f->size(), kHeaderSize + row.bodySize);
      FrameDecoder decoder(kFromDaemon);
      decoder.feed(*f);
      Result<std::optional<drm1::Frame>> decoded = decoder.next();
      ASSERT_TRUE(decoded && decoded->has_value());
      EXPECT_EQ((*decoded)->body, body);
    } else {
      EXPECT_EQ(f.error().code(), kUnencodable);
    }
  }
}

}  // namespace
}  // namespace dr::drm1
