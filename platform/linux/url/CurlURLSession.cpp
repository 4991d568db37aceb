#include "platform/linux/url/CurlURLSession.h"

#include "platform/linux/url/URLNetwork.h"

namespace kyt {
namespace {

class CurlURLSession final : public URLSession {
 public:
  explicit CurlURLSession(std::shared_ptr<URLSessionState> state) : state_(std::move(state)) {}
  ~CurlURLSession() override { CurlURLSession::finishTasksAndInvalidate(); }

  std::shared_ptr<URLTask> start(URLRequest request, URLCompletion completion) override {
    const size_t charge = countedBytes(request);
    OutstandingBytes::User& user = state_->outstanding.user(request.account);
    const bool hasRoom = user.take(charge);
    if (!hasRoom) request = {};  // it is not kept until its completion has run
    const auto refusal = state_->invalidated.load() ? URLTransfer::Refusal::invalidated
                         : hasRoom                  ? URLTransfer::Refusal::none
                                                    : URLTransfer::Refusal::tooMuch;
    auto transfer =
        std::make_shared<URLTransfer>(state_, user, std::move(request), std::move(completion), refusal);
    transfer->outstandingCharge = hasRoom ? charge : 0;
    state_->used = true;
    state_->network->start(transfer);
    return transfer;
  }

  void finishTasksAndInvalidate() override {
    if (!state_->invalidated.exchange(true) && state_->used.load()) state_->network->invalidate(state_);
  }

 private:
  std::shared_ptr<URLSessionState> state_;
};

}  // namespace

CurlURLSessionFactory::CurlURLSessionFactory(CurlURLSessionOptions options, Log& log, Counters& counters)
    : network_(std::make_shared<URLNetwork>(std::move(options), log, counters)) {}

CurlURLSessionFactory::~CurlURLSessionFactory() {
  network_->stop();
}

bool CurlURLSessionFactory::shutDownWithin(Duration patience) {
  return network_->stopWithin(patience);
}

std::unique_ptr<URLSession> CurlURLSessionFactory::create(URLSessionConfiguration configuration) {
  return std::make_unique<CurlURLSession>(
      std::make_shared<URLSessionState>(network_, std::move(configuration)));
}

void CurlURLSessionFactory::reconfigure(Access access) {
  network_->reconfigure(std::move(access));
}

void CurlURLSessionFactory::cancelAwaited() {
  network_->cancelAwaited();
}
void CurlURLSessionFactory::cancelAll() {
  network_->cancelAll();
}
void CurlURLSessionFactory::watchConnectivity(std::shared_ptr<Function<void()>> changed) {
  network_->watchConnectivity(std::move(changed));
}
URLFigures CurlURLSessionFactory::figures() const {
  return network_->figures();
}
size_t CurlURLSessionFactory::outstanding() const {
  return network_->outstanding();
}

}  // namespace kyt
