// Work that takes a processor for long and much memory meanwhile: a large batch's text and its compression. More at a time
// than there are processors would finish no sooner, hold all their memory at once, and keep small work waiting for a
// processor. Users take turns (FairLock.h).
//
// Any thread. Who holds a scope waits for nobody who needs one.
#pragma once

#include <algorithm>
#include <thread>

#include "platform/base/Blocking.h"
#include "platform/queues/FairLock.h"

namespace kyt {

class LargeWork {
 public:
  // As many at a time as there are processors, and as queues may run in a worker pool: two at least.
  LargeWork() : LargeWork(std::max(2u, std::thread::hardware_concurrency())) {}
  explicit LargeWork(unsigned atOnce) : lock_(atOnce) {}
  LargeWork(const LargeWork&) = delete;
  LargeWork& operator=(const LargeWork&) = delete;

  // Waits in line, then tells the worker pool that its thread is gone for long, until it is destroyed.
  class Scope {
   public:
    explicit Scope(LargeWork& work) : place_(work.lock_) {}

   private:
    class Place {
     public:
      explicit Place(FairLock& lock) : lock_(lock) { lock_.take(); }
      ~Place() { lock_.giveBack(); }
      Place(const Place&) = delete;
      Place& operator=(const Place&) = delete;

     private:
      FairLock& lock_;
    };

    Place place_;
    BlockingScope blocking_;
  };

 private:
  FairLock lock_;
};

}  // namespace kyt
