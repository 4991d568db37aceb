// A program started and looked after by the demonstration and by the tests of whole programs: ended at the
// latest with this object, by its own process id, never by name.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace kyt::tools {

// Whom a program runs as, without supplementary groups.
struct User {
  std::string name;
  uid_t user = 0;
  gid_t group = 0;
  // By name, or by the digits of a number; none when the system knows nobody of that name.
  [[nodiscard]] static std::optional<User> of(const std::string& name);
};

class ChildProcess {
 public:
  struct Options {
    std::vector<std::pair<std::string, std::string>> environment;  // besides this process's
    std::string outputFile;  // standard output and error go there (appended); empty: where this process's go
    std::string inputFile;   // empty: nothing
    // None: as this process. Otherwise this process must be root's; `program` is a path then, and needs to be in reach of
    // this process alone.
    std::optional<User> user;
  };
  ChildProcess() = default;
  ChildProcess(ChildProcess&& other) noexcept;
  ChildProcess& operator=(ChildProcess&& other) noexcept;
  // Sends SIGTERM, waits five seconds, then SIGKILL.
  ~ChildProcess();

  // None (with errno) when the program cannot be started.
  [[nodiscard]] static std::optional<ChildProcess> start(const std::string& program,
                                                         const std::vector<std::string>& arguments,
                                                         const Options& options);
  [[nodiscard]] int pid() const { return pid_; }
  void signal(int number) const;
  // The exit status (128 + the signal's number when a signal ended it), or none while it runs after
  // `timeout`.
  [[nodiscard]] std::optional<int> wait(std::chrono::milliseconds timeout);
  [[nodiscard]] bool isRunning() { return !wait(std::chrono::milliseconds(0)); }

 private:
  int pid_ = -1;
  std::optional<int> status_;
};

// Asks until it returns true, at most `timeout` of real time.
template <typename Condition>
[[nodiscard]] bool waitUntil(std::chrono::milliseconds timeout, Condition&& condition);

void briefPause();  // between two questions: 5 ms

template <typename Condition>
bool waitUntil(std::chrono::milliseconds timeout, Condition&& condition) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    if (condition()) return true;
    if (std::chrono::steady_clock::now() >= deadline) return false;
    briefPause();
  }
}

}  // namespace kyt::tools
