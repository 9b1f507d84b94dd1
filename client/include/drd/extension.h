// Consuming the read tokens drd hands out (Client::access, and the
// "extensions" of a discovered plug-in's form).
//
// A token names one path and is signed with the user's secret key, which
// lives in drd's socket folder as "sandbox.key". Consuming a token checks it
// against that key and answers the canonical path it grants read access to.
// Stateless apart from reading the key file; any thread.
#pragma once

#include <string>
#include <string_view>

#include "connection.h"
#include "core/status.h"
#include "export.h"

namespace dr::client {

// Errors of consumeExtension for refused tokens.
inline constexpr const char* kExtensionErrorDomain = "sandbox";
inline constexpr int64_t kExtensionMalformed = 1;   // not a token, or cut short
inline constexpr int64_t kExtensionForged = 2;      // the signature does not match
inline constexpr int64_t kExtensionWrongClass = 3;  // a token, but not one for reading files

// The path `token` grants, checked against the key in `socketDirectory`.
// Refuses malformed, altered and forged tokens, tokens of another class, and
// every token while no key exists; never crashes on any input.
DRD_EXPORT Result<std::string> consumeExtension(
    std::string_view token, const std::string& socketDirectory = DefaultSocketDirectory());

}  // namespace dr::client
