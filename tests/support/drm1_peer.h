// A blocking DRM1 peer on a real Unix socket, and a drd of the build tree in a temporary world.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "core/value.h"
#include "tests/support/process_fixtures.h"
#include "wire/drm1.h"

namespace dr::testing {

class Drm1Peer {
 public:
  explicit Drm1Peer(const std::string& socketPath);
  ~Drm1Peer();
  Drm1Peer(const Drm1Peer&) = delete;
  Drm1Peer& operator=(const Drm1Peer&) = delete;

  bool connected() const { return connected_; }
  int fd() const { return fd_; }
  // False when not every byte could be written.
  bool sendRaw(const std::string& bytes);
  bool send(uint64_t serial, const Value& body, bool wantsReply = true);
  // The next frame; nothing on end of stream, protocol error or timeout.
  std::optional<drm1::Frame> receive(
      std::chrono::milliseconds timeout = std::chrono::milliseconds(5000));
  // True when the other side closed the connection (frames before the end
  // are read and dropped).
  bool sawEndOfStream(std::chrono::milliseconds timeout = std::chrono::milliseconds(5000));
  void close();

 private:
  int fd_ = -1;
  bool connected_ = false;
  bool eof_ = false;
  drm1::FrameDecoder decoder_{drm1::kFromDaemon};
};

// drd with DR_SOCKET_DIR, DR_REGISTRY, XDG_*, DR_NOTIFY_DIR, DR_USAGE_LOG, DR_POLICY and
// DR_SYSTEM_ROOTS under `root`, then `environment` (which wins); standard error to a file;
// SIGKILLed when destroyed while running.
class DrdProcess {
 public:
  DrdProcess(const std::string& root, std::vector<std::string> arguments,
             std::vector<std::string> environment = {});
  ~DrdProcess();
  DrdProcess(const DrdProcess&) = delete;
  DrdProcess& operator=(const DrdProcess&) = delete;

  static std::string BinaryPath();

  pid_t pid() const { return pid_; }
  std::string socketPath(const std::string& serviceName = "com.corvel.dromon.drd") const;
  // False when drd exited first or the time ran out.
  bool waitUntilServing(const std::string& serviceName = "com.corvel.dromon.drd");
  // Waits for the exit; the exit status, or -1 on a signal or timeout.
  int waitForExit(std::chrono::milliseconds timeout = std::chrono::milliseconds(10000));
  bool signal(int signalNumber);
  std::string standardError() const;

 private:
  std::string root_;
  std::string errorFile_;
  pid_t pid_ = -1;
  std::optional<int> status_;
};

}  // namespace dr::testing
