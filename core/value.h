// dr::Value, the daemon's one dynamic value.
//
// A Value is absent, a boolean, a signed or unsigned 64-bit integer, a double,
// a date, a string, data, a UUID, an array or a dictionary. It carries the
// message dictionaries, pdoc contents, forms, annotations and rules.
//
// - Absent is a value: a missing key reads absent; absent reads as 0, false,
//   "" or an empty container, and no read ever throws or fails.
// - Numbers compare numerically across kinds; booleans are the numbers 1 and 0.
// - Dictionaries keep their keys in ascending byte order, which is the
//   enumeration order everywhere in drd. A dictionary never holds an absent
//   value: storing absent under a key removes the key.
// - Arrays and dictionaries are shared, immutable nodes. Copying a Value
//   shares the node; a "mutable copy" is Array/Dictionary copied out with
//   array()/dictionary(), changed, and wrapped in a new Value (a new node).
//   sameNode() tells whether two values hold the very same node.
//
// Values are immutable after construction, so they may be read from any
// number of threads at once.
#pragma once

#include <array>
#include <compare>
#include <concepts>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace dr {

class Value;

// A point in time: seconds since 1970-01-01 00:00:00 UTC.
struct Date {
  double seconds = 0;
  bool operator==(const Date&) const = default;
};

// A 128-bit UUID in RFC 4122 byte order.
struct Uuid {
  std::array<uint8_t, 16> bytes{};

  // A new random (version 4) UUID.
  static Uuid random();
  // Parses the 36-character hyphenated text (8-4-4-4-12, either case);
  // nothing for any other text.
  static std::optional<Uuid> parse(std::string_view text);
  // The canonical upper-case text, 36 characters.
  std::string string() const;

  bool operator==(const Uuid&) const = default;
  auto operator<=>(const Uuid&) const = default;
};

using Data = std::vector<uint8_t>;
using Array = std::vector<Value>;
// std::less<> compares std::string bytewise as unsigned char, which is the
// ascending byte order drd enumerates in; it also allows string_view lookups.
using Dictionary = std::map<std::string, Value, std::less<>>;

class Value {
 public:
  enum class Type : uint8_t {
    kAbsent,
    kBool,
    kInt,
    kUInt,
    kDouble,
    kDate,
    kString,
    kData,
    kUuid,
    kArray,
    kDictionary,
  };

  Value() = default;  // absent
  Value(std::nullopt_t) {}
  Value(bool b) : v_(b) {}
  template <std::signed_integral I>
  requires(!std::same_as<I, bool> && !std::same_as<I, char>) Value(I i)
      : v_(static_cast<int64_t>(i)) {}
  template <std::unsigned_integral U>
  requires(!std::same_as<U, bool>) Value(U u) : v_(static_cast<uint64_t>(u)) {}
  Value(double d) : v_(d) {}
  Value(Date d) : v_(d) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(Data d) : v_(std::move(d)) {}
  Value(Uuid u) : v_(u) {}
  // An empty optional is absent.
  template <typename T>
  Value(const std::optional<T>& o) : Value(o ? Value(*o) : Value()) {}
  Value(Array a);
  // Absent entries of `d` are dropped.
  Value(Dictionary d);
  Value(std::initializer_list<std::pair<const std::string, Value>> entries)
      : Value(Dictionary(entries)) {}

  // An empty dictionary and an empty array (each a new node).
  static Value EmptyDictionary() { return Value(Dictionary{}); }
  static Value EmptyArray() { return Value(Array{}); }

  Type type() const { return static_cast<Type>(v_.index()); }
  bool isAbsent() const { return type() == Type::kAbsent; }
  bool isPresent() const { return !isAbsent(); }
  bool isBool() const { return type() == Type::kBool; }
  // Booleans count as numbers.
  bool isNumber() const;
  bool isInteger() const { return type() == Type::kInt || type() == Type::kUInt; }
  bool isString() const { return type() == Type::kString; }
  bool isData() const { return type() == Type::kData; }
  bool isDate() const { return type() == Type::kDate; }
  bool isUuid() const { return type() == Type::kUuid; }
  bool isArray() const { return type() == Type::kArray; }
  bool isDictionary() const { return type() == Type::kDictionary; }

  // Absent-safe reads. Numbers convert between kinds (a double is truncated,
  // out-of-range values saturate); anything that is not a number reads 0.
  int64_t intValue() const;
  uint64_t uintValue() const;
  double doubleValue() const;
  // A number other than 0 reads true; everything else false.
  bool boolValue() const;
  // The string, or "" for anything else.
  const std::string& stringValue() const;
  // The string, or nothing for anything else (tells "" from not-a-string).
  std::optional<std::string_view> string() const;
  const Data& dataValue() const;
  std::optional<Uuid> uuid() const;
  std::optional<Date> date() const;
  // The array or dictionary, or an empty one for anything else.
  const Array& array() const;
  const Dictionary& dictionary() const;

  // The value under `key`, absent when this is not a dictionary or has no
  // such key.
  const Value& operator[](std::string_view key) const;
  bool has(std::string_view key) const { return (*this)[key].isPresent(); }
  // The element at `index`, absent when out of range or not an array.
  const Value& at(size_t index) const;
  // Element count of an array or dictionary; 0 for anything else.
  size_t size() const;

  // A new dictionary: a copy of this one in which `key` maps to `value`, or
  // without `key` when `value` is absent. This value is not changed. When this
  // is not a dictionary the result is absent.
  Value changing(std::string_view key, const Value& value) const;

  // Equality: numbers (and booleans) numerically across kinds, dates by
  // instant, everything else by type and contents; absent equals absent.
  bool operator==(const Value& other) const;
  // Numeric order of two numbers (booleans as 0 and 1); nothing when either
  // is not a number or the comparison is unordered (NaN).
  std::optional<std::partial_ordering> compareNumber(const Value& other) const;

  // Node identity of arrays and dictionaries: true when both hold the very
  // same node. Always false for other values.
  bool sameNode(const Value& other) const;
  const void* node() const;

  // One-line text for logs and %@. A string is its own text and a UUID its
  // canonical text; containers read like JSON:
  // { "request": "match", "uuids": [ <uuid 1B4E28BA-...> ] }. Absent is
  // "(null)". Line breaks are escaped.
  std::string description() const;
  // The text of this value inside a container (strings quoted).
  void appendDescription(std::string& out, bool nested) const;

 private:
  std::variant<std::monostate, bool, int64_t, uint64_t, double, Date, std::string, Data, Uuid,
               std::shared_ptr<const Array>, std::shared_ptr<const Dictionary>>
      v_;
};

// An absent value with static storage, for returning references.
const Value& AbsentValue();

}  // namespace dr
