// Running the built drkit (and the host example) as real processes in the
// environment of a DrdProcess started under the same root folder: same
// socket folder, registry, state, preferences and notification folders.
// For the integration tests only; header-only so that it joins the test
// binary through the tests that include it.
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

// The environment DrdProcess gives drd under `root`, plus `extra` entries.
inline std::vector<std::string> DrkitEnvironment(const std::string& root,
                                                 const std::vector<std::string>& extra = {}) {
  std::vector<std::string> env = {
      "DR_SOCKET_DIR=" + root + "/sockets",
      "DR_REGISTRY=" + root + "/registry/r.sqlite3",
      "XDG_STATE_HOME=" + root + "/state",
      "XDG_CONFIG_HOME=" + root + "/config",
      "XDG_DATA_HOME=" + root + "/data",
      "DR_NOTIFY_DIR=" + root + "/notify",
      "HOME=" + root,
      "DR_POLICY=" + root + "/policy.pdoc",
      "DR_SYSTEM_ROOTS=" + root + "/system",
      "DR_PLUGIN_PATH=" + root + "/installed",
      "PATH=/usr/bin:/bin",
  };
  env.insert(env.end(), extra.begin(), extra.end());
  return env;
}

// <build>/client/<name>, beside <build>/daemon/drd.
inline std::string ClientBinaryPath(const std::string& name) {
  std::string drd = DrdProcess::BinaryPath();                   // <build>/daemon/drd
  std::string build = drd.substr(0, drd.rfind("/daemon/drd"));  // <build>
  return build + "/client/" + name;
}

// A child process with pipes on its standard input, output and error.
class Child {
 public:
  Child(const std::string& binary, const std::vector<std::string>& args,
        std::vector<std::string> env, const std::string& cwd = "") {
    int in[2], out[2], err[2];
    if (::pipe2(in, O_CLOEXEC) || ::pipe2(out, O_CLOEXEC) || ::pipe2(err, O_CLOEXEC)) return;
    pid_ = ::fork();
    if (pid_ == 0) {
      ::dup2(in[0], 0);
      ::dup2(out[1], 1);
      ::dup2(err[1], 2);
      if (!cwd.empty() && ::chdir(cwd.c_str()) != 0) ::_exit(126);
      std::vector<std::string> argvStrings{binary};
      argvStrings.insert(argvStrings.end(), args.begin(), args.end());
      std::vector<char*> argv;
      for (std::string& a : argvStrings) argv.push_back(a.data());
      argv.push_back(nullptr);
      std::vector<char*> envp;
      for (std::string& e : env) envp.push_back(e.data());
      envp.push_back(nullptr);
      ::execve(binary.c_str(), argv.data(), envp.data());
      ::_exit(127);
    }
    ::close(in[0]);
    ::close(out[1]);
    ::close(err[1]);
    in_ = in[1];
    out_ = out[0];
    err_ = err[0];
  }
  ~Child() {
    closeInput();
    if (pid_ > 0 && !status_) {
      ::kill(pid_, SIGKILL);
      wait();
    }
    if (out_ >= 0) ::close(out_);
    if (err_ >= 0) ::close(err_);
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  pid_t pid() const { return pid_; }
  void write(const std::string& bytes) {
    if (in_ >= 0 && ::write(in_, bytes.data(), bytes.size()) < 0) closeInput();
  }
  void closeInput() {
    if (in_ >= 0) ::close(in_);
    in_ = -1;
  }
  bool signal(int number) { return ::kill(pid_, number) == 0; }

  // The next line of standard output (without its newline); "" when the
  // output ended or nothing came in time.
  std::string readLine(std::chrono::milliseconds limit = std::chrono::seconds(20)) {
    return readLineFrom(out_, outBuffer_, limit);
  }
  std::string readErrorLine(std::chrono::milliseconds limit = std::chrono::seconds(20)) {
    return readLineFrom(err_, errBuffer_, limit);
  }

  // Waits for the exit and collects what is left of both outputs. The exit
  // status, or -1 after a signal.
  int wait() {
    drain(out_, outBuffer_);
    drain(err_, errBuffer_);
    int status = 0;
    if (!status_ && ::waitpid(pid_, &status, 0) == pid_) status_ = status;
    if (!status_ || !WIFEXITED(*status_)) return -1;
    return WEXITSTATUS(*status_);
  }
  const std::string& out() const { return outBuffer_; }
  const std::string& err() const { return errBuffer_; }

 private:
  static std::string readLineFrom(int fd, std::string& buffer, std::chrono::milliseconds limit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    for (;;) {
      if (size_t nl = buffer.find('\n'); nl != std::string::npos) {
        std::string line = buffer.substr(0, nl);
        buffer.erase(0, nl + 1);
        return line;
      }
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      struct pollfd p = {fd, POLLIN, 0};
      if (fd < 0 || left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
        return "";
      }
      char chunk[4096];
      ssize_t n = ::read(fd, chunk, sizeof chunk);
      if (n <= 0) return "";
      buffer.append(chunk, static_cast<size_t>(n));
    }
  }
  static void drain(int fd, std::string& buffer) {
    char chunk[4096];
    for (ssize_t n; fd >= 0 && (n = ::read(fd, chunk, sizeof chunk)) > 0;) {
      buffer.append(chunk, static_cast<size_t>(n));
    }
  }

  pid_t pid_ = -1;
  int in_ = -1, out_ = -1, err_ = -1;
  std::string outBuffer_, errBuffer_;
  std::optional<int> status_;
};

struct Ran {
  int status;
  std::string out;
  std::string err;
};

// Runs drkit with `args` to its end, with `input` on its standard input.
inline Ran RunDrkit(const std::string& root, const std::vector<std::string>& args,
                    const std::string& input = "", const std::string& cwd = "") {
  Child child(ClientBinaryPath("drkit"), args, DrkitEnvironment(root), cwd);
  child.write(input);
  child.closeInput();
  int status = child.wait();
  return {status, child.out(), child.err()};
}

}  // namespace dr::testing
