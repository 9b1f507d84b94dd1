// DRDIpcClient: the daemon's view of one connected peer process — its
// connection, pid, the bundle of its executable and its entitlements.
//
// Each message of the connection becomes a Transaction submitted to the
// server's service queue, in this client's line (clients take turns); the
// end of the connection stops further work. The connection holds the one
// lasting reference to its client (its context), so a client lives as long
// as its connection plus any Transaction of it; each Transaction holds its
// message, and so the message's share of the connection's budget, until it
// is done. Events arrive on the message service's loop thread, which reads
// every connection, so handling them must not wait long; requests run on
// the service queue; every member is safe to call from either.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "core/value.h"
#include "platform/code_signing.h"
#include "platform/message_service.h"
#include "plugin/bundle.h"
#include "plugin/plugin_client.h"

namespace dr {

class DRDServer;

class DRDIpcClient : public PlugInClient, public std::enable_shared_from_this<DRDIpcClient> {
 public:
  // The client of `connection`, already listening on it (the connection
  // holds it). REQUIRES: on the server's "ipc" queue.
  static std::shared_ptr<DRDIpcClient> initWithConnectionServer(
      std::shared_ptr<PeerConnection> connection, std::shared_ptr<DRDServer> server);

  // PlugInClient.
  pid_t pid() const override { return token_.pid; }
  Value entitlementValueForKey(std::string_view key) const override;
  bool hasEntitlement(std::string_view key) const override;

  // The peer will be terminated soon; requests still run.
  void dying();
  // The connection is gone: its holds are released and queued requests are
  // dropped.
  void dead();

  // "<DRDIpcClient %p pid=%d con=%@>", or "... NO CONNECTION>".
  std::string description() const;

  // Decided once per client, on the first call.
  bool needs17732150Workaround();

  std::shared_ptr<PeerConnection> connection() const { return connection_.lock(); }
  DRDServer& server() const { return *server_; }
  const std::shared_ptr<DRBundle>& bundle() const { return bundle_; }
  bool acceptWork() const { return acceptWork_.load(); }
  void setAcceptWork(bool accept) { acceptWork_.store(accept); }
  // Whether a hold of this client was ever put in force (set by the server
  // before it adds one), so that the end of a client that never placed one
  // need not wait for the server's hold list.
  void notePlacedHold() { placedHold_.store(true); }
  bool placedHold() const { return placedHold_.load(); }

 private:
  DRDIpcClient(std::shared_ptr<PeerConnection> connection, std::shared_ptr<DRDServer> server);
  void handleEvent(const ConnectionEvent& event);
  void handleMessage(const PeerMessage& message);

  const std::weak_ptr<PeerConnection> connection_;
  const std::shared_ptr<DRDServer> server_;
  const AuditToken token_;
  const uint64_t id_;                 // this client's line on the service queue
  std::shared_ptr<DRBundle> bundle_;  // set at construction only
  std::atomic<bool> acceptWork_{true};
  std::shared_ptr<const SigningTask> task_;  // set at construction only
  std::once_flag once17732150Workaround_;
  std::atomic<bool> needs17732150Workaround_{false};
  uint32_t requestCount_ = 0;  // on the service queue only
  std::atomic<bool> placedHold_{false};
};

}  // namespace dr
