#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "core/value.h"
#include "platform/file_system.h"

namespace dr {
namespace {

Error FileError(int64_t code, int errnum, const std::string& what) {
  Error posix = PosixError(errnum, what);
  return Error(kFileErrorDomain, code, posix.ownDescription());
}

std::string ParentOf(const std::string& path) {
  size_t slash = path.find_last_of('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

// Writes all of `bytes` to `fd`, retrying short writes and EINTR.
bool WriteAll(int fd, std::string_view bytes) {
  const char* p = bytes.data();
  size_t left = bytes.size();
  while (left > 0) {
    ssize_t n = ::write(fd, p, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    p += n;
    left -= static_cast<size_t>(n);
  }
  return true;
}

// The file at `path` replaced by `bytes`, and when `durable` synced before
// and after the rename.
Status Replace(const std::string& path, std::string_view bytes, mode_t mode, bool durable) {
  // A unique temporary beside the target, so the rename stays within one
  // file system and concurrent writers never share a temporary.
  std::string tmp = path + ".tmp-" + Uuid::random().string();
  int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode);
  if (fd < 0) return FileError(kFileWriteError, errno, "create " + tmp);
  auto fail = [&](const char* what) {
    int e = errno;
    ::close(fd);
    ::unlink(tmp.c_str());
    return Status(FileError(kFileWriteError, e, std::string(what) + " " + tmp));
  };
  if (::fchmod(fd, mode) != 0) return fail("chmod");  // the umask may have narrowed it
  if (!WriteAll(fd, bytes)) return fail("write");
  if (durable && ::fsync(fd) != 0) return fail("fsync");
  if (::close(fd) != 0) {
    int e = errno;
    ::unlink(tmp.c_str());
    return FileError(kFileWriteError, e, "close " + tmp);
  }
  if (::rename(tmp.c_str(), path.c_str()) != 0) {
    int e = errno;
    ::unlink(tmp.c_str());
    return FileError(kFileWriteError, e, "rename " + tmp + " to " + path);
  }
  if (!durable) return Status::OK();
  // Make the rename itself durable.
  int dir = ::open(ParentOf(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dir < 0) return FileError(kFileWriteError, errno, "open folder of " + path);
  int rc = ::fsync(dir);
  int e = errno;
  ::close(dir);
  if (rc != 0) return FileError(kFileWriteError, e, "fsync folder of " + path);
  return Status::OK();
}

class LinuxFileSystem final : public FileSystem {
 public:
  Result<std::string> readFile(const std::string& path, size_t maxBytes) override {
    // Without blocking: opening a FIFO for reading would otherwise wait for
    // a writer, and with it every request behind this read.
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
    if (fd < 0) {
      int e = errno;
      return FileError(e == ENOENT ? kFileReadNoSuchFileError : kFileReadError, e, "open " + path);
    }
    struct stat st;
    if (::fstat(fd, &st) != 0) {
      int e = errno;
      ::close(fd);
      return FileError(kFileReadError, e, "read " + path);
    }
    if (!S_ISREG(st.st_mode)) {
      // A folder, FIFO, socket or device is no file of drd's to read: for
      // every reader it is as if the file were missing.
      ::close(fd);
      return Error(kFileErrorDomain, kFileReadNoSuchFileError,
                   "read " + path + ": not a regular file");
    }
    std::string out;
    char buf[65536];
    for (;;) {
      ssize_t n = ::read(fd, buf, sizeof buf);
      if (n < 0) {
        if (errno == EINTR) continue;
        int e = errno;
        ::close(fd);
        return FileError(kFileReadError, e, "read " + path);
      }
      if (n == 0) break;
      if (out.size() + static_cast<size_t>(n) > maxBytes) {
        ::close(fd);
        return FileError(kFileReadError, EFBIG, "read " + path);
      }
      out.append(buf, static_cast<size_t>(n));
    }
    ::close(fd);
    return out;
  }

  Status writeFileAtomically(const std::string& path, std::string_view bytes,
                             mode_t mode) override {
    return Replace(path, bytes, mode, true);
  }

  Status replaceFile(const std::string& path, std::string_view bytes, mode_t mode) override {
    return Replace(path, bytes, mode, false);
  }

  Status makeDirectories(const std::string& path, mode_t mode) override {
    if (path.empty()) return FileError(kFileWriteError, ENOENT, "mkdir (empty path)");
    size_t pos = 0;
    for (;;) {
      pos = path.find('/', pos + 1);
      std::string part = path.substr(0, pos);
      if (!part.empty()) {
        if (::mkdir(part.c_str(), mode) == 0) {
          // The umask may have narrowed the mode; set exactly what was asked.
          if (::chmod(part.c_str(), mode) != 0) {
            return FileError(kFileWriteError, errno, "chmod " + part);
          }
        } else if (errno != EEXIST) {
          return FileError(kFileWriteError, errno, "mkdir " + part);
        }
      }
      if (pos == std::string::npos) break;
    }
    struct stat st;
    if (::stat(path.c_str(), &st) != 0) return FileError(kFileWriteError, errno, "stat " + path);
    if (!S_ISDIR(st.st_mode)) return FileError(kFileWriteError, ENOTDIR, "mkdir " + path);
    return Status::OK();
  }

  Result<size_t> removeLeftoverTemporaries(const std::string& path) override {
    const std::string folder = ParentOf(path);
    const std::string prefix = path.substr(path.rfind('/') + 1) + ".tmp-";
    DIR* dir = ::opendir(folder.c_str());
    if (dir == nullptr) {
      if (errno == ENOENT || errno == ENOTDIR) return size_t{0};  // nothing was ever saved there
      return FileError(kFileWriteError, errno, "open folder " + folder);
    }
    size_t removed = 0;
    int failure = 0;
    std::string failed;
    while (struct dirent* entry = ::readdir(dir)) {
      std::string_view name = entry->d_name;
      // Only names writes make: the prefix and a UUID, nothing else.
      if (!name.starts_with(prefix) || !Uuid::parse(name.substr(prefix.size()))) continue;
      struct stat st;
      if (::fstatat(::dirfd(dir), entry->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0 ||
          !S_ISREG(st.st_mode)) {
        continue;
      }
      if (::unlinkat(::dirfd(dir), entry->d_name, 0) == 0) {
        ++removed;
      } else if (errno != ENOENT && failure == 0) {
        failure = errno;
        failed = folder + "/" + entry->d_name;
      }
    }
    ::closedir(dir);
    if (failure != 0) return FileError(kFileWriteError, failure, "remove " + failed);
    return removed;
  }
};

// Whether `path` is written the way realpath answers: absolute, with no
// empty, "." or ".." component and no slash at the end.
bool IsWrittenCanonically(std::string_view path) {
  if (path.empty() || path[0] != '/') return false;
  if (path.size() == 1) return true;
  for (size_t start = 1; start <= path.size();) {
    const size_t end = std::min(path.find('/', start), path.size());
    const std::string_view component = path.substr(start, end - start);
    if (component.empty() || component == "." || component == "..") return false;
    start = end + 1;
  }
  return true;
}

// Whether `path` names a file reached without any symbolic link: the kernel
// refuses the lookup (openat2 with RESOLVE_NO_SYMLINKS) at the first link.
// Such a path, written canonically, is its own canonical path, found in two
// system calls instead of three. False also where openat2 is missing (before
// Linux 5.6), and from then on without asking.
bool ReachedWithoutLinks(const std::string& path) {
  static std::atomic<bool> missing{false};
  if (missing.load(std::memory_order_relaxed)) return false;
  struct open_how how = {};
  how.flags = O_PATH | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  const long fd = ::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how);
  if (fd < 0) {
    if (errno == ENOSYS) missing.store(true, std::memory_order_relaxed);
    return false;
  }
  ::close(static_cast<int>(fd));
  return true;
}

}  // namespace

Result<std::string> CanonicalPath(const std::string& path) {
  if (path.find('\0') != std::string::npos) return PosixError(EINVAL, "path holds NUL");
  // Registered bundles are stored under their canonical paths, so this is
  // the usual case; a link, a missing file or any other refusal is left to
  // the lookup below, which tells why.
  if (IsWrittenCanonically(path) && ReachedWithoutLinks(path)) return path;
  const int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
  if (fd < 0) return PosixError(errno, "realpath " + path);
  char link[PATH_MAX];
  const std::string self = "/proc/self/fd/" + std::to_string(fd);
  const ssize_t n = ::readlink(self.c_str(), link, sizeof link);
  ::close(fd);
  constexpr std::string_view kDeleted = " (deleted)";
  if (n > 0 && static_cast<size_t>(n) < sizeof link && link[0] == '/') {
    std::string resolved(link, static_cast<size_t>(n));
    // The kernel marks a file removed since it was opened; a name that
    // truly ends so is told apart by realpath below.
    if (!resolved.ends_with(kDeleted)) return resolved;
  }
  std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr),
                                                       &std::free);
  if (!resolved) return PosixError(errno, "realpath " + path);
  return std::string(resolved.get());
}

Result<std::string> CanonicalPathWithin(const std::string& path, const std::string& root) {
  Result<std::string> resolved = CanonicalPath(path);
  if (!resolved.ok()) return resolved;
  const std::string& r = *resolved;
  const bool within = r == root || (r.starts_with(root) && r.size() > root.size() &&
                                    (r[root.size()] == '/' || root == "/"));
  if (!within) return PosixError(EACCES, "outside " + root + ": " + path);
  return resolved;
}

Result<UniqueFd> OpenForReading(const std::string& path) {
  if (path.find('\0') != std::string::npos) return PosixError(EINVAL, "path holds NUL");
  // First a handle that opens nothing, to learn what the path names without
  // the side effects of opening it (a FIFO would block, a device act).
  struct open_how how = {};
  how.flags = O_PATH | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  UniqueFd handle(
      static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how)));
  if (!handle) return PosixError(errno, "open " + path);
  struct stat st;
  if (::fstat(handle.get(), &st) != 0) return PosixError(errno, "stat " + path);
  UniqueFd fd;
  if (S_ISDIR(st.st_mode)) {
    fd.reset(::openat(handle.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  } else if (S_ISREG(st.st_mode)) {
    // Reopened through the handle: the same file, whatever the path names now.
    const std::string self = "/proc/self/fd/" + std::to_string(handle.get());
    fd.reset(::open(self.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
  } else {
    return PosixError(EACCES, "not a file or folder: " + path);
  }
  if (!fd) return PosixError(errno, "open " + path);
  return fd;
}

FileSystem* FileSystem::Default() {
  static LinuxFileSystem* fs = new LinuxFileSystem();
  return fs;
}

}  // namespace dr
