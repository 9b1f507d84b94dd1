#include "core/log.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>

#include "core/utf8.h"

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
  // Every line is one line of UTF-8, whatever bytes a path or a peer put in
  // it: line breaks are written as \n and \r, and bytes that are not UTF-8
  // as \xNN.
  std::string line;
  line.reserve(text.size());
  size_t plain = 0;  // start of the run not yet copied
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '\n' && text[i] != '\r') continue;
    AppendEscapingInvalidUtf8(line, text.substr(plain, i - plain));
    line += text[i] == '\n' ? "\\n" : "\\r";
    plain = i + 1;
  }
  AppendEscapingInvalidUtf8(line, text.substr(plain));
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
