#include "core/log.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>

namespace dr {
namespace {

std::mutex& SinkMutex() {
  static std::mutex* mu = new std::mutex();
  return *mu;
}
LogSink& CurrentSink() {
  static LogSink* sink = new LogSink();
  return *sink;
}

// True when standard error is the stream journald handed this process:
// JOURNAL_STREAM holds "<device>:<inode>" of that stream, and a process that
// redirected its standard error elsewhere must not prefix its lines.
bool StderrIsJournal() {
  const char* stream = ::getenv("JOURNAL_STREAM");
  uintmax_t device = 0, inode = 0;
  struct stat st {};
  return stream && std::sscanf(stream, "%" SCNuMAX ":%" SCNuMAX, &device, &inode) == 2 &&
         ::fstat(STDERR_FILENO, &st) == 0 && st.st_dev == device && st.st_ino == inode;
}

void WriteToStderr(std::string_view line, LogPriority priority) {
  static const bool journal = StderrIsJournal();
  std::string buf;
  if (journal) buf = "<" + std::to_string(static_cast<int>(priority)) + ">";
  buf += line;
  buf += '\n';
  const char* p = buf.data();
  size_t left = buf.size();
  while (left > 0) {
    ssize_t n = ::write(STDERR_FILENO, p, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      return;  // nowhere left to report a failing log
    }
    p += n;
    left -= static_cast<size_t>(n);
  }
}

}  // namespace

void SystemLogLine(std::string_view text, LogPriority priority) {
  std::string line;
  line.reserve(text.size());
  for (char c : text) {
    if (c == '\n') {
      line += "\\n";
    } else if (c == '\r') {
      line += "\\r";
    } else {
      line += c;
    }
  }
  std::lock_guard<std::mutex> lock(SinkMutex());
  if (CurrentSink()) {
    CurrentSink()(line);
  } else {
    WriteToStderr(line, priority);
  }
}

LogSink SetLogSink(LogSink sink) {
  std::lock_guard<std::mutex> lock(SinkMutex());
  LogSink previous = std::move(CurrentSink());
  CurrentSink() = std::move(sink);
  return previous;
}

ScopedLogCapture::ScopedLogCapture() {
  previous_ = SetLogSink([this](std::string_view line) {
    std::lock_guard<std::mutex> lock(mu_);
    lines_.emplace_back(line);
  });
}

ScopedLogCapture::~ScopedLogCapture() { SetLogSink(std::move(previous_)); }

std::vector<std::string> ScopedLogCapture::lines() const {
  std::lock_guard<std::mutex> lock(mu_);
  return lines_;
}

bool ScopedLogCapture::contains(std::string_view fragment) const {
  std::lock_guard<std::mutex> lock(mu_);
  for (const auto& l : lines_) {
    if (l.find(fragment) != std::string::npos) return true;
  }
  return false;
}

void ScopedLogCapture::clear() {
  std::lock_guard<std::mutex> lock(mu_);
  lines_.clear();
}

}  // namespace dr
