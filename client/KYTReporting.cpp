#include "kytreporting/KYTReporting.h"

#include <cstdlib>
#include <utility>

#include "client/Connection.h"
#include "client/LastWord.h"
#include "client/Loop.h"
#include "client/Output.h"
#include "client/Session.h"

namespace kyt {

using client::Answer;
using client::Call;
using client::Command;
using client::Method;

namespace {

constexpr char kSocketPath[] = "/run/kytreportingd/com.vantu.kytreportingd";

// As a file URL: everything but unreserved characters and slashes is percent-encoded.
std::string fileURL(const std::string& path) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string url = "file://";
  for (const char c : path) {
    const auto byte = static_cast<unsigned char>(c);
    const bool plain = (byte >= 'a' && byte <= 'z') || (byte >= 'A' && byte <= 'Z') ||
                       (byte >= '0' && byte <= '9') || byte == '/' || byte == '-' || byte == '.' ||
                       byte == '_' || byte == '~';
    if (plain) {
      url += c;
    } else {
      url += '%';
      url += kDigits[byte >> 4];
      url += kDigits[byte & 15];
    }
  }
  return url;
}

bool inRange(uint32_t category, uint32_t type) {
  return (category | type) <= UINT16_MAX;
}

void chooseSocket(KYTReporting::Options& options) {
  if (!options.socketPath.empty()) return;
  const char* chosen = secure_getenv("KYTREPORTING_SOCKET");
  options.socketPath = chosen != nullptr && *chosen != '\0' ? chosen : kSocketPath;
}

std::unique_ptr<Command> command(Call call) {
  return std::make_unique<Command>(std::move(call));
}

std::shared_ptr<client::Session> makeSession(KYTReporting::Options options, bool single,
                                             const KYTReporting::Behaviour& behaviour = {}) {
  chooseSocket(options);
  client::Loop* loop = client::Loop::current();
  auto session = std::make_shared<client::Session>(std::move(options), loop, single, behaviour);
  return session;
}

}  // namespace

std::optional<linux_client::LastSocket> client::lastWord(KYTReporting::Options options, uint32_t category,
                                                         uint32_t type, std::optional<Dictionary> payload) {
  if (!inRange(category, type) || KYTReporting::checkSessionInfo(options.sessionInfo)) return std::nullopt;
  chooseSocket(options);
  Call call{Method::sendMessageWithSessionInfo,
            SingleMessageArguments{std::move(options.sessionInfo), std::move(options.userInfo),
                                   static_cast<uint16_t>(category), static_cast<uint16_t>(type),
                                   std::move(payload)}};
  Output output;
  output.restart(Connection::opening());
  if (!output.call(call, false)) return std::nullopt;
  return linux_client::LastSocket::make(options.socketPath, std::string(output.waitingBytes()));
}

class KYTReporting::Implementation {
 public:
  Implementation(std::shared_ptr<client::Session> made, std::chrono::milliseconds finishing)
      : session(std::move(made)), finishOnDestruction(finishing) {}
  const std::shared_ptr<client::Session> session;
  const std::chrono::milliseconds finishOnDestruction;
};

KYTReporting::KYTReporting(std::shared_ptr<Implementation> implementation)
    : implementation_(std::move(implementation)) {}

std::unique_ptr<KYTReporting> KYTReporting::open(Options options) {
  return open(std::move(options), Behaviour());
}

std::unique_ptr<KYTReporting> KYTReporting::open(Options options, const Behaviour& behaviour) {
  auto session = makeSession(std::move(options), false, behaviour);
  client::Loop::current()->add(session);
  return std::unique_ptr<KYTReporting>(
      new KYTReporting(std::make_shared<Implementation>(std::move(session), behaviour.finishOnDestruction)));
}

KYTReporting::~KYTReporting() {
  if (implementation_->finishOnDestruction.count() > 0) finish(implementation_->finishOnDestruction);
  implementation_->session->close();
}

void KYTReporting::enqueue(std::unique_ptr<client::Command> given) {
  // Held here: the command's completion may destroy this object before the call below has returned.
  const std::shared_ptr<client::Session> session = implementation_->session;
  session->enqueueCommand(std::move(given));
}

void KYTReporting::startConfiguration(StatesCompletion completion) {
  enqueue(command({Method::startConfigWithCompletionHandler, {}, std::move(completion)}));
}

void KYTReporting::fetchStates(std::optional<Dictionary> userInfo, StatesCompletion completion) {
  enqueue(command({Method::fetchStatesWithUserInfo, client::UserInfoArguments{std::move(userInfo)},
                   std::move(completion)}));
}

void KYTReporting::fetchDisplayURL(TextCompletion completion) {
  enqueue(command({Method::fetchDisplayURL, {}, std::move(completion)}));
}

bool KYTReporting::sendMessage(uint32_t category, uint32_t type, Dictionary payload, uint32_t flag) {
  return implementation_->session->enqueueMessage(category, type, std::move(payload), flag);
}

std::optional<Error> KYTReporting::trySendMessage(uint32_t category, uint32_t type, Dictionary payload,
                                                  uint32_t flag) {
  client::Session& session = *implementation_->session;
  if (session.enqueueMessage(category, type, std::move(payload), flag)) return std::nullopt;
  if (!inRange(category, type))
    return client::clientError(ClientError::invalid, client::outOfRange(category, type));
  if (session.refuses()) return session.refusal();
  return client::clientError(ClientError::queueFull, "the queue is full");
}

void KYTReporting::sendMessage(uint32_t category, uint32_t type, Dictionary payload, uint32_t flag,
                               ObjectCompletion completion) {
  Answer answer(std::move(completion));
  if (!inRange(category, type)) {
    implementation_->session->countInvalid();
    return answer.fail(ClientError::invalid, client::outOfRange(category, type));
  }
  client::MessageArguments message{static_cast<uint16_t>(category), static_cast<uint16_t>(type), flag,
                                   std::move(payload)};
  enqueue(command({Method::sendMessageWithDictionary, std::move(message), std::move(answer)}));
}

void KYTReporting::flush(ObjectCompletion completion) {
  enqueue(command({Method::flushMessagesWithCompletion, {}, std::move(completion)}));
}

void KYTReporting::updateSharedData(Dictionary entries) {
  enqueue(command({Method::updateSharedDataWithDictionary, client::SharedDataArguments{std::move(entries)}}));
}

void KYTReporting::updateSharedData(String key, Value value) {
  enqueue(command(
      {Method::updateSharedDataForKey, client::SharedDataForKeyArguments{std::move(key), std::move(value)}}));
}

void KYTReporting::setDigestKey(Data key, int32_t algorithm) {
  enqueue(command({Method::setDigestKey, client::DigestKeyArguments{std::move(key), algorithm}}));
}

void KYTReporting::uploadFile(const std::string& path, SuccessCompletion completion) {
  Answer answer(std::move(completion));
  const std::string absolute = linux_client::absolutePath(path);
  const linux_client::OpenedFile opened = linux_client::openFileAndFolder(absolute);
  if (opened.file < 0) return answer.fail(ClientError::invalid, opened.error);
  client::UploadFileArguments upload{fileURL(absolute), {}};
  for (const int descriptor : {opened.file, opened.folder})
    upload.extension.emplace_back(descriptor, linux_client::closeDescriptor);
  enqueue(command({Method::uploadFileAtPath, std::move(upload), std::move(answer)}));
}

void KYTReporting::uploadLogData(Array logData, SuccessCompletion completion) {
  enqueue(command(
      {Method::uploadLogData, client::UploadLogDataArguments{std::move(logData)}, std::move(completion)}));
}

bool KYTReporting::finish(std::chrono::milliseconds timeout) {
  return implementation_->session->finishAndWait(timeout);
}

const char* KYTReporting::nameOf(State state) {
  switch (state) {
    case State::noDaemon:
      return "no-daemon";
    case State::refused:
      return "refused";
    case State::connected:
      return "connected";
    case State::noStorebag:
      return "no-storebag";
    case State::noLiveBackEnd:
      return "no-live-back-end";
    case State::live:
      return "live";
  }
  return "";
}

KYTReporting::State KYTReporting::state() const {
  return implementation_->session->state();
}

std::string KYTReporting::stateReason() const {
  return implementation_->session->stateReason();
}

KYTReporting::Statistics KYTReporting::statistics() const {
  return implementation_->session->statistics();
}

void KYTReporting::close() {
  implementation_->session->stop();
}

void KYTReporting::closeAll() {
  client::Loop::current()->closeAll();
}

KYTReporting::Statistics KYTReporting::totalStatistics() {
  return client::Loop::current()->totals();
}

void KYTReporting::sendSingleMessage(Options options, uint32_t category, uint32_t type,
                                     std::optional<Dictionary> payload, TextCompletion completion) {
  Answer answer(std::move(completion));
  if (!inRange(category, type)) {
    Statistics refused;
    refused.droppedInvalid = 1;
    client::Loop::current()->addToTotals(refused);
    return answer.fail(ClientError::invalid, client::outOfRange(category, type));
  }
  options.onStateChange = nullptr;  // its context may be gone once the completion has run
  client::SingleMessageArguments message{options.sessionInfo, options.userInfo,
                                         static_cast<uint16_t>(category), static_cast<uint16_t>(type),
                                         std::move(payload)};
  auto session = makeSession(std::move(options), true);
  session->enqueueCommand(
      command({Method::sendMessageWithSessionInfo, std::move(message), std::move(answer)}));
  client::Loop::current()->add(session);
}

}  // namespace kyt
