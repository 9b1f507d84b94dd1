// drkit's verbs: each runs one parsed Invocation and answers the exit
// status (0 success, 1 failure, kExitUsage for a usage error). Results go to
// `out`, errors to `err` as "drkit: <message>" lines (drd's errors with
// drd's code). Verbs that talk to drd open their own connection to the
// service of the invocation in the socket folder of the environment.
#pragma once

#include <iostream>
#include <string>

#include "client/drkit/command_line.h"

namespace dr::drkit {

struct Io {
  std::ostream& out;
  std::ostream& err;
  std::istream& in;
  bool prettyJson = false;  // standard output is a terminal
};

// `value` as JSON for io.out: indented on a terminal, one line otherwise.
std::string Json(const Io& io, const Value& value);

// Runs any verb (and --help and --version) through the verb table.
int Run(const Invocation& invocation, Io& io);

// The verbs' handlers, as the verb table names them.
int RunMatch(const Invocation& inv, Io& io);
int RunAdd(const Invocation& inv, Io& io);
int RunRemove(const Invocation& inv, Io& io);
int RunElect(const Invocation& inv, Io& io);
int RunAnnotate(const Invocation& inv, Io& io);
int RunHold(const Invocation& inv, Io& io);
int RunRelease(const Invocation& inv, Io& io);
int RunReady(const Invocation& inv, Io& io);
int RunAccess(const Invocation& inv, Io& io);
int RunRaw(const Invocation& inv, Io& io);
int RunStatus(const Invocation& inv, Io& io);
int RunExtension(const Invocation& inv, Io& io);
int RunExclude(const Invocation& inv, Io& io);
int RunWatch(const Invocation& inv, Io& io);
int RunExplain(const Invocation& inv, Io& io);
int RunHelp(const Invocation& inv, Io& io);

// Prints "drkit: <error>" on io.err, and a hint to start drd when its socket
// is missing or nobody listens on it; answers 1.
int Fail(Io& io, const Error& error);
int Fail(Io& io, const std::string& message);

// `path` made absolute against the working folder and lexically normal
// ("." and ".." folded, no trailing '/'), without resolving links: drd
// resolves what exists, and a deleted bundle is removed by the path given.
std::string AbsolutePath(const std::string& path);

}  // namespace dr::drkit
