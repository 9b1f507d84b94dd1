// drkit's command line: the table of verbs, one row each with its options
// (and what their values are), operands, help and handler, and the parser
// that turns argv into one Invocation.
//
//   drkit [-S SERVICE] VERB [OPTIONS] [OPERANDS]
//
// Parsing is pure (no files, no drd): a malformed command line is an error
// whose text names the verb and what is wrong, for standard error; help text
// comes from the same table. The parser uses getopt_long and so is not
// reentrant: one thread at a time.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "client/include/drd/client.h"
#include "core/status.h"
#include "core/value.h"

namespace dr::drkit {

struct Io;

// Usage errors (kUsageErrorDomain) end drkit with this status.
inline constexpr const char* kUsageErrorDomain = "drkit.usage";
inline constexpr int kExitUsage = 2;

struct Invocation {
  std::string service = client::kDefaultServiceName;  // -S
  std::string verb;                                   // empty only with --help or --version alone
  bool help = false;  // print the help of `verb` (or the general help)
  bool version = false;

  // match, explain and exclude: the rules dictionary built from -p, -i and
  // --rule (a key given twice gets an array of alternatives); absent when
  // none was given.
  Value rules;
  uint64_t flags = 0;  // discovery flags (match, explain)
  bool verbose = false;
  bool json = false;

  std::string identifier;  // -i, for elect and annotate
  std::optional<client::HoldTarget> holdTarget;
  std::vector<std::string> unset;  // annotate --unset KEY
  uint64_t count = 0;              // watch --count N (0: until stopped)
  std::string host;                // explain --host APP

  // Whatever follows the options: paths, UUIDs, tokens, KEY=VALUE pairs,
  // a sub-verb ("consume", "add", ...) first where the verb has them.
  std::vector<std::string> operands;
};

// Parses argv (argv[0] is the program's name). Fails with kUsageErrorDomain
// and a message such as "match: option '-p' needs a value".
Result<Invocation> ParseCommandLine(const std::vector<std::string>& argv);

// Runs one verb; answers drkit's exit status.
using VerbHandler = int (*)(const Invocation&, Io&);
// The handler of a verb; nullptr for an unknown verb.
VerbHandler HandlerFor(const std::string& verb);

// The general help: synopsis, global options, one line per verb.
std::string GeneralHelp();
// The help of one verb; empty for an unknown verb.
std::string VerbHelp(const std::string& verb);

// Where a refused command line points for help: "drkit help VERB" when argv
// names a verb, else "drkit help".
std::string HelpCommandFor(const std::vector<std::string>& argv);

// Each verb as its help, drkit's manual page and its shell completion tell
// it, from the one table the parser uses.
struct VerbDoc {
  std::string name;
  std::string synopsis;              // "match [OPTIONS]"
  std::string summary;               // one line
  std::string help;                  // VerbHelp(name)
  std::vector<std::string> options;  // "-p", "--extension-point", ... "--help"
};
std::vector<VerbDoc> VerbDocs();

}  // namespace dr::drkit
