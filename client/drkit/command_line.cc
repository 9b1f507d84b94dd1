#include "client/drkit/command_line.h"

#include <getopt.h>

#include <algorithm>
#include <charconv>
#include <string_view>

#include "client/drkit/output.h"

namespace dr::drkit {
namespace {

// Options after the verb. Each verb accepts a subset (VerbSpec::options).
enum Option : int {
  kOptHelp = 'h',
  kOptPoint = 'p',
  kOptIdentifier = 'i',
  kOptVerbose = 'v',
  kOptRule = 256,
  kOptAllVersions,
  kOptDuplicates,
  kOptAll,
  kOptHybrid,
  kOptSystemOnly,
  kOptJson,
  kOptApp,
  kOptPlugIn,
  kOptUnset,
  kOptCount,
  kOptHost,
};

struct OptionSpec {
  Option id;
  const char* longName;  // nullptr: short only
  bool hasArgument;
};

constexpr OptionSpec kOptions[] = {
    {kOptHelp, "help", false},
    {kOptPoint, "extension-point", true},
    {kOptIdentifier, "identifier", true},
    {kOptVerbose, "verbose", false},
    {kOptRule, "rule", true},
    {kOptAllVersions, "all-versions", false},
    {kOptDuplicates, "duplicates", false},
    {kOptAll, "all", false},
    {kOptHybrid, "hybrid", false},
    {kOptSystemOnly, "system-only", false},
    {kOptJson, "json", false},
    {kOptApp, "app", true},
    {kOptPlugIn, "plug-in", true},
    {kOptPlugIn, "plugin", true},  // the spelling of earlier versions
    {kOptUnset, "unset", true},
    {kOptCount, "count", true},
    {kOptHost, "host", true},
};

constexpr int kUnlimited = -1;

struct VerbSpec {
  const char* name;
  std::vector<Option> options;  // besides --help, which every verb takes
  int minOperands;
  int maxOperands;  // kUnlimited: no limit
  const char* synopsis;
  const char* summary;
  const char* details;
};

constexpr const char* kDiscoveryOptionsHelp =
    "  -p, --extension-point POINT  plug-ins of this extension point\n"
    "  -i, --identifier ID          plug-ins with this identifier\n"
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

const std::vector<VerbSpec>& Verbs() {
  static const std::vector<VerbSpec> verbs = {
      {"match",
       {kOptPoint, kOptIdentifier, kOptRule, kOptAllVersions, kOptDuplicates, kOptAll, kOptHybrid,
        kOptSystemOnly, kOptVerbose, kOptJson},
       0,
       0,
       "match [OPTIONS]",
       "list the plug-ins drd offers to a host",
       "Prints one line per plug-in, by identifier: its election mark ('+' elected,\n"
       "'-' ignored, ' ' not chosen), identifier and version.\n\n"
       "Options:\n"
       "$DISCOVERY"
       "  -v, --verbose                also print UUID, path and registration time\n"
       "      --json                   print the plug-ins' forms as JSON\n\n"
       "Rules: each names a key of the plug-ins' attributes (then of their\n"
       "information dictionary) and a pattern. After '=' the pattern is a string,\n"
       "so \"1.0\" stays a version text; after ':=' it is JSON:\n"
       "  --rule BNBundleVersion='>=2'                 a version range (a string)\n"
       "  --rule 'AcceptedTypes:={\"image/png\": 1}'    offers one PNG: a dictionary of\n"
       "                                               type to number of items\n"
       "  --rule Count:=3  --rule Enabled:=true        a number, a boolean\n"},
      {"add",
       {},
       1,
       kUnlimited,
       "add PATH...",
       "register plug-in bundles",
       "Registers the plug-in bundle at each PATH, in order; stops at the first\n"
       "failure (the bundles before it stay registered).\n"},
      {"remove",
       {},
       1,
       kUnlimited,
       "remove PATH...",
       "unregister plug-in bundles",
       "Unregisters the plug-in bundle at each PATH, in order; the bundle need\n"
       "not exist on disk any more.\n"},
      {"elect",
       {kOptIdentifier},
       1,
       1,
       "elect -i ID use|ignore|default",
       "turn a plug-in on or off for the user",
       "Records the user's election for every installed copy of plug-in ID:\n"
       "  use      turn it on (election 1)\n"
       "  ignore   turn it off (election -1); automatic election leaves it off\n"
       "  default  no choice (election 0); a plug-in entitled to automatic\n"
       "           election is turned on again when drd next loads it\n"},
      {"annotate",
       {kOptIdentifier, kOptUnset, kOptJson},
       0,
       kUnlimited,
       "annotate -i ID [KEY=VALUE...] [--unset KEY...]",
       "change a plug-in's settings",
       "Sets each KEY to the string VALUE and removes each --unset KEY in the\n"
       "settings of every installed copy of plug-in ID; the other settings stay.\n"
       "Without changes, prints the settings as JSON.\n\n"
       "Options:\n"
       "      --json                   print the settings on one line when piped\n"},
      {"hold",
       {kOptApp, kOptPlugIn, kOptJson},
       0,
       0,
       "hold --app PATH... | --plug-in PATH...",
       "keep plug-ins out of use while they are replaced",
       "Holds every plug-in of the application at each --app PATH, or the plug-in\n"
       "bundle at each --plug-in PATH (options may repeat; the two do not mix).\n"
       "Prints the hold's token and keeps the hold until SIGINT or SIGTERM, or\n"
       "until standard input ends. Ends with status 1 if drd goes away (the hold\n"
       "goes with it). Refused while a plug-in of an application is running.\n"
       "With --json the token is printed as {\"token\": TOKEN}.\n"},
      {"release",
       {},
       1,
       kUnlimited,
       "release TOKEN...",
       "release holds",
       "Releases the holds with these tokens; unknown tokens are passed over.\n"},
      {"ready",
       {},
       1,
       kUnlimited,
       "ready UUID...",
       "ready plug-ins for this process",
       "Asks drd to make the plug-ins' services reachable from drkit's process;\n"
       "shows whether a host could use them.\n"},
      {"access",
       {kOptJson},
       1,
       kUnlimited,
       "access UUID...",
       "get read tokens for plug-in bundles",
       "Prints one read token per plug-in, in order (see 'extension consume');\n"
       "with --json, a list of {\"uuid\": UUID, \"token\": TOKEN}.\n"},
      {"extension",
       {kOptJson},
       2,
       3,
       "extension consume TOKEN | extension open TOKEN [FILE]",
       "check or open a read token",
       "consume: checks TOKEN against the user's key and prints the path it grants\n"
       "(with --json, {\"path\": PATH}).\n"
       "open: hands TOKEN to drd, which opens what it grants; prints FILE (a path\n"
       "inside the granted folder) read through that, or lists the folder (with\n"
       "--json, {\"path\": PATH, \"names\": [...]}). Works inside a sandbox that\n"
       "can reach drd's socket but not the plug-in.\n"},
      {"exclude",
       {kOptPoint, kOptIdentifier, kOptRule, kOptJson},
       1,
       2,
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
      {"watch",
       {kOptCount, kOptJson},
       0,
       0,
       "watch [--count N]",
       "print drd's change notifications",
       "Prints one line per posted change notification: its name and count.\n"
       "Runs until SIGINT or SIGTERM, or until N notifications were printed.\n"
       "With --json each line is {\"name\": NAME, \"count\": COUNT}.\n"},
      {"raw",
       {kOptJson},
       0,
       1,
       "raw [JSON]",
       "send any request",
       "Sends the request given as a JSON object (read from standard input when\n"
       "absent) and prints drd's reply as JSON. Non-negative integers are sent\n"
       "unsigned. Values JSON lacks are written as objects with one key:\n"
       "{\"$uuid\": \"TEXT\"}, {\"$data\": \"BASE64\"}, {\"$date\": SECONDS}.\n"
       "Example: {\"request\": \"match\", \"version\": 2, \"flags\": 1}\n"},
      {"status",
       {kOptJson},
       0,
       0,
       "status",
       "tell whether drd is answering",
       "Prints drd's socket and whether drd answers a request there; with --json,\n"
       "{\"service\": NAME, \"socket\": PATH, \"answering\": true|false}.\n"},
      {"explain",
       {kOptHost, kOptPoint, kOptRule, kOptAllVersions, kOptDuplicates, kOptAll, kOptHybrid,
        kOptSystemOnly, kOptVerbose, kOptJson},
       1,
       1,
       "explain PATH|IDENTIFIER [--host APP] [OPTIONS]",
       "tell why plug-ins are or are not offered to a host",
       "Reads the registry and runs discovery as drd would for a host, then prints\n"
       "for each plug-in of the bundle at PATH (or with IDENTIFIER) whether it is\n"
       "registered and what discovery made of it. drd need not be running.\n\n"
       "Options:\n"
       "      --host APP               the host application's bundle (default: a\n"
       "                               host outside any bundle)\n"
       "$DISCOVERY"
       "  -v, --verbose                also print what drd would log\n"
       "      --json                   print the same as one JSON object\n"},
      {"help", {}, 0, 1, "help [VERB]", "print help", "Prints the help of VERB, or of drkit.\n"},
  };
  return verbs;
}

const VerbSpec* FindVerb(std::string_view name) {
  for (const VerbSpec& v : Verbs()) {
    if (name == v.name) return &v;
  }
  return nullptr;
}

Error UsageError(std::string message) { return Error(kUsageErrorDomain, 2, std::move(message)); }

// Adds KEY=PATTERN to a rules dictionary; a second pattern for one key turns
// the entry into an array of alternatives.
Status AddRule(Dictionary& rules, std::string_view key, Value pattern) {
  if (key.empty()) return UsageError("a rule needs a key: KEY=PATTERN");
  auto [it, inserted] = rules.try_emplace(std::string(key), pattern);
  if (inserted) return Status();
  Array alternatives = it->second.isArray() ? it->second.array() : Array{it->second};
  alternatives.push_back(std::move(pattern));
  it->second = Value(std::move(alternatives));
  return Status();
}

std::optional<uint64_t> ParseCount(std::string_view text) {
  uint64_t n = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), n);
  if (ec != std::errc() || end != text.data() + text.size() || text.empty()) return std::nullopt;
  return n;
}

// The checks getopt cannot make: operand forms and option combinations.
Status Validate(Invocation& inv, const std::vector<bool>& seen) {
  const std::vector<std::string>& ops = inv.operands;
  auto need = [&](bool ok, const std::string& message) {
    return ok ? Status() : Status(UsageError(inv.verb + ": " + message));
  };
  if (inv.verb == "elect" || inv.verb == "annotate") {
    if (inv.identifier.empty()) return need(false, "-i ID is required");
  }
  if (inv.verb == "elect") {
    return need(ops[0] == "use" || ops[0] == "ignore" || ops[0] == "default",
                "expected use, ignore or default, not '" + ops[0] + "'");
  }
  if (inv.verb == "annotate") {
    for (const std::string& pair : ops) {
      size_t eq = pair.find('=');
      if (eq == std::string::npos || eq == 0) {
        return need(false, "expected KEY=VALUE, not '" + pair + "'");
      }
    }
    return Status();
  }
  if (inv.verb == "hold") {
    if (seen[kOptApp] && seen[kOptPlugIn]) return need(false, "--app and --plug-in do not mix");
    return need(inv.holdTarget.has_value(), "--app PATH or --plug-in PATH is required");
  }
  if (inv.verb == "release" || inv.verb == "ready" || inv.verb == "access") {
    for (const std::string& text : ops) {
      if (!Uuid::parse(text)) return need(false, "not a UUID: '" + text + "'");
    }
    return Status();
  }
  if (inv.verb == "extension") {
    if (ops[0] == "consume") return need(ops.size() == 2, "consume takes one TOKEN");
    return need(ops[0] == "open", "unknown action '" + ops[0] + "' (expected consume or open)");
  }
  if (inv.verb == "exclude") {
    const std::string& action = ops[0];
    const bool rules = inv.rules.isPresent();
    if (action == "add") {
      return need(rules && ops.size() == 1, "add takes rules: -p, -i or --rule");
    }
    if (action == "remove") {
      if (ops.size() == 2) {
        std::optional<uint64_t> n = ParseCount(ops[1]);
        return need(!rules && n && *n > 0, "remove takes rules or one number from 'list'");
      }
      return need(rules, "remove takes rules or one number from 'list'");
    }
    if (action == "list") return need(!rules && ops.size() == 1, "list takes nothing more");
    return need(false, "unknown action '" + action + "' (expected add, remove or list)");
  }
  if (inv.verb == "help" && !ops.empty()) {
    return need(FindVerb(ops[0]) != nullptr, "no such verb '" + ops[0] + "'");
  }
  return Status();
}

// getopt_long over the verb's options. argv[0] of `args` is the verb.
Status ParseVerbOptions(const VerbSpec& spec, std::vector<std::string> args, Invocation& inv) {
  std::vector<Option> allowed = spec.options;
  allowed.push_back(kOptHelp);
  std::string shortOptions = ":";  // ':' first: a missing value is reported as ':'
  std::vector<struct option> longOptions;
  for (const OptionSpec& o : kOptions) {
    if (std::find(allowed.begin(), allowed.end(), o.id) == allowed.end()) continue;
    if (o.id < 256) {
      shortOptions += static_cast<char>(o.id);
      if (o.hasArgument) shortOptions += ':';
    }
    longOptions.push_back(
        {o.longName, o.hasArgument ? required_argument : no_argument, nullptr, o.id});
  }
  longOptions.push_back({nullptr, 0, nullptr, 0});

  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  const int argc = static_cast<int>(args.size());

  Dictionary rules;
  std::vector<bool> seen(kOptHost + 1, false);
  const std::string verb = spec.name;
  optind = 0;  // 0 makes GNU getopt start afresh
  opterr = 0;
  for (;;) {
    int index = 0;
    int c = getopt_long(argc, argv.data(), shortOptions.c_str(), longOptions.data(), &index);
    if (c == -1) break;
    if (c == '?' || c == ':') {
      // optind has moved past the element at fault (or its missing value).
      std::string what = optopt != 0 && optopt < 256 ? std::string("-") + static_cast<char>(optopt)
                                                     : std::string(argv[optind - 1]);
      if (size_t eq = what.find('='); what.rfind("--", 0) == 0 && eq != std::string::npos) {
        what.resize(eq);
      }
      return UsageError(
          verb + ": " +
          (c == '?' ? "unknown option '" + what + "'" : "option '" + what + "' needs a value"));
    }
    seen[c] = true;
    const std::string value = optarg ? optarg : "";
    Status s;
    switch (static_cast<Option>(c)) {
      case kOptHelp:
        inv.help = true;
        break;
      case kOptPoint:
        s = AddRule(rules, client::kRuleExtensionPoint, Value(value));
        break;
      case kOptIdentifier:
        if (verb == "elect" || verb == "annotate") {
          if (!inv.identifier.empty()) return UsageError(verb + ": -i may be given once");
          inv.identifier = value;
        } else {
          s = AddRule(rules, client::kRuleIdentifier, Value(value));
        }
        break;
      case kOptRule: {
        // KEY=PATTERN takes the text as it is; KEY:=JSON reads a typed
        // pattern (a number, boolean, list or dictionary).
        size_t eq = value.find('=');
        if (eq == std::string::npos) {
          return UsageError(verb + ": expected --rule KEY=PATTERN or --rule KEY:=JSON");
        }
        std::string_view key = std::string_view(value).substr(0, eq);
        const std::string_view text = std::string_view(value).substr(eq + 1);
        Value pattern(text);
        if (!key.empty() && key.back() == ':') {
          key.remove_suffix(1);
          Result<Value> typed = FromJson(text);
          if (!typed) {
            return UsageError(verb + ": --rule " + std::string(key) + ":=" + std::string(text) +
                              ": " + typed.error().localizedDescription());
          }
          pattern = *typed;
        }
        s = AddRule(rules, key, std::move(pattern));
        break;
      }
      case kOptAllVersions:
        inv.flags |= client::kDiscoverAllVersions;
        break;
      case kOptDuplicates:
        inv.flags |= client::kDiscoverDuplicates | client::kDiscoverAllVersions;
        break;
      case kOptAll:
        inv.flags |= client::kDiscoverAll;
        break;
      case kOptHybrid:
        inv.flags |= client::kDiscoverHybrid;
        break;
      case kOptSystemOnly:
        inv.flags |= client::kDiscoverSystemOnly;
        break;
      case kOptVerbose:
        inv.verbose = true;
        break;
      case kOptJson:
        inv.json = true;
        break;
      case kOptApp:
      case kOptPlugIn:
        inv.holdTarget =
            c == kOptApp ? client::HoldTarget::kApplication : client::HoldTarget::kPlugIn;
        inv.operands.push_back(value);
        break;
      case kOptUnset:
        if (value.empty()) return UsageError(verb + ": --unset needs a key");
        inv.unset.push_back(value);
        break;
      case kOptCount: {
        std::optional<uint64_t> n = ParseCount(value);
        if (!n) return UsageError(verb + ": --count needs a number, not '" + value + "'");
        inv.count = *n;
        break;
      }
      case kOptHost:
        inv.host = value;
        break;
    }
    if (!s.ok()) return UsageError(verb + ": " + s.error().localizedDescription());
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
  return Validate(inv, seen);
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
    } else if (a == "-S" || a == "--service") {
      if (++i == argv.size()) return UsageError("option '" + a + "' needs a value");
      inv.service = argv[i];
    } else if (a.rfind("-S", 0) == 0 && a.size() > 2) {
      inv.service = a.substr(2);
    } else if (a.rfind("--service=", 0) == 0) {
      inv.service = a.substr(10);
    } else if (a == "--") {
      ++i;
      break;
    } else if (!a.empty() && a[0] == '-') {
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

std::string GeneralHelp() {
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
    name.resize(std::max<size_t>(name.size() + 1, 11), ' ');
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
    if (a == "-S" || a == "--service") {
      ++i;
    } else if (a.empty() || a[0] != '-') {
      return FindVerb(a) ? "drkit help " + a : "drkit help";
    }
  }
  return "drkit help";
}

std::vector<VerbDoc> VerbDocs() {
  std::vector<VerbDoc> docs;
  for (const VerbSpec& v : Verbs()) {
    VerbDoc doc{v.name, v.synopsis, v.summary, VerbHelp(v.name), {}};
    std::vector<Option> allowed = v.options;
    allowed.push_back(kOptHelp);
    for (const OptionSpec& o : kOptions) {
      if (std::find(allowed.begin(), allowed.end(), o.id) == allowed.end()) continue;
      if (o.id < 256) doc.options.push_back(std::string("-") + static_cast<char>(o.id));
      doc.options.push_back(std::string("--") + o.longName);
    }
    docs.push_back(std::move(doc));
  }
  return docs;
}

std::string VerbHelp(const std::string& verb) {
  const VerbSpec* spec = FindVerb(verb);
  if (!spec) return std::string();
  std::string details = spec->details;
  if (size_t at = details.find("$DISCOVERY"); at != std::string::npos) {
    details.replace(at, 10, kDiscoveryOptionsHelp);
  }
  return std::string("Usage: drkit ") + spec->synopsis + "\n" + spec->summary + ".\n\n" + details;
}

}  // namespace dr::drkit
