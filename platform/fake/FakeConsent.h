// The diagnostics consent as a test sets it. Any thread.
#pragma once

#include <atomic>

#include "platform/DeviceProperties.h"

namespace kyt {

class FakeConsent final : public DiagnosticsConsent {
 public:
  explicit FakeConsent(bool allowed = false) : allowed_(allowed) {}
  void setAllowed(bool allowed) { allowed_ = allowed; }
  [[nodiscard]] bool isSubmissionAllowed() override { return allowed_; }

 private:
  std::atomic<bool> allowed_;
};

}  // namespace kyt
