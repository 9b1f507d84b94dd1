// UTF-8 checks shared by drd's decoders (pdoc files, DRM1 frames).
// Stateless; safe from any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace dr {

// Decodes the UTF-8 sequence at text[i], advancing i past it; nothing (and i
// unchanged) when the bytes there are not well-formed UTF-8: overlong forms,
// surrogates and code points above U+10FFFF are refused.
// REQUIRES: i < text.size().
std::optional<char32_t> DecodeUtf8(std::string_view text, size_t& i);

// True when all of `text` is well-formed UTF-8.
bool IsValidUtf8(std::string_view text);

// Appends `text` to `out` with every byte that is not part of well-formed
// UTF-8 written as "\xNN" (two upper-case hex digits), so that a path of any
// bytes can stand in a log line or a message. Well-formed text is appended
// unchanged.
void AppendEscapingInvalidUtf8(std::string& out, std::string_view text);
// `text` escaped as AppendEscapingInvalidUtf8 does.
std::string EscapeInvalidUtf8(std::string_view text);

}  // namespace dr
