// The keys of drd's request and reply messages, shared by the daemon and the
// client library so that both spell them once.
#pragma once

#include <cstdint>

namespace dr::message {

inline constexpr const char* kRequestKey = "request";          // the request name
inline constexpr const char* kVersionKey = "version";          // the protocol version
inline constexpr const char* kPathsKey = "paths";              // absolute bundle paths
inline constexpr const char* kUuidsKey = "uuids";              // plug-in UUIDs or hold tokens
inline constexpr const char* kFlagsKey = "flags";              // request options
inline constexpr const char* kRulesKey = "rules";              // a discovery's rules
inline constexpr const char* kAnnotationsKey = "annotations";  // changes to record
inline constexpr const char* kMatchesKey = "matches";          // the forms found
inline constexpr const char* kExtensionsKey = "extensions";    // read tokens
inline constexpr const char* kConflictsKey = "conflicts";      // busy plug-ins
inline constexpr const char* kTokenKey = "token";              // a read token to open
inline constexpr const char* kPathKey = "path";                // the path an opened token grants
inline constexpr const char* kErrorCodeKey = "errorcode";      // an error reply's code
inline constexpr const char* kErrorKey = "error";              // an error reply's message
// Entries of "annotations".
inline constexpr const char* kElectionKey = "election";
inline constexpr const char* kExtensionKey = "extension";

// The one protocol version drd serves.
inline constexpr uint64_t kProtocolVersion = 2;

}  // namespace dr::message
