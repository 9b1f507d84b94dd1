#include "daemon/ipc_client.h"

#include "core/format.h"
#include "daemon/server.h"
#include "daemon/transaction.h"
#include "platform/probes.h"
#include "plugin/discovery.h"
#include "plugin/helpers.h"

namespace dr {
namespace {

constexpr const char* kShortVersionKey = "BNBundleShortVersionString";

// Each client's line on the service queue; never reused, unlike pids.
std::atomic<uint64_t> gNextClientId{1};

}  // namespace

std::shared_ptr<DRDIpcClient> DRDIpcClient::initWithConnectionServer(
    std::shared_ptr<PeerConnection> connection, std::shared_ptr<DRDServer> server) {
  std::shared_ptr<DRDIpcClient> client(new DRDIpcClient(connection, std::move(server)));
  connection->setContext(client);
  std::weak_ptr<DRDIpcClient> weak = client;
  connection->setEventHandler([weak](const ConnectionEvent& event) {
    if (std::shared_ptr<DRDIpcClient> self = weak.lock()) self->handleEvent(event);
  });
  connection->resume();
  return client;
}

DRDIpcClient::DRDIpcClient(std::shared_ptr<PeerConnection> connection,
                           std::shared_ptr<DRDServer> server)
    : connection_(connection),
      server_(std::move(server)),
      token_(connection->auditToken()),
      id_(gNextClientId.fetch_add(1)) {
  const ServerOptions& options = server_->options();
  Result<std::string> executable = options.processInfo->executablePath(token_.pid);
  if (executable.ok()) {
    bundle_ = DRBundle::initWithExecutablePath(*executable, options.bundleReader);
  }
  server_->debug("client %d %s", token_.pid, executable.ok() ? *executable : std::string());
  probes::ClientNew(token_.pid);
  task_ = options.codeSigning->taskForPidWithExecutable(token_.pid, executable);
}

void DRDIpcClient::handleEvent(const ConnectionEvent& event) {
  switch (event.kind) {
    case ConnectionEvent::Kind::kMessage:
      handleMessage(event.message);
      return;
    case ConnectionEvent::Kind::kConnectionInvalid:
      dead();
      return;
  }
  server_->log("unexpected message %d on connection %@", static_cast<int>(event.kind),
               connection());
}

void DRDIpcClient::handleMessage(const PeerMessage& message) {
  if (server_->verbose() >= 2) server_->debug("incoming request %@", message.body);
  if (probes::RequestInputEnabled()) {
    probes::RequestInput(token_.pid, message.body.description().c_str());
  }
  std::shared_ptr<Transaction> transaction =
      Transaction::initWithRequestForClient(message, shared_from_this());
  server_->submitWork(id_, [self = shared_from_this(), transaction] {
    self->requestCount_++;
    if (self->requestCount_ % 1000 == 0) {
      self->server_->debug("client %d used %u requests so far", self->pid(), self->requestCount_);
    }
    transaction->dispatch();
  });
}

void DRDIpcClient::dying() { server_->debug("client %d termination imminent", pid()); }

void DRDIpcClient::dead() {
  // Before the holds are released: a hold its last requests place after
  // this sees that the client is gone (DRDServer::addHold).
  setAcceptWork(false);
  server_->unholdClient(*this);
  server_->debug("client %d is dead", pid());
  probes::ClientDone(pid());
  server_->noteActivity();  // its buffers and queued replies are freed soon
}

Value DRDIpcClient::entitlementValueForKey(std::string_view key) const {
  if (!task_) return Value();
  Result<Value> value = task_->entitlementValue(key);
  if (!value.ok()) {
    server_->log("error retrieving entitlements for pid %d", pid());
    return Value();
  }
  return *value;
}

bool DRDIpcClient::hasEntitlement(std::string_view key) const {
  return IsEntitlementHeld(entitlementValueForKey(key));
}

std::string DRDIpcClient::description() const {
  if (std::shared_ptr<PeerConnection> c = connection()) {
    return Format("<DRDIpcClient %p pid=%d con=%@>", this, pid(), c->description());
  }
  return Format("<DRDIpcClient %p NO CONNECTION>", this);
}

bool DRDIpcClient::needs17732150Workaround() {
  std::call_once(once17732150Workaround_, [this] {
    needs17732150Workaround_.store(false);
    std::optional<std::string> identifier = bundle_ ? bundle_->bundleIdentifier() : std::nullopt;
    Value version = bundle_ ? bundle_->infoDictionary()[kShortVersionKey] : Value();
    if (identifier && version.isString()) {
      needs17732150Workaround_.store(Needs17732150Workaround(*identifier, version.stringValue()));
    }
    server_->debug("client %@(v%@)[%d] %s 17732150 workaround", identifier, version, pid(),
                   needs17732150Workaround_.load() ? "needs" : "does NOT need");
  });
  return needs17732150Workaround_.load();
}

}  // namespace dr
