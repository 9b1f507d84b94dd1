#include "platform/message_service.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <future>
#include <thread>
#include <vector>

#include "core/log.h"
#include "tests/support/drm1_peer.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/stand_in_listener.h"

namespace dr {
namespace {

using namespace std::chrono_literals;
using Peer = testing::Drm1Peer;

bool WaitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout = 5s) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!done() && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(10ms);
  return done();
}

class MessageServiceTest : public ::testing::Test {
 protected:
  MessageServiceTest() : options_{folder_ / "sockets", "com.example.test"} {
    options_.useSocketActivation = false;
  }

  // Echoes requests with "echo": true; counts connection-invalid events.
  std::unique_ptr<Listener> EchoListener() {
    return testing::StartStandInListener(
        options_.socketDirectory, options_.serviceName, &queue_,
        [invalid = invalid_](const std::shared_ptr<PeerConnection>& c, const ConnectionEvent& e) {
          if (e.kind == ConnectionEvent::Kind::kConnectionInvalid) ++*invalid;
          if (c && e.message.wantsReply)
            c->sendReply(e.message.serial, e.message.body.changing("echo", true));
        },
        context_);
  }

  static void ExpectEcho(Peer& peer, uint64_t serial) {
    auto reply = peer.send(serial, Value{{"n", serial}}) ? peer.receive() : std::nullopt;
    ASSERT_TRUE(reply && reply->header.isReply() && reply->header.replyTo == serial) << serial;
    EXPECT_EQ(reply->body, (Value{{"n", serial}, {"echo", true}}));
  }

  testing::TempFolder folder_;
  ListenerOptions options_;
  SerialQueue queue_{"ipc"};
  std::shared_ptr<int> context_ = std::make_shared<int>(7);
  std::shared_ptr<std::atomic<int>> invalid_ = std::make_shared<std::atomic<int>>(0);
};

// Nothing a connection left behind (a cut frame, a protocol error, a request)
// reaches the next or one beside it; each ends once and lets go of its context.
TEST_F(MessageServiceTest, HostilePeersEndAloneAndLeaveNothingBehind) {
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  EXPECT_EQ(std::filesystem::status(options_.socketDirectory).permissions(),
            std::filesystem::perms::owner_all);
  ScopedLogCapture log;
  Peer beside(listener->path());
  beside.send(1, Value{{"n", 1}}, /*wantsReply=*/false);
  const std::string request = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Value{{"n", 1}});
  const std::string leftovers[] = {
      "DRM2" + std::string(28, '\0'),  // bad magic
      "",
      request.substr(0, drm1::kHeaderSize / 2),
      request.substr(0, drm1::kHeaderSize),
      request.substr(0, request.size() - 1),
      *drm1::EncodeFrame(1000, 0, drm1::kFlagWantsReply, Value{{"n", 1000}}),
  };
  int ended = 0;
  for (int round = 0; round < 5; ++round) {
    for (const std::string& leftover : leftovers) {
      Peer peer(listener->path());
      ExpectEcho(peer, static_cast<uint64_t>(100 + ended++));
      if (!leftover.empty()) peer.sendRaw(leftover);
      ExpectEcho(beside, static_cast<uint64_t>(1 + ended));
    }
  }
  EXPECT_TRUE(log.contains("protocol error on <connection") && log.contains("bad magic"));
  EXPECT_TRUE(WaitUntil([&] { return *invalid_ >= ended && context_.use_count() <= 2; }));
  EXPECT_EQ(*invalid_, ended);
  EXPECT_EQ(context_.use_count(), 2) << "a finished connection kept its context";
}

TEST_F(MessageServiceTest, ReplacesAStaleSocketButNeverALiveOneOrAnotherFile) {
  auto live = EchoListener();
  ASSERT_TRUE(live);
  EXPECT_EQ(Listener::Create(options_, &queue_).error().code(), EADDRINUSE);
  const std::string path = live->path();
  live.reset();
  ASSERT_EQ(::mknod(path.c_str(), S_IFSOCK | 0600, 0), 0);  // left by a daemon that died
  auto replaced = EchoListener();
  ASSERT_TRUE(replaced);
  Peer peer(path);
  ExpectEcho(peer, 1);
  replaced.reset();
  ASSERT_TRUE(testing::WriteTestFile(path, "precious"));
  EXPECT_EQ(Listener::Create(options_, &queue_).error().code(), EEXIST);
  EXPECT_EQ(std::filesystem::file_size(path), 8u);
  for (const char* bad : {"", "a/b", ".."}) {
    options_.serviceName = bad;
    EXPECT_EQ(Listener::Create(options_, &queue_).error().code(), EINVAL) << bad;
  }
}

// Queuing never waits for the peer (else this test would never end); past
// the limit its requests wait until it takes its replies.
TEST_F(MessageServiceTest, APeerThatTakesNoRepliesIsNotReadAndThenClosed) {
  std::promise<std::shared_ptr<PeerConnection>> made;
  auto delivered = std::make_shared<std::atomic<int>>(0);
  auto listener = testing::StartStandInListener(
      options_.socketDirectory, options_.serviceName, &queue_,
      [&made, delivered](const std::shared_ptr<PeerConnection>& c, const ConnectionEvent& e) {
        if (e.kind == ConnectionEvent::Kind::kMessage && (*delivered)++ == 0) made.set_value(c);
      });
  Peer peer(listener->path());
  peer.send(1, Value{{"request", "hello"}});
  const std::shared_ptr<PeerConnection> connection = made.get_future().get();
  ScopedLogCapture log;
  uint64_t serial = 0;
  auto flood = [&] {
    for (int i = 0; i < 80; ++i)
      EXPECT_TRUE(
          connection->sendReply(++serial, Value{{"blob", Value(Data(1 << 20, 0x5A))}}).ok());
  };
  flood();
  EXPECT_TRUE(log.contains("more than 64 MiB of replies unread"));
  peer.send(2, Value{{"request", "x"}});
  std::this_thread::sleep_for(300ms);
  EXPECT_EQ(delivered->load(), 1);
  for (int i = 0; i < 80; ++i) ASSERT_TRUE(peer.receive()) << i;
  EXPECT_TRUE(WaitUntil([&] { return *delivered == 2; }));
  EXPECT_TRUE(connection->isOpen() && log.contains("reading <connection"));
  flood();
  EXPECT_TRUE(
      WaitUntil([&] { return !connection->isOpen(); }, PeerConnection::kReplyStallLimit + 5s));
  EXPECT_TRUE(log.contains("took none of its replies for 30 s"));
}

TEST_F(MessageServiceTest, RefusesPeersOfAnotherUser) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to act as another user";
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  for (const std::string& p : {options_.socketDirectory, listener->path(), folder_.path()})
    ::chmod(p.c_str(), 0777);  // so that only drd's own check stands
  ScopedLogCapture log;
  pid_t child = ::fork();
  if (child == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(3);
    Peer peer(listener->path());
    peer.send(1, Value{{"x", 1}});  // drd may have closed the socket already
    ::_exit(!peer.connected() ? 4 : peer.receive(3s) ? 1 : 0);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(log.contains("refusing peer pid"));
}

}  // namespace
}  // namespace dr
