#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/process_info.h"

namespace dr {
namespace {

// Paths longer than this are refused rather than read in ever larger buffers.
constexpr size_t kMaxExecutablePath = 65536;

class LinuxProcessInfo final : public ProcessInfo {
 public:
  Result<std::string> executablePath(pid_t pid) override {
    if (pid <= 0) return PosixError(ESRCH, "executable of pid " + std::to_string(pid));
    std::string link = "/proc/" + std::to_string(pid) + "/exe";
    // readlink does not say how long the target is, so grow the buffer until
    // the answer fits with room to spare.
    std::vector<char> buf(2048);
    for (;;) {
      ssize_t n = ::readlink(link.c_str(), buf.data(), buf.size());
      if (n < 0) {
        int e = errno == ENOENT ? ESRCH : errno;  // no /proc/<pid>: the process is gone
        return PosixError(e, "readlink " + link);
      }
      if (static_cast<size_t>(n) < buf.size()) return std::string(buf.data(), n);
      if (buf.size() >= kMaxExecutablePath) return PosixError(ENAMETOOLONG, "readlink " + link);
      buf.resize(buf.size() * 2);
    }
  }
};

}  // namespace

ProcessInfo* ProcessInfo::Default() {
  static LinuxProcessInfo* info = new LinuxProcessInfo();
  return info;
}

}  // namespace dr
