#pragma once

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "tests/support/drm1_peer.h"

namespace dr::testing {

inline std::vector<std::string> DrkitEnvironment(const std::string& root) {
  return {"DR_SOCKET_DIR=" + root + "/sockets",
          "DR_REGISTRY=" + root + "/registry/r.sqlite3",
          "XDG_STATE_HOME=" + root + "/state",
          "XDG_CONFIG_HOME=" + root + "/config",
          "XDG_DATA_HOME=" + root + "/data",
          "DR_NOTIFY_DIR=" + root + "/notify",
          "HOME=" + root,
          "DR_POLICY=" + root + "/policy.pdoc",
          "DR_SYSTEM_ROOTS=" + root + "/system",
          "DR_PLUGIN_PATH=" + root + "/installed",
          "PATH=/usr/bin:/bin"};
}

inline std::string ClientBinaryPath(const std::string& name) {
  const std::string drd = DrdProcess::BinaryPath();
  return drd.substr(0, drd.rfind("/daemon/drd")) + "/client/" + name;
}

class Child {
 public:
  Child(const std::string& binary, const std::vector<std::string>& args,
        std::vector<std::string> env, const std::string& cwd = "") {
    int pipes[3][2];
    for (auto& p : pipes) {
      if (::pipe2(p, O_CLOEXEC) != 0) return;
    }
    std::vector<std::string> argvStrings{binary};
    argvStrings.insert(argvStrings.end(), args.begin(), args.end());
    std::vector<char*> argv, envp;
    for (std::string& a : argvStrings) argv.push_back(a.data());
    for (std::string& e : env) envp.push_back(e.data());
    argv.push_back(nullptr);
    envp.push_back(nullptr);
    pid_ = ::fork();
    if (pid_ == 0) {
      for (int fd = 0; fd < 3; ++fd) ::dup2(pipes[fd][fd == 0 ? 0 : 1], fd);
      if (!cwd.empty() && ::chdir(cwd.c_str()) != 0) ::_exit(126);
      ::execve(binary.c_str(), argv.data(), envp.data());
      ::_exit(127);
    }
    for (int fd = 0; fd < 3; ++fd) {
      ::close(pipes[fd][fd == 0 ? 0 : 1]);
      fds_[fd] = pipes[fd][fd == 0 ? 1 : 0];
    }
  }
  ~Child() {
    closeInput();
    if (pid_ > 0 && !status_) {
      ::kill(pid_, SIGKILL);
      wait();
    }
    for (int fd : {fds_[1], fds_[2]}) ::close(fd);
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  pid_t pid() const { return pid_; }
  void write(const std::string& bytes) {
    if (::write(fds_[0], bytes.data(), bytes.size()) < 0) closeInput();
  }
  void closeInput() {
    if (fds_[0] >= 0) ::close(fds_[0]);
    fds_[0] = -1;
  }
  bool signal(int number) { return ::kill(pid_, number) == 0; }
  std::string readLine() { return readLineFrom(1); }
  std::string readErrorLine() { return readLineFrom(2); }
  int wait() {
    for (int fd : {1, 2}) {
      char chunk[4096];
      for (ssize_t n; (n = ::read(fds_[fd], chunk, sizeof chunk)) > 0;)
        buffers_[fd].append(chunk, static_cast<size_t>(n));
    }
    int status = 0;
    if (!status_ && ::waitpid(pid_, &status, 0) == pid_) status_ = status;
    return status_ && WIFEXITED(*status_) ? WEXITSTATUS(*status_) : -1;
  }
  const std::string& out() const { return buffers_[1]; }
  const std::string& err() const { return buffers_[2]; }

 private:
  std::string readLineFrom(int fd) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    for (size_t nl; (nl = buffers_[fd].find('\n')) == std::string::npos;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd p = {fds_[fd], POLLIN, 0};
      char chunk[4096];
      ssize_t n = left.count() > 0 && ::poll(&p, 1, static_cast<int>(left.count())) > 0
                      ? ::read(fds_[fd], chunk, sizeof chunk)
                      : 0;
      if (n <= 0) return "";
      buffers_[fd].append(chunk, static_cast<size_t>(n));
    }
    const size_t nl = buffers_[fd].find('\n');
    std::string line = buffers_[fd].substr(0, nl);
    buffers_[fd].erase(0, nl + 1);
    return line;
  }

  pid_t pid_ = -1;
  int fds_[3] = {-1, -1, -1};
  std::string buffers_[3];
  std::optional<int> status_;
};

struct Ran {
  int status;
  std::string out, err;
};

inline Ran RunDrkit(const std::string& root, const std::vector<std::string>& args,
                    const std::string& input = "", const std::string& cwd = "") {
  Child child(ClientBinaryPath("drkit"), args, DrkitEnvironment(root), cwd);
  child.write(input);
  child.closeInput();
  const int status = child.wait();
  return {status, child.out(), child.err()};
}

}  // namespace dr::testing
