#include "platform/base/Blocking.h"

#include <utility>

namespace kyt {
namespace {

thread_local BlockingObserver* blockingObserver = nullptr;
thread_local HeldBack* heldBack = nullptr;

}  // namespace

BlockingObserver* BlockingObserver::exchange(BlockingObserver* observer) noexcept {
  return std::exchange(blockingObserver, observer);
}

HeldBack* HeldBack::exchange(HeldBack* held) noexcept {
  return std::exchange(heldBack, held);
}

BlockingScope::BlockingScope(BlockingKind kind) : observer_(blockingObserver) {
  if (heldBack != nullptr) heldBack->giveAway();
  if (observer_ == nullptr) return;
  const bool isNested = observer_->depth_ != 0;
  BlockingObserver& observer = *observer_;
  if (kind == BlockingKind::computing)
    observer_ = nullptr;  // what waits within it is told
  else
    ++observer.depth_;
  if (!isNested) observer.willBlock(kind);
}

BlockingScope::~BlockingScope() {
  if (observer_ != nullptr && --observer_->depth_ == 0) observer_->hasBlocked();
}

}  // namespace kyt
