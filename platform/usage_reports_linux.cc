#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <nlohmann/json.hpp>
#include <string>

#include "core/log.h"
#include "platform/usage_reports.h"

namespace dr {
namespace {

constexpr const char* kUsageLogVariable = "DR_USAGE_LOG";
constexpr char kSystemLogPrefix[] = "usage report: ";

std::string Quoted(std::string_view text) {
  return nlohmann::json(std::string(text))
      .dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

class FileUsageReports final : public UsageReports {
 public:
  explicit FileUsageReports(UsageReportOptions options) : options_(std::move(options)) {}

  void sendReport(std::string_view domain, int level, const UsageReportKeys& keys) override {
    std::string line = UsageReportJson(domain, level, keys);
    if (!options_.logPath) {
      SystemLogLine(kSystemLogPrefix + line, LogPriority::kInfo);
      return;
    }
    line += '\n';
    const std::string& path = *options_.logPath;
    // Without blocking, and only to a regular file: a FIFO in its place
    // (with no reader, or one that never reads) must not stall the caller.
    int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NONBLOCK | O_NOCTTY,
                    0600);
    if (fd < 0) {
      SystemLog("cannot append usage report to %@: %@", path, PosixError(errno, "open"));
      return;
    }
    struct stat st;
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
      ::close(fd);
      SystemLog("cannot append usage report to %@: not a regular file", path);
      return;
    }
    // One write: with O_APPEND the kernel places the whole line at the end
    // of the file at once. A short write (a full disk) is reported, not
    // completed, since finishing it later could split the line.
    ssize_t n;
    do {
      n = ::write(fd, line.data(), line.size());
    } while (n < 0 && errno == EINTR);
    int e = n < 0 ? errno : ENOSPC;
    ::close(fd);
    if (n != static_cast<ssize_t>(line.size())) {
      SystemLog("cannot append usage report to %@: %@", path, PosixError(e, "write"));
    }
  }

 private:
  UsageReportOptions options_;
};

}  // namespace

UsageReportOptions UsageReportOptionsFromEnvironment(const EnvironmentLookup& getenv) {
  UsageReportOptions options;
  if (std::string path = EnvironmentValue(getenv, kUsageLogVariable); !path.empty()) {
    options.logPath = path;
  }
  return options;
}

std::string UsageReportJson(std::string_view domain, int level, const UsageReportKeys& keys) {
  // Written by hand rather than dumped, to keep the keys in the order given
  // and the spacing of the documented layout; each text is escaped by the
  // JSON library.
  std::string out =
      "{\"domain\": " + Quoted(domain) + ", \"level\": " + std::to_string(level) + ", \"keys\": {";
  for (size_t i = 0; i < keys.size(); ++i) {
    if (i > 0) out += ", ";
    out += Quoted(keys[i].first) + ": " + Quoted(keys[i].second);
  }
  out += "}}";
  return out;
}

std::unique_ptr<UsageReports> MakeUsageReports(UsageReportOptions options) {
  return std::make_unique<FileUsageReports>(std::move(options));
}

}  // namespace dr
