// A temporary folder removed with its contents, and a copy of sleep running where a test needs.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

namespace dr::testing {

class TempFolder {
 public:
  // Under $TMPDIR (else /tmp); aborts the test binary if it cannot.
  TempFolder();
  ~TempFolder();
  TempFolder(const TempFolder&) = delete;
  TempFolder& operator=(const TempFolder&) = delete;

  const std::string& path() const { return path_; }  // canonical
  std::string operator/(std::string_view relative) const {
    return path_ + "/" + std::string(relative);
  }

 private:
  std::string path_;
};

// Writes `bytes` to `path`, making missing folders (0700); false on failure.
bool WriteTestFile(const std::string& path, const std::string& bytes, mode_t mode = 0600);

// A copy of sleep at `executablePath` (folders made), started; killed and reaped when destroyed.
// pid() is -1 when it could not be started.
class RunningProgram {
 public:
  explicit RunningProgram(const std::string& executablePath);
  ~RunningProgram();
  RunningProgram(const RunningProgram&) = delete;
  RunningProgram& operator=(const RunningProgram&) = delete;

  pid_t pid() const { return pid_; }
  // Waits for it to end and reaps it; the signal that ended it, or 0.
  int wait();

 private:
  pid_t pid_ = -1;
  bool reaped_ = false;
};

}  // namespace dr::testing
