// A daemon in which a call that the test names fails, or takes as long as the test says.
#pragma once

#include <fcntl.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <string_view>
#include <utility>

#include "tests/integration/DaemonProcess.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/failing/FailingCalls.h"

namespace kyt {

// The calls of a daemon that was not started yet: their library is loaded into it.
class FailingCalls {
 public:
  static constexpr int kAlways = 1 << 30;

  explicit FailingCalls(DaemonProcess& daemon)
      : daemon_(daemon),
        path_(daemon.root().write("failing", std::string(sizeof(kyt_failing_control), '\0'))) {
    const int file = ::open(path_.c_str(), O_RDWR | O_CLOEXEC);
    void* mapped = ::mmap(nullptr, sizeof(kyt_failing_control), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    ::close(file);
    if (mapped == MAP_FAILED) std::abort();
    control_ = static_cast<kyt_failing_control*>(mapped);
    addBeforeExecution([] {});
  }
  FailingCalls(const FailingCalls&) = delete;
  FailingCalls& operator=(const FailingCalls&) = delete;
  ~FailingCalls() { ::munmap(control_, sizeof *control_); }

  // Besides what loads the library.
  void addBeforeExecution(std::function<void()> work) {
    daemon_.setBeforeExecution([path = path_, work = std::move(work)] {
      ::setenv("KYT_FAILING_CALLS", path.c_str(), 1);
      ::setenv("LD_PRELOAD", KYT_FAILING_LIBRARY, 1);
      work();
    });
  }

  // From now on the calls from the `first` one on fail, `times` of them.
  void fail(kyt_failing_call call, int error, int first = 1, int times = 1) {
    stopFailing();
    control_->call = call;
    control_->error = error;
    control_->first = first;
    control_->times = times;
    control_->seen = control_->failed = 0;
    __atomic_store_n(&control_->armed, 1, __ATOMIC_RELEASE);
  }
  // What hangs is done now.
  void goOn() { __atomic_store_n(&control_->error, 0, __ATOMIC_RELEASE); }
  void stopFailing() { __atomic_store_n(&control_->armed, 0, __ATOMIC_RELEASE); }
  // None fails; calls() counts them.
  void count(kyt_failing_call call) { fail(call, 0, kAlways); }
  [[nodiscard]] int calls() const { return __atomic_load_n(&control_->seen, __ATOMIC_RELAXED); }
  [[nodiscard]] int failures() const { return __atomic_load_n(&control_->failed, __ATOMIC_RELAXED); }

 private:
  DaemonProcess& daemon_;
  const std::string path_;
  kyt_failing_control* control_;
};

class FailingDaemon : public DaemonProcess, public FailingCalls {
 public:
  explicit FailingDaemon(const std::string& storebags)
      : DaemonProcess(storebags), FailingCalls(static_cast<DaemonProcess&>(*this)) {
    root().write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml", "consent = true\n");
  }

  [[nodiscard]] int threadsNamed(std::string_view name) const {
    int count = 0;
    std::error_code ended;
    for (const auto& thread :
         std::filesystem::directory_iterator("/proc/" + std::to_string(process()) + "/task", ended)) {
      std::string text;
      std::ifstream(thread.path() / "comm") >> text;
      count += text.starts_with(name) ? 1 : 0;
    }
    return count;
  }
  [[nodiscard]] int threads() const { return threadsNamed(""); }
};

}  // namespace kyt
