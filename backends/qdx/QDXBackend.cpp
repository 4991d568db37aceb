#include "backends/qdx/QDXBackend.h"

#include <string>
#include <utility>

#include "platform/Counters.h"
#include "platform/Log.h"
#include "platform/Platform.h"

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
                                                     Dictionary profile,
                                                     std::optional<String> productFamily) {
  return initWithName(configuration, std::move(name), std::move(profile), std::move(productFamily), 0);
}

std::shared_ptr<QDXBackend> QDXBackend::initWithName(Configuration& configuration, String name,
                                                     Dictionary profile, std::optional<String> productFamily,
                                                     int32_t clientType) {
  struct Made final : QDXBackend {
    Made(Platform& p, String n, Dictionary d, std::optional<String> f)
        : QDXBackend(p, std::move(n), std::move(d), std::move(f)) {}
  };
  Log& log = configuration.platform.log;
  auto backend = std::make_shared<Made>(configuration.platform, std::move(name), std::move(profile),
                                        std::move(productFamily));
  log.normal("QDXBackend(initWithName): Loading QDX adaptor class for client type %d", clientType);
  if (!isClientTypeAllowed(clientType)) {
    log.error("QDXBackend(initWithName): No matching bundle found for client type %d", clientType);
    return nullptr;
  }
  backend->loadAdaptor();
  return backend;
}

void QDXBackend::loadAdaptor() {
  clientBundle_ = platform_.pluginBundles.bundleWithPath(kBundlePath);
  if (clientBundle_ == nullptr) return;
  if (!clientBundle_->isLoaded()) clientBundle_->load();
  qdxAdaptorClass_ = clientBundle_->classNamed(kAdaptorClass);
  if (qdxAdaptorClass_ != nullptr) qdxAdaptor_ = qdxAdaptorClass_->newInstance();
}

Value QDXBackend::sendMessage(Dictionary message, const TimeValue&, uint16_t method, uint16_t respCode,
                              EventID, MessageFlag) {
  if (qdxAdaptor_ != nullptr && qdxAdaptor_->respondsTo(kForwardingOperation)) {
    qdxAdaptor_->invoke(kForwardingOperation, method, respCode, message);
    return {};
  }
  platform_.counters.add(Reason::adaptorUnavailable);
  const std::string adaptor = qdxAdaptor_ != nullptr ? qdxAdaptor_->description() : "(null)";
  platform_.log.error("QDXBackend(sendMessage): QDX adaptor %s does not respond to forwarding selector %s",
                      adaptor.c_str(), kForwardingOperation);
  return {};
}

}  // namespace kyt
