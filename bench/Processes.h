// What the kernel says of the processes that a benchmark measures: the daemon's and those that it has started.
#pragma once

#include <sched.h>

#include <cstdint>
#include <initializer_list>

namespace kyt::bench {

// Summed over the processes; one that ends meanwhile counts as nothing.
struct ProcessFigures {
  double processorSeconds = 0;
  uint64_t anonymousBytes = 0, residentBytes = 0;
  uint64_t mostResidentBytes = 0;  // since each process began
  uint64_t switches = 0;           // voluntary context switches of all threads
};
[[nodiscard]] ProcessFigures figuresOf(int pid);         // of that process and those below it
[[nodiscard]] ProcessFigures figuresOfItAlone(int pid);  // without those below it
[[nodiscard]] double processorSeconds(int pid);          // of that process and those below it
// What the threads of that name in this process, or the calling one, have spent.
[[nodiscard]] double secondsOfOwnThreads(const char* name);
[[nodiscard]] double secondsOfThisThread();

// Keeps the calling thread and all threads of these processes on the processor on which the caller is now;
// lets the calling thread go at the end, the processes not.
class OneProcessor {
 public:
  explicit OneProcessor(std::initializer_list<int> pids);
  ~OneProcessor();
  OneProcessor(const OneProcessor&) = delete;
  OneProcessor& operator=(const OneProcessor&) = delete;

 private:
  cpu_set_t former_;
};

}  // namespace kyt::bench
