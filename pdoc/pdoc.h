// pdoc: drd's structured-data files (information dictionaries, SDK
// dictionaries, preferences, policy, the annotation file).
//
// A pdoc file holds one value. Two forms are read, told apart by the first
// byte that is not white space: '<' is the XML form, '{' or '[' the JSON form.
// Only the XML form is written:
//
//   <?xml version="1.0" encoding="UTF-8"?>
//   <pdoc version="1.0">
//     <dict>
//       <key>count</key>
//       <integer>-3</integer>
//       ...
//     </dict>
//   </pdoc>
//
// Elements: dict (alternating key and value elements, keys unique), array,
// string, integer (signed 64-bit; unsigned above INT64_MAX), real, true,
// false, date (ISO 8601, UTC), data (base64, white space ignored). In JSON,
// objects are dictionaries, numbers without fraction or exponent integers and
// other numbers reals; null is refused. UUIDs and absent values do not occur
// in pdoc files.
//
// Both parsers are libraries (expat, nlohmann-json) set up defensively: a
// document type declaration is ignored, entity declarations and references
// other than the five predefined entities and character references are
// refused, nothing is fetched from outside, nesting deeper than kMaxDepth is
// refused. Any input, however broken, answers a value or an error in
// kPdocErrorDomain naming what is wrong; never a crash.
//
// Stateless; safe to call from any thread.
#pragma once

#include <string>
#include <string_view>

#include "core/status.h"
#include "core/value.h"

namespace dr::pdoc {

inline constexpr int kMaxDepth = 256;

// Codes of kPdocErrorDomain.
inline constexpr int64_t kMalformed = 1;   // the bytes are not a pdoc document
inline constexpr int64_t kUnwritable = 2;  // the value cannot be written as pdoc

// Reads the one value in `bytes`.
Result<Value> Parse(std::string_view bytes);

// The XML form of `value`: indented by two spaces, dictionary keys ascending.
// Fails with kUnwritable for values pdoc cannot hold: absent, a UUID, text
// that is not UTF-8 or holds characters XML 1.0 cannot carry.
Result<std::string> WriteXml(const Value& value);

// The text of one entry, `key` with `value`, of a dictionary lying `depth`
// levels inside <pdoc> (the document's own value lies at depth 1), exactly as
// WriteXml writes that entry there. WriteXml's text of a non-empty dictionary
// holds its entries' texts one after another in ascending key order, so a
// caller that keeps each entry's text can rebuild a large document after a
// change by writing only the changed entry. Fails as WriteXml does (the
// message's path starts at `key`).
Result<std::string> WriteXmlEntry(std::string_view key, const Value& value, int depth);

}  // namespace dr::pdoc
