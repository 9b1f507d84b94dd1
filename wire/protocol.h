// The names and numbers of drd's request and reply messages, written once
// here and shared by the daemon and the client library: message keys,
// request names, the protocol version, error codes, discovery flags and hold
// targets. Installed with the client library's headers (as drd/wire/), so it
// needs nothing but the standard library.
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

// The requests drd serves (the value of "request").
inline constexpr const char* kRequestAdd = "add";            // register bundles ("paths")
inline constexpr const char* kRequestRemove = "remove";      // unregister bundles ("paths")
inline constexpr const char* kRequestBulk = "bulk";          // accepted and ignored
inline constexpr const char* kRequestMatch = "match";        // discovery ("rules", "flags")
inline constexpr const char* kRequestReady = "ready";        // enable for the sender ("uuids")
inline constexpr const char* kRequestAccess = "access";      // read tokens ("uuids")
inline constexpr const char* kRequestAnnotate = "annotate";  // record the user's choices
inline constexpr const char* kRequestLock = "lock";          // place or release holds
inline constexpr const char* kRequestOpen = "open";          // open a read token ("token")

// The codes of "errorcode". drd's own errors carry one of these as their
// code, and a reply sends such an error with it.
inline constexpr int64_t kErrorRegistration = 2;    // the registry refused a bundle
inline constexpr int64_t kErrorMalformed = 4;       // bad request, unknown UUID, failed operation
inline constexpr int64_t kErrorVersion = 7;         // protocol version not served
inline constexpr int64_t kErrorBadPath = 9;         // relative, unresolvable, or no plug-in there
inline constexpr int64_t kErrorNotPermitted = 11;   // not permitted for this process
inline constexpr int64_t kErrorInvalidPlugIn = 12;  // a bundle that cannot make a plug-in
inline constexpr int64_t kErrorBusy = 14;           // plug-ins are busy (hold refused)

// The bits of a discovery's "flags"; other bits are ignored.
inline constexpr uint64_t kDiscoverAllVersions = 0x1;  // every version of an identifier
inline constexpr uint64_t kDiscoverDuplicates = 0x4;   // with kDiscoverAllVersions: equal ones too
inline constexpr uint64_t kDiscoverSystemOnly = 0x8;   // only plug-ins on the system volume
inline constexpr uint64_t kDiscoverHybrid = 0x100;     // include plug-ins with embedded code
inline constexpr uint64_t kDiscoverAll = 0x200;        // privileged: skip visibility and holds

// The "flags" of a hold ("lock" with "paths"): what each path names.
inline constexpr uint64_t kHoldApplication = 1;  // every plug-in inside the application
inline constexpr uint64_t kHoldPlugIn = 2;       // the one plug-in at the path

}  // namespace dr::message
