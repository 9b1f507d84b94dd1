#include <cstring>

#include "client/drkit/commands.h"

namespace dr::drkit {
namespace {

struct Handler {
  const char* verb;
  int (*run)(const Invocation&, Io&);
};

constexpr Handler kHandlers[] = {
    {"match", RunMatch},
    {"add", RunAddRemove},
    {"remove", RunAddRemove},
    {"elect", RunElect},
    {"annotate", RunAnnotate},
    {"hold", RunHold},
    {"release", RunRelease},
    {"ready", RunReadyAccess},
    {"access", RunReadyAccess},
    {"extension", RunExtension},
    {"exclude", RunExclude},
    {"watch", RunWatch},
    {"raw", RunRaw},
    {"status", RunStatus},
    {"explain", RunExplain},
};

}  // namespace

int Run(const Invocation& inv, Io& io) {
  if (inv.version) {
    io.out << "drkit " << DRD_VERSION << "\n";
    return 0;
  }
  if (inv.help && !inv.verb.empty()) {
    io.out << VerbHelp(inv.verb);
    return 0;
  }
  if (inv.verb.empty() || inv.verb == "help") {
    io.out << (inv.operands.empty() ? GeneralHelp() : VerbHelp(inv.operands[0]));
    return 0;
  }
  for (const Handler& h : kHandlers) {
    if (inv.verb == h.verb) return h.run(inv, io);
  }
  io.err << "drkit: unknown verb '" << inv.verb << "'\n";
  return kExitUsage;
}

}  // namespace dr::drkit
