#include "kytreporting/KYTReporting.h"

#include <cstdlib>
#include <utility>

#include "client/Loop.h"
#include "client/Session.h"

namespace kyt {

using client::Command;
using Kind = client::Command::Kind;

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

// False, and its completion told, when a number is out of range.
bool setMessage(Command& command, uint32_t category, uint32_t type) {
  if ((category | type) > UINT16_MAX) {
    command.fail(ClientError::invalid, client::outOfRange(category, type));
    return false;
  }
  command.category = static_cast<uint16_t>(category);
  command.type = static_cast<uint16_t>(type);
  return true;
}

void chooseSocket(KYTReporting::Options& options) {
  if (!options.socketPath.empty()) return;
  const char* chosen = secure_getenv("KYTREPORTING_SOCKET");
  options.socketPath = chosen != nullptr && *chosen != '\0' ? chosen : kSocketPath;
}

std::shared_ptr<client::Session> makeSession(KYTReporting::Options options, bool single) {
  chooseSocket(options);
  client::Loop* loop = client::Loop::current();
  auto session = std::make_shared<client::Session>(std::move(options), loop, single);
  return session;
}

}  // namespace

class KYTReporting::Implementation {
 public:
  explicit Implementation(std::shared_ptr<client::Session> made) : session(std::move(made)) {}
  std::shared_ptr<client::Session> session;
};

KYTReporting::KYTReporting(std::shared_ptr<Implementation> implementation)
    : implementation_(std::move(implementation)) {}

std::unique_ptr<KYTReporting> KYTReporting::open(Options options) {
  auto session = makeSession(std::move(options), false);
  client::Loop::current()->add(session);
  return std::unique_ptr<KYTReporting>(
      new KYTReporting(std::make_shared<Implementation>(std::move(session))));
}

KYTReporting::~KYTReporting() {
  implementation_->session->close();
}

void KYTReporting::enqueue(std::unique_ptr<client::Command> command) {
  // Held here: the command's completion may destroy this object before the call below has returned.
  const std::shared_ptr<client::Session> session = implementation_->session;
  session->enqueueCommand(std::move(command));
}

void KYTReporting::startConfiguration(StatesCompletion completion) {
  auto command = std::make_unique<Command>(Kind::startConfiguration);
  command->statesCompletion = std::move(completion);
  enqueue(std::move(command));
}

void KYTReporting::fetchStates(std::optional<Dictionary> userInfo, StatesCompletion completion) {
  auto command = std::make_unique<Command>(Kind::fetchStates);
  command->dictionary = std::move(userInfo);
  command->statesCompletion = std::move(completion);
  enqueue(std::move(command));
}

void KYTReporting::fetchDisplayURL(TextCompletion completion) {
  auto command = std::make_unique<Command>(Kind::fetchDisplayURL);
  command->textCompletion = std::move(completion);
  enqueue(std::move(command));
}

bool KYTReporting::sendMessage(uint32_t category, uint32_t type, Dictionary payload, uint32_t flag) {
  return implementation_->session->enqueueMessage(category, type, std::move(payload), flag);
}

void KYTReporting::sendMessage(uint32_t category, uint32_t type, Dictionary payload, uint32_t flag,
                               ObjectCompletion completion) {
  auto command = std::make_unique<Command>(Kind::messageWithReply);
  command->flag = flag;
  command->dictionary = std::move(payload);
  command->objectCompletion = std::move(completion);
  if (!setMessage(*command, category, type)) return;
  enqueue(std::move(command));
}

void KYTReporting::flush(ObjectCompletion completion) {
  auto command = std::make_unique<Command>(Kind::flush);
  command->objectCompletion = std::move(completion);
  enqueue(std::move(command));
}

void KYTReporting::updateSharedData(Dictionary entries) {
  auto command = std::make_unique<Command>(Kind::updateSharedData);
  command->dictionary = std::move(entries);
  enqueue(std::move(command));
}

void KYTReporting::updateSharedData(String key, Value value) {
  auto command = std::make_unique<Command>(Kind::updateSharedDataForKey);
  command->text = std::move(key);
  command->value = std::move(value);
  enqueue(std::move(command));
}

void KYTReporting::setDigestKey(Data key, int32_t algorithm) {
  auto command = std::make_unique<Command>(Kind::setDigestKey);
  command->data = std::move(key);
  command->algorithm = algorithm;
  enqueue(std::move(command));
}

void KYTReporting::uploadFile(const std::string& path, SuccessCompletion completion) {
  auto command = std::make_unique<Command>(Kind::uploadFile);
  command->successCompletion = std::move(completion);
  const std::string absolute = linux_client::absolutePath(path);
  const linux_client::OpenedFile opened = linux_client::openFileAndFolder(absolute);
  if (opened.file < 0) {
    command->fail(ClientError::invalid, opened.error);
    return;
  }
  command->text = fileURL(absolute);
  command->descriptors = {opened.file, opened.folder};
  enqueue(std::move(command));
}

void KYTReporting::uploadLogData(Array logData, SuccessCompletion completion) {
  auto command = std::make_unique<Command>(Kind::uploadLogData);
  command->array = std::move(logData);
  command->successCompletion = std::move(completion);
  enqueue(std::move(command));
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

void KYTReporting::sendSingleMessage(Options options, uint32_t category, uint32_t type,
                                     std::optional<Dictionary> payload, TextCompletion completion) {
  auto command = std::make_unique<Command>(Kind::singleMessage);
  command->dictionary = std::move(payload);
  command->textCompletion = std::move(completion);
  if (!setMessage(*command, category, type)) return;
  options.onStateChange = nullptr;  // its context may be gone once the completion has run
  auto session = makeSession(std::move(options), true);
  session->enqueueCommand(std::move(command));
  client::Loop::current()->add(session);
}

}  // namespace kyt
