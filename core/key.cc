#include "core/key.h"

#include <atomic>
#include <cstring>
#include <functional>
#include <stdexcept>

namespace dr {
namespace {

// The process's shared keys: an open-addressed table of twice as many slots
// as it may hold keys, so that a probe ends soon. A slot is claimed once with
// a compare-and-swap and never changes again, so readers need no lock. The
// texts are never freed: the table lives as long as the process.
constexpr size_t kSlots = 2 * Key::kMaxSharedKeys;
static_assert((kSlots & (kSlots - 1)) == 0, "the slot count is a power of two");

struct SharedText {
  uint32_t size;
  char text[];  // size bytes and a NUL
};

std::atomic<const SharedText*> gSlots[kSlots];
std::atomic<size_t> gShared{0};

const SharedText* NewSharedText(std::string_view text) {
  void* block = ::operator new(sizeof(SharedText) + text.size() + 1);
  auto* shared = static_cast<SharedText*>(block);
  shared->size = static_cast<uint32_t>(text.size());
  std::memcpy(shared->text, text.data(), text.size());
  shared->text[text.size()] = '\0';
  return shared;
}

bool Holds(const SharedText* shared, std::string_view text) {
  return shared->size == text.size() && std::memcmp(shared->text, text.data(), text.size()) == 0;
}

// The table's copy of `text`, added when missing and there is room; nothing
// when the table is full.
const SharedText* Share(std::string_view text) {
  size_t slot = std::hash<std::string_view>{}(text) & (kSlots - 1);
  const SharedText* fresh = nullptr;
  for (;;) {
    const SharedText* present = gSlots[slot].load(std::memory_order_acquire);
    if (present == nullptr) {
      // Reserve room first, so the table never holds more than its bound.
      if (!fresh) {
        if (gShared.fetch_add(1, std::memory_order_relaxed) >= Key::kMaxSharedKeys) {
          gShared.fetch_sub(1, std::memory_order_relaxed);
          return nullptr;
        }
        fresh = NewSharedText(text);
      }
      if (gSlots[slot].compare_exchange_strong(present, fresh, std::memory_order_acq_rel,
                                               std::memory_order_acquire)) {
        return fresh;
      }
      // Another thread claimed the slot first; present is its text.
    }
    if (Holds(present, text)) {
      if (fresh) {
        ::operator delete(const_cast<SharedText*>(fresh));
        gShared.fetch_sub(1, std::memory_order_relaxed);
      }
      return present;
    }
    slot = (slot + 1) & (kSlots - 1);
  }
}

}  // namespace

Key::Key(std::string_view text) {
  if (text.empty()) return;
  if (text.size() > UINT32_MAX) throw std::length_error("dr::Key: text too long");
  size_ = static_cast<uint32_t>(text.size());
  if (text.size() <= kMaxSharedLength) {
    if (const SharedText* shared = Share(text)) {
      data_ = shared->text;
      return;
    }
  }
  char* own = new char[text.size()];
  std::memcpy(own, text.data(), text.size());
  data_ = own;
  owned_ = true;
}

Key::Key(const Key& other) : data_(other.data_), size_(other.size_), owned_(other.owned_) {
  if (owned_) {
    char* own = new char[size_];
    std::memcpy(own, other.data_, size_);
    data_ = own;
  }
}

Key::~Key() {
  if (owned_) delete[] data_;
}

}  // namespace dr
