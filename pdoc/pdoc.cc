// Parse: tells the two forms of a pdoc document apart and hands the bytes
// to the reader of that form (pdoc/xml.cc, pdoc/json.cc); and what both
// readers and the writer share.
#include "pdoc/pdoc.h"

#include <algorithm>
#include <string>
#include <string_view>

#include "core/utf8.h"
#include "pdoc/internal.h"

namespace dr::pdoc {
namespace internal {

std::string Quote(std::string_view text, size_t limit) {
  std::string out;
  size_t i = 0;
  while (i < text.size()) {
    if (out.size() >= limit) {
      out += "...";
      break;
    }
    size_t start = i;
    if (DecodeUtf8(text, i)) {
      out.append(text.substr(start, i - start));
    } else {
      out += '?';
      i = start + 1;
    }
  }
  return out;
}

}  // namespace internal

using internal::kWhiteSpace;
using internal::Malformed;
using internal::Quote;

Result<Value> Parse(std::string_view bytes) {
  // Some editors start UTF-8 files with a byte-order mark; it carries nothing.
  if (bytes.starts_with("\xEF\xBB\xBF")) bytes.remove_prefix(3);
  size_t start = bytes.find_first_not_of(kWhiteSpace);
  if (start == std::string_view::npos) return Malformed("the document is empty");
  std::string_view skipped = bytes.substr(0, start);
  bytes.remove_prefix(start);
  switch (bytes[0]) {
    case '<': {
      size_t lines = static_cast<size_t>(std::count(skipped.begin(), skipped.end(), '\n'));
      return internal::ReadXml(bytes, lines);
    }
    case '{':
    case '[':
      return internal::ReadJson(bytes);
    default:
      return Malformed("the document is neither XML nor JSON (it starts with \"" +
                       Quote(bytes.substr(0, 8), 8) + "\")");
  }
}

}  // namespace dr::pdoc
