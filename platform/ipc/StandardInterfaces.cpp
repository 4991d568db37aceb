#include "platform/ipc/StandardInterfaces.h"

#include "platform/base/Counters.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/CallReply.h"

namespace kyt {
namespace {

using Peer = MessageDispatcher::Peer;

CallReply replyTo(const Message& message, const Peer& peer) {
  return {message, peer.output};
}

bool isStandardInterface(std::string_view interface) {
  return interface == wire::kPeerInterface || interface == wire::kIntrospectableInterface ||
         interface == wire::kPropertiesInterface || interface == wire::kBusName;
}

// The child of a folder on the way to the session's object ("/" has "com"), or nothing when the path is no
// such folder.
std::string_view childOf(std::string_view path) {
  std::string_view rest = wire::kSessionPath;
  if (path == "/") {
    rest.remove_prefix(1);
  } else {
    if (path.size() >= rest.size() || rest.substr(0, path.size()) != path || rest[path.size()] != '/')
      return {};
    rest.remove_prefix(path.size() + 1);
  }
  return rest.substr(0, rest.find('/'));
}

constexpr const char* kDocumentType =
    "<!DOCTYPE node PUBLIC \"-//freedesktop//DTD D-BUS Object Introspection 1.0//EN\"\n"
    " \"http://www.freedesktop.org/standards/dbus/1.0/introspect.dtd\">\n";

}  // namespace

std::string introspectionOf(std::string_view text) {
  const size_t begin = text.find("<node ");
  const std::string_view end = "</interface>";
  std::string_view rest = text.substr(begin, text.find(end, begin) + end.size() - begin);
  std::string out = kDocumentType;
  for (size_t comment = rest.find("<!--"); comment != std::string_view::npos; comment = rest.find("<!--")) {
    out.append(rest.substr(0, comment));
    rest.remove_prefix(rest.find("-->", comment) + 3);
  }
  return out.append(rest).append("\n</node>\n");
}

const char* StandardInterfaces::handle(const Message& message, const Peer& peer) const {
  bool handled = false;
  if (const char* problem = handleKnown(message, peer, handled)) return problem;
  if (handled) return nullptr;

  const bool objectExists =
      message.path == wire::kSessionPath || !childOf(message.path).empty() || message.path == wire::kBusPath;
  if (!objectExists) return refuse(message, peer, wire::kErrorUnknownObject, "There is no such object");
  if (message.interface.empty() || isStandardInterface(message.interface) ||
      (isOurs(message.interface) && message.path == wire::kSessionPath)) {
    return refuse(message, peer, wire::kErrorUnknownMethod, "There is no such method");
  }
  return refuse(message, peer, wire::kErrorUnknownInterface, "The object has no such interface");
}

const char* StandardInterfaces::refuse(const Message& message, const Peer& peer, std::string_view error,
                                       std::string_view text) {
  if (!validateBody(message)) return "the body is malformed";
  replyTo(message, peer).error(error, text);
  return nullptr;
}

const char* StandardInterfaces::handleKnown(const Message& message, const Peer& peer, bool& handled) const {
  const auto is = [&](std::string_view interface, std::string_view member) {
    return message.member == member && (message.interface == interface || message.interface.empty());
  };
  const auto answerString = [&](std::string_view text) -> const char* {
    if (!message.body.empty()) {
      return refuse(message, peer, wire::kErrorInvalidArgs, "the method takes no arguments");
    }
    replyTo(message, peer).answer("s", [&](MessageWriter& out) { out.writeString(text); });
    return nullptr;
  };
  handled = true;
  if (is(wire::kBusName, "Hello")) return answerString(":1." + std::to_string(peer.connectionNumber));
  if (is(wire::kPeerInterface, "GetMachineId")) return answerString(options_.machineId);
  if (is(wire::kPeerInterface, "Ping")) {
    if (!message.body.empty()) {
      return refuse(message, peer, wire::kErrorInvalidArgs, "the method takes no arguments");
    }
    replyTo(message, peer).answerNothing();
    return nullptr;
  }
  if (is(wire::kIntrospectableInterface, "Introspect") &&
      (message.path == wire::kSessionPath || !childOf(message.path).empty())) {
    return introspect(message, peer);
  }
  if (is(wire::kPropertiesInterface, "GetAll") && message.path == wire::kSessionPath)
    return getAll(message, peer);
  handled = false;
  return nullptr;
}

const char* StandardInterfaces::introspect(const Message& message, const Peer& peer) const {
  if (!message.body.empty())
    return refuse(message, peer, wire::kErrorInvalidArgs, "the method takes no arguments");
  replyTo(message, peer).answer("s", [&](MessageWriter& out) {
    if (message.path == wire::kSessionPath) return out.writeString(options_.introspection);
    std::string text = kDocumentType;
    text.append("<node>\n  <node name=\"").append(childOf(message.path)).append("\"/>\n</node>\n");
    out.writeString(text);
  });
  return nullptr;
}

const char* StandardInterfaces::getAll(const Message& message, const Peer& peer) const {
  BodyReader in(message);
  std::string_view interface;
  if (in.hasSignature("s")) in.readStringView(interface);
  switch (in.finish()) {
    case BodyStatus::malformed:
      return in.problem();
    case BodyStatus::invalidArguments:
      counters_.add(Reason::invalidArguments);
      replyTo(message, peer).error(wire::kErrorInvalidArgs, in.problem());
      return nullptr;
    case BodyStatus::ok:
      break;
  }
  if (!interface.empty() && interface != options_.interface && !isStandardInterface(interface)) {
    replyTo(message, peer).error(wire::kErrorUnknownInterface, "The object has no such interface");
  } else {
    replyTo(message, peer).answer("a{sv}", [](MessageWriter& out) { out.writeEmptyDictionary(); });
  }
  return nullptr;
}

}  // namespace kyt
