#include "core/utf8.h"

namespace dr {

std::optional<char32_t> DecodeUtf8(std::string_view text, size_t& i) {
  const auto byte = [&](size_t k) { return static_cast<unsigned char>(text[k]); };
  unsigned char b0 = byte(i);
  if (b0 < 0x80) {
    ++i;
    return b0;
  }
  size_t length;
  char32_t cp;
  char32_t min;
  if ((b0 & 0xE0) == 0xC0) {
    length = 2, cp = b0 & 0x1F, min = 0x80;
  } else if ((b0 & 0xF0) == 0xE0) {
    length = 3, cp = b0 & 0x0F, min = 0x800;
  } else if ((b0 & 0xF8) == 0xF0) {
    length = 4, cp = b0 & 0x07, min = 0x10000;
  } else {
    return std::nullopt;
  }
  if (text.size() - i < length) return std::nullopt;
  for (size_t k = 1; k < length; ++k) {
    if ((byte(i + k) & 0xC0) != 0x80) return std::nullopt;
    cp = (cp << 6) | (byte(i + k) & 0x3F);
  }
  if (cp < min || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return std::nullopt;
  i += length;
  return cp;
}

bool IsValidUtf8(std::string_view text) {
  size_t i = 0;
  while (i < text.size()) {
    if (!DecodeUtf8(text, i)) return false;
  }
  return true;
}

void AppendEscapingInvalidUtf8(std::string& out, std::string_view text) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  size_t valid = 0;  // start of the well-formed run not yet copied
  size_t i = 0;
  while (i < text.size()) {
    if (DecodeUtf8(text, i)) continue;
    out.append(text.substr(valid, i - valid));
    const auto byte = static_cast<unsigned char>(text[i++]);
    out += "\\x";
    out += kHex[byte >> 4];
    out += kHex[byte & 0xF];
    valid = i;
  }
  out.append(text.substr(valid));
}

std::string EscapeInvalidUtf8(std::string_view text) {
  if (IsValidUtf8(text)) return std::string(text);
  std::string out;
  out.reserve(text.size() + 16);
  AppendEscapingInvalidUtf8(out, text);
  return out;
}

}  // namespace dr
