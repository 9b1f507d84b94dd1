#include "daemon/transaction.h"

#include <stdlib.h>

#include <cstring>

#include <cerrno>
#include <set>

#include "core/format.h"
#include "core/log.h"
#include "core/utf8.h"
#include "daemon/ipc_client.h"
#include "daemon/server.h"
#include "pdoc/pdoc.h"
#include "platform/file_system.h"
#include "platform/probes.h"
#include "plugin/discovery.h"
#include "plugin/plugin_keys.h"
#include "store/extension_issuing.h"
#include "wire/protocol.h"

namespace dr {
namespace {

using namespace message;

constexpr const char* kUnrecognizedRequest = "unrecognized request";
constexpr const char* kOnHoldReason = "the plug-in is on hold";

// The "flags" of a hold request: what each path names.
constexpr uint64_t kHoldApplication = 1;  // every plug-in inside the application
constexpr uint64_t kHoldPlugIn = 2;       // the one plug-in at the path

// Paths are resolved into a buffer of this size; longer ones do not resolve.
constexpr size_t kMaxResolvedPath = 1024;

// The requests drd serves, looked up in this order by exact name.
struct RequestKind {
  const char* name;
  void (Transaction::*handler)();
};
constexpr RequestKind kRequests[] = {
    {"add", &Transaction::addPlugIns},           {"remove", &Transaction::removePlugIns},
    {"bulk", &Transaction::bulkPlugIns},         {"match", &Transaction::matchPlugIns},
    {"ready", &Transaction::readyPlugIns},       {"access", &Transaction::accessPlugIns},
    {"annotate", &Transaction::annotatePlugIns}, {"lock", &Transaction::lockDownPlugIns},
    {"open", &Transaction::openExtension},
};

std::optional<std::string> ResolvedPath(const std::string& path) {
  Result<std::string> resolved = CanonicalPath(path);
  if (!resolved.ok() || resolved->size() >= kMaxResolvedPath) return std::nullopt;
  return std::move(resolved).value();
}

// A number as a message carries one: an integer or a floating-point value
// (a boolean is not one).
bool IsMessageNumber(const Value& value) {
  return value.type() == Value::Type::kInt || value.type() == Value::Type::kUInt ||
         value.type() == Value::Type::kDouble;
}

// One entry of "conflicts": the running instance that makes a plug-in busy.
Value BusyDescription(const BusyInstance& instance) {
  return Value(Dictionary{
      {"pid", Value(static_cast<int64_t>(instance.pid))},
      {"path", Value(instance.bundlePath)},
      {"identifier", Value(instance.bundleIdentifier)},
      {"version", Value(instance.version)},
  });
}

}  // namespace

std::shared_ptr<Transaction> Transaction::initWithRequestForClient(
    PeerMessage request, std::shared_ptr<DRDIpcClient> client) {
  return std::shared_ptr<Transaction>(new Transaction(std::move(request), std::move(client)));
}

Transaction::Transaction(PeerMessage request, std::shared_ptr<DRDIpcClient> client)
    : client_(std::move(client)), request_(std::move(request)), reply_(Value::EmptyDictionary()) {}

DRDServer& Transaction::server() const { return client_->server(); }

std::shared_ptr<PeerConnection> Transaction::connection() const { return client_->connection(); }

void Transaction::setReplyValue(std::string_view key, const Value& value) {
  reply_ = reply_.changing(key, value);
}

Value Transaction::ArrayValue(const Value& message, std::string_view key) {
  const Value& value = message[key];
  return value.isArray() ? value : Value();
}

Value Transaction::DictionaryValue(const Value& message, std::string_view key) {
  const Value& value = message[key];
  return value.isDictionary() ? value : Value();
}

void Transaction::dispatch() {
  const Value& name = request()[kRequestKey];
  const Value& version = request()[kVersionKey];
  const uint64_t received = version.type() == Value::Type::kUInt ? version.uintValue() : 0;
  if (received != kProtocolVersion) {
    failMessage(kErrorVersion,
                Format("unsupported protocol version %d (need %d)", static_cast<int32_t>(received),
                       static_cast<int>(kProtocolVersion)));
    return;
  }
  if (!client_->acceptWork()) return;
  const char* requestName = name.isString() ? name.stringValue().c_str() : nullptr;
  server().debug("client %d request %s", client_->pid(), requestName);
  probes::Request(client_->pid(), requestName);
  if (!requestName) {
    failMessage(kErrorMalformed, "invalid request format (missing type)");
    return;
  }
  for (const RequestKind& kind : kRequests) {
    if (name.stringValue() == kind.name) {
      (this->*kind.handler)();
      return;
    }
  }
  failMessage(kErrorMalformed, kUnrecognizedRequest);
}

bool Transaction::marshalPaths(const PathOperation& operation) {
  Value paths = ArrayValue(request(), kPathsKey);
  if (paths.isAbsent()) {
    failMessage(kErrorMalformed, "invalid request format");
    return false;
  }
  for (const Value& element : paths.array()) {
    if (!element.isString()) {
      failMessage(kErrorMalformed, "invalid request format");
      return false;
    }
    const std::string& path = element.stringValue();
    if (path.empty() || path[0] != '/') {
      failMessage(kErrorBadPath, Format("absolute path required: %s", path));
      return false;
    }
    std::optional<std::string> canonical = ResolvedPath(path);
    if (!operation(canonical ? *canonical : path, canonical.has_value())) return false;
  }
  return true;
}

bool Transaction::processPaths(const PathOperation& operation) {
  bool ok = marshalPaths(operation);
  if (ok) done();
  return ok;
}

bool Transaction::processUuidList(const PlugInOperation& operation) {
  Value uuids = ArrayValue(request(), kUuidsKey);
  if (uuids.isAbsent()) {
    failMessage(kErrorMalformed, "invalid request format (uuid)");
    return false;
  }
  for (const Value& element : uuids.array()) {
    if (!element.isUuid()) {
      failMessage(kErrorMalformed, "invalid request (bad uuid array)");
      return false;
    }
    std::optional<Uuid> uuid = element.uuid();
    if (!uuid) {
      failMessage(kErrorMalformed, "invalid request (uuid allocation failure)");
      return false;
    }
    DRDPlugInPtr plugIn = server().findPlugIn(*uuid);
    if (!plugIn) {
      failMessage(kErrorMalformed, "no such plugin (uuid not found)");
      return false;
    }
    if (!operation(plugIn)) return false;
  }
  return true;
}

void Transaction::done() {
  if (replied_) {
    server().log("second reply to request %llu of client %d dropped", request_.serial,
                 client_->pid());
    return;
  }
  replied_ = true;
  if (server().verbose() >= 2) server().debug("Replying %@", reply_);
  if (probes::RequestOutputEnabled()) {
    probes::RequestOutput(client_->pid(), reply_.description().c_str());
  }
  if (!request_.wantsReply) return;
  std::shared_ptr<PeerConnection> c = connection();
  if (!c) return;
  Status sent = c->sendReply(request_.serial, reply_, std::move(descriptors_));
  if (!sent.ok() && c->isOpen()) {
    server().log("unable to reply to client %d: %@", client_->pid(), sent);
    // A reply the wire cannot carry (nested too deeply or too large, say
    // from a plug-in's own dictionaries) still answers the request.
    c->sendReply(
        request_.serial,
        Value{{kErrorCodeKey, Value(kErrorMalformed)},
              {kErrorKey, Value(EscapeInvalidUtf8(Format("reply cannot be sent: %@", sent)))}});
  }
}

void Transaction::failMessage(uint64_t code, std::string_view message) {
  setReplyValue(kErrorCodeKey, Value(code));
  // A path in the text may hold any bytes; the reply must be UTF-8.
  setReplyValue(kErrorKey, Value(EscapeInvalidUtf8(message)));
  done();
}

void Transaction::failError(uint64_t code, const Error& error) {
  if (error.domain() == DRErrorDomain) {
    failMessage(static_cast<uint64_t>(error.code()), error.ownDescription().value_or(""));
  } else {
    failMessage(code, error.localizedDescription());
  }
}

// ---- Registration -------------------------------------------------------

void Transaction::addPlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    if (!resolved) {
      failMessage(kErrorBadPath, Format("invalid plugin path: %@", path));
      return false;
    }
    probes::PluginAdd(path.c_str());
    if (server().addPlugIn(path)) {
      SystemLog("failed to register plug-in at %@", path);
      failMessage(kErrorRegistration, Format("unable to register plug-in at %@", path));
      return false;
    }
    return true;
  });
}

void Transaction::removePlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    probes::PluginRemove(path.c_str(), resolved);
    // A bundle deleted from disk is unregistered under the path as sent.
    if (server().removePlugIn(path)) {
      failMessage(kErrorBadPath, Format("no plugin at %@", path));
      return false;
    }
    return true;
  });
}

void Transaction::bulkPlugIns() {
  SystemLog("bulk options 0x%lx not supported", request()[kFlagsKey].uintValue());
  done();
}

void Transaction::readyPlugIns() {
  std::vector<DRDPlugInPtr> toEnable;  // each plug-in once, in request order
  std::set<Uuid> seen;
  const pid_t pid = client_->pid();
  bool checked = processUuidList([&](const DRDPlugInPtr& p) {
    const std::string uuid = p->uuid() ? p->uuid()->string() : std::string();
    probes::PluginReady(uuid.c_str());
    if (server().holdOnPlugIn(*p)) {
      server().debug("denied access to pid %d for plugin %@(%@): %@", pid, p->identifier(), uuid,
                     kOnHoldReason);
      // A held plug-in is refused like any plug-in the host may not use.
      failMessage(kErrorNotPermitted,
                  Format("access to plugin %@ denied: %@", p->identifier(), kOnHoldReason));
      return false;
    }
    if (p->isData()) return true;  // nothing to enable
    if (std::optional<std::string> reason = p->allowForClient(*client_)) {
      server().debug("denied access to pid %d for plugin %@(%@): %@", pid, p->identifier(), uuid,
                     *reason);
      failMessage(kErrorNotPermitted,
                  Format("access to plugin %@ denied: %@", p->identifier(), *reason));
      return false;
    }
    if (!p->uuid() || seen.insert(*p->uuid()).second) toEnable.push_back(p);
    return true;
  });
  if (!checked) return;
  // Every plug-in passed the checks; enable them all, even after a failure.
  std::optional<Error> firstFailure;
  for (const DRDPlugInPtr& p : toEnable) {
    Status status = p->enableForPid(pid);
    if (!status.ok() && !firstFailure) firstFailure = status.error();
  }
  if (firstFailure) {
    failError(kErrorMalformed, *firstFailure);
  } else {
    done();
  }
}

// ---- Discovery ----------------------------------------------------------

void Transaction::matchPlugIns() {
  const Value& rules = request()[kRulesKey];
  if (rules.isPresent() && !rules.isDictionary()) {
    failMessage(kErrorMalformed, "invalid request format (bad rules dictionary)");
    return;
  }
  const Value& flagsValue = request()[kFlagsKey];
  const uint64_t flags = flagsValue.type() == Value::Type::kUInt ? flagsValue.uintValue() : 0;
  const pid_t pid = client_->pid();
  const PlugInServices& services = server().options().database.plugInServices;
  if (flags & DRDiscoverAll) {
    const bool sandboxed = !services.sandbox || services.sandbox->isSandboxed(pid);
    if (!client_->hasEntitlement(kManagerEntitlement) || sandboxed) {
      failMessage(kErrorNotPermitted, "unauthorized discovery flag (DRDiscoverAll)");
      return;
    }
  }

  DiscoveryHost host;
  host.client = client_.get();
  if (const std::shared_ptr<DRBundle>& bundle = client_->bundle()) {
    host.plugInsPath = bundle->plugInsPath();
    host.bundleIdentifier = bundle->bundleIdentifier().value_or("");
  }
  const bool needs17732150Workaround = client_->needs17732150Workaround();
  host.needs17732150Workaround = needs17732150Workaround;
  DRDServer& s = server();
  DiscoveryServices hooks;
  hooks.isHeld = [&s](const DRDPlugIn& p) { return s.holdOnPlugIn(p); };
  hooks.addAnnotation = [this](const DRDPlugIn& p, Dictionary& form) {
    addAnnotationForPlugInIn(p, form);
  };
  if (Policy* policy = s.options().policy) {
    // One judge per request: the host (its executable and Info file) and the
    // policy file are looked at once, not once per form.
    hooks.mayUse = [policy, pid, judge = Policy::PlugInJudge()](const Value& form) mutable {
      if (!judge) judge = policy->judgeForProcess(pid);
      return judge(form[kFormIdentifierKey].stringValue());
    };
  }
  hooks.log = [&s](const std::string& line) { s.log("%@", line); };
  hooks.debug = [&s](const std::string& line) { s.debug("%@", line); };
  Discovery discovery(std::move(host), rules, flags, s.userPrefs().exclusions(), std::move(hooks));

  const std::shared_ptr<const PlugInSet> candidates = s.installedPlugIns();
  probes::DiscoverRaw(static_cast<uint32_t>(candidates->size()));
  const std::vector<DRDPlugInPtr>& records = candidates->records();
  // Only the candidates whose examination can tell are examined: the rest
  // would be skipped without a trace.
  if (std::optional<std::vector<uint32_t>> chosen =
          CandidatesToExamine(*candidates, rules, flags, needs17732150Workaround)) {
    for (uint32_t position : *chosen) discovery.examine(records[position]);
  } else {
    for (const DRDPlugInPtr& candidate : records) discovery.examine(candidate);
  }
  setReplyValue(kMatchesKey, discovery.finish());
  done();
}

// ---- Access -------------------------------------------------------------

void Transaction::accessPlugIns() {
  Array tokens;
  Sandbox* sandbox = server().options().database.plugInServices.sandbox;
  bool walked = processUuidList([&](const DRDPlugInPtr& p) {
    const std::string path = p->path().value_or("");
    // The bundle as registered: a folder swapped for a link since then is
    // refused (EACCES), not followed to wherever the link points.
    std::optional<std::string> token = issueReadExtensionForURL(sandbox, path, path);
    if (!token) {
      failMessage(kErrorMalformed, Format("cannot create extension to %@: %d", path, errno));
      return false;
    }
    tokens.emplace_back(std::move(*token));
    return true;
  });
  if (!walked) return;
  setReplyValue(kExtensionsKey, Value(std::move(tokens)));
  done();
}

// ---- Annotations --------------------------------------------------------

void Transaction::annotatePlugIns() {
  const Value annotations = DictionaryValue(request(), kAnnotationsKey);
  if (annotations.isAbsent()) {
    failMessage(kErrorMalformed, "invalid request format (bad annotations dictionary)");
    return;
  }
  Dictionary changes;
  // Values the annotation file cannot hold (a UUID, say) are refused here:
  // kept in memory they would make every later save of the file fail.
  if (const Value& election = annotations[kElectionKey]; election.isPresent()) {
    if (!IsMessageNumber(election) || !pdoc::WriteXml(election)) {
      failMessage(kErrorMalformed, "invalid request format (annotation election)");
      return;
    }
    changes[kElectionKey] = election;
  }
  if (const Value& extension = annotations[kExtensionKey]; extension.isPresent()) {
    // In a form the settings sit two levels below it (its "annotations",
    // then this): deeper ones would make every reply that carries the
    // plug-in's form impossible to send.
    if (!extension.isDictionary() || extension.depth() > kMaxFormDepth - 2 ||
        !pdoc::WriteXml(extension)) {
      failMessage(kErrorMalformed, "invalid request format (annotation extension)");
      return;
    }
    changes[kExtensionKey] = extension;
  }
  if (changes.empty()) {
    done();
    return;
  }
  const Value change(std::move(changes));
  if (processUuidList([&](const DRDPlugInPtr& p) {
        server().setAnnotationForPlugIn(change, *p);
        return true;
      })) {
    done();
  }
}

void Transaction::addAnnotationForPlugInIn(const DRDPlugIn& plugIn, Dictionary& form) {
  Value annotation = server().annotationForPlugIn(plugIn);
  form[kAnnotationsKey] =
      annotation.isDictionary() ? std::move(annotation) : DRPlugInCore::NoAnnotations();
}

// ---- Opening a token ------------------------------------------------------

// A sandboxed host cannot reach a plug-in's files by path: it hands drd the
// token and gets the granted file or folder back as a descriptor. Only the
// token's signature is checked: whatever the registry says now, the token
// grants what it names, and the path is opened without following any link,
// so a folder swapped for a link since is refused.
void Transaction::openExtension() {
  const Value& token = request()[kTokenKey];
  if (!token.isString()) {
    failMessage(kErrorMalformed, "invalid request format (token)");
    return;
  }
  Sandbox* sandbox = server().options().database.plugInServices.sandbox;
  Result<std::string> path = sandbox ? sandbox->grantedPath(token.stringValue())
                                     : Result<std::string>(PosixError(ENOKEY, "no sandbox"));
  if (!path.ok()) {
    server().log("client %d: token refused: %@", client_->pid(),
                 path.error().localizedDescription());
    failMessage(kErrorNotPermitted, "token refused");
    return;
  }
  Result<UniqueFd> fd = OpenForReading(*path);
  if (!fd.ok()) {
    const int64_t code = fd.error().domain() == kPosixErrorDomain ? fd.error().code() : EIO;
    failMessage(kErrorBadPath, Format("cannot open %@: %d", *path, static_cast<int>(code)));
    return;
  }
  setReplyValue(kPathKey, Value(*path));
  descriptors_.push_back(std::move(*fd));
  done();
}

// ---- Holds --------------------------------------------------------------

void Transaction::lockDownPlugIns() {
  const Value tokens = ArrayValue(request(), kUuidsKey);
  if (tokens.isPresent()) {
    for (const Value& token : tokens.array()) {
      if (std::optional<Uuid> uuid = token.uuid()) server().unholdToken(*uuid);
    }
    done();
    return;
  }
  const uint64_t flags = request()[kFlagsKey].uintValue();
  std::vector<DRDPlugInPtr> plugIns;
  bool walked = marshalPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      failMessage(kErrorBadPath, Format("invalid path: %@", path));
      return false;
    }
    if (flags == kHoldPlugIn) {
      DRDPlugInPtr p = server().findPlugInAtPath(path);
      if (!p) {
        failMessage(kErrorBadPath, Format("no plug-in at path:%@", path));
        return false;
      }
      plugIns.push_back(std::move(p));
      return true;
    }
    if (flags == kHoldApplication) {
      for (DRDPlugInPtr& p :
           server().plugInsWithinApplication(path).value_or(std::vector<DRDPlugInPtr>{})) {
        plugIns.push_back(std::move(p));
      }
      return true;
    }
    failMessage(kErrorMalformed, "invalid request format (unsupported hold flags)");
    return false;
  });
  if (!walked) return;

  // A single plug-in named by its path is held even while it runs: the
  // caller is replacing exactly that bundle.
  Array conflicts;
  Array busy;
  if (flags != kHoldPlugIn) {
    for (const DRDPlugInPtr& p : plugIns) {
      if (std::optional<BusyInstance> instance = p->checkBusy()) {
        conflicts.push_back(BusyDescription(*instance));
        busy.emplace_back(Format("%@(%@)", p->identifier(), p->uuid()));
      }
    }
  }
  if (!busy.empty()) {
    server().debug("hold rejected. Busy plug-ins:%@", Value(std::move(busy)));
    setReplyValue(kConflictsKey, Value(std::move(conflicts)));
    failMessage(kErrorBusy, "plug-ins are busy");
    return;
  }
  std::shared_ptr<DRDPlugInHold> hold = DRDPlugInHold::initWithPlugInsForClient(plugIns, client_);
  server().addHold(hold);
  setReplyValue(kUuidsKey, Value(hold->uuid()));
  server().debug("hold request granted uuid:%@", hold->uuid().string());
  done();
}

}  // namespace dr
