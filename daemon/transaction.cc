#include "daemon/transaction.h"

#include <optional>

#include "core/utf8.h"
#include "daemon/ipc_client.h"
#include "daemon/requests/requests.h"
#include "daemon/server.h"
#include "platform/file_system.h"
#include "platform/probes.h"
#include "wire/protocol.h"

namespace dr {
namespace {

using namespace message;

constexpr const char* kUnrecognizedRequest = "unrecognized request";

// Paths are resolved into a buffer of this size; longer ones do not resolve.
constexpr size_t kMaxResolvedPath = 1024;

// The requests drd serves, looked up in this order by exact name. Each row
// hands its handler the parts of the server that handler uses.
struct RequestKind {
  const char* name;
  void (*handle)(Transaction& t, DRDServer& server);
};
constexpr RequestKind kRequests[] = {
    {kRequestAdd, [](Transaction& t, DRDServer& s) { requests::addPlugIns(t, s); }},
    {kRequestRemove, [](Transaction& t, DRDServer& s) { requests::removePlugIns(t, s); }},
    {kRequestBulk, [](Transaction& t, DRDServer&) { requests::bulkPlugIns(t); }},
    {kRequestMatch,
     [](Transaction& t, DRDServer& s) {
       requests::matchPlugIns(t, s, s, s.userPrefs(), s.options().database.plugInServices.sandbox,
                              s.options().policy);
     }},
    {kRequestReady, [](Transaction& t, DRDServer& s) { requests::readyPlugIns(t, s, s); }},
    {kRequestAccess,
     [](Transaction& t, DRDServer& s) {
       requests::accessPlugIns(t, s, s.options().database.plugInServices.sandbox);
     }},
    {kRequestAnnotate, [](Transaction& t, DRDServer& s) { requests::annotatePlugIns(t, s); }},
    {kRequestLock, [](Transaction& t, DRDServer& s) { requests::lockDownPlugIns(t, s, s); }},
    {kRequestOpen,
     [](Transaction& t, DRDServer& s) {
       requests::openExtension(t, s.options().database.plugInServices.sandbox);
     }},
};

std::optional<std::string> ResolvedPath(const std::string& path) {
  Result<std::string> resolved = CanonicalPath(path);
  if (!resolved.ok() || resolved->size() >= kMaxResolvedPath) return std::nullopt;
  return std::move(resolved).value();
}

}  // namespace

std::shared_ptr<Transaction> Transaction::initWithRequestForClient(
    PeerMessage request, std::shared_ptr<DRDIpcClient> client) {
  return std::shared_ptr<Transaction>(new Transaction(std::move(request), std::move(client)));
}

Transaction::Transaction(PeerMessage request, std::shared_ptr<DRDIpcClient> client)
    : client_(std::move(client)),
      request_(std::move(request)),
      verbose_(client_->server().verbose()),
      reply_(Value::EmptyDictionary()) {}

void Transaction::setReplyValue(std::string_view key, const Value& value) {
  reply_ = reply_.changing(key, value);
}

void Transaction::setReplyForms(std::string_view key, DiscoveredForms forms) {
  formsKey_ = key;
  forms_ = std::move(forms);
}

Value Transaction::replyValue() const {
  return forms_ ? reply_.changing(formsKey_, forms_->value()) : reply_;
}

// The reply's entries in key order, the forms among them.
drm1::Splice Transaction::replyFrame() const {
  drm1::Splice frame(drm1::kMaxReplyBodySize);
  if (!forms_) {
    frame.value(reply_, 1);
    return frame;
  }
  const Dictionary& entries = reply_.dictionary();
  const bool replaced = entries.contains(formsKey_);
  frame.container(drm1::kTagDictionary, static_cast<uint32_t>(entries.size() + (replaced ? 0 : 1)),
                  1);
  bool written = false;
  for (const auto& [key, value] : entries) {
    if (!written && key >= formsKey_) {
      frame.key(formsKey_);
      forms_->splice(frame);
      written = true;
      if (key == formsKey_) continue;
    }
    frame.key(key);
    frame.value(value, 2);
  }
  if (!written) {
    frame.key(formsKey_);
    forms_->splice(frame);
  }
  return frame;
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
  debug("client %d request %s", client_->pid(), requestName);
  probes::Request(client_->pid(), requestName);
  if (!requestName) {
    failMessage(kErrorMalformed, "invalid request format (missing type)");
    return;
  }
  for (const RequestKind& kind : kRequests) {
    if (name.stringValue() == kind.name) {
      kind.handle(*this, client_->server());
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

bool Transaction::processUuidList(DRDatabase& database, const PlugInOperation& operation) {
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
    DRDPlugInPtr plugIn = database.findPlugIn(*element.uuid());
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
    log("second reply to request %llu of client %d dropped", request_.serial, client_->pid());
    return;
  }
  replied_ = true;
  if (verbose_ >= 2) debug("Replying %@", replyValue());
  if (probes::RequestOutputEnabled()) {
    probes::RequestOutput(client_->pid(), replyValue().description().c_str());
  }
  if (!request_.wantsReply) return;
  std::shared_ptr<PeerConnection> c = client_->connection();
  if (!c) return;
  Status sent = c->sendReply(request_.serial, replyFrame(), std::move(descriptors_));
  if (!sent.ok() && c->isOpen()) {
    log("unable to reply to client %d: %@", client_->pid(), sent);
    // A reply the wire cannot carry (nested too deeply or too large, say
    // from a plug-in's own dictionaries) still answers the request.
    c->sendReply(
        request_.serial,
        Value{{kErrorCodeKey, Value(static_cast<uint64_t>(kErrorMalformed))},
              {kErrorKey, Value(EscapeInvalidUtf8(Format("reply cannot be sent: %@", sent)))}});
  }
}

void Transaction::failMessage(int64_t code, std::string_view message) {
  // Codes travel unsigned.
  setReplyValue(kErrorCodeKey, Value(static_cast<uint64_t>(code)));
  // A path in the text may hold any bytes; the reply must be UTF-8.
  setReplyValue(kErrorKey, Value(EscapeInvalidUtf8(message)));
  done();
}

void Transaction::failError(int64_t code, const Error& error) {
  if (error.domain() == DRErrorDomain) {
    failMessage(error.code(), error.ownDescription().value_or(""));
  } else {
    failMessage(code, error.localizedDescription());
  }
}

}  // namespace dr
