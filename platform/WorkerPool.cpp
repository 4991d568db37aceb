#include "platform/WorkerPool.h"

#include "platform/Mutex.h"
#include "platform/SerialQueue.h"
#include "platform/SpinPause.h"

namespace kyt {

BlockingScope::BlockingScope() : worker_(nullptr) {
  if (Turn* turn = Turn::current()) turn->handDeferredToExecutors();
}

BlockingScope::~BlockingScope() = default;

void Monitor::lock() {
  for (int spin = 0; spin < 40; ++spin) {  // most holders are done within a microsecond
    if (mutex_.try_lock()) return;
    spinPause();
  }
  BlockingScope blocking;
  mutex_.lock();
}

}  // namespace kyt
