#include "platform/queues/LineOrder.h"

#include <deque>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

thread_local LineOrder* currentOrder = nullptr;
thread_local LineOrder::Place* currentPlace = nullptr;

struct Held {
  LogSink* sink;
  LogLevel level;
  std::string line;
};

}  // namespace

// Slots from the oldest on. Each is a place, or what the owner writes between two places and after the last. Only the
// first slot writes; what the others get waits. The last slot is the owner's, which is why there is none without places.
struct LineOrder::Lines {
  struct Slot {
    const Place* place = nullptr;  // null: the owner's
    std::vector<Held> held;
  };
  Mutex mutex;
  std::deque<Slot> slots GUARDED_BY(mutex);
  size_t heldBytes GUARDED_BY(mutex) = 0;

  void takePlace(const Place* place) {
    MutexLock lock(mutex);
    slots.push_back({place, {}});
    slots.push_back({});
  }
  // The owner's line. False: nothing is before it.
  bool hold(LogSink& sink, LogLevel level, std::string_view line) {
    MutexLock lock(mutex);
    if (slots.empty()) return false;
    hold(slots.back(), sink, level, line);
    return true;
  }
  void write(const Place* place, LogSink& sink, LogLevel level, std::string_view line) {
    MutexLock lock(mutex);
    if (slots.front().place == place) return sink.write(level, line);
    for (Slot& slot : slots)
      if (slot.place == place) return hold(slot, sink, level, line);
  }
  // Its slot becomes one of the owner's; those are written as far as no place is before them.
  void end(const Place* place) {
    MutexLock lock(mutex);
    for (Slot& slot : slots)
      if (slot.place == place) slot.place = nullptr;
    while (!slots.empty() && slots.front().place == nullptr) {
      writeHeld(slots.front());
      slots.pop_front();
    }
    // A place that is the first now goes on by itself; what it wrote meanwhile goes before.
    if (!slots.empty()) writeHeld(slots.front());
  }
  bool holdsMuch() {
    MutexLock lock(mutex);
    return heldBytes >= kMuch;
  }

 private:
  void hold(Slot& slot, LogSink& sink, LogLevel level, std::string_view line) REQUIRES(mutex) {
    slot.held.push_back({&sink, level, std::string(line)});
    heldBytes += line.size();
  }
  void writeHeld(Slot& slot) REQUIRES(mutex) {
    for (const Held& held : slot.held) {
      held.sink->write(held.level, held.line);
      heldBytes -= held.line.size();
    }
    slot.held.clear();
  }
};

class LineOrder::Place {
 public:
  explicit Place(std::shared_ptr<Lines> lines) : lines_(std::move(lines)) { lines_->takePlace(this); }
  ~Place() { lines_->end(this); }
  Place(const Place&) = delete;
  Place& operator=(const Place&) = delete;
  void write(LogSink& sink, LogLevel level, std::string_view line) { lines_->write(this, sink, level, line); }

 private:
  const std::shared_ptr<Lines> lines_;
};

LineOrder::LineOrder() = default;
LineOrder::~LineOrder() = default;

LineOrder::Scope::Scope(LineOrder& order) : orderBefore_(currentOrder), placeBefore_(currentPlace) {
  currentOrder = &order;
  currentPlace = nullptr;
}

LineOrder::Scope::Scope(const SharedPlace& place) : orderBefore_(currentOrder), placeBefore_(currentPlace) {
  currentOrder = nullptr;
  currentPlace = place.get();
}

LineOrder::Scope::~Scope() {
  currentOrder = orderBefore_;
  currentPlace = placeBefore_;
}

LineOrder::SharedPlace LineOrder::later() {
  if (currentOrder == nullptr) return nullptr;
  if (currentOrder->lines_ == nullptr) currentOrder->lines_ = std::make_shared<Lines>();
  return std::make_shared<Place>(currentOrder->lines_);
}

bool LineOrder::holdsMuch() {
  return currentOrder != nullptr && currentOrder->lines_ != nullptr && currentOrder->lines_->holdsMuch();
}

bool LineOrder::takes(LogSink& sink, LogLevel level, std::string_view line) {
  if (currentPlace != nullptr) {
    currentPlace->write(sink, level, line);
    return true;
  }
  return currentOrder != nullptr && currentOrder->lines_ != nullptr &&
         currentOrder->lines_->hold(sink, level, line);
}

}  // namespace kyt
