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

#include "tests/integration/drkit_runner.h"
#include "tests/integration/world.h"
#include "tests/support/process_fixtures.h"

namespace dr::testing {
namespace {

using namespace std::chrono_literals;

constexpr char kFilterPoint[] = "org.example.gallery.filter";
constexpr char kFilterProtocol[] = "org.example.gallery.FilterProtocol";
constexpr char kService[] = "com.corvel.dromon.drd";

std::string ExamplesDir() {
  const char* dir = ::getenv("DRD_TEST_SOURCE_DIR");
  return std::filesystem::canonical(std::string(dir ? dir : ".") + "/examples");
}
std::string GalleryApp() { return ExamplesDir() + "/Gallery.app"; }

struct ExamplePlugIn {
  std::string bundle, identifier, protocol, pointName;
  uint64_t hubProtocolVersion;
  std::string version;
  Value cleanTimeout;
};
const ExamplePlugIn kExamples[] = {
    {"Adjust.appex", "org.example.gallery.filter.brightness", kFilterProtocol, kFilterPoint, 2,
     "2.0", Value()},
    {"Adjust.appex", "org.example.gallery.filter.contrast", kFilterProtocol, kFilterPoint, 2, "2.0",
     Value()},
    {"Presets.appex", "org.example.gallery.presets", "#Data", "org.example.gallery.presets", 2,
     "1.0", Value()},
    {"Sepia.appex", "org.example.gallery.filter.sepia", kFilterProtocol, kFilterPoint, 2, "1.2",
     Value(30)},
    {"Vignette.appex", "org.example.gallery.filter.vignette", kFilterProtocol, kFilterPoint, 1,
     "0.9", Value(30)},
};

// As ./dev examples: Gallery copied into the install folder of a running drd registers every
// plug-in as the table says (one without its row fails), is found by a host's rules, and readies.
TEST(ExamplesTest, DrdRegistersFindsAndReadiesTheExamples) {
  std::set<std::string> onDisk, listed;
  for (const auto& e : std::filesystem::directory_iterator(GalleryApp() + "/Contents/PlugIns")) {
    onDisk.insert(e.path().filename().string());
  }
  for (const ExamplePlugIn& e : kExamples) listed.insert(e.bundle);
  EXPECT_EQ(onDisk, listed);

  World w;
  ASSERT_TRUE(w.start({"DR_SDK_PATH=" + ExamplesDir() + "/SDKs"})) << w.log();
  const std::string gallery = w.path("installed/Gallery.app");
  std::filesystem::create_directories(w.path("installed"));
  std::filesystem::copy(GalleryApp(), gallery, std::filesystem::copy_options::recursive);
  for (auto deadline = std::chrono::steady_clock::now() + 10s;
       w.match().size() < std::size(kExamples);) {
    ASSERT_LT(std::chrono::steady_clock::now(), deadline) << w.log();
    std::this_thread::sleep_for(100ms);
  }
  EXPECT_EQ(ErrorCode(w.add({gallery})), 2u);
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
      {Value{{"AcceptedTypes", Value{{"image/png", 1}}}},
       brightness + " " + contrast + " " + sepia},
      {Value{{"AcceptedTypes", Value{{"image/jpeg", 1}}}},
       brightness + " " + contrast + " " + sepia + " org.example.gallery.filter.vignette"},
      {Value{{"AcceptedTypes", Value{{"image/jpeg", 2}}}}, sepia},
  };
  for (const auto& [rules, identifiers] : rows) {
    EXPECT_EQ(World::Identifiers(w.match(rules)), identifiers) << rules.description();
  }
  Value readied = w.call(Request("ready", {{"uuids", Value(all)}}));
  EXPECT_EQ(ErrorCode(readied), 0u) << readied.description() << w.log();
}

// ---- Socket activation, as drd.socket and drd.service run it -----------------

// A Unix socket at `path`: a listening one as systemd makes it (0700/0600) or datagram; -1 if not.
int BoundSocket(const std::string& path, int type) {
  const std::string folder = std::filesystem::path(path).parent_path();
  std::filesystem::create_directories(folder);
  ::chmod(folder.c_str(), 0700);
  int fd = type == SOCK_STREAM ? ::fcntl(::socket(AF_UNIX, type, 0), F_DUPFD, 64)
                               : ::socket(AF_UNIX, type, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
  if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      (type == SOCK_STREAM && (::chmod(path.c_str(), 0600) != 0 || ::listen(fd, 16) != 0))) {
    return -1;
  }
  return fd;
}

// Alone and after another passed socket: drd serves its own name, is ready, leaves the socket.
class SocketActivationTest : public ::testing::TestWithParam<bool> {};
INSTANTIATE_TEST_SUITE_P(PassedFirst, SocketActivationTest, ::testing::Values(false, true));

TEST_P(SocketActivationTest, DrdServesThePassedSocketReportsReadyAndLeavesItBehind) {
  const bool decoyFirst = GetParam();
  TempFolder root;
  const std::string runtime = root / "run/dromon";  // %t/dromon
  const std::string socketPath = runtime + "/" + kService;
  const int listenFd = BoundSocket(socketPath, SOCK_STREAM);
  const int decoyFd = decoyFirst ? BoundSocket(root / "run/other.sock", SOCK_STREAM) : listenFd;
  const int notifyFd = BoundSocket(root / "notify.sock", SOCK_DGRAM | SOCK_CLOEXEC);
  ASSERT_TRUE(listenFd >= 0 && decoyFd >= 0 && notifyFd >= 0);
  struct stat before {};
  ASSERT_EQ(::lstat(socketPath.c_str(), &before), 0);
  const std::string l = std::to_string(listenFd), d = std::to_string(decoyFd);
  const std::string fds =
      decoyFirst ? "3<&" + d + " 4<&" + l + " LISTEN_FDS=2" : "3<&" + l + " LISTEN_FDS=1";
  Child drd("/bin/bash",
            {"-c",
             "exec " + fds.substr(0, fds.find(" LISTEN")) + " " + l + "<&- " + d +
                 "<&-; LISTEN_PID=$$" + fds.substr(fds.find(" LISTEN")) + " exec \"$0\"",
             DrdProcess::BinaryPath()},
            {"NOTIFY_SOCKET=" + root / "notify.sock", "DR_SOCKET_DIR=" + runtime,
             "DR_REGISTRY=" + root / "registry.sqlite3", "XDG_STATE_HOME=" + root / "state",
             "XDG_CONFIG_HOME=" + root / "config", "XDG_DATA_HOME=" + root / "data",
             "HOME=" + root.path()});
  for (int fd : {listenFd, decoyFd}) ::close(fd);  // only drd holds them, as under systemd
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
  EXPECT_NE(("\n" + seen).find("\nREADY=1\n"), std::string::npos) << "got " << seen;
  Drm1Peer peer(socketPath);
  ASSERT_TRUE(peer.send(7, Request("bulk")));
  std::optional<drm1::Frame> reply = peer.receive();
  EXPECT_TRUE(reply && reply->header.replyTo == 7u && !reply->body.has("error"));
  drd.signal(SIGTERM);
  EXPECT_EQ(drd.wait(), 0) << drd.err();
  struct stat after {};
  ASSERT_EQ(::lstat(socketPath.c_str(), &after), 0) << "drd removed the passed socket";
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_TRUE(S_ISSOCK(after.st_mode));
}

}  // namespace
}  // namespace dr::testing
