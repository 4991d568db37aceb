// Work that takes a processor for long and much memory meanwhile: a large batch's text and its compression. Of the queues
// that may run at once in a worker pool it leaves one to small work: where large work has all processors, or more threads
// want one than there are, small work waits for the scheduler's next tick at each of its steps. Users take turns
// (FairLock.h).
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
  // One less at a time than queues may run in a worker pool (which are two at least).
  LargeWork() : LargeWork(std::max(2u, std::thread::hardware_concurrency()) - 1) {}
  explicit LargeWork(unsigned atOnce) : lock_(atOnce) {}
  LargeWork(const LargeWork&) = delete;
  LargeWork& operator=(const LargeWork&) = delete;

  // Waits in line, then tells whoever counts on its thread that it computes for long, until it is destroyed.
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
    BlockingScope blocking_{BlockingKind::computing};
  };

 private:
  FairLock lock_;
};

}  // namespace kyt
