// Change notifications: named, payload-free signals between processes.
//
// Posting name N replaces the file <folder>/N atomically (written beside,
// renamed over) with the count of posts of N so far and a newline, e.g.
// "3\n". Observers watch the folder with inotify and see one event per post
// (posts in quick succession may be seen as fewer events, each with the
// latest count). A name holding '/' or NUL, empty, "." or ".." is refused
// with EINVAL. Both classes are thread-safe; the folder is made 0700.
#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "core/status.h"
#include "platform/file_system.h"
#include "wire/locations.h"

namespace dr {

struct NotificationOptions {
  std::string directory;
};

// DR_NOTIFY_DIR, else <socket folder>/notify.
NotificationOptions NotificationOptionsFromEnvironment(const EnvironmentLookup& getenv = nullptr);

// Whether `name` can name a notification.
bool IsValidNotificationName(std::string_view name);

class NotificationCenter {
 public:
  virtual ~NotificationCenter() = default;
  // Posts `name`. Errors: EINVAL for a refused name; otherwise the file
  // write's error, after which the count is as it was before the call.
  virtual Status post(std::string_view name) = 0;
};

std::unique_ptr<NotificationCenter> MakeFileNotificationCenter(
    NotificationOptions options, FileSystem* fs = FileSystem::Default());

struct Notification {
  std::string name;
  uint64_t count = 0;  // the count in the file when it was read; 0 if unreadable
};

// Watches one notification folder. Not copyable; the inotify descriptor is
// closed when it is destroyed.
class NotificationObserver {
 public:
  // Starts watching `directory`, making it (0700) if it does not exist.
  static Result<std::unique_ptr<NotificationObserver>> Open(const std::string& directory);
  ~NotificationObserver();
  NotificationObserver(const NotificationObserver&) = delete;
  NotificationObserver& operator=(const NotificationObserver&) = delete;

  // The next post seen since the observer was opened or last asked, waiting
  // up to `timeout`; nothing when none came in time.
  Result<std::optional<Notification>> waitForPost(std::chrono::milliseconds timeout);

 private:
  NotificationObserver(std::string directory, int fd) : directory_(std::move(directory)), fd_(fd) {}
  Status readEvents();

  std::string directory_;
  int fd_;
  std::mutex mu_;
  std::deque<std::string> pending_;
};

}  // namespace dr
