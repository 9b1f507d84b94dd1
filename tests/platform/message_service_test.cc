#include "platform/message_service.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <filesystem>
#include <fstream>
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

// Polls `done` until it holds or `timeout` passes; answers its last value.
bool WaitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout = 5s) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!done() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(10ms);
  }
  return done();
}

// A child process that opens `n` connections to `path` and keeps them open
// until killed; answers its pid once all are made.
pid_t ConnectFromAnotherProcess(const std::string& path, int n) {
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  int ready[2];
  if (::pipe(ready) != 0) return -1;
  pid_t child = ::fork();
  if (child == 0) {  // system calls only: the parent has threads running
    for (int i = 0; i < n; ++i) {
      int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      if (::connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) ::_exit(2);
    }
    char byte = 1;
    if (::write(ready[1], &byte, 1) != 1) ::_exit(3);
    ::pause();
    ::_exit(0);
  }
  ::close(ready[1]);
  char byte = 0;
  if (::read(ready[0], &byte, 1) != 1) child = -1;
  ::close(ready[0]);
  return child;
}

void Kill(pid_t child) {
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
}

class MessageServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    options_.socketDirectory = folder_.path() + "/sockets";
    options_.serviceName = "com.example.test";
    options_.useSocketActivation = false;
  }

  // A listener whose connections answer each request with its own body plus
  // "echo": true, and count their connection-invalid events.
  std::unique_ptr<Listener> EchoListener() {
    return testing::StartStandInListener(
        options_.socketDirectory, options_.serviceName, &queue_,
        [invalid = invalid_](const std::shared_ptr<PeerConnection>& conn,
                             const ConnectionEvent& e) {
          if (e.kind == ConnectionEvent::Kind::kConnectionInvalid) {
            (*invalid)++;
            return;
          }
          if (conn && e.message.wantsReply) {
            conn->sendReply(e.message.serial, e.message.body.changing("echo", true));
          }
        },
        context_);
  }

  // Sends request `serial` and expects its echo.
  void ExpectEcho(Peer& peer, uint64_t serial) {
    ASSERT_TRUE(peer.send(serial, Value{{"n", serial}}));
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply) << serial;
    EXPECT_TRUE(reply->header.isReply());
    EXPECT_EQ(reply->header.replyTo, serial);
    EXPECT_EQ(reply->body, (Value{{"n", serial}, {"echo", true}}));
  }

  testing::TempFolder folder_;
  ListenerOptions options_;
  SerialQueue queue_{"ipc"};
  std::shared_ptr<int> context_ = std::make_shared<int>(7);
  std::shared_ptr<std::atomic<int>> invalid_ = std::make_shared<std::atomic<int>>(0);
};

TEST_F(MessageServiceTest, AnswersEachRequestWithOneBoundReplyInOrder) {
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  struct stat st;
  ASSERT_EQ(::stat(options_.socketDirectory.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);

  Peer peer(listener->path());
  ASSERT_TRUE(peer.connected());
  for (uint64_t serial : {5, 6, 9}) peer.send(serial, Value{{"n", serial}});
  peer.send(10, Value{{"n", 10}}, /*wantsReply=*/false);  // gets no reply
  peer.send(11, Value{{"n", 11}});
  uint64_t lastSerial = 0;
  for (uint64_t expected : {5, 6, 9, 11}) {
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply) << expected;
    EXPECT_TRUE(reply->header.isReply());
    EXPECT_EQ(reply->header.replyTo, expected);
    EXPECT_GT(reply->header.serial, lastSerial);
    lastSerial = reply->header.serial;
    EXPECT_EQ(reply->body, (Value{{"n", expected}, {"echo", true}}));
  }
}

// Every message holds its connection's budget until the last copy of it is
// gone, whether it wants a reply or not: at the limit the connection is not
// read, and a message let go lets the next one in.
TEST_F(MessageServiceTest, MessagesHoldTheirConnectionsBudgetUntilLetGo) {
  struct Held {  // outlives the test: the connection delivers until it ends
    std::mutex mu;
    std::condition_variable cv;
    std::vector<PeerMessage> messages;
  };
  auto held = std::make_shared<Held>();
  auto listener = testing::StartStandInListener(
      options_.socketDirectory, options_.serviceName, &queue_,
      [held](const std::shared_ptr<PeerConnection>&, const ConnectionEvent& e) {
        if (e.kind != ConnectionEvent::Kind::kMessage) return;
        std::lock_guard<std::mutex> lock(held->mu);
        held->messages.push_back(e.message);
        held->cv.notify_all();
      },
      context_);
  ASSERT_TRUE(listener);
  Peer peer(listener->path());
  for (uint64_t serial = 1; serial <= 100; ++serial) peer.send(serial, Value{{"n", serial}}, false);
  constexpr size_t kLimit = PeerConnection::kMaxMessagesInFlight;
  std::unique_lock<std::mutex> lock(held->mu);
  auto& messages = held->messages;
  ASSERT_TRUE(held->cv.wait_for(lock, 5s, [&] { return messages.size() >= kLimit; }));
  EXPECT_FALSE(held->cv.wait_for(lock, 300ms, [&] { return messages.size() > kLimit; }));
  messages.erase(messages.begin());
  ASSERT_TRUE(held->cv.wait_for(lock, 5s, [&] { return messages.size() == kLimit; }));
  EXPECT_EQ(messages.back().serial, kLimit + 1);
}

// Connections one after another are read by the loop that served earlier
// ones: nothing a connection left behind (a cut frame, a protocol error, an
// unanswered request) may reach the next one or a connection beside it, and
// each ends with its one connection-invalid event and lets go of its context.
TEST_F(MessageServiceTest, ConnectionsEndAloneAndOneAfterAnotherStartClean) {
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  ScopedLogCapture log;
  const std::string request = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Value{{"n", 1}});
  const std::string badMagic = "DRM2" + std::string(28, '\0');
  // A protocol error closes only its own connection.
  Peer good(listener->path()), bad(listener->path());
  ExpectEcho(good, 1);
  bad.sendRaw(badMagic);
  EXPECT_TRUE(bad.sawEndOfStream());
  ExpectEcho(good, 2);
  EXPECT_TRUE(log.contains("protocol error on <connection"));
  EXPECT_TRUE(log.contains("bad magic"));
  EXPECT_TRUE(WaitUntil([&] { return *invalid_ >= 1 && context_.use_count() <= 2; }));
  EXPECT_EQ(*invalid_, 1);
  EXPECT_EQ(context_.use_count(), 2);  // the good connection still holds its own
  good.close();

  const struct {
    const char* name;
    std::string bytes;  // sent after the answered request, before hanging up
  } leftovers[] = {
      {"nothing", ""},
      {"half a header", request.substr(0, drm1::kHeaderSize / 2)},
      {"a header without its body", request.substr(0, drm1::kHeaderSize)},
      {"a frame without its last byte", request.substr(0, request.size() - 1)},
      {"bad magic", badMagic},
      {"an unanswered request",
       *drm1::EncodeFrame(1000, 0, drm1::kFlagWantsReply, Value{{"n", 1000}})},
  };
  int ended = 2;
  for (int round = 0; round < 5; ++round) {
    for (const auto& leftover : leftovers) {
      SCOPED_TRACE(leftover.name);
      Peer peer(listener->path());
      ExpectEcho(peer, static_cast<uint64_t>(100 + ended));
      if (!leftover.bytes.empty()) peer.sendRaw(leftover.bytes);
      ++ended;
    }
  }
  EXPECT_TRUE(WaitUntil([&] { return *invalid_ >= ended && context_.use_count() <= 1; }));
  EXPECT_EQ(*invalid_, ended);
  EXPECT_EQ(context_.use_count(), 1) << "a finished connection kept its context";
}

TEST_F(MessageServiceTest, ReplacesAStaleSocketButNeverALiveOneOrAnotherFile) {
  // A live listener holds the name.
  auto live = EchoListener();
  ASSERT_TRUE(live);
  Result<std::unique_ptr<Listener>> second = Listener::Create(options_, &queue_);
  ASSERT_FALSE(second);
  EXPECT_EQ(second.error().code(), EADDRINUSE);

  // A socket file nobody accepts on is left over from a daemon that died.
  const std::string path = live->path();
  int stale = ::socket(AF_UNIX, SOCK_STREAM, 0);
  live.reset();
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  ASSERT_EQ(::bind(stale, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr), 0);
  ::close(stale);
  auto replaced = EchoListener();
  ASSERT_TRUE(replaced);
  Peer peer(path);
  ExpectEcho(peer, 1);
  replaced.reset();

  // Anything else at the path is left alone.
  { std::ofstream(path) << "precious"; }
  ASSERT_FALSE(Listener::Create(options_, &queue_));
  std::ifstream in(path);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "precious");

  for (const char* bad : {"", "a/b", ".."}) {
    options_.serviceName = bad;
    EXPECT_FALSE(Listener::Create(options_, &queue_)) << bad;
  }
}

TEST_F(MessageServiceTest, APeerThatTakesNoRepliesIsNotReadAndThenClosed) {
  auto listener = Listener::Create(options_, &queue_);
  ASSERT_TRUE(listener);
  std::shared_ptr<PeerConnection> connection;
  std::atomic<int> delivered{0};
  std::mutex mu;
  (*listener)->setEventHandler([&](std::shared_ptr<PeerConnection> c) {
    c->setEventHandler([&](const ConnectionEvent& e) {
      if (e.kind == ConnectionEvent::Kind::kMessage) ++delivered;
    });
    c->resume();
    std::lock_guard<std::mutex> lock(mu);
    connection = c;
  });
  (*listener)->resume();
  Peer peer((*listener)->path());
  ASSERT_TRUE(WaitUntil([&] {
    std::lock_guard<std::mutex> lock(mu);
    return connection != nullptr;
  }));
  ScopedLogCapture log;
  const Value big = Value{{"blob", Value(Data(1 << 20, 0x5A))}};
  uint64_t serial = 0;
  auto flood = [&] {
    // Queuing never waits for the peer, which reads nothing: were it to
    // wait, this loop would never end.
    for (int i = 0; i < 80; ++i) EXPECT_TRUE(connection->sendReply(++serial, big).ok());
  };
  flood();
  EXPECT_TRUE(log.contains("more than 64 MiB of replies unread"));
  // Its requests wait while its replies do, and go once it takes them.
  peer.send(1, Value{{"request", "x"}});
  std::this_thread::sleep_for(300ms);
  EXPECT_EQ(delivered.load(), 0);
  for (int i = 0; i < 80; ++i) ASSERT_TRUE(peer.receive()) << i;
  EXPECT_TRUE(WaitUntil([&] { return delivered.load() != 0; }));
  EXPECT_EQ(delivered.load(), 1);
  EXPECT_TRUE(connection->isOpen());
  // Taking none of them for long ends it.
  flood();
  EXPECT_TRUE(
      WaitUntil([&] { return !connection->isOpen(); }, PeerConnection::kReplyStallLimit + 5s));
  EXPECT_TRUE(log.contains("took none of its replies for 30 s"));
}

TEST_F(MessageServiceTest, RefusesPeersOfAnotherUser) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to act as another user";
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  // Open the way for the other user, so that only drd's own check stands.
  ::chmod(options_.socketDirectory.c_str(), 0755);
  ::chmod(listener->path().c_str(), 0777);
  ::chmod(folder_.path().c_str(), 0755);
  ScopedLogCapture log;
  pid_t child = ::fork();
  if (child == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(3);
    Peer peer(listener->path());
    if (!peer.connected()) ::_exit(4);
    // The daemon may already have closed the socket; no reply may come.
    peer.send(1, Value{{"x", 1}});
    ::_exit(peer.receive(3s) ? 1 : 0);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_TRUE(log.contains("refusing peer pid"));
}

// A process that connects in a loop must not make another process's new
// connection wait behind all of its own: connections are handed over in
// turns by process. The handler is slow for the looping process's
// connections, so they pile up; the test's own must come within the first
// few turns instead of after all of them.
TEST_F(MessageServiceTest, NewPeersTakeTurnsByProcess) {
  auto listener = Listener::Create(options_, &queue_);
  ASSERT_TRUE(listener) << listener.error().description();
  std::mutex mu;
  std::vector<pid_t> order;
  (*listener)->setEventHandler([&](std::shared_ptr<PeerConnection> c) {
    if (c->pid() != ::getpid()) std::this_thread::sleep_for(20ms);
    std::lock_guard<std::mutex> lock(mu);
    order.push_back(c->pid());
  });
  (*listener)->resume();
  constexpr int kLooped = 40;
  const pid_t child = ConnectFromAnotherProcess((*listener)->path(), kLooped);
  ASSERT_GT(child, 0);
  Peer mine((*listener)->path());
  ASSERT_TRUE(mine.connected());
  WaitUntil([&] {
    std::lock_guard<std::mutex> lock(mu);
    return order.size() == kLooped + 1;
  });
  Kill(child);
  (*listener)->stop();
  queue_.sync([] {});
  std::lock_guard<std::mutex> lock(mu);
  ASSERT_EQ(order.size(), static_cast<size_t>(kLooped + 1));
  const auto at = std::find(order.begin(), order.end(), ::getpid()) - order.begin();
  EXPECT_LT(at, 5) << "the test's connection came after " << at << " of the other process's";
}

size_t OpenDescriptors() {
  size_t n = 0;
  for ([[maybe_unused]] const auto& e : std::filesystem::directory_iterator("/proc/self/fd")) ++n;
  return n;
}

// While connections are not handed over (the event queue is busy), no more
// than kMaxWaitingConnections are accepted; the rest wait in the backlog and
// all are handed over once the queue moves again.
TEST_F(MessageServiceTest, AcceptsNoMoreThanTheWaitingLimitWhileTheQueueIsBusy) {
  auto listener = Listener::Create(options_, &queue_);
  ASSERT_TRUE(listener) << listener.error().description();
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  std::atomic<size_t> handed{0};
  (*listener)->setEventHandler([&](std::shared_ptr<PeerConnection>) {
    if (handed++ == 0) released.wait();
  });
  const size_t base = OpenDescriptors();
  (*listener)->resume();
  constexpr size_t kPeers = 2 * Listener::kMaxWaitingConnections;
  const pid_t child = ConnectFromAnotherProcess((*listener)->path(), static_cast<int>(kPeers));
  ASSERT_GT(child, 0);
  // Each accepted connection holds its socket, a wake-up descriptor and, where
  // the kernel gives one, a pidfd: at most three.
  const size_t limit = 3 * (Listener::kMaxWaitingConnections + 1) + 8;
  WaitUntil([&] { return OpenDescriptors() - base >= kPeers; }, 2s);
  std::this_thread::sleep_for(200ms);  // room for the listener to overrun, were it to
  EXPECT_LE(OpenDescriptors() - base, limit);
  release.set_value();
  EXPECT_TRUE(WaitUntil([&] { return handed == kPeers; }));
  Kill(child);
  (*listener)->stop();
  queue_.sync([] {});
}

}  // namespace
}  // namespace dr
