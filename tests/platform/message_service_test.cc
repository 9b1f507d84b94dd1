#include "platform/message_service.h"

#include <gtest/gtest.h>
#include <poll.h>
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
#include <future>
#include <thread>
#include <vector>

#include "core/log.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/stand_in_listener.h"

namespace dr {
namespace {

using namespace std::chrono_literals;

// A blocking test peer speaking DRM1 on a real socket.
class Peer {
 public:
  explicit Peer(const std::string& path) {
    fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    connected_ = ::connect(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) == 0;
  }
  ~Peer() { ::close(fd_); }
  bool connected() const { return connected_; }
  int fd() const { return fd_; }

  void sendRaw(const std::string& bytes) {
    ASSERT_EQ(::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(bytes.size()));
  }
  void sendRequest(uint64_t serial, const Value& body) {
    sendRaw(*drm1::EncodeFrame(serial, 0, drm1::kFlagWantsReply, body));
  }
  // The next frame, or nothing on EOF, error or timeout.
  std::optional<drm1::Frame> receive(std::chrono::milliseconds timeout = 5s) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      Result<std::optional<drm1::Frame>> f = decoder_.next();
      if (!f) return std::nullopt;
      if (f->has_value()) return std::move(**f);
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      struct pollfd p = {fd_, POLLIN, 0};
      if (left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
        return std::nullopt;
      }
      char buf[65536];
      ssize_t n = ::recv(fd_, buf, sizeof buf, 0);
      if (n <= 0) {
        eof_ = true;
        return std::nullopt;
      }
      decoder_.feed(std::string_view(buf, static_cast<size_t>(n)));
    }
  }
  bool sawEof() {
    while (!eof_ && receive(2s)) {
    }
    return eof_;
  }

 private:
  int fd_ = -1;
  bool connected_ = false;
  bool eof_ = false;
  drm1::FrameDecoder decoder_{drm1::kFromDaemon};
};

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
  for (uint64_t serial : {5, 6, 9}) peer.sendRequest(serial, Value{{"n", serial}});
  // A message that wants no reply gets none.
  peer.sendRaw(*drm1::EncodeFrame(10, 0, 0, Value{{"n", 10}}));
  peer.sendRequest(11, Value{{"n", 11}});
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
  for (uint64_t serial = 1; serial <= 100; ++serial) {
    peer.sendRaw(*drm1::EncodeFrame(serial, 0, 0, Value{{"n", serial}}));
  }
  constexpr size_t kLimit = PeerConnection::kMaxMessagesInFlight;
  std::unique_lock<std::mutex> lock(held->mu);
  auto& messages = held->messages;
  ASSERT_TRUE(held->cv.wait_for(lock, 5s, [&] { return messages.size() >= kLimit; }));
  EXPECT_FALSE(held->cv.wait_for(lock, 300ms, [&] { return messages.size() > kLimit; }));
  messages.erase(messages.begin());
  ASSERT_TRUE(held->cv.wait_for(lock, 5s, [&] { return messages.size() == kLimit; }));
  EXPECT_EQ(messages.back().serial, kLimit + 1);
}

TEST_F(MessageServiceTest, ProtocolErrorClosesOnlyThatConnectionAndReleasesItsContext) {
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  ScopedLogCapture log;
  Peer good(listener->path()), bad(listener->path());
  good.sendRequest(1, Value{{"a", 1}});
  ASSERT_TRUE(good.receive());
  bad.sendRaw("DRM2" + std::string(28, '\0'));
  EXPECT_TRUE(bad.sawEof());
  good.sendRequest(2, Value{{"a", 2}});
  std::optional<drm1::Frame> reply = good.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->header.replyTo, 2u);
  EXPECT_TRUE(log.contains("protocol error on <connection"));
  EXPECT_TRUE(log.contains("bad magic"));

  // Each connection that ends delivers one connection-invalid event and then
  // lets go of its context; the good connection still holds its own.
  for (int i = 0; i < 200 && (*invalid_ < 1 || context_.use_count() > 2); ++i) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(*invalid_, 1);
  EXPECT_EQ(context_.use_count(), 2);
}

// Connections one after another are read by the loop that served earlier
// ones: nothing a connection left behind (a cut frame, a protocol error, an
// unanswered request) may reach the next one, and each still ends with its
// one connection-invalid event and lets go of its context.
TEST_F(MessageServiceTest, ConnectionsOneAfterAnotherStartClean) {
  auto listener = EchoListener();
  ASSERT_TRUE(listener);
  ScopedLogCapture log;
  const std::string request = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Value{{"n", 1}});
  struct Leftover {
    const char* name;
    std::string bytes;  // sent after the answered request, before hanging up
  };
  const std::vector<Leftover> leftovers = {
      {"nothing", ""},
      {"half a header", request.substr(0, drm1::kHeaderSize / 2)},
      {"a header without its body", request.substr(0, drm1::kHeaderSize)},
      {"a frame without its last byte", request.substr(0, request.size() - 1)},
      {"bad magic", "DRM2" + std::string(28, '\0')},
      {"an unanswered request",
       *drm1::EncodeFrame(1000, 0, drm1::kFlagWantsReply, Value{{"n", 1000}})},
  };
  int ended = 0;
  for (int round = 0; round < 5; ++round) {
    for (const Leftover& leftover : leftovers) {
      SCOPED_TRACE(leftover.name);
      Peer peer(listener->path());
      ASSERT_TRUE(peer.connected());
      const uint64_t serial = static_cast<uint64_t>(100 + ended);
      peer.sendRequest(serial, Value{{"n", serial}});
      std::optional<drm1::Frame> reply = peer.receive();
      ASSERT_TRUE(reply);
      EXPECT_EQ(reply->header.replyTo, serial);
      EXPECT_EQ(reply->body, (Value{{"n", serial}, {"echo", true}}));
      if (!leftover.bytes.empty()) peer.sendRaw(leftover.bytes);
      ++ended;
    }
  }
  for (int i = 0; i < 500 && (*invalid_ < ended || context_.use_count() > 1); ++i) {
    std::this_thread::sleep_for(10ms);
  }
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
  peer.sendRequest(1, Value{{"x", 1}});
  EXPECT_TRUE(peer.receive());
  replaced.reset();

  // Anything else at the path is left alone.
  { std::ofstream(path) << "precious"; }
  Result<std::unique_ptr<Listener>> onFile = Listener::Create(options_, &queue_);
  ASSERT_FALSE(onFile);
  std::ifstream in(path);
  std::string content((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  EXPECT_EQ(content, "precious");

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
  std::condition_variable cv;
  (*listener)->setEventHandler([&](std::shared_ptr<PeerConnection> c) {
    c->setEventHandler([&](const ConnectionEvent& e) {
      if (e.kind == ConnectionEvent::Kind::kMessage) ++delivered;
    });
    c->resume();
    std::lock_guard<std::mutex> lock(mu);
    connection = c;
    cv.notify_all();
  });
  (*listener)->resume();
  Peer peer((*listener)->path());
  {
    std::unique_lock<std::mutex> lock(mu);
    ASSERT_TRUE(cv.wait_for(lock, 5s, [&] { return connection != nullptr; }));
  }
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
  peer.sendRequest(1, Value{{"request", "x"}});
  std::this_thread::sleep_for(300ms);
  EXPECT_EQ(delivered.load(), 0);
  for (int i = 0; i < 80; ++i) ASSERT_TRUE(peer.receive()) << i;
  for (int i = 0; i < 100 && delivered.load() == 0; ++i) std::this_thread::sleep_for(50ms);
  EXPECT_EQ(delivered.load(), 1);
  EXPECT_TRUE(connection->isOpen());
  // Taking none of them for long ends it.
  flood();
  const auto deadline = std::chrono::steady_clock::now() + PeerConnection::kReplyStallLimit + 5s;
  while (connection->isOpen() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(100ms);
  }
  EXPECT_FALSE(connection->isOpen());
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
    std::string frame = *drm1::EncodeFrame(1, 0, drm1::kFlagWantsReply, Value{{"x", 1}});
    [[maybe_unused]] ssize_t sent = ::send(peer.fd(), frame.data(), frame.size(), MSG_NOSIGNAL);
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
// turns by process. The handler is made slow for the looping process's
// connections, so they pile up; the test's own connection must come within
// the first few turns instead of after all of them.
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
  int ready[2];
  ASSERT_EQ(::pipe(ready), 0);
  // The child only makes system calls: the parent has threads running.
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, (*listener)->path().c_str(), sizeof addr.sun_path - 1);
  pid_t child = ::fork();
  if (child == 0) {
    for (int i = 0; i < kLooped; ++i) {
      int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      if (::connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) ::_exit(2);
    }
    char byte = 1;
    if (::write(ready[1], &byte, 1) != 1) ::_exit(3);
    ::pause();  // keep the connections open until the parent is done
    ::_exit(0);
  }
  ::close(ready[1]);
  char byte = 0;
  ASSERT_EQ(::read(ready[0], &byte, 1), 1);
  ::close(ready[0]);
  Peer mine((*listener)->path());
  ASSERT_TRUE(mine.connected());
  for (int i = 0; i < 500; ++i) {
    {
      std::lock_guard<std::mutex> lock(mu);
      if (order.size() == kLooped + 1) break;
    }
    std::this_thread::sleep_for(10ms);
  }
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
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
  constexpr int kPeers = 2 * Listener::kMaxWaitingConnections;
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, (*listener)->path().c_str(), sizeof addr.sun_path - 1);
  int ready[2];
  ASSERT_EQ(::pipe(ready), 0);
  pid_t child = ::fork();
  if (child == 0) {  // system calls only: the parent has threads running
    for (int i = 0; i < kPeers; ++i) {
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
  ASSERT_EQ(::read(ready[0], &byte, 1), 1);
  ::close(ready[0]);
  // Each accepted connection holds its socket, a wake-up descriptor and, where
  // the kernel gives one, a pidfd: at most three.
  const size_t limit = 3 * (Listener::kMaxWaitingConnections + 1) + 8;
  for (int i = 0; i < 100 && OpenDescriptors() - base < 2 * Listener::kMaxWaitingConnections; ++i) {
    std::this_thread::sleep_for(20ms);
  }
  std::this_thread::sleep_for(200ms);  // room for the listener to overrun, were it to
  EXPECT_LE(OpenDescriptors() - base, limit);
  release.set_value();
  for (int i = 0; i < 500 && handed < static_cast<size_t>(kPeers); ++i) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(handed, static_cast<size_t>(kPeers));
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
  (*listener)->stop();
  queue_.sync([] {});
}

}  // namespace
}  // namespace dr
