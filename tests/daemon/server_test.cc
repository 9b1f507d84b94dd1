// The server's own decisions, over fake platform services: which uninstalled
// plug-ins' removals are logged, and how holds block and release plug-ins.
#include "daemon/server.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "core/log.h"
#include "tests/support/drm1_peer.h"
#include "tests/support/fake_service_manager.h"
#include "tests/support/fake_services.h"
#include "tests/support/registry_bundles.h"
#include "tests/support/test_registry.h"

namespace dr {
namespace {

using namespace std::chrono_literals;
using registry_test::MakeBundle;

Value Info(const std::string& id) {
  return Value{
      {"BNBundleIdentifier", id},
      {"BNBundleVersion", "3"},
      {"UXExtension", Value{{"UXExtensionPointIdentifier", "com.example.point"},
                            {"UXExtensionAttributes", Value{{"UXExtensionIdentifier", id},
                                                            {"UXExtensionPointName", "Point"}}}}}};
}

class ServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    registry_ = test::OpenTestRegistry(folder_.path());
    ASSERT_TRUE(registry_);
    ServerOptions options;
    options.database.registry = registry_.get();
    options.database.notifications = &notifications_;
    options.database.usageReports = &reports_;
    options.database.plugInServices.serviceManager = &serviceManager_;
    options.socketDirectory = folder_ / "sockets";
    options.useSocketActivation = false;
    options.serviceManager = &serviceManager_;
    options.codeSigning = &codeSigning_;
    options.preferences = &preferences_;
    server_ =
        DRDServer::initForServiceDatabase("com.example.drd", folder_ / "Annotations", options);
    ASSERT_TRUE(server_);
  }

  DRDPlugInPtr Add(const std::string& id) {
    std::string path = MakeBundle(folder_ / (id + ".appex"), Info(id),
                                  Value{{"com.corvel.security.app-sandbox", true}});
    EXPECT_TRUE(server_->addPlugIn(path).ok());
    return server_->findPlugInAtPath(path);
  }

  registry_test::TempFolder folder_;
  testing::FakeNotificationCenter notifications_;
  testing::FakeUsageReports reports_;
  test::FakeServiceManager serviceManager_;
  testing::FakeCodeSigning codeSigning_;
  testing::FakePreferences preferences_;
  // After the services it reports to: going, it finishes the install events
  // it queued, which reach the server and so the services.
  std::unique_ptr<Registry> registry_;
  std::shared_ptr<DRDServer> server_;
};

TEST_F(ServerTest, UninstallStopsInstancesAndLogsOnlyRealFailures) {
  serviceManager_.removeResults[{"com.example.stopped", "3"}] = 0;
  serviceManager_.removeResults[{"com.example.refused", "3"}] = 1;
  std::vector<std::string> paths;
  for (const char* id : {"com.example.stopped", "com.example.idle", "com.example.refused"}) {
    ASSERT_TRUE(Add(id));
    paths.push_back(folder_ / (std::string(id) + ".appex"));
  }
  ScopedLogCapture log;
  for (const std::string& path : paths) ASSERT_TRUE(server_->removePlugIn(path).ok());
  bool logged = false;
  for (int i = 0; i < 300 && !logged; ++i) {
    server_->mainQueue().sync([] {});
    logged = log.contains("PLUGIN REMOVAL:");
    if (!logged) std::this_thread::sleep_for(10ms);
  }
  std::this_thread::sleep_for(100ms);
  server_->mainQueue().sync([] {});
  std::vector<std::string> removals;
  for (const std::string& line : log.lines()) {
    if (line.starts_with("PLUGIN REMOVAL:")) removals.push_back(line);
  }
  EXPECT_EQ(removals, std::vector<std::string>{"PLUGIN REMOVAL:com.example.refused RESULT:1"});
  EXPECT_EQ(serviceManager_.removals.size(), 3u) << "every uninstalled plug-in is stopped";
}

// A "lock" whose connection ends while the request runs, after its client was
// still found alive: the client's end releases its holds first, finding none,
// and the hold placed afterwards must not outlive it (nobody could release it
// but a restart).
TEST_F(ServerTest, HoldOfAClientThatEndedWhileItsRequestRanIsReleased) {
  const std::string app = folder_ / "Host.app";
  MakeBundle(app, Value{{"BNBundleIdentifier", "com.example.host"}});
  const std::string path =
      MakeBundle(app + "/Contents/PlugIns/held.appex", Info("com.example.held"),
                 Value{{"com.corvel.security.app-sandbox", true}});
  ASSERT_TRUE(server_->addPlugIn(path).ok());
  DRDPlugInPtr held = server_->findPlugInAtPath(path);
  ASSERT_TRUE(held);
  server_->setVerbose(1);
  server_->resume();
  ScopedLogCapture log;
  // The request stops at its busy check, past the check that its client lives.
  std::promise<void> reached, go;
  serviceManager_.onBusyQuery = [&reached, f = go.get_future().share()] {
    reached.set_value();
    f.wait();
  };

  testing::Drm1Peer peer(folder_ / "sockets/com.example.drd");
  ASSERT_TRUE(peer.send(1, Value{{"request", "lock"},
                                 {"version", uint64_t{2}},
                                 {"flags", uint64_t{1}},
                                 {"paths", Value(Array{Value(app)})}}));
  ASSERT_EQ(reached.get_future().wait_for(5s), std::future_status::ready);
  peer.close();
  for (int i = 0; i < 500 && !log.contains("is dead"); ++i) std::this_thread::sleep_for(10ms);
  ASSERT_TRUE(log.contains("is dead"));

  go.set_value();
  server_->mainQueue().sync([] {});
  EXPECT_TRUE(log.contains("hold request granted")) << "the request ran to its end";
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_FALSE(server_->holdOnPlugIn(*held));
  EXPECT_TRUE(log.contains("for dead client pid"));
}

// A second record of the same plug-in counts as the same plug-in; a hold
// lasts until its own token is released, once.
TEST_F(ServerTest, HoldsBlockUntilEachIsReleased) {
  DRDPlugInPtr held = Add("com.example.held"), free = Add("com.example.free");
  ASSERT_TRUE(held && free);
  DRDPlugInPtr twin = DRDPlugIn::initWithRGData(registry_->entryForUuid(*held->uuid()));
  ASSERT_TRUE(twin && twin.get() != held.get());
  const int keepAlive = KeepAliveCount();
  auto first = DRDPlugInHold::initWithPlugInsForClient({held, held}, nullptr);
  auto second = DRDPlugInHold::initWithPlugInsForClient({twin}, nullptr);
  auto empty = DRDPlugInHold::initWithPlugInsForClient({}, nullptr);
  EXPECT_EQ(first->blocked().size(), 1u);
  const Uuid tokens[] = {first->uuid(), second->uuid(), empty->uuid()};
  for (auto* hold : {&first, &second, &empty}) server_->addHold(std::move(*hold));
  EXPECT_EQ(KeepAliveCount(), keepAlive + 3);
  const std::pair<Uuid, bool> steps[] = {// released token, and whether a release is logged
                                         {tokens[0], true},
                                         {tokens[0], false},
                                         {tokens[2], true},
                                         {tokens[1], true},
                                         {Uuid::random(), false}};
  size_t posted = 3, step = 0;
  EXPECT_TRUE(server_->holdOnPlugIn(*held) && server_->holdOnPlugIn(*twin));
  for (const auto& [token, logged] : steps) {
    SCOPED_TRACE(step++);
    ScopedLogCapture log;
    server_->unholdToken(token);
    const bool heldAfter = step < 4;
    EXPECT_EQ(server_->holdOnPlugIn(*held), heldAfter);
    EXPECT_EQ(server_->holdOnPlugIn(*twin), heldAfter);
    EXPECT_FALSE(server_->holdOnPlugIn(*free));
    // Install lines of the registry's event thread may still arrive here.
    std::vector<std::string> releases;
    for (const std::string& line : log.lines()) {
      if (line.starts_with("releasing plug-in hold")) releases.push_back(line);
    }
    EXPECT_EQ(releases, logged ? std::vector<std::string>{Format(
                                     "releasing plug-in hold %@ at client's request", token)}
                               : std::vector<std::string>{});
    EXPECT_EQ(notifications_.posted().size(), posted += logged);
  }
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_EQ(KeepAliveCount(), keepAlive);
}

// The requests' handlers, answered in process over a real socket: each
// reply's error code and text, in order on one connection (drd's end-to-end
// tests send the same requests to the real binary).
TEST_F(ServerTest, RequestsGetTheirReplies) {
  const std::string a = MakeBundle(folder_ / "a.appex", Info("com.example.a"),
                                   Value{{"com.corvel.security.app-sandbox", true}});
  const std::string missing = folder_ / "missing.appex";
  server_->resume();
  testing::Drm1Peer peer(folder_ / "sockets/com.example.drd");
  ASSERT_TRUE(peer.connected());
  auto request = [](const char* name, Dictionary fields = {}) {
    fields.insert_or_assign("request", name);
    fields.insert_or_assign("version", uint64_t{2});
    return Value(std::move(fields));
  };
  auto list = [](std::initializer_list<Value> v) { return Value(Array(v)); };
  const Value unknown = list({Uuid::random()});
  ASSERT_TRUE(server_->addPlugIn(a).ok());
  const Value mine = list({*server_->findPlugInAtPath(a)->uuid()});
  struct Row {
    Value request;
    uint64_t code;
    std::string error;
  } rows[] = {
      {Value{{"request", "match"}}, 7, "unsupported protocol version 0 (need 2)"},
      {Value{{"version", uint64_t{2}}}, 4, "invalid request format (missing type)"},
      {request("Match"), 4, "unrecognized request"},
      {request("add"), 4, "invalid request format"},
      {request("add", {{"paths", list({a, "rel/b.appex"})}}), 9,
       "absolute path required: rel/b.appex"},
      {request("add", {{"paths", list({missing})}}), 9, "invalid plugin path: " + missing},
      {request("ready"), 4, "invalid request format (uuid)"},
      {request("ready", {{"uuids", list({"x"})}}), 4, "invalid request (bad uuid array)"},
      {request("ready", {{"uuids", unknown}}), 4, "no such plugin (uuid not found)"},
      {request("access", {{"uuids", unknown}}), 4, "no such plugin (uuid not found)"},
      {request("match", {{"rules", "x"}}), 4, "invalid request format (bad rules dictionary)"},
      {request("match",
               {{"rules", Value{{"UXExtensionPointName", "Point"}}}, {"flags", uint64_t{1}}}),
       0, ""},
      {request("annotate"), 4, "invalid request format (bad annotations dictionary)"},
      {request("annotate", {{"annotations", Value{{"election", "yes"}}}, {"uuids", unknown}}), 4,
       "invalid request format (annotation election)"},
      {request("annotate", {{"annotations", Value{{"election", 1}}}, {"uuids", unknown}}), 4,
       "no such plugin (uuid not found)"},
      {request("bulk", {{"flags", uint64_t{0x1f}}}), 0, ""},
      {request("lock", {{"flags", uint64_t{1}}, {"paths", list({missing})}}), 9,
       "invalid path: " + missing},
      {request("ready", {{"uuids", mine}}), 0, ""},
      {request("annotate", {{"annotations", Value{{"election", 1}}}, {"uuids", mine}}), 0, ""},
      {request("lock", {{"uuids", unknown}}), 0, ""},
      {request("remove", {{"paths", list({a})}}), 0, ""},
      {request("remove", {{"paths", list({a})}}), 9, "no plugin at " + a},
  };
  uint64_t serial = 0;
  for (const Row& row : rows) {
    SCOPED_TRACE(row.request.description());
    ASSERT_TRUE(peer.send(++serial, row.request));
    std::optional<drm1::Frame> reply = peer.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->header.replyTo, serial);
    EXPECT_EQ(reply->body["errorcode"].uintValue(), row.code);
    EXPECT_EQ(reply->body["error"].stringValue(), row.error);
  }
}

}  // namespace
}  // namespace dr
