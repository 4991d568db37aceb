#include "backends/https/OutgoingPost.h"

#include <utility>

#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/Departures.h"

namespace kyt {

void OutgoingPost::send(std::string json) && {
  const std::shared_ptr<const BookedEvents> events = reply.events.events();
  if (WatchedPost* watched = events != nullptr ? events->watchedPost() : nullptr;
      watched != nullptr && poster != nullptr)
    watched->leaves(serverOf(url.view()), json);
  URLRequest request = post.request(url, std::move(json), eventMap);
  // The poster went away with its session: nothing is sent, and the completion is deliberately never called.
  if (poster == nullptr) {
    reply.events.dropped(Reason::postWithoutPoster);
    return;
  }
  request.events = events;
  reply.bytes = request.body.size();
  reply.address = withoutPassword(request.url.substr(0, request.url.find('?')));
  poster->postURLRequestWithCompletionHandler(std::move(request), std::move(reply));
}

}  // namespace kyt
