// The client library against the real drd, started in a fresh temporary
// environment.
#include <gtest/gtest.h>
#include <signal.h>

#include "client/include/drd/connection.h"
#include "tests/support/drm1_peer.h"
#include "tests/support/process_fixtures.h"

namespace dr::client {
namespace {

using namespace std::chrono_literals;

TEST(DrdClientTest, RequestsGetTheirRepliesUntilDrdGoesAway) {
  dr::testing::TempFolder root;
  dr::testing::DrdProcess drd(root.path(), {"-S", "com.example.drd"});
  ASSERT_TRUE(drd.waitUntilServing("com.example.drd")) << drd.standardError();
  auto connection = Connection::Open("com.example.drd", root.path() + "/sockets");
  ASSERT_TRUE(connection) << connection.error().description();
  Connection& c = **connection;

  struct Row {
    Value message;
    Value error;
  };
  const std::vector<Row> rows = {
      {Value{{"request", "frobnicate"}, {"version", uint64_t{2}}}, Value("unrecognized request")},
      {Value{{"request", "match"}, {"version", uint64_t{3}}},
       Value("unsupported protocol version 3 (need 2)")},
      {Value{{"version", uint64_t{2}}}, Value("invalid request format (missing type)")},
  };
  // A message wanting no reply in between leaves no reply behind to be
  // mistaken for the next request's.
  ASSERT_TRUE(c.send(Value{{"request", "match"}}).ok());
  for (const Row& row : rows) {
    Result<Value> reply = c.request(row.message, 10s);
    ASSERT_TRUE(reply) << reply.error().description();
    EXPECT_EQ((*reply)["error"], row.error) << reply->description();
  }

  ASSERT_TRUE(drd.signal(SIGTERM));
  EXPECT_EQ(drd.waitForExit(), 0) << drd.standardError();
  Result<Value> gone = c.request(rows[0].message, 10s);
  ASSERT_FALSE(gone);
  EXPECT_EQ(gone.error().domain(), kClientErrorDomain);
  EXPECT_EQ(gone.error().code(), kConnectionClosed) << gone.error().description();
  EXPECT_FALSE(c.isOpen());
  EXPECT_FALSE(Connection::Open("com.example.drd", root.path() + "/sockets"));
}

}  // namespace
}  // namespace dr::client
