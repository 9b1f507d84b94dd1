#include "core/value.h"

#include <sys/random.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <limits>

namespace dr {
namespace {

const Array& EmptyArrayRef() {
  static const Array* a = new Array();
  return *a;
}
const Dictionary& EmptyDictionaryRef() {
  static const Dictionary* d = new Dictionary();
  return *d;
}
const std::string& EmptyStringRef() {
  static const std::string* s = new std::string();
  return *s;
}
const Data& EmptyDataRef() {
  static const Data* d = new Data();
  return *d;
}

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Appends `s` as a JSON-like quoted string; control characters escaped so the
// text stays on one line.
void AppendQuoted(std::string& out, std::string_view s) {
  out += '"';
  for (char c : s) {
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          char buf[8];
          std::snprintf(buf, sizeof buf, "\\u%04x", static_cast<unsigned>(c));
          out += buf;
        } else {
          out += c;
        }
    }
  }
  out += '"';
}

void AppendDouble(std::string& out, double d) {
  char buf[64];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, d);
  if (ec == std::errc()) out.append(buf, end);
}

void AppendDate(std::string& out, Date d) {
  double whole = std::floor(d.seconds);
  if (!std::isfinite(whole) || std::fabs(whole) > 1e15) {
    out += "<date ";
    AppendDouble(out, d.seconds);
    out += '>';
    return;
  }
  time_t t = static_cast<time_t>(whole);
  struct tm tm;
  gmtime_r(&t, &tm);
  char buf[64];
  std::snprintf(buf, sizeof buf, "%04d-%02d-%02d %02d:%02d:%02d +0000", tm.tm_year + 1900,
                tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
  out += buf;
}

}  // namespace

const Value& AbsentValue() {
  static const Value* v = new Value();
  return *v;
}

Uuid Uuid::random() {
  Uuid u;
  size_t got = 0;
  while (got < u.bytes.size()) {
    ssize_t n = getrandom(u.bytes.data() + got, u.bytes.size() - got, 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      // getrandom cannot fail on a supported kernel once the pool is ready;
      // a UUID that is not unique would corrupt identity, so stop here.
      std::abort();
    }
    got += static_cast<size_t>(n);
  }
  u.bytes[6] = static_cast<uint8_t>((u.bytes[6] & 0x0F) | 0x40);
  u.bytes[8] = static_cast<uint8_t>((u.bytes[8] & 0x3F) | 0x80);
  return u;
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  Uuid u;
  size_t byte = 0;
  for (size_t i = 0; i < 36;) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    int hi = HexDigit(text[i]), lo = HexDigit(text[i + 1]);
    if (hi < 0 || lo < 0) return std::nullopt;
    u.bytes[byte++] = static_cast<uint8_t>(hi * 16 + lo);
    i += 2;
  }
  return u;
}

std::string Uuid::string() const {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string s;
  s.reserve(36);
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) s += '-';
    s += kHex[bytes[i] >> 4];
    s += kHex[bytes[i] & 0xF];
  }
  return s;
}

size_t Dictionary::lowerIndex(std::string_view key) const {
  size_t lo = 0, hi = entries_.size();
  while (lo < hi) {
    size_t mid = lo + (hi - lo) / 2;
    if (entries_[mid].first.view() < key) {
      lo = mid + 1;
    } else {
      hi = mid;
    }
  }
  return lo;
}

size_t Dictionary::findIndex(std::string_view key) const {
  size_t i = lowerIndex(key);
  return i < entries_.size() && entries_[i].first == key ? i : entries_.size();
}

bool DictionaryBuilder::contains(std::string_view key) const {
  if (!ascending_) return seen_.contains(key);
  // Keys so far ascend: the last is the usual one to compare with.
  if (entries_.empty() || entries_.back().first < key) return false;
  auto it = std::lower_bound(entries_.begin(), entries_.end(), key,
                             [](const auto& entry, std::string_view k) { return entry.first < k; });
  return it != entries_.end() && it->first == key;
}

bool DictionaryBuilder::add(Key key, Value value) {
  if (ascending_ && !entries_.empty() && !(entries_.back().first < key)) {
    if (contains(key)) return false;
    // From here on the keys are out of order: keep a set of them.
    ascending_ = false;
    seen_.reserve(entries_.size() * 2);
    for (const auto& entry : entries_) seen_.insert(entry.first.view());
  }
  // The set holds views of the keys' texts, which stay put when a key is
  // moved (into the entries, or as they grow or are sorted).
  if (!ascending_ && !seen_.insert(key.view()).second) return false;
  entries_.emplace_back(std::move(key), std::move(value));
  return true;
}

Dictionary DictionaryBuilder::finish() {
  if (!ascending_) {
    std::sort(entries_.begin(), entries_.end(),
              [](const auto& a, const auto& b) { return a.first < b.first; });
  }
  Dictionary d;
  d.entries_ = std::move(entries_);
  entries_.clear();
  ascending_ = true;
  seen_.clear();
  return d;
}

Value::Value(Array a) : v_(std::make_shared<const Array>(std::move(a))) {}

Value::Value(std::initializer_list<std::pair<Key, Value>> entries) : Value(Dictionary(entries)) {}

Value Value::EmptyDictionary() { return Value(Dictionary{}); }

Value::Value(Dictionary d) {
  erase_if(d, [](const auto& entry) { return entry.second.isAbsent(); });
  d.shrink_to_fit();
  v_ = std::make_shared<const Dictionary>(std::move(d));
}

bool Value::isNumber() const {
  switch (type()) {
    case Type::kBool:
    case Type::kInt:
    case Type::kUInt:
    case Type::kDouble:
      return true;
    default:
      return false;
  }
}

int64_t Value::intValue() const {
  switch (type()) {
    case Type::kBool:
      return std::get<bool>(v_) ? 1 : 0;
    case Type::kInt:
      return std::get<int64_t>(v_);
    case Type::kUInt: {
      uint64_t u = std::get<uint64_t>(v_);
      return u > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())
                 ? std::numeric_limits<int64_t>::max()
                 : static_cast<int64_t>(u);
    }
    case Type::kDouble: {
      double d = std::get<double>(v_);
      if (std::isnan(d)) return 0;
      if (d >= 9223372036854775807.0) return std::numeric_limits<int64_t>::max();
      if (d <= -9223372036854775808.0) return std::numeric_limits<int64_t>::min();
      return static_cast<int64_t>(d);
    }
    default:
      return 0;
  }
}

uint64_t Value::uintValue() const {
  switch (type()) {
    case Type::kBool:
      return std::get<bool>(v_) ? 1 : 0;
    case Type::kInt: {
      int64_t i = std::get<int64_t>(v_);
      return i < 0 ? 0 : static_cast<uint64_t>(i);
    }
    case Type::kUInt:
      return std::get<uint64_t>(v_);
    case Type::kDouble: {
      double d = std::get<double>(v_);
      if (std::isnan(d) || d <= 0) return 0;
      if (d >= 18446744073709551615.0) return std::numeric_limits<uint64_t>::max();
      return static_cast<uint64_t>(d);
    }
    default:
      return 0;
  }
}

double Value::doubleValue() const {
  switch (type()) {
    case Type::kBool:
      return std::get<bool>(v_) ? 1.0 : 0.0;
    case Type::kInt:
      return static_cast<double>(std::get<int64_t>(v_));
    case Type::kUInt:
      return static_cast<double>(std::get<uint64_t>(v_));
    case Type::kDouble:
      return std::get<double>(v_);
    default:
      return 0;
  }
}

bool Value::boolValue() const {
  switch (type()) {
    case Type::kBool:
      return std::get<bool>(v_);
    case Type::kInt:
      return std::get<int64_t>(v_) != 0;
    case Type::kUInt:
      return std::get<uint64_t>(v_) != 0;
    case Type::kDouble:
      return std::get<double>(v_) != 0;  // NaN is not 0: reads true
    default:
      return false;
  }
}

const std::string& Value::stringValue() const {
  if (auto* s = std::get_if<std::string>(&v_)) return *s;
  return EmptyStringRef();
}

std::optional<std::string_view> Value::string() const {
  if (auto* s = std::get_if<std::string>(&v_)) return std::string_view(*s);
  return std::nullopt;
}

const Data& Value::dataValue() const {
  if (auto* d = std::get_if<Data>(&v_)) return *d;
  return EmptyDataRef();
}

std::optional<Uuid> Value::uuid() const {
  if (auto* u = std::get_if<Uuid>(&v_)) return *u;
  return std::nullopt;
}

std::optional<Date> Value::date() const {
  if (auto* d = std::get_if<Date>(&v_)) return *d;
  return std::nullopt;
}

const Array& Value::array() const {
  if (auto* a = std::get_if<std::shared_ptr<const Array>>(&v_)) return **a;
  return EmptyArrayRef();
}

const Dictionary& Value::dictionary() const {
  if (auto* d = std::get_if<std::shared_ptr<const Dictionary>>(&v_)) return **d;
  return EmptyDictionaryRef();
}

const Value& Value::operator[](std::string_view key) const {
  auto* d = std::get_if<std::shared_ptr<const Dictionary>>(&v_);
  if (!d) return AbsentValue();
  auto it = (*d)->find(key);
  return it == (*d)->end() ? AbsentValue() : it->second;
}

const Value& Value::at(size_t index) const {
  const Array& a = array();
  return index < a.size() ? a[index] : AbsentValue();
}

size_t Value::size() const {
  if (isArray()) return array().size();
  if (isDictionary()) return dictionary().size();
  return 0;
}

size_t Value::depth() const {
  size_t deepest = 0;
  if (isArray()) {
    for (const Value& v : array()) deepest = std::max(deepest, v.depth());
  } else if (isDictionary()) {
    for (const auto& entry : dictionary()) deepest = std::max(deepest, entry.second.depth());
  } else {
    return 0;
  }
  return deepest + 1;
}

Value Value::changing(std::string_view key, const Value& value) const {
  if (!isDictionary()) return Value();
  Dictionary copy = dictionary();
  if (value.isAbsent()) {
    auto it = copy.find(key);
    if (it != copy.end()) copy.erase(it);
  } else {
    copy.insert_or_assign(Key(key), value);
  }
  return Value(std::move(copy));
}

std::optional<std::partial_ordering> Value::compareNumber(const Value& other) const {
  if (!isNumber() || !other.isNumber()) return std::nullopt;
  const bool aDouble = type() == Type::kDouble, bDouble = other.type() == Type::kDouble;
  std::partial_ordering r = std::partial_ordering::unordered;
  if (aDouble || bDouble) {
    r = doubleValue() <=> other.doubleValue();
  } else {
    // Both integral (booleans included): compare exactly, without rounding
    // through double.
    const bool aNeg = type() == Type::kInt && std::get<int64_t>(v_) < 0;
    const bool bNeg = other.type() == Type::kInt && std::get<int64_t>(other.v_) < 0;
    if (aNeg != bNeg) {
      r = aNeg ? std::partial_ordering::less : std::partial_ordering::greater;
    } else if (aNeg) {
      r = intValue() <=> other.intValue();
    } else {
      r = uintValue() <=> other.uintValue();
    }
  }
  if (r == std::partial_ordering::unordered) return std::nullopt;
  return r;
}

bool Value::operator==(const Value& other) const {
  if (isNumber() && other.isNumber()) {
    auto r = compareNumber(other);
    return r && *r == std::partial_ordering::equivalent;
  }
  if (type() != other.type()) return false;
  switch (type()) {
    case Type::kAbsent:
      return true;
    case Type::kDate:
      return std::get<Date>(v_).seconds == std::get<Date>(other.v_).seconds;
    case Type::kString:
      return std::get<std::string>(v_) == std::get<std::string>(other.v_);
    case Type::kData:
      return std::get<Data>(v_) == std::get<Data>(other.v_);
    case Type::kUuid:
      return std::get<Uuid>(v_) == std::get<Uuid>(other.v_);
    case Type::kArray:
      return sameNode(other) || array() == other.array();
    case Type::kDictionary:
      return sameNode(other) || dictionary() == other.dictionary();
    default:
      return false;  // numbers handled above
  }
}

const void* Value::node() const {
  if (auto* a = std::get_if<std::shared_ptr<const Array>>(&v_)) return a->get();
  if (auto* d = std::get_if<std::shared_ptr<const Dictionary>>(&v_)) return d->get();
  return nullptr;
}

bool Value::sameNode(const Value& other) const {
  const void* n = node();
  return n != nullptr && n == other.node();
}

std::string Value::description() const {
  std::string out;
  appendDescription(out, false);
  return out;
}

void Value::appendDescription(std::string& out, bool nested) const {
  switch (type()) {
    case Type::kAbsent:
      out += nested ? "null" : "(null)";
      break;
    case Type::kBool:
      out += std::get<bool>(v_) ? "true" : "false";
      break;
    case Type::kInt:
      out += std::to_string(std::get<int64_t>(v_));
      break;
    case Type::kUInt:
      out += std::to_string(std::get<uint64_t>(v_));
      break;
    case Type::kDouble:
      AppendDouble(out, std::get<double>(v_));
      break;
    case Type::kDate:
      AppendDate(out, std::get<Date>(v_));
      break;
    case Type::kString:
      if (nested) {
        AppendQuoted(out, std::get<std::string>(v_));
      } else {
        // A bare string is its own text, with line breaks escaped so that a
        // log line is never split.
        for (char c : std::get<std::string>(v_)) {
          if (c == '\n') {
            out += "\\n";
          } else if (c == '\r') {
            out += "\\r";
          } else {
            out += c;
          }
        }
      }
      break;
    case Type::kData: {
      static constexpr char kHex[] = "0123456789abcdef";
      const Data& d = std::get<Data>(v_);
      out += '<';
      for (size_t i = 0; i < d.size() && i < 64; ++i) {
        if (i > 0 && i % 4 == 0) out += ' ';
        out += kHex[d[i] >> 4];
        out += kHex[d[i] & 0xF];
      }
      if (d.size() > 64) out += " ... " + std::to_string(d.size()) + " bytes";
      out += '>';
      break;
    }
    case Type::kUuid:
      if (nested) out += "<uuid ";
      out += std::get<Uuid>(v_).string();
      if (nested) out += '>';
      break;
    case Type::kArray: {
      const Array& a = array();
      out += '[';
      for (size_t i = 0; i < a.size(); ++i) {
        out += i == 0 ? " " : ", ";
        a[i].appendDescription(out, true);
      }
      out += " ]";
      break;
    }
    case Type::kDictionary: {
      const Dictionary& d = dictionary();
      out += '{';
      bool first = true;
      for (const auto& [k, v] : d) {
        out += first ? " " : ", ";
        first = false;
        AppendQuoted(out, k);
        out += ": ";
        v.appendDescription(out, true);
      }
      out += " }";
      break;
    }
  }
}

}  // namespace dr
