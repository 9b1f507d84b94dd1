// CodeSigning: the entitlements of a process, from the bundle its executable
// lies in.
//
// A program inside a bundle (<bundle>/Contents/Exec/<name>) has the
// entitlements dictionary of <bundle>/Contents/Entitlements.pdoc, or none
// when that file does not exist; a free-standing program has none. A
// SigningTask is made once per peer at connect time, when its executable is
// resolved and its entitlements read; it is immutable afterwards and may be
// shared between threads. A task whose entitlements could not be read answers
// that error on every lookup. CodeSigning implementations are thread-safe.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "core/status.h"
#include "core/value.h"
#include "platform/file_system.h"
#include "platform/process_info.h"

namespace dr {

class SigningTask {
 public:
  virtual ~SigningTask() = default;

  // The process the task was made for.
  virtual pid_t pid() const = 0;

  // The value of the entitlement `key` (any type), absent when the process
  // does not have it. An error when the entitlements could not be read; the
  // caller logs it and treats the entitlement as absent.
  virtual Result<Value> entitlementValue(std::string_view key) const = 0;
};

// A task over entitlements read once, when it is made (or the error that
// reading them gave).
class ReadSigningTask final : public SigningTask {
 public:
  ReadSigningTask(pid_t pid, Result<Value> entitlements)
      : pid_(pid), entitlements_(std::move(entitlements)) {}
  pid_t pid() const override { return pid_; }
  Result<Value> entitlementValue(std::string_view key) const override {
    if (!entitlements_.ok()) return entitlements_.error();
    return (*entitlements_)[key];
  }

 private:
  pid_t pid_;
  Result<Value> entitlements_;
};

class CodeSigning {
 public:
  virtual ~CodeSigning() = default;

  // The task of the process `pid`, its executable and entitlements read now.
  // Never null; a process that is gone gives a task whose lookups fail.
  virtual std::shared_ptr<const SigningTask> taskForPid(pid_t pid) = 0;

  // taskForPid for a caller that has just read `pid`'s executable (or failed
  // to) through the same ProcessInfo: the same task without reading /proc
  // again, which the daemon does for every connection. The default reads
  // again.
  virtual std::shared_ptr<const SigningTask> taskForPidWithExecutable(
      pid_t pid, const Result<std::string>& /*executable*/) {
    return taskForPid(pid);
  }

  // The entitlements dictionary of the program at `executablePath`: an empty
  // dictionary for a free-standing program or a bundle without entitlements;
  // an error when the bundle's file cannot be read or is not a dictionary.
  virtual Result<Value> entitlementsForExecutable(const std::string& executablePath) = 0;

  // The real one, over the real /proc and file system. Never null.
  static CodeSigning* Default();
};

// A CodeSigning that reads processes through `processes` and files through
// `fs`; both must outlive it.
std::unique_ptr<CodeSigning> MakeLinuxCodeSigning(ProcessInfo* processes, FileSystem* fs);

// The bundle folder whose Contents/Exec/ folder holds `executablePath`
// directly; nothing for a program that lies in no bundle.
std::optional<std::string> BundleOfExecutable(const std::string& executablePath);

// Whether an entitlement with this value is held: present and not equal to
// boolean false (so the number 0 is not held, while any string, even "NO",
// is).
bool IsEntitlementHeld(const Value& value);

}  // namespace dr
