#include "platform/linux/service/MemoryReserve.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cstdlib>
#include <new>
#include <string_view>

namespace kyt {
namespace {

std::atomic<MemoryReserve*> theReserve{nullptr};

// Nothing here may allocate.
void say(std::string_view line) {
  static_cast<void>(!::write(STDERR_FILENO, line.data(), line.size()));
}

}  // namespace

MemoryReserve::MemoryReserve(StopSignals& stopSignals) : stopSignals_(stopSignals) {
  void* const block = ::mmap(nullptr, kBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  block_ = block == MAP_FAILED ? nullptr : block;
  theReserve = this;
  std::set_new_handler(memoryWasRefused);
}

MemoryReserve::~MemoryReserve() {
  std::set_new_handler(nullptr);
  theReserve = nullptr;
  if (void* const block = block_.exchange(nullptr)) ::munmap(block, kBytes);
}

void MemoryReserve::memoryWasRefused() {
  if (MemoryReserve* const reserve = theReserve.load()) {
    reserve->use();
  } else {
    throw std::bad_alloc();
  }
}

void MemoryReserve::use() {
  if (void* const block = block_.exchange(nullptr)) {
    ::munmap(block, kBytes);
    used_ = true;
    say("<3>main: The system refuses memory, ending\n");
    stopSignals_.request();
    return;
  }
  say("<3>main: No memory is left for an orderly end\n");
  std::_Exit(1);
}

}  // namespace kyt
