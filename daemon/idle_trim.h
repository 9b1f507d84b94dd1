// IdleTrimmer: runs a memory trim once the daemon has been quiet for a while
// after some activity.
//
// Serving a burst (many connections, each reading on its own thread and so
// allocating from one of the allocator's per-thread arenas, or a peer whose
// unread replies piled up) leaves the allocator holding the freed memory:
// the resident set stays near its peak long after the burst. Returning it
// costs a walk over every arena, far too much to do after each request, so it
// is done once per quiet spell: `trim` runs on the trimmer's own thread when
// `quiet` has passed with no activity() since the last one, or when `busy`
// has passed since the first activity after the last trim (so that a burst
// whose tail drags on, such as a backlog of dead connections being taken
// off the listening socket, still gets its memory back soon), and not again
// until there is new activity. A daemon that stays idle never wakes for it.
//
// All members are safe to call from any thread; activity() is one atomic
// increment unless the trimmer is asleep.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <thread>

namespace dr {

class IdleTrimmer {
 public:
  IdleTrimmer(std::chrono::milliseconds quiet, std::chrono::milliseconds busy,
              std::function<void()> trim);
  // Stops the thread without trimming.
  ~IdleTrimmer();
  IdleTrimmer(const IdleTrimmer&) = delete;
  IdleTrimmer& operator=(const IdleTrimmer&) = delete;

  // Something happened that may have left freed memory behind.
  void activity();

  // glibc's malloc_trim(0): gives the free pages of every arena back to the
  // system.
  static void TrimMalloc();

 private:
  void run();

  const std::chrono::milliseconds quiet_;
  const std::chrono::milliseconds busy_;
  const std::function<void()> trim_;
  std::atomic<uint64_t> events_{0};
  std::atomic<bool> asleep_{true};  // waiting for activity, with no deadline
  std::mutex mu_;
  std::condition_variable cv_;
  bool stopping_ = false;  // guarded by mu_
  std::thread thread_;
};

}  // namespace dr
