#include <unistd.h>

#include <chrono>
#include <filesystem>

#include <gtest/gtest.h>

#include "platform/sandbox.h"
#include "tests/integration/world.h"
#include "tests/support/process_fixtures.h"
#include "wire/protocol.h"

namespace dr::testing {
namespace {

using message::kDiscoverAllVersions;
using message::kDiscoverHybrid;
using message::kDiscoverSystemOnly;

class RequestsTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(w.start()) << w.log(); }
  Value lock(uint64_t flags, const std::string& path, client::Connection* c = nullptr) {
    return w.call(Request("lock", {{"flags", flags}, {"paths", Value(Array{Value(path)})}}), c);
  }

  World w;
};

// Pipelined, each request gets one reply bound to its serial, in order; failures: code and error.
TEST_F(RequestsTest, EachRequestGetsOneBoundReply) {
  const std::string a = w.makePlugIn("system/a.appex", "com.example.a");
  const Value v2(uint64_t{2});
  auto annotate = [](Dictionary annotations) {
    return Request("annotate", {{"annotations", Value(std::move(annotations))}, {"uuids", "junk"}});
  };
  const struct {
    Value request;
    uint64_t code;
    std::string error;
  } rows[] = {
      {Value{{"request", "match"}}, 7, "unsupported protocol version 0 (need 2)"},
      {Value{{"request", "match"}, {"version", uint64_t{3}}}, 7,
       "unsupported protocol version 3 (need 2)"},
      {Value{{"request", "match"}, {"version", "2"}}, 7, "unsupported protocol version 0 (need 2)"},
      {Value{{"version", v2}}, 4, "invalid request format (missing type)"},
      {Value{{"request", uint64_t{1}}, {"version", v2}}, 4,
       "invalid request format (missing type)"},
      {Request("Match"), 4, "unrecognized request"},
      {Request("frobnicate"), 4, "unrecognized request"},
      {Request("add"), 4, "invalid request format"},
      {Request("remove"), 4, "invalid request format"},
      {Request("bulk"), 0, ""},
      {Request("bulk", {{"flags", Value(uint64_t{0x1f})}}), 0, ""},
      {Request("match"), 0, ""},
      {Request("ready"), 4, "invalid request format (uuid)"},
      {Request("access"), 4, "invalid request format (uuid)"},
      {Request("annotate"), 4, "invalid request format (bad annotations dictionary)"},
      {Request("lock"), 4, "invalid request format"},
      {Request("add", {{"paths", Value(Array{Value(uint64_t{1})})}}), 4, "invalid request format"},
      {Request("add", {{"paths", Value(Array{Value(a), Value("rel/b.appex")})}}), 9,
       "absolute path required: rel/b.appex"},
      {Request("ready", {{"uuids", Value(Array{Value("x")})}}), 4,
       "invalid request (bad uuid array)"},
      {Request("access", {{"uuids", Value(Array{Value(Uuid::random())})}}), 4,
       "no such plugin (uuid not found)"},
      {Request("match", {{"rules", "x"}}), 4, "invalid request format (bad rules dictionary)"},
      // Settings are checked before the UUIDs; nothing to change succeeds
      // without them. The annotation file could not hold a UUID.
      {annotate({{"other", 1}}), 0, ""},
      {annotate({{"election", "yes"}}), 4, "invalid request format (annotation election)"},
      {annotate({{"election", true}}), 4, "invalid request format (annotation election)"},
      {annotate({{"extension", 3}}), 4, "invalid request format (annotation extension)"},
      {annotate({{"extension", Value{{"id", Value(Uuid::random())}}}}), 4,
       "invalid request format (annotation extension)"},
  };
  Drm1Peer peer(w.drd().socketPath());
  ASSERT_TRUE(peer.send(1, Request("match"), false));
  for (size_t i = 0; i < std::size(rows); ++i) ASSERT_TRUE(peer.send(10 + i, rows[i].request));
  for (size_t i = 0; i < std::size(rows); ++i) {
    SCOPED_TRACE(rows[i].request.description());
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply);
    EXPECT_TRUE(reply->header.isReply());
    EXPECT_EQ(reply->header.replyTo, 10 + i);
    EXPECT_EQ(ErrorCode(reply->body), rows[i].code);
    EXPECT_EQ(ErrorText(reply->body), rows[i].error);
    if (rows[i].code != 0) {
      EXPECT_EQ(reply->body.size(), 2u) << reply->body.description();
    }
  }
  EXPECT_FALSE(peer.receive(std::chrono::milliseconds(200))) << "one reply too many";
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.a") << w.log();
  EXPECT_NE(w.log().find("bulk options 0x1f not supported"), std::string::npos);
}

TEST_F(RequestsTest, WhatEachHostIsOffered) {
  w.makeApp("Host.app", "com.example.host");
  w.makeApp("Other.app", "com.example.other");
  w.makeApp("A.app", "com.example.appa");
  w.makeApp("B.app", "com.example.appb");
  const Dictionary dedicated{{"Dedicated", true}};
  ASSERT_EQ(
      ErrorCode(w.add({
          w.makePlugIn("system/sys.appex", "com.example.sys"),
          w.makePlugIn("Host.app/Contents/PlugIns/inapp.appex", "com.example.inapp"),
          w.makePlugIn("Other.app/Contents/PlugIns/ded.appex", "com.example.ded", "1.0", dedicated),
          w.makePlugIn("Host.app/Contents/PlugIns/own.appex", "com.example.own", "1.0", dedicated),
          w.makePlugIn("loose/free.appex", "com.example.free"),
          w.makePlugIn("system/hy.appex", "com.example.hy", "1.0", {{"EmbeddedCode", "lib"}}),
          w.makePlugIn("A.app/Contents/PlugIns/p.appex", "com.example.p", "1.2"),
          w.makePlugIn("B.app/Contents/PlugIns/p.appex", "com.example.p", "1.10"),
      })),
      0u);
  std::unique_ptr<HostApp> host = w.host("Host.app");
  const struct {
    const char* what;
    client::Connection* from;
    uint64_t flags;
    std::string expected;
  } rows[] = {
      {"free-standing program", nullptr, 0, "com.example.inapp com.example.p com.example.sys"},
      {"application sees its dedicated plug-in", host->connection(), 0,
       "com.example.inapp com.example.own com.example.p com.example.sys"},
      {"hybrids on request", nullptr, kDiscoverHybrid,
       "com.example.hy com.example.inapp com.example.p com.example.sys"},
      {"every version", nullptr, kDiscoverAllVersions,
       "com.example.inapp com.example.p com.example.p com.example.sys"},
      {"system volume only", host->connection(), kDiscoverSystemOnly, "com.example.sys"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(World::Identifiers(w.match(Value(), row.flags, row.from)), row.expected) << row.what;
  }
  const Value p = w.match(Value{{"UXExtensionIdentifier", "com.example.p"}});
  ASSERT_EQ(p.size(), 1u);
  EXPECT_EQ(p.at(0)["version"].stringValue(), "1.10");
  Value reply =
      w.call(Request("match", {{"flags", Value(message::kDiscoverAll)}}), host->connection());
  EXPECT_EQ(ErrorCode(reply), 11u);
  EXPECT_EQ(ErrorText(reply), "unauthorized discovery flag (DRDiscoverAll)");
  EXPECT_EQ(w.everything().size(), 7u);  // one copy of com.example.p
}

// A form no reply could carry is refused by "add"; settings get the same bound (two levels lower).
TEST_F(RequestsTest, PlugInNestedTooDeepForAReplyIsRefused) {
  auto nested = [](int depth) {
    Value v("bottom");
    for (int level = 0; level < depth; ++level) v = Value(Array{v});
    return v;
  };
  // Reply, "matches", form, "bundleInfo", "UXExtension", "Deep" + 59 arrays: the 64 levels allowed.
  ASSERT_EQ(ErrorCode(w.add({w.makePlugIn("system/fits.appex", "com.example.fits", "1.0",
                                          {{"Deep", nested(59)}})})),
            0u);
  EXPECT_EQ(ErrorCode(w.add({w.makePlugIn("system/deep.appex", "com.example.deep", "1.0",
                                          {{"Deep", nested(60)}})})),
            2u);
  EXPECT_NE(w.log().find("Contents/Info.pdoc cannot be carried in a reply: it nests deeper than "
                         "the 61 levels a reply can carry"),
            std::string::npos)
      << w.log();
  const Value fits = w.uuidOf("com.example.fits");
  auto annotate = [&](int depth) {
    return ErrorCode(w.call(
        Request("annotate", {{"annotations", Value{{"extension", Value{{"d", nested(depth)}}}}},
                             {"uuids", Uuids({fits})}})));
  };
  EXPECT_NE(annotate(60), 0u);
  EXPECT_EQ(annotate(59), 0u);
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.fits") << w.log();
}

// A reply over the wire's 256 MiB is answered with an error; the connection goes on serving.
TEST_F(RequestsTest, ReplyTooLargeForTheWireIsAnsweredWithAnError) {
  // Each form carries the 8 MiB text twice: in "bundleInfo" and in "info".
  const std::string big(size_t{8} << 20, 'x');
  std::vector<std::string> paths;
  for (int i = 0; i < 17; ++i) {
    const std::string n = std::to_string(i);
    paths.push_back(w.makePlugIn("system/big" + n + ".appex", "com.example.big" + n, "1.0",
                                 {{"Big", Value(big)}}));
  }
  ASSERT_EQ(ErrorCode(w.add(paths)), 0u);
  std::unique_ptr<client::Connection> c = w.connect();
  for (int i = 0; i < 2; ++i) {
    Value reply = w.call(Request("match"), c.get());
    ASSERT_EQ(ErrorCode(reply), 4u) << i;
    ASSERT_TRUE(ErrorText(reply).starts_with("reply cannot be sent: ")) << ErrorText(reply);
  }
  EXPECT_EQ(ErrorCode(w.call(Request("bulk"), c.get())), 0u);
}

TEST_F(RequestsTest, ReadyChecksEveryPlugInBeforeEnablingAny) {
  w.makeApp("Host.app", "com.example.host", Value{{"com.example.may-use", true}});
  w.makeApp("Plain.app", "com.example.plain");
  w.add({w.makePlugIn("system/open.appex", "com.example.open"),
         w.makePlugIn("system/guarded.appex", "com.example.guarded", "1.0",
                      {{"UXExtensionHostEntitlement", "com.example.may-use"}}),
         w.makePlugIn("system/data.appex", "com.example.data", "1.0",
                      {{"UXExtensionProtocol", "#Data"}})});
  const Value open = w.uuidOf("com.example.open");
  const Value guarded = w.uuidOf("com.example.guarded");
  std::unique_ptr<HostApp> host = w.host("Host.app");
  std::unique_ptr<HostApp> plain = w.host("Plain.app");
  auto ready = [&](HostApp& h, Array list) {
    return w.call(Request("ready", {{"uuids", Value(std::move(list))}}), h.connection());
  };
  EXPECT_EQ(ErrorCode(ready(*host, {open, guarded, open, w.uuidOf("com.example.data")})), 0u);
  Value reply = ready(*plain, {open, guarded});
  EXPECT_EQ(ErrorCode(reply), 11u);
  EXPECT_EQ(ErrorText(reply),
            "access to plugin com.example.guarded denied: the host does not have the "
            "\"com.example.may-use\" entitlement");
  const std::string log = w.log();
  EXPECT_NE(
      log.find("enabling pid=" + std::to_string(host->pid()) + " for plug-in com.example.open"),
      std::string::npos);
  EXPECT_EQ(log.find("enabling pid=" + std::to_string(plain->pid())), std::string::npos);
  EXPECT_EQ(Occurrences(log, "for plug-in com.example.open"), 1u);
  EXPECT_EQ(log.find("for plug-in com.example.data"), std::string::npos);
}

// One token per UUID; a bundle swapped for a link to /etc is refused (EACCES), and has no token.
TEST_F(RequestsTest, AccessHandsOutOneTokenPerUuid) {
  const std::string a = w.makePlugIn("system/a.appex", "com.example.a");
  w.add({a});
  const Value uuid = w.uuidOf("com.example.a");
  Value reply = w.call(Request("access", {{"uuids", Uuids({uuid, uuid})}}));
  ASSERT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  ASSERT_EQ(reply["extensions"].size(), 2u);
  SandboxOptions options{.keyPath = w.path("state/com.corvel.dromon/sandbox.key")};
  EXPECT_EQ(consumeExtension(reply["extensions"].at(1).stringValue(), options).value_or(""), a);
  EXPECT_EQ(w.call(Request("access", {{"uuids", Uuids({})}}))["extensions"], Value(Array{}));

  const std::string registered = w.everything().at(0)["path"].stringValue();
  std::filesystem::rename(registered, registered + ".moved");
  ASSERT_EQ(::symlink("/etc", registered.c_str()), 0);
  reply = w.call(Request("access", {{"uuids", Uuids({uuid})}}));
  EXPECT_EQ(ErrorCode(reply), 4u);
  EXPECT_EQ(ErrorText(reply), "cannot create extension to " + registered + ": 13");
  EXPECT_EQ(w.everything().at(0)["extensions"].size(), 0u);
}

// A hold hides and refuses its plug-ins as long as the connection that placed it lives.
TEST_F(RequestsTest, HoldsHideAndRefuseUntilTheirHostDies) {
  w.makeApp("Host.app", "com.example.host");
  w.add({w.makePlugIn("Host.app/Contents/PlugIns/p.appex", "com.example.p")});
  const Value uuid = w.uuidOf("com.example.p");
  const std::string app = w.path("Host.app");
  const struct {
    Value reply;
    uint64_t code;
    std::string error;
  } rows[] = {
      {lock(0, app), 4, "invalid request format (unsupported hold flags)"},
      {lock(1, w.path("Gone.app")), 9, "invalid path: " + w.path("Gone.app")},
      {lock(2, app), 9, "no plug-in at path:" + app},
      {w.call(Request("lock", {{"uuids", Uuids({Value(Uuid::random())})}})), 0, ""},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(ErrorCode(row.reply), row.code) << row.error;
    EXPECT_EQ(ErrorText(row.reply), row.error);
  }
  std::unique_ptr<HostApp> holder = w.host("Host.app");
  ASSERT_TRUE(lock(1, app, holder->connection())["uuids"].isUuid());
  EXPECT_EQ(w.match().size(), 0u) << w.log();
  Value reply = w.call(Request("ready", {{"uuids", Uuids({uuid})}}));
  EXPECT_EQ(ErrorCode(reply), 11u);
  EXPECT_EQ(ErrorText(reply), "access to plugin com.example.p denied: the plug-in is on hold");
  holder->kill();
  EXPECT_TRUE(Eventually([&] { return w.match().size() == 1; })) << w.log();
}

// A running plug-in refuses a hold of its application (by its own version); naming it holds it.
TEST_F(RequestsTest, BusyPlugInRefusesAnApplicationHold) {
  const Dictionary rows[] = {{}, {{"UXExtensionAttributes", Value{{"UXExtensionVersion", "1.0"}}}}};
  int n = 0;
  for (const Dictionary& extra : rows) {
    const std::string app = "Host" + std::to_string(++n) + ".app";
    SCOPED_TRACE(app);
    w.makeApp(app, "com.example.host");
    const std::string p = w.makePlugIn(app + "/Contents/PlugIns/p.appex",
                                       "com.example.p" + std::to_string(n), "1", extra);
    w.add({p});
    RunningProgram running(p + "/Contents/Exec/run");
    ASSERT_GT(running.pid(), 0);
    Value reply = lock(1, w.path(app));
    EXPECT_EQ(ErrorCode(reply), 14u);
    EXPECT_EQ(ErrorText(reply), "plug-ins are busy");
    ASSERT_EQ(reply["conflicts"].size(), 1u);
    EXPECT_EQ(reply["conflicts"].at(0)["pid"].intValue(), running.pid());
    EXPECT_EQ(reply["conflicts"].at(0)["path"].stringValue(), p);
    EXPECT_TRUE(lock(2, p)["uuids"].isUuid());
  }
}

}  // namespace
}  // namespace dr::testing
