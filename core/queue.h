// SerialQueue: a labelled serial work queue.
//
// Work submitted to one queue runs one item at a time, in submission order.
// async() runs work on the queue's own thread (started with the queue). sync()
// waits until everything submitted before it has run, then runs its work
// inline on the caller's thread while the queue is held, so a synchronous
// entry costs no thread hop. isCurrent() tells whether the calling thread is
// running work of this queue (also inside a sync() nested in another queue's
// work). Calling sync() on the queue one is already on would deadlock; it is
// a programming error and stops the process.
//
// The destructor runs the work still queued, then joins the thread.
// All members are safe to call from any thread.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>

namespace dr {

// Lowers the calling thread's priority for background work: its nice value
// becomes 10 above the process's main thread's (once: a thread already that
// low is left alone), so it gives way to drd's other threads whenever both
// are ready to run. Linux has no classes of service for threads, but a
// thread may lower its own priority without privileges (not raise it again:
// threads it makes start as low).
void EnterBackgroundPriority();

// Whether a queue's thread does background work (EnterBackgroundPriority).
enum class QueuePriority { kDefault, kBackground };

class SerialQueue {
 public:
  // Starts the queue's thread, with the calling thread's priority, lowered
  // for a background queue.
  explicit SerialQueue(std::string label, QueuePriority priority = QueuePriority::kDefault);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return label_; }

  void async(std::function<void()> work);

  // REQUIRES: !isCurrent().
  void sync(const std::function<void()>& work);

  // sync() that answers what `work` answers.
  template <typename F>
  auto syncResult(F&& work) -> std::invoke_result_t<F&> {
    using R = std::invoke_result_t<F&>;
    if constexpr (std::is_void_v<R>) {
      sync(work);
    } else {
      std::optional<R> result;
      sync([&] { result.emplace(work()); });
      return std::move(*result);
    }
  }

  bool isCurrent() const;

  // Stops the process with a message naming the queue when the caller is not
  // on it: the check for "REQUIRES: on queue X" contracts.
  void assertCurrent(const char* what) const;

 private:
  // Everything the worker thread touches, shared with it so that a queue
  // released from inside its own work leaves the thread nothing dangling.
  struct State {
    std::mutex mu;
    std::condition_variable cv;  // the worker's: async work may have its turn
    // Each sync() caller waiting for its turn, by ticket, on a condition of
    // its own: a turn ends by waking the one thread whose turn is next, not
    // every waiter (thousands of dying connections may be waiting at once).
    std::map<uint64_t, std::condition_variable*> waiting;  // guarded by mu
    uint64_t nextTicket = 0;                               // guarded by mu
    uint64_t serving = 0;  // guarded by mu: the ticket whose turn it is
    std::deque<std::pair<uint64_t, std::function<void()>>> pending;  // guarded by mu
    bool stopping = false;                                           // guarded by mu
    std::thread worker;                                              // guarded by mu
  };
  static void runWorker(std::shared_ptr<State> state);
  // Gives the turn to the next ticket and wakes its holder. REQUIRES: mu held.
  static void advance(State& state);
  void enter();  // waits for the caller's turn
  void leave();  // ends the current turn

  const std::string label_;
  const std::shared_ptr<State> state_;
};

}  // namespace dr
