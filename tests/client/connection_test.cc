#include "client/include/drd/connection.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
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

TEST_F(ConnectionTest, EachRequestGetsItsOwnReplyAndSerialsIncrease) {
  auto connection = Open();
  ASSERT_TRUE(connection) << connection.error().description();
  Connection& c = **connection;
  // Mixed: messages without reply between requests must not shift replies.
  ASSERT_TRUE(c.send(Value{{"n", 1}}).ok());
  for (int n = 2; n <= 4; ++n) {
    Result<Value> reply = c.request(Value{{"n", n}}, 5s);
    ASSERT_TRUE(reply) << reply.error().description();
    EXPECT_EQ((*reply)["n"], Value(n));
  }
  ASSERT_TRUE(c.send(Value{{"n", 5}}).ok());
  Result<Value> last = c.request(Value{{"n", 6}}, 5s);
  ASSERT_TRUE(last);
  EXPECT_EQ((*last)["n"], Value(6));

  std::lock_guard<std::mutex> lock(mu_);
  const std::vector<bool> wantsReply = {false, true, true, true, false, true};
  ASSERT_EQ(seen_.size(), wantsReply.size());
  uint64_t previous = 0;
  for (size_t i = 0; i < seen_.size(); ++i) {
    EXPECT_GT(seen_[i].first, previous) << i;
    previous = seen_[i].first;
    EXPECT_EQ(seen_[i].second, wantsReply[i]) << i;
  }
}

// The late reply to a request that timed out arrives before the next
// request's reply; it must be skipped, not handed to the wrong caller.
TEST_F(ConnectionTest, TimeoutLeavesTheConnectionUsableAndSkipsTheLateReply) {
  auto connection = Open();
  ASSERT_TRUE(connection);
  Connection& c = **connection;
  Result<Value> slow = c.request(Value{{"do", "sleep"}, {"ms", 400}, {"n", 1}}, 100ms);
  ASSERT_FALSE(slow);
  EXPECT_EQ(slow.error().domain(), kClientErrorDomain);
  EXPECT_EQ(slow.error().code(), kTimeout);
  Result<Value> ignored = c.request(Value{{"do", "ignore"}}, 50ms);
  ASSERT_FALSE(ignored);
  EXPECT_EQ(ignored.error().code(), kTimeout);
  EXPECT_TRUE(c.isOpen());

  Result<Value> next = c.request(Value{{"n", 2}}, 5s);
  ASSERT_TRUE(next) << next.error().description();
  EXPECT_EQ((*next)["n"], Value(2));
}

// Several threads share one connection; each gets the reply to its own
// request.
TEST_F(ConnectionTest, ConcurrentCallersEachGetTheirOwnReply) {
  auto connection = Open();
  ASSERT_TRUE(connection);
  Connection& c = **connection;
  std::atomic<int> wrong{0}, failed{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 50; ++i) {
        Result<Value> reply = c.request(Value{{"t", t}, {"i", i}}, 5s);
        if (!reply) {
          failed++;
        } else if ((*reply)["t"] != Value(t) || (*reply)["i"] != Value(i)) {
          wrong++;
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failed, 0);
  EXPECT_EQ(wrong, 0);
}

TEST_F(ConnectionTest, FailuresAreReturnedErrors) {
  struct Row {
    const char* what;
    std::function<Result<Value>(Connection&)> call;
    int64_t code;
    bool staysOpen;
  };
  const std::vector<Row> rows = {
      {"closed by the daemon",
       [](Connection& c) {
         return c.request(Value{{"do", "hang up"}});
       },
       kConnectionClosed, false},
      {"timeout",
       [](Connection& c) {
         return c.request(Value{{"do", "ignore"}}, 100ms);
       },
       kTimeout, true},
  };
  for (const Row& row : rows) {
    auto connection = Open();
    ASSERT_TRUE(connection) << row.what;
    Result<Value> result = row.call(**connection);
    ASSERT_FALSE(result) << row.what;
    EXPECT_EQ(result.error().domain(), kClientErrorDomain) << row.what;
    EXPECT_EQ(result.error().code(), row.code) << result.error().description();
    EXPECT_EQ((*connection)->isOpen(), row.staysOpen) << row.what;
    if (!row.staysOpen) {
      EXPECT_EQ(result.error().localizedDescription(), "connection closed by drd");
      // A dead connection keeps failing; it never hangs or crashes.
      Result<Value> again = (*connection)->request(Value{{"n", 1}}, 5s);
      ASSERT_FALSE(again) << row.what;
      EXPECT_EQ(again.error().code(), row.code) << row.what;
      EXPECT_FALSE((*connection)->send(Value{{"n", 1}}).ok()) << row.what;
    }
  }
}

TEST_F(ConnectionTest, MessagesThatCannotBeSentSendNothing) {
  auto connection = Open();
  ASSERT_TRUE(connection);
  const std::vector<std::pair<const char*, Value>> rows = {
      {"not a dictionary", Value(Array{Value(1)})},
      {"text that is not UTF-8", Value{{"s", std::string("\xC3\x28")}}},
  };
  for (const auto& [what, message] : rows) {
    EXPECT_FALSE((*connection)->request(message, 1s)) << what;
    EXPECT_FALSE((*connection)->send(message).ok()) << what;
  }
  Result<Value> reply = (*connection)->request(Value{{"n", 1}}, 5s);
  ASSERT_TRUE(reply) << reply.error().description();
  std::lock_guard<std::mutex> lock(mu_);
  EXPECT_EQ(seen_.size(), 1u);
}

TEST_F(ConnectionTest, OpenFailsWithoutAListeningSocket) {
  const std::vector<std::pair<std::string, std::string>> rows = {
      {"no.such.service", folder_.path() + "/sockets"},
      {kService, folder_.path() + "/missing"},
      {kService, folder_.path() + "/" + std::string(200, 'x')},
      {"", folder_.path() + "/sockets"},
  };
  for (const auto& [service, directory] : rows) {
    Result<std::unique_ptr<Connection>> connection = Connection::Open(service, directory);
    ASSERT_FALSE(connection) << service << " in " << directory;
    EXPECT_EQ(connection.error().domain(), kPosixErrorDomain);
  }
}

}  // namespace
}  // namespace dr::client
