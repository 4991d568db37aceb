// A kernel as Debian 12's own (6.1) seems to a program: Landlock of version 2, which knows neither truncation
// nor TCP rules nor scopes, and no SO_PEERPIDFD. A filter that the test installs before the program starts
// answers for the kernel; what such a kernel does know, the real one does.
#pragma once

#include <atomic>
#include <thread>

namespace kyt {

class OldKernel {
 public:
  static constexpr int kLandlock = 2;  // its version

  OldKernel();
  ~OldKernel();  // ends the thread that answers; the process must have ended, or need no answer any more
  OldKernel(const OldKernel&) = delete;
  OldKernel& operator=(const OldKernel&) = delete;

  // In the child, before it executes the program: from then on it lives on the old kernel.
  void installHere() const;
  // In the test, after the fork: answers on a thread of its own from now on.
  void serve();
  [[nodiscard]] bool wasAskedForVersion() const { return askedForVersion_; }
  // How many rulesets asked for what such a kernel does not know, and so failed.
  [[nodiscard]] int refusedRulesets() const { return refusedRulesets_; }

 private:
  void answer(int listener);
  int toTest_ = -1, fromChild_ = -1;  // a socket pair: the filter's descriptor comes over it
  std::atomic<bool> askedForVersion_{false}, stop_{false};
  std::atomic<int> refusedRulesets_{0};
  std::thread thread_;
};

// In the child, before it executes the program: from then on the kernel is one without Landlock, or without seccomp.
void takeLandlockAwayHere();
void takeSeccompAwayHere();

}  // namespace kyt
