// TurnQueue: the work of many sources run in turns on one SerialQueue.
//
// Each source (a number the caller chooses, such as one per connection) has
// a line of its own. Whenever the SerialQueue gets to a TurnQueue item, it
// runs the first item of the source whose turn it is; that source then goes
// to the back of the round if it has more. So a source with many items
// waiting delays another source's next item by at most one of its own per
// round instead of all of them. Within one source, items run in the order
// they were submitted. Every submitted item runs exactly once, on the
// SerialQueue, whatever becomes of its source: the TurnQueue holds an item
// (and what it captures) until it has run, also when the TurnQueue itself is
// gone before the SerialQueue.
//
// Work posted to the SerialQueue directly keeps its place among the
// TurnQueue's items: each submit() posts one piece of work there, which runs
// whichever item's turn it is.
//
// All members are safe to call from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "core/queue.h"

namespace dr {

class TurnQueue {
 public:
  // REQUIRES: `queue` outlives the work submitted here.
  explicit TurnQueue(SerialQueue* queue);
  TurnQueue(const TurnQueue&) = delete;
  TurnQueue& operator=(const TurnQueue&) = delete;

  // Queues `work` at the end of `source`'s line.
  void submit(uint64_t source, std::function<void()> work);

  // Items submitted and not yet started.
  size_t waiting() const;

 private:
  struct Lines {
    mutable std::mutex mu;
    std::map<uint64_t, std::deque<std::function<void()>>> lines;  // guarded by mu
    std::deque<uint64_t> round;  // guarded by mu: each source with a non-empty line, once
    size_t count = 0;            // guarded by mu

    // The first item of the source whose turn it is (empty when none waits).
    std::function<void()> next();
  };

  SerialQueue* const queue_;
  const std::shared_ptr<Lines> lines_;  // shared with the work posted to queue_
};

}  // namespace dr
