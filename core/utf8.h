// UTF-8 checks shared by drd's decoders (pdoc files, DRM1 frames).
// Stateless; safe from any thread.
#pragma once

#include <optional>
#include <string_view>

namespace dr {

// Decodes the UTF-8 sequence at text[i], advancing i past it; nothing (and i
// unchanged) when the bytes there are not well-formed UTF-8: overlong forms,
// surrogates and code points above U+10FFFF are refused.
// REQUIRES: i < text.size().
std::optional<char32_t> DecodeUtf8(std::string_view text, size_t& i);

// True when all of `text` is well-formed UTF-8.
bool IsValidUtf8(std::string_view text);

}  // namespace dr
