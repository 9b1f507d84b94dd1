// Read tokens: the text drd hands a host to grant it reading a path.
//
// A token names a path and an extension class and is signed with the user's
// secret key (grammar in token.cc). drd issues tokens and, for a sandboxed
// host, opens them ("open" request); an unsandboxed host may check one itself
// against the key (consumeExtension). Both sides check a token here.
//
// The key is 32 random bytes in a file of its own (mode 0600, in a folder of
// mode 0700 owned by the user), made at first use; a key file that is not a
// regular file of the user's, closed to others and exactly 32 bytes long is
// refused, never trusted. Stateless functions and an immutable Signer; any
// thread.
#pragma once

#include <sodium.h>

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "core/status.h"

namespace dr {

// The class of tokens that grant reading a file or folder.
inline constexpr std::string_view kReadOnlyFileExtensionClass = "file.read-only";

// Errors of a refused token (kSandboxErrorDomain).
inline constexpr const char* kSandboxErrorDomain = "sandbox";
inline constexpr int64_t kExtensionMalformed = 1;   // not a token, or cut short
inline constexpr int64_t kExtensionForged = 2;      // the signature does not match
inline constexpr int64_t kExtensionWrongClass = 3;  // signed, but not a read-only token

namespace token {

inline constexpr size_t kKeyBytes = 32;
using Key = std::array<uint8_t, kKeyBytes>;

// Whether `cls` may name an extension class: 1 to 64 of A-Z a-z 0-9 . - _
bool ValidClass(std::string_view cls);

// The key file at `path`, checked. ENOENT when there is none.
Result<Key> ReadKey(const std::string& path);
// The key file at `path`, made (with its folder) when missing. With `seed`,
// a new file holds those bytes instead of random ones. Several processes may
// make it at once: all of them end up with the same key.
Result<Key> MakeKey(const std::string& path, const std::optional<Key>& seed = std::nullopt);

// Signs tokens with one key.
class Signer {
 public:
  explicit Signer(const Key& key);
  ~Signer();
  Signer(const Signer&) = delete;
  Signer& operator=(const Signer&) = delete;

  // The token of `cls` for `path`. REQUIRES: ValidClass(cls), `path` absolute
  // and without NUL.
  std::string issue(std::string_view cls, std::string_view path) const;

 private:
  // The HMAC state keyed with the key: hashing the key's pads once, not for
  // every token.
  crypto_auth_hmacsha256_state keyed_;
};

// The path a read-only token grants, when `token` was signed with `key`.
// Refuses (kSandboxErrorDomain) anything else: malformed, truncated, altered
// or forged tokens, and tokens of another class.
Result<std::string> Verify(std::string_view token, const Key& key);

}  // namespace token
}  // namespace dr
