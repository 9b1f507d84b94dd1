// drkit: drd's command-line tool. Parses the command line, runs the verb,
// exits with its status (0 success, 1 failure, 2 usage error).
#include <unistd.h>

#include <iostream>
#include <string>
#include <vector>

#include "client/drkit/command_line.h"
#include "client/drkit/commands.h"

int main(int argc, char** argv) {
  std::vector<std::string> args(argv, argv + argc);
  // JSON for people is indented; JSON for a pipe or a file is one line.
  dr::drkit::Io io{std::cout, std::cerr, std::cin, ::isatty(STDOUT_FILENO) == 1};
  dr::Result<dr::drkit::Invocation> invocation = dr::drkit::ParseCommandLine(args);
  if (!invocation.ok()) {
    std::cerr << "drkit: " << invocation.error().localizedDescription() << "\n"
              << "Try '" << dr::drkit::HelpCommandFor(args) << "'.\n";
    return dr::drkit::kExitUsage;
  }
  return dr::drkit::Run(*invocation, io);
}
