#include "backends/qdx/QDXBackend.h"

#include <string>
#include <utility>

#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr char kBundlePath[] =
    "/System/Library/PrivateFrameworks/Cadmor.framework/Frameworks/TQSPerformance.framework";
constexpr char kAdaptorClass[] = "QDXAdaptor";
constexpr char kForwardingOperation[] = "sendMessageWithMethod:respCode:dict:";

constexpr int32_t kFirstMaskedType = 7, kLastMaskedType = 13;
constexpr uint32_t kAllowedTypes = 81;  // bits 0, 4 and 6: types 7, 11 and 13

}  // namespace

bool QDXBackend::isClientTypeAllowed(int32_t clientType) {
  if (clientType < kFirstMaskedType || clientType > kLastMaskedType) return false;
  return (kAllowedTypes >> (clientType - kFirstMaskedType) & 1U) != 0;
}

std::shared_ptr<QDXBackend> QDXBackend::initWithName(Configuration& configuration, String name,
                                                     Dictionary profile, SharedSessionFacts facts) {
  Log& log = configuration.platform.log;
  const int32_t clientType = facts->compType;
  auto backend = std::make_shared<QDXBackend>(Making(), configuration.platform, std::move(name),
                                              std::move(profile), std::move(facts));
  log.normal("QDXBackend(initWithName): Loading QDX adaptor class for client type %d", clientType);
  if (!isClientTypeAllowed(clientType)) {
    log.error("QDXBackend(initWithName): No matching bundle found for client type %d", clientType);
    return nullptr;
  }
  backend->loadAdaptor();
  return backend;
}

void QDXBackend::loadAdaptor() {
  clientBundle_ = platform().pluginBundles.bundleWithPath(kBundlePath);
  if (clientBundle_ == nullptr) return;
  if (!clientBundle_->isLoaded()) clientBundle_->load();
  qdxAdaptorClass_ = clientBundle_->classNamed(kAdaptorClass);
  if (qdxAdaptorClass_ != nullptr) qdxAdaptor_ = qdxAdaptorClass_->newInstance();
}

Value QDXBackend::sendMessage(Dictionary message, const TimeValue&, uint16_t method, uint16_t respCode,
                              EventID, MessageFlag) {
  if (qdxAdaptor_ != nullptr && qdxAdaptor_->respondsTo(kForwardingOperation)) {
    qdxAdaptor_->invoke(kForwardingOperation, method, respCode, message);
    eventDelivered();
    return {};
  }
  dropEvent(Reason::adaptorUnavailable);
  const std::string adaptor = qdxAdaptor_ != nullptr ? qdxAdaptor_->description() : "(null)";
  platform().log.error("QDXBackend(sendMessage): QDX adaptor %s does not respond to forwarding selector %s",
                       adaptor.c_str(), kForwardingOperation);
  return {};
}

}  // namespace kyt
