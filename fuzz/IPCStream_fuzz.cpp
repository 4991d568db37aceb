// The server's stream: a handshake and messages, in pieces, on a stream in memory. The first byte says whether a
// good handshake comes before the input, how the rest is cut, and whether the socket is clients' or administrators'; then the connection must end or go
// on, answer only well-formed messages, and close every descriptor.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include "platform/Entitlements.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/fake/MemoryStream.h"
#include "platform/ipc/AdministrationDispatcher.h"
#include "platform/ipc/AdministrationInterface.h"
#include "platform/ipc/BodyValidator.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/DBusServer.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageReader.h"
#include "platform/queues/Log.h"

namespace {

using namespace kyt;

// Gives back what it can, so that decoded objects are written again.
class EchoingSession final : public ClientSessionInterface {
 public:
  void setSessionInfo(Dictionary, std::optional<Dictionary>, Value, bool) override {}
  void startConfigWithCompletionHandler(StatesReply reply) override { reply(Array{"httppost"}); }
  void fetchStatesWithUserInfo(std::optional<Dictionary>, StatesReply reply) override { reply(std::nullopt); }
  void fetchDisplayURL(StringReply) override {}
  void sendMessageWithDictionary(Dictionary message, ObjectReply reply) override {
    if (reply) reply(std::move(message));
  }
  void flushMessagesWithCompletion(ResultReply reply) override { reply(nullptr, Error{"d", 1, "t"}); }
  void finishSessionGracefully() override {}
  void uploadFileAtPath(String, String, std::optional<FileExtension> extension, SuccessReply reply) override {
    reply(extension.has_value());
  }
  void uploadLogData(Value, SuccessErrorReply reply) override { reply(true, std::nullopt); }
  void sendMessageWithSessionInfo(Dictionary, std::optional<Dictionary>, uint16_t, uint16_t,
                                  std::optional<Dictionary>, StringReply reply) override {
    reply("s");
  }
  void updateSharedDataWithDictionary(Dictionary) override {}
  void updateSharedDataForKey(String key, Value value) override { (void)description(Array{key, value}); }
  void setDigestKey(Data, int32_t) override {}
};

class EmptyWindow final : public AdministrationInterface {
 public:
  const char* refusal() const override { return nullptr; }
  Dictionary status() override { return {{"pid", 1}}; }
  std::vector<Dictionary> sessions(size_t /*most*/) override { return {{{"user", 1}}, {}}; }
  std::vector<Dictionary> books(size_t /*mostRowsOfUser*/) override { return {}; }
  std::vector<Dictionary> storebags() override { return {}; }
  std::optional<Dictionary> storebag(std::string_view name) override {
    return name.empty() ? std::nullopt : std::optional(Dictionary{{"name", name}});
  }
  std::string metrics(size_t /*mostRowsOfUser*/) override { return "# EOF\n"; }
  std::optional<std::string> setLogLevel(std::string_view level) override { return std::string(level); }
  std::optional<std::string> reload(std::vector<std::string>& /*lines*/) override { return std::nullopt; }
  std::vector<Dictionary> outbox() override { return {{{"server", "https://example.org"}}}; }
  std::optional<AdministrationRefusal> flushOutbox() override { return std::nullopt; }
  std::optional<AdministrationRefusal> dropOutbox(const Dictionary& filter, uint64_t& dropped) override {
    dropped = filter.size();
    return std::nullopt;
  }
  std::optional<AdministrationRefusal> watch(const Dictionary& filter, PassedSignal signal) override {
    if (filter.empty()) return AdministrationRefusal{AdministrationRefusal::Why::tooMany, "too many"};
    static_cast<void>(signal(filter));
    return std::nullopt;
  }
};

class NoEntitlements final : public Entitlements {
 public:
  Value valueFor(const PeerCredentials&, std::string_view) override { return {}; }
};

class Delegate final : public ListenerDelegate {
 public:
  bool listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) override {
    if (administers)
      connection->setExportedObject(std::make_shared<EmptyWindow>());
    else
      connection->setExportedObject(std::make_shared<EchoingSession>());
    connection->setInvalidationHandler([this] { ++invalidations; });
    connection->resume();
    return true;
  }
  bool administers = false;
  int invalidations = 0;
};

void require(bool condition) {
  if (!condition) std::abort();
}

// What the server says after its part of the handshake is whole, valid messages.
void checkAnswers(std::string_view answers) {
  while (!answers.empty()) {
    Message message;
    const Frame frame = readMessage(std::as_bytes(std::span(answers)), wire::kMaxMessageBytes, message);
    require(frame.status == FrameStatus::complete && validateBody(message));
    answers.remove_prefix(frame.size);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  constexpr int kStream = 7;
  Limits limits;
  limits.maxMessageBytes = 65536;
  limits.maxBytesPerUser = 2u << 20;
  UserBudget budget(UserShares::of(limits, 0, 65536));
  Counters counters;
  MemoryLogSink sink;
  Log log(sink, LogLevel::debug);
  ManualClock clock;
  ManualTimers timers(clock);
  ManualExecutor executor;
  ManualReactor reactor;
  NoEntitlements entitlements;
  Delegate delegate;
  auto pipe = std::make_shared<MemoryPipe>();
  pipe->credentials.uid = 0;
  auto acceptor = std::make_unique<MemoryAcceptor>();
  acceptor->waiting.push_back(std::make_unique<MemoryStream>(pipe, kStream));
  delegate.administers = (data[0] & 8) != 0;
  std::shared_ptr<const MessageDispatcher> dispatcher;
  if (delegate.administers)
    dispatcher = std::make_shared<AdministrationDispatcher>(counters, std::string(32, 'f'));
  DBusServer server({limits, counters, log, clock, timers, executor, reactor, entitlements, budget,
                     std::string(32, 'f'), dispatcher},
                    std::move(acceptor));
  server.setDelegate(delegate);
  server.resume();
  require(reactor.report(MemoryAcceptor::kDescriptor, ready::readable));
  executor.runAll();

  const bool handshakeFirst = (data[0] & 1) != 0;
  const size_t step = (data[0] & 2) != 0 ? 1 + (data[0] >> 4) : size;
  int passed = 0;
  const auto say = [&](std::string_view bytes) {
    pipe->toServer.append(bytes);
    reactor.report(kStream, ready::readable);
    executor.runAll();
  };
  if (handshakeFirst) {
    say(ClientHandshake::opening(0));
    pipe->fromServer.clear();
  }
  const int closedBefore = MemoryPipe::closedDescriptors;
  for (size_t at = 1; at < size; at += step) {
    if ((data[0] & 4) != 0 && !pipe->closed) {
      passed += 2;
      pipe->passed += 2;
    }
    say({reinterpret_cast<const char*>(data) + at, step < size - at ? step : size - at});
  }
  if (handshakeFirst) checkAnswers(pipe->fromServer);
  pipe->ended = true;
  for (int i = 0; i < 4 && !pipe->closed; ++i) say({});
  require(pipe->closed && delegate.invalidations == 1 && server.connectionCount() == 0);
  require(MemoryPipe::closedDescriptors - closedBefore == passed - pipe->passed);
  return 0;
}
