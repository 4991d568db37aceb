// What the reply to a post means: what is counted and logged, and whether it switches its back end off. It may come when
// its back end is gone. Called once, on the URL session's queue.
#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>

#include "backend/KYTReportingBackend.h"
#include "platform/URLSession.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"

namespace kyt {

struct PostReply {
  std::weak_ptr<KYTReportingBackend> backend;
  Platform& platform;
  String name;
  FlushCompletion completion;
  PostedEvents events;  // that are delivered or lost with the message
  std::string address;  // without what a "?" begins
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
