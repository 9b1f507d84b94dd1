// DRDServer: the daemon's one server. It listens under its service name, turns
// each new connection into a DRDIpcClient, owns the "ipc", "service" and
// "serverSync" queues, carries the verbosity and the two logging operations,
// and is the plug-in database (and that database's delegate, so that it can
// stop the running instances of uninstalled plug-ins).
//
// Made once by main and kept until the process ends; held by std::shared_ptr.
// Every request of every client runs on the service queue, one at a time:
// each client's in the order it sent them, different clients' in turns, so a
// client that pipelines many requests does not hold up the others' next one. The platform services
// are injected and must outlive it. Construction fails (empty pointer, reason logged) when the
// listener cannot be made, for instance when a live daemon already serves the name.
#pragma once

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "core/log.h"
#include "core/queue.h"
#include "core/turn_queue.h"
#include "daemon/idle_trim.h"
#include "daemon/plugin_hold.h"
#include "platform/bundle_reader.h"
#include "platform/code_signing.h"
#include "platform/message_service.h"
#include "platform/policy.h"
#include "platform/process_info.h"
#include "platform/service_manager.h"
#include "registry/service_manager_linux.h"
#include "store/database.h"
#include "store/user_prefs.h"

namespace dr {

// The platform services of the server and its clients.
struct ServerOptions {
  // The plug-in database's options; database.registry is required.
  DatabaseOptions database;
  // The folder of the listening socket, and whether a socket passed by
  // systemd is taken.
  std::string socketDirectory;
  bool useSocketActivation = true;
  // Stops the instances of uninstalled plug-ins; null: DefaultServiceManager().
  ServiceManager* serviceManager = nullptr;
  // The entitlements of peers; null: CodeSigning::Default().
  CodeSigning* codeSigning = nullptr;
  // The executables of peers; null: ProcessInfo::Default().
  ProcessInfo* processInfo = nullptr;
  // Opens the bundles of peers; null: BundleReader::Default().
  BundleReader* bundleReader = nullptr;
  // The user's exclusions; required.
  Preferences* preferences = nullptr;
  // The administrator's deny list; null: nothing is denied.
  Policy* policy = nullptr;
};

class DRDServer : public DRDatabase, public DRDatabaseDelegate, public PlugInHolds {
 public:
  static constexpr const char* kDefaultServiceName = "com.corvel.dromon.drd";

  // The server listening (suspended until run) under `serviceName`, with the
  // annotation file at `databasePath` (none: the default location). Empty
  // when the listener cannot be made (logged).
  static std::shared_ptr<DRDServer> initForServiceDatabase(
      const std::string& serviceName, const std::optional<std::string>& databasePath,
      ServerOptions options);
  ~DRDServer() override;

  // Starts accepting connections and returns at once.
  void resume();
  // Serves until SIGTERM or SIGINT, then stops accepting and sends the
  // replies already queued as far as peers read them within `flushTimeout`.
  // REQUIRES: SIGTERM and SIGINT are blocked in every thread of the process.
  void run(std::chrono::milliseconds flushTimeout = std::chrono::seconds(1));
  // Stops accepting and flushes queued replies (what run does on a signal).
  void shutdown(std::chrono::milliseconds flushTimeout);

  // Enqueues `work` on the service queue in the line of `source` (one per
  // client): sources take turns, each source's work runs in submission order,
  // and every piece runs exactly once.
  void submitWork(uint64_t source, std::function<void()> work);

  // Something that may leave freed memory behind happened (a connection
  // came or went, a request was queued): once the daemon has been quiet for
  // kTrimAfterQuiet since, or busy for kTrimWhileBusy, the allocator gives
  // its free memory back. Without it the resident set stays near the peak
  // of the last burst (64 clients beside hostile peers left drd at 2.6 times
  // its size before the load; with it drd is back to that size 2 s after);
  // a trim walks every arena, so it is not done per request.
  void noteActivity();
  static constexpr std::chrono::milliseconds kTrimAfterQuiet{250};
  static constexpr std::chrono::milliseconds kTrimWhileBusy{1000};

  // Database delegate: stops the running instances of each uninstalled
  // plug-in; results other than success and "none was running" are logged.
  void removedPlugIns(const RegistryEntries& entries) override;

  // The common sink: one line of the system log, as formatted. The level is
  // not used for filtering.
  template <typename... Args>
  void logFormat(int /*level*/, std::string_view format, const Args&... args) {
    SystemLogLine(Format(format, args...));
  }
  // Always written.
  template <typename... Args>
  void log(std::string_view format, const Args&... args) {
    logFormat(5, format, args...);
  }
  // Written only when verbose is not 0.
  template <typename... Args>
  void debug(std::string_view format, const Args&... args) {
    if (verbose() != 0) logFormat(6, format, args...);
  }

  // ---- Plug-in holds (each enters "serverSync" synchronously) ------------
  // REQUIRES (all four): not on "serverSync".

  // Whether some hold in force blocks `plugIn`.
  bool holdOnPlugIn(const DRDPlugIn& plugIn) override;
  // Puts `hold` in force and posts the annotation change. A hold whose
  // client's connection has ended meanwhile is released again at once, as
  // the client's other holds were.
  void addHold(std::shared_ptr<DRDPlugInHold> hold) override;
  // Releases the hold with `token`, if any (logged, change posted); any
  // client may release any hold.
  void unholdToken(const Uuid& token) override;
  // Releases every hold `client` placed, one log line and one change each.
  void unholdClient(const DRDIpcClient& client);
  // The holds in force, in the order they were added.
  std::vector<std::shared_ptr<DRDPlugInHold>> holds();

  uint32_t verbose() const { return verbose_.load(); }
  // REQUIRES: before run.
  void setVerbose(uint32_t verbose) { verbose_.store(verbose); }

  SerialQueue& mainQueue() { return mainQueue_; }
  Listener* service() const { return service_.get(); }
  DRDUserPrefs& userPrefs() { return *userPrefs_; }
  const ServerOptions& options() const { return options_; }

 private:
  DRDServer(const std::optional<std::string>& databasePath, ServerOptions options);
  void accept(std::shared_ptr<PeerConnection> connection);
  void postAnnotationChange();

  ServerOptions options_;
  std::atomic<uint32_t> verbose_{0};
  // New clients are set up in the background: under a flood of connections
  // the requests of the clients already there go first.
  SerialQueue ipcQueue_{"ipc", QueuePriority::kBackground};
  SerialQueue mainQueue_{"service"};
  SerialQueue syncQueue_{"serverSync"};
  TurnQueue serviceTurns_{&mainQueue_};                // the clients' requests, in turns
  std::vector<std::shared_ptr<DRDPlugInHold>> holds_;  // on syncQueue_ only
  std::unique_ptr<Listener> service_;
  std::unique_ptr<DRDUserPrefs> userPrefs_;
  // The connections made so far, only so that shutdown can flush their
  // replies; the server owns none of them.
  std::mutex connectionsMu_;
  std::vector<std::weak_ptr<PeerConnection>> connections_;  // guarded by connectionsMu_
  // Declared last: its thread stops before anything else goes.
  IdleTrimmer trimmer_{kTrimAfterQuiet, kTrimWhileBusy, IdleTrimmer::TrimMalloc};
};

}  // namespace dr
