// The outbox's part of the books: whose events lie in it. It also tells watchers what became of them; of which category they
// were only where somebody watched when they were kept. Used by Outbox, on its queue.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <vector>

#include "platform/base/Books.h"
#include "platform/base/Counters.h"

namespace kyt {

class OutboxBooks {
 public:
  using Events = std::vector<BookedEvents::OfRow>;

  OutboxBooks(Books& books, Counters& counters) : books_(books), counters_(counters) {}

  // A number for what a post holds, which needs no reading of it to be booked; 0: too many different ones are known.
  [[nodiscard]] uint16_t remember(const Events& events);
  // Null: not known.
  [[nodiscard]] const Events* remembered(uint16_t contents) const;
  // No post holds any of it any more.
  void forgetContents();

  // An earlier process kept them.
  void restore(const Events& events);
  // They came from their back end, whose post got that status; null: of no back end.
  void enter(int64_t post, const std::shared_ptr<const BookedEvents>& booked, const Events& events,
             int status);
  // `status`: of the answer, 0: there was none.
  void deliver(int64_t post, const Events& events, int status);
  void drop(int64_t post, const Events& events, Reason fate, int status = 0);
  // All that are left, whatever they were: no post is.
  void dropRest(Reason fate);
  // Nobody watches any more.
  void forgetUnwatched();

 private:
  struct Held {
    std::shared_ptr<Tally> tally;
    uint64_t events = 0;
  };
  Held& held(const BookRowName& row);
  // Those of them that are still held: a file that was damaged may say anything.
  template <typename Operation>
  void leave(const Events& events, Operation operation);
  void tellWatchers(int64_t post, const Events& events, std::optional<Reason> dropped, int status);

  Books& books_;
  Counters& counters_;
  std::map<BookRowName, Held> held_;
  std::map<Events, uint16_t> contents_;                             // Limits::maxKnownOutboxContents at most
  std::vector<const Events*> contentsByNumber_;                     // from 1; keys of contents_
  std::map<int64_t, std::shared_ptr<const BookedEvents>> watched_;  // Limits::maxWatchedKeptPosts at most
};

}  // namespace kyt
