// Keeps the daemon from being ended as idle. begin() and end() alternate; called under the agent's monitor.
#pragma once

namespace kyt {

class ProcessTransaction {
 public:
  virtual ~ProcessTransaction() = default;
  virtual void begin() = 0;
  virtual void end() = 0;
};

}  // namespace kyt
