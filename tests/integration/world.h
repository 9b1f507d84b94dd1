// A private world for end-to-end tests of the requests: a temporary folder
// with drd's socket, registry, state, preferences, policy and "system volume"
// (root/system), a drd started in it, plug-in bundles and applications on
// disk, and host applications that talk to drd from inside their bundle.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "client/include/drd/connection.h"
#include "core/value.h"
#include "tests/support/drm1_peer.h"
#include "tests/support/registry_bundles.h"

namespace dr::testing {

// Waits up to five seconds for `predicate` to hold.
template <typename P>
bool Eventually(P predicate) {
  for (int i = 0; i < 100; ++i) {
    if (predicate()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  return false;
}

// A request message of `name` with the protocol version and `fields`.
Value Request(const std::string& name, Dictionary fields = {});
// The "errorcode" of a reply (0 for a success) and its "error".
uint64_t ErrorCode(const Value& reply);
std::string ErrorText(const Value& reply);

// A host application process: a copy of the relay program at
// <app>/Contents/Exec/<executable>, connected to drd, so drd judges it by
// that application's bundle and entitlements. The test talks through it.
class HostApp {
 public:
  // `launcher`: a command the host is started through (a sandbox, say).
  HostApp(const std::string& appPath, const std::string& executable, const std::string& drdSocket,
          const std::string& relayFolder, std::vector<std::string> launcher = {});
  ~HostApp();
  HostApp(const HostApp&) = delete;
  HostApp& operator=(const HostApp&) = delete;

  pid_t pid() const { return pid_; }
  client::Connection* connection() const { return connection_.get(); }
  // Ends the host process (and so its connection to drd).
  void kill();

 private:
  pid_t pid_ = -1;
  std::unique_ptr<client::Connection> connection_;
};

class World {
 public:
  World();
  // Starts drd (-v, plus `environment` entries); false when it did not come up.
  bool start(std::vector<std::string> environment = {});
  // SIGTERM and wait; true when drd exited cleanly.
  bool stop();
  // SIGTERM, wait, start again with the same environment.
  bool restart();
  // SIGKILL (a crash: no clean-up runs), reap, start again with the same
  // environment.
  bool kill9();

  const std::string& root() const { return root_.path(); }
  std::string path(const std::string& relative) const { return root_ / relative; }
  DrdProcess& drd() { return *drd_; }
  std::string log() const { return drd_->standardError(); }

  // A connection of the test process itself (a free-standing program).
  std::unique_ptr<client::Connection> connect() const;
  // One request on `connection` (a fresh free-standing one when null); the
  // reply, or a reply with errorcode 99999 when the call failed.
  Value call(const Value& request, client::Connection* connection = nullptr) const;

  // An application folder at `path` (relative to root) with identifier `id`.
  std::string makeApp(const std::string& path, const std::string& id,
                      const Value& entitlements = Value()) const;
  // A plug-in bundle at `path` (relative to root) with identifier `id`, for
  // extension point "com.example.point", version `version`, an executable
  // named "run", `extra` entries merged into its plug-in dictionary (and
  // extra "UXExtensionAttributes" into its attributes), and
  // `entitlements` besides the sandbox entitlement every plug-in needs.
  std::string makePlugIn(const std::string& path, const std::string& id,
                         const std::string& version = "1.0", const Dictionary& extra = {},
                         const Value& entitlements = Value()) const;
  // Registers `paths` with "add"; the reply.
  Value add(const std::vector<std::string>& paths) const;
  // The "matches" of a "match" with `rules` (absent: none) and `flags`,
  // asked on `connection` (null: a free-standing connection).
  Value match(const Value& rules = Value(), uint64_t flags = 0,
              client::Connection* connection = nullptr) const;
  // The identifiers of `matches`, in order, as one text "a b c".
  static std::string Identifiers(const Value& matches);
  // Every registered plug-in's form as a manager host sees it (all
  // visibility filters off), and the UUID (a UUID value) of the first one
  // of `id`.
  Value everything() const;
  Value uuidOf(const std::string& id) const;

  // A host application process running from `app` (made with makeApp),
  // started through `launcher` when given; it relays through a socket in
  // path("relays").
  std::unique_ptr<HostApp> host(const std::string& app,
                                std::vector<std::string> launcher = {}) const;

 private:
  registry_test::TempFolder root_;
  std::vector<std::string> environment_;
  std::unique_ptr<DrdProcess> drd_;
  mutable std::unique_ptr<HostApp> manager_;
};

}  // namespace dr::testing
