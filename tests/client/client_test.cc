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

Value Form(const std::string& identifier, const Uuid& uuid) {
  return Value{{"identifier", identifier},
               {"path", "/p/" + identifier},
               {"uuid", uuid.string()},
               {"version", "2"},
               {"annotations", Value{{"election", 1}}}};
}

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
// error reply into an error with drd's code and text.
TEST_F(ClientTest, CallsSendTheirRequestAndRelayDrdsErrors) {
  struct Row {
    std::function<Status(Client&)> call;
    Value request;  // without "version"
  };
  const Value uuids(Array{kA, kB});
  const std::vector<Row> rows = {
      {[](Client& c) {
         return c.addPlugIns({"/a", "/b"});
       },
       Value{{"request", "add"}, {"paths", Value(Array{"/a", "/b"})}}},
      {[](Client& c) { return c.removePlugIns({}); },
       Value{{"request", "remove"}, {"paths", Value::EmptyArray()}}},
      {[](Client& c) { return c.bulk(3); }, Value{{"request", "bulk"}, {"flags", uint64_t{3}}}},
      {[](Client& c) { return c.match(Value(), kDiscoverHybrid).status(); },
       Value{{"request", "match"}, {"flags", uint64_t{0x100}}}},
      {[](Client& c) {
         return c.match(Value{{"k", "v"}}).status();
       },
       Value{{"request", "match"}, {"flags", uint64_t{0}}, {"rules", Value{{"k", "v"}}}}},
      {[](Client& c) {
         return c.ready({kA, kB});
       },
       Value{{"request", "ready"}, {"uuids", uuids}}},
      {[](Client& c) { return c.access({kA}).status(); },
       Value{{"request", "access"}, {"uuids", Value(Array{kA})}}},
      {[](Client& c) {
         return c.annotate({kA}, {kElectionIgnore, Value{{"s", 1}}});
       },
       Value{{"request", "annotate"},
             {"uuids", Value(Array{kA})},
             {"annotations", Value{{"election", -1}, {"extension", Value{{"s", 1}}}}}}},
      {[](Client& c) { return c.annotate({}, {}); },
       Value{{"request", "annotate"},
             {"uuids", Value::EmptyArray()},
             {"annotations", Value::EmptyDictionary()}}},
      {[](Client& c) { return c.hold(HoldTarget::kApplication, {"/A.app"}).status(); },
       Value{{"request", "lock"}, {"flags", uint64_t{1}}, {"paths", Value(Array{"/A.app"})}}},
      {[](Client& c) { return c.release({kB}); },
       Value{{"request", "lock"}, {"uuids", Value(Array{kB})}}},
  };
  for (const Row& row : rows) {
    answer(Value{{"errorcode", uint64_t{9}}, {"error", "bad path"}});
    Status s = row.call(*client_);
    EXPECT_EQ(sent(), row.request.changing("version", uint64_t{2}));
    ASSERT_FALSE(s.ok()) << row.request.description();
    EXPECT_EQ(s.error(), Error(kDaemonErrorDomain, 9, "bad path"));
  }
  // An error code without a text still fails, with a text of its own.
  answer(Value{{"errorcode", uint64_t{14}}});
  EXPECT_EQ(client_->ready({kA}).error().localizedDescription(), "drd error 14");
}

TEST_F(ClientTest, RepliesAreReadIntoTypedResults) {
  answer(Value{{"matches", Value(Array{Form("com.example.a", kA), Form("com.example.b", kB)})}});
  Result<std::vector<PlugIn>> found = client_->match(Value());
  ASSERT_TRUE(found) << found.error().description();
  ASSERT_EQ(found->size(), 2u);
  EXPECT_EQ((*found)[1].identifier, "com.example.b");
  EXPECT_EQ((*found)[1].uuid, kB);
  EXPECT_EQ((*found)[1].election(), Election::kElected);

  answer(Value{{"extensions", Value(Array{"t1", "t2"})}});
  EXPECT_EQ(*client_->access({kA, kB}), (std::vector<std::string>{"t1", "t2"}));

  answer(Value{{"uuids", kB}});
  EXPECT_EQ(*client_->hold(HoldTarget::kPlugIn, {"/p"}), kB);

  // A refused hold hands over what is busy.
  answer(Value{{"errorcode", uint64_t{14}},
               {"error", "plug-ins are busy"},
               {"conflicts", Value(Array{"com.example.a 2 /p"})}});
  std::vector<Value> conflicts;
  Result<Uuid> busy = client_->hold(HoldTarget::kApplication, {"/A.app"}, &conflicts);
  ASSERT_FALSE(busy);
  EXPECT_EQ(busy.error().code(), kErrorBusy);
  EXPECT_EQ(conflicts, std::vector<Value>{Value("com.example.a 2 /p")});

  // send() hands back error replies as they are.
  answer(Value{{"errorcode", uint64_t{4}}, {"error", "unrecognized request"}});
  Result<Value> raw = client_->send(Value{{"request", "x"}});
  ASSERT_TRUE(raw);
  EXPECT_EQ((*raw)["errorcode"], Value(4));
}

TEST_F(ClientTest, RepliesMissingWhatWasPromisedAreErrors) {
  struct Row {
    Value reply;
    std::function<Status(Client&)> call;
  };
  const std::vector<Row> rows = {
      {Value::EmptyDictionary(), [](Client& c) { return c.match(Value()).status(); }},
      {Value{{"matches", Value(Array{Value{{"identifier", "a"}}})}},
       [](Client& c) { return c.match(Value()).status(); }},
      {Value{{"extensions", Value(Array{"only one"})}},
       [](Client& c) {
         return c.access({kA, kB}).status();
       }},
      {Value{{"extensions", Value(Array{1})}}, [](Client& c) { return c.access({kA}).status(); }},
      {Value{{"uuids", kA.string()}},
       [](Client& c) { return c.hold(HoldTarget::kPlugIn, {"/p"}).status(); }},
  };
  for (const Row& row : rows) {
    answer(row.reply);
    Status s = row.call(*client_);
    ASSERT_FALSE(s.ok()) << row.reply.description();
    EXPECT_EQ(s.error().domain(), kClientErrorDomain);
    EXPECT_EQ(s.error().code(), kUnexpectedReply);
  }
}

}  // namespace
}  // namespace dr::client
