// drkit end to end: the real drkit binary against the real drd, each in a
// fresh temporary environment with real bundles on disk. Checks what a user
// sees: standard output, standard error and exit status.
#include <gtest/gtest.h>
#include <signal.h>

#include <functional>
#include <string>
#include <vector>

#include "platform/file_system.h"
#include "platform/pdoc_file.h"
#include "platform/preferences.h"
#include "store/user_prefs.h"
#include "tests/integration/drkit_runner.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/registry_bundles.h"

namespace dr {
namespace {

using testing::Child;
using testing::ClientBinaryPath;
using testing::DrdProcess;
using testing::DrkitEnvironment;
using testing::Ran;
using testing::RunDrkit;
using testing::TempFolder;

constexpr char kPoint[] = "com.example.point";

class DrkitTest : public ::testing::Test {
 protected:
  void SetUp() override {
    drd_ = std::make_unique<DrdProcess>(root(), std::vector<std::string>{"-v"});
    ASSERT_TRUE(drd_->waitUntilServing()) << drd_->standardError();
  }
  void TearDown() override {
    ASSERT_TRUE(drd_->signal(SIGTERM));
    EXPECT_EQ(drd_->waitForExit(), 0) << drd_->standardError();
  }

  const std::string& root() const { return root_.path(); }

  // A plug-in bundle <root>/Apps/Host.app/Contents/PlugIns/<name>.appex with
  // identifier com.example.<name>, inside an application so that discovery
  // offers it to any host. Answers its path.
  std::string makePlugIn(const std::string& name, const std::string& version = "1.0",
                         const std::string& point = kPoint,
                         const std::string& app = "Apps/Host.app") {
    const std::string appPath = root_ / app;
    testing::WriteTestFile(appPath + "/Contents/Info.pdoc",
                           R"({"BNBundleIdentifier": "com.example.host"})");
    const std::string path = appPath + "/Contents/PlugIns/" + name + ".appex";
    registry_test::MakeBundle(
        path,
        Value{{"BNBundleIdentifier", "com.example.bundle." + name},
              {"BNBundleVersion", version},
              {"BNBundleExecutable", "run"},
              {"UXExtension", Value{{"UXExtensionPointIdentifier", point},
                                    {"UXExtensionAttributes",
                                     Value{{"UXExtensionIdentifier", "com.example." + name},
                                           {"UXExtensionPointName", point}}}}}},
        Value{{"com.corvel.security.app-sandbox", true}});
    testing::WriteTestFile(path + "/Contents/Exec/run", "#!/bin/sh\nexec sleep 60\n", 0755);
    return path;
  }

  Ran drkit(const std::vector<std::string>& args, const std::string& input = "") {
    return RunDrkit(root(), args, input);
  }
  // drkit that must succeed; its standard output.
  std::string ok(const std::vector<std::string>& args, const std::string& input = "") {
    Ran r = drkit(args, input);
    EXPECT_EQ(r.status, 0) << args[0] << ": " << r.err;
    return r.out;
  }
  std::string uuidOf(const std::string& identifier) {
    Result<Value> forms = pdoc::Parse(ok({"match", "-i", identifier, "--json"}));
    return forms ? (*forms).at(0)["uuid"].stringValue() : "";
  }

  TempFolder root_;
  std::unique_ptr<DrdProcess> drd_;
};

TEST_F(DrkitTest, RegistersListsFiltersAndRemoves) {
  const std::string a = makePlugIn("a", "1.0");
  makePlugIn("b", "2.0");
  makePlugIn("other", "3.0", "com.example.elsewhere");
  // A relative path is taken from drkit's working folder.
  Ran added = RunDrkit(root(),
                       {"add", a, "Apps/Host.app/Contents/PlugIns/b.appex",
                        "Apps/Host.app/Contents/PlugIns/other.appex"},
                       "", root());
  ASSERT_EQ(added.status, 0) << added.err;
  EXPECT_EQ(added.out, "");

  struct Row {
    std::vector<std::string> args;
    std::string out;
  };
  const std::vector<Row> rows = {
      {{"match"}, "  com.example.a (1.0)\n  com.example.b (2.0)\n  com.example.other (3.0)\n"},
      {{"match", "-p", kPoint}, "  com.example.a (1.0)\n  com.example.b (2.0)\n"},
      {{"match", "-i", "com.example.b"}, "  com.example.b (2.0)\n"},
      {{"match", "--rule", "UXExtensionIdentifier=com.example.a", "--rule",
        "UXExtensionIdentifier=com.example.other"},
       "  com.example.a (1.0)\n  com.example.other (3.0)\n"},
      {{"match", "--rule", "BNBundleVersion=>=2"},
       "  com.example.b (2.0)\n  com.example.other (3.0)\n"},
      {{"match", "-p", "com.example.nowhere"}, ""},
      // Typed patterns: true asks for a key that is present (and not 0),
      // false for one that is absent; the text "true" is a version text.
      {{"match", "--rule", "UXExtensionPointName:=true"},
       "  com.example.a (1.0)\n  com.example.b (2.0)\n  com.example.other (3.0)\n"},
      {{"match", "--rule", "UXExtensionPointName=true"}, ""},
      {{"match", "--rule", "NoSuchKey:=false", "-i", "com.example.a"}, "  com.example.a (1.0)\n"},
      {{"match", "--rule", "BNBundleVersion:=[\"1.0\", \"3.0\"]"},
       "  com.example.a (1.0)\n  com.example.other (3.0)\n"},
  };
  for (const Row& row : rows) EXPECT_EQ(ok(row.args), row.out) << row.args.back();

  const std::string verbose = ok({"match", "-v", "-i", "com.example.a"});
  EXPECT_EQ(verbose.rfind("  com.example.a (1.0)\n    uuid: ", 0), 0u) << verbose;
  EXPECT_NE(verbose.find("\n    path: " + a + "\n    registered: 20"), std::string::npos)
      << verbose;
  Result<Value> json = pdoc::Parse(ok({"match", "--json", "-p", kPoint}));
  ASSERT_TRUE(json) << json.error().description();
  ASSERT_EQ(json->size(), 2u);
  EXPECT_TRUE((*json).at(0)["annotations"].isDictionary());
  EXPECT_EQ(Uuid::parse((*json).at(0)["uuid"].stringValue()).has_value(), true);

  EXPECT_EQ(ok({"remove", a}), "");
  EXPECT_EQ(ok({"match", "-p", kPoint}), "  com.example.b (2.0)\n");

  // drd's refusals: message and code on standard error, status 1.
  const std::vector<std::pair<std::vector<std::string>, std::string>> failures = {
      {{"remove", a}, "drkit: no plugin at " + a + " (bad path, code 9)\n"},
      {{"add", root() + "/missing.appex"},
       "drkit: invalid plugin path: " + root() + "/missing.appex (bad path, code 9)\n"},
      {{"match", "--all"},
       "drkit: unauthorized discovery flag (DRDiscoverAll) (not permitted, code 11)\n"},
  };
  for (const auto& [args, err] : failures) {
    Ran r = drkit(args);
    EXPECT_EQ(r.status, 1) << args[0];
    EXPECT_EQ(r.err, err);
    EXPECT_EQ(r.out, "");
  }
}

TEST_F(DrkitTest, ElectionsAndSettingsAreRecorded) {
  ok({"add", makePlugIn("a"), makePlugIn("b")});
  const std::vector<std::pair<std::string, std::string>> rows = {
      {"use", "+ com.example.a (1.0)\n  com.example.b (1.0)\n"},
      {"ignore", "- com.example.a (1.0)\n  com.example.b (1.0)\n"},
      {"default", "  com.example.a (1.0)\n  com.example.b (1.0)\n"},
  };
  for (const auto& [choice, listing] : rows) {
    EXPECT_EQ(ok({"elect", "-i", "com.example.a", choice}), "");
    EXPECT_EQ(ok({"match"}), listing) << choice;
  }
  Ran unknown = drkit({"elect", "-i", "com.example.none", "use"});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_EQ(unknown.err, "drkit: no plug-in with identifier 'com.example.none'\n");

  // Settings change key by key; the election stays.
  ok({"elect", "-i", "com.example.b", "use"});
  EXPECT_EQ(ok({"annotate", "-i", "com.example.b", "color=red", "size=3", "note=a=b"}), "");
  EXPECT_EQ(ok({"annotate", "-i", "com.example.b", "--unset", "color", "size=4"}), "");
  EXPECT_EQ(ok({"annotate", "-i", "com.example.b"}), "{\"note\":\"a=b\",\"size\":\"4\"}\n");
  EXPECT_EQ(ok({"match", "-i", "com.example.b"}), "+ com.example.b (1.0)\n");
  EXPECT_EQ(ok({"annotate", "-i", "com.example.a"}), "{}\n");
}

TEST_F(DrkitTest, AccessTokensGrantTheBundleAndReadyChecksThePlugIn) {
  const std::string a = makePlugIn("a");
  ok({"add", a});
  const std::string uuid = uuidOf("com.example.a");
  ASSERT_FALSE(uuid.empty());

  const std::string tokens = ok({"access", uuid, uuid});
  const std::string token = tokens.substr(0, tokens.find('\n'));
  EXPECT_EQ(tokens, token + "\n" + token + "\n");
  EXPECT_EQ(ok({"extension", "consume", token}), a + "\n");

  std::string altered = token;
  altered.back() = altered.back() == '0' ? '1' : '0';
  for (const std::string& bad : {altered, std::string("garbage")}) {
    Ran r = drkit({"extension", "consume", bad});
    EXPECT_NE(r.status, 0);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err.rfind("drkit: ", 0), 0u) << r.err;
  }

  EXPECT_EQ(ok({"ready", uuid}), "");
  const std::string unknown = Uuid::random().string();
  for (const char* verb : {"ready", "access"}) {
    Ran r = drkit({verb, uuid, unknown});
    EXPECT_EQ(r.status, 1) << verb;
    EXPECT_EQ(r.err, "drkit: no such plugin (uuid not found) (bad request, code 4)\n") << verb;
  }
}

TEST_F(DrkitTest, HoldLastsUntilInputEndsOrASignalOrARelease) {
  const std::string a = makePlugIn("a");
  ok({"add", a});
  const std::string listed = "  com.example.a (1.0)\n";
  ASSERT_EQ(ok({"match"}), listed);
  const std::string uuid = uuidOf("com.example.a");

  {
    Child holder(ClientBinaryPath("drkit"), {"hold", "--plugin", a}, DrkitEnvironment(root()));
    const std::string token = holder.readLine();
    ASSERT_TRUE(Uuid::parse(token)) << token << holder.err();
    EXPECT_EQ(ok({"match"}), "");
    Ran refused = drkit({"ready", uuid});
    EXPECT_EQ(refused.status, 1);
    EXPECT_EQ(refused.err,
              "drkit: access to plugin com.example.a denied: the plug-in is on hold "
              "(not permitted, code 11)\n");
    holder.closeInput();
    EXPECT_EQ(holder.wait(), 0) << holder.err();
    EXPECT_EQ(ok({"match"}), listed);
  }
  {
    Child holder(ClientBinaryPath("drkit"), {"hold", "--app", root() + "/Apps/Host.app"},
                 DrkitEnvironment(root()));
    ASSERT_TRUE(Uuid::parse(holder.readLine())) << holder.err();
    EXPECT_EQ(ok({"match"}), "");
    ASSERT_TRUE(holder.signal(SIGTERM));
    EXPECT_EQ(holder.wait(), 0) << holder.err();
    EXPECT_EQ(ok({"match"}), listed);
  }
  {
    // Any process may release a hold by its token.
    Child holder(ClientBinaryPath("drkit"), {"hold", "--plugin", a}, DrkitEnvironment(root()));
    const std::string token = holder.readLine();
    ASSERT_TRUE(Uuid::parse(token)) << holder.err();
    EXPECT_EQ(ok({"release", token}), "");
    EXPECT_EQ(ok({"match"}), listed);
    ASSERT_TRUE(holder.signal(SIGINT));
    EXPECT_EQ(holder.wait(), 0) << holder.err();
  }
  Ran nothing = drkit({"hold", "--plugin", root() + "/Apps/Host.app"});
  EXPECT_EQ(nothing.status, 1);
  EXPECT_EQ(nothing.err,
            "drkit: no plug-in at path:" + root() + "/Apps/Host.app (bad path, code 9)\n");
  {
    // The hold dies with drd; a drkit that kept waiting would claim a hold
    // nobody keeps.
    Child holder(ClientBinaryPath("drkit"), {"hold", "--plugin", a}, DrkitEnvironment(root()));
    ASSERT_TRUE(Uuid::parse(holder.readLine())) << holder.err();
    ASSERT_TRUE(drd_->signal(SIGKILL));
    drd_->waitForExit();
    EXPECT_EQ(holder.wait(), 1);
    EXPECT_EQ(holder.err(), "drkit: drd closed the connection; the hold is gone\n");
    drd_ = std::make_unique<DrdProcess>(root(), std::vector<std::string>{"-v"});
    ASSERT_TRUE(drd_->waitUntilServing()) << drd_->standardError();
    EXPECT_EQ(ok({"match"}), listed);
  }
}

TEST_F(DrkitTest, ExclusionsHidePlugInsAndKeepTheRestOfTheFile) {
  ok({"add", makePlugIn("a"), makePlugIn("b")});
  // Another setting of the same preferences domain survives drkit's edits.
  const std::string configHome = root() + "/config";
  const std::string file = CurrentHostPreferencesFile(
      PreferencesOptionsFromEnvironment([&](const char* name) -> const char* {
        return std::string_view(name) == "XDG_CONFIG_HOME" ? configHome.c_str() : nullptr;
      }),
      DRDUserPrefs::kDomain);
  ASSERT_TRUE(FileSystem::Default()->makeDirectories(file.substr(0, file.rfind('/'))).ok());
  ASSERT_TRUE(pdoc::WriteFile(file, Value{{"other", "kept"}}).ok());
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

  Result<Value> stored = pdoc::ReadFile(file);
  ASSERT_TRUE(stored) << stored.error().description();
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
  Ran refused = drkit({"raw", R"({"request": "frobnicate", "version": 2})"});
  EXPECT_EQ(refused.status, 1);
  EXPECT_EQ(refused.out, "{\"error\":\"unrecognized request\",\"errorcode\":4}\n");
  EXPECT_EQ(refused.err, "drkit: unrecognized request (bad request, code 4)\n");
  for (const char* bad : {"{", "[1]", R"({"a": null})", R"({"u": {"$uuid": "nope"}})"}) {
    EXPECT_EQ(drkit({"raw", bad}).status, 2) << bad;
  }

  const std::string socket = root() + "/sockets/";
  EXPECT_EQ(ok({"status"}), "service: com.corvel.dromon.drd\nsocket: " + socket +
                                "com.corvel.dromon.drd\nstate: answering\n");
  Ran absent = drkit({"-S", "com.example.none", "status"});
  EXPECT_EQ(absent.status, 1);
  EXPECT_EQ(absent.out, "service: com.example.none\nsocket: " + socket +
                            "com.example.none\nstate: not answering\n");
  EXPECT_NE(absent.err.find("No such file or directory\ndrkit: drd is not running; start it with "
                            "'systemctl --user start drd.socket'"),
            std::string::npos)
      << absent.err;
}

// --json on every verb that prints: one line of JSON when piped, with the
// fields the text shows.
TEST_F(DrkitTest, JsonOutputOfEveryVerbThatPrints) {
  const std::string a = makePlugIn("a");
  ok({"add", a, makePlugIn("b")});
  const std::string uuid = uuidOf("com.example.a");
  ok({"annotate", "-i", "com.example.a", "color=red"});
  ok({"exclude", "add", "-i", "com.example.b"});
  const std::string access = ok({"access", uuid});
  const std::string token = access.substr(0, access.find('\n'));

  struct Row {
    std::vector<std::string> args;
    std::function<void(const Value&)> check;
  };
  const std::vector<Row> rows = {
      {{"match", "--json"},
       [&](const Value& v) {
         ASSERT_EQ(v.size(), 1u);
         EXPECT_EQ(v.at(0)["identifier"], Value("com.example.a"));
         EXPECT_EQ(v.at(0)["uuid"], Value(uuid));
       }},
      {{"annotate", "-i", "com.example.a", "--json"},
       [](const Value& v) {
         EXPECT_EQ(v, (Value{{"color", "red"}}));
       }},
      {{"access", uuid, "--json"},
       [&](const Value& v) {
         EXPECT_EQ(v, Value(Array{Value{{"uuid", uuid}, {"token", token}}}));
       }},
      {{"extension", "consume", token, "--json"},
       [&](const Value& v) {
         EXPECT_EQ(v, (Value{{"path", a}}));
       }},
      {{"exclude", "list", "--json"},
       [](const Value& v) {
         EXPECT_EQ(v, Value(Array{Value{{"UXExtensionIdentifier", "com.example.b"}}}));
       }},
      {{"status", "--json"},
       [&](const Value& v) {
         EXPECT_EQ(v, (Value{{"service", "com.corvel.dromon.drd"},
                             {"socket", root() + "/sockets/com.corvel.dromon.drd"},
                             {"answering", true}}));
       }},
      {{"explain", "com.example.a", "--json"},
       [&](const Value& v) {
         EXPECT_EQ(v["registered"], Value(true));
         ASSERT_EQ(v["plugins"].size(), 1u);
         EXPECT_EQ(v["plugins"].at(0)["path"], Value(a));
         EXPECT_EQ(v["plugins"].at(0)["discovery"], Value("returned"));
         EXPECT_EQ(v["plugins"].at(0)["election"], Value("not chosen"));
       }},
      {{"raw", "--json", R"({"request": "match", "version": 2})"},
       [](const Value& v) { EXPECT_EQ(v["matches"].size(), 1u); }},
      // Standard input ends at once: the hold is placed, printed, released.
      {{"hold", "--plugin", a, "--json"},
       [](const Value& v) { EXPECT_TRUE(Uuid::parse(v["token"].stringValue())); }},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.args[0]);
    const std::string out = ok(row.args);
    EXPECT_EQ(out.find('\n'), out.size() - 1) << "not one line: " << out;
    Result<Value> parsed = pdoc::Parse(out);
    ASSERT_TRUE(parsed) << out;
    row.check(*parsed);
  }
}

TEST_F(DrkitTest, ExplainTellsTheFateOfEveryCopy) {
  ok({"add", makePlugIn("a", "1.0"), makePlugIn("b", "1.0")});
  // A second copy of com.example.a: same identifier, newer version, in
  // another application.
  const std::string newer = makePlugIn("a", "2.0", kPoint, "Apps/Other.app");
  ok({"add", newer});
  const std::string older = root() + "/Apps/Host.app/Contents/PlugIns/a.appex";

  Ran r = drkit({"explain", "com.example.a"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_NE(r.out.find("    path: " + newer + "\n    registered: "), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("    version: 2.0\n    election: not chosen\n    discovery: returned\n"),
            std::string::npos)
      << r.out;
  EXPECT_NE(r.out.find("    path: " + older), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("    discovery: superseded by another copy by com.example.a (2.0) "),
            std::string::npos)
      << r.out;

  ok({"exclude", "add", "-i", "com.example.a"});
  Ran excluded = drkit({"explain", newer, "--host", root() + "/Apps/Host.app"});
  ASSERT_EQ(excluded.status, 0) << excluded.err;
  EXPECT_EQ(excluded.out.rfind("host: " + root() + "/Apps/Host.app (com.example.host)\n", 0), 0u)
      << excluded.out;
  EXPECT_NE(excluded.out.find("    discovery: excluded by the user: "
                              "{ \"UXExtensionIdentifier\": \"com.example.a\" }\n"),
            std::string::npos)
      << excluded.out;
  Ran mismatch = drkit({"explain", newer, "-p", "com.example.elsewhere"});
  EXPECT_NE(mismatch.out.find("    discovery: does not match the host's rules\n"),
            std::string::npos)
      << mismatch.out;

  // The administrator's policy is read as drd reads it.
  testing::WriteTestFile(root() + "/policy.pdoc", R"({"DeniedPlugIns": ["com.example.b"]})");
  EXPECT_EQ(ok({"match", "-i", "com.example.b"}), "");
  Ran vetoed = drkit({"explain", "com.example.b"});
  EXPECT_NE(vetoed.out.find("    discovery: denied by the administrator's policy\n"),
            std::string::npos)
      << vetoed.out;

  Ran missing = drkit({"explain", "com.example.none"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_NE(missing.out.find("com.example.none: not registered\n"), std::string::npos);
}

TEST_F(DrkitTest, HostExampleDiscoversAndReadiesAPlugIn) {
  ok({"add", makePlugIn("a"), makePlugIn("b")});
  ok({"elect", "-i", "com.example.b", "use"});
  Child host(ClientBinaryPath("host_example"), {kPoint}, DrkitEnvironment(root()));
  EXPECT_EQ(host.wait(), 0) << host.err();
  EXPECT_NE(host.out().find("com.example.a 1.0 "), std::string::npos) << host.out();
  EXPECT_NE(host.out().find("\nreadied com.example.b\nread "), std::string::npos) << host.out();
  EXPECT_NE(host.out().find(" bytes of Contents/Info.pdoc\n"), std::string::npos) << host.out();

  Child nothing(ClientBinaryPath("host_example"), {"com.example.nowhere"},
                DrkitEnvironment(root()));
  EXPECT_EQ(nothing.wait(), 1);
  EXPECT_EQ(nothing.err(), "no plug-in to ready\n");
}

// The command line is checked before anything is sent (the cases are in
// the unit tests); here: what the process prints and its exit status.
TEST(DrkitProcessTest, UsageErrorsExit2AndHelpExits0) {
  TempFolder root;
  const std::vector<std::pair<std::vector<std::string>, std::string>> errors = {
      {{}, "drkit: missing verb\nTry 'drkit help'.\n"},
      {{"-S", "x", "match", "-x"}, "drkit: match: unknown option '-x'\nTry 'drkit help match'.\n"},
      {{"nothing"}, "drkit: unknown verb 'nothing'\nTry 'drkit help'.\n"},
  };
  for (const auto& [args, err] : errors) {
    Ran r = RunDrkit(root.path(), args);
    EXPECT_EQ(r.status, 2) << err;
    EXPECT_EQ(r.err, err);
    EXPECT_EQ(r.out, "");
  }
  const std::vector<std::pair<std::vector<std::string>, std::string>> helps = {
      {{"--help"}, "Usage: drkit [-S SERVICE] VERB"},
      {{"help", "hold"}, "Usage: drkit hold "},
      {{"hold", "--help"}, "Usage: drkit hold "},
      {{"help", "--help"}, "Usage: drkit help "},
  };
  for (const auto& [args, start] : helps) {
    Ran r = RunDrkit(root.path(), args);
    EXPECT_EQ(r.status, 0) << start;
    EXPECT_EQ(r.out.rfind(start, 0), 0u) << r.out;
  }
}

}  // namespace
}  // namespace dr
