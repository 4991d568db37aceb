// How many blocks one batched event takes from the allocator, from the bytes of its call to its place in the
// batch (Pipeline.h); those of the connection's turn are spread over the events that came with it. Every
// call of malloc, calloc and realloc in the process is counted, so nothing may run beside it. Prints the
// figure and ends with 1 when it is over the limit; runs as a test too.
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "bench/Pipeline.h"

namespace {

constexpr double kLimit = 12;
std::atomic<size_t> allocations{0};

}  // namespace

extern "C" {
void* __libc_malloc(size_t size);
void* __libc_calloc(size_t count, size_t size);
void* __libc_realloc(void* block, size_t size);

void* malloc(size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return __libc_malloc(size);
}
void* calloc(size_t count, size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return __libc_calloc(count, size);
}
void* realloc(void* block, size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return __libc_realloc(block, size);
}
}

namespace kyt::bench {
namespace {

constexpr int kBatches = 20;

int run() {
  Pipeline pipeline;
  if (!pipeline.isLive()) {
    std::fprintf(stderr, "no back end is live\n");
    return 1;
  }
  size_t taken = 0;
  for (int batch = 0; batch < kBatches; ++batch) {
    const size_t before = allocations.load();
    pipeline.fillBatch();
    const size_t blocks = allocations.load() - before;
    if (pipeline.batchedBytes() < Pipeline::kEvents * 100) {
      std::fprintf(stderr, "the events did not reach the batch\n");
      return 1;
    }
    if (batch > 0) taken += blocks;  // the first one fills caches that stay
    pipeline.discardBatch();
  }
  const double each = static_cast<double>(taken) / (Pipeline::kEvents * (kBatches - 1));
  std::printf("%-58s | %-26s | %-34s | %-18s | %s\n", "heap allocations for one batched event",
              std::to_string(each).substr(0, 5).c_str(), "", "at most 12",
              each <= kLimit ? "reached" : "MISSED");
  return each <= kLimit ? 0 : 1;
}

}  // namespace
}  // namespace kyt::bench

int main() {
  return kyt::bench::run();
}
