#include "client/drkit/command_line.h"

#include <gtest/gtest.h>

#include "client/drkit/output.h"

namespace dr::drkit {
namespace {

// An invocation as its verb, the fields not at their defaults, [operands].
std::string Show(const Invocation& i) {
  using client::HoldTarget;
  std::string out = i.verb + (i.service != client::kDefaultServiceName ? " S=" + i.service : "") +
                    (i.help ? " help" : "") + (i.version ? " version" : "") +
                    (i.verbose ? " verbose" : "") + (i.json ? " json" : "") +
                    (i.flags ? " flags=" + std::to_string(i.flags) : "") +
                    (i.rules.isPresent() ? " rules=" + ToJson(i.rules, false) : "") +
                    (i.identifier.empty() ? "" : " id=" + i.identifier) +
                    (i.holdTarget == HoldTarget::kApplication ? " app" : "") +
                    (i.holdTarget == HoldTarget::kPlugIn ? " plug-in" : "") +
                    (i.count ? " count=" + std::to_string(i.count) : "") +
                    (i.host.empty() ? "" : " host=" + i.host);
  for (const std::string& key : i.unset) out += " unset=" + key;
  for (const std::string& operand : i.operands) out += " [" + operand + "]";
  return out;
}

// The parse of drkit's arguments `args`: Show, or "! " and the usage error.
std::string Parse(std::vector<std::string> args) {
  args.insert(args.begin(), "drkit");
  Result<Invocation> inv = ParseCommandLine(args);
  if (inv) return Show(*inv);
  EXPECT_EQ(inv.error().domain(), kUsageErrorDomain);
  return "! " + inv.error().localizedDescription();
}

TEST(DrkitCommandLineTest, ParsesOrRefusesEachCommandLine) {
  const std::vector<std::pair<std::vector<std::string>, std::string>> rows = {
      // --duplicates implies --all-versions.
      {{"-Sx", "match", "-v", "--json", "--hybrid", "--system-only", "--duplicates", "--all"},
       "match S=x verbose json flags=781"},
      {{"--service=x", "--", "match", "--all-v"}, "match S=x flags=1"},
      // -p and -i become rules; a key given twice lists alternatives.
      {{"match", "-p", "pt", "-i", "a", "--rule", "UXExtensionIdentifier=b", "--rule", "k==v",
        "--rule=e="},
       R"(match rules={"UXExtensionIdentifier":["a","b"],"UXExtensionPointName":"pt","e":"","k":"=v"})"},
      // After ':=' a pattern is JSON; after '=' it stays text, even "1.0".
      {{"match", "--rule", "n:=3", "--rule", "b:=true", "--rule", "v=1.0", "--rule",
        R"(T:={"image/png": 1})", "--rule", "n:=-1"},
       R"(match rules={"T":{"image/png":1},"b":true,"n":[3,-1],"v":"1.0"})"},
      {{"elect", "use", "-i", "com.x"}, "elect id=com.x [use]"},
      {{"annotate", "-i", "com.x", "a=1", "--unset", "b", "c=", "--", "-d=2"},
       "annotate id=com.x unset=b [a=1] [c=] [-d=2]"},
      {{"hold", "--plugin", "/p", "--plug", "q"}, "hold plug-in [/p] [q]"},
      {{"exclude", "add", "-i", "com.x"},
       R"(exclude rules={"UXExtensionIdentifier":"com.x"} [add])"},
      {{"watch", "--count", "3"}, "watch count=3"},
      {{"explain", "com.x", "--host", "/A.app", "--all-versions"},
       "explain flags=1 host=/A.app [com.x]"},
      // Help is asked before the operands are checked.
      {{"--help", "hold"}, "hold help"},
      {{"--version"}, " version"},
      {{"-S"}, "! option '-S' needs a value"},
      {{"--service=", "match"}, "! the service name must not be empty"},
      {{"-q", "match"}, "! unknown option '-q'"},
      {{"match", "--bogus=1"}, "! match: unknown option '--bogus'"},
      {{"match", "--rule"}, "! match: option '--rule' needs a value"},
      {{"match", "--rule", "novalue"}, "! match: expected --rule KEY=PATTERN or --rule KEY:=JSON"},
      {{"match", "--rule", "n:=three"}, "! match: --rule n:=three: not valid JSON"},
      {{"match", "--rule", "n:=null"}, "! match: --rule n:=null: null is not a value drd knows"},
      {{"match", "--rule", ":=1"}, "! match: a rule needs a key: KEY=PATTERN"},
      {{"match", "stray"}, "! match: unexpected operand 'stray'"},
      {{"match", "--count", "1"}, "! match: unknown option '--count'"},
      {{"elect", "-i", "a"}, "! elect: missing operand"},
      {{"elect", "-i", "a", "on"}, "! elect: expected use, ignore or default, not 'on'"},
      {{"elect", "-i", "a", "-i", "b", "use"}, "! elect: -i may be given once"},
      {{"annotate", "-i", "a", "=v"}, "! annotate: expected KEY=VALUE, not '=v'"},
      {{"annotate", "x=1"}, "! annotate: -i ID is required"},
      {{"annotate", "-i", "a", "--unset="}, "! annotate: --unset needs a key"},
      {{"hold"}, "! hold: --app PATH or --plug-in PATH is required"},
      {{"hold", "--app", "/a", "--plug-in", "/b"}, "! hold: --app and --plug-in do not mix"},
      {{"hold", "--app", "/a", "/b"}, "! hold: unexpected operand '/b'"},
      {{"ready", "1B4E28BA-2FA1-11D2-883F-0016D3CCA42"},
       "! ready: not a UUID: '1B4E28BA-2FA1-11D2-883F-0016D3CCA42'"},
      {{"extension", "eat", "t"}, "! extension: unknown action 'eat' (expected consume or open)"},
      {{"exclude", "add"}, "! exclude: add takes rules: -p, -i or --rule"},
      {{"exclude", "remove", "0"}, "! exclude: remove takes rules or one number from 'list'"},
      {{"exclude", "remove", "1", "-i", "a"},
       "! exclude: remove takes rules or one number from 'list'"},
      {{"exclude", "list", "-i", "a"}, "! exclude: list takes nothing more"},
      {{"exclude", "drop"}, "! exclude: unknown action 'drop' (expected add, remove or list)"},
      {{"watch", "--count", "-1"}, "! watch: --count needs a number, not '-1'"},
      {{"explain"}, "! explain: missing operand"},
      {{"explain", "a", "-i", "b"}, "! explain: unknown option '-i'"},
      {{"help", "nothing"}, "! help: no such verb 'nothing'"},
  };
  for (const auto& [args, expected] : rows) EXPECT_EQ(Parse(args), expected);
}

// Each verb has help, and takes every option its manual page and completion offer.
TEST(DrkitCommandLineTest, EveryVerbHasHelpAndTakesItsListedOptions) {
  const std::string general = GeneralHelp();
  for (const VerbDoc& v : VerbDocs()) {
    EXPECT_NE(general.find("\n  " + v.name + " "), std::string::npos) << v.name;
    EXPECT_EQ(v.help.rfind("Usage: drkit " + v.synopsis + "\n" + v.summary + ".\n\n", 0), 0u);
    EXPECT_EQ(Parse({"help", v.name}), "help [" + v.name + "]");
    EXPECT_EQ(Parse({v.name, "--help"}), v.name + " help");
    for (const std::string& option : v.options) {
      EXPECT_EQ(Parse({v.name, option, "1", "--help"}).find("unknown"), std::string::npos)
          << option;
    }
  }
  EXPECT_EQ(VerbHelp("nothing"), "");
}

}  // namespace
}  // namespace dr::drkit
