// What happens on the network queue: sending, acknowledgements, the timer's ticks, and the end.
#include <array>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr int32_t kMaxRetransmits = 4;
// Ticks that a packet waits for its acknowledgement, by the retransmissions it has had.
constexpr std::array<int32_t, kMaxRetransmits> kWaitTable = {2, 3, 5, 9};

constexpr int32_t kRunning = 0, kCleaningUp = 1, kLastResortScheduled = 2;
constexpr int kLastResortMilliseconds = 9500;

}  // namespace

void DashboardBackend::useReliableUDP() {
  if (const int number = socket_->bindToAnyPort(); number != 0) {
    platform().log.error("DashboardBackend(useReliableUDP): can't bind socket, %d", number);
    return;
  }
  reliableUDP_ = true;
  // Reported once for each time that it is armed, so that the reactor does not spin while the queue waits.
  readSource_ = platform().reactor.watch(socket_->descriptor(), ready::readable | ready::oneShot,
                                         [weak = weak_from_this(), queue = networkProcQueue_](unsigned) {
                                           queue->async([weak] {
                                             const auto self =
                                                 std::static_pointer_cast<DashboardBackend>(weak.lock());
                                             if (self == nullptr) return;
                                             self->networkProcQueue_->assertCurrent();
                                             self->processSocketRead();
                                           });
                                         });
  if (!readSource_) platform().log.error("DashboardBackend(useReliableUDP): can't create read source");
}

bool DashboardBackend::send(std::span<const std::byte> datagram) {
  return socket_ != nullptr && socket_->send(datagram) == static_cast<int64_t>(datagram.size());
}

void DashboardBackend::tryToSendMsg(const DashboardDatagram& datagram, EventID eventNumber) {
  const bool sent = send({datagram.bytes(), datagram.length()});
  if (sent && !reliableUDP_) return;
  // Where the user's memory is used up, older ones of this back end give way; without any this one is not kept.
  Charge charge(userAccount(), Share::bytes);
  while (!charge.set(UDPPacketToSend::kCost + datagram.length(), kLeftForMessages)) {
    platform().counters.add(Reason::datagramDisplaced);
    if (messageQueue_.empty()) return;
    messageQueue_.pop_front();
  }
  auto packet =
      UDPPacketToSend::initWithBytes(datagram.bytes(), datagram.length(), static_cast<uint16_t>(eventNumber));
  packet->setCharge(std::move(charge));
  if (sent) packet->setState(UDPPacketToSend::kWaiting);
  messageQueue_.push_back(std::move(packet));
  if (messageQueue_.size() <= kMaxPackets) return;
  messageQueue_.pop_front();
  platform().counters.add(Reason::datagramDisplaced);
}

void DashboardBackend::processSocketRead() {
  if (socket_ == nullptr) return;
  std::array<std::byte, DashboardDatagram::kSize> buffer{};
  const int64_t received = socket_->receive(buffer);
  static_cast<void>(readSource_.rearm());
  if (received < 0) return;
  const std::optional<uint16_t> acknowledged =
      DashboardDatagram::acknowledgedEvent(std::span(buffer).first(static_cast<size_t>(received)));
  if (!acknowledged) return;
  for (auto packet = messageQueue_.begin(); packet != messageQueue_.end(); ++packet) {
    if ((*packet)->eventNumber() != acknowledged) continue;
    messageQueue_.erase(packet);
    return;
  }
}

bool DashboardBackend::checkWaiting(UDPPacketToSend& packet) {
  const int32_t retransmits = packet.numberOfRetransmits();
  if (retransmits >= kMaxRetransmits) {
    platform().counters.add(Reason::datagramUnacknowledged);
    return true;
  }
  const int32_t checks = packet.numberOfChecks() + 1;
  if (checks < kWaitTable[static_cast<size_t>(retransmits)]) {
    packet.setNumberOfChecks(checks);
  } else if (send(packet.data().bytes())) {  // otherwise the next tick tries again
    packet.setNumberOfChecks(0);
    packet.setNumberOfRetransmits(retransmits + 1);
  }
  return false;
}

bool DashboardBackend::checkUnsent(UDPPacketToSend& packet) {
  if (!send(packet.data().bytes())) return false;
  if (!reliableUDP_) return true;
  packet.setState(UDPPacketToSend::kWaiting);
  return false;
}

void DashboardBackend::myPeriodicTask() {
  for (size_t i = 0; i < messageQueue_.size();) {
    UDPPacketToSend& packet = *messageQueue_[i];
    bool done = false;
    if (packet.state() == UDPPacketToSend::kWaiting)
      done = checkWaiting(packet);
    else if (packet.state() == UDPPacketToSend::kUnsent)
      done = checkUnsent(packet);
    if (done)
      messageQueue_.erase(messageQueue_.begin() + static_cast<std::ptrdiff_t>(i));
    else
      ++i;
  }
  if (cleanupState_ == kRunning) return;
  if (messageQueue_.empty()) {
    platform().log.normal("DashboardBackend(myPeriodicTask): clean up at myPeriodicTask.");
    cleanupSources();
  } else if (cleanupState_ == kCleaningUp) {
    scheduleLastResort();
  }
}

void DashboardBackend::scheduleLastResort() {
  cleanupState_ = kLastResortScheduled;
  platform().log.normal("DashboardBackend(myPeriodicTask): scheduled last resort clean-up in %d ms.",
                        kLastResortMilliseconds);
  if (lastResort_) return;  // a second clean-up does not put off the end that the first one set
  lastResort_ = platform().timers.after(
      std::chrono::milliseconds(kLastResortMilliseconds), networkProcQueue_, [weak = weak_from_this()] {
        const auto self = std::static_pointer_cast<DashboardBackend>(weak.lock());
        if (self == nullptr) return;
        self->networkProcQueue_->assertCurrent();
        self->cleanupSources();
      });
}

void DashboardBackend::cleanup() {
  networkProcQueue_->async([self = std::static_pointer_cast<DashboardBackend>(shared_from_this())] {
    self->networkProcQueue_->assertCurrent();
    if (self->messageQueue_.empty()) {
      self->cleanupSources();
      return;
    }
    self->cleanupState_ = kCleaningUp;
    if (self->timer_) self->keptAlive_ = self;  // without a timer nothing would ever let go
  });
}

void DashboardBackend::cleanupSources() {
  const auto kept = std::move(keptAlive_);  // whoever called holds the object until it has returned
  lastResort_.cancel();
  timer_.cancel();
  readSource_.cancel();
  socket_.reset();
  platform().counters.add(Reason::datagramGivenUp, messageQueue_.size());
  messageQueue_.clear();
}

}  // namespace kyt
