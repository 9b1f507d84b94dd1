// The usage-report sink: one JSON object per line in the report file, whole
// even when several processes append at once.
#include "platform/usage_reports.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <nlohmann/json.hpp>
#include <sstream>

#include "core/log.h"
#include "platform/file_system.h"
#include "tests/support/process_fixtures.h"

namespace dr {
namespace {

using testing::TempFolder;

TEST(UsageReportsTest, LineHasTheDocumentedLayoutAndEscapes) {
  EXPECT_EQ(UsageReportJson("d", 5, {{"b", "1"}, {"a", "say \"hi\"\n"}}),
            R"({"domain": "d", "level": 5, "keys": {"b": "1", "a": "say \"hi\"\n"}})");
  // Bytes that are not UTF-8 are replaced, never a crash or a broken line.
  EXPECT_TRUE(nlohmann::json::accept(UsageReportJson("d", 5, {{"k", "bad \xff byte"}})));
}

// Without a report file a report is a log line that says it is one.
TEST(UsageReportsTest, WithoutAFileAReportIsAMarkedLogLine) {
  ScopedLogCapture log;
  MakeUsageReports({})->sendReport("d", 5, {{"k", "v"}});
  EXPECT_EQ(log.lines(), std::vector<std::string>{
                             R"(usage report: {"domain": "d", "level": 5, "keys": {"k": "v"}})"});
}

TEST(UsageReportsTest, ConcurrentProcessesNeverInterleaveLines) {
  TempFolder folder;
  UsageReportOptions options{folder / "usage.log"};
  constexpr int kProcesses = 4, kReports = 200;
  std::string longValue(3000, 'v');  // long lines make a torn write likelier to show
  std::vector<pid_t> children;
  for (int p = 0; p < kProcesses; ++p) {
    pid_t pid = ::fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      auto reports = MakeUsageReports(options);
      for (int i = 0; i < kReports; ++i) {
        reports->sendReport("d", 5, {{"p", std::to_string(p)}, {"v", longValue}});
      }
      ::_exit(0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) ::waitpid(pid, nullptr, 0);

  std::istringstream lines(FileSystem::Default()->readFile(options.logPath.value()).value());
  int count = 0;
  for (std::string line; std::getline(lines, line); ++count) {
    ASSERT_TRUE(nlohmann::json::accept(line)) << "line " << count << " is torn";
  }
  EXPECT_EQ(count, kProcesses * kReports);
}

// A FIFO in place of the report file, read or not: the report is refused
// with a log line, never waited on.
TEST(UsageReportsTest, FifoInPlaceOfTheFileIsRefusedWithoutWaiting) {
  TempFolder folder;
  UsageReportOptions options{folder / "usage.log"};
  ASSERT_EQ(::mkfifo(options.logPath->c_str(), 0600), 0);
  for (bool reader : {false, true}) {
    const int fd = reader ? ::open(options.logPath->c_str(), O_RDONLY | O_NONBLOCK) : -1;
    ScopedLogCapture log;
    MakeUsageReports(options)->sendReport("d", 5, {{"k", "v"}});
    EXPECT_TRUE(log.contains("cannot append usage report to " + *options.logPath)) << reader;
    if (fd >= 0) ::close(fd);
  }
}

}  // namespace
}  // namespace dr
