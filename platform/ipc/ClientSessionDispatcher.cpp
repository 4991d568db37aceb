#include "platform/ipc/ClientSessionDispatcher.h"

#include <array>
#include <optional>
#include <utility>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/ClientSessionReplies.h"
#include "platform/ipc/Contract.h"
#include "platform/ipc/InterfaceDescription.h"

namespace kyt {
namespace {

using Peer = ClientSessionDispatcher::Peer;
using wire::Method;

// Each operation reads its arguments and, when they are whole, calls the session. A call of an operation
// without results is answered when the operation has returned.

CallReply replyTo(const Message& message, const Peer& peer) {
  return {message, peer.output};
}

// Replies with what `body` writes in the form that the contract has for the method.
template <typename Body>
void answer(CallReply& reply, Method method, Body&& body) {
  reply.answer(wire::contractOf(method).reply, std::forward<Body>(body));
}

void setSessionInfo(const Message& message, const Peer& peer, BodyReader& in) {
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo;
  Value frameworks;
  bool aggregation = false;
  in.readDictionary(sessionInfo);
  in.readOptionalDictionary(userInfo);
  in.readOptionalValue(frameworks);
  in.readBoolean(aggregation);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  peer.session.setSessionInfo(std::move(sessionInfo), std::move(userInfo), std::move(frameworks),
                              aggregation);
  reply.answerNothing();
}

StatesReply statesReply(Method method, const Message& message, const Peer& peer) {
  return [method, reply = replyTo(message, peer)](std::optional<Array> states) mutable {
    answer(reply, method, [&](MessageWriter& out) { out.writeOptionalStrings(states); });
  };
}

void startConfig(const Message& message, const Peer& peer, BodyReader& in) {
  if (in.finish() == BodyStatus::ok)
    peer.session.startConfigWithCompletionHandler(
        statesReply(Method::startConfigWithCompletionHandler, message, peer));
}

void fetchStates(const Message& message, const Peer& peer, BodyReader& in) {
  std::optional<Dictionary> userInfo;
  in.readOptionalDictionary(userInfo);
  if (in.finish() != BodyStatus::ok) return;
  peer.session.fetchStatesWithUserInfo(std::move(userInfo),
                                       statesReply(Method::fetchStatesWithUserInfo, message, peer));
}

StringReply stringReply(Method method, const Message& message, const Peer& peer) {
  return [method, reply = replyTo(message, peer)](String text) mutable {
    answer(reply, method, [&](MessageWriter& out) { out.writeString(text); });
  };
}

void fetchDisplayURL(const Message& message, const Peer& peer, BodyReader& in) {
  if (in.finish() == BodyStatus::ok)
    peer.session.fetchDisplayURL(stringReply(Method::fetchDisplayURL, message, peer));
}

void sendMessageWithDictionary(const Message& message, const Peer& peer, BodyReader& in) {
  Dictionary dictionary;
  in.readDictionary(dictionary);
  if (in.finish() != BodyStatus::ok) return;
  ObjectReply objectReply;
  if (message.expectsReply()) {
    objectReply = [reply = replyTo(message, peer)](const Value& object) mutable {
      answer(reply, Method::sendMessageWithDictionary,
             [&](MessageWriter& out) { out.writeOptionalValue(object); });
    };
  }
  peer.session.sendMessageWithDictionary(std::move(dictionary), std::move(objectReply));
}

void flushMessages(const Message& message, const Peer& peer, BodyReader& in) {
  if (in.finish() != BodyStatus::ok) return;
  peer.session.flushMessagesWithCompletion(
      [reply = replyTo(message, peer)](const Value& result, const std::optional<Error>& error) mutable {
        answer(reply, Method::flushMessagesWithCompletion, [&](MessageWriter& out) {
          out.writeOptionalValue(result);
          out.writeOptionalError(error);
        });
      });
}

void finishSessionGracefully(const Message& message, const Peer& peer, BodyReader& in) {
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  peer.session.finishSessionGracefully();
  reply.answerNothing();
}

// None when the indexes name no two descriptors of the message.
bool takeExtension(const std::vector<uint32_t>& indexes, const Peer& peer,
                   std::optional<FileExtension>& extension) {
  const std::span<Descriptor> descriptors = peer.descriptors;
  if (indexes.empty()) return true;
  if (indexes.size() != 2 || indexes[0] == indexes[1]) return false;
  if (indexes[0] >= descriptors.size() || indexes[1] >= descriptors.size()) return false;
  PeerIdentity client;
  if (peer.stream != nullptr) {
    PeerCredentials known = peer.stream->peer();
    client = {known.uid, known.gid, std::move(known.groups)};
  }
  extension = FileExtension{std::move(descriptors[indexes[0]]), std::move(descriptors[indexes[1]]),
                            std::move(client)};
  return true;
}

void uploadFile(const Message& message, const Peer& peer, BodyReader& in) {
  String fileURL, token;
  std::vector<uint32_t> indexes;
  in.readString(fileURL);
  in.readString(token);
  in.readDescriptorIndexes(indexes);
  if (in.finish() != BodyStatus::ok) return;
  std::optional<FileExtension> extension;
  if (!takeExtension(indexes, peer, extension)) {
    in.refuse("the extension is not two descriptors of the message");
    return;
  }
  peer.session.uploadFileAtPath(std::move(fileURL), std::move(token), std::move(extension),
                                [reply = replyTo(message, peer)](bool success) mutable {
                                  answer(reply, Method::uploadFileAtPath,
                                         [&](MessageWriter& out) { out.writeBoolean(success); });
                                });
}

void uploadLogData(const Message& message, const Peer& peer, BodyReader& in) {
  Array logData;
  in.readArray(logData);
  if (in.finish() != BodyStatus::ok) return;
  peer.session.uploadLogData(
      std::move(logData),
      [reply = replyTo(message, peer)](bool success, const std::optional<Error>& error) mutable {
        answer(reply, Method::uploadLogData, [&](MessageWriter& out) {
          out.writeBoolean(success);
          out.writeOptionalError(error);
        });
      });
}

void sendMessageWithSessionInfo(const Message& message, const Peer& peer, BodyReader& in) {
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo, payload;
  uint16_t category = 0, type = 0;
  in.readDictionary(sessionInfo);
  in.readOptionalDictionary(userInfo);
  in.readUInt16(category);
  in.readUInt16(type);
  in.readOptionalDictionary(payload);
  if (in.finish() != BodyStatus::ok) return;
  peer.session.sendMessageWithSessionInfo(std::move(sessionInfo), std::move(userInfo), category, type,
                                          std::move(payload),
                                          stringReply(Method::sendMessageWithSessionInfo, message, peer));
}

void updateSharedData(const Message& message, const Peer& peer, BodyReader& in) {
  Dictionary sharedData;
  in.readDictionary(sharedData);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  peer.session.updateSharedDataWithDictionary(std::move(sharedData));
  reply.answerNothing();
}

void updateSharedDataForKey(const Message& message, const Peer& peer, BodyReader& in) {
  String key;
  Value value;
  in.readString(key);
  in.readOptionalValue(value);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  peer.session.updateSharedDataForKey(std::move(key), std::move(value));
  reply.answerNothing();
}

void setDigestKey(const Message& message, const Peer& peer, BodyReader& in) {
  Data key;
  int32_t algorithm = 0;
  in.readData(key);
  in.readInt32(algorithm);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  peer.session.setDigestKey(std::move(key), algorithm);
  reply.answerNothing();
}

struct Operation {
  Method method;
  void (*call)(const Message&, const Peer&, BodyReader&);
};

constexpr std::array kOperations{
    Operation{Method::sendMessageWithDictionary, sendMessageWithDictionary},
    Operation{Method::setSessionInfo, setSessionInfo},
    Operation{Method::startConfigWithCompletionHandler, startConfig},
    Operation{Method::fetchStatesWithUserInfo, fetchStates},
    Operation{Method::fetchDisplayURL, fetchDisplayURL},
    Operation{Method::flushMessagesWithCompletion, flushMessages},
    Operation{Method::finishSessionGracefully, finishSessionGracefully},
    Operation{Method::uploadFileAtPath, uploadFile},
    Operation{Method::uploadLogData, uploadLogData},
    Operation{Method::sendMessageWithSessionInfo, sendMessageWithSessionInfo},
    Operation{Method::updateSharedDataWithDictionary, updateSharedData},
    Operation{Method::updateSharedDataForKey, updateSharedDataForKey},
    Operation{Method::setDigestKey, setDigestKey},
};
static_assert(wire::standsInOrder(kOperations));

const wire::MethodContract* methodNamed(std::string_view member) {
  for (const wire::MethodContract& row : wire::kMethods) {
    if (row.member == member) return &row;
  }
  return nullptr;
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

std::string clientSessionIntrospection() {
  const std::string_view text = interfaceDescription();
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

ClientSessionDispatcher::ClientSessionDispatcher(Counters& counters, ClientSessionDispatcherOptions options)
    : counters_(counters), options_(std::move(options)) {}

const char* ClientSessionDispatcher::handle(const Message& message, const Peer& peer) const {
  if (message.type == wire::MessageType::methodCall) return handleCall(message, peer);
  // The daemon calls its client one way only, so nobody waits for replies, and there is no signal it knows.
  return validateBody(message) ? nullptr : "the body is malformed";
}

const char* ClientSessionDispatcher::handleCall(const Message& message, const Peer& peer) const {
  const bool ours = message.interface == wire::kSessionInterface || message.interface.empty();
  const wire::MethodContract* method = ours ? methodNamed(message.member) : nullptr;
  if (method != nullptr && message.path == wire::kSessionPath) {
    BodyReader in(message);
    if (in.hasSignature(method->signature))
      kOperations[static_cast<size_t>(method->method)].call(message, peer, in);
    switch (in.finish()) {
      case BodyStatus::ok:
        return nullptr;
      case BodyStatus::malformed:
        return in.problem();
      case BodyStatus::invalidArguments:
        counters_.add(Reason::invalidArguments);
        replyTo(message, peer).error(wire::kErrorInvalidArgs, in.problem());
        return nullptr;
    }
  }
  bool handled = false;
  if (const char* problem = handleStandard(message, peer, handled)) return problem;
  if (handled) return nullptr;

  const bool objectExists =
      message.path == wire::kSessionPath || !childOf(message.path).empty() || message.path == wire::kBusPath;
  if (!objectExists) return refuse(message, peer, wire::kErrorUnknownObject, "There is no such object");
  if (message.interface.empty() || isStandardInterface(message.interface) ||
      (ours && message.path == wire::kSessionPath)) {
    return refuse(message, peer, wire::kErrorUnknownMethod, "There is no such method");
  }
  return refuse(message, peer, wire::kErrorUnknownInterface, "The object has no such interface");
}

const char* ClientSessionDispatcher::refuse(const Message& message, const Peer& peer, std::string_view error,
                                            std::string_view text) const {
  if (!validateBody(message)) return "the body is malformed";
  replyTo(message, peer).error(error, text);
  return nullptr;
}

const char* ClientSessionDispatcher::handleStandard(const Message& message, const Peer& peer,
                                                    bool& handled) const {
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

const char* ClientSessionDispatcher::introspect(const Message& message, const Peer& peer) const {
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

const char* ClientSessionDispatcher::getAll(const Message& message, const Peer& peer) const {
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
  if (!interface.empty() && interface != wire::kSessionInterface && !isStandardInterface(interface)) {
    replyTo(message, peer).error(wire::kErrorUnknownInterface, "The object has no such interface");
  } else {
    replyTo(message, peer).answer("a{sv}", [](MessageWriter& out) { out.writeEmptyDictionary(); });
  }
  return nullptr;
}

}  // namespace kyt
