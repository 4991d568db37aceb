#include "backends/https/PostReply.h"

#include <cstdio>

#include "platform/Platform.h"
#include "platform/base/Clock.h"
#include "platform/base/Departures.h"
#include "platform/base/UserBudget.h"
#include "platform/objects/Keys.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

Reason fateBy(const Error& error) {
  switch (error.code) {
    case kURLErrorWaitingTooMuch:
      return Reason::postDisplaced;
    case kURLErrorOutstandingTooMuch:
      return Reason::postWithoutRoom;
    case kURLErrorCancelled:
      return Reason::postCancelled;
    default:
      return Reason::postFailed;
  }
}

}  // namespace

void PostReply::operator()(std::optional<Data>, std::optional<URLResponse> response,
                           std::optional<Error> error) {
  const ClientScope scope(account ? std::optional(account->user()) : std::nullopt);
  tellOwner(response, error);
  const int status = response ? response->status : 0;
  standing.ended(static_cast<uint32_t>(platform.clock.timeOfDay().asSeconds()), status);
  if (const auto posted = events.events();
      posted != nullptr && !posted->areKept() && posted->watchedPost() != nullptr)
    posted->watchedPost()->answered(status);
  const bool redirected = status >= 300 && status <= 399;
  const bool refused = status >= 400 && status <= 599;  // also by a reply that broke off
  if (redirected) {
    tell(status, Reason::requestRedirected, Reason::postRedirected);
  } else if (refused) {
    tell(status, Reason::requestRefused, Reason::postRefused);
  } else if (error) {
    lose(Reason::requestFailed, fateBy(*error));
  } else {
    events.delivered();
  }
  if (error)
    platform.log.error("HTTPSPostBackend(postJsonMessage): post error: %s",
                       error->localizedDescription.c_str());
  if (status >= 500 && status <= 599) error = disable(status);
  if (completion) completion(Value(), std::move(error));
}

// The programs' parts of a message are as large as they have events.
void PostReply::tellOwner(const std::optional<URLResponse>& response,
                          const std::optional<Error>& error) const {
  const std::shared_ptr<const BookedEvents> posted = events.events();
  if (posted == nullptr || posted->areKept() || !mayHaveLeft(response, error))
    return;  // the outbox tells of its own
  for (const auto& [program, count] : posted->programs())
    platform.departures.add({.program = program,
                             .server = serverOf(address),
                             .kind = DepartureKind::events,
                             .events = count,
                             .bytes = bytes * count / posted->size(),
                             .isAnswered = response.has_value()});
}

void PostReply::lose(Reason request, Reason fate) {
  platform.counters.add(request);
  events.dropped(fate);
}

// What switches the back end off has a line of its own.
void PostReply::tell(int status, Reason request, Reason fate) {
  const size_t lost = events.size();
  lose(request, fate);
  const bool mayLog = platform.counters.addAndMayLog(fate, platform.clock.monotonic(), 0);
  if (mayLog && status < 500)
    platform.log.normal("postJSONMessage: %s answered with status %d, %zu events of backend %s are lost",
                        address.c_str(), status, lost, name.c_str());
}

Error PostReply::disable(int status) const {
  char text[256];
  std::snprintf(text, sizeof text, "backend %s disabled by server %d return code", name.c_str(), status);
  platform.log.normal("postJSONMessage: %s", text);
  if (const auto alive = backend.lock()) alive->setState(kBackendStateDisabled, StateRule::server, status);
  return Error{kKYTReportingErrorDomain, status, text};
}

}  // namespace kyt
