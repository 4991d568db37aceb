#include "bench/Processes.h"

#include <time.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

namespace kyt::bench {

namespace {

double secondsOf(clockid_t clock) {
  timespec spent{};
  if (clock_gettime(clock, &spent) != 0) return 0;
  return static_cast<double>(spent.tv_sec) + static_cast<double>(spent.tv_nsec) / 1e9;
}

std::vector<std::filesystem::path> threadsOf(const std::string& pid) {
  std::vector<std::filesystem::path> threads;
  std::error_code error;
  for (const auto& task : std::filesystem::directory_iterator("/proc/" + pid + "/task", error))
    threads.push_back(task.path());
  return threads;
}

// The process first.
std::vector<int> withThoseBelow(int pid) {
  std::vector<int> pids = {pid};
  for (size_t i = 0; i < pids.size(); ++i) {
    for (const auto& thread : threadsOf(std::to_string(pids[i]))) {
      std::ifstream children(thread / "children");
      for (int child = 0; children >> child;) pids.push_back(child);
    }
  }
  return pids;
}

double secondsOfProcess(int pid) {
  clockid_t clock{};
  return clock_getcpuclockid(pid, &clock) == 0 ? secondsOf(clock) : 0;
}

void addStatus(int pid, ProcessFigures& figures) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string key; status >> key;) {
    uint64_t value = 0;
    if (key == "RssAnon:" && status >> value) figures.anonymousBytes += value * 1024;
    if (key == "VmRSS:" && status >> value) figures.residentBytes += value * 1024;
    if (key == "VmHWM:" && status >> value) figures.mostResidentBytes += value * 1024;
  }
}

ProcessFigures figuresOf(const std::vector<int>& pids) {
  ProcessFigures figures;
  for (const int each : pids) {
    figures.processorSeconds += secondsOfProcess(each);
    addStatus(each, figures);
    for (const auto& path : threadsOf(std::to_string(each))) {
      std::ifstream thread(path / "status");
      for (std::string key; thread >> key;) {
        uint64_t value = 0;
        if (key == "voluntary_ctxt_switches:" && thread >> value) figures.switches += value;
      }
    }
  }
  return figures;
}

}  // namespace

double processorSeconds(int pid) {
  double seconds = 0;
  for (const int each : withThoseBelow(pid)) seconds += secondsOfProcess(each);
  return seconds;
}

double secondsOfThisThread() {
  return secondsOf(CLOCK_THREAD_CPUTIME_ID);
}

double secondsOfOwnThreads(const char* name) {
  double seconds = 0;
  for (const auto& thread : threadsOf("self")) {
    std::string comm;
    std::getline(std::ifstream(thread / "comm") >> std::ws, comm);
    double nanoseconds = 0;
    if (comm == name && std::ifstream(thread / "schedstat") >> nanoseconds) seconds += nanoseconds / 1e9;
  }
  return seconds;
}

ProcessFigures figuresOf(int pid) {
  return figuresOf(withThoseBelow(pid));
}

ProcessFigures figuresOfItAlone(int pid) {
  return figuresOf(std::vector{pid});
}

OneProcessor::OneProcessor(std::initializer_list<int> pids) {
  CPU_ZERO(&former_);
  sched_getaffinity(0, sizeof former_, &former_);
  cpu_set_t one;
  CPU_ZERO(&one);
  CPU_SET(static_cast<size_t>(std::max(sched_getcpu(), 0)), &one);
  sched_setaffinity(0, sizeof one, &one);
  for (const int pid : pids)
    for (const auto& thread : threadsOf(std::to_string(pid)))
      sched_setaffinity(std::stoi(thread.filename()), sizeof one, &one);
}

OneProcessor::~OneProcessor() {
  sched_setaffinity(0, sizeof former_, &former_);
}

}  // namespace kyt::bench
