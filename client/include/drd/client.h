// A host's typed calls to drd: one method per request drd serves.
//
// What: a Client owns one Connection (connection.h) and turns each call into
// one request of protocol version 2, waits for its reply and answers the
// reply's contents as typed values. A reply that carries "errorcode" becomes
// an Error of kDaemonErrorDomain with drd's code and its "error" text; a
// reply that lacks what the request promises fails with kClientErrorDomain /
// kUnexpectedReply. Connection failures are the Connection's errors.
//
// Holds live as long as the connection that placed them: destroying the
// Client (or drd seeing its process end) releases every hold it placed.
//
// Threads: a Client may be used from any thread; its calls are serialized by
// its connection. Nothing here throws.
//
// Public types come from drd's core headers, installed beside this one:
// dr::Value (messages, rules, forms, settings), dr::Uuid, dr::Error,
// dr::Status and dr::Result<T>; the protocol's names and numbers come from
// drd/wire/protocol.h. The headers need C++20.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "connection.h"
#include "core/status.h"
#include "core/value.h"
#include "export.h"
#include "wire/protocol.h"

namespace dr::client {

// Errors that drd answered; the code is drd's "errorcode" (wire/protocol.h).
inline constexpr const char* kDaemonErrorDomain = "drd";
using message::kErrorBadPath;
using message::kErrorBusy;
using message::kErrorMalformed;
using message::kErrorNotPermitted;
using message::kErrorRegistration;
using message::kErrorVersion;

// A short name for one of drd's error codes ("bad path" for kErrorBadPath),
// for messages beside drd's own text; nullptr for a code drd does not use.
DRD_EXPORT const char* ErrorCodeName(int64_t code);

// kClientErrorDomain: a reply without the keys its request promises.
inline constexpr int64_t kUnexpectedReply = 4;

// Discovery flags of match(); other bits are ignored by drd.
using message::kDiscoverAll;
using message::kDiscoverAllVersions;
using message::kDiscoverDuplicates;
using message::kDiscoverHybrid;
using message::kDiscoverSystemOnly;

// Rule keys of match() that every plug-in answers.
inline constexpr const char* kRuleIdentifier = "UXExtensionIdentifier";
inline constexpr const char* kRuleExtensionPoint = "UXExtensionPointName";
inline constexpr const char* kRuleUuid = "com.corvel.uuid";

// The user's election of a plug-in, as stored in its annotation's
// "election": 1 elects (turns on); 0 (or none) leaves the choice open, so a
// plug-in entitled to it may be elected automatically; any other value
// (kElectionIgnore) turns it off for good.
inline constexpr int64_t kElectionUse = 1;
inline constexpr int64_t kElectionDefault = 0;
inline constexpr int64_t kElectionIgnore = -1;

enum class Election { kDefault, kElected, kIgnored };

// One plug-in as discovery returns it: the fields hosts use most, and the
// whole form drd sent.
struct DRD_EXPORT PlugIn {
  std::string identifier;
  std::string version;
  std::string path;  // the bundle folder
  Uuid uuid;
  std::optional<std::string> containingPath;  // the application it lies in
  std::optional<std::string> displayName;
  bool systemResident = false;  // lies on the system volume
  int64_t registered = 0;       // registration time, seconds since 1970 (UTC)
  Value annotations;            // the user's annotation: "election", "extension"
  Value form;                   // the whole form, as sent

  // The plug-in of a form; nothing when "identifier", "path" or "uuid" is
  // missing or malformed.
  static std::optional<PlugIn> FromForm(const Value& form);

  // From annotations["election"]: elected when it equals 1, default when it
  // is absent, not a number, or 0, ignored otherwise.
  Election election() const;
  // annotations["extension"]: the settings dictionary (absent when none).
  const Value& settings() const { return annotations["extension"]; }
};

// What annotate() records; absent parts stay as stored.
struct AnnotationChange {
  std::optional<int64_t> election;  // e.g. kElectionUse
  Value settings;                   // a dictionary; replaces the stored one
};

// What hold() designates with each path.
enum class HoldTarget : uint64_t {
  kApplication = message::kHoldApplication,  // every plug-in inside the application at the path
  kPlugIn = message::kHoldPlugIn,  // the one plug-in bundle at the path (held even while it runs)
};

class DRD_EXPORT Client {
 public:
  // Connects as Connection::Open does.
  static Result<std::unique_ptr<Client>> Open(
      const std::string& serviceName = kDefaultServiceName,
      const std::string& socketDirectory = DefaultSocketDirectory());
  explicit Client(std::unique_ptr<Connection> connection);
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // The time each call waits for its reply (kDefaultTimeout at first).
  // REQUIRES: not called while another thread uses this client.
  void setTimeout(std::chrono::milliseconds timeout);

  // Registers / unregisters the plug-in bundles at `paths` (absolute). Stops
  // at the first failing path; the ones before it stay done.
  Status addPlugIns(const std::vector<std::string>& paths);
  Status removePlugIns(const std::vector<std::string>& paths);
  // Accepted and ignored by drd; kept for completeness.
  Status bulk(uint64_t flags);

  // The plug-ins that satisfy `rules` (a dictionary of rule key to pattern;
  // absent: all), as drd offers them to this process, in drd's order.
  Result<std::vector<PlugIn>> match(const Value& rules, uint64_t flags = 0);
  // Makes the plug-ins' services reachable from this process. Nothing is
  // done unless every plug-in may be used (held plug-ins may not).
  Status ready(const std::vector<Uuid>& plugIns);
  // One read token per plug-in, in order, each granting read access to the
  // plug-in's bundle (see consumeExtension, extension.h).
  Result<std::vector<std::string>> access(const std::vector<Uuid>& plugIns);
  // Records `change` for each plug-in. Nothing is sent to drd's store when
  // the change is empty.
  Status annotate(const std::vector<Uuid>& plugIns, const AnnotationChange& change);

  // Holds the plug-ins `paths` designate: discovery stops offering them and
  // ready refuses them until the hold is released or this client goes away.
  // Answers the hold's token. When drd refuses because plug-ins are busy
  // (kErrorBusy) and `conflicts` is given, it receives drd's description of
  // each busy plug-in.
  Result<Uuid> hold(HoldTarget target, const std::vector<std::string>& paths,
                    std::vector<Value>* conflicts = nullptr);
  // Releases the holds with these tokens; unknown tokens are passed over.
  Status release(const std::vector<Uuid>& tokens);

  // Sends `message` as it is (it must carry "request" and "version") and
  // answers drd's reply as it is, error replies included.
  Result<Value> send(const Value& message);

  Connection& connection() { return *connection_; }

 private:
  // Sends a request of `name` with `fields`; answers the reply as it is.
  Result<Value> exchange(std::string_view name, Dictionary fields);
  // exchange, with an error reply turned into its Error.
  Result<Value> call(std::string_view name, Dictionary fields);

  std::unique_ptr<Connection> connection_;
  std::chrono::milliseconds timeout_ = kDefaultTimeout;
};

// The Error a reply carries when it carries "errorcode", else OK.
DRD_EXPORT Status ReplyStatus(const Value& reply);

}  // namespace dr::client
