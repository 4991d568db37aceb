#include "platform/fake/FakeUDPSocket.h"

#include <algorithm>
#include <cstring>

#include "platform/base/InternetAddress.h"

namespace kyt {

class FakeUDPSockets::Socket final : public UDPSocket {
 public:
  Socket(std::shared_ptr<Record> record, const Faults& faults)
      : record_(std::move(record)), faults_(faults) {}
  ~Socket() override { record_->open = false; }

  [[nodiscard]] int descriptor() const override { return record_->descriptor; }
  void suppressBrokenPipeSignal() override { record_->brokenPipeSuppressed = true; }
  [[nodiscard]] int bindToAnyPort() override {
    record_->bound = faults_.bind == 0;
    return faults_.bind;
  }
  [[nodiscard]] int connect(uint32_t address, uint16_t port) override {
    if (faults_.connect != 0) return faults_.connect;
    if (address == kNoIPv4Address) return kAccessDenied;
    record_->address = address;
    record_->port = port;
    return 0;
  }
  [[nodiscard]] int64_t send(std::span<const std::byte> datagram) override {
    ++record_->attempts;
    if (faults_.send != 0) return -faults_.send;
    if (faults_.sendOnly && *faults_.sendOnly < datagram.size())
      return static_cast<int64_t>(*faults_.sendOnly);
    record_->sent.emplace_back(reinterpret_cast<const char*>(datagram.data()), datagram.size());
    return static_cast<int64_t>(datagram.size());
  }
  [[nodiscard]] int64_t receive(std::span<std::byte> buffer) override {
    if (record_->arriving.empty()) return -kWouldBlock;
    const std::string datagram = std::move(record_->arriving.front());
    record_->arriving.pop_front();
    const size_t size = std::min(datagram.size(), buffer.size());
    if (size > 0) std::memcpy(buffer.data(), datagram.data(), size);
    return static_cast<int64_t>(size);
  }

 private:
  const std::shared_ptr<Record> record_;
  const Faults& faults_;
};

std::variant<std::unique_ptr<UDPSocket>, int> FakeUDPSockets::open() {
  if (faults.open != 0) return faults.open;
  sockets_.push_back(std::make_shared<Record>());
  sockets_.back()->descriptor = kFirstDescriptor + static_cast<int>(sockets_.size()) - 1;
  return std::make_unique<Socket>(sockets_.back(), faults);
}

size_t FakeUDPSockets::openSockets() const {
  return static_cast<size_t>(
      std::count_if(sockets_.begin(), sockets_.end(), [](const auto& record) { return record->open; }));
}

}  // namespace kyt
