#include "daemon/server.h"

#include <signal.h>

#include <algorithm>

#include "daemon/ipc_client.h"
#include "registry/service_manager_linux.h"

namespace dr {

std::shared_ptr<DRDServer> DRDServer::initForServiceDatabase(
    const std::string& serviceName, const std::optional<std::string>& databasePath,
    ServerOptions options) {
  std::shared_ptr<DRDServer> server(new DRDServer(databasePath, std::move(options)));
  Result<std::unique_ptr<Listener>> listener =
      Listener::Create(ListenerOptions{server->options_.socketDirectory, serviceName,
                                       server->options_.useSocketActivation},
                       &server->ipcQueue_);
  if (!listener.ok()) {
    SystemLog("unable to listen as \"%s\": %@", serviceName, listener.error());
    return nullptr;
  }
  server->service_ = std::move(*listener);
  server->subscribe();
  server->setDelegate(std::weak_ptr<DRDatabaseDelegate>(server));
  std::weak_ptr<DRDServer> weak = server;
  server->service_->setEventHandler([weak](std::shared_ptr<PeerConnection> connection) {
    if (std::shared_ptr<DRDServer> self = weak.lock()) self->accept(std::move(connection));
  });
  server->userPrefs_ = std::make_unique<DRDUserPrefs>(server->options_.preferences);
  return server;
}

DRDServer::DRDServer(const std::optional<std::string>& databasePath, ServerOptions options)
    : DRDatabase(databasePath, options.database), options_(std::move(options)) {
  if (!options_.serviceManager) options_.serviceManager = DefaultServiceManager();
  if (!options_.codeSigning) options_.codeSigning = CodeSigning::Default();
  if (!options_.processInfo) options_.processInfo = ProcessInfo::Default();
  if (!options_.bundleReader) options_.bundleReader = BundleReader::Default();
}

DRDServer::~DRDServer() {
  if (service_) service_->stop();
}

void DRDServer::accept(std::shared_ptr<PeerConnection> connection) {
  {
    std::lock_guard<std::mutex> lock(connectionsMu_);
    std::erase_if(connections_, [](const auto& c) { return c.expired(); });
    connections_.push_back(connection);
  }
  noteActivity();
  // The connection keeps the client alive; nothing here holds it.
  DRDIpcClient::initWithConnectionServer(std::move(connection),
                                         std::static_pointer_cast<DRDServer>(shared_from_this()));
}

void DRDServer::resume() { service_->resume(); }

void DRDServer::run(std::chrono::milliseconds flushTimeout) {
  resume();
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGTERM);
  sigaddset(&stop, SIGINT);
  int signal = 0;
  while (sigwait(&stop, &signal) != 0) {
  }
  debug("signal %d: stopping", signal);
  shutdown(flushTimeout);
}

void DRDServer::shutdown(std::chrono::milliseconds flushTimeout) {
  service_->stop();
  std::vector<std::shared_ptr<PeerConnection>> open;
  {
    std::lock_guard<std::mutex> lock(connectionsMu_);
    for (const auto& weak : connections_) {
      if (auto c = weak.lock()) open.push_back(std::move(c));
    }
  }
  const auto deadline = std::chrono::steady_clock::now() + flushTimeout;
  for (const auto& connection : open) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    connection->flush(static_cast<int>(std::max<int64_t>(left.count(), 0)));
  }
}

void DRDServer::submitWork(uint64_t source, std::function<void()> work) {
  serviceTurns_.submit(source, std::move(work));
  noteActivity();
}

void DRDServer::noteActivity() { trimmer_.activity(); }

void DRDServer::removedPlugIns(const RegistryEntries& entries) {
  for (const RegistryEntryPtr& entry : entries) {
    std::string identifier = entry->bundleIdentifier().value_or("");
    int result = options_.serviceManager->removeExternalServiceInstance(
        identifier, entry->bundleVersion().value_or(""));
    mainQueue_.async([identifier = std::move(identifier), result] {
      if (result != 0 && result != kNoInstanceRunning) {
        SystemLog("PLUGIN REMOVAL:%@ RESULT:%d", identifier, result);
      }
    });
  }
}

bool DRDServer::holdOnPlugIn(const DRDPlugIn& plugIn) {
  return syncQueue_.syncResult([&] {
    return std::any_of(holds_.begin(), holds_.end(),
                       [&](const auto& hold) { return hold->blocks(plugIn); });
  });
}

void DRDServer::addHold(std::shared_ptr<DRDPlugInHold> hold) {
  std::shared_ptr<DRDIpcClient> client = hold->client();
  if (client) client->notePlacedHold();
  syncQueue_.sync([&] {
    holds_.push_back(std::move(hold));
    postAnnotationChange();
  });
  // A request still ran after its connection ended. The client's end
  // released its holds before this one was in the list, or releases it
  // now: it stopped accepting work before it released them.
  if (client && !client->acceptWork()) unholdClient(*client);
}

void DRDServer::unholdToken(const Uuid& token) {
  syncQueue_.sync([&] {
    auto it = std::find_if(holds_.begin(), holds_.end(),
                           [&](const auto& hold) { return hold->uuid() == token; });
    if (it == holds_.end()) return;
    SystemLog("releasing plug-in hold %@ at client's request", token);
    holds_.erase(it);
    postAnnotationChange();
  });
}

void DRDServer::unholdClient(const DRDIpcClient& client) {
  // Most clients never place a hold; a peer connecting in a loop would
  // otherwise line up every dying connection here, ahead of the service
  // queue's own hold checks.
  if (!client.placedHold()) return;
  syncQueue_.sync([&] {
    for (;;) {
      auto it = std::find_if(holds_.begin(), holds_.end(),
                             [&](const auto& hold) { return hold->placedBy(&client); });
      if (it == holds_.end()) return;
      SystemLog("releasing plug-in hold %@ for dead client pid %d", (*it)->uuid(), client.pid());
      holds_.erase(it);
      postAnnotationChange();
    }
  });
}

std::vector<std::shared_ptr<DRDPlugInHold>> DRDServer::holds() {
  return syncQueue_.syncResult([&] { return holds_; });
}

void DRDServer::postAnnotationChange() {
  NotificationCenter* center = options_.database.notifications;
  if (!center) return;
  Status posted = center->post(kAnnotationChangeNotification);
  if (!posted.ok()) SystemLog("unable to post %s: %@", kAnnotationChangeNotification, posted);
}

}  // namespace dr
