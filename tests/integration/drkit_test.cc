#include <gtest/gtest.h>
#include <signal.h>

#include <functional>
#include <string>
#include <vector>

#include "platform/pdoc_file.h"
#include "tests/integration/drkit_runner.h"
#include "tests/integration/world.h"

namespace dr::testing {
namespace {

constexpr char kPoint[] = "com.example.point";

class DrkitTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(w.start()) << w.log(); }

  const std::string& root() const { return w.root(); }
  std::string makePlugIn(const std::string& name, const std::string& version = "1.0",
                         const std::string& point = kPoint,
                         const std::string& app = "Apps/Host.app") {
    w.makeApp(app, "com.example.host");
    return w.makePlugIn(app + "/Contents/PlugIns/" + name + ".appex", "com.example." + name,
                        version, {{"UXExtensionPointIdentifier", Value(point)}});
  }
  Ran drkit(const std::vector<std::string>& args) { return RunDrkit(root(), args); }
  std::string ok(const std::vector<std::string>& args, const std::string& input = "") {
    Ran r = RunDrkit(root(), args, input);
    EXPECT_EQ(r.status, 0) << args[0] << ": " << r.err;
    return r.out;
  }
  void refused(const std::vector<std::string>& args, const std::string& err) {
    Ran r = drkit(args);
    EXPECT_EQ(r.status, 1) << args[0];
    EXPECT_EQ(r.out, "") << args[0];
    EXPECT_EQ(r.err, err);
  }
  std::unique_ptr<Child> hold(const std::vector<std::string>& args) {
    auto holder =
        std::make_unique<Child>(ClientBinaryPath("drkit"), args, DrkitEnvironment(root()));
    const std::string token = holder->readLine();
    EXPECT_TRUE(Uuid::parse(token)) << token << holder->err();
    last = token;
    return holder;
  }

  World w;
  std::string last;  // the token of the last hold
};

TEST_F(DrkitTest, RegistersListsFiltersAndRemoves) {
  const std::string a = makePlugIn("a", "1.0");
  makePlugIn("b", "2.0");
  makePlugIn("other", "3.0", "com.example.elsewhere");
  Ran added = RunDrkit(root(),
                       {"add", a, "Apps/Host.app/Contents/PlugIns/b.appex",
                        "Apps/Host.app/Contents/PlugIns/other.appex"},
                       "", root());
  ASSERT_EQ(added.status, 0) << added.err;
  EXPECT_EQ(added.out, "");
  const std::string all =
      "  com.example.a (1.0)\n  com.example.b (2.0)\n  com.example.other (3.0)\n";
  const std::pair<std::vector<std::string>, std::string> rows[] = {
      {{"match"}, all},
      {{"match", "-p", kPoint}, "  com.example.a (1.0)\n  com.example.b (2.0)\n"},
      {{"match", "-i", "com.example.b"}, "  com.example.b (2.0)\n"},
      {{"match", "--rule", "UXExtensionIdentifier=com.example.a", "--rule",
        "UXExtensionIdentifier=com.example.other"},
       "  com.example.a (1.0)\n  com.example.other (3.0)\n"},
      {{"match", "--rule", "BNBundleVersion=>=2"},
       "  com.example.b (2.0)\n  com.example.other (3.0)\n"},
      {{"match", "-p", "com.example.nowhere"}, ""},
      {{"match", "--rule", "UXExtensionPointName:=true"}, all},
      {{"match", "--rule", "UXExtensionPointName=true"}, ""},
      {{"match", "--rule", "NoSuchKey:=false", "-i", "com.example.a"}, "  com.example.a (1.0)\n"},
      {{"match", "--rule", "BNBundleVersion:=[\"1.0\", \"3.0\"]"},
       "  com.example.a (1.0)\n  com.example.other (3.0)\n"},
  };
  for (const auto& [args, out] : rows) EXPECT_EQ(ok(args), out) << args.back();
  const std::string verbose = ok({"match", "-v", "-i", "com.example.a"});
  EXPECT_EQ(verbose.rfind("  com.example.a (1.0)\n    uuid: ", 0), 0u) << verbose;
  EXPECT_NE(verbose.find("\n    path: " + a + "\n    registered: 20"), std::string::npos)
      << verbose;

  EXPECT_EQ(ok({"remove", a}), "");
  EXPECT_EQ(ok({"match", "-p", kPoint}), "  com.example.b (2.0)\n");
  refused({"remove", a}, "drkit: no plugin at " + a + " (bad path, code 9)\n");
  refused({"add", root() + "/missing.appex"},
          "drkit: invalid plugin path: " + root() + "/missing.appex (bad path, code 9)\n");
  refused({"match", "--all"},
          "drkit: unauthorized discovery flag (DRDiscoverAll) (not permitted, code 11)\n");
}

TEST_F(DrkitTest, AccessTokensGrantTheBundleAndReadyChecksThePlugIn) {
  const std::string a = makePlugIn("a");
  ok({"add", a});
  const std::string uuid = w.uuidOf("com.example.a").description();
  const std::string tokens = ok({"access", uuid, uuid});
  const std::string token = tokens.substr(0, tokens.find('\n'));
  EXPECT_EQ(tokens, token + "\n" + token + "\n");
  EXPECT_EQ(ok({"extension", "consume", token}), a + "\n");
  EXPECT_EQ(ok({"extension", "open", token, "Contents/Info.pdoc"}),
            registry_test::ReadBytes(a + "/Contents/Info.pdoc"));
  Ran missing = drkit({"extension", "open", token, "Contents/none"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_EQ(missing.err.rfind("drkit: Contents/none: ", 0), 0u) << missing.err;
  std::string altered = token;
  altered.back() = altered.back() == '0' ? '1' : '0';
  for (const std::string& bad : {altered, std::string("garbage")}) {
    Ran r = drkit({"extension", "consume", bad});
    EXPECT_NE(r.status, 0);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err.rfind("drkit: ", 0), 0u) << r.err;
  }
  EXPECT_EQ(ok({"ready", uuid}), "");
  for (const char* verb : {"ready", "access"}) {
    refused({verb, uuid, Uuid::random().string()},
            "drkit: no such plugin (uuid not found) (bad request, code 4)\n");
  }
}

// A hold lasts until input ends, a signal, a release by token, or drd's end (drkit says so).
TEST_F(DrkitTest, HoldLastsUntilInputEndsOrASignalOrARelease) {
  const std::string a = makePlugIn("a");
  ok({"add", a});
  const std::string listed = "  com.example.a (1.0)\n";
  const std::string uuid = w.uuidOf("com.example.a").description();
  const struct {
    std::vector<std::string> args;
    std::function<void(Child&)> end;
  } rows[] = {
      {{"hold", "--plugin", a}, [](Child& c) { c.closeInput(); }},
      {{"hold", "--app", root() + "/Apps/Host.app"}, [](Child& c) { c.signal(SIGTERM); }},
      {{"hold", "--plugin", a},
       [&](Child& c) {
         EXPECT_EQ(ok({"release", last}), "");
         EXPECT_EQ(ok({"match"}), listed);
         c.signal(SIGINT);
       }},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.args[1]);
    std::unique_ptr<Child> holder = hold(row.args);
    EXPECT_EQ(ok({"match"}), "");
    refused({"ready", uuid},
            "drkit: access to plugin com.example.a denied: the plug-in is on hold "
            "(not permitted, code 11)\n");
    row.end(*holder);
    EXPECT_EQ(holder->wait(), 0) << holder->err();
    EXPECT_EQ(ok({"match"}), listed);
  }
  refused({"hold", "--plugin", root() + "/Apps/Host.app"},
          "drkit: no plug-in at path:" + root() + "/Apps/Host.app (bad path, code 9)\n");
  std::unique_ptr<Child> holder = hold({"hold", "--plugin", a});
  ASSERT_TRUE(w.kill9()) << w.log();
  EXPECT_EQ(holder->wait(), 1);
  EXPECT_EQ(holder->err(), "drkit: drd closed the connection; the hold is gone\n");
  EXPECT_EQ(ok({"match"}), listed);
}

TEST_F(DrkitTest, ExclusionsHidePlugInsAndKeepTheRestOfTheFile) {
  ok({"add", makePlugIn("a"), makePlugIn("b")});
  registry_test::WriteBytes(w.prefsFile(), "{\"other\": \"kept\"}");
  ok({"exclude", "add", "-i", "com.example.a"});
  EXPECT_EQ(ok({"exclude", "list"}), "1: {\"UXExtensionIdentifier\":\"com.example.a\"}\n");
  EXPECT_EQ(ok({"match"}), "  com.example.b (1.0)\n");
  ok({"exclude", "add", "-p", kPoint, "--rule", "BNBundleVersion=1.0"});
  EXPECT_EQ(ok({"match"}), "");
  EXPECT_EQ(ok({"exclude", "remove", "1"}), "");
  EXPECT_EQ(ok({"exclude", "list"}),
            "1: {\"BNBundleVersion\":\"1.0\",\"UXExtensionPointName\":\"com.example.point\"}\n");
  EXPECT_EQ(ok({"exclude", "remove", "--rule", "BNBundleVersion=1.0", "-p", kPoint}), "");
  EXPECT_EQ(ok({"exclude", "list"}), "");
  EXPECT_EQ(ok({"match"}), "  com.example.a (1.0)\n  com.example.b (1.0)\n");
  Result<Value> stored = pdoc::ReadFile(w.prefsFile());
  ASSERT_TRUE(stored.ok()) << stored.error().description();
  EXPECT_EQ(*stored, (Value{{"other", "kept"}, {"exclusions", Value::EmptyArray()}}));
  for (const std::vector<std::string>& args :
       {std::vector<std::string>{"exclude", "remove", "1"},
        std::vector<std::string>{"exclude", "remove", "-i", "com.example.a"}}) {
    Ran r = drkit(args);
    EXPECT_EQ(r.status, 1) << args.back();
    EXPECT_EQ(r.err.rfind("drkit: no ", 0), 0u) << r.err;
  }
}

TEST_F(DrkitTest, WatchPrintsOneLinePerPost) {
  ok({"add", makePlugIn("a")});
  Child watcher(ClientBinaryPath("drkit"), {"watch", "--count", "2"}, DrkitEnvironment(root()));
  Child json(ClientBinaryPath("drkit"), {"watch", "--count", "1", "--json"},
             DrkitEnvironment(root()));
  ASSERT_EQ(watcher.readErrorLine(), "drkit: watching " + root() + "/notify");
  ASSERT_EQ(json.readErrorLine(), "drkit: watching " + root() + "/notify");
  ok({"elect", "-i", "com.example.a", "use"});
  EXPECT_EQ(watcher.readLine(), "com.corvel.dromon.annotation-change 1");
  EXPECT_EQ(json.readLine(), R"({"count":1,"name":"com.corvel.dromon.annotation-change"})");
  EXPECT_EQ(json.wait(), 0) << json.err();
  ok({"elect", "-i", "com.example.a", "ignore"});
  EXPECT_EQ(watcher.readLine(), "com.corvel.dromon.annotation-change 2");
  EXPECT_EQ(watcher.wait(), 0) << watcher.err();
}

TEST_F(DrkitTest, RawSendsAnyRequestAndStatusTellsWhetherDrdAnswers) {
  EXPECT_EQ(ok({"raw", R"({"request": "lock", "version": 2, "uuids": [{"$uuid": ")" +
                           Uuid::random().string() + "\"}]}"}),
            "{}\n");
  EXPECT_EQ(ok({"raw"}, R"({"request": "match", "version": 2, "flags": 1})"), "{\"matches\":[]}\n");
  Ran r = drkit({"raw", R"({"request": "frobnicate", "version": 2})"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "{\"error\":\"unrecognized request\",\"errorcode\":4}\n");
  EXPECT_EQ(r.err, "drkit: unrecognized request (bad request, code 4)\n");
  for (const char* bad : {"{", "[1]", R"({"a": null})", R"({"u": {"$uuid": "nope"}})"}) {
    EXPECT_EQ(drkit({"raw", bad}).status, 2) << bad;
  }
  const std::string socket = root() + "/sockets/";
  EXPECT_EQ(ok({"status"}), "service: com.corvel.dromon.drd\nsocket: " + socket +
                                "com.corvel.dromon.drd\nstate: answering\n");
  r = drkit({"-S", "com.example.none", "status"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "service: com.example.none\nsocket: " + socket +
                       "com.example.none\nstate: not answering\n");
  EXPECT_NE(r.err.find("No such file or directory\ndrkit: drd is not running; start it with "
                       "'systemctl --user start drd.socket'"),
            std::string::npos)
      << r.err;
}

// --json on every verb that prints: one line of JSON, with the fields the text shows.
TEST_F(DrkitTest, JsonOutputOfEveryVerbThatPrints) {
  const std::string a = makePlugIn("a");
  ok({"add", a, makePlugIn("b")});
  const std::string uuid = w.uuidOf("com.example.a").description();
  ok({"annotate", "-i", "com.example.a", "color=red"});
  ok({"exclude", "add", "-i", "com.example.b"});
  const std::string access = ok({"access", uuid});
  const std::string token = access.substr(0, access.find('\n'));
  const struct {
    std::vector<std::string> args, path;
    Value expected;
  } rows[] = {
      {{"match", "--json"}, {"0", "uuid"}, Value(uuid)},
      {{"annotate", "-i", "com.example.a", "--json"}, {}, Value{{"color", "red"}}},
      {{"access", uuid, "--json"}, {}, Value(Array{Value{{"uuid", uuid}, {"token", token}}})},
      {{"extension", "consume", token, "--json"}, {}, Value{{"path", a}}},
      {{"extension", "open", token, "--json"}, {"names", "0"}, Value("Contents")},
      {{"exclude", "list", "--json"},
       {},
       Value(Array{Value{{"UXExtensionIdentifier", "com.example.b"}}})},
      {{"status", "--json"},
       {},
       Value{{"service", "com.corvel.dromon.drd"},
             {"socket", root() + "/sockets/com.corvel.dromon.drd"},
             {"answering", true}}},
      {{"explain", "com.example.a", "--json"}, {"plugins", "0", "discovery"}, Value("returned")},
      {{"raw", "--json", R"({"request": "match", "version": 2})"},
       {"matches", "0", "identifier"},
       Value("com.example.a")},
      {{"hold", "--plugin", a, "--json"}, {"token"}, Value()},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.args[0]);
    const std::string out = ok(row.args);
    EXPECT_EQ(out.find('\n'), out.size() - 1) << "not one line: " << out;
    Result<Value> parsed = pdoc::Parse(out);
    ASSERT_TRUE(parsed.ok()) << out;
    Value at = *parsed;
    for (const std::string& step : row.path) {
      at = at.isArray() ? at.at(std::stoul(step)) : Value(at[step]);
    }
    EXPECT_TRUE(row.expected.isPresent() ? at == row.expected : at.isPresent()) << out;
  }
}

TEST_F(DrkitTest, ExplainTellsTheFateOfEveryCopy) {
  ok({"add", makePlugIn("a", "1.0"), makePlugIn("b", "1.0")});
  const std::string newer = makePlugIn("a", "2.0", kPoint, "Apps/Other.app");
  ok({"add", newer});
  const std::string older = root() + "/Apps/Host.app/Contents/PlugIns/a.appex";
  auto explains = [&](const std::vector<std::string>& args, const std::string& text) {
    Ran r = drkit(args);
    EXPECT_NE(r.out.find(text), std::string::npos) << r.out;
    return r.status;
  };
  EXPECT_EQ(explains({"explain", "com.example.a"}, "    path: " + newer + "\n    registered: "), 0);
  explains({"explain", "com.example.a"},
           "    version: 2.0\n    election: not chosen\n    discovery: returned\n");
  explains({"explain", "com.example.a"}, "    path: " + older);
  explains({"explain", "com.example.a"},
           "    discovery: superseded by another copy by com.example.a (2.0) ");
  ok({"exclude", "add", "-i", "com.example.a"});
  const std::vector<std::string> inHost = {"explain", newer, "--host", root() + "/Apps/Host.app"};
  explains(inHost, "host: " + root() + "/Apps/Host.app (com.example.host)\n");
  explains(
      inHost,
      "    discovery: excluded by the user: { \"UXExtensionIdentifier\": \"com.example.a\" }\n");
  explains({"explain", newer, "-p", "com.example.elsewhere"},
           "    discovery: does not match the host's rules\n");
  registry_test::WriteBytes(root() + "/policy.pdoc", R"({"DeniedPlugIns": ["com.example.b"]})");
  EXPECT_EQ(ok({"match", "-i", "com.example.b"}), "");
  explains({"explain", "com.example.b"}, "    discovery: denied by the administrator's policy\n");
  EXPECT_EQ(explains({"explain", "com.example.none"}, "com.example.none: not registered\n"), 1);
}

TEST_F(DrkitTest, HostExampleDiscoversAndReadiesAPlugIn) {
  ok({"add", makePlugIn("a"), makePlugIn("b")});
  ok({"elect", "-i", "com.example.b", "use"});
  Child host(ClientBinaryPath("host_example"), {kPoint}, DrkitEnvironment(root()));
  EXPECT_EQ(host.wait(), 0) << host.err();
  for (const char* text :
       {"com.example.a 1.0 ", "\nreadied com.example.b\nread ", " bytes of Contents/Info.pdoc\n"}) {
    EXPECT_NE(host.out().find(text), std::string::npos) << host.out();
  }
  Child nothing(ClientBinaryPath("host_example"), {"com.example.nowhere"},
                DrkitEnvironment(root()));
  EXPECT_EQ(nothing.wait(), 1);
  EXPECT_EQ(nothing.err(), "no plug-in to ready\n");
}

// Exit status and output for a bad command line (cases in the unit tests) and for help.
TEST(DrkitProcessTest, UsageErrorsExit2AndHelpExits0) {
  TempFolder root;
  const struct {
    std::vector<std::string> args;
    int status;
    std::string out, err;  // out: its start
  } rows[] = {
      {{}, 2, "", "drkit: missing verb\nTry 'drkit help'.\n"},
      {{"-S", "x", "match", "-x"},
       2,
       "",
       "drkit: match: unknown option '-x'\nTry 'drkit help match'.\n"},
      {{"nothing"}, 2, "", "drkit: unknown verb 'nothing'\nTry 'drkit help'.\n"},
      {{"--help"}, 0, "Usage: drkit [-S SERVICE] VERB", ""},
      {{"help", "hold"}, 0, "Usage: drkit hold ", ""},
      {{"hold", "--help"}, 0, "Usage: drkit hold ", ""},
      {{"help", "--help"}, 0, "Usage: drkit help ", ""},
  };
  for (const auto& row : rows) {
    Ran r = RunDrkit(root.path(), row.args);
    EXPECT_EQ(r.status, row.status) << row.err << row.out;
    EXPECT_EQ(r.out.rfind(row.out, 0), 0u) << r.out;
    EXPECT_EQ(r.err, row.err);
    if (row.out.empty()) {
      EXPECT_EQ(r.out, "");
    }
  }
}

}  // namespace
}  // namespace dr::testing
