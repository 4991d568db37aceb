// One datagram that is not known to be delivered: a record of the dashboard back end's queue. A plain object
// that belongs to that back end's network queue.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "platform/base/UserBudget.h"
#include "platform/objects/Value.h"

namespace kyt {

class UDPPacketToSend {
 public:
  static constexpr int32_t kUnsent = 0;   // it has not gone out in full yet
  static constexpr int32_t kWaiting = 1;  // for its acknowledgement

  // What a packet costs besides its bytes.
  static constexpr size_t kCost = 192;

  // Copies the bytes.
  [[nodiscard]] static std::unique_ptr<UDPPacketToSend> initWithBytes(const std::byte* bytes, uint16_t length,
                                                                      uint16_t eventNum) {
    auto packet = std::make_unique<UDPPacketToSend>();
    packet->data_ = Data(std::span(bytes, length));
    packet->eventNumber_ = eventNum;
    return packet;
  }

  [[nodiscard]] int32_t state() const { return state_; }
  void setState(int32_t value) { state_ = value; }
  // Ticks of the timer since the last transmission.
  [[nodiscard]] int32_t numberOfChecks() const { return numberOfChecks_; }
  void setNumberOfChecks(int32_t value) { numberOfChecks_ = value; }
  [[nodiscard]] int32_t numberOfRetransmits() const { return numberOfRetransmits_; }
  void setNumberOfRetransmits(int32_t value) { numberOfRetransmits_ = value; }
  [[nodiscard]] uint16_t eventNumber() const { return eventNumber_; }
  void setEventNumber(uint16_t value) { eventNumber_ = value; }
  [[nodiscard]] const Data& data() const { return data_; }
  void setData(Data value) { data_ = std::move(value); }
  // What it counts towards the memory of its user.
  void setCharge(Charge charge) { charge_ = std::move(charge); }

 private:
  int32_t state_ = kUnsent;
  int32_t numberOfChecks_ = 0;
  int32_t numberOfRetransmits_ = 0;
  uint16_t eventNumber_ = 0;
  Data data_;
  Charge charge_;
};

}  // namespace kyt
