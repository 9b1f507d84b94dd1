#include "client/include/drd/client.h"

#include <utility>

#include "wire/protocol.h"

namespace dr::client {
namespace {

using namespace message;

constexpr const char* kSettingsKey = message::kExtensionKey;

Error UnexpectedReply(std::string_view request, const Value& reply) {
  return Error(
      kClientErrorDomain, kUnexpectedReply,
      "unexpected reply from drd to \"" + std::string(request) + "\": " + reply.description());
}

Value Strings(const std::vector<std::string>& strings) {
  Array array;
  array.reserve(strings.size());
  for (const std::string& s : strings) array.emplace_back(s);
  return Value(std::move(array));
}

Value Uuids(const std::vector<Uuid>& uuids) {
  Array array;
  array.reserve(uuids.size());
  for (const Uuid& u : uuids) array.emplace_back(u);
  return Value(std::move(array));
}

std::optional<std::string> OptionalString(const Value& v) {
  if (std::optional<std::string_view> s = v.string()) return std::string(*s);
  return std::nullopt;
}

}  // namespace

std::optional<PlugIn> PlugIn::FromForm(const Value& form) {
  std::optional<std::string_view> identifier = form["identifier"].string();
  std::optional<std::string_view> path = form["path"].string();
  std::optional<Uuid> uuid = Uuid::parse(form["uuid"].stringValue());
  if (!form.isDictionary() || !identifier || !path || !uuid) return std::nullopt;
  PlugIn p;
  p.identifier = std::string(*identifier);
  p.version = form["version"].stringValue();
  p.path = std::string(*path);
  p.uuid = *uuid;
  p.containingPath = OptionalString(form["containingPath"]);
  p.displayName = OptionalString(form["localizedDisplayName"]);
  p.systemResident = form["systemResident"].boolValue();
  p.registered = form["lastmodified"].intValue();
  p.annotations =
      form[kAnnotationsKey].isDictionary() ? form[kAnnotationsKey] : Value::EmptyDictionary();
  p.form = form;
  return p;
}

Election PlugIn::election() const {
  const Value& e = annotations[kElectionKey];
  if (!e.isNumber() || e == Value(kElectionDefault)) return Election::kDefault;
  return e == Value(kElectionUse) ? Election::kElected : Election::kIgnored;
}

Status ReplyStatus(const Value& reply) {
  const Value& code = reply[kErrorCodeKey];
  if (code.isAbsent()) return Status::OK();
  std::optional<std::string_view> text = reply[kErrorKey].string();
  std::string message =
      text && !text->empty() ? std::string(*text) : "drd error " + std::to_string(code.intValue());
  return Error(kDaemonErrorDomain, code.intValue(), std::move(message));
}

Result<std::unique_ptr<Client>> Client::Open(const std::string& serviceName,
                                             const std::string& socketDirectory) {
  Result<std::unique_ptr<Connection>> connection = Connection::Open(serviceName, socketDirectory);
  if (!connection.ok()) return connection.error();
  return std::make_unique<Client>(std::move(*connection));
}

Client::Client(std::unique_ptr<Connection> connection) : connection_(std::move(connection)) {}

Client::~Client() = default;

void Client::setTimeout(std::chrono::milliseconds timeout) { timeout_ = timeout; }

Result<Value> Client::send(const Value& message) { return connection_->request(message, timeout_); }

Result<Value> Client::exchange(std::string_view name, Dictionary fields) {
  fields[kRequestKey] = Value(name);
  fields[kVersionKey] = Value(kProtocolVersion);
  return connection_->request(Value(std::move(fields)), timeout_);
}

Result<Value> Client::call(std::string_view name, Dictionary fields) {
  Result<Value> reply = exchange(name, std::move(fields));
  if (!reply.ok()) return reply;
  if (Status status = ReplyStatus(*reply); !status.ok()) return status.error();
  return reply;
}

Status Client::addPlugIns(const std::vector<std::string>& paths) {
  return call(kRequestAdd, {{kPathsKey, Strings(paths)}}).status();
}

Status Client::removePlugIns(const std::vector<std::string>& paths) {
  return call(kRequestRemove, {{kPathsKey, Strings(paths)}}).status();
}

Status Client::bulk(uint64_t flags) {
  return call(kRequestBulk, {{kFlagsKey, Value(flags)}}).status();
}

Result<std::vector<PlugIn>> Client::match(const Value& rules, uint64_t flags) {
  Dictionary fields{{kFlagsKey, Value(flags)}};
  if (rules.isPresent()) fields[kRulesKey] = rules;
  Result<Value> reply = call(kRequestMatch, std::move(fields));
  if (!reply.ok()) return reply.error();
  const Value& matches = (*reply)[kMatchesKey];
  if (!matches.isArray()) return UnexpectedReply(kRequestMatch, *reply);
  std::vector<PlugIn> plugIns;
  plugIns.reserve(matches.size());
  for (const Value& form : matches.array()) {
    std::optional<PlugIn> p = PlugIn::FromForm(form);
    if (!p) return UnexpectedReply(kRequestMatch, form);
    plugIns.push_back(std::move(*p));
  }
  return plugIns;
}

Status Client::ready(const std::vector<Uuid>& plugIns) {
  return call(kRequestReady, {{kUuidsKey, Uuids(plugIns)}}).status();
}

Result<std::vector<std::string>> Client::access(const std::vector<Uuid>& plugIns) {
  Result<Value> reply = call(kRequestAccess, {{kUuidsKey, Uuids(plugIns)}});
  if (!reply.ok()) return reply.error();
  const Value& tokens = (*reply)[kExtensionsKey];
  if (!tokens.isArray() || tokens.size() != plugIns.size()) {
    return UnexpectedReply(kRequestAccess, *reply);
  }
  std::vector<std::string> out;
  for (const Value& token : tokens.array()) {
    if (!token.isString()) return UnexpectedReply(kRequestAccess, *reply);
    out.push_back(token.stringValue());
  }
  return out;
}

Status Client::annotate(const std::vector<Uuid>& plugIns, const AnnotationChange& change) {
  Dictionary annotations;
  if (change.election) annotations[kElectionKey] = Value(*change.election);
  if (change.settings.isPresent()) annotations[kSettingsKey] = change.settings;
  return call(kRequestAnnotate,
              {{kAnnotationsKey, Value(std::move(annotations))}, {kUuidsKey, Uuids(plugIns)}})
      .status();
}

Result<Uuid> Client::hold(HoldTarget target, const std::vector<std::string>& paths,
                          std::vector<Value>* conflicts) {
  Result<Value> reply = exchange(kRequestLock, {{kFlagsKey, Value(static_cast<uint64_t>(target))},
                                                {kPathsKey, Strings(paths)}});
  if (!reply.ok()) return reply.error();
  if (Status status = ReplyStatus(*reply); !status.ok()) {
    if (conflicts) {
      const Array& busy = (*reply)[kConflictsKey].array();
      conflicts->assign(busy.begin(), busy.end());
    }
    return status.error();
  }
  std::optional<Uuid> token = (*reply)[kUuidsKey].uuid();
  if (!token) return UnexpectedReply(kRequestLock, *reply);
  return *token;
}

Status Client::release(const std::vector<Uuid>& tokens) {
  return call(kRequestLock, {{kUuidsKey, Uuids(tokens)}}).status();
}

const char* ErrorCodeName(int64_t code) {
  switch (code) {
    case kErrorRegistration:
      return "registration refused";
    case kErrorMalformed:
      return "bad request";
    case kErrorVersion:
      return "unsupported version";
    case kErrorBadPath:
      return "bad path";
    case kErrorNotPermitted:
      return "not permitted";
    case kErrorBusy:
      return "busy";
    default:
      return nullptr;
  }
}

}  // namespace dr::client
