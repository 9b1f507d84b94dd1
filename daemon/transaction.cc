#include "daemon/transaction.h"

#include <stdlib.h>

#include <cstring>

#include "core/format.h"
#include "daemon/ipc_client.h"
#include "daemon/server.h"
#include "platform/probes.h"

namespace dr {
namespace {

constexpr const char* kRequestKey = "request";
constexpr const char* kVersionKey = "version";
constexpr const char* kPathsKey = "paths";
constexpr const char* kUuidsKey = "uuids";
constexpr const char* kErrorCodeKey = "errorcode";
constexpr const char* kErrorKey = "error";
constexpr const char* kUnrecognizedRequest = "unrecognized request";

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
};

std::optional<std::string> CanonicalPath(const std::string& path) {
  char* resolved = ::realpath(path.c_str(), nullptr);
  if (!resolved) return std::nullopt;
  std::string result(resolved);
  ::free(resolved);
  if (result.size() >= kMaxResolvedPath) return std::nullopt;
  return result;
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
    std::optional<std::string> canonical = CanonicalPath(path);
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
  Status sent = c->sendReply(request_.serial, reply_);
  if (!sent.ok() && c->isOpen()) {
    server().log("unable to reply to client %d: %@", client_->pid(), sent);
  }
}

void Transaction::failMessage(uint64_t code, std::string_view message) {
  setReplyValue(kErrorCodeKey, Value(code));
  setReplyValue(kErrorKey, Value(message));
  done();
}

void Transaction::failError(uint64_t code, const Error& error) {
  if (error.domain() == DRErrorDomain) {
    failMessage(static_cast<uint64_t>(error.code()), error.ownDescription().value_or(""));
  } else {
    failMessage(code, error.localizedDescription());
  }
}

// The request handlers are not written yet: each request is answered as
// unknown until its handler lands.
void Transaction::addPlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::removePlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::bulkPlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::matchPlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::readyPlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::accessPlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::annotatePlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }
void Transaction::lockDownPlugIns() { failMessage(kErrorMalformed, kUnrecognizedRequest); }

}  // namespace dr
