// What the pdoc readers and writer share inside pdoc/: the error makers, the
// quoting of input in messages, the frame of an open element or container,
// and the two readers Parse chooses between. Not for use outside pdoc/.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "core/status.h"
#include "core/value.h"
#include "pdoc/pdoc.h"

namespace dr::pdoc::internal {

inline constexpr std::string_view kWhiteSpace = " \t\r\n";
inline constexpr size_t kMaxQuoted = 64;  // bytes of offending text quoted in messages

inline Error Malformed(std::string message) {
  return Error(kPdocErrorDomain, kMalformed, std::move(message));
}

inline Error Unwritable(std::string message) {
  return Error(kPdocErrorDomain, kUnwritable, std::move(message));
}

// `text` with every byte that is not part of well-formed UTF-8 replaced by
// '?', cut to about `limit` bytes at a character boundary. Messages quote
// input through this so that an error's text is always valid UTF-8.
std::string Quote(std::string_view text, size_t limit = kMaxQuoted);

// What an open element (XML) or container (JSON) is while it is read.
enum class Kind {
  kRoot,
  kDict,
  kArray,
  kKey,
  kString,
  kInteger,
  kReal,
  kTrue,
  kFalse,
  kDate,
  kData
};

// An open element or container, gathering what it holds until it closes.
struct Frame {
  Kind kind = Kind::kRoot;
  std::string name{};
  std::string text{};                // keys and scalars
  Array array{};                     // kArray
  DictionaryBuilder dict{};          // kDict
  std::optional<std::string> key{};  // kDict: a key waiting for its value
  Value value{};                     // kRoot: the document's value
};

// The XML form in `bytes`, which starts at its first '<'; `lineOffset` lines
// were skipped before it, so that messages name the line of the whole file.
Result<Value> ReadXml(std::string_view bytes, size_t lineOffset);

// The JSON form in `bytes`, which starts at its first '{' or '['.
Result<Value> ReadJson(std::string_view bytes);

}  // namespace dr::pdoc::internal
