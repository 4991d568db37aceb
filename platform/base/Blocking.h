// How a thread says that it is about to wait for long. Whoever counts on the thread is told: the worker pool keeps others
// running, the reactor lets another thread wait for events. Before that, what the thread holds back for the end of its
// present work is given away, so that it never waits for the waiter. Each thread's own; no effect where nobody counts on
// it.
#pragma once

#include <cstdint>

namespace kyt {

// What a thread waits for: others that hold a lock, or anything else. One that computes for long waits for nothing: whoever
// counts on the thread for what is urgent is told, and its processor is not given to another.
enum class BlockingKind : uint8_t { inLine, other, computing };

// Who is told when its thread is about to wait. Nested waits are told once; those while it computes as any others.
class BlockingObserver {
 public:
  virtual ~BlockingObserver() = default;
  virtual void willBlock(BlockingKind kind) = 0;
  virtual void hasBlocked() = 0;  // not after `computing`
  // Of the calling thread; null: none. Returns the former one.
  static BlockingObserver* exchange(BlockingObserver* observer) noexcept;

 private:
  friend class BlockingScope;
  unsigned depth_ = 0;
};

// What the calling thread holds back (a turn's deferred queues and gathered replies).
class HeldBack {
 public:
  virtual void giveAway() = 0;
  // Of the calling thread; null: nothing. Returns the former one.
  static HeldBack* exchange(HeldBack* held) noexcept;

 protected:
  ~HeldBack() = default;
};

// Stands where a thread waits. Made before the wait begins, with no lock held that others need for their work, but for the
// gate (Gate.h) or monitor that is there for such waits: it is made behind it, so that who stands in line is told as that.
class BlockingScope {
 public:
  explicit BlockingScope(BlockingKind kind = BlockingKind::other);
  ~BlockingScope();
  BlockingScope(const BlockingScope&) = delete;
  BlockingScope& operator=(const BlockingScope&) = delete;

 private:
  BlockingObserver* observer_;
};

}  // namespace kyt
