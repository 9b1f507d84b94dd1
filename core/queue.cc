#include "core/queue.h"

#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "core/log.h"

namespace dr {
namespace {

// The queues whose work the calling thread is running, innermost last.
thread_local std::vector<const void*> tCurrentQueues;

struct CurrentQueueScope {
  explicit CurrentQueueScope(const void* q) { tCurrentQueues.push_back(q); }
  ~CurrentQueueScope() { tCurrentQueues.pop_back(); }
};

// How far background threads' nice value is above the process's: their
// share of a busy processor falls to about a tenth of a default thread's.
constexpr int kBackgroundNice = 10;

}  // namespace

void EnterBackgroundPriority() {
  // Relative to the process's main thread, so that a thread made by a
  // background one (and so already lowered) is not lowered twice.
  errno = 0;
  const int base = ::getpriority(PRIO_PROCESS, static_cast<id_t>(::getpid()));
  if (base == -1 && errno != 0) return;
  const auto tid = static_cast<id_t>(::gettid());
  errno = 0;
  const int nice = ::getpriority(PRIO_PROCESS, tid);
  if (nice == -1 && errno != 0) return;
  const int target = std::min(base + kBackgroundNice, 19);
  if (nice >= target) return;
  if (::setpriority(PRIO_PROCESS, tid, target) != 0) {
    static std::atomic<bool> logged{false};
    if (!logged.exchange(true)) {
      SystemLog("cannot lower a background thread's priority: %s", std::strerror(errno));
    }
  }
}

// The thread is made here rather than at first use: a thread starts with the
// priority of the thread that makes it, and may not raise its own, so the
// queue's thread must not come from whichever thread (a background one, say)
// happens to submit first.
SerialQueue::SerialQueue(std::string label, QueuePriority priority)
    : label_(std::move(label)), state_(std::make_shared<State>()) {
  state_->worker = std::thread([state = state_, priority] {
    if (priority == QueuePriority::kBackground) EnterBackgroundPriority();
    runWorker(state);
  });
}

SerialQueue::~SerialQueue() {
  std::thread worker;
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->stopping = true;
    worker = std::move(state_->worker);
  }
  state_->cv.notify_all();
  if (!worker.joinable()) return;
  if (worker.get_id() == std::this_thread::get_id()) {
    // The last owner let go from inside the queue's own work: the thread
    // runs what is left and ends on its own, holding the state alive.
    worker.detach();
  } else {
    worker.join();
  }
}

void SerialQueue::async(std::function<void()> work) {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->pending.emplace_back(state_->nextTicket++, std::move(work));
  }
  state_->cv.notify_one();
}

void SerialQueue::enter() {
  std::unique_lock<std::mutex> lock(state_->mu);
  const uint64_t ticket = state_->nextTicket++;
  if (state_->serving == ticket) return;
  std::condition_variable turn;
  state_->waiting.emplace(ticket, &turn);
  turn.wait(lock, [&] { return state_->serving == ticket; });
  state_->waiting.erase(ticket);
}

void SerialQueue::leave() {
  std::lock_guard<std::mutex> lock(state_->mu);
  advance(*state_);
}

void SerialQueue::advance(State& s) {
  ++s.serving;
  if (auto it = s.waiting.find(s.serving); it != s.waiting.end()) {
    it->second->notify_one();
  } else if (!s.pending.empty() && s.pending.front().first == s.serving) {
    s.cv.notify_one();
  }
}

void SerialQueue::sync(const std::function<void()>& work) {
  if (isCurrent()) {
    SystemLog("queue \"%@\": synchronous entry from its own work would deadlock", label_);
    std::abort();
  }
  enter();
  struct Leave {
    SerialQueue* q;
    ~Leave() { q->leave(); }
  } leave{this};
  CurrentQueueScope scope(state_.get());
  work();
}

void SerialQueue::runWorker(std::shared_ptr<State> s) {
  std::unique_lock<std::mutex> lock(s->mu);
  for (;;) {
    s->cv.wait(lock, [&] {
      return (!s->pending.empty() && s->pending.front().first == s->serving) ||
             (s->stopping && s->pending.empty());
    });
    if (s->pending.empty()) return;  // stopping, and everything ran
    std::function<void()> work = std::move(s->pending.front().second);
    s->pending.pop_front();
    lock.unlock();
    {
      CurrentQueueScope scope(s.get());
      work();
      work = nullptr;  // release captures before the next turn
    }
    lock.lock();
    advance(*s);
  }
}

bool SerialQueue::isCurrent() const {
  return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), state_.get()) !=
         tCurrentQueues.end();
}

void SerialQueue::assertCurrent(const char* what) const {
  if (isCurrent()) return;
  SystemLog("%s: not on queue \"%@\"", what, label_);
  std::abort();
}

}  // namespace dr
