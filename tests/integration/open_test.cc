#include <dirent.h>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>

#include <gtest/gtest.h>

#include "tests/integration/drkit_runner.h"
#include "tests/integration/world.h"
#include "wire/drm1.h"
#include "wire/protocol.h"

namespace dr::testing {
namespace {

constexpr const char* kBwrap = "/usr/bin/bwrap";

// bwrap arguments: system programs and libraries, the build tree and `binds` (read-write) only;
// `extra` comes last.
std::vector<std::string> Sandbox(const std::vector<std::string>& binds,
                                 const std::vector<std::string>& extra = {}) {
  std::vector<std::string> args{
      kBwrap, "--die-with-parent", "--ro-bind", "/usr", "/usr", "--proc", "/proc", "--dev",
      "/dev", "--tmpfs",           "/tmp"};
  for (const char* top : {"/bin", "/sbin", "/lib", "/lib32", "/lib64", "/etc"}) {
    std::error_code ec;
    if (std::filesystem::is_symlink(top, ec)) {
      args.insert(args.end(), {"--symlink", std::filesystem::read_symlink(top).string(), top});
    } else if (std::filesystem::is_directory(top, ec)) {
      args.insert(args.end(), {"--ro-bind", top, top});
    }
  }
  const std::string build = ClientBinaryPath("");
  args.insert(args.end(), {"--ro-bind", build.substr(0, build.rfind("/client/")),
                           build.substr(0, build.rfind("/client/"))});
  for (const std::string& b : binds) args.insert(args.end(), {"--bind", b, b});
  args.insert(args.end(), extra.begin(), extra.end());
  return args;
}

size_t OpenDescriptors(pid_t pid) {
  auto fds = std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/fd");
  return static_cast<size_t>(std::distance(fds, {}));
}

class OpenTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::access(kBwrap, X_OK) != 0) GTEST_SKIP() << "bubblewrap is not installed";
    ASSERT_TRUE(w.start()) << w.log();
    plugIn = w.makePlugIn("system/a.appex", "com.example.a");
    ASSERT_EQ(ErrorCode(w.add({plugIn})), 0u) << w.log();
    Value reply = w.call(Request("access", {{"uuids", Value(Array{w.uuidOf("com.example.a")})}}));
    ASSERT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
    token = reply["extensions"].at(0).stringValue();
  }

  Ran sandboxed(const std::vector<std::string>& binds, std::vector<std::string> argv) {
    std::vector<std::string> all = Sandbox(binds, argv);
    Child child(all[0], std::vector<std::string>(all.begin() + 1, all.end()),
                DrkitEnvironment(w.root()));
    child.closeInput();
    int status = child.wait();
    return {status, child.out(), child.err()};
  }

  World w;
  std::string plugIn;
  std::string token;
};

TEST_F(OpenTest, SandboxedHostReadsThePlugInOnlyThroughItsToken) {
  const std::string info = registry_test::ReadBytes(plugIn + "/Contents/Info.pdoc");
  const std::string drkit = ClientBinaryPath("drkit");
  const struct {
    std::vector<std::string> binds, argv;
    int status;
    std::string out;
  } rows[] = {
      {{w.path("sockets")}, {drkit, "extension", "open", token, "Contents/Info.pdoc"}, 0, info},
      {{w.path("sockets")}, {drkit, "extension", "open", token}, 0, "Contents\n"},
      {{}, {"/usr/bin/cat", plugIn + "/Contents/Info.pdoc"}, 1, ""},
  };
  ASSERT_FALSE(info.empty());
  for (const auto& row : rows) {
    Ran r = sandboxed(row.binds, row.argv);
    EXPECT_EQ(r.status, row.status) << r.err << w.log();
    EXPECT_EQ(r.out, row.out);
  }
}

TEST_F(OpenTest, BadTokensOpenNothing) {
  ASSERT_EQ(ErrorCode(w.call(Request("open", {{"token", Value(token)}}))), 0u);
  const size_t before = OpenDescriptors(w.drd().pid());
  std::string altered = token;
  altered[token.rfind(';') + 1] ^= 1;  // one bit of the signature's first digit
  struct Row {
    const char* what;
    Value token;
    uint64_t code;
    std::string error;
  } rows[] = {
      {"missing", Value(), 4, "invalid request format (token)"},
      {"not a string", Value(uint64_t{1}), 4, "invalid request format (token)"},
      {"not a token", Value("hello"), 11, "token refused"},
      {"altered signature", Value(altered), 11, "token refused"},
  };
  auto check = [&](const Row& row) {
    SCOPED_TRACE(row.what);
    Dictionary fields;
    if (row.token.isPresent()) fields["token"] = row.token;
    Value reply = w.call(Request("open", std::move(fields)));
    EXPECT_EQ(ErrorCode(reply), row.code);
    EXPECT_EQ(ErrorText(reply), row.error);
  };
  for (const Row& row : rows) check(row);
  const std::string moved = w.path("elsewhere.appex");
  std::filesystem::rename(plugIn, moved);
  std::filesystem::create_directory_symlink(moved, plugIn);
  check({"link", Value(token), 9, "cannot open " + plugIn + ": " + std::to_string(ELOOP)});
  std::filesystem::remove(plugIn);
  check({"gone", Value(token), 9, "cannot open " + plugIn + ": " + std::to_string(ENOENT)});
  EXPECT_TRUE(Eventually([&] { return OpenDescriptors(w.drd().pid()) <= before; }));
}

TEST_F(OpenTest, RequestsMayNotCarryDescriptors) {
  const Value open = Request("open", {{"token", Value(token)}});
  const std::string frame = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, open);
  const std::string flagged =
      *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply | drm1::kFlagDescriptors, open);
  struct Row {
    const char* what;
    const std::string& bytes;
    bool attach;
  } rows[] = {
      {"flag without descriptors", flagged, false},
      {"descriptors without the flag", frame, true},
      {"both", flagged, true},
  };
  ASSERT_EQ(ErrorCode(w.call(open)), 0u);
  const size_t before = OpenDescriptors(w.drd().pid());
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    Drm1Peer peer(w.drd().socketPath());
    int passed = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    iovec iov = {const_cast<char*>(row.bytes.data()), row.bytes.size()};
    msghdr msg = {};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = row.attach ? control : nullptr;
    msg.msg_controllen = row.attach ? sizeof control : 0;
    if (row.attach) {
      cmsghdr* c = CMSG_FIRSTHDR(&msg);
      c->cmsg_level = SOL_SOCKET;
      c->cmsg_type = SCM_RIGHTS;
      c->cmsg_len = CMSG_LEN(sizeof(int));
      std::memcpy(CMSG_DATA(c), &passed, sizeof passed);
    }
    ASSERT_EQ(::sendmsg(peer.fd(), &msg, MSG_NOSIGNAL), static_cast<ssize_t>(row.bytes.size()));
    ::close(passed);
    EXPECT_TRUE(peer.sawEndOfStream()) << "drd answered a request that carried descriptors";
  }
  EXPECT_EQ(ErrorCode(w.call(Request("open", {{"token", Value(token)}}))), 0u);  // still serving
  EXPECT_TRUE(Eventually([&] { return OpenDescriptors(w.drd().pid()) <= before; }));
  EXPECT_NE(w.log().find("descriptors"), std::string::npos) << w.log();
}

TEST_F(OpenTest, AHostInsideAFlatpakIsSandboxed) {
  const std::string marker = w.path("flatpak-info");
  registry_test::WriteBytes(marker, "[Application]\nname=com.example.Manager\n");
  for (bool flatpak : {false, true}) {
    SCOPED_TRACE(flatpak ? "in a flatpak" : "in a plain sandbox");
    const std::string app = flatpak ? "Flatpak.app" : "Confined.app";
    w.makeApp(app, "com.example.manager", Value{{"com.corvel.private.dromon.manager", true}});
    std::filesystem::create_directories(w.path("relays"));
    std::vector<std::string> launcher = Sandbox({w.path("sockets"), w.path("relays"), w.path(app)});
    if (flatpak) launcher.insert(launcher.end(), {"--ro-bind", marker, "/.flatpak-info"});
    launcher.push_back("--");
    std::unique_ptr<HostApp> host = w.host(app, launcher);
    ASSERT_NE(host->connection(), nullptr);
    Value reply =
        w.call(Request("match", {{"flags", Value(message::kDiscoverAll)}}), host->connection());
    EXPECT_EQ(ErrorCode(reply), flatpak ? 11u : 0u) << ErrorText(reply);
  }
}

}  // namespace
}  // namespace dr::testing
