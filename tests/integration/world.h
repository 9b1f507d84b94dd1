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

std::string RawU32(uint32_t n);
std::string RawKey(const std::string& key);
std::string RawRequest(const std::string& body);
std::string NestedBody(int depth);
std::vector<std::pair<std::string, std::string>> BrokenFrames();

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
  bool start(std::vector<std::string> environment = {});
  bool stop();     // SIGTERM; true on a clean exit
  bool restart();  // stop, then start with the same environment
  bool kill9();    // SIGKILL (no clean-up runs), then start again

  const std::string& root() const { return root_.path(); }
  std::string path(const std::string& relative) const { return root_ / relative; }
  DrdProcess& drd() { return *drd_; }
  std::string log() const { return drd_->standardError(); }
  std::string prefsFile() const;

  std::unique_ptr<client::Connection> connect() const;
  Value call(const Value& request, client::Connection* connection = nullptr) const;

  std::string makeApp(const std::string& path, const std::string& id,
                      const Value& entitlements = Value()) const;
  std::string makePlugIn(const std::string& path, const std::string& id,
                         const std::string& version = "1.0", const Dictionary& extra = {},
                         const Value& entitlements = Value()) const;
  Value add(const std::vector<std::string>& paths) const;
  Value match(const Value& rules = Value(), uint64_t flags = 0,
              client::Connection* connection = nullptr) const;
  static std::string Identifiers(const Value& matches);
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
