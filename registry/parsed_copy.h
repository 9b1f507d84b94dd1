// The parsed copy of a bundle's files that the registry database keeps beside
// their bytes, so that opening the registry decodes binary values instead of
// parsing every bundle's XML again. Internal to the registry (registry_*.cc);
// stateless, safe from any thread.
//
// A copy is "DRP1" | a 16-byte BLAKE2b checksum | the message codec's
// (drm1) encoding of {"entitlements": ..., "info": ...}. The checksum covers
// the files' bytes and the encoding, which ties the copy to the very bytes it
// was made from: a copy that is damaged, of another format, or made from
// other bytes is refused, and the caller parses the bytes instead. A change
// of what parsing yields needs a new magic.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "core/value.h"

namespace dr::registry_internal {

// What a bundle's stored files read as: the information dictionary (absent
// when the bytes do not read as a dictionary) and the entitlements (an empty
// dictionary when there are none or they do not read as a dictionary).
struct ParsedFiles {
  Value info;
  Value entitlements;
};

// Parses the stored bytes of a bundle's files.
ParsedFiles ParseFiles(std::string_view infoBytes, std::optional<std::string_view> entitlements);

// The parsed copy of `parsed`, made from the bytes given; nothing when the
// values cannot be encoded or would not decode to themselves (the database
// then keeps no copy and the bytes are parsed at each open).
std::optional<std::string> EncodeParsedCopy(const ParsedFiles& parsed, std::string_view infoBytes,
                                            std::optional<std::string_view> entitlements);

// The values in `copy`, or nothing when it is not a sound copy made from
// exactly these bytes.
std::optional<ParsedFiles> DecodeParsedCopy(std::string_view copy, std::string_view infoBytes,
                                            std::optional<std::string_view> entitlements);

// DecodeParsedCopy in two steps, so that the cheap check can run where the
// bytes are and the decoding elsewhere (another thread, after the bytes are
// gone): the encoded values of `copy` when it is a copy of this format made
// from exactly these bytes (a view into `copy`), else nothing; then their
// decoding, nothing when they are not sound.
std::optional<std::string_view> CheckedParsedValues(std::string_view copy,
                                                    std::string_view infoBytes,
                                                    std::optional<std::string_view> entitlements);
std::optional<ParsedFiles> DecodeParsedValues(std::string_view values);

}  // namespace dr::registry_internal
