// The requests end to end: a real drd, real bundles, hosts running from
// inside application bundles.
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "platform/preferences.h"
#include "platform/sandbox.h"
#include "tests/integration/world.h"
#include "tests/support/process_fixtures.h"

namespace dr::testing {
namespace {

using registry_test::ReadBytes;
using registry_test::WriteBytes;

constexpr uint64_t kAllVersions = 0x1;
constexpr uint64_t kSystemOnly = 0x8;
constexpr uint64_t kHybrid = 0x100;
constexpr uint64_t kAll = 0x200;

class RequestsTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(w.start()) << w.log(); }

  Value uuids(std::initializer_list<Value> list) { return Value(Array(list)); }

  World w;
};

TEST_F(RequestsTest, EnvelopeAndListErrors) {
  const std::string a = w.makePlugIn("system/a.appex", "com.example.a");
  struct Row {
    const char* what;
    Value request;
    uint64_t code;
    std::string error;
  } rows[] = {
      {"no version", Value{{"request", "match"}}, 7, "unsupported protocol version 0 (need 2)"},
      {"version 3", Value{{"request", "match"}, {"version", Value(uint64_t{3})}}, 7,
       "unsupported protocol version 3 (need 2)"},
      {"no request name", Value{{"version", Value(uint64_t{2})}}, 4,
       "invalid request format (missing type)"},
      {"name in other case", Request("Match"), 4, "unrecognized request"},
      {"paths missing", Request("add"), 4, "invalid request format"},
      {"paths element not text", Request("add", {{"paths", Value(Array{Value(uint64_t{1})})}}), 4,
       "invalid request format"},
      {"absolute then relative path",
       Request("add", {{"paths", Value(Array{Value(a), Value("rel/b.appex")})}}), 9,
       "absolute path required: rel/b.appex"},
      {"uuids missing", Request("ready"), 4, "invalid request format (uuid)"},
      {"uuids holding text", Request("ready", {{"uuids", Value(Array{Value("x")})}}), 4,
       "invalid request (bad uuid array)"},
      {"unknown uuid", Request("access", {{"uuids", Value(Array{Value(Uuid::random())})}}), 4,
       "no such plugin (uuid not found)"},
      {"rules not a dictionary", Request("match", {{"rules", "x"}}), 4,
       "invalid request format (bad rules dictionary)"},
      {"annotations missing", Request("annotate"), 4,
       "invalid request format (bad annotations dictionary)"},
  };
  for (const Row& row : rows) {
    Value reply = w.call(row.request);
    EXPECT_EQ(ErrorCode(reply), row.code) << row.what;
    EXPECT_EQ(ErrorText(reply), row.error) << row.what;
  }
  // The path before the relative one was registered.
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.a") << w.log();
}

TEST_F(RequestsTest, AddAndRemoveStopAtTheFirstBadPath) {
  const std::string a = w.makePlugIn("system/a.appex", "com.example.a");
  const std::string c = w.makePlugIn("system/c.appex", "com.example.c");
  const std::string missing = w.path("system/missing.appex");
  Value reply = w.add({a, missing, c});
  EXPECT_EQ(ErrorCode(reply), 9u);
  EXPECT_EQ(ErrorText(reply), "invalid plugin path: " + missing);
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.a");

  // A folder without a plug-in dictionary is refused by the registry.
  const std::string junk =
      registry_test::MakeBundle(w.path("system/junk.appex"), Value{{"BNBundleIdentifier", "j"}});
  reply = w.add({junk});
  EXPECT_EQ(ErrorCode(reply), 2u);
  EXPECT_EQ(ErrorText(reply), "unable to register plug-in at " + junk);
  EXPECT_NE(w.log().find("failed to register plug-in at " + junk), std::string::npos);

  EXPECT_EQ(ErrorCode(w.add({})), 0u);
  EXPECT_EQ(ErrorCode(w.add({c})), 0u);
  // A bundle removed from disk is still unregistered under the path sent.
  std::filesystem::remove_all(c);
  reply = w.call(Request("remove", {{"paths", Value(Array{Value(c), Value(a)})}}));
  EXPECT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  EXPECT_EQ(World::Identifiers(w.match()), "");
  reply = w.call(Request("remove", {{"paths", Value(Array{Value(a)})}}));
  EXPECT_EQ(ErrorCode(reply), 9u);
  EXPECT_EQ(ErrorText(reply), "no plugin at " + a);
}

TEST_F(RequestsTest, BulkIsAcceptedAndLogged) {
  EXPECT_EQ(ErrorCode(w.call(Request("bulk", {{"flags", Value(uint64_t{0x1f})}}))), 0u);
  EXPECT_EQ(ErrorCode(w.call(Request("bulk"))), 0u);
  EXPECT_NE(w.log().find("bulk options 0x1f not supported"), std::string::npos);
}

TEST_F(RequestsTest, WhatEachHostIsOffered) {
  w.makeApp("Host.app", "com.example.host");
  w.makeApp("Other.app", "com.example.other");
  w.add({
      w.makePlugIn("system/sys.appex", "com.example.sys"),
      w.makePlugIn("Host.app/Contents/PlugIns/inapp.appex", "com.example.inapp"),
      w.makePlugIn("Other.app/Contents/PlugIns/ded.appex", "com.example.ded", "1.0",
                   {{"Dedicated", true}}),
      w.makePlugIn("Host.app/Contents/PlugIns/own.appex", "com.example.own", "1.0",
                   {{"Dedicated", true}}),
      w.makePlugIn("loose/free.appex", "com.example.free"),
      w.makePlugIn("system/hy.appex", "com.example.hy", "1.0", {{"EmbeddedCode", "lib"}}),
  });
  std::unique_ptr<HostApp> host = w.host("Host.app");
  struct Row {
    const char* what;
    client::Connection* from;
    uint64_t flags;
    std::string expected;
  } rows[] = {
      {"free-standing program", nullptr, 0, "com.example.inapp com.example.sys"},
      {"application sees its dedicated plug-in", host->connection(), 0,
       "com.example.inapp com.example.own com.example.sys"},
      {"hybrids on request", nullptr, kHybrid, "com.example.hy com.example.inapp com.example.sys"},
      {"system volume only", host->connection(), kSystemOnly, "com.example.sys"},
  };
  for (const Row& row : rows) {
    std::string got = World::Identifiers(w.match(Value(), row.flags, row.from));
    // Candidates come in no defined order; compare as sorted words.
    std::vector<std::string> words;
    for (size_t at = 0; at < got.size();) {
      size_t end = got.find(' ', at);
      if (end == std::string::npos) end = got.size();
      words.push_back(got.substr(at, end - at));
      at = end + 1;
    }
    std::sort(words.begin(), words.end());
    std::string sorted;
    for (const std::string& word : words) sorted += (sorted.empty() ? "" : " ") + word;
    EXPECT_EQ(sorted, row.expected) << row.what;
  }

  // The privileged view needs the manager entitlement.
  Value reply = w.call(Request("match", {{"flags", Value(kAll)}}), host->connection());
  EXPECT_EQ(ErrorCode(reply), 11u);
  EXPECT_EQ(ErrorText(reply), "unauthorized discovery flag (DRDiscoverAll)");
  EXPECT_EQ(w.everything().size(), 6u);
}

TEST_F(RequestsTest, UserExclusionsAndAdministratorPolicyHideAPlugIn) {
  w.add({w.makePlugIn("system/a.appex", "com.example.a"),
         w.makePlugIn("system/b.appex", "com.example.b"),
         w.makePlugIn("system/c.appex", "com.example.c")});
  PreferencesOptions prefs =
      PreferencesOptionsFromEnvironment([&](const char* name) -> const char* {
        static std::string config;
        config = w.path("config");
        return std::string_view(name) == "XDG_CONFIG_HOME" ? config.c_str() : ::getenv(name);
      });
  WriteBytes(prefs.directory + "/ByHost/com.corvel.dromon.userprefs." + prefs.hostId + ".pdoc",
             "{\"exclusions\": [{\"UXExtensionIdentifier\": \"com.example.b\"}, 3]}");
  WriteBytes(w.path("policy.pdoc"), "{\"DeniedPlugIns\": [\"com.example.c\"]}");
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.a");
  EXPECT_NE(w.log().find("plugin com.example.b excluded"), std::string::npos);
  EXPECT_NE(w.log().find("plugin com.example.c rejected by Keeper"), std::string::npos);
}

TEST_F(RequestsTest, OneCopyPerIdentifierUnlessAllVersionsAreAsked) {
  w.makeApp("A.app", "com.example.appa");
  w.makeApp("B.app", "com.example.appb");
  w.add({w.makePlugIn("A.app/Contents/PlugIns/p.appex", "com.example.p", "1.2"),
         w.makePlugIn("B.app/Contents/PlugIns/p.appex", "com.example.p", "1.10")});
  Value one = w.match();
  ASSERT_EQ(one.size(), 1u);
  EXPECT_EQ(one.at(0)["version"].stringValue(), "1.10");
  EXPECT_EQ(w.match(Value(), kAllVersions).size(), 2u);
}

// Bundles may nest deeper than a message can. A plug-in whose form no reply
// could carry is refused by "add", with a log line, so that discovery still
// finds the others; one level less is found.
TEST_F(RequestsTest, PlugInNestedTooDeepForAReplyIsRefused) {
  auto nested = [](int depth) {
    Value v("bottom");
    for (int level = 0; level < depth; ++level) v = Value(Array{v});
    return v;
  };
  // The reply, "matches", the form, "bundleInfo", "UXExtension", then "Deep":
  // 59 arrays reach the 64 levels a message may nest.
  ASSERT_EQ(ErrorCode(w.add({w.makePlugIn("system/fits.appex", "com.example.fits", "1.0",
                                          {{"Deep", nested(59)}})})),
            0u);
  EXPECT_EQ(ErrorCode(w.add({w.makePlugIn("system/deep.appex", "com.example.deep", "1.0",
                                          {{"Deep", nested(60)}})})),
            2u);
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.fits") << w.log();
  EXPECT_NE(w.log().find("Contents/Info.pdoc cannot be carried in a reply: it nests deeper than "
                         "the 61 levels a reply can carry"),
            std::string::npos)
      << w.log();

  // Settings are held to the same bound: in a form they sit two levels lower
  // than in the request.
  const Value fits = w.uuidOf("com.example.fits");
  auto annotate = [&](int depth) {
    return ErrorCode(w.call(
        Request("annotate", {{"annotations", Value{{"extension", Value{{"d", nested(depth)}}}}},
                             {"uuids", Value(Array{fits})}})));
  };
  EXPECT_NE(annotate(60), 0u);
  EXPECT_EQ(annotate(59), 0u);
  EXPECT_EQ(World::Identifiers(w.match()), "com.example.fits") << w.log();
}

// A reply the wire cannot carry (here over 256 MiB) is answered with an
// error instead, and the connection goes on serving.
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
  for (int i = 0; i < 3; ++i) {
    Value reply = w.call(Request("match"), c.get());
    ASSERT_EQ(ErrorCode(reply), 4u) << i;
    ASSERT_TRUE(ErrorText(reply).starts_with("reply cannot be sent: ")) << ErrorText(reply);
  }
  EXPECT_EQ(ErrorCode(w.call(Request("bulk"), c.get())), 0u);
}

TEST_F(RequestsTest, ReplacementIsMarkedOnBothForms) {
  w.add({w.makePlugIn("system/old.appex", "com.example.old"),
         w.makePlugIn("system/new.appex", "com.example.new", "1.0", {},
                      Value{{"com.corvel.developer.replace-plugin", "com.example.old"}})});
  Value matches = w.match();
  ASSERT_EQ(matches.size(), 2u);
  for (const Value& form : matches.array()) {
    if (form["identifier"].stringValue() == "com.example.old") {
      EXPECT_EQ(form["overrider"].stringValue(), w.uuidOf("com.example.new").description());
    } else {
      EXPECT_EQ(form["overriding"].stringValue(), "com.example.old");
    }
  }
}

TEST_F(RequestsTest, AnnotationsAreMergedNotifiedAndKeptAcrossRestart) {
  w.add({w.makePlugIn("system/a.appex", "com.example.a"),
         w.makePlugIn("system/b.appex", "com.example.b")});
  const Value a = w.uuidOf("com.example.a");
  const Value b = w.uuidOf("com.example.b");
  auto annotate = [&](Dictionary annotations, Value list) {
    return w.call(Request(
        "annotate", {{"annotations", Value(std::move(annotations))}, {"uuids", std::move(list)}}));
  };
  const std::string counter = w.path("notify/com.corvel.dromon.annotation-change");
  // Nothing to change: succeeds without looking at "uuids", posts nothing.
  EXPECT_EQ(ErrorCode(annotate({{"other", 1}}, Value("junk"))), 0u);
  EXPECT_EQ(ReadBytes(counter), "");

  EXPECT_EQ(ErrorCode(annotate({{"election", 1}}, uuids({a, b}))), 0u);
  EXPECT_EQ(ReadBytes(counter), "2\n");
  EXPECT_EQ(ErrorCode(annotate({{"extension", Value{{"size", 3}}}}, uuids({a}))), 0u);

  struct Bad {
    Dictionary annotations;
    std::string error;
  } bad[] = {
      {{{"election", "yes"}}, "invalid request format (annotation election)"},
      {{{"election", true}}, "invalid request format (annotation election)"},
      {{{"extension", 3}}, "invalid request format (annotation extension)"},
      // The annotation file cannot hold a UUID.
      {{{"extension", Value{{"id", Value(Uuid::random())}}}},
       "invalid request format (annotation extension)"},
  };
  for (const Bad& row : bad) {
    Value reply = annotate(row.annotations, uuids({a}));
    EXPECT_EQ(ErrorCode(reply), 4u) << row.error;
    EXPECT_EQ(ErrorText(reply), row.error);
  }
  // An unknown UUID in the middle: the plug-ins before it are annotated.
  Value reply = annotate({{"election", 0}}, uuids({b, Value(Uuid::random()), a}));
  EXPECT_EQ(ErrorText(reply), "no such plugin (uuid not found)");

  ASSERT_TRUE(w.restart()) << w.log();
  const Value matches = w.match();
  for (const Value& form : matches.array()) {
    const Value& annotations = form["annotations"];
    if (form["uuid"].stringValue() == a.description()) {
      EXPECT_EQ(annotations, (Value{{"election", 1}, {"extension", Value{{"size", 3}}}}));
    } else {
      EXPECT_EQ(annotations, (Value{{"election", 0}}));
    }
  }
  // One report per change of election: a and b elected, then b unelected.
  const std::string usage = ReadBytes(w.path("usage.log"));
  auto count = [&](const std::string& word) {
    size_t n = 0;
    for (size_t at = usage.find(word); at != std::string::npos; at = usage.find(word, at + 1)) ++n;
    return n;
  };
  EXPECT_EQ(count("\"Enabled\""), 2u) << usage;
  EXPECT_EQ(count("\"Disabled\""), 1u) << usage;
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
  const Value data = w.uuidOf("com.example.data");
  std::unique_ptr<HostApp> host = w.host("Host.app");
  std::unique_ptr<HostApp> plain = w.host("Plain.app");
  auto ready = [&](HostApp& h, Value list) {
    return w.call(Request("ready", {{"uuids", std::move(list)}}), h.connection());
  };
  EXPECT_EQ(ErrorCode(ready(*host, uuids({open, guarded, open, data}))), 0u);
  Value reply = ready(*plain, uuids({open, guarded}));
  EXPECT_EQ(ErrorCode(reply), 11u);
  EXPECT_EQ(ErrorText(reply),
            "access to plugin com.example.guarded denied: the host does not have the "
            "\"com.example.may-use\" entitlement");
  const std::string log = w.log();
  EXPECT_NE(
      log.find("enabling pid=" + std::to_string(host->pid()) + " for plug-in com.example.open"),
      std::string::npos);
  // The refused request enabled nothing, not even the allowed plug-in.
  EXPECT_EQ(log.find("enabling pid=" + std::to_string(plain->pid())), std::string::npos);
  // Enabled once although named twice; the data plug-in needs nothing.
  size_t first = log.find("for plug-in com.example.open");
  EXPECT_EQ(log.find("for plug-in com.example.open", first + 1), std::string::npos);
  EXPECT_EQ(log.find("for plug-in com.example.data"), std::string::npos);
}

TEST_F(RequestsTest, AccessHandsOutOneTokenPerUuid) {
  const std::string a = w.makePlugIn("system/a.appex", "com.example.a");
  w.add({a});
  const Value uuid = w.uuidOf("com.example.a");
  Value reply = w.call(Request("access", {{"uuids", uuids({uuid, uuid})}}));
  ASSERT_EQ(ErrorCode(reply), 0u) << ErrorText(reply);
  ASSERT_EQ(reply["extensions"].size(), 2u);
  SandboxOptions options{.keyPath = w.path("state/com.corvel.dromon/sandbox.key")};
  Result<std::string> granted = consumeExtension(reply["extensions"].at(1).stringValue(), options);
  ASSERT_TRUE(granted.ok());
  EXPECT_EQ(*granted, a);
  EXPECT_EQ(w.call(Request("access", {{"uuids", uuids({})}}))["extensions"], Value(Array{}));
}

TEST_F(RequestsTest, HoldsHideAndRefuseUntilReleased) {
  w.makeApp("Host.app", "com.example.host");
  const std::string p = w.makePlugIn("Host.app/Contents/PlugIns/p.appex", "com.example.p");
  w.add({p});
  const Value uuid = w.uuidOf("com.example.p");
  auto lock = [&](Dictionary fields) { return w.call(Request("lock", std::move(fields))); };
  struct Row {
    const char* what;
    Dictionary fields;
    uint64_t code;
    std::string error;
  } rows[] = {
      {"unsupported flags",
       {{"flags", 0}, {"paths", Value(Array{Value(w.path("Host.app"))})}},
       4,
       "invalid request format (unsupported hold flags)"},
      {"missing path",
       {{"flags", 1}, {"paths", Value(Array{Value(w.path("Gone.app"))})}},
       9,
       "invalid path: " + w.path("Gone.app")},
      {"no plug-in at path",
       {{"flags", 2}, {"paths", Value(Array{Value(w.path("Host.app"))})}},
       9,
       "no plug-in at path:" + w.path("Host.app")},
      {"release of an unknown token", {{"uuids", uuids({Value(Uuid::random())})}}, 0, ""},
  };
  for (const Row& row : rows) {
    Value reply = lock(row.fields);
    EXPECT_EQ(ErrorCode(reply), row.code) << row.what;
    EXPECT_EQ(ErrorText(reply), row.error) << row.what;
  }

  // A hold lasts as long as the connection that placed it.
  std::unique_ptr<client::Connection> holder = w.connect();
  Value held =
      w.call(Request("lock", {{"flags", 1}, {"paths", Value(Array{Value(w.path("Host.app"))})}}),
             holder.get());
  ASSERT_TRUE(held["uuids"].isUuid()) << ErrorText(held);
  EXPECT_EQ(w.match().size(), 0u) << w.log();
  Value reply = w.call(Request("ready", {{"uuids", uuids({uuid})}}));
  EXPECT_EQ(ErrorCode(reply), 11u);
  EXPECT_EQ(ErrorText(reply), "access to plugin com.example.p denied: the plug-in is on hold");
  EXPECT_EQ(ErrorCode(lock({{"uuids", uuids({held["uuids"]})}, {"paths", 3}})), 0u);
  EXPECT_EQ(w.match().size(), 1u);
  EXPECT_NE(w.log().find("releasing plug-in hold " + held["uuids"].description()),
            std::string::npos);
}

TEST_F(RequestsTest, BusyPlugInRefusesAnApplicationHold) {
  // A plug-in's version may differ from its bundle's; the plug-in's is the
  // one that makes a process an instance of it.
  struct Row {
    const char* what;
    Dictionary extra;
  } rows[] = {
      {"plug-in version is the bundle's", {}},
      {"plug-in version differs from the bundle's",
       {{"UXExtensionAttributes", Value{{"UXExtensionVersion", "1.0"}}}}},
  };
  int n = 0;
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    const std::string app = "Host" + std::to_string(++n) + ".app";
    w.makeApp(app, "com.example.host");
    const std::string p = w.makePlugIn(app + "/Contents/PlugIns/p.appex",
                                       "com.example.p" + std::to_string(n), "1", row.extra);
    w.add({p});
    RunningProgram running(p + "/Contents/Exec/run");
    ASSERT_GT(running.pid(), 0);
    Value reply =
        w.call(Request("lock", {{"flags", 1}, {"paths", Value(Array{Value(w.path(app))})}}));
    EXPECT_EQ(ErrorCode(reply), 14u);
    EXPECT_EQ(ErrorText(reply), "plug-ins are busy");
    ASSERT_EQ(reply["conflicts"].size(), 1u);
    EXPECT_EQ(reply["conflicts"].at(0)["pid"].intValue(), running.pid());
    EXPECT_EQ(reply["conflicts"].at(0)["path"].stringValue(), p);
    // Naming the one plug-in holds it even while it runs.
    reply = w.call(Request("lock", {{"flags", 2}, {"paths", Value(Array{Value(p)})}}));
    EXPECT_TRUE(reply["uuids"].isUuid()) << ErrorText(reply);
  }
}

TEST_F(RequestsTest, HoldEndsWhenItsHostDies) {
  w.makeApp("Host.app", "com.example.host");
  w.add({w.makePlugIn("Host.app/Contents/PlugIns/p.appex", "com.example.p")});
  std::unique_ptr<HostApp> holder = w.host("Host.app");
  Value held =
      w.call(Request("lock", {{"flags", 1}, {"paths", Value(Array{Value(w.path("Host.app"))})}}),
             holder->connection());
  ASSERT_TRUE(held["uuids"].isUuid()) << ErrorText(held);
  EXPECT_EQ(w.match().size(), 0u);
  holder->kill();
  EXPECT_TRUE(Eventually([&] { return w.match().size() == 1; })) << w.log();
}

}  // namespace
}  // namespace dr::testing
