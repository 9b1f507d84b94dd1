#include "client/include/drd/extension.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string_view>
#include <utility>

#include "client/include/drd/client.h"
#include "core/unique_fd.h"
#include "wire/locations.h"
#include "wire/protocol.h"
#include "wire/token.h"

namespace dr::client {

// The public constants restate the sandbox's own, so hosts need no internal
// header; they must not drift apart.
static_assert(std::string_view(kExtensionErrorDomain) == std::string_view(kSandboxErrorDomain));
static_assert(kExtensionMalformed == dr::kExtensionMalformed);
static_assert(kExtensionForged == dr::kExtensionForged);
static_assert(kExtensionWrongClass == dr::kExtensionWrongClass);

namespace {

// `relative` inside the folder `dir`, opened with `flags`: the kernel keeps
// the lookup beneath the folder and refuses every symbolic link.
Result<UniqueFd> OpenBeneath(int dir, const std::string& relative, uint64_t flags) {
  struct open_how how = {};
  how.flags = flags | O_CLOEXEC | O_NOCTTY;
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  const char* name = relative.empty() ? "." : relative.c_str();
  UniqueFd fd(static_cast<int>(::syscall(SYS_openat2, dir, name, &how, sizeof how)));
  if (!fd) return PosixError(errno, "open " + relative);
  return fd;
}

}  // namespace

std::string DefaultSandboxKeyPath() { return SandboxKeyPath(); }

Result<std::string> consumeExtension(std::string_view token, const std::string& keyPath) {
  Result<token::Key> key = token::ReadKey(keyPath);
  if (!key.ok()) return key.error();
  return token::Verify(token, *key);
}

OpenedExtension::OpenedExtension(int descriptor, std::string path)
    : fd_(descriptor), path_(std::move(path)) {}

OpenedExtension::~OpenedExtension() {
  if (fd_ >= 0) ::close(fd_);
}

OpenedExtension::OpenedExtension(OpenedExtension&& other) noexcept
    : fd_(std::exchange(other.fd_, -1)), path_(std::move(other.path_)) {}

OpenedExtension& OpenedExtension::operator=(OpenedExtension&& other) noexcept {
  if (this != &other) {
    if (fd_ >= 0) ::close(fd_);
    fd_ = std::exchange(other.fd_, -1);
    path_ = std::move(other.path_);
  }
  return *this;
}

Result<std::string> OpenedExtension::readFile(const std::string& relative, size_t maxBytes) const {
  UniqueFd own;
  int fd = fd_;
  if (!relative.empty()) {
    // Never blocks on a FIFO placed where a file should be.
    Result<UniqueFd> opened = OpenBeneath(fd_, relative, O_RDONLY | O_NONBLOCK);
    if (!opened.ok()) return opened.error();
    own = std::move(*opened);
    fd = own.get();
  }
  struct stat st;
  if (::fstat(fd, &st) != 0) return PosixError(errno, "stat " + relative);
  if (!S_ISREG(st.st_mode)) return PosixError(EISDIR, "not a file: " + relative);
  if (static_cast<uint64_t>(st.st_size) > maxBytes) return PosixError(EFBIG, relative);
  std::string bytes;
  char buffer[65536];
  for (off_t at = 0;;) {
    ssize_t n = ::pread(fd, buffer, sizeof buffer, at);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return PosixError(errno, "read " + relative);
    if (n == 0) return bytes;
    if (bytes.size() + static_cast<size_t>(n) > maxBytes) return PosixError(EFBIG, relative);
    bytes.append(buffer, static_cast<size_t>(n));
    at += n;
  }
}

Result<std::vector<std::string>> OpenedExtension::listFolder(const std::string& relative) const {
  Result<UniqueFd> opened = OpenBeneath(fd_, relative, O_RDONLY | O_DIRECTORY);
  if (!opened.ok()) return opened.error();
  DIR* dir = ::fdopendir(opened->get());
  if (!dir) return PosixError(errno, "list " + relative);
  opened->release();  // the DIR owns it now
  std::vector<std::string> names;
  errno = 0;
  while (struct dirent* e = ::readdir(dir)) {
    std::string_view name = e->d_name;
    if (name != "." && name != "..") names.emplace_back(name);
  }
  const int error = errno;
  ::closedir(dir);
  if (error != 0) return PosixError(error, "list " + relative);
  std::sort(names.begin(), names.end());
  return names;
}

Result<OpenedExtension> openExtension(Connection& connection, std::string_view token,
                                      std::chrono::milliseconds timeout) {
  std::vector<int> descriptors;
  Result<Value> reply =
      connection.request(Value{{message::kRequestKey, message::kRequestOpen},
                               {message::kVersionKey, Value(message::kProtocolVersion)},
                               {message::kTokenKey, Value(token)}},
                         timeout, &descriptors);
  // Owned from here on, whatever the reply says.
  std::vector<UniqueFd> owned;
  for (int d : descriptors) owned.emplace_back(d);
  if (!reply.ok()) return reply.error();
  if (Status status = ReplyStatus(*reply); !status.ok()) return status.error();
  std::optional<std::string_view> path = (*reply)[message::kPathKey].string();
  if (!path || owned.size() != 1) {
    return Error(kClientErrorDomain, kUnexpectedReply,
                 "drd's reply to \"open\" is not an opened file");
  }
  return OpenedExtension(owned[0].release(), std::string(*path));
}

}  // namespace dr::client
