// ProcessInfo: facts about a running process, read from /proc.
//
// The answers are snapshots: a process may exit, or its pid be reused, right
// after the call. Failures carry the errno (ESRCH when the process is gone,
// EACCES when it belongs to someone else). Implementations are safe to use
// from any thread; ProcessInfo::Default() lives for the whole process.
#pragma once

#include <sys/types.h>

#include <string>

#include "core/status.h"

namespace dr {

class ProcessInfo {
 public:
  virtual ~ProcessInfo() = default;

  // The path of the executable `pid` runs (the target of /proc/<pid>/exe).
  // An executable deleted since it started still answers its old path with
  // " (deleted)" appended, as the kernel reports it.
  virtual Result<std::string> executablePath(pid_t pid) = 0;

  // The real one, reading /proc. Never null.
  static ProcessInfo* Default();
};

}  // namespace dr
