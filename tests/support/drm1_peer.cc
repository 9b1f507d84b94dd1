#include "tests/support/drm1_peer.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <sstream>
#include <thread>

namespace dr::testing {

using namespace std::chrono_literals;

Drm1Peer::Drm1Peer(const std::string& socketPath) {
  fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, socketPath.c_str(), sizeof addr.sun_path - 1);
  connected_ = ::connect(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) == 0;
}

Drm1Peer::~Drm1Peer() { close(); }

void Drm1Peer::close() {
  if (fd_ >= 0) ::close(fd_);
  fd_ = -1;
}

bool Drm1Peer::sendRaw(const std::string& bytes) {
  size_t sent = 0;
  while (sent < bytes.size()) {
    ssize_t n = ::send(fd_, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
    if (n <= 0) return false;
    sent += static_cast<size_t>(n);
  }
  return true;
}

bool Drm1Peer::send(uint64_t serial, const Value& body, bool wantsReply) {
  Result<std::string> frame =
      drm1::EncodeFrame(serial, 0, wantsReply ? drm1::kFlagWantsReply : 0, body);
  return frame.ok() && sendRaw(*frame);
}

std::optional<drm1::Frame> Drm1Peer::receive(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    Result<std::optional<drm1::Frame>> frame = decoder_.next();
    if (!frame.ok()) return std::nullopt;
    if (frame->has_value()) return std::move(**frame);
    if (eof_) return std::nullopt;
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    struct pollfd p = {fd_, POLLIN, 0};
    if (left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
      return std::nullopt;
    }
    char buffer[65536];
    ssize_t n = ::recv(fd_, buffer, sizeof buffer, 0);
    if (n <= 0) {
      eof_ = true;
      return std::nullopt;
    }
    decoder_.feed(std::string_view(buffer, static_cast<size_t>(n)));
  }
}

bool Drm1Peer::sawEndOfStream(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!eof_ && std::chrono::steady_clock::now() < deadline) {
    receive(std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now()));
  }
  return eof_;
}

DrdProcess::DrdProcess(const std::string& root, std::vector<std::string> arguments,
                       std::vector<std::string> extraEnvironment)
    : root_(root) {
  const std::string binary = BinaryPath();
  const std::string errorFile = root_ + "/drd-stderr-" + std::to_string(::getpid()) + "-" +
                                std::to_string(reinterpret_cast<uintptr_t>(this));
  std::vector<std::string> environment = {
      "DR_SOCKET_DIR=" + root_ + "/sockets",
      "DR_REGISTRY=" + root_ + "/registry/r.sqlite3",
      "XDG_STATE_HOME=" + root_ + "/state",
      "XDG_CONFIG_HOME=" + root_ + "/config",
      "XDG_DATA_HOME=" + root_ + "/data",
      "DR_NOTIFY_DIR=" + root_ + "/notify",
      "DR_USAGE_LOG=" + root_ + "/usage.log",
      "HOME=" + root_,
      "DR_POLICY=" + root_ + "/policy.pdoc",
      "DR_SYSTEM_ROOTS=" + root_ + "/system",
      // Nothing installed on the machine leaks in.
      "DR_PLUGIN_PATH=" + root_ + "/installed",
  };
  // Later entries win: drop the defaults that `extraEnvironment` sets.
  for (const std::string& entry : extraEnvironment) {
    const std::string name = entry.substr(0, entry.find('=') + 1);
    std::erase_if(environment, [&](const std::string& e) { return e.starts_with(name); });
    environment.push_back(entry);
  }
  errorFile_ = errorFile;
  pid_ = ::fork();
  if (pid_ == 0) {
    int fd = ::open(errorFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (fd >= 0) ::dup2(fd, STDERR_FILENO);
    std::vector<char*> argv{const_cast<char*>(binary.c_str())};
    for (std::string& a : arguments) argv.push_back(a.data());
    argv.push_back(nullptr);
    std::vector<char*> envp;
    for (std::string& e : environment) envp.push_back(e.data());
    envp.push_back(nullptr);
    ::execve(binary.c_str(), argv.data(), envp.data());
    ::_exit(127);
  }
}

DrdProcess::~DrdProcess() {
  if (pid_ > 0 && !status_) {
    ::kill(pid_, SIGKILL);
    int status = 0;
    ::waitpid(pid_, &status, 0);
  }
}

std::string DrdProcess::BinaryPath() {
  char self[4096] = {};
  ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
  std::string path(self, n > 0 ? static_cast<size_t>(n) : 0);
  path = path.substr(0, path.rfind('/'));  // build/<dir>/tests
  return path.substr(0, path.rfind('/')) + "/daemon/drd";
}

std::string DrdProcess::socketPath(const std::string& serviceName) const {
  return root_ + "/sockets/" + serviceName;
}

bool DrdProcess::waitUntilServing(const std::string& serviceName) {
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (std::chrono::steady_clock::now() < deadline) {
    int status = 0;
    if (!status_ && ::waitpid(pid_, &status, WNOHANG) == pid_) status_ = status;
    if (status_) return false;
    if (Drm1Peer(socketPath(serviceName)).connected()) return true;
    std::this_thread::sleep_for(20ms);
  }
  return false;
}

int DrdProcess::waitForExit(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!status_ && std::chrono::steady_clock::now() < deadline) {
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      status_ = status;
    } else {
      std::this_thread::sleep_for(10ms);
    }
  }
  if (!status_ || !WIFEXITED(*status_)) return -1;
  return WEXITSTATUS(*status_);
}

bool DrdProcess::signal(int signalNumber) { return ::kill(pid_, signalNumber) == 0; }

std::string DrdProcess::standardError() const {
  std::ifstream in(errorFile_);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

}  // namespace dr::testing
