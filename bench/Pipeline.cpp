#include "bench/Pipeline.h"

#include <unistd.h>

#include <utility>

#include "backend/KYTReportingBackend.h"
#include "bench/Corpus.h"
#include "platform/objects/Keys.h"

namespace kyt::bench {

namespace {

constexpr int kDescriptor = 7;
constexpr uint16_t kCategory = 7;

}  // namespace

Pipeline::Pipeline() : Pipeline(corpusPayloads(kEvents)) {}

Pipeline::Pipeline(const std::vector<Dictionary>& payloads) {
  test_.log.setLevel(LogLevel::error);
  test_.deviceProperties.setCountryCode("DE");
  pipe_->credentials.uid = geteuid();
  const Dictionary bag = benchBag("https://post.example.org/", 49);
  delegate_.storebag = *bag.find("vantu_internal")->dictionary();
  delegate_.storebagVersion = String("bench");
  auto acceptor = std::make_unique<MemoryAcceptor>();
  acceptor->waiting.push_back(std::make_unique<MemoryStream>(pipe_, kDescriptor));
  server_ = std::make_unique<DBusServer>(
      DBusServerServices{test_.limits, test_.counters, test_.log, test_.clock, test_.timers, test_.executor,
                         test_.reactor, entitlements_, test_.budget, std::string(32, 'f')},
      std::move(acceptor));
  server_->setDelegate(*this);
  server_->resume();
  test_.reactor.report(MemoryAcceptor::kDescriptor, ready::readable);
  test_.executor.runAll();
  pipe_->toServer = openingCalls(1);
  receive();
  const std::optional<Array> states = session_ ? session_->fetchReportingStates() : std::nullopt;
  live_ = states && !states->empty();
  for (const Dictionary& payload : payloads) appendEventCall(calls_, 1000, kCategory, payload);
  if (live_) discardBatch();
}

Pipeline::~Pipeline() {
  pipe_->ended = true;
  receive();
}

bool Pipeline::listenerShouldAcceptNewConnection(Listener&, const std::shared_ptr<Connection>& connection) {
  session_ = ReportingdSession::initWithSessionDelegate(delegate_, connection, class_);
  connection->setExportedObject(session_);
  connection->setInvalidationHandler([this] { session_->dealloc(); });
  connection->resume();
  return true;
}

void Pipeline::receive() {
  test_.reactor.report(kDescriptor, ready::readable);
  test_.executor.runAll();
}

void Pipeline::fillBatch() {
  pipe_->toServer = calls_;
  receive();
}

size_t Pipeline::postBatch() {
  test_.deflate.faults.noStream = true;
  static_cast<void>(
      session_->backendForKey(kKYTReportingBackendHTTPPost)->flushMessagesWithCompletion(nullptr));
  test_.executor.runAll();
  const size_t requests = test_.urlSessions.requestCount();
  return requests == 0 ? 0 : test_.urlSessions.lastRequest().body.size();
}

void Pipeline::stopBooking() {
  session_->backendForKey(kKYTReportingBackendHTTPPost)->setProgram(nullptr);
}

void Pipeline::discardBatch() {
  KYTReportingBackend& backend = *session_->backendForKey(kKYTReportingBackendHTTPPost);
  backend.setState(kBackendStateHeld);
  static_cast<void>(backend.flushMessagesWithCompletion(nullptr));  // of a held back end: drops the batch
  backend.setState(kBackendStateEnabled);
  test_.executor.runAll();
}

}  // namespace kyt::bench
