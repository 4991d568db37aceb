// The diagnostics consent as a test sets it. Any thread.
#pragma once

#include <atomic>

#include "platform/DeviceProperties.h"

namespace kyt {

class FakeConsent final : public DiagnosticsConsent {
 public:
  explicit FakeConsent(bool allowed = false) : allowed_(allowed) {}
  void setAllowed(bool allowed) {
    if (allowed_.exchange(allowed) && !allowed) ++epoch_;
  }
  [[nodiscard]] uint64_t epoch() override { return epoch_; }
  [[nodiscard]] bool isSubmissionAllowed() override { return allowed_; }

 private:
  std::atomic<bool> allowed_;
  std::atomic<uint64_t> epoch_{1};
};

}  // namespace kyt
