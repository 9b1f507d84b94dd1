// Reading a plug-in bundle for registration, and the path rules of the
// registry. Internal to the registry (registry_*.cc); stateless, safe from any
// thread. A bundle that cannot be registered answers kRegistryRefused with a
// text naming the bundle and the reason.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/status.h"
#include "platform/file_system.h"
#include "registry/parsed_copy.h"
#include "registry/registry.h"

namespace dr::registry_internal {

// One plug-in of a scanned bundle.
struct ScannedPlugIn {
  std::string identifier;
  bool multiple = false;  // one of the top dictionary's "Multiple" plug-ins
};

// Everything registration needs from a bundle, read once.
struct ScannedBundle {
  std::string path;  // canonical
  std::string infoBytes;
  std::optional<std::string> entitlementsBytes;
  std::string contentHash;  // of both files; equal hashes mean unchanged files
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> bundleVersion;
  std::optional<std::string> displayName;
  std::optional<std::string> shortName;
  bool onSystemVolume = false;
  std::optional<RegistryApplication> containingApplication;
  std::vector<ScannedPlugIn> plugIns;  // never empty; ascending identifiers
  // The files' dictionaries when known: parsed at registration, or decoded
  // from the database's parsed copy (the bytes are then not loaded).
  std::optional<ParsedFiles> parsed;
  // The parsed copy to store beside the bytes; nothing stores none.
  std::optional<std::string> parsedCopy;
};

// Reads and checks the bundle at `url` (an absolute path).
Result<ScannedBundle> ScanBundle(const std::string& url,
                                 const std::vector<std::string>& systemRoots, FileSystem* fs);

// The content hash of a bundle's stored files (BLAKE2b, `bytes` long), each
// length-prefixed; `more`, when given, is hashed after them (a parsed copy's
// checksum covers the files and the copy).
std::string HashFiles(std::string_view info, std::optional<std::string_view> entitlements,
                      std::optional<std::string_view> more = std::nullopt, size_t bytes = 32);

// `path` made absolute-normal without touching the disk: "." and empty
// components dropped, ".." taken back, no trailing slash. Empty for a
// relative path.
std::string LexicalPath(std::string_view path);
// The path with symbolic links resolved; nothing when it does not exist.
std::optional<std::string> CanonicalPath(const std::string& path);
// Whether `path` is `root` or lies below it (both lexically normal).
bool LiesUnder(std::string_view path, std::string_view root);

// The plug-in dictionary of a plug-in, from its bundle's information
// dictionary: the top dictionary, or its "Multiple" entry for `identifier`.
Value PlugInDictionaryOf(const Value& info, const std::string& identifier, bool multiple);

}  // namespace dr::registry_internal
