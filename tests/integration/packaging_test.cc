// drd as it is installed and first met: the example application's plug-ins
// register and are usable through a running drd, and drd started the way its systemd units start it
// serves the socket it is handed and reports itself ready.
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

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "tests/integration/world.h"
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

std::string ExamplesDir() {
  const char* dir = ::getenv("DRD_TEST_SOURCE_DIR");
  return std::filesystem::canonical(std::string(dir ? dir : ".") + "/examples");
}
std::string GalleryApp() { return ExamplesDir() + "/Gallery.app"; }

// What each example plug-in must register as once its SDK is merged in:
// bundle, identifier, protocol, point name, hub protocol version, version,
// and the SDK's CleanTimeout where the SDK reaches the plug-in's dictionary.
struct ExamplePlugIn {
  std::string bundle, identifier, protocol, pointName;
  uint64_t hubProtocolVersion;
  std::string version;
  Value cleanTimeout;
};
const ExamplePlugIn kExamples[] = {
    // One multiple bundle: each plug-in states its own protocol and point,
    // since the SDK completes the bundle's top dictionary only.
    {"Adjust.appex", "org.example.gallery.filter.brightness", kFilterProtocol, kFilterPoint, 2,
     "2.0", Value()},
    {"Adjust.appex", "org.example.gallery.filter.contrast", kFilterProtocol, kFilterPoint, 2, "2.0",
     Value()},
    {"Presets.appex", "org.example.gallery.presets", "#Data", "org.example.gallery.presets", 2,
     "1.0", Value()},
    // New style: protocol and point name come from the SDK.
    {"Sepia.appex", "org.example.gallery.filter.sepia", kFilterProtocol, kFilterPoint, 2, "1.2",
     Value(30)},
    // Old style ("Dromon"): converted, then completed from the same SDK.
    {"Vignette.appex", "org.example.gallery.filter.vignette", kFilterProtocol, kFilterPoint, 1,
     "0.9", Value(30)},
};

// What ./dev examples does, through a real drd with the examples' SDK folder
// on DR_SDK_PATH: install Gallery by copying it into the install folder
// while drd runs (no "add"); every plug-in of every bundle registers as the
// table says (an example added without its row fails), is found by the
// rules a host would send, and readies.
TEST(ExamplesTest, DrdRegistersFindsAndReadiesTheExamples) {
  std::set<std::string> onDisk, listed;
  for (const auto& e : std::filesystem::directory_iterator(GalleryApp() + "/Contents/PlugIns")) {
    onDisk.insert(e.path().filename().string());
  }
  for (const ExamplePlugIn& e : kExamples) listed.insert(e.bundle);
  EXPECT_EQ(onDisk, listed);

  testing::World w;
  ASSERT_TRUE(w.start({"DR_SDK_PATH=" + ExamplesDir() + "/SDKs"})) << w.log();
  const std::string gallery = w.path("installed/Gallery.app");
  std::filesystem::create_directories(w.path("installed"));
  std::filesystem::copy(GalleryApp(), gallery, std::filesystem::copy_options::recursive);
  for (auto deadline = std::chrono::steady_clock::now() + 10s;
       w.match().size() < std::size(kExamples);) {
    ASSERT_LT(std::chrono::steady_clock::now(), deadline) << w.log();
    std::this_thread::sleep_for(100ms);
  }
  // The application holds plug-ins but is none itself.
  EXPECT_EQ(testing::ErrorCode(w.add({gallery})), 2u);
  Array all;
  for (const Value forms = w.match(); const Value& form : forms.array()) {
    SCOPED_TRACE(form["identifier"].stringValue());
    auto want = std::find_if(std::begin(kExamples), std::end(kExamples), [&](const auto& e) {
      return e.identifier == form["identifier"].stringValue();
    });
    ASSERT_NE(want, std::end(kExamples));
    const Value& info = form["info"];
    EXPECT_EQ(form["path"], Value(gallery + "/Contents/PlugIns/" + want->bundle));
    EXPECT_EQ(form["containingPath"], Value(gallery));
    EXPECT_EQ(form["localizedContainingDisplayName"], Value("Gallery"));
    EXPECT_EQ(info["UXExtensionProtocol"], Value(want->protocol));
    EXPECT_EQ(info["UXExtensionAttributes"]["UXExtensionPointName"], Value(want->pointName));
    EXPECT_EQ(form["hubProtocolVersion"].uintValue(), want->hubProtocolVersion);
    EXPECT_EQ(form["version"], Value(want->version));
    if (want->cleanTimeout.isPresent()) {
      EXPECT_EQ(info["CleanTimeout"], want->cleanTimeout);
    }
    all.push_back(Value(Uuid::parse(form["uuid"].stringValue())));
  }
  const std::string brightness = "org.example.gallery.filter.brightness",
                    contrast = "org.example.gallery.filter.contrast",
                    sepia = "org.example.gallery.filter.sepia";
  const std::pair<Value, std::string> rows[] = {
      {Value{{"UXExtensionPointName", kFilterPoint}},
       brightness + " " + contrast + " " + sepia + " org.example.gallery.filter.vignette"},
      {Value{{"UXExtensionPointName", "org.example.gallery.presets"}},
       "org.example.gallery.presets"},
      // Activation rules: image/* takes any image type, up to its count.
      {Value{{"AcceptedTypes", Value{{"image/png", 1}}}},
       brightness + " " + contrast + " " + sepia},
      {Value{{"AcceptedTypes", Value{{"image/jpeg", 1}}}},
       brightness + " " + contrast + " " + sepia + " org.example.gallery.filter.vignette"},
      {Value{{"AcceptedTypes", Value{{"image/jpeg", 2}}}}, sepia},
  };
  for (const auto& [rules, identifiers] : rows) {
    EXPECT_EQ(testing::World::Identifiers(w.match(rules)), identifiers) << rules.description();
  }
  // Readying hands each filter's executable to the service manager, so a
  // missing or non-executable Exec/ file fails here; the data plug-in needs
  // none.
  Value readied = w.call(testing::Request("ready", {{"uuids", Value(all)}}));
  EXPECT_EQ(testing::ErrorCode(readied), 0u) << readied.description() << w.log();
}

// ---- Socket activation, as drd.socket and drd.service run it -----------------

// A Unix socket bound at `path`: a listening stream socket made as systemd
// makes it (folder 0700, socket 0600), or a datagram one. -1 on failure.
int BoundSocket(const std::string& path, int type) {
  const std::string folder = std::filesystem::path(path).parent_path();
  std::filesystem::create_directories(folder);
  ::chmod(folder.c_str(), 0700);
  int fd = ::socket(AF_UNIX, type, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
  if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      (type == SOCK_STREAM && (::chmod(path.c_str(), 0600) != 0 || ::listen(fd, 16) != 0))) {
    return -1;
  }
  return fd;
}

// Run alone, and after another listening socket passed first (a unit that
// listens under more than one name): drd serves the one of its own name,
// reports itself ready, and leaves the socket behind.
class SocketActivationTest : public ::testing::TestWithParam<bool> {};
INSTANTIATE_TEST_SUITE_P(PassedFirst, SocketActivationTest, ::testing::Values(false, true));

TEST_P(SocketActivationTest, DrdServesThePassedSocketReportsReadyAndLeavesItBehind) {
  const bool decoyFirst = GetParam();
  TempFolder root;
  const std::string runtime = root / "run/dromon";  // %t/dromon
  const std::string socketPath = runtime + "/" + kService;
  const int listenFd = BoundSocket(socketPath, SOCK_STREAM);
  const int decoyFd = decoyFirst ? BoundSocket(root / "run/other.sock", SOCK_STREAM) : -1;
  const int notifyFd = BoundSocket(root / "notify.sock", SOCK_DGRAM | SOCK_CLOEXEC);
  ASSERT_TRUE(listenFd >= 0 && notifyFd >= 0 && (decoyFd >= 0 || !decoyFirst));
  struct stat before {};
  ASSERT_EQ(::lstat(socketPath.c_str(), &before), 0);

  const std::string binary = DrdProcess::BinaryPath();
  const std::string errorFile = root / "drd.stderr";
  // Everything the child needs is made before fork; it only fills in its
  // own pid before exec.
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
  const pid_t pid = ::fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    // What systemd execs: the sockets as the first passed descriptors, moved
    // out of the way first so that neither overwrites the other, and only
    // they stay open (a socket drd closes must stop listening).
    int err = ::open(errorFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (err >= 0) ::dup2(err, STDERR_FILENO);
    const int listenHigh = ::fcntl(listenFd, F_DUPFD, 64);
    const int decoyHigh = decoyFirst ? ::fcntl(decoyFd, F_DUPFD, 64) : -1;
    if (decoyFirst && ::dup2(decoyHigh, SD_LISTEN_FDS_START) < 0) ::_exit(126);
    if (::dup2(listenHigh, SD_LISTEN_FDS_START + (decoyFirst ? 1 : 0)) < 0) ::_exit(126);
    for (int fd : {listenFd, decoyFd, listenHigh, decoyHigh}) {
      if (fd > SD_LISTEN_FDS_START + 1) ::close(fd);
    }
    std::snprintf(listenPid, sizeof listenPid, "LISTEN_PID=%d", static_cast<int>(::getpid()));
    ::execve(binary.c_str(), argv, envp.data());
    ::_exit(127);
  }
  ::close(listenFd);  // from here on only drd holds it, as under systemd
  if (decoyFirst) ::close(decoyFd);
  auto standardError = [&] {
    std::ifstream in(errorFile);
    return std::string(std::istreambuf_iterator<char>(in), {});
  };
  // drd must not outlive the test, even after a failed assertion (it would
  // hold the test runner's output open): SIGKILL when it does not exit.
  std::optional<int> status;
  auto reap = [&](std::chrono::milliseconds timeout) {
    int raw = 0;
    for (auto deadline = std::chrono::steady_clock::now() + timeout; !status;) {
      if (::waitpid(pid, &raw, WNOHANG) == pid) {
        status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
      } else if (std::chrono::steady_clock::now() >= deadline) {
        ::kill(pid, SIGKILL);
        ::waitpid(pid, &raw, 0);
        status = -1;
      } else {
        std::this_thread::sleep_for(10ms);
      }
    }
    return *status;
  };
  std::shared_ptr<void> reapOnReturn(nullptr, [&](void*) { reap(0ms); });

  std::string seen;  // the notify messages, until READY=1 or 10 s pass
  for (auto deadline = std::chrono::steady_clock::now() + 10s;
       ("\n" + seen).find("\nREADY=1\n") == std::string::npos &&
       std::chrono::steady_clock::now() < deadline;) {
    pollfd p{notifyFd, POLLIN, 0};
    char buf[4096];
    ssize_t n = ::poll(&p, 1, 100) > 0 ? ::recv(notifyFd, buf, sizeof buf, 0) : 0;
    if (n > 0) seen += std::string(buf, static_cast<size_t>(n)) + "\n";
  }
  ::close(notifyFd);
  ASSERT_NE(("\n" + seen).find("\nREADY=1\n"), std::string::npos)
      << "no READY=1 (got " << seen << "): " << standardError();
  {
    Drm1Peer peer(socketPath);
    ASSERT_TRUE(peer.send(7, testing::Request("bulk")));
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply) << standardError();
    EXPECT_EQ(reply->header.replyTo, 7u);
    EXPECT_FALSE(reply->body.has("error")) << reply->body.description();
  }
  ASSERT_EQ(::kill(pid, SIGTERM), 0);
  EXPECT_EQ(reap(10s), 0) << standardError();
  // The socket is systemd's: still the same file after drd is gone, so the
  // next client starts drd again.
  struct stat after {};
  ASSERT_EQ(::lstat(socketPath.c_str(), &after), 0) << "drd removed the passed socket";
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_TRUE(S_ISSOCK(after.st_mode));
}

}  // namespace
}  // namespace dr
