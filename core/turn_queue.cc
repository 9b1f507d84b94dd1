#include "core/turn_queue.h"

#include <utility>

namespace dr {

TurnQueue::TurnQueue(SerialQueue* queue) : queue_(queue), lines_(std::make_shared<Lines>()) {}

void TurnQueue::submit(uint64_t source, std::function<void()> work) {
  {
    std::lock_guard<std::mutex> lock(lines_->mu);
    std::deque<std::function<void()>>& line = lines_->lines[source];
    if (line.empty()) lines_->round.push_back(source);
    line.push_back(std::move(work));
    ++lines_->count;
  }
  // One piece of work per item, so the SerialQueue runs exactly as many
  // items as were submitted, each taking whichever turn is next.
  queue_->async([lines = lines_] {
    if (std::function<void()> work = lines->next()) work();
  });
}

size_t TurnQueue::waiting() const {
  std::lock_guard<std::mutex> lock(lines_->mu);
  return lines_->count;
}

std::function<void()> TurnQueue::Lines::next() {
  std::lock_guard<std::mutex> lock(mu);
  if (round.empty()) return nullptr;
  const uint64_t source = round.front();
  round.pop_front();
  auto it = lines.find(source);
  std::function<void()> work = std::move(it->second.front());
  it->second.pop_front();
  if (it->second.empty()) {
    lines.erase(it);
  } else {
    round.push_back(source);
  }
  --count;
  return work;
}

}  // namespace dr
