// Consuming the read tokens drd hands out (Client::access, and the
// "extensions" of a discovered plug-in's form).
//
// A token names one path and is signed with the user's secret key, which
// drd keeps in the user's state folder
// ($XDG_STATE_HOME/com.corvel.dromon/sandbox.key). A host that can read the
// key and the path consumes a token (consumeExtension): the key checks it,
// and the answer is the canonical path it grants read access to. Stateless
// apart from reading the key file; any thread.
#pragma once

#include <chrono>
#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "connection.h"
#include "core/status.h"
#include "export.h"

namespace dr::client {

// Errors of consumeExtension for refused tokens.
inline constexpr const char* kExtensionErrorDomain = "sandbox";
inline constexpr int64_t kExtensionMalformed = 1;   // not a token, or cut short
inline constexpr int64_t kExtensionForged = 2;      // the signature does not match
inline constexpr int64_t kExtensionWrongClass = 3;  // a token, but not one for reading files

// Where drd keeps the key: $XDG_STATE_HOME/com.corvel.dromon/sandbox.key
// (XDG_STATE_HOME defaulting to ~/.local/state).
DRD_EXPORT std::string DefaultSandboxKeyPath();

// The path `token` grants, checked against the key file at `keyPath`.
// Refuses malformed, altered and forged tokens, tokens of another class, and
// every token while no key exists; never crashes on any input.
DRD_EXPORT Result<std::string> consumeExtension(
    std::string_view token, const std::string& keyPath = DefaultSandboxKeyPath());

// A file or folder that drd opened for this process from a token: the way a
// sandboxed host, which cannot reach the path itself, reads a plug-in. Owns
// the descriptor and closes it. Movable, not copyable; its members may be
// called from any thread.
class DRD_EXPORT OpenedExtension {
 public:
  OpenedExtension(int descriptor, std::string path);
  ~OpenedExtension();
  OpenedExtension(OpenedExtension&& other) noexcept;
  OpenedExtension& operator=(OpenedExtension&& other) noexcept;
  OpenedExtension(const OpenedExtension&) = delete;
  OpenedExtension& operator=(const OpenedExtension&) = delete;

  // The descriptor, read-only (a folder's for openat()); owned by this object.
  int descriptor() const { return fd_; }
  // The path the token grants, as drd opened it.
  const std::string& path() const { return path_; }

  // The contents of the regular file at `relative` inside the opened folder
  // ("" for the opened file itself), refused when larger than `maxBytes`.
  // Nothing outside the folder is reached: no "..", no absolute path, no
  // symbolic link (ELOOP, EXDEV).
  Result<std::string> readFile(const std::string& relative = "",
                               size_t maxBytes = size_t{16} << 20) const;
  // The names in the folder at `relative` inside the opened folder ("" for
  // itself), sorted, without "." and "..".
  Result<std::vector<std::string>> listFolder(const std::string& relative = "") const;

 private:
  int fd_ = -1;
  std::string path_;
};

// Hands `token` to drd ("open") and answers what it opened. Errors: drd's
// (kDaemonErrorDomain in client.h: 11 for a token drd did not issue, 9 for a
// path it cannot open) and the connection's.
DRD_EXPORT Result<OpenedExtension> openExtension(
    Connection& connection, std::string_view token,
    std::chrono::milliseconds timeout = kDefaultTimeout);

}  // namespace dr::client
