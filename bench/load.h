// The end-to-end load program's parts: a private environment with plug-in
// bundles on disk and a drd process in it (load_env.cc), the floor and the
// peer it is compared with (load_peers.cc), and the workloads and the report
// (load.cc). Everything runs in one process on the calling thread unless a
// comment says otherwise; failures stop the program with a message (a load
// run that cannot set itself up has nothing to report).
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "core/value.h"

namespace drbench {

using Clock = std::chrono::steady_clock;

// Prints "load: <message>" and exits with status 1.
[[noreturn]] void Die(const std::string& message);

// Microseconds between two instants.
double Micros(Clock::time_point from, Clock::time_point to);

// Latency samples in microseconds.
struct Samples {
  std::vector<double> micros;
  double cpuMicros = 0;  // drd's CPU time per sample, when measured
  void add(double us) { micros.push_back(us); }
  // The p-th quantile (0 < p <= 1), nearest rank; 0 without samples.
  double quantile(double p) const;
};

// A fresh folder under /tmp, removed with its contents when destroyed
// (unless keep is set).
class TempRoot {
 public:
  TempRoot();
  ~TempRoot();
  const std::string& path() const { return path_; }
  bool keep = false;

 private:
  std::string path_;
};

// Writes `bytes` to `path`, making missing folders.
void WriteFile(const std::string& path, const std::string& bytes);
// Writes `value` as an XML pdoc file.
void WritePdoc(const std::string& path, const dr::Value& value);

// The plug-in bundles of one workload: `apps` applications under `folder`
// whose plug-ins belong to `points` extension points, `perPoint` plug-ins of
// each point spread over the applications. Every plug-in is an app
// extension (so it shares its bundle and discovery issues it a token), is
// sandboxed, and names its extension point, whose SDK dictionary (written
// once into `sdkFolder`) supplies the attribute "UXExtensionPointName".
struct BundleSet {
  std::vector<std::string> plugIns;  // bundle paths
  int points = 0;
  int perPoint = 0;
};
BundleSet MakeBundles(const std::string& folder, const std::string& sdkFolder, int apps, int points,
                      int perPoint);
// The extension point name of point `point`.
std::string PointName(int point);

// A drd of the build tree run with its own socket folder, registry,
// state, configuration, data, notification and SDK folders under `home`
// (standard error to <home>/drd.log). Killed when destroyed while running.
class Drd {
 public:
  Drd(std::string binary, std::string home, std::string sdkFolder);
  ~Drd();

  // Starts drd; answers the instant just before fork().
  Clock::time_point start();
  // Waits until the socket accepts; dies when drd exits first or 10 s pass.
  void waitUntilServing();
  // SIGTERM and wait for the exit (SIGKILL after 10 s).
  void stop();

  pid_t pid() const { return pid_; }
  const std::string& home() const { return home_; }
  // Its install folders (DR_PLUGIN_PATH): none unless set.
  std::string pluginPath;
  // How many times drd has logged the end of its install folders'
  // reconcile so far (in all its runs).
  int reconciles() const;
  std::string socketFolder() const { return home_ + "/sockets"; }
  std::string annotationFile() const { return home_ + "/state/com.corvel.dromon/Annotations"; }
  // VmHWM and VmRSS of the running drd, in KiB (0 when unreadable).
  long peakResidentKiB() const;
  long residentKiB() const;
  // CPU time drd's running threads have used so far, in seconds: on a busy
  // machine it says more about drd's own work than the wall clock.
  double cpuSeconds() const;

 private:
  long statusField(const char* name) const;

  std::string binary_;
  std::string home_;
  std::string sdkFolder_;
  pid_t pid_ = -1;
};

// ---- Peers (load_peers.cc) ---------------------------------------------------

// A one-thread DRM1 server on a Unix socket at <folder>/<name> that polls
// every connection; the subclass's run() serves them. A subclass calls
// start() when it is ready and stop() first thing in its destructor.
class FloorServer {
 public:
  virtual ~FloorServer();
  const std::string& folder() const { return folder_; }
  const std::string& name() const { return name_; }

 protected:
  FloorServer(std::string folder, std::string name);
  void start();
  void stop();
  virtual void run() = 0;

  const std::string folder_;
  const std::string name_;
  int listenFd_ = -1;
  int wakeFd_ = -1;
  std::atomic<bool> stop_{false};

 private:
  std::thread thread_;
};

// The floor: a DRM1 echo server on a Unix socket at <folder>/<name>, one
// thread polling every connection. Each request frame is decoded and answered
// with a reply frame whose body is the one set with setReply (so the bytes
// on the wire have the sizes of drd's own reply).
class EchoServer : public FloorServer {
 public:
  EchoServer(std::string folder, std::string name);
  ~EchoServer() override { stop(); }
  void setReply(const dr::Value& body);

 private:
  void run() override;

  std::mutex mu_;
  dr::Value reply_;  // guarded by mu_
};

// The canned floor: a FloorServer that answers each request with body bytes
// recorded from drd's own reply to the same request, under the request's
// serial. It reads only frame headers and looks the request body up as
// bytes, so it costs what moving drd's reply bytes costs and nothing else.
class CannedServer : public FloorServer {
 public:
  CannedServer(std::string folder, std::string name);
  ~CannedServer() override { stop(); }
  // From now on a request whose body is `request` is answered with `reply`.
  void record(std::string request, std::string reply);

 private:
  void run() override;

  std::mutex mu_;
  std::map<std::string, std::string, std::less<>> replies_;  // guarded by mu_
};

// A client on the bare DRM1 framing, with no values in its path: it writes
// a request frame encoded beforehand (under its own next serial) and reads
// the reply's header and body bytes without decoding the body. Dies when the
// peer fails, closes or takes over 120 s to answer.
class RawClient {
 public:
  RawClient(const std::string& folder, const std::string& name);
  ~RawClient();
  // Sends `frame` (a whole request frame; its serial is replaced) and
  // answers the reply's body bytes, valid until the next exchange.
  const std::string& exchange(const std::string& frame);

 private:
  void readExactly(char* to, size_t size);

  int fd_ = -1;
  uint64_t serial_ = 0;
  std::string body_;
};

// The peer: a private dbus-daemon and an sd-bus echo service on it. A call
// carries the DRM1 encoding of a request as a byte array and is answered
// with the DRM1 encoding of the reply set with setReply; both ends encode
// and decode the values as drd and its clients do, so the difference to the
// floor is the transport alone.
class DbusPeer {
 public:
  // Starts dbus-daemon with its socket in `folder`; available() is false
  // when dbus-daemon cannot be started.
  explicit DbusPeer(const std::string& folder);
  ~DbusPeer();
  bool available() const { return available_; }
  const std::string& unavailableReason() const { return reason_; }
  void setReply(const dr::Value& body);

  // One client connection to the bus; used from one thread.
  class Client {
   public:
    explicit Client(const std::string& address);
    ~Client();
    // One method call carrying `request`; the decoded reply.
    dr::Value call(const dr::Value& request);

   private:
    void* bus_ = nullptr;  // sd_bus*
    uint64_t serial_ = 1;
  };
  std::unique_ptr<Client> connect() const;

  // The method handler: `message` is the sd_bus_message of a call,
  // `userdata` this peer.
  static int OnEcho(void* message, void* userdata);

 private:
  void serve();

  bool available_ = false;
  std::string reason_;
  std::string address_;
  pid_t daemon_ = -1;
  std::mutex mu_;
  dr::Value reply_;  // guarded by mu_
  std::atomic<bool> stop_{false};
  std::atomic<bool> ready_{false};
  std::thread thread_;
};

}  // namespace drbench
