// drd as it is installed and first met: the example application's plug-ins
// register and are usable (through the registry and through a running drd),
// and drd started the way its systemd units start it serves the socket it is
// handed and reports itself ready.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "client/include/drd/connection.h"
#include "platform/service_manager.h"
#include "plugin/plugin.h"
#include "registry/registry.h"
#include "registry/service_manager_linux.h"
#include "tests/support/drm1_peer.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using namespace std::chrono_literals;
using testing::DrdProcess;
using testing::Drm1Peer;
using testing::TempFolder;

constexpr char kFilterPoint[] = "org.example.gallery.filter";
constexpr char kFilterProtocol[] = "org.example.gallery.FilterProtocol";
constexpr char kService[] = "com.corvel.dromon.drd";

std::string SourceDir() {
  const char* dir = ::getenv("DRD_TEST_SOURCE_DIR");
  return dir ? dir : ".";
}
std::string ExamplesDir() { return std::filesystem::canonical(SourceDir() + "/examples"); }
std::string GalleryApp() { return ExamplesDir() + "/Gallery.app"; }
std::string PlugInPath(const std::string& bundle) {
  return GalleryApp() + "/Contents/PlugIns/" + bundle;
}

// What each example bundle must register as, and what the daemon's record of
// each of its plug-ins must say once its SDK is merged in.
struct ExamplePlugIn {
  std::string identifier;
  std::string protocol;
  std::string pointName;  // the attribute hosts match on
  uint64_t hubProtocolVersion;
  std::string version;
  std::optional<int64_t> sdkCleanTimeout;  // when the SDK reaches this plug-in's dictionary
};
struct ExampleBundle {
  std::string name;
  std::vector<ExamplePlugIn> plugIns;  // ascending identifiers
};

const std::vector<ExampleBundle>& Examples() {
  static const std::vector<ExampleBundle> examples = {
      // One multiple bundle: each plug-in states its own protocol and point,
      // since the SDK completes the bundle's top dictionary only.
      {"Adjust.appex",
       {{"org.example.gallery.filter.brightness", kFilterProtocol, kFilterPoint, 2, "2.0", {}},
        {"org.example.gallery.filter.contrast", kFilterProtocol, kFilterPoint, 2, "2.0", {}}}},
      {"Presets.appex",
       {{"org.example.gallery.presets", "#Data", "org.example.gallery.presets", 2, "1.0", {}}}},
      // New style: protocol and point name come from the SDK.
      {"Sepia.appex",
       {{"org.example.gallery.filter.sepia", kFilterProtocol, kFilterPoint, 2, "1.2", 30}}},
      // Old style ("Dromon"): converted, then completed from the same SDK.
      {"Vignette.appex",
       {{"org.example.gallery.filter.vignette", kFilterProtocol, kFilterPoint, 1, "0.9", 30}}},
  };
  return examples;
}

std::string ReadAll(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Every bundle under Gallery.app/Contents/PlugIns is one of Examples(), so an
// example added without its row here fails.
TEST(ExamplesTest, TheTableCoversEveryExampleBundle) {
  std::set<std::string> onDisk, listed;
  for (const auto& e : std::filesystem::directory_iterator(GalleryApp() + "/Contents/PlugIns")) {
    onDisk.insert(e.path().filename().string());
  }
  for (const ExampleBundle& b : Examples()) listed.insert(b.name);
  EXPECT_EQ(onDisk, listed);
}

// Offline, with the registry and the daemon's plug-in records themselves:
// each bundle registers with the expected plug-ins inside Gallery, and each
// plug-in passes the checks that decide whether drd offers it at all.
TEST(ExamplesTest, EveryPlugInRegistersAndIsAdmitted) {
  TempFolder home;
  ASSERT_EQ(::setenv("DR_SDK_PATH", (ExamplesDir() + "/SDKs").c_str(), 1), 0);
  RegistryOptions options;
  options.databasePath = home / "registry.sqlite3";
  Result<std::unique_ptr<Registry>> registry = Registry::Open(options);
  ASSERT_TRUE(registry) << registry.error().description();
  std::unique_ptr<ServiceManager> serviceManager = NewServiceManager({registry->get()});
  PlugInServices services;
  services.serviceManager = serviceManager.get();
  services.getenv = [](const char*) -> const char* { return nullptr; };

  // The application holds plug-ins but is none itself.
  Status app = (*registry)->registerBundle(GalleryApp());
  ASSERT_FALSE(app.ok());
  EXPECT_EQ(app.error().code(), kRegistryRefused) << app.description();

  for (const ExampleBundle& bundle : Examples()) {
    SCOPED_TRACE(bundle.name);
    const std::string path = PlugInPath(bundle.name);
    Status registered = (*registry)->registerBundle(path);
    ASSERT_TRUE(registered.ok()) << registered.error().description();
    RegistryEntries entries = (*registry)->entriesForUrl(path);
    ASSERT_EQ(entries.size(), bundle.plugIns.size());
    for (size_t i = 0; i < entries.size(); ++i) {
      const ExamplePlugIn& want = bundle.plugIns[i];
      SCOPED_TRACE(want.identifier);
      EXPECT_EQ(entries[i]->plugInIdentifier(), want.identifier);
      ASSERT_TRUE(entries[i]->containingApplication());
      EXPECT_EQ(entries[i]->containingApplication()->url, GalleryApp());
      EXPECT_EQ(entries[i]->containingApplication()->displayName, "Gallery");

      std::shared_ptr<DRDPlugIn> plugIn = DRDPlugIn::initWithRGData(entries[i], services);
      ASSERT_TRUE(plugIn) << "drd would ignore this plug-in (see its log line)";
      EXPECT_EQ(plugIn->protocolSpec(), Value(want.protocol));
      EXPECT_EQ(plugIn->attributes()["UXExtensionPointName"], Value(want.pointName));
      EXPECT_EQ(plugIn->hubProtocolVersion(), want.hubProtocolVersion);
      EXPECT_EQ(plugIn->version(), want.version);
      if (want.sdkCleanTimeout) {
        EXPECT_EQ(plugIn->plugInDictionary()["CleanTimeout"], Value(*want.sdkCleanTimeout));
      }
      // Everything but data needs an executable for drd to hand to hosts.
      if (!plugIn->isData()) {
        const std::string exe = path + "/Contents/Exec/" +
                                plugIn->bundleInfoDictionary()["BNBundleExecutable"].stringValue();
        EXPECT_EQ(::access(exe.c_str(), X_OK), 0) << exe;
      }
    }
  }
}

// What ./dev examples does, through a real drd with the examples' SDK folder
// on DR_SDK_PATH: install Gallery by copying it into the install folder
// while drd runs (no "add"), find the plug-ins by the rules a host would
// send, ready them.
TEST(ExamplesTest, DrdRegistersFindsAndReadiesTheExamples) {
  TempFolder root;
  DrdProcess drd(root.path(), {}, {"DR_SDK_PATH=" + ExamplesDir() + "/SDKs"});
  ASSERT_TRUE(drd.waitUntilServing()) << drd.standardError();
  auto connection = client::Connection::Open(kService, root / "sockets");
  ASSERT_TRUE(connection) << connection.error().description();
  client::Connection& c = **connection;
  auto request = [&](const char* name, Dictionary fields) -> Value {
    fields.insert_or_assign("request", Value(name));
    fields.insert_or_assign("version", Value(uint64_t{2}));
    Result<Value> reply = c.request(Value(std::move(fields)), 10s);
    EXPECT_TRUE(reply) << reply.error().description();
    return reply ? *reply : Value();
  };

  std::filesystem::create_directories(root / "installed");
  std::filesystem::copy(GalleryApp(), root / "installed/Gallery.app",
                        std::filesystem::copy_options::recursive);
  // Its four bundles hold five plug-ins.
  for (auto deadline = std::chrono::steady_clock::now() + 10s;
       request("match", {})["matches"].size() < 5;) {
    ASSERT_LT(std::chrono::steady_clock::now(), deadline) << drd.standardError();
    std::this_thread::sleep_for(100ms);
  }

  struct Row {
    const char* what;
    Value rules;
    std::set<std::string> identifiers;
  };
  const std::vector<Row> rows = {
      {"by extension point",
       Value{{"UXExtensionPointName", kFilterPoint}},
       {"org.example.gallery.filter.brightness", "org.example.gallery.filter.contrast",
        "org.example.gallery.filter.sepia", "org.example.gallery.filter.vignette"}},
      {"the data plug-in",
       Value{{"UXExtensionPointName", "org.example.gallery.presets"}},
       {"org.example.gallery.presets"}},
      // Activation rules: image/* takes any image type, up to its count.
      {"one PNG",
       Value{{"AcceptedTypes", Value{{"image/png", 1}}}},
       {"org.example.gallery.filter.brightness", "org.example.gallery.filter.contrast",
        "org.example.gallery.filter.sepia"}},
      {"one JPEG",
       Value{{"AcceptedTypes", Value{{"image/jpeg", 1}}}},
       {"org.example.gallery.filter.brightness", "org.example.gallery.filter.contrast",
        "org.example.gallery.filter.sepia", "org.example.gallery.filter.vignette"}},
      {"two JPEGs",
       Value{{"AcceptedTypes", Value{{"image/jpeg", 2}}}},
       {"org.example.gallery.filter.sepia"}},
  };
  std::map<std::string, Uuid> uuids;  // of every plug-in found
  for (const Row& row : rows) {
    Value reply = request("match", {{"rules", row.rules}});
    ASSERT_TRUE(reply["matches"].isArray()) << row.what << ": " << reply.description();
    std::set<std::string> found;
    for (const Value& form : reply["matches"].array()) {
      found.insert(form["identifier"].stringValue());
      std::optional<Uuid> uuid = Uuid::parse(form["uuid"].stringValue());
      ASSERT_TRUE(uuid) << form.description();
      uuids.insert_or_assign(form["identifier"].stringValue(), *uuid);
    }
    EXPECT_EQ(found, row.identifiers) << row.what;
  }
  // Readying hands each filter's executable to the service manager, so a
  // missing or non-executable Exec/ file fails here; the data plug-in needs
  // none.
  ASSERT_EQ(uuids.size(), 5u);
  Array all;
  for (const auto& [identifier, uuid] : uuids) all.push_back(Value(uuid));
  Value readied = request("ready", {{"uuids", Value(all)}});
  EXPECT_FALSE(readied.has("error")) << readied.description() << drd.standardError();
}

// ---- Socket activation, as drd.socket and drd.service run it -----------------

// A listening Unix stream socket at `path` made as systemd makes it: folder
// 0700, socket 0600. -1 on failure.
int ListenLikeSystemd(const std::string& path) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  ::chmod(std::filesystem::path(path).parent_path().c_str(), 0700);
  int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
  if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      ::chmod(path.c_str(), 0600) != 0 || ::listen(fd, 16) != 0) {
    return -1;
  }
  return fd;
}

// A datagram socket at `path` that receives sd_notify messages.
int NotifySocket(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
  if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) return -1;
  return fd;
}

// The notify messages that arrive until one holds `line` (or 10 s pass).
bool AwaitNotify(int fd, const std::string& line, std::string* seen) {
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (std::chrono::steady_clock::now() < deadline) {
    pollfd p{fd, POLLIN, 0};
    if (::poll(&p, 1, 100) <= 0) continue;
    char buf[4096];
    ssize_t n = ::recv(fd, buf, sizeof buf, 0);
    if (n <= 0) continue;
    std::string message(buf, static_cast<size_t>(n));
    *seen += message + "|";
    if (("\n" + message + "\n").find("\n" + line + "\n") != std::string::npos) return true;
  }
  return false;
}

// Run alone, and after another listening socket passed first (a unit that
// listens under more than one name): drd serves the one of its own name.
class SocketActivationTest : public ::testing::TestWithParam<bool> {};
INSTANTIATE_TEST_SUITE_P(PassedFirst, SocketActivationTest, ::testing::Values(false, true));

TEST_P(SocketActivationTest, DrdServesThePassedSocketReportsReadyAndLeavesItBehind) {
  const bool decoyFirst = GetParam();
  TempFolder root;
  const std::string runtime = root / "run/dromon";  // %t/dromon
  const std::string socketPath = runtime + "/" + kService;
  int listenFd = ListenLikeSystemd(socketPath);
  ASSERT_GE(listenFd, 0) << socketPath;
  int decoyFd = decoyFirst ? ListenLikeSystemd(root / "run/other.sock") : -1;
  if (decoyFirst) {
    ASSERT_GE(decoyFd, 0);
  }
  int notifyFd = NotifySocket(root / "notify.sock");
  ASSERT_GE(notifyFd, 0);
  struct stat before {};
  ASSERT_EQ(::lstat(socketPath.c_str(), &before), 0);

  const std::string binary = DrdProcess::BinaryPath();
  const std::string errorFile = root / "drd.stderr";
  // Everything the child needs is made before fork, so that it only fills
  // in its own pid before exec.
  char listenPid[32] = "LISTEN_PID=";
  std::vector<std::string> env = {
      decoyFirst ? "LISTEN_FDS=2" : "LISTEN_FDS=1",
      "NOTIFY_SOCKET=" + root / "notify.sock",
      "DR_SOCKET_DIR=" + runtime,  // as drd.service sets it
      "DR_REGISTRY=" + root / "registry.sqlite3",
      "XDG_STATE_HOME=" + root / "state",
      "XDG_CONFIG_HOME=" + root / "config",
      "XDG_DATA_HOME=" + root / "data",
      "HOME=" + root.path(),
  };
  std::vector<char*> envp{listenPid};
  for (std::string& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);
  char* argv[] = {const_cast<char*>(binary.c_str()), nullptr};
  pid_t pid = ::fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    // What systemd execs: the sockets as the first passed descriptors.
    int err = ::open(errorFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (err >= 0) ::dup2(err, STDERR_FILENO);
    // Moved out of the way first, so that neither is overwritten by the other.
    const int listenHigh = ::fcntl(listenFd, F_DUPFD, 64);
    const int decoyHigh = decoyFirst ? ::fcntl(decoyFd, F_DUPFD, 64) : -1;
    if (decoyFirst && ::dup2(decoyHigh, SD_LISTEN_FDS_START) < 0) ::_exit(126);
    if (::dup2(listenHigh, SD_LISTEN_FDS_START + (decoyFirst ? 1 : 0)) < 0) ::_exit(126);
    // Only the passed descriptors stay open: a socket drd closes must stop
    // listening, as it would under systemd.
    for (int fd : {listenFd, decoyFd, listenHigh, decoyHigh})
      if (fd > SD_LISTEN_FDS_START + 1) ::close(fd);
    std::snprintf(listenPid, sizeof listenPid, "LISTEN_PID=%d", static_cast<int>(::getpid()));
    ::execve(binary.c_str(), argv, envp.data());
    ::_exit(127);
  }
  ::close(listenFd);  // from here on only drd holds it, as under systemd
  if (decoyFirst) ::close(decoyFd);
  auto standardError = [&] { return ReadAll(errorFile); };
  bool reaped = false;
  auto reap = [&](std::chrono::milliseconds timeout) -> int {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    int status = 0;
    reaped = true;
    while (std::chrono::steady_clock::now() < deadline) {
      if (::waitpid(pid, &status, WNOHANG) == pid)
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
      std::this_thread::sleep_for(10ms);
    }
    ::kill(pid, SIGKILL);
    ::waitpid(pid, &status, 0);
    return -1;
  };
  // A failed assertion returns early: drd must not outlive the test (it
  // would hold the test runner's output open).
  std::shared_ptr<void> reapOnReturn(nullptr, [&](void*) {
    if (!reaped) reap(0ms);
  });

  std::string seen;
  bool ready = AwaitNotify(notifyFd, "READY=1", &seen);
  if (!ready) {
    reap(0ms);
    FAIL() << "no READY=1 (got " << seen << "): " << standardError();
  }
  {
    Drm1Peer peer(socketPath);
    ASSERT_TRUE(peer.connected());
    ASSERT_TRUE(peer.send(7, Value{{"request", "bulk"}, {"version", uint64_t{2}}}));
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply) << standardError();
    EXPECT_EQ(reply->header.replyTo, 7u);
    EXPECT_FALSE(reply->body.has("error")) << reply->body.description();
  }
  ASSERT_EQ(::kill(pid, SIGTERM), 0);
  EXPECT_EQ(reap(10s), 0) << standardError();
  ::close(notifyFd);

  // The socket is systemd's: still the same file after drd is gone, so the
  // next client starts drd again.
  struct stat after {};
  ASSERT_EQ(::lstat(socketPath.c_str(), &after), 0) << "drd removed the passed socket";
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_TRUE(S_ISSOCK(after.st_mode));
}

}  // namespace
}  // namespace dr
