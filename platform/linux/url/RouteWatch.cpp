#include "platform/linux/url/RouteWatch.h"

#include <sys/epoll.h>

#include <utility>

namespace kyt {
namespace {

constexpr Duration kSettleTime = std::chrono::milliseconds(50);

}  // namespace

RouteWatch::RouteWatch(NetworkTools& tools, Callbacks callbacks)
    : tools_(tools),
      callbacks_(std::move(callbacks)),
      settle_(Deadline::calling<&RouteWatch::settled>(tools.deadlines, *this)),
      slow_(Deadline::calling<&RouteWatch::slowTimerFired>(tools.deadlines, *this)) {}

void RouteWatch::listen() {
  if (!slow_.isSet()) slow_.set(tools_.now + tools_.options.waitingRetryPeriod);
  if (isListening()) return;
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kEpollKey;
  const bool hears =
      events_.subscribe() && epoll_ctl(epoll_, EPOLL_CTL_ADD, events_.descriptor(), &event) == 0;
  // Otherwise again with the next request; until then each of them, and the slow timer, looks by itself.
  if (!hears) events_.unsubscribe();
  if (std::exchange(isDeaf_, !hears) && hears) noteChange();
}

void RouteWatch::takeEvents() {
  if (events_.takeAll()) noteChange();
}

void RouteWatch::takeEventsOrSuspectSome() {
  takeEvents();
  if (!isDeaf_) return;
  ++changes_;  // for all that is known
  listen();
}

void RouteWatch::noteChange() {
  ++changes_;
  settleSoon();
}

void RouteWatch::settleSoon() {
  if (!settle_.isSet()) settle_.set(tools_.now + kSettleTime);
}

void RouteWatch::slowTimerFired() {
  if (!callbacks_.isNeeded()) {
    events_.unsubscribe();
    return;
  }
  slow_.set(tools_.now + tools_.options.waitingRetryPeriod);
  if (isDeaf_) noteChange();
  callbacks_.slowTimer();
}

}  // namespace kyt
