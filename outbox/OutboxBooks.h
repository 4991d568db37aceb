// The outbox's part of the books: whose events lie in it. Used by Outbox, on its queue.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <vector>

#include "platform/base/Books.h"
#include "platform/base/Counters.h"

namespace kyt {

class OutboxBooks {
 public:
  using Events = std::vector<BookedEvents::OfRow>;

  OutboxBooks(Books& books, Counters& counters) : books_(books), counters_(counters) {}

  // An earlier process kept them.
  void restore(const Events& events);
  // They came from their back end; null: of no back end.
  void enter(const BookedEvents* booked, const Events& events);
  void deliver(const Events& events);
  void drop(const Events& events, Reason fate);
  // All that are left, whatever they were: no post is.
  void dropRest(Reason fate);

 private:
  struct Held {
    std::shared_ptr<Tally> tally;
    uint64_t events = 0;
  };
  Held& held(const BookRowName& row);
  // Those of them that are still held: a file that was damaged may say anything.
  template <typename Operation>
  void leave(const Events& events, Operation operation);

  Books& books_;
  Counters& counters_;
  std::map<BookRowName, Held> held_;
};

}  // namespace kyt
