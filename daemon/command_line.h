// drd's command line, written once: main parses it and prints --help from
// this table, and the build makes drd's manual page from the same table, so
// the two never disagree.
//
//   drd [-S servicename] [-v]      (also --help, --version)
//
// Header-only and constant: no state, any thread.
#pragma once

namespace dr::drd_command_line {

// Printed, exactly, with exit status 2 for every command line drd refuses.
inline constexpr char kUsage[] = "Usage: drd [-S servicename] [-v]\n";

inline constexpr char kSummary[] = "the per-user plug-in registry daemon";

struct OptionHelp {
  const char* option;       // as written on the command line
  const char* description;  // one sentence
};

// What --help lists and the manual's OPTIONS section describes. -d (the
// annotation file, for tests) is accepted but not offered to users.
inline constexpr OptionHelp kOptions[] = {
    {"-S servicename",
     "Serve under this name: the socket is $DR_SOCKET_DIR/servicename (default "
     "com.corvel.dromon.drd)."},
    {"-v", "Log more detail; given twice, also every request and its reply."},
    {"--help", "Print this help on standard output and exit."},
    {"--version", "Print drd's version on standard output and exit."},
};

}  // namespace dr::drd_command_line
