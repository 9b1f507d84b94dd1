#include "client/include/drd/connection.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <thread>
#include <vector>

#include "core/queue.h"
#include "platform/message_service.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/stand_in_listener.h"

namespace dr::client {
namespace {

using namespace std::chrono_literals;

// A real listener whose connections act on each message's "do":
//   "echo" (or nothing): reply with the body plus the request's serial;
//   "hang up": close the connection without a reply;
//   "sleep": wait "ms" milliseconds, then echo;
//   "ignore": no reply.
// Every message is recorded (serial, wants-reply).
class ConnectionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    listener_ = testing::StartStandInListener(
        folder_.path() + "/sockets", kService, &queue_,
        [this](const std::shared_ptr<PeerConnection>& conn, const ConnectionEvent& e) {
          if (e.kind != ConnectionEvent::Kind::kMessage || !conn) return;
          {
            std::lock_guard<std::mutex> lock(mu_);
            seen_.emplace_back(e.message.serial, e.message.wantsReply);
          }
          const Value& what = e.message.body["do"];
          if (what == Value("hang up")) return conn->cancel();
          if (what == Value("ignore") || !e.message.wantsReply) return;
          if (what == Value("sleep")) {
            std::this_thread::sleep_for(std::chrono::milliseconds(e.message.body["ms"].intValue()));
          }
          conn->sendReply(e.message.serial, e.message.body.changing("serial", e.message.serial));
        });
    ASSERT_TRUE(listener_);
  }

  Result<std::unique_ptr<Connection>> Open() {
    return Connection::Open(kService, folder_.path() + "/sockets");
  }

  static constexpr const char* kService = "com.example.client-test";
  testing::TempFolder folder_;
  SerialQueue queue_{"ipc"};
  std::unique_ptr<Listener> listener_;
  std::mutex mu_;
  std::vector<std::pair<uint64_t, bool>> seen_;  // guarded by mu_
};

// The late reply to a request that timed out arrives before the next
// request's reply; it must be skipped, not handed to the wrong caller. A
// connection the daemon closes fails every call after, and never hangs.
TEST_F(ConnectionTest, TimeoutSkipsTheLateReplyAndClosingFailsEveryCall) {
  auto connection = Open();
  ASSERT_TRUE(connection);
  Connection& c = **connection;
  Result<Value> slow = c.request(Value{{"do", "sleep"}, {"ms", 400}, {"n", 1}}, 100ms);
  EXPECT_EQ(slow.ok() ? "" : slow.error().domain(), kClientErrorDomain);
  EXPECT_EQ(slow.ok() ? 0 : slow.error().code(), kTimeout);
  Result<Value> ignored = c.request(Value{{"do", "ignore"}}, 50ms);
  EXPECT_EQ(ignored.ok() ? 0 : ignored.error().code(), kTimeout);
  EXPECT_TRUE(c.isOpen());
  EXPECT_EQ(c.request(Value{{"n", 2}}, 5s).value_or(Value())["n"], Value(2));

  Result<Value> closed = c.request(Value{{"do", "hang up"}});
  ASSERT_FALSE(closed);
  EXPECT_EQ(closed.error(),
            Error(kClientErrorDomain, kConnectionClosed, "connection closed by drd"));
  EXPECT_FALSE(c.isOpen());
  EXPECT_EQ(c.request(Value{{"n", 1}}, 5s).status().error().code(), kConnectionClosed);
  EXPECT_FALSE(c.send(Value{{"n", 1}}).ok());
}

// Several threads share one connection; each gets the reply to its own
// request.
TEST_F(ConnectionTest, ConcurrentCallersEachGetTheirOwnReply) {
  auto connection = Open();
  ASSERT_TRUE(connection);
  Connection& c = **connection;
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 50; ++i) {
        Result<Value> reply = c.request(Value{{"t", t}, {"i", i}}, 5s);
        if (!reply || (*reply)["t"] != Value(t) || (*reply)["i"] != Value(i)) wrong++;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
}

TEST_F(ConnectionTest, MessagesThatCannotBeSentSendNothing) {
  auto connection = Open();
  ASSERT_TRUE(connection);
  for (const Value& message : {Value(Array{Value(1)}), Value{{"s", std::string("\xC3\x28")}}}) {
    EXPECT_FALSE((*connection)->request(message, 1s)) << message.description();
    EXPECT_FALSE((*connection)->send(message).ok()) << message.description();
  }
  ASSERT_TRUE((*connection)->request(Value{{"n", 1}}, 5s));
  std::lock_guard<std::mutex> lock(mu_);
  EXPECT_EQ(seen_.size(), 1u);
}

TEST_F(ConnectionTest, OpenFailsWithoutAListeningSocket) {
  const std::string sockets = folder_.path() + "/sockets";
  const std::pair<std::string, std::string> rows[] = {
      {"no.such.service", sockets},
      {kService, folder_.path() + "/missing"},
      {kService, folder_.path() + "/" + std::string(200, 'x')},
      {"", sockets},
  };
  for (const auto& [service, directory] : rows) {
    Result<std::unique_ptr<Connection>> connection = Connection::Open(service, directory);
    EXPECT_EQ(connection.ok() ? "" : connection.error().domain(), kPosixErrorDomain)
        << service << " in " << directory;
  }
}

}  // namespace
}  // namespace dr::client
