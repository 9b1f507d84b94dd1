#include "wire/drm1.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <string>

#include "core/utf8.h"

namespace dr::drm1 {
namespace {

static_assert(std::endian::native == std::endian::little,
              "the DRM1 codec copies integers as they are in memory");

Error ProtocolError(const std::string& what) {
  return Error(kDrm1ErrorDomain, kProtocolError, what);
}
Error Unencodable(const std::string& what) { return Error(kDrm1ErrorDomain, kUnencodable, what); }

// Whether `s` is UTF-8. Replies carry mostly ASCII text (paths, identifiers,
// tokens), which is taken eight bytes at a time before the exact check.
bool IsUtf8(std::string_view s) {
  size_t i = 0;
  for (uint64_t word; i + 8 <= s.size(); i += 8) {
    std::memcpy(&word, s.data() + i, 8);
    if (word & 0x8080808080808080ull) break;
  }
  while (i < s.size() && static_cast<unsigned char>(s[i]) < 0x80) ++i;
  // An ASCII byte ends a character, so the rest starts on a boundary.
  return i == s.size() || IsValidUtf8(s.substr(i));
}

template <typename T>
T Load(const char* p) {
  T v;
  std::memcpy(&v, p, sizeof v);
  return v;
}

template <typename T>
void Store(std::string& out, T v) {
  char buf[sizeof v];
  std::memcpy(buf, &v, sizeof v);
  out.append(buf, sizeof v);
}

// Whether `s` is ASCII without NUL, the usual text of a message, in one pass
// eight bytes at a time. False sends `s` to the full checks, which tell why.
bool IsPlainAscii(std::string_view s) {
  constexpr uint64_t kOnes = 0x0101010101010101ull, kHighs = 0x8080808080808080ull;
  size_t i = 0;
  for (uint64_t word; i + 8 <= s.size(); i += 8) {
    std::memcpy(&word, s.data() + i, 8);
    // No byte at or above 0x80, and (for such bytes exactly) none that is 0.
    if ((word & kHighs) != 0 || ((word - kOnes) & kHighs) != 0) return false;
  }
  for (; i < s.size(); ++i) {
    const auto c = static_cast<unsigned char>(s[i]);
    if (c == 0 || c >= 0x80) return false;
  }
  return true;
}

// Reads one value from `in` at `pos`. Every length and count is checked
// against the bytes left before anything is reserved or copied.
class BodyReader {
 public:
  BodyReader(std::string_view in, size_t maxValues) : in_(in), maxValues_(maxValues) {}
  size_t values() const { return values_; }

  Result<Value> readTop() {
    if (in_.empty()) return ProtocolError("empty body");
    if (static_cast<uint8_t>(in_[0]) != kTagDictionary) {
      return ProtocolError("the body is not a dictionary");
    }
    Result<Value> v = read(1);
    if (!v.ok()) return v;
    if (pos_ != in_.size()) {
      return ProtocolError(std::to_string(in_.size() - pos_) + " trailing bytes after the body");
    }
    return v;
  }

 private:
  size_t left() const { return in_.size() - pos_; }

  bool take(size_t n, const char** p) {
    if (left() < n) return false;
    *p = in_.data() + pos_;
    pos_ += n;
    return true;
  }

  std::optional<uint32_t> u32() {
    const char* p;
    if (!take(4, &p)) return std::nullopt;
    return Load<uint32_t>(p);
  }

  // The text at the read position, a view into the body.
  Result<std::string_view> text(const char* what) {
    std::optional<uint32_t> n = u32();
    if (!n) return ProtocolError(std::string("truncated ") + what + " length");
    const char* p;
    if (!take(*n, &p)) {
      return ProtocolError(std::string(what) + " of " + std::to_string(*n) +
                           " bytes exceeds the body");
    }
    std::string_view s(p, *n);
    if (IsPlainAscii(s)) return s;
    if (s.find('\0') != std::string_view::npos) {
      return ProtocolError(std::string(what) + " holds NUL");
    }
    if (!IsUtf8(s)) return ProtocolError(std::string(what) + " is not UTF-8");
    return s;
  }

  Result<Value> read(int depth) {
    const char* p;
    if (!take(1, &p)) return ProtocolError("truncated value tag");
    if (++values_ > maxValues_) return TooManyValues();
    const auto tag = static_cast<uint8_t>(*p);
    switch (tag) {
      case kTagNull:
        return Value();
      case kTagFalse:
        return Value(false);
      case kTagTrue:
        return Value(true);
      case kTagInt:
      case kTagUInt:
      case kTagDouble:
      case kTagDate:
        if (!take(8, &p)) return ProtocolError("truncated number");
        if (tag == kTagInt) return Value(Load<int64_t>(p));
        if (tag == kTagUInt) return Value(Load<uint64_t>(p));
        if (tag == kTagDouble) return Value(Load<double>(p));
        return Value(Date{Load<double>(p)});
      case kTagString: {
        Result<std::string_view> s = text("string");
        if (!s.ok()) return s.error();
        return Value(*s);
      }
      case kTagData: {
        std::optional<uint32_t> n = u32();
        if (!n) return ProtocolError("truncated data length");
        if (!take(*n, &p)) {
          return ProtocolError("data of " + std::to_string(*n) + " bytes exceeds the body");
        }
        return Value(Data(p, p + *n));
      }
      case kTagUuid: {
        if (!take(16, &p)) return ProtocolError("truncated UUID");
        Uuid u;
        std::memcpy(u.bytes.data(), p, 16);
        return Value(u);
      }
      case kTagArray:
      case kTagDictionary: {
        if (depth > kMaxDepth) {
          return ProtocolError("nesting deeper than " + std::to_string(kMaxDepth) + " levels");
        }
        std::optional<uint32_t> n = u32();
        if (!n) return ProtocolError("truncated element count");
        // Every element takes at least one byte (two with its key), so a
        // count beyond the bytes left is a lie told before any allocation.
        const size_t least = tag == kTagArray ? 1 : 5;
        if (*n > left() / least) {
          return ProtocolError("count of " + std::to_string(*n) + " exceeds the body");
        }
        // Refused before any element is read: a body of small values may
        // hold far more of them than the cap.
        if (*n > maxValues_ - values_) return TooManyValues();
        // Room for the elements is made as they come beyond the first few
        // thousand, so that a count the body could hold but does not fill
        // costs no more than the body.
        const size_t room = std::min<size_t>(*n, 4096);
        if (tag == kTagArray) {
          Array a;
          a.reserve(room);
          for (uint32_t i = 0; i < *n; ++i) {
            Result<Value> v = read(depth + 1);
            if (!v.ok()) return v;
            a.push_back(std::move(*v));
          }
          return Value(std::move(a));
        }
        DictionaryBuilder d;
        d.reserve(room);
        for (uint32_t i = 0; i < *n; ++i) {
          Result<std::string_view> key = text("key");
          if (!key.ok()) return key.error();
          Result<Value> v = read(depth + 1);
          if (!v.ok()) return v;
          if (!d.add(Key(*key), std::move(*v))) return ProtocolError("duplicate key");
        }
        return Value(d.finish());
      }
      default:
        return ProtocolError("unknown tag " + std::to_string(tag));
    }
  }

  Error TooManyValues() const {
    return ProtocolError("more than " + std::to_string(maxValues_) + " values");
  }

  std::string_view in_;
  size_t pos_ = 0;
  const size_t maxValues_;
  size_t values_ = 0;  // read so far
};

// Why `s` cannot be written as text: too long, holding NUL, or not UTF-8,
// in that order of precedence.
Status CheckText(std::string_view s, const char* what, size_t limit) {
  if (s.size() > limit) return Unencodable(std::string(what) + " too long");
  if (s.find('\0') != std::string_view::npos) return Unencodable(std::string(what) + " holds NUL");
  if (!IsUtf8(s)) return Unencodable(std::string(what) + " is not UTF-8");
  return Status::OK();
}

// The bytes ValueWriter writes for `v`, so that a large reply is built in one
// allocation instead of growing (and copying) its buffer about twenty times.
// Deeper nesting than the codec allows is not walked: the writer refuses it.
size_t EncodedSize(const Value& v, int depth) {
  switch (v.type()) {
    case Value::Type::kAbsent:
    case Value::Type::kBool:
      return 1;
    case Value::Type::kInt:
    case Value::Type::kUInt:
    case Value::Type::kDouble:
    case Value::Type::kDate:
      return 1 + 8;
    case Value::Type::kString:
      return 1 + 4 + v.stringValue().size();
    case Value::Type::kData:
      return 1 + 4 + v.dataValue().size();
    case Value::Type::kUuid:
      return 1 + 16;
    case Value::Type::kArray:
    case Value::Type::kDictionary: {
      size_t n = 1 + 4;
      if (depth > kMaxDepth) return n;
      if (v.isArray()) {
        for (const Value& e : v.array()) n += EncodedSize(e, depth + 1);
      } else {
        for (const auto& [k, e] : v.dictionary()) n += 4 + k.size() + EncodedSize(e, depth + 1);
      }
      return n;
    }
  }
  return 0;
}

// Writes into a buffer already sized to hold the whole encoding (of a body
// known to fit the limit), through a pointer.
class FittingSink {
 public:
  explicit FittingSink(char* out) : p_(out) {}
  char* end() const { return p_; }
  static constexpr bool overLimit() { return false; }
  void put(const void* from, size_t n) {
    if (n != 0) std::memcpy(p_, from, n);
    p_ += n;
  }

 private:
  char* p_;
};

// Counts what would be written, for a body known to pass the limit: the
// writer stops with an error at the first value that starts beyond it, or
// at a value it refuses before, and nothing the size of the body is made.
class CountingSink {
 public:
  explicit CountingSink(size_t limit) : limit_(limit) {}
  bool overLimit() const { return size_ > limit_; }
  void put(const void*, size_t n) { size_ += n; }

 private:
  size_t size_ = 0;
  const size_t limit_;
};

std::string TooLarge(size_t limit) {
  return "body larger than " + std::to_string(limit >> 20) + " MiB";
}

// The encoder of values, over either sink; both refuse the same values with
// the same errors, in the same order, except that only the counting sink
// meets the limit.
template <typename Sink>
class ValueWriter {
 public:
  ValueWriter(Sink& sink, size_t limit) : sink_(sink), limit_(limit) {}

  Status value(const Value& v, int depth) {
    if (sink_.overLimit()) return Unencodable(TooLarge(limit_));
    switch (v.type()) {
      case Value::Type::kAbsent:
        tag(kTagNull);
        return Status::OK();
      case Value::Type::kBool:
        tag(v.boolValue() ? kTagTrue : kTagFalse);
        return Status::OK();
      case Value::Type::kInt:
        tag(kTagInt);
        raw(v.intValue());
        return Status::OK();
      case Value::Type::kUInt:
        tag(kTagUInt);
        raw(v.uintValue());
        return Status::OK();
      case Value::Type::kDouble:
        tag(kTagDouble);
        raw(v.doubleValue());
        return Status::OK();
      case Value::Type::kDate:
        tag(kTagDate);
        raw(v.date()->seconds);
        return Status::OK();
      case Value::Type::kString:
        tag(kTagString);
        return text(v.stringValue(), "string");
      case Value::Type::kData: {
        const Data& d = v.dataValue();
        if (d.size() > limit_) return Unencodable("data too long");
        tag(kTagData);
        raw(static_cast<uint32_t>(d.size()));
        sink_.put(d.data(), d.size());
        return Status::OK();
      }
      case Value::Type::kUuid:
        tag(kTagUuid);
        sink_.put(v.uuid()->bytes.data(), 16);
        return Status::OK();
      case Value::Type::kArray:
      case Value::Type::kDictionary:
        if (depth > kMaxDepth) {
          return Unencodable("nesting deeper than " + std::to_string(kMaxDepth) + " levels");
        }
        if (v.isArray()) {
          const Array& a = v.array();
          tag(kTagArray);
          raw(static_cast<uint32_t>(a.size()));
          for (const Value& e : a) {
            if (Status s = value(e, depth + 1); !s.ok()) return s;
          }
        } else {
          const Dictionary& d = v.dictionary();
          tag(kTagDictionary);
          raw(static_cast<uint32_t>(d.size()));
          for (const auto& [k, e] : d) {
            if (Status s = text(k, "key"); !s.ok()) return s;
            if (Status s = value(e, depth + 1); !s.ok()) return s;
          }
        }
        return Status::OK();
    }
    return Unencodable("unknown value type");
  }

 private:
  void tag(uint8_t t) { sink_.put(&t, 1); }
  template <typename T>
  void raw(T v) {
    sink_.put(&v, sizeof v);
  }
  Status text(std::string_view s, const char* what) {
    if (s.size() > limit_ || !IsPlainAscii(s)) {
      if (Status st = CheckText(s, what, limit_); !st.ok()) return st;
    }
    raw(static_cast<uint32_t>(s.size()));
    sink_.put(s.data(), s.size());
    return Status::OK();
  }

  Sink& sink_;
  const size_t limit_;
};

// `value` encoded at nesting level `depth` after what `out` holds, the
// buffer grown once: text and data of at most `limit` bytes, and the whole
// encoding within `room` bytes (else "too large", after any value met
// before the room ran out is refused as such).
Status Encode(std::string& out, const Value& value, int depth, size_t limit, size_t room) {
  const size_t prefix = out.size();
  const size_t size = EncodedSize(value, depth);
  if (size <= room) {
    out.resize(prefix + size);
    FittingSink sink(out.data() + prefix);
    if (Status s = ValueWriter<FittingSink>(sink, limit).value(value, depth); !s.ok()) {
      out.resize(prefix);
      return s;
    }
    out.resize(static_cast<size_t>(sink.end() - out.data()));
    return Status::OK();
  }
  CountingSink sink(room);
  if (Status s = ValueWriter<CountingSink>(sink, limit).value(value, depth); !s.ok()) return s;
  return Unencodable(TooLarge(limit));
}

// A string's length and bytes, checked as a key.
Status AppendKey(std::string& out, std::string_view key, size_t limit) {
  if (key.size() > limit || !IsPlainAscii(key)) {
    if (Status s = CheckText(key, "key", limit); !s.ok()) return s;
  }
  Store(out, static_cast<uint32_t>(key.size()));
  out.append(key);
  return Status::OK();
}

}  // namespace

Result<Header> DecodeHeader(std::string_view bytes, const Limits& limits) {
  const char* p = bytes.data();
  if (std::memcmp(p, kMagic, sizeof kMagic) != 0) return ProtocolError("bad magic");
  Header h;
  h.bodyLength = Load<uint32_t>(p + 4);
  h.serial = Load<uint64_t>(p + 8);
  h.replyTo = Load<uint64_t>(p + 16);
  h.flags = Load<uint32_t>(p + 24);
  const uint32_t reserved = Load<uint32_t>(p + 28);
  if (h.bodyLength > limits.maxBodySize) {
    return ProtocolError("body length " + std::to_string(h.bodyLength) + " above " +
                         std::to_string(limits.maxBodySize >> 20) + " MiB");
  }
  if (h.serial == 0) return ProtocolError("serial 0");
  if ((h.flags & ~(kFlagWantsReply | kFlagIsReply | kFlagDescriptors)) != 0)
    return ProtocolError("unknown flags");
  if (h.isReply() != (h.replyTo != 0)) {
    return ProtocolError("reply-to does not match the reply flag");
  }
  if (reserved != 0) return ProtocolError("reserved field not 0");
  return h;
}

Result<Value> DecodeBody(std::string_view body, size_t maxValues, size_t* values) {
  BodyReader reader(body, maxValues);
  Result<Value> value = reader.readTop();
  if (values) *values = reader.values();
  return value;
}

Result<std::string> EncodeValue(const Value& value) {
  std::string out;
  if (Status s = Encode(out, value, 1, kMaxBodySize, kMaxBodySize); !s.ok()) return s.error();
  return out;
}

Result<std::string> EncodeFrame(uint64_t serial, uint64_t replyTo, uint32_t flags,
                                const Value& body) {
  Splice frame((flags & kFlagIsReply) != 0 ? kMaxReplyBodySize : kMaxBodySize);
  frame.value(body, 1);
  if (Status s = frame.seal(serial, replyTo, flags); !s.ok()) return s.error();
  return std::move(frame).flatten();
}

std::string_view EncodedEntries::key(size_t i) const {
  const char* p = bytes.data() + starts[i];
  return std::string_view(p + 4, Load<uint32_t>(p));
}

size_t EncodedEntries::lowerBound(std::string_view key) const {
  size_t low = 0, high = count();
  while (low < high) {
    const size_t mid = (low + high) / 2;
    // Keys order as unsigned bytes, as a dictionary's do (and memcmp).
    if (this->key(mid).compare(key) < 0) {
      low = mid + 1;
    } else {
      high = mid;
    }
  }
  return low;
}

EncodedEntries EncodeEntries(const Dictionary& entries, int depth) {
  EncodedEntries out;
  size_t size = 0;
  for (const auto& [k, v] : entries) size += 4 + k.size() + EncodedSize(v, depth);
  out.bytes.reserve(std::min<size_t>(size, kMaxReplyBodySize));
  out.starts.reserve(entries.size() + 1);
  for (const auto& [k, v] : entries) {
    const size_t start = out.bytes.size();
    out.starts.push_back(static_cast<uint32_t>(start));
    Status s = AppendKey(out.bytes, k, kMaxReplyBodySize);
    if (s.ok() && out.bytes.size() > kMaxReplyBodySize)
      s = Unencodable(TooLarge(kMaxReplyBodySize));
    if (s.ok()) {
      s = Encode(out.bytes, v, depth, kMaxReplyBodySize, kMaxReplyBodySize - out.bytes.size());
    }
    if (!s.ok()) {
      out.bytes.resize(start);
      out.refusal = s;
      return out;
    }
  }
  out.starts.push_back(static_cast<uint32_t>(out.bytes.size()));
  return out;
}

Splice::Splice(size_t limit) : limit_(limit), local_(kHeaderSize, '\0') { local(0); }

void Splice::local(size_t from) {
  const size_t n = local_.size() - from;
  if (n == 0) return;
  if (!pieces_.empty() && pieces_.back().shared == nullptr &&
      pieces_.back().at + pieces_.back().size == from) {
    pieces_.back().size += n;
  } else {
    pieces_.push_back({nullptr, from, n});
  }
  size_ += n;
}

void Splice::stop(Status why) {
  if (status_.ok()) status_ = std::move(why);
}

void Splice::container(Tag tag, uint32_t count, int depth) {
  if (stopped()) return;
  if (depth > kMaxDepth) {
    return stop(Unencodable("nesting deeper than " + std::to_string(kMaxDepth) + " levels"));
  }
  const size_t from = local_.size();
  local_.push_back(static_cast<char>(tag));
  Store(local_, count);
  local(from);
}

void Splice::key(std::string_view key) {
  if (stopped()) return;
  const size_t from = local_.size();
  if (Status s = AppendKey(local_, key, limit_); !s.ok()) return stop(std::move(s));
  local(from);
}

void Splice::value(const Value& value, int depth) {
  if (stopped()) return;
  const size_t from = local_.size();
  const size_t room = limit_ - (size_ - kHeaderSize);
  if (Status s = Encode(local_, value, depth, limit_, room); !s.ok()) return stop(std::move(s));
  local(from);
}

void Splice::entries(const std::shared_ptr<const EncodedEntries>& entries, size_t from, size_t to) {
  if (stopped()) return;
  const size_t end = std::min(to, entries->count());
  if (from < end) {
    const char* p = entries->bytes.data() + entries->starts[from];
    const size_t n = entries->starts[end] - entries->starts[from];
    pieces_.push_back({p, 0, n});
    size_ += n;
    if (kept_.empty() || kept_.back() != entries) kept_.push_back(entries);
  }
  // A refusal beyond the limit is not reached: the body is too large first.
  if (to > entries->count() && !entries->refusal.ok() && !stopped()) stop(entries->refusal);
}

Status Splice::seal(uint64_t serial, uint64_t replyTo, uint32_t flags) {
  if (!status_.ok()) return status_;
  const size_t length = size_ - kHeaderSize;
  if (length > limit_) return Unencodable(TooLarge(limit_));
  struct iovec first;
  if (length == 0 || gather(kHeaderSize, &first, 1) != 1 ||
      *static_cast<const uint8_t*>(first.iov_base) != kTagDictionary) {
    return Unencodable("the body is not a dictionary");
  }
  char* out = local_.data();
  std::memcpy(out, kMagic, sizeof kMagic);
  const uint32_t length32 = static_cast<uint32_t>(length), reserved = 0;
  std::memcpy(out + 4, &length32, 4);
  std::memcpy(out + 8, &serial, 8);
  std::memcpy(out + 16, &replyTo, 8);
  std::memcpy(out + 24, &flags, 4);
  std::memcpy(out + 28, &reserved, 4);
  return Status::OK();
}

size_t Splice::gather(size_t offset, struct iovec* out, size_t max) const {
  size_t filled = 0;
  for (const Piece& piece : pieces_) {
    if (filled == max) break;
    if (offset >= piece.size) {
      offset -= piece.size;
      continue;
    }
    const char* base = piece.shared != nullptr ? piece.shared : local_.data() + piece.at;
    out[filled++] = {const_cast<char*>(base + offset), piece.size - offset};
    offset = 0;
  }
  return filled;
}

std::string Splice::flatten() && {
  if (pieces_.size() == 1 && size_ == local_.size()) return std::move(local_);
  std::string out;
  out.reserve(size_);
  for (const Piece& piece : pieces_) {
    out.append(piece.shared != nullptr ? piece.shared : local_.data() + piece.at, piece.size);
  }
  return out;
}

Error FrameDecoder::fail(Error error) {
  status_ = error;
  return error;
}

Result<std::optional<Header>> FrameDecoder::nextHeader() {
  if (!status_.ok()) return status_;
  if (header_) return header_;
  std::string_view pending = std::string_view(buffer_).substr(consumed_);
  if (pending.size() < kHeaderSize) return std::optional<Header>();
  Result<Header> header = DecodeHeader(pending, limits_);
  if (!header.ok()) return fail(header.error());
  if (header->serial <= lastSerial_) {
    return fail(ProtocolError("serial " + std::to_string(header->serial) +
                              " not above the one before, " + std::to_string(lastSerial_)));
  }
  header_ = *header;
  return header_;
}

Result<std::optional<Frame>> FrameDecoder::next() {
  Result<std::optional<Header>> header = nextHeader();
  if (!header.ok()) return header.error();
  if (!header->has_value()) return std::optional<Frame>();
  const Header h = **header;
  if (buffered() - kHeaderSize < h.bodyLength) return std::optional<Frame>();
  size_t values = 0;
  Result<Value> body =
      DecodeBody(std::string_view(buffer_).substr(consumed_ + kHeaderSize, h.bodyLength),
                 limits_.maxValues, &values);
  if (!body.ok()) return fail(body.error());
  consumed_ += kHeaderSize + h.bodyLength;
  lastSerial_ = h.serial;
  header_.reset();
  if (consumed_ == buffer_.size()) {
    // All taken: a connection that sent one large frame keeps no large
    // buffer while it idles.
    consumed_ = 0;
    if (buffer_.capacity() > 65536) {
      std::string().swap(buffer_);
    } else {
      buffer_.clear();
    }
  } else if (consumed_ > 65536 && consumed_ * 2 > buffer_.size()) {
    // Drop consumed bytes once they dominate, so a long-lived connection's
    // buffer stays the size of what is in flight.
    buffer_.erase(0, consumed_);
    consumed_ = 0;
  }
  return std::optional<Frame>(Frame{h, std::move(*body), values});
}

}  // namespace dr::drm1
