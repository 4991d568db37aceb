// What the reply to a post means: what is counted and logged, and whether it switches its back end off. It may come when
// its back end is gone. Called once, on the URL session's queue.
#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "backend/KYTReportingBackend.h"
#include "platform/URLSession.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"

namespace kyt {

// The part that a post has in how its back end stands: in flight from its making to its answer, or its loss.
class PostStanding {
 public:
  PostStanding(std::shared_ptr<BackEndStanding> standing, size_t events)
      : standing_(std::move(standing)), events_(events) {
    standing_->beginPost(events_);
  }
  PostStanding(PostStanding&& other) noexcept = default;
  PostStanding& operator=(PostStanding&&) = delete;
  ~PostStanding() {
    if (standing_) standing_->endPost(events_);
  }
  void ended(uint32_t now, int status) const { standing_->posted(now, status); }

 private:
  std::shared_ptr<BackEndStanding> standing_;
  size_t events_;
};

struct PostReply {
  std::weak_ptr<KYTReportingBackend> backend;
  PostStanding standing;
  Platform& platform;
  String name;
  FlushCompletion completion;
  PostedEvents events;  // that are delivered or lost with the message
  std::string address;  // without a name and password, and without what a "?" begins
  std::shared_ptr<UserAccount> account;
  size_t bytes = 0;  // of the body

  void operator()(std::optional<Data> data, std::optional<URLResponse> response, std::optional<Error> error);

 private:
  void tellOwner(const std::optional<URLResponse>& response, const std::optional<Error>& error) const;
  void lose(Reason request, Reason fate);
  void tell(int status, Reason request, Reason fate);
  [[nodiscard]] Error disable(int status) const;
};

}  // namespace kyt
