#include "platform/ipc/fake/FakeListener.h"

#include <utility>

namespace kyt {

struct FakeConnection::State {
  mutable Mutex mutex;
  std::map<std::string, Value, std::less<>> entitlements GUARDED_BY(mutex);
  std::shared_ptr<ExportedObject> exportedObject GUARDED_BY(mutex);
  Task interruptionHandler GUARDED_BY(mutex);
  Task invalidationHandler GUARDED_BY(mutex);
  std::vector<MessageToClient> messages GUARDED_BY(mutex);
  std::optional<Error> sendError GUARDED_BY(mutex);
  bool resumed GUARDED_BY(mutex) = false;
  bool invalidating GUARDED_BY(mutex) = false;
  bool invalidated GUARDED_BY(mutex) = false;
};

FakeConnection::FakeConnection(std::shared_ptr<SerialQueue> queue, uint32_t user)
    : queue_(std::move(queue)),
      user_(user),
      description_("connection of a test, user " + std::to_string(user)),
      state_(std::make_shared<State>()) {}

void FakeConnection::setEntitlement(std::string_view key, Value value) {
  MutexLock lock(state_->mutex);
  state_->entitlements.insert_or_assign(std::string(key), std::move(value));
}

void FakeConnection::setSendError(std::optional<Error> error) {
  MutexLock lock(state_->mutex);
  state_->sendError = std::move(error);
}

std::vector<MessageToClient> FakeConnection::messagesToClient() const {
  MutexLock lock(state_->mutex);
  return state_->messages;
}

bool FakeConnection::resumed() const {
  MutexLock lock(state_->mutex);
  return state_->resumed;
}

bool FakeConnection::invalidated() const {
  MutexLock lock(state_->mutex);
  return state_->invalidated;
}

std::shared_ptr<ClientSessionInterface> FakeConnection::exportedObject() const {
  MutexLock lock(state_->mutex);
  return std::dynamic_pointer_cast<ClientSessionInterface>(state_->exportedObject);
}

std::shared_ptr<ExportedObject> FakeConnection::anyExportedObject() const {
  MutexLock lock(state_->mutex);
  return state_->exportedObject;
}

void FakeConnection::interruptNow() {
  queue_->sync([this] {
    Task handler;
    {
      MutexLock lock(state_->mutex);
      if (!state_->invalidated) handler = std::move(state_->interruptionHandler);
    }
    if (handler) handler();
  });
}

void FakeConnection::runInvalidation(State& state) {
  Task invalidationHandler, interruptionHandler;
  std::shared_ptr<ExportedObject> object;
  {
    MutexLock lock(state.mutex);
    if (state.invalidated) return;
    state.invalidated = true;
    invalidationHandler = std::move(state.invalidationHandler);
    interruptionHandler = std::move(state.interruptionHandler);
    object = std::exchange(state.exportedObject, nullptr);
  }
  if (invalidationHandler) invalidationHandler();
}

void FakeConnection::invalidateNow() {
  queue_->sync([this] { runInvalidation(*state_); });
}

void FakeConnection::invalidate() {
  {
    MutexLock lock(state_->mutex);
    if (std::exchange(state_->invalidating, true)) return;
  }
  queue_->async([state = state_] { runInvalidation(*state); });
}

Value FakeConnection::entitlementValue(std::string_view key) {
  MutexLock lock(state_->mutex);
  const auto found = state_->entitlements.find(key);
  return found == state_->entitlements.end() ? Value() : found->second;
}

void FakeConnection::setExportedObject(std::shared_ptr<ExportedObject> object) {
  MutexLock lock(state_->mutex);
  state_->exportedObject = std::move(object);
}

void FakeConnection::setInterruptionHandler(Task handler) {
  MutexLock lock(state_->mutex);
  state_->interruptionHandler = std::move(handler);
}

void FakeConnection::setInvalidationHandler(Task handler) {
  MutexLock lock(state_->mutex);
  state_->invalidationHandler = std::move(handler);
}

void FakeConnection::resume() {
  MutexLock lock(state_->mutex);
  state_->resumed = true;
}

std::optional<Error> FakeConnection::sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                         double timestamp, uint16_t category, uint16_t type,
                                                         std::optional<Dictionary> payload) {
  MutexLock lock(state_->mutex);
  if (state_->invalidated) return Error{"KYTReportingErrorDomain", -1, "The connection was invalidated"};
  if (state_->sendError) return state_->sendError;
  state_->messages.push_back({std::move(sessionInfo), timestamp, category, type, std::move(payload)});
  return std::nullopt;
}

bool FakeListener::connect(const std::shared_ptr<FakeConnection>& connection) {
  if (!accepting_ || delegate_ == nullptr) return false;
  return connection->queue()->sync(
      [&] { return delegate_->listenerShouldAcceptNewConnection(*this, connection); });
}

}  // namespace kyt
