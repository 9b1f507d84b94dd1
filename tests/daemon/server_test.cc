// The server over fake platform services: a hold lasts until released, even
// one placed for a client that ended while its request ran.
#include "daemon/server.h"

#include <gtest/gtest.h>

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

// A "lock" whose connection ends while the request runs, after its client was
// found alive: the client's end releases its holds first, finding none, and
// the hold placed afterwards must not outlive it (only a restart could).
TEST(ServerTest, HoldsLastUntilReleasedEvenOnesOfAClientThatEndedWhileItsRequestRan) {
  registry_test::TempFolder folder;
  test::FakeServiceManager serviceManager;
  testing::FakeCodeSigning codeSigning;
  testing::FakePreferences preferences;
  // After the services it reports to: going, it finishes the events it queued.
  std::unique_ptr<Registry> registry = test::OpenTestRegistry(folder.path());
  ServerOptions o;
  o.database.registry = registry.get();
  o.database.plugInServices.serviceManager = o.serviceManager = &serviceManager;
  o.socketDirectory = folder / "sockets";
  o.useSocketActivation = false;
  o.codeSigning = &codeSigning;
  o.preferences = &preferences;
  auto server = DRDServer::initForServiceDatabase("com.example.drd", folder / "Annotations", o);
  const std::string app = registry_test::MakeBundle(folder / "Host.app", Value::EmptyDictionary());
  const std::string path = registry_test::MakeBundle(
      app + "/Contents/PlugIns/held.appex", registry_test::PlugInInfo("held"),
      Value{{"com.corvel.security.app-sandbox", true}});
  ASSERT_TRUE(server && server->addPlugIn(path).ok());
  DRDPlugInPtr held = server->findPlugInAtPath(path);
  server->setVerbose(1);
  server->resume();
  ScopedLogCapture log;
  std::promise<void> reached, go;  // the request stops at its busy check
  serviceManager.onBusyQuery = [&reached, f = go.get_future().share()] {
    reached.set_value();
    f.wait();
  };
  testing::Drm1Peer peer(folder / "sockets/com.example.drd");
  ASSERT_TRUE(peer.send(1, Value{{"request", "lock"},
                                 {"version", uint64_t{2}},
                                 {"flags", uint64_t{1}},
                                 {"paths", Value(Array{Value(app)})}}));
  ASSERT_EQ(reached.get_future().wait_for(5s), std::future_status::ready);
  peer.close();
  for (int i = 0; i < 500 && !log.contains("is dead"); ++i) std::this_thread::sleep_for(10ms);
  go.set_value();
  server->mainQueue().sync([] {});
  EXPECT_TRUE(log.contains("hold request granted")) << "the request ran to its end";
  EXPECT_TRUE(log.contains("for dead client pid"));
  EXPECT_FALSE(server->holdOnPlugIn(*held));
  // A second record of the same plug-in is held too, until the hold's own
  // token is released.
  DRDPlugInPtr twin = DRDPlugIn::initWithRGData(registry->entryForUuid(*held->uuid()));
  auto hold = DRDPlugInHold::initWithPlugInsForClient({held, held}, nullptr);
  EXPECT_EQ(hold->blocked().size(), 1u);
  const Uuid token = hold->uuid();
  server->addHold(std::move(hold));
  for (const Uuid& released : {Uuid::random(), token}) {
    EXPECT_TRUE(server->holdOnPlugIn(*twin)) << "before releasing " << released.string();
    server->unholdToken(released);
  }
  EXPECT_TRUE(server->holds().empty());
}

}  // namespace
}  // namespace dr
