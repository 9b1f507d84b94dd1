#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <climits>

#include "platform/notifications.h"

namespace dr {
namespace {

constexpr const char* kNotifyFolderVariable = "DR_NOTIFY_DIR";
constexpr const char* kNotifySubfolder = "/notify";
// A counter file holds a number and a newline; anything longer is not ours.
constexpr size_t kMaxCounterBytes = 64;

// The number at the start of a counter file's contents; 0 when there is none.
uint64_t ParseCount(std::string_view bytes) {
  uint64_t count = 0;
  std::from_chars(bytes.data(), bytes.data() + bytes.size(), count);
  return count;
}

// Counts are kept in memory per process. The first post of a name in a
// process starts from the count already in its file, so counts keep rising
// across restarts of drd and an observer never sees a count go back; two
// processes posting the same name at once may both write the same count
// (each still produces an event, which is what observers wait for).
class FileNotificationCenter final : public NotificationCenter {
 public:
  FileNotificationCenter(NotificationOptions options, FileSystem* fs)
      : options_(std::move(options)), fs_(fs) {}

  Status post(std::string_view name) override {
    if (!IsValidNotificationName(name)) {
      return PosixError(EINVAL, "notification name \"" + std::string(name) + "\"");
    }
    std::string key(name);
    std::string path = options_.directory + "/" + key;
    std::lock_guard<std::mutex> lock(mu_);
    auto it = counts_.find(key);
    uint64_t previous = 0;
    if (it != counts_.end()) {
      previous = it->second;
    } else if (Result<std::string> old = fs_->readFile(path, kMaxCounterBytes); old.ok()) {
      previous = ParseCount(*old);
    }
    if (Status s = fs_->makeDirectories(options_.directory, 0700); !s.ok()) return s;
    uint64_t count = previous + 1;
    // A counter lost in a crash costs nothing (observers wait for the
    // rename, not the number), so the post is not synced to disk: it comes
    // with every change drd makes, and syncing would double that change's cost.
    if (Status s = fs_->replaceFile(path, std::to_string(count) + "\n", 0600); !s.ok()) {
      return s;
    }
    counts_[key] = count;
    return Status::OK();
  }

 private:
  NotificationOptions options_;
  FileSystem* fs_;
  std::mutex mu_;
  std::map<std::string, uint64_t> counts_;
};

}  // namespace

NotificationOptions NotificationOptionsFromEnvironment(const EnvironmentLookup& getenv) {
  NotificationOptions options;
  options.directory = EnvironmentValue(getenv, kNotifyFolderVariable);
  if (options.directory.empty()) options.directory = SocketDirectory(getenv) + kNotifySubfolder;
  return options;
}

bool IsValidNotificationName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.size() <= NAME_MAX &&
         name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

std::unique_ptr<NotificationCenter> MakeFileNotificationCenter(NotificationOptions options,
                                                               FileSystem* fs) {
  return std::make_unique<FileNotificationCenter>(std::move(options), fs);
}

Result<std::unique_ptr<NotificationObserver>> NotificationObserver::Open(
    const std::string& directory) {
  if (Status s = FileSystem::Default()->makeDirectories(directory, 0700); !s.ok()) return s;
  int fd = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (fd < 0) return PosixError(errno, "inotify_init1");
  // A post ends with a rename onto the name, so IN_MOVED_TO is exactly one
  // event per post; the temporary's own events are not watched.
  if (::inotify_add_watch(fd, directory.c_str(), IN_MOVED_TO | IN_ONLYDIR) < 0) {
    int e = errno;
    ::close(fd);
    return PosixError(e, "watch " + directory);
  }
  return std::unique_ptr<NotificationObserver>(new NotificationObserver(directory, fd));
}

NotificationObserver::~NotificationObserver() { ::close(fd_); }

Status NotificationObserver::readEvents() {
  alignas(struct inotify_event) char buf[16 * (sizeof(struct inotify_event) + NAME_MAX + 1)];
  for (;;) {
    ssize_t n = ::read(fd_, buf, sizeof buf);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN) return Status::OK();
      return PosixError(errno, "read inotify events of " + directory_);
    }
    for (ssize_t off = 0; off < n;) {
      const auto* event = reinterpret_cast<const struct inotify_event*>(buf + off);
      off += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
      if (event->len == 0 || (event->mask & IN_MOVED_TO) == 0) continue;
      std::string name(event->name);  // NUL-padded by the kernel
      if (IsValidNotificationName(name)) pending_.push_back(std::move(name));
    }
  }
}

Result<std::optional<Notification>> NotificationObserver::waitForPost(
    std::chrono::milliseconds timeout) {
  std::lock_guard<std::mutex> lock(mu_);
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (pending_.empty()) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() < 0) return std::optional<Notification>();
    struct pollfd pfd = {fd_, POLLIN, 0};
    int rc = ::poll(&pfd, 1, static_cast<int>(std::min<int64_t>(left.count(), INT_MAX)));
    if (rc < 0 && errno != EINTR) return PosixError(errno, "poll inotify of " + directory_);
    if (rc > 0) {
      if (Status s = readEvents(); !s.ok()) return s;
    }
  }
  Notification note;
  note.name = std::move(pending_.front());
  pending_.pop_front();
  Result<std::string> bytes = FileSystem::Default()->readFile(directory_ + "/" + note.name, 64);
  if (bytes.ok()) note.count = ParseCount(*bytes);
  return std::optional<Notification>(std::move(note));
}

}  // namespace dr
