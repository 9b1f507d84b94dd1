// A private world for end-to-end tests: a temporary folder with drd's socket,
// registry, state, preferences, policy and "system volume" (root/system), a
// drd started in it, bundles on disk, and host applications that talk to drd
// from inside their bundle.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "client/include/drd/connection.h"
#include "core/value.h"
#include "tests/integration/drkit_runner.h"
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

Value Request(const std::string& name, Dictionary fields = {});
uint64_t ErrorCode(const Value& reply);  // 0 for a success
std::string ErrorText(const Value& reply);
Value Uuids(Array list);
size_t Occurrences(const std::string& text, const std::string& what);

// Hand-made frames, for bytes the encoder refuses to make: a little-endian
// 32-bit number, a key, a request frame with serial 1 around a `body`, a top
// dictionary {"a": [[...]]} whose innermost array is at `depth`, and frames
// that each break the protocol in their own way.
std::string RawU32(uint32_t n);
std::string RawKey(const std::string& key);
std::string RawRequest(const std::string& body);
std::string NestedBody(int depth);
std::vector<std::pair<std::string, std::string>> BrokenFrames();

// A copy of the relay program at <app>/Contents/Exec/host, connected to drd,
// so drd judges it by that bundle; the test talks through it. `launcher`:
// a command the host is started through (a sandbox, say).
class HostApp {
 public:
  HostApp(const std::string& appPath, const std::string& drdSocket, const std::string& relayFolder,
          std::vector<std::string> launcher);
  pid_t pid() const { return child_->pid(); }
  client::Connection* connection() const { return connection_.get(); }
  void kill() {
    connection_.reset();
    child_.reset();
  }

 private:
  std::unique_ptr<Child> child_;
  std::unique_ptr<client::Connection> connection_;
};

class World {
 public:
  World();
  ~World();  // stops drd with SIGTERM, as the service manager would
  // Starts drd -v with `environment` entries; false when it did not come up.
  bool start(std::vector<std::string> environment = {});
  bool stop();     // SIGTERM; true on a clean exit
  bool restart();  // stop, then start with the same environment
  bool kill9();    // SIGKILL (no clean-up runs), then start again

  const std::string& root() const { return root_.path(); }
  std::string path(const std::string& relative) const { return root_ / relative; }
  DrdProcess& drd() { return *drd_; }
  std::string log() const { return drd_->standardError(); }
  // The per-host user preferences file drd reads.
  std::string prefsFile() const;

  std::unique_ptr<client::Connection> connect() const;
  // One request on `connection` (null: a fresh one); a failed call gives
  // errorcode 99999.
  Value call(const Value& request, client::Connection* connection = nullptr) const;

  std::string makeApp(const std::string& path, const std::string& id,
                      const Value& entitlements = Value()) const;
  // A plug-in bundle at `path` with identifier `id`, for "com.example.point"
  // unless `extra` (merged into its plug-in dictionary) names another, an
  // executable "run", and the sandbox entitlement besides `entitlements`.
  std::string makePlugIn(const std::string& path, const std::string& id,
                         const std::string& version = "1.0", const Dictionary& extra = {},
                         const Value& entitlements = Value()) const;
  Value add(const std::vector<std::string>& paths) const;
  // The "matches" of a "match" (expected to succeed).
  Value match(const Value& rules = Value(), uint64_t flags = 0,
              client::Connection* connection = nullptr) const;
  // The identifiers of `matches`, sorted, as one text "a b c".
  static std::string Identifiers(const Value& matches);
  // Every registered plug-in as a manager host sees it, and the UUID value
  // of the first of `id`.
  Value everything() const;
  Value uuidOf(const std::string& id) const;

  std::unique_ptr<HostApp> host(const std::string& app,
                                std::vector<std::string> launcher = {}) const;

 private:
  registry_test::TempFolder root_;
  std::vector<std::string> environment_;
  std::unique_ptr<DrdProcess> drd_;
  bool serving_ = false;
  mutable std::unique_ptr<HostApp> manager_;
};

}  // namespace dr::testing
