#include "client/drkit/command_line.h"

#include <gtest/gtest.h>

#include <functional>

namespace dr::drkit {
namespace {

std::vector<std::string> Argv(std::vector<std::string> args) {
  args.insert(args.begin(), "drkit");
  return args;
}

TEST(DrkitCommandLineTest, ParsesEachVerbsOptions) {
  struct Row {
    std::vector<std::string> args;
    std::function<void(const Invocation&)> check;
  };
  const std::vector<Row> rows = {
      {{"match"},
       [](const Invocation& i) {
         EXPECT_EQ(i.service, "com.corvel.dromon.drd");
         EXPECT_TRUE(i.rules.isAbsent());
         EXPECT_EQ(i.flags, 0u);
       }},
      {{"-S", "com.example.svc", "match", "-v", "--json", "--hybrid", "--system-only"},
       [](const Invocation& i) {
         EXPECT_EQ(i.service, "com.example.svc");
         EXPECT_TRUE(i.verbose && i.json);
         EXPECT_EQ(i.flags, 0x108u);
       }},
      {{"-Sx.y", "match", "--duplicates", "--all"},
       [](const Invocation& i) {
         EXPECT_EQ(i.service, "x.y");
         EXPECT_EQ(i.flags, 0x205u);  // duplicates imply all versions
       }},
      // -p and -i become rules; a key given twice lists alternatives.
      {{"match", "-p", "pt", "-i", "a", "--rule", "UXExtensionIdentifier=b", "--rule", "k==v",
        "--rule=e="},
       [](const Invocation& i) {
         EXPECT_EQ(i.rules, (Value{{"UXExtensionPointName", "pt"},
                                   {"UXExtensionIdentifier", Value(Array{"a", "b"})},
                                   {"k", "=v"},
                                   {"e", ""}}));
       }},
      // After ':=' a pattern is JSON; after '=' it stays text, even "1.0".
      {{"match", "--rule", "n:=3", "--rule", "b:=true", "--rule", "v=1.0", "--rule",
        R"(AcceptedTypes:={"image/png": 1})", "--rule", "n:=-1"},
       [](const Invocation& i) {
         EXPECT_EQ(i.rules, (Value{{"n", Value(Array{uint64_t{3}, int64_t{-1}})},
                                   {"b", true},
                                   {"v", "1.0"},
                                   {"AcceptedTypes", Value{{"image/png", uint64_t{1}}}}}));
       }},
      {{"add", "a", "/b"},
       [](const Invocation& i) {
         EXPECT_EQ(i.operands, (std::vector<std::string>{"a", "/b"}));
       }},
      {{"elect", "use", "-i", "com.x"},
       [](const Invocation& i) {
         EXPECT_EQ(i.identifier, "com.x");
         EXPECT_TRUE(i.rules.isAbsent());
         EXPECT_EQ(i.operands, std::vector<std::string>{"use"});
       }},
      {{"annotate", "-i", "com.x", "a=1", "--unset", "b", "c=", "--", "-d=2"},
       [](const Invocation& i) {
         EXPECT_EQ(i.operands, (std::vector<std::string>{"a=1", "c=", "-d=2"}));
         EXPECT_EQ(i.unset, std::vector<std::string>{"b"});
       }},
      {{"hold", "--plugin", "/p", "--plugin", "q"},
       [](const Invocation& i) {
         EXPECT_EQ(i.holdTarget, client::HoldTarget::kPlugIn);
         EXPECT_EQ(i.operands, (std::vector<std::string>{"/p", "q"}));
       }},
      {{"hold", "--app", "/a"},
       [](const Invocation& i) { EXPECT_EQ(i.holdTarget, client::HoldTarget::kApplication); }},
      {{"release", "1b4e28ba-2fa1-11d2-883f-0016d3cca427"},
       [](const Invocation& i) { EXPECT_EQ(i.operands.size(), 1u); }},
      {{"exclude", "remove", "2"},
       [](const Invocation& i) {
         EXPECT_EQ(i.operands, (std::vector<std::string>{"remove", "2"}));
       }},
      {{"exclude", "add", "-i", "com.x"},
       [](const Invocation& i) {
         EXPECT_EQ(i.rules, (Value{{"UXExtensionIdentifier", "com.x"}}));
       }},
      {{"watch", "--count", "3"}, [](const Invocation& i) { EXPECT_EQ(i.count, 3u); }},
      {{"explain", "com.x", "--host", "/A.app", "--all-versions"},
       [](const Invocation& i) {
         EXPECT_EQ(i.host, "/A.app");
         EXPECT_EQ(i.flags, 1u);
         EXPECT_EQ(i.operands, std::vector<std::string>{"com.x"});
       }},
      // Help is asked before the operands are checked.
      {{"elect", "--help"}, [](const Invocation& i) { EXPECT_TRUE(i.help); }},
      {{"--help", "hold"},
       [](const Invocation& i) {
         EXPECT_TRUE(i.help);
         EXPECT_EQ(i.verb, "hold");
       }},
      {{"--version"}, [](const Invocation& i) { EXPECT_TRUE(i.version && i.verb.empty()); }},
  };
  for (const Row& row : rows) {
    Result<Invocation> inv = ParseCommandLine(Argv(row.args));
    ASSERT_TRUE(inv) << row.args[0] << ": " << inv.error().description();
    row.check(*inv);
  }
}

TEST(DrkitCommandLineTest, RefusesMalformedCommandLines) {
  const std::vector<std::pair<std::vector<std::string>, std::string>> rows = {
      {{}, "missing verb"},
      {{"-S"}, "option '-S' needs a value"},
      {{"-S", "", "match"}, "the service name must not be empty"},
      {{"-q", "match"}, "unknown option '-q'"},
      {{"Match"}, "unknown verb 'Match'"},
      {{"match", "--bogus=1"}, "match: unknown option '--bogus'"},
      {{"match", "--rule"}, "match: option '--rule' needs a value"},
      {{"match", "--rule", "novalue"}, "match: expected --rule KEY=PATTERN or --rule KEY:=JSON"},
      {{"match", "--rule", "n:=three"}, "match: --rule n:=three: not valid JSON"},
      {{"match", "--rule", "n:=null"}, "match: --rule n:=null: null is not a value drd knows"},
      {{"match", "--rule", ":=1"}, "match: a rule needs a key: KEY=PATTERN"},
      {{"match", "--rule", "=x"}, "match: a rule needs a key: KEY=PATTERN"},
      {{"match", "stray"}, "match: unexpected operand 'stray'"},
      {{"add", "--json", "/a"}, "add: unknown option '--json'"},
      {{"elect", "--json", "-i", "a", "use"}, "elect: unknown option '--json'"},
      {{"elect", "-i", "a"}, "elect: missing operand"},
      {{"elect", "-i", "a", "on"}, "elect: expected use, ignore or default, not 'on'"},
      {{"elect", "-i", "a", "-i", "b", "use"}, "elect: -i may be given once"},
      {{"annotate", "-i", "a", "novalue"}, "annotate: expected KEY=VALUE, not 'novalue'"},
      {{"annotate", "-i", "a", "=v"}, "annotate: expected KEY=VALUE, not '=v'"},
      {{"annotate", "x=1"}, "annotate: -i ID is required"},
      {{"hold"}, "hold: --app PATH or --plug-in PATH is required"},
      {{"hold", "--app", "/a", "--plug-in", "/b"}, "hold: --app and --plug-in do not mix"},
      {{"hold", "--app", "/a", "/b"}, "hold: unexpected operand '/b'"},
      {{"ready", "1B4E28BA-2FA1-11D2-883F-0016D3CCA42"},
       "ready: not a UUID: '1B4E28BA-2FA1-11D2-883F-0016D3CCA42'"},
      {{"extension", "eat", "t"}, "extension: unknown action 'eat' (expected consume or open)"},
      {{"extension", "consume"}, "extension: missing operand"},
      {{"exclude", "add"}, "exclude: add takes rules: -p, -i or --rule"},
      {{"exclude", "remove", "0"}, "exclude: remove takes rules or one number from 'list'"},
      {{"exclude", "remove", "1", "-i", "a"},
       "exclude: remove takes rules or one number from 'list'"},
      {{"exclude", "list", "-i", "a"}, "exclude: list takes nothing more"},
      {{"exclude", "drop"}, "exclude: unknown action 'drop' (expected add, remove or list)"},
      {{"watch", "--count", "many"}, "watch: --count needs a number, not 'many'"},
      {{"explain"}, "explain: missing operand"},
      {{"explain", "a", "-i", "b"}, "explain: unknown option '-i'"},
      {{"help", "nothing"}, "help: no such verb 'nothing'"},
  };
  for (const auto& [args, message] : rows) {
    Result<Invocation> inv = ParseCommandLine(Argv(args));
    ASSERT_FALSE(inv) << message;
    EXPECT_EQ(inv.error().domain(), kUsageErrorDomain);
    EXPECT_EQ(inv.error().localizedDescription(), message);
  }
}

TEST(DrkitCommandLineTest, EveryVerbHasHelp) {
  const std::string general = GeneralHelp();
  for (const char* verb :
       {"match", "add", "remove", "elect", "annotate", "hold", "release", "ready", "access",
        "extension", "exclude", "watch", "raw", "status", "explain", "help"}) {
    EXPECT_NE(general.find(std::string("\n  ") + verb + " "), std::string::npos) << verb;
    const std::string help = VerbHelp(verb);
    EXPECT_EQ(help.rfind(std::string("Usage: drkit ") + verb, 0), 0u) << help;
    EXPECT_EQ(help.find("$DISCOVERY"), std::string::npos) << verb;
  }
  EXPECT_EQ(VerbHelp("nothing"), "");
}

}  // namespace
}  // namespace dr::drkit
