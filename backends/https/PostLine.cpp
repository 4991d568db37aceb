#include "backends/https/PostLine.h"

#include <utility>

namespace kyt {

void PostLine::add(Function<void()> post) {
  if (executor_.hasMuchReady()) {
    finish();
    post();
    return;
  }
  if (queue_ == nullptr) {
    // A worker for it counts among those of the user whose connection this is.
    queue_ = SerialQueue::create("kyt.post", executor_, SerialQueue::ownerOfThread());
    waiting_ = std::make_shared<std::atomic<unsigned>>(0);
  }
  if (waiting_->load(std::memory_order_relaxed) >= kMostWaiting) finish();
  waiting_->fetch_add(1, std::memory_order_relaxed);
  queue_->asyncBeside([waiting = waiting_, post = std::move(post)]() mutable {
    waiting->fetch_sub(1, std::memory_order_relaxed);
    post();
  });
}

void PostLine::finish() {
  if (queue_ != nullptr) queue_->sync([] {});
}

}  // namespace kyt
