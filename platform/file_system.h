// FileSystem: whole-file reads, atomic and durable writes, folder creation.
//
// The daemon's writes of its own state go through writeFileAtomically:
// the bytes go to a new temporary file beside the target, are fsynced, the
// temporary is renamed over the target, and the folder is fsynced, so that a
// crash at any point leaves either the old file or the new one, whole. A
// failure before the rename leaves the old file untouched and removes the
// temporary; a process killed before the rename leaves the temporary
// ("<name>.tmp-<UUID>"), which removeLeftoverTemporaries clears at start.
//
// FileSystem is an interface so that tests can inject faults;
// FileSystem::Default() is the real one. Implementations are safe to use from
// any thread. Errors: a missing file reads as kFileErrorDomain /
// kFileReadNoSuchFileError; other failures carry the errno text.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <string_view>

#include "core/status.h"
#include "core/unique_fd.h"

namespace dr {

class FileSystem {
 public:
  virtual ~FileSystem() = default;

  // The whole contents of the file at `path`. Files larger than `maxBytes`
  // are refused (kFileReadError), so a hostile file cannot exhaust memory.
  // Only regular files are read, and opening never waits: a folder, FIFO,
  // socket or device reads as a missing file (kFileReadNoSuchFileError), so
  // a FIFO put where a file belongs cannot stall the reader.
  virtual Result<std::string> readFile(const std::string& path,
                                       size_t maxBytes = kDefaultMaxRead) = 0;

  // Replaces the file at `path` with `bytes`, atomically and durably, with
  // permissions `mode`. Errors: kFileErrorDomain / kFileWriteError.
  virtual Status writeFileAtomically(const std::string& path, std::string_view bytes,
                                     mode_t mode = 0600) = 0;

  // Replaces the file at `path` with `bytes` atomically (written beside,
  // renamed over) but not durably: nothing is synced, so after a crash the
  // file may hold its old contents. For files whose loss costs nothing, such
  // as change notification counters, where two syncs would double the cost
  // of the change they announce. Errors: kFileErrorDomain / kFileWriteError.
  // The base version is the durable write.
  virtual Status replaceFile(const std::string& path, std::string_view bytes, mode_t mode = 0600) {
    return writeFileAtomically(path, bytes, mode);
  }
  // Creates the folder `path` and any missing parents, each with `mode`.
  // Succeeds when the folder exists already.
  virtual Status makeDirectories(const std::string& path, mode_t mode = 0700) = 0;

  // Removes the temporaries that writes to `path` left beside it when the
  // writing process died before renaming them: the regular files named
  // "<file name of path>.tmp-<UUID>" in its folder. Answers how many were
  // removed (0 when there is no such folder). REQUIRES: no write to `path`
  // is in progress (call it before the first one, as the file's only
  // writer). Errors: kFileErrorDomain / kFileWriteError.
  virtual Result<size_t> removeLeftoverTemporaries(const std::string& path) = 0;

  static constexpr size_t kDefaultMaxRead = size_t{256} << 20;

  // The real file system. Never null; lives for the whole process.
  static FileSystem* Default();
};

// Forwards every call to another FileSystem, so that a fault-injecting fake
// overrides only the call it breaks.
class FileSystemWrapper : public FileSystem {
 public:
  explicit FileSystemWrapper(FileSystem* target) : target_(target) {}
  Result<std::string> readFile(const std::string& path, size_t maxBytes) override {
    return target_->readFile(path, maxBytes);
  }
  Status writeFileAtomically(const std::string& path, std::string_view bytes,
                             mode_t mode) override {
    return target_->writeFileAtomically(path, bytes, mode);
  }
  Status replaceFile(const std::string& path, std::string_view bytes, mode_t mode) override {
    return target_->replaceFile(path, bytes, mode);
  }
  Status makeDirectories(const std::string& path, mode_t mode) override {
    return target_->makeDirectories(path, mode);
  }
  Result<size_t> removeLeftoverTemporaries(const std::string& path) override {
    return target_->removeLeftoverTemporaries(path);
  }

 private:
  FileSystem* target_;
};

// `path` with every symbolic link, "." and ".." resolved, absolute (what
// realpath(3) answers). A path already written canonically that the kernel
// resolves without meeting a symbolic link is answered as it is (two system
// calls); otherwise it asks the kernel for the path of the opened file,
// three system calls, where realpath looks up each component on its own;
// when /proc cannot tell (not mounted, a file deleted meanwhile) it falls
// back to realpath. Errors: kPosixErrorDomain with the errno of the lookup.
Result<std::string> CanonicalPath(const std::string& path);

// The canonical path of `path` when it is `root` or lies inside it, where
// `root` is itself canonical (say a bundle's path as it was registered).
// Errors: EACCES (kPosixErrorDomain) when `path` resolves anywhere else, as
// a name such as "../x" does, or any path after a folder on the way was
// swapped for a symbolic link; otherwise as CanonicalPath.
Result<std::string> CanonicalPathWithin(const std::string& path, const std::string& root);

// The file or folder at `path` opened for reading (O_RDONLY | O_CLOEXEC, and
// O_DIRECTORY for a folder), for a process that cannot reach the path
// itself. No symbolic link is followed anywhere in the path (ELOOP), and
// anything but a regular file or a folder is refused (EACCES) before it is
// opened, so neither a FIFO nor a device is ever opened by it.
Result<UniqueFd> OpenForReading(const std::string& path);

}  // namespace dr
