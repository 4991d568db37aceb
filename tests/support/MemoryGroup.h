// A control group of memory with a limit, as a service manager's MemoryMax= makes one, where this machine lets the test
// make it: the second version of control groups with the controller given to children of the root, or the first.
#pragma once

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

namespace kyt::test {

class MemoryGroup {
 public:
  explicit MemoryGroup(uint64_t limit) {
    const std::string root = "/sys/fs/cgroup";
    std::string children;
    std::getline(std::ifstream(root + "/cgroup.subtree_control"), children);
    second_ = children.find("memory") != std::string::npos;
    folder_ = (second_ ? root : root + "/memory") + "/kyt-test-" + std::to_string(::getpid());
    made_ = ::mkdir(folder_.c_str(), 0755) == 0;
    limited_ = made_ && write(second_ ? "memory.max" : "memory.limit_in_bytes", std::to_string(limit));
    if (second_ && limited_) write("memory.swap.max", "0");
  }
  // Whoever is still in it is killed.
  ~MemoryGroup() {
    if (!made_) return;
    while (::rmdir(folder_.c_str()) != 0 && errno == EBUSY) {
      std::ifstream members(folder_ + "/cgroup.procs");
      for (pid_t one = 0; members >> one;) ::kill(one, SIGKILL);
      std::this_thread::yield();
    }
  }
  MemoryGroup(const MemoryGroup&) = delete;
  MemoryGroup& operator=(const MemoryGroup&) = delete;

  [[nodiscard]] bool limited() const { return limited_; }
  // What a process takes from now on counts here, and what the children that it has now take.
  [[nodiscard]] bool take(pid_t process) const {
    const std::string id = std::to_string(process);
    std::ifstream children("/proc/" + id + "/task/" + id + "/children");
    for (pid_t child = 0; children >> child;)
      if (!take(child)) return false;
    return write("cgroup.procs", id);
  }
  // Bytes: the most there ever was, files that the kernel keeps in memory while there is room included.
  [[nodiscard]] uint64_t most() const {
    uint64_t bytes = 0;
    std::ifstream(folder_ + (second_ ? "/memory.peak" : "/memory.max_usage_in_bytes")) >> bytes;
    return bytes;
  }
  // Processes that the kernel killed because there was no more.
  [[nodiscard]] uint64_t kills() const {
    std::ifstream events(folder_ + (second_ ? "/memory.events" : "/memory.oom_control"));
    std::string key;
    for (uint64_t value = 0; events >> key >> value;)
      if (key == "oom_kill") return value;
    return 0;
  }

 private:
  bool write(const std::string& name, const std::string& text) const {
    std::ofstream file(folder_ + "/" + name);
    return static_cast<bool>(file << text << std::flush);
  }
  std::string folder_;
  bool second_ = false, made_ = false, limited_ = false;
};

}  // namespace kyt::test
