#include <utility>

#include "kytreporting/FakeDaemon.h"

namespace kyt::testing {

namespace {

void setUserInfo(Dictionary& line, const std::optional<Dictionary>& userInfo) {
  if (userInfo) line.set("userInfo", *userInfo);
}

void describeMessage(Dictionary& line, const Event& event) {
  line.set("category", static_cast<unsigned>(event.category));
  line.set("type", static_cast<unsigned>(event.type));
  line.set("flag", event.flag);
  line.set("payload", event.payload);
  if (event.dropped) line.set("dropped", true);
  if (!event.single) return;
  line.set("sessionInfo", event.sessionInfo);
  setUserInfo(line, event.userInfo);
}

}  // namespace

const char* nameOf(Kind kind) {
  switch (kind) {
    case Kind::session:
      return "session";
    case Kind::configuration:
      return "configuration";
    case Kind::states:
      return "states";
    case Kind::message:
      return "message";
    case Kind::flush:
      return "flush";
    case Kind::sharedData:
      return "sharedData";
    case Kind::digestKey:
      return "digestKey";
    case Kind::file:
      return "file";
    case Kind::logData:
      return "logData";
    case Kind::finish:
      return "finish";
    case Kind::end:
      return "end";
  }
  return "";
}

Dictionary Event::dictionary() const {
  Dictionary line{{"event", nameOf(kind)}, {"connection", connection}};
  switch (kind) {
    case Kind::session:
      line.set("sessionInfo", sessionInfo);
      setUserInfo(line, userInfo);
      line.set("aggregates", aggregates);
      break;
    case Kind::states:
      setUserInfo(line, userInfo);
      break;
    case Kind::message:
      describeMessage(line, *this);
      break;
    case Kind::sharedData:
      line.set("entries", payload);
      break;
    case Kind::digestKey:
      line.set("key", text);
      break;
    case Kind::file:
      line.set("url", text);
      break;
    case Kind::logData:
      if (const Value* data = payload.find("logData")) line.set("logData", *data);
      break;
    case Kind::configuration:
    case Kind::flush:
    case Kind::finish:
    case Kind::end:
      break;
  }
  return line;
}

}  // namespace kyt::testing
