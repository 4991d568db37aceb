#include "platform/linux/service/MemoryReserve.h"

#include <sched.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdlib>
#include <new>
#include <string_view>

#include "platform/base/Allocation.h"

namespace kyt {
namespace {

std::atomic<MemoryReserve*> theReserve{nullptr};

// Whether this thread has asked for memory again since the reserve was given up.
thread_local bool hasAskedAgain = false;

// Nothing here may allocate.
void say(std::string_view line) {
  static_cast<void>(!::write(STDERR_FILENO, line.data(), line.size()));
}

}  // namespace

MemoryReserve::MemoryReserve(StopSignals& stopSignals) : stopSignals_(stopSignals) {
  void* const block = ::mmap(nullptr, kBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  block_ = block == MAP_FAILED ? nullptr : block;
  theReserve = this;
  std::set_new_handler(refused);
}

MemoryReserve::~MemoryReserve() {
  std::set_new_handler(nullptr);
  theReserve = nullptr;
  setMemoryWasRefused(false);
  if (void* const block = block_.exchange(nullptr)) ::munmap(block, kBytes);
}

void MemoryReserve::refused() {
  if (MemoryReserve* const reserve = theReserve.load()) {
    reserve->use();
  } else {
    throw std::bad_alloc();
  }
}

void MemoryReserve::use() {
  if (void* const block = block_.exchange(nullptr)) {
    hasAskedAgain = true;
    ::munmap(block, kBytes);
    used_ = true;
    setMemoryWasRefused(true);
    say("<3>main: The system refuses memory, ending\n");
    stopSignals_.request();
    return;
  }
  // What this thread asked for may have been refused just before another gave the reserve up.
  if (!hasAskedAgain) {
    hasAskedAgain = true;
    while (!used_) ::sched_yield();
    return;
  }
  say("<3>main: No memory is left for an orderly end\n");
  std::_Exit(1);
}

}  // namespace kyt
