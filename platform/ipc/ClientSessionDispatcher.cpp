#include "platform/ipc/ClientSessionDispatcher.h"

#include <array>
#include <optional>
#include <utility>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/CallReply.h"
#include "platform/ipc/Contract.h"
#include "platform/ipc/InterfaceDescription.h"

namespace kyt {
namespace {

using Peer = MessageDispatcher::Peer;
using wire::Method;

// Each operation reads its arguments and, when they are whole, calls the session. A call of an operation
// without results is answered when the operation has returned.

CallReply replyTo(const Message& message, const Peer& peer) {
  return {message, peer.output};
}

ClientSessionInterface& sessionOf(const Peer& peer) {
  return static_cast<ClientSessionInterface&>(peer.object);
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
  sessionOf(peer).setSessionInfo(std::move(sessionInfo), std::move(userInfo), std::move(frameworks),
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
    sessionOf(peer).startConfigWithCompletionHandler(
        statesReply(Method::startConfigWithCompletionHandler, message, peer));
}

void fetchStates(const Message& message, const Peer& peer, BodyReader& in) {
  std::optional<Dictionary> userInfo;
  in.readOptionalDictionary(userInfo);
  if (in.finish() != BodyStatus::ok) return;
  sessionOf(peer).fetchStatesWithUserInfo(std::move(userInfo),
                                          statesReply(Method::fetchStatesWithUserInfo, message, peer));
}

StringReply stringReply(Method method, const Message& message, const Peer& peer) {
  return [method, reply = replyTo(message, peer)](String text) mutable {
    answer(reply, method, [&](MessageWriter& out) { out.writeString(text); });
  };
}

void fetchDisplayURL(const Message& message, const Peer& peer, BodyReader& in) {
  if (in.finish() == BodyStatus::ok)
    sessionOf(peer).fetchDisplayURL(stringReply(Method::fetchDisplayURL, message, peer));
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
  sessionOf(peer).sendMessageWithDictionary(std::move(dictionary), std::move(objectReply));
}

void flushMessages(const Message& message, const Peer& peer, BodyReader& in) {
  if (in.finish() != BodyStatus::ok) return;
  sessionOf(peer).flushMessagesWithCompletion(
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
  sessionOf(peer).finishSessionGracefully();
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
  sessionOf(peer).uploadFileAtPath(std::move(fileURL), std::move(token), std::move(extension),
                                   [reply = replyTo(message, peer)](bool success) mutable {
                                     answer(reply, Method::uploadFileAtPath,
                                            [&](MessageWriter& out) { out.writeBoolean(success); });
                                   });
}

void uploadLogData(const Message& message, const Peer& peer, BodyReader& in) {
  Array logData;
  in.readArray(logData);
  if (in.finish() != BodyStatus::ok) return;
  sessionOf(peer).uploadLogData(
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
  sessionOf(peer).sendMessageWithSessionInfo(std::move(sessionInfo), std::move(userInfo), category, type,
                                             std::move(payload),
                                             stringReply(Method::sendMessageWithSessionInfo, message, peer));
}

void updateSharedData(const Message& message, const Peer& peer, BodyReader& in) {
  Dictionary sharedData;
  in.readDictionary(sharedData);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  sessionOf(peer).updateSharedDataWithDictionary(std::move(sharedData));
  reply.answerNothing();
}

void updateSharedDataForKey(const Message& message, const Peer& peer, BodyReader& in) {
  String key;
  Value value;
  in.readString(key);
  in.readOptionalValue(value);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  sessionOf(peer).updateSharedDataForKey(std::move(key), std::move(value));
  reply.answerNothing();
}

void setDigestKey(const Message& message, const Peer& peer, BodyReader& in) {
  Data key;
  int32_t algorithm = 0;
  in.readData(key);
  in.readInt32(algorithm);
  if (in.finish() != BodyStatus::ok) return;
  CallReply reply = replyTo(message, peer);
  sessionOf(peer).setDigestKey(std::move(key), algorithm);
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

}  // namespace

std::string clientSessionIntrospection() {
  return introspectionOf(interfaceDescription());
}

ClientSessionDispatcher::ClientSessionDispatcher(Counters& counters, std::string machineId)
    : counters_(counters),
      standard_(counters, {.interface = wire::kSessionInterface,
                           .machineId = std::move(machineId),
                           .introspection = clientSessionIntrospection()}) {}

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
  return standard_.handle(message, peer);
}

}  // namespace kyt
