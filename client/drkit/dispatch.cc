#include "client/drkit/commands.h"

namespace dr::drkit {

int Run(const Invocation& inv, Io& io) {
  if (inv.version) {
    io.out << "drkit " << DRD_VERSION << "\n";
    return 0;
  }
  if (inv.help || inv.verb.empty()) {
    io.out << (inv.verb.empty() ? GeneralHelp() : VerbHelp(inv.verb));
    return 0;
  }
  if (VerbHandler run = HandlerFor(inv.verb)) return run(inv, io);
  io.err << "drkit: unknown verb '" << inv.verb << "'\n";
  return kExitUsage;
}

int RunHelp(const Invocation& inv, Io& io) {
  io.out << (inv.operands.empty() ? GeneralHelp() : VerbHelp(inv.operands[0]));
  return 0;
}

}  // namespace dr::drkit
