// The system log: one line per message on standard error (journald adds the
// time and process under systemd). A message is never split over lines: line
// breaks inside a formatted text are written as "\n", and every line is
// UTF-8: a byte that is not (from a path, say) is written as "\xNN". Lines
// from several threads never interleave. Tests may install a sink that
// captures lines. When standard error is the journal's stream
// (JOURNAL_STREAM names it), each line starts with its priority as "<N>",
// which journald strips and keeps.
#pragma once

#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "core/format.h"

namespace dr {

// A line's priority, as syslog numbers it.
enum class LogPriority : int { kError = 3, kWarning = 4, kNotice = 5, kInfo = 6, kDebug = 7 };

// Writes `text` as one line of the system log.
void SystemLogLine(std::string_view text, LogPriority priority = LogPriority::kNotice);

// Formats and writes one line of the system log.
template <typename... Args>
void SystemLog(std::string_view format, const Args&... args) {
  SystemLogLine(Format(format, args...));
}
template <typename... Args>
void SystemLogAt(LogPriority priority, std::string_view format, const Args&... args) {
  SystemLogLine(Format(format, args...), priority);
}

// Where log lines go. The default writes to standard error.
using LogSink = std::function<void(std::string_view line)>;
// Installs `sink` (empty: back to standard error) and answers the one before.
LogSink SetLogSink(LogSink sink);

// For tests: while alive, log lines are kept here instead of being written.
class ScopedLogCapture {
 public:
  ScopedLogCapture();
  ~ScopedLogCapture();
  ScopedLogCapture(const ScopedLogCapture&) = delete;
  ScopedLogCapture& operator=(const ScopedLogCapture&) = delete;

  std::vector<std::string> lines() const;
  // True when some captured line contains `fragment`.
  bool contains(std::string_view fragment) const;
  void clear();

 private:
  mutable std::mutex mu_;
  std::vector<std::string> lines_;
  LogSink previous_;
};

}  // namespace dr
