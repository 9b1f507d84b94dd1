// drkit: drd's command-line tool. Parses the command line, runs the verb,
// exits with its status (0 success, 1 failure, 2 usage error).
#include <iostream>
#include <string>
#include <vector>

#include "client/drkit/command_line.h"
#include "client/drkit/commands.h"

int main(int argc, char** argv) {
  std::vector<std::string> args(argv, argv + argc);
  dr::drkit::Io io{std::cout, std::cerr, std::cin};
  dr::Result<dr::drkit::Invocation> invocation = dr::drkit::ParseCommandLine(args);
  if (!invocation) {
    std::cerr << "drkit: " << invocation.error().localizedDescription() << "\n"
              << "Try 'drkit --help'.\n";
    return dr::drkit::kExitUsage;
  }
  return dr::drkit::Run(*invocation, io);
}
