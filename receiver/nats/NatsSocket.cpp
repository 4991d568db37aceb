#include "receiver/nats/NatsSocket.h"

#include <sys/epoll.h>
#include <sys/socket.h>

namespace kyt::receiver {
namespace {

constexpr uint64_t kSocket = 0, kWake = 1;

// This thread publishes: what the library wants written it writes itself, right after.
thread_local bool tIsPublishing = false;

void setEvents(int epoll, int operation, int descriptor, uint32_t events, uint64_t which) {
  epoll_event event{events, {.u64 = which}};
  static_cast<void>(::epoll_ctl(epoll, operation, descriptor, &event));
}

}  // namespace

NatsSocket::NatsSocket(std::chrono::milliseconds writeTime)
    : writeTime_(writeTime),
      epoll_(ownDescriptor(::epoll_create1(EPOLL_CLOEXEC))),
      wake_(makeEventDescriptor()) {
  setEvents(epoll_.get(), EPOLL_CTL_ADD, wake_.get(), EPOLLIN, kWake);
}

natsStatus NatsSocket::use(natsOptions* options, bool secure) {
  isSecure_ = secure;
  if (epoll_.get() < 0 || wake_.get() < 0) return NATS_SYS_ERROR;
  return natsOptions_SetEventLoop(options, this, &NatsSocket::attach, &NatsSocket::watchReads,
                                  &NatsSocket::watchWrites, &NatsSocket::detach);
}

// Again after each time that the library has connected again.
natsStatus NatsSocket::attach(void** data, void* self, natsConnection* connection, natsSock socket) {
  auto& us = *static_cast<NatsSocket*>(self);
  *data = self;
  MutexLock lock(us.mutex_);
  us.connection_ = connection;
  us.socket_ = socket;
  us.isBehind_ = us.wantsWrite_ = false;
  setEvents(us.epoll_.get(), EPOLL_CTL_ADD, socket, EPOLLIN, kSocket);
  return NATS_OK;
}

// Removed before the library closes the socket.
natsStatus NatsSocket::watchReads(void* self, bool add) {
  if (!add) static_cast<NatsSocket*>(self)->leave();
  return NATS_OK;
}

natsStatus NatsSocket::watchWrites(void* self, bool add) {
  auto& us = *static_cast<NatsSocket*>(self);
  us.wantsWrite_ = add;
  if (add != us.isBehind_ && !(add && tIsPublishing)) us.watch(add);
  return NATS_OK;
}

natsStatus NatsSocket::detach(void* self) {
  auto& us = *static_cast<NatsSocket*>(self);
  us.leave();
  MutexLock lock(us.mutex_);
  us.connection_ = nullptr;
  return NATS_OK;
}

void NatsSocket::watch(bool writes) {
  MutexLock lock(mutex_);
  if (socket_ < 0 || isBehind_ == writes) return;
  isBehind_ = writes;
  progressAt_ = std::chrono::steady_clock::now();
  setEvents(epoll_.get(), EPOLL_CTL_MOD, socket_, writes ? EPOLLIN | EPOLLOUT : EPOLLIN, kSocket);
  if (!writes) wake();  // what was kept back meanwhile may go
}

void NatsSocket::leave() {
  MutexLock lock(mutex_);
  if (socket_ >= 0) setEvents(epoll_.get(), EPOLL_CTL_DEL, socket_, 0, kSocket);
  socket_ = -1;
  isBehind_ = wantsWrite_ = false;
}

natsConnection* NatsSocket::connection() {
  MutexLock lock(mutex_);
  return socket_ < 0 ? nullptr : connection_;
}

natsStatus NatsSocket::publish(natsConnection* connection, natsMsg* message) {
  tIsPublishing = true;
  const natsStatus status = natsConnection_PublishMsg(connection, message);
  tIsPublishing = false;
  return status;
}

Duration NatsSocket::sinceFlush() const {
  return std::chrono::steady_clock::now() - flushedAt_.load(std::memory_order_relaxed);
}

void NatsSocket::flush() {
  MutexLock lock(ioMutex_);
  if (!wantsWrite_) return;  // another publisher wrote it
  flushedAt_.store(std::chrono::steady_clock::now(), std::memory_order_relaxed);
  if (natsConnection* const connection = this->connection(); connection != nullptr)
    natsConnection_ProcessWriteEvent(connection);
  if (wantsWrite_) watch(true);
}

void NatsSocket::read() {
  natsConnection* const connection = this->connection();
  if (connection == nullptr) return;
  if (!isSecure_) return natsConnection_ProcessReadEvent(connection);
  MutexLock lock(ioMutex_);
  natsConnection_ProcessReadEvent(connection);
}

void NatsSocket::noteProgress() {
  MutexLock lock(mutex_);
  progressAt_ = std::chrono::steady_clock::now();
}

void NatsSocket::endSlow() {
  MutexLock lock(mutex_);
  if (socket_ >= 0 && std::chrono::steady_clock::now() - progressAt_ > writeTime_)
    ::shutdown(socket_, SHUT_RDWR);
}

void NatsSocket::wait(Duration most) {
  const auto seconds = std::chrono::floor<std::chrono::seconds>(most);
  const timespec time{static_cast<time_t>(seconds.count()), static_cast<long>((most - seconds).count())};
  epoll_event events[2];
  const int count = ::epoll_pwait2(epoll_.get(), events, 2, &time, nullptr);
  for (int i = 0; i < count; ++i) {
    if (events[i].data.u64 == kWake) {
      clearEventDescriptor(wake_.get());
      continue;
    }
    if ((events[i].events & ~uint32_t{EPOLLOUT}) != 0) read();
    if ((events[i].events & EPOLLOUT) != 0) {
      noteProgress();
      flush();
    }
  }
  if (isBehind_) endSlow();
}

}  // namespace kyt::receiver
