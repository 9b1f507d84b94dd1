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
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <variant>
#include <vector>

// Named from this folder, not from the top, so that the header works where
// it is installed for hosts too (drd/core/).
#include "key.h"

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
class Dictionary;

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
  // A dictionary of `entries`; of two entries with the same key the first
  // is kept.
  Value(std::initializer_list<std::pair<Key, Value>> entries);

  // An empty dictionary and an empty array (each a new node).
  static Value EmptyDictionary();
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
  // How many levels of containers this value nests: 0 for a scalar (or
  // absent), 1 for a container of scalars or an empty one, and so on.
  size_t depth() const;

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

// A dictionary's entries, in ascending byte order of their keys, held in one
// block rather than a node each: dictionaries are read far more often than
// changed, most hold a handful of keys, and there are hundreds of thousands
// of them in a large registry. The interface is the part of std::map's that
// drd uses, with its meaning (an insert never replaces an existing entry,
// insert_or_assign does; keys compare as unsigned bytes), except that any
// insert or erase moves the entries after it, so iterators and references
// into a dictionary are good only until it next changes.
class Dictionary {
 public:
  using key_type = Key;
  using mapped_type = Value;
  using value_type = std::pair<Key, Value>;
  using size_type = size_t;
  using iterator = std::vector<value_type>::iterator;
  using const_iterator = std::vector<value_type>::const_iterator;

  Dictionary() = default;
  // Of two entries with the same key, the first is kept.
  Dictionary(std::initializer_list<value_type> entries)
      : Dictionary(entries.begin(), entries.end()) {}
  template <typename It>
  Dictionary(It first, It last);

  iterator begin() { return entries_.begin(); }
  iterator end() { return entries_.end(); }
  const_iterator begin() const { return entries_.begin(); }
  const_iterator end() const { return entries_.end(); }
  const_iterator cbegin() const { return entries_.begin(); }

  size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  // Room for `n` entries without moving the block again.
  void reserve(size_t n) { entries_.reserve(n); }
  // Gives back the room beyond the entries when that is more than a quarter
  // of them (a dictionary is made once and then kept).
  void shrink_to_fit() {
    if (entries_.capacity() - entries_.size() > entries_.size() / 4) entries_.shrink_to_fit();
  }

  // The first entry whose key is not below `key`.
  iterator find(std::string_view key) { return begin() + findIndex(key); }
  const_iterator find(std::string_view key) const { return begin() + findIndex(key); }
  bool contains(std::string_view key) const { return findIndex(key) != size(); }

  // The value under `key`, inserted absent when there is none.
  Value& operator[](std::string_view key) { return try_emplace(Key(key)).first->second; }

  // Inserts `key` with a value made of `args` unless `key` is present; the
  // entry under `key`, and whether it is new.
  template <typename... Args>
  std::pair<iterator, bool> try_emplace(Key key, Args&&... args) {
    size_t i = lowerIndex(key);
    if (i < size() && entries_[i].first == key) return {begin() + i, false};
    return {entries_.emplace(begin() + i, std::piecewise_construct,
                             std::forward_as_tuple(std::move(key)),
                             std::forward_as_tuple(std::forward<Args>(args)...)),
            true};
  }
  template <typename V>
  std::pair<iterator, bool> emplace(Key key, V&& value) {
    return try_emplace(std::move(key), std::forward<V>(value));
  }
  template <typename V>
  std::pair<iterator, bool> insert_or_assign(Key key, V&& value) {
    auto [it, inserted] = try_emplace(std::move(key), std::forward<V>(value));
    if (!inserted) it->second = std::forward<V>(value);
    return {it, inserted};
  }
  // As emplace; cheap when the key belongs just before `hint`, as when
  // entries come in ascending order with `hint` at the end.
  template <typename V>
  iterator emplace_hint(const_iterator hint, Key key, V&& value) {
    const size_t h = static_cast<size_t>(hint - cbegin());
    if ((h == size() || key < entries_[h].first) && (h == 0 || entries_[h - 1].first < key)) {
      return entries_.emplace(begin() + h, std::move(key), std::forward<V>(value));
    }
    return try_emplace(std::move(key), std::forward<V>(value)).first;
  }

  iterator erase(const_iterator it) { return entries_.erase(it); }
  size_t erase(std::string_view key) {
    size_t i = findIndex(key);
    if (i == size()) return 0;
    entries_.erase(begin() + i);
    return 1;
  }
  template <typename Pred>
  friend size_t erase_if(Dictionary& d, Pred pred) {
    return std::erase_if(d.entries_, pred);
  }

  bool operator==(const Dictionary& other) const { return entries_ == other.entries_; }

 private:
  friend class DictionaryBuilder;

  size_t lowerIndex(std::string_view key) const;
  size_t findIndex(std::string_view key) const;

  std::vector<value_type> entries_;
};

// Makes a dictionary of entries that come in any order, as a parser or a
// decoder meets them, in O(n log n) for any input: entries that come in
// ascending order (the usual case, and the only one of drd's own writers)
// are added at the end; from the first that is out of order on, a set of the
// keys seen finds duplicates, and the entries are sorted once at the end.
// Inserting each entry at its place instead would cost O(n^2) moves for a
// large dictionary in descending order.
class DictionaryBuilder {
 public:
  // Whether an entry with `key` was added.
  bool contains(std::string_view key) const;
  // Adds the entry unless one with `key` was added; false when one was (and
  // this one is dropped).
  bool add(Key key, Value value);
  size_t size() const { return entries_.size(); }
  void reserve(size_t n) { entries_.reserve(n); }
  // The dictionary of the entries added; the builder is left empty.
  Dictionary finish();

 private:
  std::vector<Dictionary::value_type> entries_;
  bool ascending_ = true;
  std::unordered_set<std::string_view> seen_;  // once not ascending: every key
};

template <typename It>
Dictionary::Dictionary(It first, It last) {
  DictionaryBuilder builder;
  for (; first != last; ++first) builder.add(first->first, first->second);
  *this = builder.finish();
}

}  // namespace dr
