// dr::Key, the key of a dictionary entry.
//
// A key is text like a std::string, but the same few dozen keys name the
// entries of every plug-in's dictionaries, every form and every message, so
// a key is kept once for the whole process and shared: making a key looks its
// text up in a process-wide table of keys and points at the copy there. The
// table only grows, so it is bounded: it takes keys of up to kMaxSharedLength
// bytes until it holds kMaxSharedKeys of them; a key it does not take (longer,
// or made once the table is full) owns a copy of its own text. Either way a
// key behaves the same; only its cost differs.
//
// Moving a key leaves its text where it is: the new key's view() names the
// same bytes, so a view taken before the move stays good. Keys are immutable;
// any number of threads may make, copy and read them.
#pragma once

#include <compare>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace dr {

class Key {
 public:
  static constexpr size_t kMaxSharedLength = 64;
  static constexpr size_t kMaxSharedKeys = 4096;

  Key() = default;  // ""
  Key(std::string_view text);
  Key(const std::string& text) : Key(std::string_view(text)) {}
  Key(const char* text) : Key(std::string_view(text)) {}
  Key(const Key& other);
  Key(Key&& other) noexcept : data_(other.data_), size_(other.size_), owned_(other.owned_) {
    other.data_ = "";
    other.size_ = 0;
    other.owned_ = false;
  }
  Key& operator=(Key other) noexcept {
    swap(other);
    return *this;
  }
  ~Key();

  void swap(Key& other) noexcept {
    std::swap(data_, other.data_);
    std::swap(size_, other.size_);
    std::swap(owned_, other.owned_);
  }

  std::string_view view() const { return {data_, size_}; }
  operator std::string_view() const { return view(); }
  std::string str() const { return std::string(view()); }
  const char* data() const { return data_; }
  size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }

  // Whether this key shares the process's copy of its text (for tests).
  bool isShared() const { return !owned_ && size_ > 0; }

  // Keys compare as their text does, byte by byte as unsigned char.
  friend bool operator==(const Key& a, const Key& b) {
    return (a.data_ == b.data_ && a.size_ == b.size_) || a.view() == b.view();
  }
  friend bool operator==(const Key& a, std::string_view b) { return a.view() == b; }
  friend bool operator==(const Key& a, const std::string& b) { return a.view() == b; }
  friend bool operator==(const Key& a, const char* b) { return a.view() == b; }
  friend std::strong_ordering operator<=>(const Key& a, const Key& b) {
    return a.view() <=> b.view();
  }
  friend std::strong_ordering operator<=>(const Key& a, std::string_view b) {
    return a.view() <=> b;
  }
  friend std::strong_ordering operator<=>(const Key& a, const std::string& b) {
    return a.view() <=> std::string_view(b);
  }
  friend std::strong_ordering operator<=>(const Key& a, const char* b) {
    return a.view() <=> std::string_view(b);
  }

 private:
  const char* data_ = "";
  uint32_t size_ = 0;
  bool owned_ = false;  // data_ is this key's own copy, else the table's
};

}  // namespace dr
