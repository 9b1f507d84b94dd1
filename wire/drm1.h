// DRM1: the framing and value encoding of drd's message socket.
//
// Every message in either direction is one frame, a 32-byte header and a
// body; all integers are little-endian:
//
//   frame  := magic "DRM1" | u32 body-length | u64 serial (!= 0, increasing)
//             | u64 reply-to | u32 flags | u32 reserved (0) | body
//   flags  := bit 0: the sender wants a reply; bit 1: this is a reply
//             (reply-to is the request's serial; 0 for anything else);
//             bit 2: descriptors travel beside the frame
//   body   := value, a dictionary at the top level
//   value  := 0x00 null | 0x01 false | 0x02 true | 0x03 i64 | 0x04 u64
//           | 0x05 f64 | 0x06 date (f64 seconds since 1970) | 0x07 string
//           | 0x08 data | 0x09 uuid (16 bytes) | 0x0A array | 0x0B dictionary
//   string := u32 byte count, UTF-8 without NUL
//   data   := u32 byte count, bytes
//   array  := u32 element count, values
//   dictionary := u32 entry count, (key: string, value)*; keys unique
//
// Nesting is at most 64 levels (the top dictionary is level 1). A frame sent
// to the daemon has a body of at most 16 MiB holding at most 1,048,576 values
// (every array element and dictionary value, the top dictionary too), so
// that what it decodes to stays a small multiple of its bytes; a frame from
// the daemon may be 256 MiB and hold any number of values. The serials of a
// stream are strictly increasing (gaps allowed). A frame that breaks any
// rule is refused with kDrm1ErrorDomain and a message naming the field at
// fault; the decoder never trusts a length or count. Null decodes to an
// absent value (and so vanishes from a dictionary).
//
// Stateless functions, and a FrameDecoder owned by one connection; neither
// is shared between threads.
#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/status.h"
#include "core/value.h"

namespace dr::drm1 {

inline constexpr const char* kDrm1ErrorDomain = "drm1";
inline constexpr int64_t kProtocolError = 1;  // the bytes break the frame rules
inline constexpr int64_t kUnencodable = 2;    // the value cannot be sent

inline constexpr char kMagic[4] = {'D', 'R', 'M', '1'};
inline constexpr size_t kHeaderSize = 32;
inline constexpr uint32_t kMaxBodySize = uint32_t{16} << 20;        // sent to the daemon
inline constexpr uint32_t kMaxReplyBodySize = uint32_t{256} << 20;  // sent by the daemon
inline constexpr size_t kMaxValues = size_t{1} << 20;               // sent to the daemon
inline constexpr int kMaxDepth = 64;
inline constexpr uint32_t kFlagWantsReply = 1u << 0;
inline constexpr uint32_t kFlagIsReply = 1u << 1;
// Descriptors travel beside the frame (SCM_RIGHTS with its first byte), at
// most kMaxDescriptors; only replies carry them.
inline constexpr uint32_t kFlagDescriptors = 1u << 2;
inline constexpr size_t kMaxDescriptors = 4;

enum Tag : uint8_t {
  kTagNull = 0x00,
  kTagFalse = 0x01,
  kTagTrue = 0x02,
  kTagInt = 0x03,
  kTagUInt = 0x04,
  kTagDouble = 0x05,
  kTagDate = 0x06,
  kTagString = 0x07,
  kTagData = 0x08,
  kTagUuid = 0x09,
  kTagArray = 0x0A,
  kTagDictionary = 0x0B,
};

// What a reader takes: frames sent to the daemon (what the daemon reads) or
// frames the daemon sends (what its clients read).
struct Limits {
  uint32_t maxBodySize;
  size_t maxValues;
};
inline constexpr Limits kToDaemon{kMaxBodySize, kMaxValues};
inline constexpr Limits kFromDaemon{kMaxReplyBodySize, SIZE_MAX};

struct Header {
  uint32_t bodyLength = 0;
  uint64_t serial = 0;
  uint64_t replyTo = 0;
  uint32_t flags = 0;

  bool wantsReply() const { return (flags & kFlagWantsReply) != 0; }
  bool isReply() const { return (flags & kFlagIsReply) != 0; }
  bool carriesDescriptors() const { return (flags & kFlagDescriptors) != 0; }
};

struct Frame {
  Header header;
  Value body;         // always a dictionary
  size_t values = 0;  // how many values the body held, the top dictionary too
};

// The header in the first kHeaderSize bytes of `bytes`, checked.
// REQUIRES: bytes.size() >= kHeaderSize.
Result<Header> DecodeHeader(std::string_view bytes, const Limits& limits = kToDaemon);

// The value of a body, checked; the top level must be a dictionary holding
// at most `maxValues` values in all; their number goes to `values`.
Result<Value> DecodeBody(std::string_view body, size_t maxValues = SIZE_MAX,
                         size_t* values = nullptr);

// The encoding of one value (any type; absent is written as null).
// Fails with kUnencodable for text that is not UTF-8 or holds NUL.
Result<std::string> EncodeValue(const Value& value);

// A whole frame: `body` must be a dictionary and encode to at most
// kMaxBodySize bytes (kMaxReplyBodySize for a reply, kFlagIsReply); the
// header's bodyLength is filled in. Fails with kUnencodable otherwise.
Result<std::string> EncodeFrame(uint64_t serial, uint64_t replyTo, uint32_t flags,
                                const Value& body);

// The entries of a dictionary, (key: string, value)* without the
// dictionary's tag and count, encoded once to be spliced into many messages
// (Splice::entries). `starts` holds where each entry begins, then the end.
// An entry that cannot be encoded ends them: `bytes` stop where it begins,
// and `refusal` says why (OK when every entry was encoded).
struct EncodedEntries {
  std::string bytes;
  std::vector<uint32_t> starts;
  Status refusal;

  size_t count() const { return starts.empty() ? 0 : starts.size() - 1; }
  // The key of entry `i`, read back from the bytes. REQUIRES: i < count().
  std::string_view key(size_t i) const;
  // The first entry whose key is not below `key` (count() when none).
  size_t lowerBound(std::string_view key) const;
};

// `entries` encoded as they sit in a dictionary at nesting level `depth`
// (their values one level deeper), with the limits of a reply.
EncodedEntries EncodeEntries(const Dictionary& entries, int depth);

// A frame written in pieces: bytes encoded for this message, and bytes
// encoded once and shared with other messages (EncodedEntries), which are
// kept alive and not copied, so a reply made mostly of the latter is written
// with scatter-gather I/O. The pieces are appended in wire order; the first
// refusal (or the body passing the limit) is kept, later pieces are then
// ignored, and seal() answers it. Not shared between threads; moving it
// keeps every piece valid.
class Splice {
 public:
  // An empty frame whose body may be `limit` bytes (kMaxReplyBodySize for a
  // reply).
  explicit Splice(size_t limit);

  // The tag and count of an array or dictionary at nesting level `depth`;
  // its `count` elements follow.
  void container(Tag tag, uint32_t count, int depth);
  // A dictionary key; its value follows.
  void key(std::string_view key);
  // `value` encoded at nesting level `depth`.
  void value(const Value& value, int depth);
  // Entries [from, to) of `entries`, shared, not copied. A `to` past
  // count() means to the end, where the refusal of entries that could not
  // all be encoded becomes this frame's.
  void entries(const std::shared_ptr<const EncodedEntries>& entries, size_t from, size_t to);

  // Fills in the header once the body is complete: OK, or why the frame
  // cannot be sent (as EncodeFrame answers).
  Status seal(uint64_t serial, uint64_t replyTo, uint32_t flags);
  // Bytes of the whole frame, header included.
  size_t size() const { return size_; }
  // The iovecs of the frame's bytes from `offset` on, at most `max` of them;
  // answers how many were filled.
  size_t gather(size_t offset, struct iovec* out, size_t max) const;
  // The frame in one string (moved out when no piece is shared).
  std::string flatten() &&;

 private:
  struct Piece {
    const char* shared;  // null: local_[at, at + size)
    size_t at;
    size_t size;
  };
  bool stopped() const { return !status_.ok() || size_ - kHeaderSize > limit_; }
  void local(size_t from);  // local_ from `from` on is the next piece
  void stop(Status why);

  const size_t limit_;
  std::string local_;  // the header and every byte encoded here
  std::vector<Piece> pieces_;
  std::vector<std::shared_ptr<const EncodedEntries>> kept_;
  size_t size_ = 0;
  Status status_;
};

// Splits a byte stream into frames within `limits`. Feed it what the socket
// delivers; take frames while next() answers one. The buffer holds what was
// fed and not yet taken, never more: a header's length reserves nothing. After
// an error the stream is unusable (the connection must be closed) and next()
// keeps answering that error.
class FrameDecoder {
 public:
  explicit FrameDecoder(const Limits& limits = kToDaemon) : limits_(limits) {}
  void feed(std::string_view bytes) { buffer_.append(bytes); }
  // The checked header of the next frame once its bytes are in (nothing
  // before), or the protocol error.
  Result<std::optional<Header>> nextHeader();
  // A frame, nothing when more bytes are needed, or the protocol error.
  Result<std::optional<Frame>> next();
  // Bytes received and not yet consumed by a frame.
  size_t buffered() const { return buffer_.size() - consumed_; }

 private:
  Error fail(Error error);

  Limits limits_;
  std::string buffer_;
  size_t consumed_ = 0;
  uint64_t lastSerial_ = 0;       // of the last frame taken
  std::optional<Header> header_;  // of the next frame, once checked
  Status status_;                 // failed: the error next() keeps answering
};

}  // namespace dr::drm1
