// One post on its way from the back end, which decided on it, to the poster: it holds all that is needed, and nothing of the
// back end or its session, so it may run on any thread. Once. Used by HTTPSPostBackend.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "backend/ReportingSessionConnectivityInterface.h"
#include "backends/https/PostReply.h"
#include "backends/https/PostRequest.h"
#include "platform/objects/Value.h"

namespace kyt {

struct OutgoingPost {
  PostRequest post;
  String url;  // as the storebag gives it
  std::optional<EventMap> eventMap;
  std::shared_ptr<ReportingSessionConnectivityInterface> poster;
  PostReply reply;

  void send(std::string json) &&;
};

}  // namespace kyt
