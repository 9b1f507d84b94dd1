#include "client/include/drd/client.h"

#include <gtest/gtest.h>

#include <functional>
#include <mutex>

#include "core/queue.h"
#include "platform/message_service.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/stand_in_listener.h"

namespace dr::client {
namespace {

const Uuid kA = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
const Uuid kB = *Uuid::parse("00000000-0000-4000-8000-000000000001");

// A stand-in for drd on a real socket: records each message and answers it
// with the reply the test set.
class ClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    listener_ = testing::StartStandInListener(
        folder_.path() + "/sockets", "com.example.client", &queue_,
        [this](const std::shared_ptr<PeerConnection>& conn, const ConnectionEvent& e) {
          if (e.kind != ConnectionEvent::Kind::kMessage || !conn) return;
          std::lock_guard<std::mutex> lock(mu_);
          sent_ = e.message.body;
          conn->sendReply(e.message.serial, reply_);
        });
    ASSERT_TRUE(listener_);
    auto client = Client::Open("com.example.client", folder_.path() + "/sockets");
    ASSERT_TRUE(client) << client.error().description();
    client_ = std::move(*client);
  }

  void answer(Value reply) {
    std::lock_guard<std::mutex> lock(mu_);
    reply_ = std::move(reply);
  }
  Value sent() {
    std::lock_guard<std::mutex> lock(mu_);
    return sent_;
  }

  testing::TempFolder folder_;
  SerialQueue queue_{"ipc"};
  std::unique_ptr<Listener> listener_;
  std::unique_ptr<Client> client_;
  std::mutex mu_;
  Value sent_;   // guarded by mu_
  Value reply_;  // guarded by mu_
};

// Each call sends its request with the protocol version, and turns drd's
// error reply into an error with drd's code and text. (drkit's end-to-end
// tests send the other requests through this library to the real drd.)
TEST_F(ClientTest, CallsSendTheirRequestAndRelayDrdsErrors) {
  const std::pair<std::function<Status(Client&)>, Value> rows[] = {
      {[](Client& c) { return c.bulk(3); }, Value{{"request", "bulk"}, {"flags", uint64_t{3}}}},
      {[](Client& c) { return c.match(Value(), kDiscoverHybrid).status(); },
       Value{{"request", "match"}, {"flags", uint64_t{0x100}}}},
      {[](Client& c) {
         return c.annotate({kA}, {kElectionIgnore, Value{{"s", 1}}});
       },
       Value{{"request", "annotate"},
             {"uuids", Value(Array{kA})},
             {"annotations", Value{{"election", -1}, {"extension", Value{{"s", 1}}}}}}},
      {[](Client& c) { return c.release({kB}); },
       Value{{"request", "lock"}, {"uuids", Value(Array{kB})}}},
  };
  for (const auto& [call, request] : rows) {
    answer(Value{{"errorcode", uint64_t{9}}, {"error", "bad path"}});
    Status s = call(*client_);
    EXPECT_EQ(sent(), request.changing("version", uint64_t{2}));
    EXPECT_EQ(s.ok() ? Error("", 0) : s.error(), Error(kDaemonErrorDomain, 9, "bad path"));
  }
  // An error code without a text still fails, with a text of its own.
  answer(Value{{"errorcode", uint64_t{14}}});
  EXPECT_EQ(client_->ready({kA}).error().localizedDescription(), "drd error 14");
}

// A refused hold hands over what is busy. (drkit's end-to-end tests read
// every other kind of reply through this library.)
TEST_F(ClientTest, RefusedHoldHandsOverTheConflicts) {
  answer(Value{{"errorcode", uint64_t{14}},
               {"error", "plug-ins are busy"},
               {"conflicts", Value(Array{"com.example.a 2 /p"})}});
  std::vector<Value> conflicts;
  Result<Uuid> busy = client_->hold(HoldTarget::kApplication, {"/A.app"}, &conflicts);
  EXPECT_EQ(busy.ok() ? 0 : busy.error().code(), kErrorBusy);
  EXPECT_EQ(conflicts, std::vector<Value>{Value("com.example.a 2 /p")});
}

TEST_F(ClientTest, RepliesMissingWhatWasPromisedAreErrors) {
  auto match = [](Client& c) { return c.match(Value()).status(); };
  const std::pair<Value, std::function<Status(Client&)>> rows[] = {
      {Value::EmptyDictionary(), match},
      {Value{{"matches", Value(Array{Value{{"identifier", "a"}}})}}, match},
      {Value{{"extensions", Value(Array{"only one"})}},
       [](Client& c) {
         return c.access({kA, kB}).status();
       }},
      {Value{{"extensions", Value(Array{1})}}, [](Client& c) { return c.access({kA}).status(); }},
      {Value{{"uuids", kA.string()}},
       [](Client& c) { return c.hold(HoldTarget::kPlugIn, {"/p"}).status(); }},
  };
  for (const auto& [reply, call] : rows) {
    answer(reply);
    Status s = call(*client_);
    EXPECT_EQ(s.ok() ? 0 : s.error().code(), kUnexpectedReply) << reply.description();
    EXPECT_EQ(s.ok() ? "" : s.error().domain(), kClientErrorDomain);
  }
}

}  // namespace
}  // namespace dr::client
