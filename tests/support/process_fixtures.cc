#include "tests/support/process_fixtures.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>

extern char** environ;

namespace dr::testing {

TempFolder::TempFolder() {
  const char* tmp = std::getenv("TMPDIR");
  path_ = std::string(tmp && *tmp ? tmp : "/tmp") + "/drd-test-XXXXXX";
  if (::mkdtemp(path_.data()) == nullptr) {
    std::perror("mkdtemp");
    std::abort();
  }
  path_ = std::filesystem::canonical(path_).string();
}

TempFolder::~TempFolder() {
  std::error_code ec;
  // Every folder writable again first, in case a test took rights away.
  for (const auto& e : std::filesystem::recursive_directory_iterator(path_, ec)) {
    std::filesystem::permissions(e.path(), std::filesystem::perms::owner_all,
                                 std::filesystem::perm_options::add, ec);
  }
  std::filesystem::remove_all(path_, ec);
}

bool WriteTestFile(const std::string& path, const std::string& bytes, mode_t mode) {
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
  int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
  if (fd < 0) return false;
  bool ok = ::write(fd, bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size());
  return ::close(fd) == 0 && ok;
}

RunningProgram::RunningProgram(const std::string& executablePath) {
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(executablePath).parent_path(), ec);
  std::filesystem::copy_file("/bin/sleep", executablePath,
                             std::filesystem::copy_options::overwrite_existing, ec);
  std::filesystem::permissions(executablePath, std::filesystem::perms::owner_all, ec);
  std::string arg0 = executablePath, arg1 = "60";
  char* argv[] = {arg0.data(), arg1.data(), nullptr};
  pid_t pid;
  // posix_spawn returns once the child has run exec, so /proc/<pid>/exe
  // already names the copy.
  if (::posix_spawn(&pid, executablePath.c_str(), nullptr, nullptr, argv, environ) == 0) {
    pid_ = pid;
  }
}

RunningProgram::~RunningProgram() {
  if (pid_ <= 0 || reaped_) return;
  ::kill(pid_, SIGKILL);
  wait();
}

int RunningProgram::wait() {
  int status = 0;
  reaped_ = ::waitpid(pid_, &status, 0) == pid_;
  return reaped_ && WIFSIGNALED(status) ? WTERMSIG(status) : 0;
}

}  // namespace dr::testing
