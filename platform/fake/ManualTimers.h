// The timer service of tests: time passes only in advance(), which moves the manual clock from one due time
// to the next and hands the due work to its queues in that order. Nothing runs here: the test drains the
// queues' executor. Leeway is noted and not used: periodic work is due on the dot. Schedule from any thread; advance
// from one at a time.
#pragma once

#include <memory>
#include <vector>

#include "platform/fake/ManualClock.h"
#include "platform/queues/Timer.h"

namespace kyt {

class ManualTimers final : public TimerService {
 public:
  explicit ManualTimers(ManualClock& clock);
  ~ManualTimers() override;
  TimerHandle after(Duration delay, std::shared_ptr<SerialQueue> queue, Task work) override;
  TimerHandle every(Duration period, Duration leeway, std::shared_ptr<SerialQueue> queue, Task work) override;

  void advance(Duration duration);
  // advance(), and `afterEach` (drain the executor, say) after each due time and at the end.
  void advance(Duration duration, Task afterEach);
  [[nodiscard]] size_t pending() const;  // timers that are armed
  // From now on handles are empty, and `queues` notes what was asked for.
  bool refuses = false;
  std::vector<std::weak_ptr<SerialQueue>> queues;
  Duration leeway{};  // of the last periodic timer

 private:
  struct Shared;
  class Entry;
  TimerHandle arm(Duration delay, Duration period, std::shared_ptr<SerialQueue> queue, Task work);
  ManualClock& clock_;
  std::shared_ptr<Shared> shared_;  // handles may outlive the service
};

}  // namespace kyt
