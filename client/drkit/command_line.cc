#include "client/drkit/command_line.h"

#include <getopt.h>

#include <algorithm>
#include <bitset>
#include <charconv>
#include <string_view>

#include "client/drkit/commands.h"
#include "client/drkit/output.h"

namespace dr::drkit {
namespace {

// drkit's own option before the verb, and its spellings with a glued value.
constexpr std::string_view kServiceShort = "-S";
constexpr std::string_view kServiceLong = "--service";
constexpr std::string_view kServiceLongGlued = "--service=";

// The options after the verb. Each verb's row lists those it takes.
enum class Opt {
  kHelp,
  kPoint,
  kIdentifierRule,  // -i as a rule (discovery, exclusions)
  kIdentifier,      // -i naming the one plug-in a verb changes
  kVerbose,
  kRule,
  kAllVersions,
  kDuplicates,
  kAll,
  kHybrid,
  kSystemOnly,
  kJson,
  kApp,
  kPlugIn,
  kUnset,
  kCount,
  kHost,
};
constexpr size_t kOptCount = static_cast<size_t>(Opt::kHost) + 1;
using Seen = std::bitset<kOptCount>;

// What follows an option.
enum class Takes {
  kNothing,
  kText,
  kNumber,  // a non-negative decimal integer
  kRule,    // KEY=PATTERN or KEY:=JSON
};

struct OptionSpec {
  Opt id;
  char shortName;  // 0: long only
  const char* longName;
  Takes takes;
  // What the option sets besides its own handling in ApplyOption.
  bool Invocation::*sets = nullptr;
  uint64_t flags = 0;             // discovery flags
  const char* ruleKey = nullptr;  // the rule whose pattern is the value
};

constexpr OptionSpec kOptions[] = {
    {Opt::kHelp, 'h', "help", Takes::kNothing, &Invocation::help},
    {Opt::kPoint, 'p', "extension-point", Takes::kText, nullptr, 0, client::kRuleExtensionPoint},
    {Opt::kIdentifierRule, 'i', "identifier", Takes::kText, nullptr, 0, client::kRuleIdentifier},
    {Opt::kIdentifier, 'i', "identifier", Takes::kText},
    {Opt::kVerbose, 'v', "verbose", Takes::kNothing, &Invocation::verbose},
    {Opt::kRule, 0, "rule", Takes::kRule},
    {Opt::kAllVersions, 0, "all-versions", Takes::kNothing, nullptr, client::kDiscoverAllVersions},
    {Opt::kDuplicates, 0, "duplicates", Takes::kNothing, nullptr,
     client::kDiscoverDuplicates | client::kDiscoverAllVersions},
    {Opt::kAll, 0, "all", Takes::kNothing, nullptr, client::kDiscoverAll},
    {Opt::kHybrid, 0, "hybrid", Takes::kNothing, nullptr, client::kDiscoverHybrid},
    {Opt::kSystemOnly, 0, "system-only", Takes::kNothing, nullptr, client::kDiscoverSystemOnly},
    {Opt::kJson, 0, "json", Takes::kNothing, &Invocation::json},
    {Opt::kApp, 0, "app", Takes::kText},
    {Opt::kPlugIn, 0, "plug-in", Takes::kText},
    {Opt::kPlugIn, 0, "plugin", Takes::kText},  // the spelling of earlier versions
    {Opt::kUnset, 0, "unset", Takes::kText},
    {Opt::kCount, 0, "count", Takes::kNumber},
    {Opt::kHost, 0, "host", Takes::kText},
};

// getopt_long's answer for an option: its short name when it has one (so
// that a long spelling's errors name the short one), else a number past
// every character.
constexpr int kLongOnly = 256;
int GetoptCode(const OptionSpec& o) {
  return o.shortName != 0 ? o.shortName : kLongOnly + static_cast<int>(o.id);
}

constexpr int kUnlimited = -1;

// A verb's checks of what getopt cannot check (operand forms, option
// combinations): the problem, or empty.
using Check = std::string (*)(const Invocation&, const Seen&);

// How a verb is parsed and run.
struct VerbGrammar {
  const char* name;
  std::vector<Opt> options;  // besides --help, which every verb takes
  int minOperands;
  int maxOperands;  // kUnlimited: no limit
  Check check;      // nullptr: nothing more to check
  VerbHandler run;

  bool takes(Opt o) const {
    return o == Opt::kHelp || std::find(options.begin(), options.end(), o) != options.end();
  }
};

// One verb: everything the parser, the dispatcher, the help, the manual
// page and the shell completion know of it.
struct VerbSpec : VerbGrammar {
  const char* synopsis;
  const char* summary;
  std::string details;
};

constexpr const char* kPointOptionHelp =
    "  -p, --extension-point POINT  plug-ins of this extension point\n";
// explain names its plug-ins by an operand instead.
constexpr const char* kIdentifierOptionHelp =
    "  -i, --identifier ID          plug-ins with this identifier\n";
constexpr const char* kRuleOptionsHelp =
    "      --rule KEY=PATTERN       any rule, PATTERN a string; a KEY given again\n"
    "                               adds an alternative\n"
    "      --rule KEY:=JSON         a rule whose pattern is a number, boolean,\n"
    "                               list or dictionary, written as JSON\n"
    "      --all-versions           every version of an identifier, not just the newest\n"
    "      --duplicates             equal versions too (implies --all-versions)\n"
    "      --hybrid                 include plug-ins with embedded code\n"
    "      --system-only            only plug-ins on the system volume\n"
    "      --all                    skip visibility and hold checks (needs the\n"
    "                               manager entitlement)\n";

std::optional<uint64_t> ParseCount(std::string_view text) {
  uint64_t n = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), n);
  if (ec != std::errc() || end != text.data() + text.size() || text.empty()) return std::nullopt;
  return n;
}

const VerbSpec* FindVerb(std::string_view name);

std::string CheckElect(const Invocation& inv, const Seen&) {
  const std::string& choice = inv.operands[0];
  if (inv.identifier.empty()) return "-i ID is required";
  if (choice == "use" || choice == "ignore" || choice == "default") return "";
  return "expected use, ignore or default, not '" + choice + "'";
}

std::string CheckAnnotate(const Invocation& inv, const Seen&) {
  if (inv.identifier.empty()) return "-i ID is required";
  for (const std::string& pair : inv.operands) {
    size_t eq = pair.find('=');
    if (eq == std::string::npos || eq == 0) return "expected KEY=VALUE, not '" + pair + "'";
  }
  return "";
}

std::string CheckHold(const Invocation& inv, const Seen& seen) {
  if (seen[static_cast<size_t>(Opt::kApp)] && seen[static_cast<size_t>(Opt::kPlugIn)]) {
    return "--app and --plug-in do not mix";
  }
  return inv.holdTarget ? "" : "--app PATH or --plug-in PATH is required";
}

std::string CheckUuids(const Invocation& inv, const Seen&) {
  for (const std::string& text : inv.operands) {
    if (!Uuid::parse(text)) return "not a UUID: '" + text + "'";
  }
  return "";
}

std::string CheckExtension(const Invocation& inv, const Seen&) {
  const std::string& action = inv.operands[0];
  if (action == "consume") return inv.operands.size() == 2 ? "" : "consume takes one TOKEN";
  if (action == "open") return "";
  return "unknown action '" + action + "' (expected consume or open)";
}

std::string CheckExclude(const Invocation& inv, const Seen&) {
  const std::vector<std::string>& ops = inv.operands;
  const bool rules = inv.rules.isPresent();
  if (ops[0] == "add") return rules && ops.size() == 1 ? "" : "add takes rules: -p, -i or --rule";
  if (ops[0] == "remove") {
    std::optional<uint64_t> n = ops.size() == 2 ? ParseCount(ops[1]) : std::nullopt;
    const bool ok = ops.size() == 2 ? !rules && n && *n > 0 : rules;
    return ok ? "" : "remove takes rules or one number from 'list'";
  }
  if (ops[0] == "list") return !rules && ops.size() == 1 ? "" : "list takes nothing more";
  return "unknown action '" + ops[0] + "' (expected add, remove or list)";
}

std::string CheckHelp(const Invocation& inv, const Seen&) {
  if (inv.operands.empty() || FindVerb(inv.operands[0])) return "";
  return "no such verb '" + inv.operands[0] + "'";
}

const std::vector<VerbSpec>& Verbs() {
  static const std::vector<VerbSpec> verbs = {
      {{"match",
        {Opt::kPoint, Opt::kIdentifierRule, Opt::kRule, Opt::kAllVersions, Opt::kDuplicates,
         Opt::kAll, Opt::kHybrid, Opt::kSystemOnly, Opt::kVerbose, Opt::kJson},
        0,
        0,
        nullptr,
        RunMatch},
       "match [OPTIONS]",
       "list the plug-ins drd offers to a host",
       std::string("Prints one line per plug-in, by identifier: its election mark ('+' elected,\n"
                   "'-' ignored, ' ' not chosen), identifier and version.\n\n"
                   "Options:\n") +
           kPointOptionHelp + kIdentifierOptionHelp + kRuleOptionsHelp +
           "  -v, --verbose                also print UUID, path and registration time\n"
           "      --json                   print the plug-ins' forms as JSON\n\n"
           "Rules: each names a key of the plug-ins' attributes (then of their\n"
           "information dictionary) and a pattern. After '=' the pattern is a string,\n"
           "so \"1.0\" stays a version text; after ':=' it is JSON:\n"
           "  --rule BNBundleVersion='>=2'                 a version range (a string)\n"
           "  --rule 'AcceptedTypes:={\"image/png\": 1}'    offers one PNG: a dictionary of\n"
           "                                               type to number of items\n"
           "  --rule Count:=3  --rule Enabled:=true        a number, a boolean\n"},
      {{"add", {}, 1, kUnlimited, nullptr, RunAdd},
       "add PATH...",
       "register plug-in bundles",
       "Registers the plug-in bundle at each PATH, in order; stops at the first\n"
       "failure (the bundles before it stay registered).\n"},
      {{"remove", {}, 1, kUnlimited, nullptr, RunRemove},
       "remove PATH...",
       "unregister plug-in bundles",
       "Unregisters the plug-in bundle at each PATH, in order; the bundle need\n"
       "not exist on disk any more.\n"},
      {{"elect", {Opt::kIdentifier}, 1, 1, CheckElect, RunElect},
       "elect -i ID use|ignore|default",
       "turn a plug-in on or off for the user",
       "Records the user's election for every installed copy of plug-in ID:\n"
       "  use      turn it on (election 1)\n"
       "  ignore   turn it off (election -1); automatic election leaves it off\n"
       "  default  no choice (election 0); a plug-in entitled to automatic\n"
       "           election is turned on again when drd next loads it\n"},
      {{"annotate",
        {Opt::kIdentifier, Opt::kUnset, Opt::kJson},
        0,
        kUnlimited,
        CheckAnnotate,
        RunAnnotate},
       "annotate -i ID [KEY=VALUE...] [--unset KEY...]",
       "change a plug-in's settings",
       "Sets each KEY to the string VALUE and removes each --unset KEY in the\n"
       "settings of every installed copy of plug-in ID; the other settings stay.\n"
       "Without changes, prints the settings as JSON.\n\n"
       "Options:\n"
       "      --json                   print the settings on one line when piped\n"},
      {{"hold", {Opt::kApp, Opt::kPlugIn, Opt::kJson}, 0, 0, CheckHold, RunHold},
       "hold --app PATH... | --plug-in PATH...",
       "keep plug-ins out of use while they are replaced",
       "Holds every plug-in of the application at each --app PATH, or the plug-in\n"
       "bundle at each --plug-in PATH (options may repeat; the two do not mix).\n"
       "Prints the hold's token and keeps the hold until SIGINT or SIGTERM, or\n"
       "until standard input ends. Ends with status 1 if drd goes away (the hold\n"
       "goes with it). Refused while a plug-in of an application is running.\n"
       "With --json the token is printed as {\"token\": TOKEN}.\n"},
      {{"release", {}, 1, kUnlimited, CheckUuids, RunRelease},
       "release TOKEN...",
       "release holds",
       "Releases the holds with these tokens; unknown tokens are passed over.\n"},
      {{"ready", {}, 1, kUnlimited, CheckUuids, RunReady},
       "ready UUID...",
       "ready plug-ins for this process",
       "Asks drd to make the plug-ins' services reachable from drkit's process;\n"
       "shows whether a host could use them.\n"},
      {{"access", {Opt::kJson}, 1, kUnlimited, CheckUuids, RunAccess},
       "access UUID...",
       "get read tokens for plug-in bundles",
       "Prints one read token per plug-in, in order (see 'extension consume');\n"
       "with --json, a list of {\"uuid\": UUID, \"token\": TOKEN}.\n"},
      {{"extension", {Opt::kJson}, 2, 3, CheckExtension, RunExtension},
       "extension consume TOKEN | extension open TOKEN [FILE]",
       "check or open a read token",
       "consume: checks TOKEN against the user's key and prints the path it grants\n"
       "(with --json, {\"path\": PATH}).\n"
       "open: hands TOKEN to drd, which opens what it grants; prints FILE (a path\n"
       "inside the granted folder) read through that, or lists the folder (with\n"
       "--json, {\"path\": PATH, \"names\": [...]}). Works inside a sandbox that\n"
       "can reach drd's socket but not the plug-in.\n"},
      {{"exclude",
        {Opt::kPoint, Opt::kIdentifierRule, Opt::kRule, Opt::kJson},
        1,
        2,
        CheckExclude,
        RunExclude},
       "exclude add RULES | exclude remove RULES|N | exclude list",
       "edit the user's plug-in exclusions",
       "The user's exclusions hide every plug-in that satisfies one of them from\n"
       "every host. Each exclusion is one set of rules:\n"
       "  add RULES      add the exclusion made of RULES\n"
       "  remove RULES   remove every exclusion equal to RULES\n"
       "  remove N       remove the N-th exclusion of 'list'\n"
       "  list           print the exclusions, numbered, as JSON (with --json,\n"
       "                 one JSON list of them)\n"
       "RULES:\n"
       "  -p, --extension-point POINT, -i, --identifier ID, --rule KEY=PATTERN,\n"
       "  --rule KEY:=JSON (see 'drkit help match')\n"},
      {{"watch", {Opt::kCount, Opt::kJson}, 0, 0, nullptr, RunWatch},
       "watch [--count N]",
       "print drd's change notifications",
       "Prints one line per posted change notification: its name and count.\n"
       "Runs until SIGINT or SIGTERM, or until N notifications were printed.\n"
       "With --json each line is {\"name\": NAME, \"count\": COUNT}.\n"},
      {{"raw", {Opt::kJson}, 0, 1, nullptr, RunRaw},
       "raw [JSON]",
       "send any request",
       "Sends the request given as a JSON object (read from standard input when\n"
       "absent) and prints drd's reply as JSON. Non-negative integers are sent\n"
       "unsigned. Values JSON lacks are written as objects with one key:\n"
       "{\"$uuid\": \"TEXT\"}, {\"$data\": \"BASE64\"}, {\"$date\": SECONDS}.\n"
       "Example: {\"request\": \"match\", \"version\": 2, \"flags\": 1}\n"},
      {{"status", {Opt::kJson}, 0, 0, nullptr, RunStatus},
       "status",
       "tell whether drd is answering",
       "Prints drd's socket and whether drd answers a request there; with --json,\n"
       "{\"service\": NAME, \"socket\": PATH, \"answering\": true|false}.\n"},
      {{"explain",
        {Opt::kHost, Opt::kPoint, Opt::kRule, Opt::kAllVersions, Opt::kDuplicates, Opt::kAll,
         Opt::kHybrid, Opt::kSystemOnly, Opt::kVerbose, Opt::kJson},
        1,
        1,
        nullptr,
        RunExplain},
       "explain PATH|IDENTIFIER [--host APP] [OPTIONS]",
       "tell why plug-ins are or are not offered to a host",
       std::string("Reads the registry and runs discovery as drd would for a host, then prints\n"
                   "for each plug-in of the bundle at PATH (or with IDENTIFIER) whether it is\n"
                   "registered and what discovery made of it. drd need not be running.\n\n"
                   "Options:\n"
                   "      --host APP               the host application's bundle (default: a\n"
                   "                               host outside any bundle)\n") +
           kPointOptionHelp + kRuleOptionsHelp +
           "  -v, --verbose                also print what drd would log\n"
           "      --json                   print the same as one JSON object\n"},
      {{"help", {}, 0, 1, CheckHelp, RunHelp},
       "help [VERB]",
       "print help",
       "Prints the help of VERB, or of drkit.\n"},
  };
  return verbs;
}

const VerbSpec* FindVerb(std::string_view name) {
  for (const VerbSpec& v : Verbs()) {
    if (name == v.name) return &v;
  }
  return nullptr;
}

Error UsageError(std::string message) {
  return Error(kUsageErrorDomain, kExitUsage, std::move(message));
}

// Adds KEY=PATTERN to a rules dictionary; a second pattern for one key turns
// the entry into an array of alternatives. Answers the problem, or empty.
std::string AddRule(Dictionary& rules, std::string_view key, Value pattern) {
  if (key.empty()) return "a rule needs a key: KEY=PATTERN";
  auto [it, inserted] = rules.try_emplace(std::string(key), pattern);
  if (inserted) return "";
  Array alternatives = it->second.isArray() ? it->second.array() : Array{it->second};
  alternatives.push_back(std::move(pattern));
  it->second = Value(std::move(alternatives));
  return "";
}

// --rule's value: KEY=PATTERN takes the text as it is; KEY:=JSON reads a
// typed pattern (a number, boolean, list or dictionary).
std::string AddRuleText(Dictionary& rules, std::string_view value) {
  size_t eq = value.find('=');
  if (eq == std::string::npos) return "expected --rule KEY=PATTERN or --rule KEY:=JSON";
  std::string_view key = value.substr(0, eq);
  const std::string_view text = value.substr(eq + 1);
  if (key.empty() || key.back() != ':') return AddRule(rules, key, Value(text));
  key.remove_suffix(1);
  Result<Value> typed = FromJson(text);
  if (!typed.ok()) {
    return "--rule " + std::string(key) + ":=" + std::string(text) + ": " +
           typed.error().localizedDescription();
  }
  return AddRule(rules, key, *typed);
}

// Applies one option and its value: the problem, or empty.
std::string ApplyOption(const OptionSpec& o, const std::string& value, Invocation& inv,
                        Dictionary& rules) {
  if (o.sets) inv.*o.sets = true;
  inv.flags |= o.flags;
  if (o.ruleKey) return AddRule(rules, o.ruleKey, Value(value));
  if (o.takes == Takes::kRule) return AddRuleText(rules, value);
  const std::optional<uint64_t> number = ParseCount(value);
  if (o.takes == Takes::kNumber && !number) {
    return "--" + std::string(o.longName) + " needs a number, not '" + value + "'";
  }
  switch (o.id) {
    case Opt::kIdentifier:
      if (!inv.identifier.empty()) return "-i may be given once";
      inv.identifier = value;
      return "";
    case Opt::kApp:
    case Opt::kPlugIn:
      inv.holdTarget =
          o.id == Opt::kApp ? client::HoldTarget::kApplication : client::HoldTarget::kPlugIn;
      inv.operands.push_back(value);
      return "";
    case Opt::kUnset:
      if (value.empty()) return "--unset needs a key";
      inv.unset.push_back(value);
      return "";
    case Opt::kCount:
      inv.count = *number;
      return "";
    case Opt::kHost:
      inv.host = value;
      return "";
    default:
      return "";
  }
}

// getopt_long over the verb's options, then its operands and checks.
// argv[0] of `args` is the verb.
Status ParseVerbOptions(const VerbSpec& spec, std::vector<std::string> args, Invocation& inv) {
  std::string shortOptions = ":";  // ':' first: a missing value is reported as ':'
  std::vector<struct option> longOptions;
  for (const OptionSpec& o : kOptions) {
    if (!spec.takes(o.id)) continue;
    const bool hasValue = o.takes != Takes::kNothing;
    if (o.shortName != 0) {
      shortOptions += o.shortName;
      if (hasValue) shortOptions += ':';
    }
    longOptions.push_back(
        {o.longName, hasValue ? required_argument : no_argument, nullptr, GetoptCode(o)});
  }
  longOptions.push_back({nullptr, 0, nullptr, 0});

  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  const int argc = static_cast<int>(args.size());

  Dictionary rules;
  Seen seen;
  const std::string verb = spec.name;
  optind = 0;  // 0 makes GNU getopt start afresh
  opterr = 0;
  for (;;) {
    int index = 0;
    int c = getopt_long(argc, argv.data(), shortOptions.c_str(), longOptions.data(), &index);
    if (c == -1) break;
    if (c == '?' || c == ':') {
      // optind has moved past the element at fault (or its missing value).
      std::string what = optopt != 0 && optopt < kLongOnly
                             ? std::string("-") + static_cast<char>(optopt)
                             : std::string(argv[optind - 1]);
      if (size_t eq = what.find('='); what.starts_with("--") && eq != std::string::npos) {
        what.resize(eq);
      }
      return UsageError(
          verb + ": " +
          (c == '?' ? "unknown option '" + what + "'" : "option '" + what + "' needs a value"));
    }
    // The verb's option with this code (getopt answers only those).
    const OptionSpec& o = *std::find_if(std::begin(kOptions), std::end(kOptions), [&](auto& a) {
      return spec.takes(a.id) && GetoptCode(a) == c;
    });
    seen.set(static_cast<size_t>(o.id));
    std::string problem = ApplyOption(o, optarg ? optarg : "", inv, rules);
    if (!problem.empty()) return UsageError(verb + ": " + problem);
  }
  if (!rules.empty()) inv.rules = Value(std::move(rules));
  if (inv.help) return Status();

  const int operands = argc - optind;
  for (int i = optind; i < argc; ++i) inv.operands.emplace_back(argv[i]);
  if (operands < spec.minOperands) return UsageError(verb + ": missing operand");
  if (spec.maxOperands != kUnlimited && operands > spec.maxOperands) {
    return UsageError(verb + ": unexpected operand '" +
                      std::string(argv[optind + spec.maxOperands]) + "'");
  }
  if (spec.check) {
    if (std::string problem = spec.check(inv, seen); !problem.empty()) {
      return UsageError(verb + ": " + problem);
    }
  }
  return Status();
}

}  // namespace

Result<Invocation> ParseCommandLine(const std::vector<std::string>& argv) {
  Invocation inv;
  size_t i = 1;
  // Global options come before the verb; getopt is not used here so that
  // the verb's own options are never taken for global ones.
  for (; i < argv.size(); ++i) {
    const std::string& a = argv[i];
    if (a == "-h" || a == "--help") {
      inv.help = true;
    } else if (a == "--version") {
      inv.version = true;
    } else if (a == kServiceShort || a == kServiceLong) {
      if (++i == argv.size()) return UsageError("option '" + a + "' needs a value");
      inv.service = argv[i];
    } else if (a.starts_with(kServiceLongGlued)) {
      inv.service = a.substr(kServiceLongGlued.size());
    } else if (a.starts_with(kServiceShort) && a.size() > kServiceShort.size()) {
      inv.service = a.substr(kServiceShort.size());
    } else if (a == "--") {
      ++i;
      break;
    } else if (a.starts_with("-")) {
      return UsageError("unknown option '" + a + "'");
    } else {
      break;
    }
  }
  if (inv.service.empty()) return UsageError("the service name must not be empty");
  if (i == argv.size()) {
    if (inv.help || inv.version) return inv;
    return UsageError("missing verb");
  }
  inv.verb = argv[i];
  const VerbSpec* spec = FindVerb(inv.verb);
  if (!spec) return UsageError("unknown verb '" + inv.verb + "'");
  if (inv.help) return inv;  // "drkit --help VERB": the verb's help
  std::vector<std::string> args(argv.begin() + static_cast<std::ptrdiff_t>(i), argv.end());
  if (Status s = ParseVerbOptions(*spec, std::move(args), inv); !s.ok()) return s.error();
  return inv;
}

VerbHandler HandlerFor(const std::string& verb) {
  const VerbSpec* spec = FindVerb(verb);
  return spec ? spec->run : nullptr;
}

std::string GeneralHelp() {
  constexpr size_t kSummaryColumn = 11;  // of the verb list, after its indent
  std::string out =
      "Usage: drkit [-S SERVICE] VERB [OPTIONS] [OPERANDS]\n"
      "Talks to drd, the plug-in registry daemon of this user.\n\n"
      "Options:\n"
      "  -S, --service SERVICE   drd's service name (default ";
  out += client::kDefaultServiceName;
  out +=
      ")\n"
      "  -h, --help              print this help, or a verb's with VERB\n"
      "      --version           print drkit's version\n\n"
      "Verbs:\n";
  for (const VerbSpec& v : Verbs()) {
    std::string name = v.name;
    name.resize(std::max(name.size() + 1, kSummaryColumn), ' ');
    out += "  " + name + v.summary + "\n";
  }
  out +=
      "\nRun 'drkit help VERB' for a verb's options. drd's socket folder is\n"
      "$DR_SOCKET_DIR, else $XDG_RUNTIME_DIR/dromon.\n";
  return out;
}

std::string HelpCommandFor(const std::vector<std::string>& argv) {
  for (size_t i = 1; i < argv.size(); ++i) {
    const std::string& a = argv[i];
    if (a == kServiceShort || a == kServiceLong) {
      ++i;
    } else if (!a.starts_with("-")) {
      return FindVerb(a) ? "drkit help " + a : "drkit help";
    }
  }
  return "drkit help";
}

std::vector<VerbDoc> VerbDocs() {
  std::vector<VerbDoc> docs;
  for (const VerbSpec& v : Verbs()) {
    VerbDoc doc{v.name, v.synopsis, v.summary, VerbHelp(v.name), {}};
    for (const OptionSpec& o : kOptions) {
      if (!v.takes(o.id)) continue;
      if (o.shortName != 0) doc.options.push_back(std::string("-") + o.shortName);
      doc.options.push_back(std::string("--") + o.longName);
    }
    docs.push_back(std::move(doc));
  }
  return docs;
}

std::string VerbHelp(const std::string& verb) {
  const VerbSpec* spec = FindVerb(verb);
  if (!spec) return std::string();
  return std::string("Usage: drkit ") + spec->synopsis + "\n" + spec->summary + ".\n\n" +
         spec->details;
}

}  // namespace dr::drkit
