#include "daemon/WatchedEvents.h"

#include <limits>

#include "config/ClientTypes.h"

namespace kyt {

namespace {

bool isNumberUpTo(const Value& value, uint64_t most) {
  const Value::Kind kind = value.kind();
  return (kind == Value::Kind::integer || kind == Value::Kind::unsignedInteger) &&
         value.longLongValue() >= 0 && static_cast<uint64_t>(value.longLongValue()) <= most;
}

const char* fateOf(const PassedEvent& event) {
  if (event.dropped) return reasonName(*event.dropped);
  return event.isKept ? "in-outbox" : "delivered";
}

}  // namespace

// A key that nobody knows is refused: who misspells one would watch what he did not mean to.
const char* readWatchFilter(const Dictionary& wanted, WatchFilter& filter) {
  for (const auto& entry : wanted) {
    const std::string_view key = entry.key.view();
    const Value& value = entry.value;
    if (key == "user") {
      if (!isNumberUpTo(value, std::numeric_limits<uint32_t>::max()))
        return "\"user\" must be a user's number";
      filter.user = static_cast<uint32_t>(value.longLongValue());
    } else if (key == "client") {
      if (value.string() == nullptr) return "\"client\" must be a text";
      filter.client = std::string(cutName(value.string()->view()));
    } else if (key == "category") {
      if (!isNumberUpTo(value, 65535)) return "\"category\" must be a number up to 65535";
      filter.category = static_cast<uint16_t>(value.longLongValue());
    } else if (key == "bodies") {
      if (value.kind() != Value::Kind::boolean) return "\"bodies\" must be a boolean";
      filter.bodies = value.boolValue();
    } else {
      return "the filter's keys are \"user\", \"client\", \"category\" and \"bodies\"";
    }
  }
  return nullptr;
}

const char* readOutboxFilter(const Dictionary& wanted, OutboxFilter& filter) {
  for (const auto& entry : wanted) {
    const std::string_view key = entry.key.view();
    const Value& value = entry.value;
    if (key == "server") {
      if (value.string() == nullptr) return "\"server\" must be a text";
      filter.server = value.string()->str();
    } else if (key == "user") {
      if (!isNumberUpTo(value, std::numeric_limits<uint32_t>::max()))
        return "\"user\" must be a user's number";
      filter.user = static_cast<uint32_t>(value.longLongValue());
    } else {
      return "the filter's keys are \"server\" and \"user\"";
    }
  }
  return nullptr;
}

Dictionary passedView(const PassedEvent& event, bool bodies) {
  Dictionary view{{"time", event.seconds},
                  {"user", event.program.user},
                  {"clientType", event.program.clientType},
                  {"family", clientTypeShortCode(event.program.clientType)},
                  {"client", event.program.clientName},
                  {"service", event.program.service},
                  {"backEnd", event.backEnd},
                  {"internal", event.isInternal},
                  {"fate", fateOf(event)}};
  if (event.kind.category >= 0) view.set("category", event.kind.category);
  if (event.kind.type >= 0) view.set("type", event.kind.type);
  if (event.rule[0] != '\0') view.set("rule", event.rule);
  if (event.post == nullptr) return view;
  view.set("post", event.post->number());
  view.set("server", event.post->server());
  view.set("status", event.post->status());
  if (!bodies || !event.isFirstOfPost) return view;
  view.set("bodyBytes", static_cast<uint64_t>(event.post->bodyBytes()));
  view.set("body", event.body != nullptr ? event.body->text() : std::string());
  return view;
}

}  // namespace kyt
