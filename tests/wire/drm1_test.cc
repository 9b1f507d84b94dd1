#include "wire/drm1.h"

#include <gtest/gtest.h>

#include <limits>
#include <string>
#include <vector>

namespace dr::drm1 {
namespace {

// Little-endian helpers for writing frames by hand.
template <typename T>
std::string Raw(T v) {
  return std::string(reinterpret_cast<const char*>(&v), sizeof v);
}
std::string U32(uint32_t v) { return Raw(v); }
std::string U64(uint64_t v) { return Raw(v); }
std::string Str(std::string_view s) { return U32(s.size()) + std::string(s); }
std::string Tag(uint8_t t) { return std::string(1, static_cast<char>(t)); }
std::string Dict(uint32_t n) { return Tag(kTagDictionary) + U32(n); }
std::string Arr(uint32_t n, char c = 0) { return Tag(kTagArray) + U32(n) + std::string(n, c); }
const std::string kEmpty = Dict(0), kTrue = Tag(kTagTrue), kFalse = Tag(kTagFalse);

std::string HeaderBytes(uint32_t length, uint64_t serial, uint64_t replyTo, uint32_t flags,
                        uint32_t reserved = 0) {
  return "DRM1" + U32(length) + U64(serial) + U64(replyTo) + U32(flags) + U32(reserved);
}

std::string Frame(const std::string& body) {
  return HeaderBytes(static_cast<uint32_t>(body.size()), 1, 0, kFlagWantsReply) + body;
}

// A dictionary body with one entry "k" holding `value` (already encoded).
std::string OneEntry(const std::string& value) { return Dict(1) + Str("k") + value; }

Result<Value> DecodeWhole(const std::string& bytes, const Limits& limits = kToDaemon) {
  FrameDecoder decoder(limits);
  decoder.feed(bytes);
  Result<std::optional<drm1::Frame>> frame = decoder.next();
  if (!frame.ok() || !*frame) return frame.ok() ? Error("test", 0, "incomplete") : frame.error();
  return (*frame)->body;
}

TEST(Drm1Test, EncodesFramesToTheByte) {
  const Uuid u = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  const Value body = Value{{"a", Value(Array{true, false, Value(-2), Value(uint64_t{3})})},
                           {"b", Value(Data{0xAB})},
                           {"c", Value(u)},
                           {"d", Value(Date{1.5})},
                           {"e", "é"}};
  std::string expected = Dict(5) + Str("a") + Tag(kTagArray) + U32(4) + kTrue + kFalse +
                         Tag(kTagInt) + U64(static_cast<uint64_t>(-2)) + Tag(kTagUInt) + U64(3) +
                         Str("b") + Tag(kTagData) + U32(1) + "\xAB" + Str("c") + Tag(kTagUuid) +
                         Raw(u.bytes) + Str("d") + Tag(kTagDate) + Raw(1.5) + Str("e") +
                         Tag(kTagString) + Str("é");

  Result<std::string> frame = EncodeFrame(7, 3, kFlagIsReply, body);
  ASSERT_TRUE(frame.ok()) << frame.error().description();
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
  ASSERT_EQ(back.value_or(Value()), more);
  EXPECT_TRUE((*back)["umax"].type() == Value::Type::kUInt &&
              (*back)["min"].type() == Value::Type::kInt);
  // Null decodes to absent and so leaves no entry behind.
  EXPECT_EQ(DecodeWhole(Frame(OneEntry(Tag(kTagNull)))).value_or(Value()),
            Value::EmptyDictionary());
}

// `levels` levels of containers: the top dictionary and arrays around a boolean.
std::string Nested(int levels) {
  std::string body;
  for (int i = 1; i < levels; ++i) body += Tag(kTagArray) + U32(1);
  return body + kTrue;
}

TEST(Drm1Test, RefusesFramesThatBreakTheRules) {
  const struct {
    std::string bytes;
    const char* fragment;
  } rows[] = {
      {"DRM2" + HeaderBytes(1, 1, 0, 1).substr(4) + Tag(kTagDictionary), "magic"},
      {HeaderBytes(kMaxBodySize + 1, 1, 0, 1), "above 16 MiB"},
      {HeaderBytes(5, 0, 0, 1) + kEmpty, "serial 0"},
      {HeaderBytes(5, 1, 0, 1 | 8) + kEmpty, "flags"},
      {HeaderBytes(5, 1, 0, kFlagIsReply) + kEmpty, "reply-to"},
      {HeaderBytes(5, 1, 9, kFlagWantsReply) + kEmpty, "reply-to"},
      {HeaderBytes(5, 1, 0, 1, 1) + kEmpty, "reserved"},
      {Frame(""), "empty body"},
      {Frame(Tag(kTagArray) + U32(0)), "not a dictionary"},
      {Frame(kEmpty + "x"), "trailing"},
      {Frame(OneEntry(Tag(0x0C))), "unknown tag 12"},
      {Frame(OneEntry(Tag(kTagInt) + "1234")), "truncated number"},
      {Frame(OneEntry(Tag(kTagString) + U32(100) + "ab")), "exceeds the body"},
      {Frame(OneEntry(Tag(kTagData) + U32(0xFFFFFFFF))), "exceeds the body"},
      {Frame(OneEntry(Tag(kTagArray) + U32(0xFFFFFFFF))), "exceeds the body"},
      {Frame(Tag(kTagDictionary) + U32(0x10000000)), "exceeds the body"},
      {Frame(OneEntry(Tag(kTagUuid) + "short")), "truncated UUID"},
      {Frame(OneEntry(Tag(kTagString) + Str("\xC3\x28"))), "not UTF-8"},
      {Frame(OneEntry(Tag(kTagString) + Str("\xED\xA0\x80"))), "not UTF-8"},  // a surrogate
      {Frame(OneEntry(Tag(kTagString) + U32(3) + std::string("a\0b", 3))), "NUL"},
      {Frame(Dict(1) + U32(1) + std::string(1, '\0') + kTrue), "key holds NUL"},
      {Frame(Dict(2) + Str("k") + kTrue + Str("k") + kFalse), "duplicate key"},
      // Keys out of order are allowed, but not twice.
      {Frame(Dict(3) + Str("k") + kTrue + Str("b") + kTrue + Str("k") + kFalse), "duplicate key"},
      {Frame(OneEntry(Nested(kMaxDepth + 1))), "deeper than 64"},
      // The top dictionary and the array count too, so these nulls are two
      // values too many, refused at the array's count.
      {Frame(OneEntry(Arr(kMaxValues))), "more than 1048576 values"},
      {Frame(OneEntry(Tag(kTagArray) + U32(2) + Arr(kMaxValues / 2) + Arr(kMaxValues / 2))),
       "more than 1048576 values"},
  };
  for (const auto& row : rows) {
    Result<Value> v = DecodeWhole(row.bytes);
    ASSERT_FALSE(v.ok()) << row.fragment;
    EXPECT_TRUE(v.error().domain() == kDrm1ErrorDomain && v.error().code() == kProtocolError);
    EXPECT_NE(v.error().localizedDescription().find(row.fragment), std::string::npos)
        << v.error().localizedDescription();
  }
  // 64 levels of containers is the limit, the top dictionary being level 1.
  EXPECT_TRUE(DecodeWhole(Frame(OneEntry(Nested(kMaxDepth)))).ok());
  EXPECT_TRUE(DecodeWhole(Frame(OneEntry(Arr(kMaxValues - 2, kTagTrue)))).ok());
  // Frames from the daemon may be larger and hold any number of values.
  EXPECT_TRUE(DecodeHeader(HeaderBytes(kMaxReplyBodySize, 1, 1, kFlagIsReply), kFromDaemon).ok());
  EXPECT_FALSE(
      DecodeHeader(HeaderBytes(kMaxReplyBodySize + 1, 1, 1, kFlagIsReply), kFromDaemon).ok());
  EXPECT_TRUE(DecodeWhole(Frame(OneEntry(Arr(kMaxValues))), kFromDaemon).ok());
}

TEST(Drm1Test, DecoderSplitsAStreamFedInPiecesAndStaysBrokenAfterAnError) {
  std::string stream;
  for (uint64_t serial : {1, 2, 5}) stream += *EncodeFrame(serial, 0, 0, Value{{"n", serial}});
  FrameDecoder decoder;
  std::vector<uint64_t> serials;  // increasing, gaps allowed
  for (char c : stream) {
    decoder.feed(std::string_view(&c, 1));
    Result<std::optional<drm1::Frame>> f = decoder.next();
    ASSERT_TRUE(f.ok());
    if (*f) {
      EXPECT_EQ((**f).body["n"].uintValue(), (**f).header.serial);
      serials.push_back((**f).header.serial);
    }
  }
  EXPECT_EQ(serials, (std::vector<uint64_t>{1, 2, 5}));
  EXPECT_EQ(decoder.buffered(), 0u);
  // A serial again is refused at its header, before its body is in; nothing after is read.
  decoder.feed(EncodeFrame(5, 0, 0, Value::EmptyDictionary())->substr(0, kHeaderSize));
  Result<std::optional<drm1::Frame>> again = decoder.next();
  ASSERT_FALSE(again.ok());
  EXPECT_NE(again.error().localizedDescription().find("serial 5 not above"), std::string::npos);
  decoder.feed(*EncodeFrame(6, 0, 0, Value::EmptyDictionary()));
  EXPECT_FALSE(decoder.next().ok());
}

// Text is read eight bytes at a time, so a NUL or a byte that is not UTF-8
// is placed at each position of a word, across words and in the tail, in a
// value and in a key. A string holding both is refused for its NUL.
TEST(Drm1Test, RefusesToEncodeWhatPeersWouldRefuse) {
  const std::string ascii = "abcdefghijklmnopqrstuvw";  // 23 bytes: two words and a tail
  std::vector<std::pair<std::string, const char*>> texts = {
      {ascii, nullptr},
      {"", nullptr},
      {ascii + "\xC3\xA9" + ascii, nullptr},
      {"\x7F" + ascii, nullptr},
      {ascii + "\xFF" + std::string(1, '\0'), "holds NUL"},
      {"\xC0\x80", "is not UTF-8"}};
  for (size_t at : {0, 1, 7, 8, 9, 15, 16, 22}) {
    texts.push_back({ascii.substr(0, at) + '\0' + ascii.substr(at + 1), "holds NUL"});
    texts.push_back({ascii.substr(0, at) + '\x80' + ascii.substr(at + 1), "is not UTF-8"});
  }
  Value deep = Value(true);
  for (int i = 0; i < kMaxDepth; ++i) deep = Value(Array{deep});
  std::vector<std::pair<Value, const char*>> rows = {{Value("not a dictionary"), ""},
                                                     {Value{{"k", deep}}, ""}};
  for (const auto& [text, refusal] : texts) {
    rows.push_back({Value{{"k", text}}, refusal});
    rows.push_back({Value{{text, 1}}, refusal});
  }
  for (const auto& [body, refusal] : rows) {
    Result<std::string> f = EncodeFrame(1, 0, 0, body);
    if (!refusal) {
      ASSERT_TRUE(f.ok()) << f.error().description();
      EXPECT_EQ(DecodeWhole(*f).value_or(Value()), body);
      continue;
    }
    ASSERT_FALSE(f.ok()) << body.description();
    EXPECT_EQ(f.error().code(), kUnencodable);
    EXPECT_NE(f.error().description().find(refusal), std::string::npos) << f.error().description();
  }
}

// A body of up to 16 MiB is encoded whole, one byte more is refused: at the
// limit less the header, at the limit, and past it; a reply may pass it.
TEST(Drm1Test, EncodesBodiesUpTo16MiB) {
  for (size_t size :
       {size_t{kMaxBodySize} - kHeaderSize, size_t{kMaxBodySize}, size_t{kMaxBodySize} + 1}) {
    for (uint32_t flags : {0u, kFlagIsReply}) {
      const Value body{{"k", std::string(size - 15, 'x')}};  // 15 bytes around the padding
      Result<std::string> f = EncodeFrame(1, flags ? 1 : 0, flags, body);
      ASSERT_EQ(f.ok(), size <= kMaxBodySize || flags) << size;
      EXPECT_TRUE(f.ok() ? f->size() == kHeaderSize + size &&
                               DecodeWhole(*f, kFromDaemon).value_or(Value()) == body
                         : f.error().code() == kUnencodable);
    }
  }
}

}  // namespace
}  // namespace dr::drm1
